// The dispatcher: runs one request from its request form to its response.
//
// APIRunner checks the request against the API descriptions of the web-API
// directory, asks the permission hooks, loads the handler library, sets up
// the identity, priority, standard streams and working directory of the
// call, calls the handler and restores everything. The outcome is left in
// the runner's response. The base class serves requests given as JSON; the
// CGI front end (WebEntry) derives from it and overrides the hooks.
//
// Relative paths ("*.lib" description files, the candidates of one API, the
// "lib" paths) are resolved against the working directory, which the caller
// sets to the web-API directory (<root>/usr/vela/velaman/webapi).
#pragma once

#include <json/json.h>
#include <string>

#include "webapi/APITable.h"

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

class APIRequest;
class APIResponse;
// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
class APIRunnerPrivate;
#pragma GCC visibility pop

class VELA_EXPORT APIRunner {
public:
    // Creates an empty request and its response, makes the process lead a
    // new session and reads the defaults file lib.def.
    APIRunner();
    APIRunner(const APIRunner&) = delete;
    APIRunner& operator=(const APIRunner&) = delete;
    // Closes the handler libraries, deletes the request and the response and
    // puts the process name back.
    virtual ~APIRunner();

    // ---- Hooks ----
    // Initialize, SetProcessName, then Process. The outcome is in GetResponse().
    virtual bool Run(const Json::Value& request);
    // Fills the request from the process environment and the request JSON.
    virtual bool Initialize(const Json::Value& request);
    virtual bool CheckSharingPermission(APIRequest* req, APIResponse* resp);  // true
    virtual bool NeedPermission(APIRequest* req);                             // false
    virtual bool CheckPermission(APIRequest* req, APIResponse* resp);         // true
    virtual bool HandleUpload(APIRequest* req, APIResponse* resp);            // true
    virtual bool SkipPermission(APIRequest* req);                             // true

    // Lets the runner show the API being served in argument 0 (ps).
    void SetArgs(int argc, char** argv);

    // ---- The road of a call (public for the compound handler) ----
    bool Process(APIRequest* req, APIResponse* resp);
    bool ProcessEntry(APIRequest* req, APIResponse* resp);
    bool ProcessLib(APIRequest* req, APIResponse* resp);
    bool HandleCompound(APIRequest* req, APIResponse* resp);
    // Names the process, the log identity and the thread after the call:
    // "<prefix>_<api>_<version>_<method>". Errors 101 and 118. An API name
    // that fails the name check is never shown: the process keeps its name
    // and the road refuses the call.
    bool SetProcessName(APIRequest* req, APIResponse* resp);

    // The response body plus "httpd_restart"; null without a response.
    Json::Value GetResponse();
    // Runs the response's after-reply callbacks in a detached child, one
    // second later, so that the reply is not held up: the child's standard
    // input and output are /dev/null (its standard error too unless that is
    // a file), and it closes every pipe and socket it inherited, so the web
    // server sees the answer end at once. A callback opens what it needs.
    void HandleCallback(APIResponse* resp);

    // Runs one API method on behalf of `user`, with `params` as its
    // parameters ("api", "method" and "version" in them are replaced by the
    // arguments) and `extra` as the request's attributes; the answer is
    // left in `out` (the response body and "httpd_restart"). No permission
    // is checked: the caller decides whether `user` may call the method.
    // The call runs from the web-API directory; the working directory, the
    // identity and USERNAME / VELA_WEBAPI_USERNAME are put back afterwards.
    // A method that would switch identity for good ("grantable" and
    // "grantByDefault" both false) runs in a detached child whose standard
    // input and output are /dev/null. With `fd` >= 0 the call always runs in
    // a child, and the body the handler writes to standard output (after its
    // header lines and the empty line) goes to `fd`. Errors of its own:
    // 101 api, method or user missing, or not usable; 117 the child could
    // not be made or gave no answer. The forms without `fd` forward
    // nothing; the last passes an empty object as `extra`.
    void Exec(Json::Value& out, int fd, const char* api, int version, const char* method,
              const Json::Value& params, const Json::Value& extra, const char* user);
    void Exec(Json::Value& out, const char* api, int version, const char* method,
              const Json::Value& params, const Json::Value& extra, const char* user);
    void Exec(Json::Value& out, const char* api, int version, const char* method,
              const Json::Value& params, const char* user);

    // ---- Method attributes, as every part of a call reads them ----
    // The attribute object of one method; the defaults' "methods" when the
    // method has none of its own. For the call being processed the answers
    // come from its description check, without asking the registry again.
    const Json::Value& GetMethod(const std::string& api, int version, const std::string& method);
    bool GetMethodAttr(const std::string& api, int version, const std::string& method,
                       const std::string& attr);
    bool GetMethodAttr(APIRequest* req, const std::string& attr);

    // ---- For running sub-requests (compound requests) ----
    // Hands the request its API's description (already loaded).
    bool AddAPIInfo(APIRequest* req);
    // Loads (or finds) the handler library of the request's API.
    bool CacheLib(APIRequest* req, void** handle);

    // ---- Warm processes (a front end that forks one child per request) ----
    // Loads the description of `api` and opens its handler library with
    // every symbol bound now, so that processes forked from this one find
    // both ready. The library's path, as the description names it, goes to
    // `lib`. False when the name, the description or the library fails.
    bool WarmUp(const std::string& api, std::string* lib = nullptr);
    // Whether a warm process may serve this method itself, without a child:
    // its API's description is loaded already, lists the method, and the
    // method says "inProcess", runs as the superuser (the warm process's
    // own identity) with none of "grantByUser", "grantByDefault" and
    // "allowUpload".
    bool ServesInProcess(const std::string& api, int version, const std::string& method) const;
    // Exchanges the descriptions and the handler libraries with `other`, so
    // that a fresh runner can serve one request with a warm one's state and
    // hand it back afterwards.
    void SwapWarmState(APIRunner& other);

    APIRequest* GetRequest() const { return request_; }
    APIResponse* GetResponseObject() const { return response_; }

protected:
    // ---- For runners deriving from this one (front ends, tests) ----
    // Collects the process environment ("NAME=value" entries) into the
    // object `env`. False when `env` is not an object (or null).
    bool InitEnv(Json::Value& env);

    // ---- Description registry ----
    // Copies the defaults' "authLevel", "allowUser" and "priority" into
    // `desc` where absent; "requestFormat" defaults to "JSON".
    Json::Value& ApplyLibDef(Json::Value& desc);
    bool CheckLibDescription(Json::Value& desc);
    // Loads every *.lib file of the working directory into `table`.
    bool InitLibDesc(Json::Value& table);
    // Makes sure `api` is in `table`, loading the one file that declares it.
    // A name holding anything but letters, digits, ".", "_" and "-" is
    // refused before any file is touched.
    bool InitLibDesc(Json::Value& table, const std::string& api);
    bool InitLibDesc(Json::Value& table, APIRequest* req);
    // Errors 101, 102, 103, 104, 115, 116.
    bool CheckRequestParam(APIRequest* req, APIResponse* resp);

    // ---- Handler libraries ----
    bool OpenLib(APIRequest* req, _tag_API_TABLE** table, _tag_API_CHECK_TABLE** check);
    bool GetTableFunc(void* handle, _tag_API_TABLE** table);
    bool GetCheckTableFunc(void* handle, _tag_API_CHECK_TABLE** check);
    void CloseLib();

    // ---- Usage counter ----
    // Counts one call of the request's API, version and method when usage
    // data collection is on; never fails the call.
    void IncreaseCounter(APIRequest* req);

    APIRequest* request_;
    APIResponse* response_;
    // The registry, the library cache, the compound depth, the names of the
    // process.
    APIRunnerPrivate* d_;
};

}  // namespace VELA

#pragma GCC visibility pop
