// The login API "VELA.Auth" (description VELA.Auth.lib): open to callers
// without a session, run as the superuser (run-as "system").
//
//   login   POST account, passwd: checks the password through PAM (Pam.cpp)
//           behind the brute-force guard (vela/loginguard.h), replaces the
//           caller's session ("id" cookie) with a new one and sets the cookie
//           "id"; answers {"sid", "token", "account", "isAdmin"}
//   logout  removes the caller's session and deletes the cookie
//   key     the public key of encrypted parameters: {"publicKey": <PEM>}
//
// Error codes of this API (besides the framework's 101 for a malformed
// call):
//   400  wrong account or password (also: unknown or locked account, and
//        the account name "system", the dispatcher's run-as name of the
//        superuser, which no login may take: refused without asking PAM)
//   401  right password, but it has expired and must be changed first
//   402  the login could not be completed on the server (logged)
//   403  the password came in the URL: the query string names "passwd" or
//        one of the encrypted forms that carry it (__cIpHeRtExT,
//        __nEkOtReHpIc, __tXeTrEhPiC). URLs end up in access logs and
//        browser histories, so the secret is read from the POST body only;
//        the refusal is logged without the query string
//   407  too many failed logins: blocked, {"waitSeconds": <seconds>}
#include <cstring>
#include <json/json.h>
#include <string>

#include "Pam.h"
#include "vela/audit.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/loginguard.h"
#include "vela/session.h"
#include "vela/user.h"
#include "vela/webapiutil.h"
#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

constexpr int kErrWrongPassword = 400;
constexpr int kErrPasswordExpired = 401;
constexpr int kErrServer = 402;
constexpr int kErrPasswordInUrl = 403;
constexpr int kErrBlocked = 407;

constexpr size_t kMaxAccount = VELA_LOGIN_ACCOUNT_MAX;
constexpr size_t kMaxPassword = 512;  // PAM's own bound of an answer

const char kCookie[] = "id";
const char kReservedName[] = "the account name \"" VELA_RUNAS_SUPERUSER "\" is reserved";

// Printable bytes only: no NUL, no other control byte, no DEL.
bool IsPrintable(const char* text, size_t len)
{
    for (size_t i = 0; i < len; ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        if (c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

// The string parameter `name` of 1 to `maxLen` printable bytes, without
// copying it. False when it is missing, not a string or not like that.
bool TextParam(const APIRequest* req, const char* name, size_t maxLen, const char*& text, size_t& len)
{
    static const Json::Value kNone;
    const Json::Value& v = req->GetParamRef(name, kNone);
    const char* begin = nullptr;
    const char* end = nullptr;
    if (!v.isString() || !v.getString(&begin, &end)) {
        return false;
    }
    len = static_cast<size_t>(end - begin);
    text = begin;
    return len >= 1 && len <= maxLen && IsPrintable(begin, len);
}

// The parameters that carry the password: the plain one and the encrypted
// forms, which may hold it.
const char* const kSecretParams[] = {"passwd", "__cIpHeRtExT", "__nEkOtReHpIc", "__tXeTrEhPiC"};
// Longer names are none of them, whatever their percent-encoding.
constexpr size_t kMaxSecretName = 3 * 16;

// True when the query string `query` names a parameter of kSecretParams.
// One pass over the text; names are decoded as the form parser decodes
// them ("%hh", "+"), each only when it is short enough to be one of them.
bool QueryCarriesSecret(const std::string& query)
{
    size_t start = 0;      // of the current pair
    bool inName = true;    // before the pair's "="
    for (size_t i = 0; i <= query.size(); ++i) {
        const bool pairEnd = i == query.size() || query[i] == '&';
        if (inName && (pairEnd || query[i] == '=')) {
            inName = false;
            if (i > start && i - start <= kMaxSecretName) {
                const std::string name = VELA::WebAPIUtil::URLDecode(query.substr(start, i - start), true);
                for (const char* secret : kSecretParams) {
                    if (name == secret) {
                        return true;
                    }
                }
            }
        }
        if (pairEnd) {
            start = i + 1;
            inName = true;
        }
    }
    return false;
}

// A user name PAM and NSS can be asked about: the platform's rule (no "/",
// ":", control byte, not "." or "..") and no leading "-", which helpers
// would read as an option.
bool IsAccount(const std::string& account)
{
    return VELAUserNameIsValid(account.c_str()) == 1 && account[0] != '-';
}

// A session id the store can be asked about: the cookie arrives
// percent-decoded, and an id holding a NUL byte would reach the store cut
// short, as another session's id.
bool IsSessionId(const std::string& sid) { return !sid.empty() && sid.find('\0') == std::string::npos; }

bool OverHttps(const APIRequest* req) { return req->GetURLProto("") == "https"; }

const char* ClientName(const std::string& clientIP)
{
    return clientIP.empty() ? "an unknown address" : clientIP.c_str();
}

// The account and password of a login, taken from the POST body only. False
// (the error set and logged) when the call does not carry them that way.
struct Credentials {
    std::string account;
    const char* password = nullptr;
    size_t passwordLen = 0;
};

bool ReadCredentials(const APIRequest* req, APIResponse* resp, const std::string& clientIP, Credentials& out)
{
    const Json::Value query = req->GetEnv("QUERY_STRING");
    if (query.isString() && QueryCarriesSecret(query.asString())) {
        VELA_LOG(LOG_AUTHPRIV | LOG_WARNING,
                 "login refused: a password in the query string, from %s; it must come in the POST body",
                 ClientName(clientIP));
        resp->SetError(kErrPasswordInUrl);
        return false;
    }
    if (req->GetRequestMethod() != VELA::REQUEST_METHOD_POST) {
        VELA_LOG_ERR("login refused: the credentials must come in a POST body");
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
        return false;
    }
    const char* accountText = nullptr;
    size_t accountLen = 0;
    const bool accountOk = TextParam(req, "account", kMaxAccount, accountText, accountLen);
    out.account = accountOk ? std::string(accountText, accountLen) : "";
    const char* bad = nullptr;
    if (!accountOk || !IsAccount(out.account)) {
        bad = "account";
    } else if (!TextParam(req, "passwd", kMaxPassword, out.password, out.passwordLen)) {
        bad = "passwd";
    }
    if (bad != nullptr) {
        VELA_LOG_ERR("login from %s refused: \"%s\" missing, empty, too long or not a valid text",
                     ClientName(clientIP), bad);
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
        return false;
    }
    return true;
}

// The password check. The run-as name of the superuser is never a login
// name: refused like a wrong password, and counted as one, without asking
// PAM. A name PAM settles on is held to the same rule.
VelaAuth::PamResult CheckPassword(const Credentials& creds, const std::string& clientIP, std::string& user,
                                  std::string& reason)
{
    if (VELA::System::RunAsIsSuperuser(creds.account.c_str())) {
        reason = kReservedName;
        return VelaAuth::PamResult::Denied;
    }
    VelaAuth::PamResult checked =
        VelaAuth::CheckPassword(creds.account, creds.password, creds.passwordLen, clientIP, user, reason);
    if (checked != VelaAuth::PamResult::Error && VELA::System::RunAsIsSuperuser(user.c_str())) {
        checked = VelaAuth::PamResult::Denied;
        reason = kReservedName;
    }
    return checked;
}

// A refused login in the audit trail: the account as given (never the
// password), the client address and the error answered.
void AuditRefusal(const char* name, const std::string& account, const std::string& clientIP, int code)
{
    VELA::Audit::Event event;
    event.name = name;
    event.user = account;
    event.address = clientIP;
    event.result = code;
    VELA::Audit::Record(event);
}

// The password check behind the brute-force guard. True when the login may
// go on as `user`; otherwise the error is set.
bool GuardedCheck(const Credentials& creds, const std::string& clientIP, VELA::Session::LoginSettings& settings,
                  APIResponse* resp, std::string& user)
{
    int wait = 0;
    const int verdict = VELA::Session::LoginGuardBegin(&settings, creds.account.c_str(), clientIP.c_str(), &wait);
    if (verdict == VELA_LOGIN_GUARD_BLOCKED) {
        Json::Value details(Json::objectValue);
        details["waitSeconds"] = wait;
        resp->SetError(kErrBlocked, details);
        AuditRefusal(VELA::Audit::kLoginBlocked, creds.account, clientIP, kErrBlocked);
        return false;
    }
    if (verdict != VELA_LOGIN_GUARD_ALLOW) {
        resp->SetError(kErrServer);
        return false;
    }
    std::string reason;
    const VelaAuth::PamResult checked = CheckPassword(creds, clientIP, user, reason);
    if (checked == VelaAuth::PamResult::Denied) {
        VELA::Session::LoginGuardFailed(&settings, creds.account.c_str(), clientIP.c_str(), reason.c_str());
        resp->SetError(kErrWrongPassword);
        AuditRefusal(VELA::Audit::kLoginFailed, creds.account, clientIP, kErrWrongPassword);
        return false;
    }
    if (checked == VelaAuth::PamResult::Error) {
        resp->SetError(kErrServer);
        return false;
    }
    VELA::Session::LoginGuardSucceeded(&settings, creds.account.c_str(), clientIP.c_str());
    if (checked == VelaAuth::PamResult::Expired) {
        VELA_LOG(LOG_AUTHPRIV | LOG_NOTICE, "login of \"%s\" refused: the password has expired", user.c_str());
        resp->SetError(kErrPasswordExpired);
        AuditRefusal(VELA::Audit::kLoginFailed, user, clientIP, kErrPasswordExpired);
        return false;
    }
    return true;
}

// Replaces the caller's session with a new one of `user` and sets its
// cookie; answers the session's facts.
void OpenSession(APIRequest* req, APIResponse* resp, const std::string& user, const std::string& clientIP,
                 const VELA::Session::LoginSettings& settings)
{
    const std::string oldSid = req->GetSessionID();
    if (IsSessionId(oldSid)) {
        VELA::Session::Remove(oldSid.c_str());
    }
    VELA::Session::Options options;
    options.idleTimeout = settings.idleTimeout;
    options.lifetime = settings.lifetime;
    options.tokenProtect = true;
    options.auditEvent = VELA::Audit::kLogin;  // the session's creation is the login
    char lang[4] = "";
    if (VelaCgiGetLang(nullptr, lang, sizeof(lang)) == 0) {
        options.lang = lang;
    }
    std::string sid;
    std::string token;
    if (VELA::Session::Create(user.c_str(), clientIP.empty() ? nullptr : clientIP.c_str(), &options, sid, token) != 0) {
        resp->SetError(kErrServer);
        return;
    }
    // A browser-session cookie: gone when the browser closes, never sent
    // along with requests of other sites, out of reach of scripts, and
    // marked Secure when the login came over HTTPS.
    if (!resp->AddCookie(kCookie, sid, "/", 0, "", OverHttps(req), true, "Strict")) {
        VELA::Session::Remove(sid.c_str());
        resp->SetError(kErrServer);
        return;
    }
    Json::Value data(Json::objectValue);
    data["sid"] = sid;
    data["token"] = token;
    data["account"] = user;
    data["isAdmin"] = VLIBGroupIsAdminGroupMem(user.c_str(), 0) == 1;
    resp->SetSuccess(data);
}

void Login(APIRequest* req, APIResponse* resp)
{
    const std::string clientIP = req->GetRemoteIP();
    Credentials creds;
    if (!ReadCredentials(req, resp, clientIP, creds)) {
        return;
    }
    VELA::Session::LoginSettings settings;
    VELA::Session::LoginSettingsLoad(&settings);
    std::string user;
    if (GuardedCheck(creds, clientIP, settings, resp, user)) {
        // A new login ends the session the caller came with.
        OpenSession(req, resp, user, clientIP, settings);
    }
}

void Logout(APIRequest* req, APIResponse* resp)
{
    const std::string sid = req->GetSessionID();
    if (IsSessionId(sid) && VELA::Session::Remove(sid.c_str(), VELA::Audit::kLogout) == -1) {
        VELA_LOG_ERR("logout: the session could not be removed");
        resp->SetError(kErrServer);
        return;
    }
    resp->AddCookie(kCookie, "", "/", -1, "", OverHttps(req), true, "Strict");
    resp->SetSuccess();
}

void Key(APIRequest*, APIResponse* resp)
{
    std::string pem;
    if (VelaCgiPublicKeyPEM(pem) != 0) {
        resp->SetError(kErrServer);
        return;
    }
    Json::Value data(Json::objectValue);
    data["publicKey"] = pem;
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Auth", 1, "login", VELA::APIGuarded<Login, kErrServer>},
    {"VELA.Auth", 1, "logout", VELA::APIGuarded<Logout, kErrServer>},
    {"VELA.Auth", 1, "key", VELA::APIGuarded<Key, kErrServer>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
