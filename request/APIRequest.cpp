#include "webapi/APIRequest.h"

#include <climits>
#include <cstdlib>
#include <strings.h>

#include "request/APIRequestPrivate.h"
#include "request/RequestFacts.h"
#include "vela/cgi.h"
#include "vela/vlibc.h"

namespace VELA {

namespace {

const Json::Value& Null()
{
    static const Json::Value kNull;
    return kNull;
}

const char* const kAllowUserNames[] = {"admin.local", "admin.domain", "admin.ldap",
                                       "normal.local", "normal.domain", "normal.ldap"};
const int kAllowUserBits[] = {ALLOW_ADMIN_LOCAL, ALLOW_ADMIN_DOMAIN, ALLOW_ADMIN_LDAP,
                              ALLOW_NORMAL_LOCAL, ALLOW_NORMAL_DOMAIN, ALLOW_NORMAL_LDAP};

const size_t kPreferenceDirSize = 1024;

}  // namespace

// ---- Lifetime ---------------------------------------------------------------

APIRequest::APIRequest(const Json::Value& request) : d_(new APIRequestPrivate(this))
{
    if (!request.isObject() || request.empty()) {
        return;
    }
    if (request.isMember("environ")) {
        InitEnv(request["environ"]);
    }
    if (request.isMember("getParam") || request.isMember("postParam")) {
        InitParam(request, false);
    }
    if (request.isMember("reqLib")) {
        InitAPIInfo(request["reqLib"]);
    }
    if (request.isMember("session")) {
        InitSession(request["session"]);
    }
}

APIRequest::APIRequest(const APIRequest& other) : d_(new APIRequestPrivate(*other.d_, this)) {}

APIRequest::~APIRequest() { delete d_; }

void APIRequest::InitEnv(const Json::Value& env) { d_->InitEnv(env); }

void APIRequest::InitParam(const Json::Value& request, bool reset) { d_->InitParam(request, reset); }

void APIRequest::InitAPIInfo(const Json::Value& info) { d_->InitAPIInfo(info); }

void APIRequest::InitSession(const Json::Value& session) { d_->InitSession(session); }

// ---- Generic accessors -------------------------------------------------------

bool APIRequest::HasEnv(const std::string& name) const { return d_->HasData("environ", name); }

Json::Value APIRequest::GetEnv(const std::string& name, const Json::Value& def) const
{
    return d_->GetData("environ", name, def);
}

bool APIRequest::HasParam(const std::string& name) const { return d_->HasData("param", name); }

Json::Value APIRequest::GetParam(const std::string& name, const Json::Value& def) const
{
    return d_->GetData("param", name, def);
}

const Json::Value& APIRequest::GetParamRef(const std::string& name, const Json::Value& def) const
{
    return d_->GetData("param", name, def);
}

bool APIRequest::HasAttr(const std::string& name) const { return d_->HasData("attr", name); }

Json::Value APIRequest::GetAttr(const std::string& name, const Json::Value& def) const
{
    return d_->GetData("attr", name, def);
}

bool APIRequest::SetAttr(const std::string& name, const Json::Value& value)
{
    return d_->SetData("attr", name, value, false);
}

bool APIRequest::HasCookie(const std::string& name) const { return d_->HasData("cookie", name); }

std::string APIRequest::GetCookie(const std::string& name, const std::string& def) const
{
    const Json::Value& v = d_->GetData("cookie", name, Null());
    return v.isString() ? v.asString() : def;
}

bool APIRequest::SetCookie(const std::string& name, const std::string& value)
{
    return d_->SetData("cookie", name, value, true);
}

Json::Value APIRequest::GetAPIInfo(const std::string& key, const Json::Value& def) const
{
    return d_->GetData("reqLib", key, def);
}

std::string APIRequest::GetAPIClass() const { return d_->apiClass; }

int APIRequest::GetAPIVersion() const { return d_->apiVersion; }

std::string APIRequest::GetAPIMethod() const { return d_->apiMethod; }

int APIRequest::GetRequestMethod() const { return d_->requestMethod; }

void APIRequest::SetAuthResult(_tag_authorized_result_ result)
{
    d_->SetData("session", "authResult", Json::Value(static_cast<int>(result)), false);
}

_tag_authorized_result_ APIRequest::GetAuthResult() const
{
    long long v = RequestFacts::Integer(d_->GetData("session", "authResult", Null()), AUTH_RESULT_NONE);
    if (v < INT_MIN || v > INT_MAX) {
        v = AUTH_RESULT_NONE;
    }
    return static_cast<_tag_authorized_result_>(v);
}

bool APIRequest::IsDemoMode() const { return false; }

// ---- URL and protocol -----------------------------------------------------------

std::string APIRequest::GetURLProto(const std::string& def) const
{
    d_->InitURL();
    return d_->HasData("url", "urlProto") ? d_->GetText("url", "urlProto") : def;
}

std::string APIRequest::GetURLHost(const std::string& def) const
{
    d_->InitURL();
    return d_->HasData("url", "urlHost") ? d_->GetText("url", "urlHost") : def;
}

int APIRequest::GetURLPort(int def) const
{
    d_->InitURL();
    if (!d_->HasData("url", "urlPort")) {
        return def;
    }
    // Port text is not validated; text that is not a decimal number in range
    // reads as 0.
    long long port = RequestFacts::Integer(d_->GetData("url", "urlPort", Null()), 0);
    return (port < INT_MIN || port > INT_MAX) ? 0 : static_cast<int>(port);
}

std::string APIRequest::GetURLPath(const std::string& def) const
{
    d_->InitURL();
    return d_->HasData("url", "urlPath") ? d_->GetText("url", "urlPath") : def;
}

std::string APIRequest::GetURLName(const std::string& def) const
{
    d_->InitURL();
    return d_->HasData("url", "urlName") ? d_->GetText("url", "urlName") : def;
}

std::string APIRequest::GetRemoteIP() const
{
    if (!d_->HasData("environ", "vela_remoteIP")) {
        char buffer[65] = {0};
        if (VelaCgiGetRemoteIP(buffer, sizeof(buffer)) == 0) {
            buffer[sizeof(buffer) - 1] = '\0';
            d_->SetData("environ", "vela_remoteIP", std::string(buffer), true);
        }
    }
    return d_->GetText("environ", "vela_remoteIP");
}

// ---- Client kind -------------------------------------------------------------------

#define VELA_UA_FLAG(Accessor, key)            \
    bool APIRequest::Accessor() const          \
    {                                          \
        d_->InitUA();                          \
        return d_->GetBool("userAgent", key, false); \
    }
VELA_UA_FLAG(IsMobile, "uaMobile")
VELA_UA_FLAG(IsMobileDevice, "uaMobileDevice")
VELA_UA_FLAG(IsIPhone, "uaIPhone")
VELA_UA_FLAG(IsAndroid, "uaAndroid")
VELA_UA_FLAG(IsIEMobile, "uaIEMobile")
VELA_UA_FLAG(IsIPad, "uaIPad")
VELA_UA_FLAG(IsPlayBook, "uaPlayBook")
VELA_UA_FLAG(IsBlackBerry6, "uaBlackBerry6")
VELA_UA_FLAG(IsWebKit, "uaWebKit")
VELA_UA_FLAG(IsSupportWebApp, "uaSupportWebAPP")
#undef VELA_UA_FLAG

// ---- Session and identity -------------------------------------------------------------

std::string APIRequest::GetSessionID() const { return GetCookie("id", ""); }

const char* APIRequest::GetVelaAccessTokenID() const { return getenv("velaAccessToken"); }

bool APIRequest::IsTokenEnable() const
{
    VELACGI_CTX* ctx = nullptr;
    if (VelaCgiInit("", &ctx) != 0 || !ctx) {
        return false;
    }
    bool enabled = VelaCgiLoadInCookies(ctx) == 0 && VelaCgiIsTokenEnable(ctx) != 0;
    VelaCgiFree(ctx);
    return enabled;
}

uid_t APIRequest::GetLoginUID() const { return d_->GetLoginUID(); }

std::string APIRequest::GetLoginUserName() const { return d_->GetText("session", "username"); }

bool APIRequest::IsAdmin() const { return d_->GetBool("session", "isAdmin", false); }

bool APIRequest::IsSkipCheckIP() const { return d_->GetBool("session", "isSkipCheckIP", true); }

bool APIRequest::IsTimeout() const { return d_->GetBool("session", "isTimeout", true); }

int APIRequest::GetTimeoutDuration() const
{
    long long v = RequestFacts::Integer(d_->GetData("session", "timeout", Null()), 0);
    return (v < INT_MIN || v > INT_MAX) ? 0 : static_cast<int>(v);
}

bool APIRequest::IsAuthorized() const { return d_->GetBool("session", "isAuthorized", false); }

std::string APIRequest::GetApplication() const { return d_->GetText("session", "app"); }

std::string APIRequest::GetWebAPIPriv() const { return d_->GetText("session", "webapi"); }

std::string APIRequest::GetSessionFilePath() const { return d_->GetText("session", "sessFile"); }

std::string APIRequest::GetUILanguage() const
{
    static const Json::Value kDefault("enu");
    const Json::Value& lang = d_->GetData("session", "uiLang", kDefault);
    return lang.isString() ? lang.asString() : std::string();
}

bool APIRequest::HasAppPriv(const std::string& priv) const
{
    static const Json::Value kEmpty("");
    return d_->GetData("session", "appPriv", kEmpty) == Json::Value(priv);
}

int APIRequest::GetAllowUser() const
{
    long long cached = RequestFacts::Integer(d_->GetData("session", "allowUser", Null()), 0);
    if (cached != 0 && cached >= INT_MIN && cached <= INT_MAX) {
        return static_cast<int>(cached);
    }
    static const Json::Value kEmptyList(Json::arrayValue);
    const Json::Value& list = d_->GetData("reqLib", "allowUser", kEmptyList);
    if (!list.isArray() || list.empty()) {
        return 0;
    }
    int mask = 0;
    for (const Json::Value& entry : list) {
        if (!entry.isString()) {
            continue;
        }
        const std::string name = entry.asString();
        for (size_t i = 0; i < sizeof(kAllowUserBits) / sizeof(kAllowUserBits[0]); ++i) {
            if (name == kAllowUserNames[i]) {
                mask |= kAllowUserBits[i];
            }
        }
    }
    d_->SetData("session", "allowUser", mask, false);
    return mask;
}

std::string APIRequest::GetPreferenceDir() const
{
    char buffer[kPreferenceDirSize] = {0};
    if (VELAUserPreferenceDirGet(GetLoginUserName().c_str(), buffer, sizeof(buffer)) < 0) {
        return "/tmp";
    }
    buffer[sizeof(buffer) - 1] = '\0';
    return buffer;
}

std::string APIRequest::GetGroupPreferenceDir(const std::string& group) const
{
    char buffer[kPreferenceDirSize] = {0};
    if (VELAGroupPreferenceDirGet(group.c_str(), buffer, sizeof(buffer)) < 0) {
        return "/tmp";
    }
    buffer[sizeof(buffer) - 1] = '\0';
    return buffer;
}

bool APIRequest::IsPollingTask() const
{
    return d_->HasData("environ", "task_id") && d_->HasData("environ", "task_user");
}

std::string APIRequest::GetPollingTaskId() const { return d_->GetText("environ", "full_task_id"); }

bool APIRequest::IsUploadRequest() const
{
    const std::string contentType = d_->GetText("environ", "CONTENT_TYPE");
    if (!contentType.empty() && contentType.find("multipart/form-data") != std::string::npos) {
        return true;
    }
    return IsSliceUploadRequest();
}

bool APIRequest::IsSliceUploadRequest() const
{
    return strcasecmp(d_->GetText("environ", "HTTP_X_TYPE_NAME").c_str(), "SLICEUPLOAD") == 0;
}

// ---- Sharing link ----------------------------------------------------------------------

bool APIRequest::IsSharing() const { return !d_->sharingID.empty(); }

std::string APIRequest::GetSharingID() const { return d_->sharingID; }

std::string APIRequest::GetSharingSID() const { return d_->sharingSID; }

sharing::record::Entry APIRequest::GetSharingEntry() const { return d_->sharingEntry; }

sharing::record::Session APIRequest::GetSharingSession() const { return d_->sharingSession; }

sharing::record::Token APIRequest::GetSharingToken() const { return d_->sharingToken; }

std::string APIRequest::GetSharingURL(const std::string& def) const
{
    d_->InitSharingURL();
    const Json::Value& url = d_->GetData("url", "urlSharing", Json::Value::nullSingleton());
    return url.isString() ? url.asString() : def;
}

sharing::_tag_SHARING_URL_TYPE APIRequest::GetSharingURLType() const
{
    d_->InitSharingURL();
    return d_->sharingURLType;
}

}  // namespace VELA
