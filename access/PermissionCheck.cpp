// The session permission check: whether a method needs a login, the
// login-session / access-token verdict with its cache, the user classes and
// application privilege of the API.
//
// The platform's verdict (VelaCgiIsAuthorizedEx, VelaAccessTokenGrant) is
// computed at most once per process for each value of "allowTimeout" and kept
// in permission_["permResult"]: slot 0 with timeout allowed, slot 1 without.
#include "access/PermissionCheck.h"

#include <errno.h>
#include <json/json.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <string>

#include "dispatcher/Refusal.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/relay.h"
#include "vela/token.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace VELA {

namespace {

// Room for any user name the platform hands back, terminator included.
constexpr size_t kUserNameSize = 493;

// The token refusal's line, "WebEntry:566 Token Authentication Fail.": log
// watchers and fail2ban-style filters match its whole text, so its source
// and line are fixed instead of following this file's name and layout.
struct FixedLogLine {
    const char* source;
    int line;
    const char* text;
};
constexpr FixedLogLine kTokenFail = {"WebEntry", 566, "Token Authentication Fail."};

// The API's "authLevel": 0 no login, 1 login required, 2 checked but not
// enforced. Absent or not a number counts as 1, the safe side.
int AuthLevel(const APIRequest* req)
{
    const Json::Value level = req->GetAPIInfo("authLevel", Json::Value(1));
    if (level.isInt()) {
        return level.asInt();
    }
    return 1;
}

// The error code of a platform verdict; 105 outside -8 .. 2.
int VerdictToError(int verdict)
{
    static const int kTable[] = {
        WEBAPI_ERR_REMOTE_IP,         // -8 client address refused
        WEBAPI_ERR_NO_PERMISSION,     // -7 anti-forgery token missing
        WEBAPI_ERR_NO_PERMISSION,     // -6
        WEBAPI_ERR_NOT_AUTHENTICATED, // -5 no credentials, token refused
        WEBAPI_ERR_NO_PERMISSION,     // -4
        WEBAPI_ERR_NO_PERMISSION,     // -3
        WEBAPI_ERR_NO_PERMISSION,     // -2 no such session
        WEBAPI_ERR_SESSION_TIMEOUT,   // -1 idle timeout passed
        WEBAPI_ERR_NO_PERMISSION,     //  0
        WEBAPI_ERR_NONE,              //  1 authorised
        WEBAPI_ERR_NONE,              //  2 authorised
    };
    if (verdict < -8 || verdict > 2) {
        return WEBAPI_ERR_NO_PERMISSION;
    }
    return kTable[verdict + 8];
}

// The word the client reads beside a refusal's code; null for none.
const char* ServerErrorWord(int code)
{
    switch (code) {
    case WEBAPI_ERR_SESSION_TIMEOUT:
        return "timeout";
    case WEBAPI_ERR_NOT_AUTHENTICATED:
        return "unauth";
    case WEBAPI_ERR_REMOTE_IP:
        return "errorip";
    case WEBAPI_ERR_NO_PERMISSION:
        return "noprivilege";
    default:
        return nullptr;
    }
}

// "admin." or "normal." followed by the user's origin: "domain" for
// DOMAIN\user, "ldap" for user@realm, else "local".
std::string UserClass(bool isAdmin, const std::string& user)
{
    std::string cls = isAdmin ? "admin." : "normal.";
    if (user.find('\\') != std::string::npos) {
        cls += "domain";
    } else if (user.find('@') != std::string::npos) {
        cls += "ldap";
    } else {
        cls += "local";
    }
    return cls;
}

// Whole decimal number of an option text; 0 for anything else.
int DecimalOption(const char* text)
{
    long long value = 0;
    if (text == nullptr || !System::ParseDecimal(text, strlen(text), 0, INT_MAX, value)) {
        return 0;
    }
    return static_cast<int>(value);
}

// The session facts of the user the platform named for `verdict`, from the
// login options and the session the platform put into the CGI handle.
Json::Value StoreSessionFacts(APIRequest* req, VELACGI_CTX* cgi, const char* user, int verdict)
{
    setenv("VELA_WEBAPI_USERNAME", user, 1);
    int timeout = DecimalOption(VelaCgiGetOption(cgi, VELACGI_OPT_TIMEOUT, "0"));
    if (timeout == 0) {
        timeout = VelaCgiGetTimeout(cgi);
    }
    const char* skipOption = VelaCgiGetOption(cgi, VELACGI_OPT_SKIP_IP, nullptr);
    const bool skipIP = skipOption == nullptr ? VelaCgiGetSkipCheckIP(cgi) == 1 : strcmp(skipOption, "1") == 0;
    char lang[8] = "";
    VelaCgiGetLang(cgi, lang, sizeof(lang));
    const char* app = VelaCgiGetOption(cgi, VELACGI_OPT_APP, "");
    const char* webapi = VelaCgiGetOption(cgi, VELACGI_OPT_WEBAPI, "");
    const char* sessFile = VelaCgiGetSessionFile(cgi);

    Json::Value session(Json::objectValue);
    session["username"] = user;
    session["isAdmin"] = user[0] != '\0' && VLIBGroupIsAdminGroupMem(user, 0) == 1;
    session["sessFile"] = sessFile != nullptr ? sessFile : "";
    session["isTimeout"] = verdict == AUTH_RESULT_TIMEOUT;
    session["timeout"] = timeout;
    session["isSkipCheckIP"] = skipIP;
    session["uiLang"] = lang;
    session["app"] = app != nullptr ? app : "";
    session["webapi"] = webapi != nullptr ? webapi : "";
    session["isAuthorized"] = true;
    req->InitSession(session);
    return session;
}

// Sets the session check's `code` on `resp`; a refusal that is enforced
// logs one line. `verdict` is the cached verdict that gave the code.
void RecordCode(APIRequest* req, APIResponse* resp, int code, const Json::Value& verdict)
{
    if (code == WEBAPI_ERR_NONE) {
        resp->SetError(code);
    } else if (verdict.isInt() && verdict.asInt() == AUTH_RESULT_TOKEN_MISSING && AuthLevel(req) == 1) {
        RefuseAt(resp, code, kTokenFail.source, kTokenFail.line, "%s", kTokenFail.text);
    } else if (AuthLevel(req) == 2) {
        // Checked but not required: the call goes on, so this is no refusal
        // and logs nothing.
        resp->SetError(code);
    } else {
        VELA_REFUSE(resp, code, "session check refused %s %s (verdict %d)", LogSafe(req->GetAPIClass()).c_str(),
                    LogSafe(req->GetAPIMethod()).c_str(), verdict.isInt() ? verdict.asInt() : 0);
    }
}

// The API's "appPriv" (empty: none) into `appPriv`; whether `user` holds it
// from the client's address.
bool HoldsAppPriv(APIRequest* req, const std::string& user, std::string& appPriv)
{
    const Json::Value privValue = req->GetAPIInfo("appPriv", Json::Value(""));
    appPriv = privValue.isString() ? privValue.asString() : "";
    return appPriv.empty() || VLIBAppPrivUserHas(user.c_str(), appPriv.c_str(), req->GetRemoteIP().c_str()) == 1;
}

// HoldsAppPriv, with 105 on `resp` and one line when it does not.
bool CheckAppPriv(APIRequest* req, APIResponse* resp, const std::string& user, std::string& appPriv)
{
    if (!HoldsAppPriv(req, user, appPriv)) {
        VELA_REFUSE(resp, WEBAPI_ERR_NO_PERMISSION, "user \"%s\" lacks the application privilege %s for %s",
                    LogSafe(user).c_str(), appPriv.c_str(), LogSafe(req->GetAPIClass()).c_str());
        return false;
    }
    return true;
}

// The session facts of an allowed call, read back from the request, with
// the application privilege that was checked.
void StoreCheckedSession(APIRequest* req, const std::string& user, const std::string& appPriv)
{
    Json::Value session(Json::objectValue);
    session["appPriv"] = appPriv;
    session["username"] = user;
    session["isAdmin"] = req->IsAdmin();
    session["sessFile"] = req->GetSessionFilePath();
    session["isTimeout"] = req->IsTimeout();
    session["timeout"] = req->GetTimeoutDuration();
    session["isSkipCheckIP"] = req->IsSkipCheckIP();
    session["uiLang"] = req->GetUILanguage();
    session["app"] = req->GetApplication();
    session["webapi"] = req->GetWebAPIPriv();
    session["isAuthorized"] = req->IsAuthorized();
    // The verdict is kept with the facts it produced.
    session["authResult"] = static_cast<int>(req->GetAuthResult());
    req->InitSession(session);
}

}  // namespace

PermissionCheck::PermissionCheck(APIRunner& runner)
    : runner_(runner), ownCgi_(nullptr), permission_(Json::objectValue)
{
    Json::Value slots(Json::arrayValue);
    slots.append(Json::Value());
    slots.append(Json::Value());
    permission_["permResult"] = slots;
}

PermissionCheck::~PermissionCheck()
{
    VelaCgiFree(ownCgi_);
    ownCgi_ = nullptr;
}

bool PermissionCheck::NeedPermission(const APIRequest* req)
{
    if (req == nullptr) {
        return true;
    }
    return AuthLevel(req) != 0;
}

bool PermissionCheck::SkipPermission(const APIRequest* req)
{
    if (req == nullptr) {
        return false;
    }
    return AuthLevel(req) == 2;
}

Json::Value& PermissionCheck::Slot(bool allowTimeout)
{
    Json::Value& slots = permission_["permResult"];
    if (!slots.isArray() || slots.size() != 2) {
        slots = Json::Value(Json::arrayValue);
        slots.append(Json::Value());
        slots.append(Json::Value());
    }
    return slots[allowTimeout ? 0 : 1];
}

VELACGI_CTX* PermissionCheck::Handle(VELACGI_CTX* cgi)
{
    if (cgi != nullptr) {
        return cgi;
    }
    // A check before the runner has a handle (a runner built by hand) still
    // needs one for the skip-IP flag and the session facts.
    if (ownCgi_ == nullptr && (VelaCgiInit("", &ownCgi_) != 0 || VelaCgiLoadInCookies(ownCgi_) != 0)) {
        VELA_LOG_ERR("cannot set up the CGI handle for the session check");
    }
    return ownCgi_;
}

int PermissionCheck::CheckPermission(bool allowTimeout, VELACGI_CTX* cgi)
{
    return CheckRequest(runner_.GetRequest(), allowTimeout, cgi);
}

int PermissionCheck::CheckRequest(APIRequest* req, bool allowTimeout, VELACGI_CTX* cgi)
{
    if (req == nullptr) {
        return WEBAPI_ERR_NO_PERMISSION;
    }
    Json::Value& slot = Slot(allowTimeout);
    Given& given = given_[allowTimeout ? 0 : 1];
    const std::string call = req->GetAPIClass() + "\n" + req->GetAPIMethod();
    if (slot.isInt() && (given.tokenCall.empty() || given.tokenCall == call)) {
        if (given.session.isObject() && !req->IsAuthorized()) {
            req->InitSession(given.session);  // another call of the same client
        }
        req->SetAuthResult(static_cast<_tag_authorized_result_>(slot.asInt()));
        return VerdictToError(slot.asInt());
    }
    const int verdict = AskPlatform(req, Handle(cgi), allowTimeout, given);
    req->SetAuthResult(static_cast<_tag_authorized_result_>(verdict));
    slot = verdict;
    return VerdictToError(verdict);
}

// The platform's verdict on the session id or, failing that, the access
// token of `req`; the session facts are stored whenever the platform named
// a user (also for a refused token, so that the reply knows who asked).
int PermissionCheck::AskPlatform(APIRequest* req, VELACGI_CTX* cgi, bool allowTimeout, Given& given)
{
    given = Given();
    const std::string sid = req->GetSessionID();
    const char* tokenEnv = req->GetVelaAccessTokenID();
    const std::string token = tokenEnv != nullptr ? tokenEnv : "";
    if (sid.empty() && token.empty()) {
        return AUTH_RESULT_UNAUTHENTICATED;
    }
    const std::string api = req->GetAPIClass();
    const std::string method = req->GetAPIMethod();
    if (runner_.GetMethodAttr(req, "skipCheckIP")) {
        VelaCgiSetSkipCheckIP(cgi, 1);
    }
    char user[kUserNameSize];
    memset(user, 0, sizeof(user));
    int verdict = AUTH_RESULT_NO_SESSION;
    bool facts = false;
    // The cookie arrives percent-decoded: an id holding a NUL byte would
    // reach the platform cut short, as some other id. It names no session.
    if (!sid.empty() && sid.find('\0') == std::string::npos) {
        VELACGI_SESSION_INFO info;
        // A page that polls by itself must not keep an idle session alive.
        const int flags = allowTimeout ? VELACGI_AUTH_NO_REFRESH : 0;
        verdict = VelaCgiIsAuthorizedEx(cgi, sid.c_str(), user, sizeof(user), &info, flags);
        facts = verdict >= 0;
    }
    if (!facts && !token.empty()) {
        const int granted = VelaAccessTokenGrant(token.c_str(), api.c_str(), method.c_str(), user, sizeof(user));
        verdict = granted < 0 ? AUTH_RESULT_UNAUTHENTICATED : AUTH_RESULT_AUTHORIZED;
        facts = true;
        given.tokenCall = api + "\n" + method;
    }
    if (facts) {
        user[sizeof(user) - 1] = '\0';
        given.session = StoreSessionFacts(req, cgi, user, verdict);
    }
    return verdict;
}

bool PermissionCheck::SessionAllowed(APIRequest* req, APIResponse* resp, bool allowTimeout, VELACGI_CTX* cgi)
{
    const int code = CheckRequest(req, allowTimeout, cgi);
    RecordCode(req, resp, code, Slot(allowTimeout));
    if (code != WEBAPI_ERR_NONE) {
        const char* word = ServerErrorWord(code);
        if (word != nullptr) {
            resp->SetServerError(word);
        }
        return false;
    }
    return true;
}

bool PermissionCheck::CheckRelay(APIRequest* req, APIResponse* resp, bool allowTimeout, VELACGI_CTX* cgi)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    if (!SessionAllowed(req, resp, allowTimeout, cgi)) {
        return false;
    }
    const std::string user = req->GetLoginUserName();
    if (VLIBAppPrivUserHas(user.c_str(), kRelayPrivilege, req->GetRemoteIP().c_str()) != 1) {
        VELA_REFUSE(resp, WEBAPI_ERR_NO_PERMISSION, "relay refused: %s lacks the privilege %s",
                    LogSafe(user).c_str(), kRelayPrivilege);
        resp->SetServerError("noprivilege");
        return false;
    }
    return true;
}

bool PermissionCheck::CheckPermission(APIRequest* req, APIResponse* resp, VELACGI_CTX* cgi)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    const bool allowTimeout = runner_.GetMethodAttr(req, "allowTimeout");
    if (!SessionAllowed(req, resp, allowTimeout, cgi)) {
        return false;
    }
    const std::string user = req->GetLoginUserName();
    std::string appPriv;
    if (!CheckUserClass(req, resp, user) || !CheckAppPriv(req, resp, user, appPriv)) {
        return false;
    }
    StoreCheckedSession(req, user, appPriv);
    return true;
}

// User classes: the method's own "allowUser" list replaces the API's. A
// missing, non-array or empty list admits every logged-in user.
bool PermissionCheck::ClassAdmitted(APIRequest* req, const std::string& cls)
{
    Json::Value allowUser = req->GetAPIInfo("allowUser", Json::Value());
    const Json::Value& method = runner_.GetMethod(req->GetAPIClass(), req->GetAPIVersion(), req->GetAPIMethod());
    if (method.isObject() && method.isMember("allowUser")) {
        allowUser = method["allowUser"];
    }
    if (!allowUser.isArray() || allowUser.empty()) {
        return true;
    }
    for (const Json::Value& entry : allowUser) {
        if (entry.isString() && entry.asString() == cls) {
            return true;
        }
    }
    return false;
}

bool PermissionCheck::CheckUserClass(APIRequest* req, APIResponse* resp, const std::string& user)
{
    const std::string cls = UserClass(req->IsAdmin(), user);
    if (ClassAdmitted(req, cls)) {
        return true;
    }
    VELA_REFUSE(resp, WEBAPI_ERR_NO_PERMISSION, "user \"%s\" (%s) may not call %s", LogSafe(user).c_str(),
                cls.c_str(), LogSafe(req->GetAPIClass()).c_str());
    return false;
}

bool PermissionCheck::UserMayCall(APIRequest* req)
{
    if (req == nullptr) {
        return false;
    }
    if (!NeedPermission(req)) {
        return true;
    }
    const std::string user = req->GetLoginUserName();
    std::string appPriv;
    if (ClassAdmitted(req, UserClass(req->IsAdmin(), user)) && HoldsAppPriv(req, user, appPriv)) {
        return true;
    }
    return SkipPermission(req);
}

}  // namespace VELA
