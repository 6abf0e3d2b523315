// The CGI front end: the runner that serves one web-API call arriving from
// the web server. velascgi constructs one WebEntry per process and calls Run.
//
// Initialize builds the request from the CGI environment, the query string,
// the body (decrypting encrypted parameters) and the cookies; the pipeline of
// APIRunner then runs it; OutputHeader and OutputBody write the CGI reply to
// standard output. The permission hooks hand the call to a PermissionCheck.
#pragma once

#include <json/json.h>
#include <string>

#include "access/PermissionCheck.h"
#include "webapi/APITable.h"
#include "vela/cgi.h"
#include "vela/export.h"
#include "webapi/APIRunner.h"

namespace VELA {

// Exported for velascgi and the tests (VELA_EXPORT: see vela/export.h).
class VELA_EXPORT WebEntry : public APIRunner {
public:
    WebEntry();
    ~WebEntry() override;

    // The argument is not used: the request comes from the CGI environment.
    bool Run(const Json::Value& unused) override;
    bool Initialize(const Json::Value& unused) override;

    // ---- Permission: answered by permission_ ----
    bool CheckSharingPermission(APIRequest* req, APIResponse* resp) override;
    bool NeedPermission(APIRequest* req) override;
    bool CheckPermission(APIRequest* req, APIResponse* resp) override;
    bool SkipPermission(APIRequest* req) override;
    // The session check itself: the error code for the platform's verdict
    // (0 allowed), computed at most once per value of `allowTimeout`.
    int CheckPermission(bool allowTimeout);

    // ---- Sharing links: answered by SharingCheck (access/SharingCheck.h) ----
    std::string GetSharingCheckLibPath(APIRequest* req);
    bool OpenSharingCheckLib(APIRequest* req, _tag_API_SHARING_CHECK_TABLE** table);
    bool GetSharingCheckTableFunc(void* handle, _tag_API_SHARING_CHECK_TABLE** table);
    bool GetSharingCheckFunc(APIRequest* req, _tag_API_SHARING_CHECK_TABLE* table,
                             bool (**check)(APIRequest*, APIResponse*));
    int RegexMatch(const char* pattern, const char* text);
    bool CheckSharingAppPermission(APIRequest* req, APIResponse* resp);
    void InitSharingSession(APIRequest* req);

    // ---- Uploads ----
    bool HandleUpload(APIRequest* req, APIResponse* resp) override;
    // For an upload whose query string lacks api, version or method: reads
    // them from the leading form fields of the body into `postParam`.
    bool LoadUploadAPIDesc(Json::Value& postParam);

    // ---- Building the request ----
    bool InitParam(Json::Value& param);
    bool InitGetParam(Json::Value& getParam);
    bool InitPostParam(Json::Value& postParam);
    bool DetectAndDecryptParamLine(const std::string& line, Json::Value& out);
    bool DecryptParam(const std::string& cipher, Json::Value& out);
    bool DecryptAESParam(Json::Value& param);

    // ---- Relay to another service: not served yet (error 109) ----
    bool ProcessRelay(APIRequest* req, APIResponse* resp);

    // ---- HTTP output (standard output) ----
    void OutputHeader();
    void OutputBody();

protected:
    // Removes the request's private upload directory with the files the
    // handler left in it.
    void RemoveUploadedFiles();

    VELACGI_CTX* cgi_;
    Json::Value uploadedFiles_;   // stored files of the upload, in body order
    PermissionCheck permission_;  // the session check and its verdict cache
};

// A front end that only asks the sharing check library of a link whether
// the call the CGI environment names may be made: Run is Initialize, then
// CheckSharingAppPermission on the request and response.
class VELA_EXPORT SharingChecker : public WebEntry {
public:
    bool Run(const Json::Value& unused) override;
};

// After-reply callback: asks the platform to restart the web server.
void RestartHttpd(void*);

}  // namespace VELA
