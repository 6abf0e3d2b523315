// WebEntry: one web-API call from the web server's CGI interface. Run is the
// road of the call: Initialize builds the request from the environment, the
// query string, the body and the cookies; the dispatcher runs it; the reply
// goes to standard output (Output.cpp); callbacks run after it.
#include "webentry/WebEntry.h"

#include <cerrno>
#include <cstdlib>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <unistd.h>

#include "access/SharingCheck.h"
#include "request/APIRequestPrivate.h"
#include "request/EncryptedParams.h"
#include "request/RequestFacts.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/relay.h"
#include "vela/sharing.h"
#include "vela/upload.h"
#include "vela/vlibc.h"
#include "vela/uploaddir.h"
#include "vela/webapiutil.h"
#include "vela/webserver.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIUpload.h"
#include "webentry/RequestLimits.h"

namespace VELA {

namespace {

// A form-encoded body larger than this is refused before anything is
// allocated for it; uploads are streamed and not bound by it.
constexpr long long kMaxPostBody = VELACGI_MAX_PARAM_LINE;
// The largest upload relayed to a peer (it streams; nothing is stored here).
constexpr long long kMaxRelayBody = 1LL << 40;

// The word a client reads for a failed relay (the manager's error).
const char* RelayReason(int error)
{
    switch (error) {
    case CredRequestMgr::kUnknownPeer:
        return "unknown peer";
    case CredRequestMgr::kPeersFile:
        return "peers not configured";
    case CredRequestMgr::kLibrary:
        return "relay unavailable";
    case CredRequestMgr::kConnect:
        return "peer unreachable";
    case CredRequestMgr::kTimeout:
        return "peer timed out";
    case CredRequestMgr::kTls:
        return "peer certificate refused";
    case CredRequestMgr::kBadAnswer:
        return "peer answer not JSON";
    case CredRequestMgr::kTooLarge:
        return "peer answer too large";
    case CredRequestMgr::kTransfer:
        return "transfer broken off";
    default:
        return "bad relay request";
    }
}

// RFC 6265 section 4.1.1 cookie-octet: what may stand in a cookie value
// without ending it or starting another cookie.
bool IsCookieValue(const std::string& value)
{
    for (char ch : value) {
        const unsigned char c = static_cast<unsigned char>(ch);
        if (c < 0x21 || c == 0x7f || c == '"' || c == ',' || c == ';' || c == '\\') {
            return false;
        }
    }
    return true;
}

bool Present(const APIParameter<std::string>& p)
{
    return p.IsSet() && !p.IsInvalid() && !p.IsReset();
}

// Reads exactly `want` bytes of standard input into `body`; false when the
// input ends (or fails) first, or sends nothing for `idleSeconds`.
bool ReadBody(std::string& body, size_t want, int idleSeconds)
{
    body.assign(want, '\0');
    size_t got = 0;
    while (got < want) {
        struct pollfd in = {STDIN_FILENO, POLLIN, 0};
        const int ready = poll(&in, 1, idleSeconds * 1000);
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        if (ready == 0) {
            VELA_LOG_ERR("body refused: nothing arrived for %d s (%zu of %zu bytes)", idleSeconds, got, want);
            return false;
        }
        const ssize_t n = ready < 0 ? -1 : read(STDIN_FILENO, &body[got], want - got);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            VELA_LOG_ERR("body truncated: %zu of %zu bytes (CONTENT_LENGTH) arrived", got, want);
            return false;
        }
        got += static_cast<size_t>(n);
    }
    return true;
}

// Standard input on /dev/null, so that nothing later reads a consumed body.
void StdinToDevNull()
{
    const int fd = open("/dev/null", O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return;
    }
    if (fd != STDIN_FILENO) {
        dup2(fd, STDIN_FILENO);
        close(fd);
    }
}

// The session id ("_sid"), access token ("tid") and sharing-link
// parameters ("_sharing_id", "_sharing_sid") of the query; a value is empty
// when its flag says it is absent.
struct IdentityParams {
    std::string sid, tid, sharingId, sharingSid;
    bool hasSid = false;
    bool hasTid = false;
    bool hasSharingId = false;
    bool hasSharingSid = false;  // with or without a sharing id
};

IdentityParams ReadIdentityParams(APIRequest* req)
{
    IdentityParams p;
    const struct {
        const char* name;
        std::string& value;
        bool& present;
    } params[] = {{"_sid", p.sid, p.hasSid},
                  {"tid", p.tid, p.hasTid},
                  {"_sharing_id", p.sharingId, p.hasSharingId},
                  {"_sharing_sid", p.sharingSid, p.hasSharingSid}};
    for (const auto& param : params) {
        const APIParameter<std::string> value = req->GetAndCheckString(param.name, APIRequest::OPTIONAL);
        param.present = Present(value);
        if (param.present) {
            param.value = value.Get();
        }
    }
    // An access token may come in the header X-Vela-Access-Token instead of
    // "tid" (a peer relaying a call presents it there): then it is not among
    // the parameters a handler reads, and may answer with.
    if (!p.hasTid) {
        const std::string header = RequestFacts::Text(req->GetEnv("HTTP_X_VELA_ACCESS_TOKEN"));
        if (!header.empty()) {
            p.tid = header;
            p.hasTid = true;
        }
    }
    return p;
}

// setenv(name, value); a failure is logged and, with a response, answered
// with 101.
bool SetEnv(const char* name, const std::string& value, APIResponse* resp)
{
    if (setenv(name, value.c_str(), 1) == 0) {
        return true;
    }
    VELA_LOG_ERR("setenv %s failed[%m]", name);
    if (resp != nullptr) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
    }
    return false;
}

// A sharing id becomes the sharing header; with it, a sharing session id
// joins the cookie header. A sharing session id alone changes nothing.
// `cookieCameIn`: the client sent a non-empty cookie header, which is what
// decides whether "; " separates what is appended (not the header as it
// stands after an earlier addition).
bool MoveSharingParams(const IdentityParams& p, bool cookieCameIn, APIResponse* resp, std::string& cookie,
                       std::string& sharingHeader)
{
    if (!p.hasSharingId) {
        return true;
    }
    sharingHeader = p.sharingId;
    if (!SetEnv(SZ_X_SHARING_HEADER, sharingHeader, resp)) {
        return false;
    }
    if (!p.hasSharingSid) {
        return true;
    }
    if (cookieCameIn) {
        cookie += "; ";
    }
    cookie += std::string(sharing::SZK_SHARING_SID) + "=" + p.sharingSid;
    return SetEnv("HTTP_COOKIE", cookie, resp);
}

// The session id of the query replaces the one of the cookie header: the
// first "id=" in the header (a plain substring search, which can also hit
// the end of a longer name) becomes "abandoned=", and the new id is
// appended; both only when the client sent a cookie header. Without a
// session id, an access token goes into the environment (a failure there
// sets no error).
bool MoveSessionParams(const IdentityParams& p, bool cookieCameIn, APIResponse* resp, std::string& cookie)
{
    if (!p.hasSid) {
        return !p.hasTid || SetEnv("velaAccessToken", p.tid, nullptr);
    }
    if (cookieCameIn) {
        cookie += "; ";
        const size_t at = cookie.find("id=");
        if (at != std::string::npos) {
            cookie.replace(at, 2, "abandoned");
        }
    }
    cookie += "id=" + p.sid;
    return SetEnv("HTTP_COOKIE", cookie, resp);
}

// Steps 7 to 11 of Initialize: the identity parameters of the query move
// into the process environment and the request's cookie header, where the
// session checks look for them.
bool MoveIdentityParams(APIRequest* req, APIResponse* resp, VELACGI_CTX* cgi)
{
    const IdentityParams p = ReadIdentityParams(req);
    if (!p.hasSid && !p.hasTid && !p.hasSharingId && !p.hasSharingSid) {
        return true;
    }
    // The values become part of a Cookie header: one that would end its
    // cookie and start another is refused.
    const bool sharingSid = p.hasSharingId && p.hasSharingSid;
    if ((p.hasSid && !IsCookieValue(p.sid)) || (sharingSid && !IsCookieValue(p.sharingSid))) {
        VELA_LOG_ERR("refused a session id parameter that is not a cookie value (%zu bytes)",
                     p.hasSid ? p.sid.size() : p.sharingSid.size());
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
        return false;
    }

    std::string cookie = RequestFacts::Text(req->GetEnv("HTTP_COOKIE"));
    std::string sharingHeader = RequestFacts::Text(req->GetEnv(SZ_X_SHARING_HEADER));
    const bool cookieCameIn = !cookie.empty();
    if (!MoveSharingParams(p, cookieCameIn, resp, cookie, sharingHeader) ||
        !MoveSessionParams(p, cookieCameIn, resp, cookie)) {
        return false;
    }

    // Both headers join the request's environment, empty ones included.
    VelaCgiLoadInCookies(cgi);
    Json::Value env(Json::objectValue);
    env["HTTP_COOKIE"] = cookie;
    env[SZ_X_SHARING_HEADER] = sharingHeader;
    req->InitEnv(env);
    return true;
}

// The permission check has run on the request's API, version and method:
// form fields of the upload never name another call. They are dropped from
// the fields merged into the request; one that differs is logged.
void KeepCheckedCall(const APIRequest* req, Json::Value& fields)
{
    const struct {
        const char* key;
        std::string checked;
    } call[] = {
        {"api", req->GetAPIClass()},
        {"version", std::to_string(req->GetAPIVersion())},
        {"method", req->GetAPIMethod()},
    };
    for (const auto& c : call) {
        const Json::Value* field = fields.find(c.key, c.key + strlen(c.key));
        if (field == nullptr) {
            continue;
        }
        const bool same = strcmp(c.key, "version") == 0
                              ? RequestFacts::Integer(*field, 0) == req->GetAPIVersion()
                              : RequestFacts::Text(*field) == c.checked;
        if (!same) {
            VELA_LOG_ERR("upload field \"%s\" ignored: the call checked is %s %s %s", c.key,
                         call[0].checked.c_str(), call[1].checked.c_str(), call[2].checked.c_str());
        }
        fields.removeMember(c.key);
    }
}

}  // namespace

WebEntry::WebEntry() : cgi_(nullptr), uploadedFiles_(Json::arrayValue), permission_(*this) {}

WebEntry::~WebEntry()
{
    uploadedFiles_ = Json::Value();
    VelaCgiFree(cgi_);
    cgi_ = nullptr;
}

bool WebEntry::Run(const Json::Value& /*unused*/)
{
    // A request the web server ends (the client went away) or a time limit
    // kills still removes what its upload stored.
    VELA::Transfer::UploadCleanupOnExit();
    bool served = false;
    try {
        if (Initialize(Json::Value()) && SetProcessName(request_, response_)) {
            served = request_->HasParam("relay_ds") ? ProcessRelay(request_, response_)
                                                    : Process(request_, response_);
        }
    } catch (const std::exception& e) {
        VELA_LOG_ERR("request aborted: %s", e.what());
        response_->SetError(WEBAPI_ERR_NO_RESPONSE);
        served = false;
    } catch (...) {
        VELA_LOG_ERR("request aborted");
        response_->SetError(WEBAPI_ERR_NO_RESPONSE);
        served = false;
    }
    if (response_->IsEnableOutput()) {
        OutputHeader();
        OutputBody();
    }
    RemoveUploadedFiles();
    if (response_->GetHttpdRestart()) {
        response_->SetCallbackFunc(RestartHttpd, nullptr);
    }
    HandleCallback(response_);
    return served;
}

bool WebEntry::Initialize(const Json::Value& /*unused*/)
{
    Json::Value env(Json::objectValue);
    Json::Value session(Json::objectValue);

    VelaCgiFree(cgi_);
    cgi_ = nullptr;
    if (VelaCgiInit("", &cgi_) != 0 || VelaCgiLoadInCookies(cgi_) != 0) {
        VELA_LOG_ERR("CGI library could not load the cookies");
    }
    request_->SetAttr("_collector_count_webapi", true);

    char lang[8] = "";
    if (VelaCgiGetLang(cgi_, lang, sizeof(lang)) != 0) {
        strcpy(lang, "enu");
    }
    session["uiLang"] = lang;
    request_->InitSession(session);

    if (!InitEnv(env)) {
        response_->SetError(WEBAPI_ERR_BAD_REQUEST);
        return false;
    }
    request_->InitEnv(env);
    env = Json::Value(Json::objectValue);  // now the parameters
    if (!InitParam(env)) {
        return false;
    }
    request_->InitParam(env, false);

    return MoveIdentityParams(request_, response_, cgi_);
}

bool WebEntry::InitParam(Json::Value& param)
{
    if (request_->HasEnv("QUERY_STRING")) {
        param["getParam"] = Json::Value(Json::objectValue);
        if (!InitGetParam(param["getParam"])) {
            return false;
        }
    }
    if (request_->GetRequestMethod() != REQUEST_METHOD_POST) {
        return true;
    }
    const Json::Value* get = param.isMember("getParam") ? &param["getParam"] : nullptr;
    const bool hasIdentity = get != nullptr && get->isObject() && get->isMember("api") &&
                             get->isMember("version") && get->isMember("method");
    param["postParam"] = Json::Value(Json::objectValue);
    if (request_->IsUploadRequest()) {
        // The result of an upload is read by a browser frame as plain text.
        response_->SetHeader("Content-type", "text/plain; charset=\"UTF-8\"");
        if (hasIdentity || LoadUploadAPIDesc(param["postParam"])) {
            return true;
        }
        response_->SetError(WEBAPI_ERR_BAD_REQUEST);
        return false;
    }
    if (InitPostParam(param["postParam"])) {
        return true;
    }
    response_->SetError(WEBAPI_ERR_BAD_REQUEST);
    return false;
}

bool WebEntry::InitGetParam(Json::Value& getParam)
{
    const Json::Value query = request_->GetEnv("QUERY_STRING");
    if (!query.isString() || !DetectAndDecryptParamLine(query.asString(), getParam)) {
        response_->SetError(WEBAPI_ERR_BAD_REQUEST);
        return false;
    }
    return true;
}

bool WebEntry::InitPostParam(Json::Value& postParam)
{
    if (!postParam.isObject() || request_->IsUploadRequest()) {
        return false;
    }
    const Json::Value lengthText = request_->GetEnv("CONTENT_LENGTH");
    const long long length = RequestFacts::ContentLength(lengthText, kMaxPostBody);
    if (length < 0) {
        VELA_LOG_ERR("body refused: CONTENT_LENGTH \"%.32s\" is not a length of at most %lld bytes",
                     RequestFacts::Text(lengthText).c_str(), kMaxPostBody);
        return false;
    }
    if (length == 0) {
        VELA_LOG_ERR("body refused: empty POST body");
        return false;
    }
    std::string body;
    const bool complete = ReadBody(body, static_cast<size_t>(length), LoadRequestLimits().bodyIdleSeconds);
    StdinToDevNull();
    // A NUL byte inside the body is refused with the rest of the line.
    return complete && DetectAndDecryptParamLine(body, postParam);
}

bool WebEntry::DetectAndDecryptParamLine(const std::string& line, Json::Value& out)
{
    return EncryptedParams::DecryptLine(line, out);
}

bool WebEntry::DecryptParam(const std::string& cipher, Json::Value& out)
{
    return EncryptedParams::DecryptCipher(cipher, out);
}

bool WebEntry::DecryptAESParam(Json::Value& param) { return EncryptedParams::DecryptAES(param); }

// The identity of an upload whose query string lacks it comes from the form
// fields before the first file part. The platform keeps one multipart reader
// per process over standard input, so the fields read here stay with it and
// the rest of the body waits for HandleUpload (or a deferring handler).
bool WebEntry::LoadUploadAPIDesc(Json::Value& postParam)
{
    if (!postParam.isObject() && !postParam.isNull()) {
        return false;
    }
    unsigned long long length = 0;
    char fileName[512] = "";
    char fieldName[512] = "";
    char fieldValue[512] = "";
    const int rc = VelaCgiLoadUploadParams(cgi_, nullptr, &length, fileName, sizeof(fileName), fieldName,
                                           sizeof(fieldName), fieldValue, sizeof(fieldValue));
    if (rc != VELA_UPLOAD_OK) {
        VELA_LOG_ERR("upload refused: its leading form fields could not be read[%d]", rc);
        return false;
    }
    const Json::Value fields = WebAPIUtil::SzHashToJsonObj(VelaCgiGetUploadParams(cgi_));
    for (const char* key : {"api", "version", "method"}) {
        if (!fields.isMember(key)) {
            VELA_LOG_ERR("upload refused: no \"%s\" in the query or before the first file part", key);
            return false;
        }
    }
    for (const char* key : {"api", "version", "method"}) {
        postParam[key] = fields[key];
    }
    return true;
}

bool WebEntry::HandleUpload(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    if (GetMethodAttr(req, "deferUpload")) {
        return true;  // the handler reads the body itself
    }
    Json::Value param(Json::objectValue);
    param["postParam"] = Json::Value(Json::objectValue);
    APIUpload upload(req);
    const int rc = upload.GetUploadAll(param["postParam"], &uploadedFiles_);
    if (rc != UPLOAD_RESULT_SUCCESS) {
        Json::Value detail(Json::objectValue);
        detail["upload_err"] = rc;
        resp->SetError(WEBAPI_ERR_UPLOAD_FAILED, detail);
        return false;
    }
    KeepCheckedCall(req, param["postParam"]);
    req->InitParam(param, false);
    return true;
}

// The files an upload stored are the handler's during the call; a handler
// that keeps one moves it out of the request's private upload directory.
// The directory goes afterwards with whatever is still in it, so that no
// upload outlives its request (the front end's and a deferring handler's
// alike).
void WebEntry::RemoveUploadedFiles()
{
    VELA::Transfer::UploadDirRemove();  // logs what it cannot remove
    uploadedFiles_ = Json::Value(Json::arrayValue);
}

// A relayed call (parameter "relay_ds") goes to the peer of that name in the
// peers file, under the peer's access token; this server only checks that
// its caller may relay. Order: the session (with "allowTimeout", or
// "skipTimeout" of a method that must not depend on the idle timer), the
// relay privilege, "relay_timeout" (1 to 3600 seconds, default 60), then the
// exchange. The peer's JSON answer is the answer, its error codes included;
// a file answer (a download, ranges too) streams through. Failures of the
// exchange answer 109 with {"reason": ...}.
bool WebEntry::ProcessRelay(APIRequest* req, APIResponse* resp)
{
    const bool allowTimeout = GetMethodAttr(req, "allowTimeout") || GetMethodAttr(req, "skipTimeout");
    if (!permission_.CheckRelay(req, resp, allowTimeout, cgi_)) {
        return false;
    }
    const std::string target = RequestFacts::Text(req->GetParam("relay_ds"));
    long long timeout = CredRequestMgr::kDefaultTimeout;
    if (req->HasParam("relay_timeout")) {
        timeout = RequestFacts::CheckedInteger(req->GetParam("relay_timeout"), 1, CredRequestMgr::kMaxTimeout, -1);
        if (timeout < 0) {
            VELA_LOG_ERR("relay refused: relay_timeout is not 1 to %d seconds", CredRequestMgr::kMaxTimeout);
            resp->SetError(WEBAPI_ERR_BAD_REQUEST);
            return false;
        }
    }

    CredRequestMgr::RelayRequest relay;
    if (req->IsUploadRequest()) {
        // The body streams through unread: the call must be named by the
        // query string, whose parameters are then all there is.
        Json::Value query(Json::objectValue);
        const long long length = RequestFacts::ContentLength(req->GetEnv("CONTENT_LENGTH"), kMaxRelayBody);
        if (!DetectAndDecryptParamLine(RequestFacts::Text(req->GetEnv("QUERY_STRING")), query) ||
            !query.isMember("api") || !query.isMember("version") || !query.isMember("method") || length < 0) {
            VELA_LOG_ERR("relay refused: an upload names its call in the query string and has a length");
            resp->SetError(WEBAPI_ERR_BAD_REQUEST);
            return false;
        }
        relay.params = query;
        relay.bodyFd = STDIN_FILENO;
        relay.contentLength = length;
        relay.contentType = RequestFacts::Text(req->GetEnv("CONTENT_TYPE"));
    } else {
        relay.params = req->GetPrivate()->GetData("param", "", Json::Value(Json::objectValue));
        relay.post = true;
    }
    // What names this server's caller or the relay itself stays here.
    for (const char* name : {"relay_ds", "relay_timeout", "_sid", "tid", "_sharing_id", "_sharing_sid", "VelaToken"}) {
        relay.params.removeMember(name);
    }
    const char* range = getenv("HTTP_RANGE");
    relay.range = range != nullptr && strlen(range) <= 256 ? range : "";
    relay.outFd = STDOUT_FILENO;

    CredRequestMgr mgr;
    mgr.SetTimeout(static_cast<int>(timeout));
    if (!mgr.AddRelayRequest(target, relay) || !mgr.Run()) {
        VELA_LOG_ERR("relay request fail[%d]: peer \"%.64s\": %s", mgr.GetError(),
                     System::IsCheckedName(target, System::kNameDotted, Relay::kMaxPeerName) ? target.c_str() : "?",
                     mgr.GetErrorText().c_str());
        if (mgr.Streamed()) {
            resp->SetEnableOutput(false);  // the answer's headers went out already
            return false;
        }
        Json::Value detail(Json::objectValue);
        detail["reason"] = RelayReason(mgr.GetError());
        resp->SetError(WEBAPI_ERR_RELAY_FAILED, detail);
        return false;
    }
    if (mgr.Streamed()) {
        resp->SetEnableOutput(false);
        return true;
    }
    const Json::Value& answer = mgr.GetResponse();
    if (answer["success"].asBool()) {
        resp->SetSuccess(answer["data"]);
        return true;
    }
    const Json::Value& error = answer["error"];
    const long long code = RequestFacts::Integer(error.isObject() ? error["code"] : Json::Value(), 0);
    if (code <= 0 || code > INT_MAX) {
        Json::Value detail(Json::objectValue);
        detail["reason"] = RelayReason(CredRequestMgr::kBadAnswer);
        resp->SetError(WEBAPI_ERR_RELAY_FAILED, detail);
        return false;
    }
    resp->SetError(static_cast<int>(code), error.isMember("errors") ? error["errors"] : Json::Value());
    return false;
}

bool WebEntry::CheckSharingPermission(APIRequest* req, APIResponse* resp)
{
    return SharingCheck::CheckSharingPermission(*this, req, resp, cgi_);
}

std::string WebEntry::GetSharingCheckLibPath(APIRequest* req) { return SharingCheck::GetSharingCheckLibPath(req); }

bool WebEntry::OpenSharingCheckLib(APIRequest* req, _tag_API_SHARING_CHECK_TABLE** table)
{
    return SharingCheck::OpenSharingCheckLib(req, table);
}

bool WebEntry::GetSharingCheckTableFunc(void* handle, _tag_API_SHARING_CHECK_TABLE** table)
{
    return SharingCheck::GetSharingCheckTableFunc(handle, table);
}

bool WebEntry::GetSharingCheckFunc(APIRequest* req, _tag_API_SHARING_CHECK_TABLE* table,
                                   bool (**check)(APIRequest*, APIResponse*))
{
    return SharingCheck::GetSharingCheckFunc(req, table, check);
}

int WebEntry::RegexMatch(const char* pattern, const char* text) { return SharingCheck::RegexMatch(pattern, text); }

bool WebEntry::CheckSharingAppPermission(APIRequest* req, APIResponse* resp)
{
    return SharingCheck::CheckSharingAppPermission(req, resp);
}

void WebEntry::InitSharingSession(APIRequest* req) { SharingCheck::InitSharingSession(req, cgi_); }

bool SharingChecker::Run(const Json::Value& unused)
{
    return Initialize(unused) && CheckSharingAppPermission(GetRequest(), GetResponseObject());
}

bool WebEntry::NeedPermission(APIRequest* req) { return PermissionCheck::NeedPermission(req); }

bool WebEntry::CheckPermission(APIRequest* req, APIResponse* resp)
{
    return permission_.CheckPermission(req, resp, cgi_);
}

bool WebEntry::SkipPermission(APIRequest* req) { return PermissionCheck::SkipPermission(req); }

int WebEntry::CheckPermission(bool allowTimeout) { return permission_.CheckPermission(allowTimeout, cgi_); }

void RestartHttpd(void* /*unused*/)
{
    velaw3::Engine engine;
    velaw3::TARN(engine).RestartService();  // logs its own refusals
}

}  // namespace VELA
