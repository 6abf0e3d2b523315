// The request a handler receives.
//
// It carries the CGI environment, the query and body parameters, the cookies,
// the login-session facts, free attributes set by the framework, and the
// identity (class, version, method) and description of the API being called.
// Accessors never throw and never report errors: a missing fact yields the
// default given by the caller or the fixed default documented here. Facts
// derived from the environment (URL, client kind, user id) are computed on
// first use and cached in the request.
#pragma once

#include <json/json.h>
#include <string>
#include <sys/types.h>

#include "vela/authresult.h"
#include "vela/sharing.h"
#include "webapi/APIParameter.h"

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
class APIRequestPrivate;
#pragma GCC visibility pop

// User classes an API admits (its description's "allowUser" list).
enum {
    ALLOW_ADMIN_LOCAL = 0x01,   // "admin.local"
    ALLOW_ADMIN_DOMAIN = 0x02,  // "admin.domain"
    ALLOW_ADMIN_LDAP = 0x04,    // "admin.ldap"
    ALLOW_NORMAL_LOCAL = 0x08,  // "normal.local"
    ALLOW_NORMAL_DOMAIN = 0x10, // "normal.domain"
    ALLOW_NORMAL_LDAP = 0x20,   // "normal.ldap"
};

// HTTP request method codes of GetRequestMethod().
enum {
    REQUEST_METHOD_UNKNOWN = 0,
    REQUEST_METHOD_GET = 1,
    REQUEST_METHOD_POST = 2,
    REQUEST_METHOD_HEAD = 3,
};

class VELA_EXPORT APIRequest {
public:
    typedef VELA::PARAM_NECESSITY PARAM_NECESSITY;
    static constexpr PARAM_NECESSITY REQUIRED = PARAM_REQUIRED;
    static constexpr PARAM_NECESSITY OPTIONAL = PARAM_OPTIONAL;

    // Builds a request from the request JSON: members "environ" (object of
    // strings), "getParam", "postParam", "reqLib" and "session", all
    // optional. Anything but a non-empty object gives an empty request.
    explicit APIRequest(const Json::Value& request = Json::Value());
    // Deep copy; the two requests share nothing afterwards.
    APIRequest(const APIRequest& other);
    APIRequest& operator=(const APIRequest&) = delete;
    virtual ~APIRequest();

    // ---- Set-up (front end and dispatcher) ----
    // Merges the string members of `env` into the environment, then
    // re-derives cookies, request method and sharing identifiers.
    void InitEnv(const Json::Value& env);
    // Merges "getParam", then "postParam" (decrypted first) into the
    // parameters; the body wins. `reset` clears the parameters first (the
    // API name, version and method stay until new parameters name others).
    void InitParam(const Json::Value& request, bool reset);
    // Replaces the API description.
    void InitAPIInfo(const Json::Value& info);
    // Replaces the session facts as a whole.
    void InitSession(const Json::Value& session);

    // ---- Generic accessors ----
    bool HasEnv(const std::string& name) const;
    Json::Value GetEnv(const std::string& name, const Json::Value& def = Json::Value()) const;
    bool HasParam(const std::string& name) const;
    Json::Value GetParam(const std::string& name, const Json::Value& def = Json::Value()) const;
    // The stored value itself, or `def` itself when absent. Valid while the
    // request lives and its parameters are not re-initialised.
    const Json::Value& GetParamRef(const std::string& name, const Json::Value& def) const;
    bool HasAttr(const std::string& name) const;
    Json::Value GetAttr(const std::string& name, const Json::Value& def = Json::Value()) const;
    // Any JSON type; false only for an empty name.
    bool SetAttr(const std::string& name, const Json::Value& value);
    bool HasCookie(const std::string& name) const;
    // The cookie when it is a string, else `def`.
    std::string GetCookie(const std::string& name, const std::string& def = "") const;
    // Changes this request's view only; nothing is sent to the client.
    bool SetCookie(const std::string& name, const std::string& value);
    // An entry of the API description; an empty key gives all of it.
    Json::Value GetAPIInfo(const std::string& key, const Json::Value& def = Json::Value()) const;
    std::string GetAPIClass() const;
    int GetAPIVersion() const;
    std::string GetAPIMethod() const;
    // REQUEST_METHOD_UNKNOWN, _GET, _POST or _HEAD.
    int GetRequestMethod() const;
    void SetAuthResult(_tag_authorized_result_ result);
    // AUTH_RESULT_NONE (-4) when no verdict was stored.
    _tag_authorized_result_ GetAuthResult() const;
    // Demo mode is never active in this system.
    bool IsDemoMode() const;

    // ---- URL and protocol (derived once, on first use) ----
    std::string GetURLProto(const std::string& def = "") const;
    std::string GetURLHost(const std::string& def = "") const;
    int GetURLPort(int def = 0) const;
    std::string GetURLPath(const std::string& def = "") const;
    std::string GetURLName(const std::string& def = "") const;
    // The client address, "" when unknown.
    std::string GetRemoteIP() const;

    // ---- Client kind (classified once, from the user agent) ----
    bool IsMobile() const;
    bool IsMobileDevice() const;
    bool IsIPhone() const;
    bool IsAndroid() const;
    bool IsIEMobile() const;
    bool IsIPad() const;
    bool IsPlayBook() const;
    bool IsBlackBerry6() const;
    bool IsWebKit() const;
    bool IsSupportWebApp() const;

    // ---- Session and identity ----
    // The cookie "id".
    std::string GetSessionID() const;
    // The process environment variable "velaAccessToken", or null.
    const char* GetVelaAccessTokenID() const;
    bool IsTokenEnable() const;
    // The uid of the logged-in user, (uid_t)-1 when unknown; the platform is
    // asked at most once per request.
    uid_t GetLoginUID() const;
    std::string GetLoginUserName() const;
    bool IsAdmin() const;           // default false
    bool IsSkipCheckIP() const;     // default true
    bool IsTimeout() const;         // default true
    int GetTimeoutDuration() const; // default 0
    bool IsAuthorized() const;      // default false
    std::string GetApplication() const;
    std::string GetWebAPIPriv() const;
    std::string GetSessionFilePath() const;
    std::string GetUILanguage() const; // default "enu"
    bool HasAppPriv(const std::string& priv) const;
    // ALLOW_* bits of the description's "allowUser" list.
    int GetAllowUser() const;
    // The user's (group's) preference directory, "/tmp" when unavailable.
    std::string GetPreferenceDir() const;
    std::string GetGroupPreferenceDir(const std::string& group) const;
    bool IsPollingTask() const;
    std::string GetPollingTaskId() const;
    bool IsUploadRequest() const;
    bool IsSliceUploadRequest() const;

    // ---- Sharing link ----
    // A request is a sharing request when it names a link (the sharing
    // header, or "_sharing_id" moved there by the front end). The records
    // are those the sharing database held when the environment was set;
    // a record that was not found is empty. Nothing here says whether the
    // visitor may go on: the sharing permission check judges the records.
    bool IsSharing() const;
    std::string GetSharingID() const;
    std::string GetSharingSID() const;
    sharing::record::Entry GetSharingEntry() const;
    sharing::record::Session GetSharingSession() const;
    sharing::record::Token GetSharingToken() const;
    // The URL under which visitors reach this server's sharing page, derived
    // once from the request's host, port and scheme and the application
    // ("HOST", else "REWRITE_APP"), or `def` when no URL is stored. The
    // URL is "" when the platform refused the host, port or name, with the
    // type SHARING_URL_TYPE_NONE.
    std::string GetSharingURL(const std::string& def = "") const;
    sharing::_tag_SHARING_URL_TYPE GetSharingURLType() const;

    // ---- Typed parameters ----
    // Each looks `name` up in the parameters and returns it typed, with its
    // flags (see APIParameter). A null validator validates nothing.
    APIParameter<int> GetAndCheckInt(const std::string& name, PARAM_NECESSITY necessity,
                                     bool (*validator)(int const&) = nullptr) const;
    APIParameter<bool> GetAndCheckBool(const std::string& name, PARAM_NECESSITY necessity,
                                       bool (*validator)(bool const&) = nullptr) const;
    APIParameter<double> GetAndCheckReal(const std::string& name, PARAM_NECESSITY necessity,
                                         bool (*validator)(double const&) = nullptr) const;
    APIParameter<std::string> GetAndCheckString(const std::string& name, PARAM_NECESSITY necessity,
                                                bool (*validator)(std::string const&) = nullptr) const;
    APIParameter<Json::Value> GetAndCheckArray(const std::string& name, PARAM_NECESSITY necessity,
                                               bool (*validator)(Json::Value const&) = nullptr) const;
    APIParameter<Json::Value> GetAndCheckObject(const std::string& name, PARAM_NECESSITY necessity,
                                                bool (*validator)(Json::Value const&) = nullptr) const;
    // For long long, unsigned int and unsigned long long.
    template <typename T>
    APIParameter<T> GetAndCheckIntegral(const std::string& name, PARAM_NECESSITY necessity,
                                        bool (*validator)(T const&) = nullptr) const;
    // Like GetAndCheckArray, but a single value is taken as a one-element
    // array (null becomes [null], set and not reset).
    APIParameter<Json::Value> GetAndCheckUnitArray(const std::string& name, PARAM_NECESSITY necessity,
                                                   bool (*validator)(Json::Value const&) = nullptr) const;

    // The private object; for the framework's own use.
    APIRequestPrivate* GetPrivate() const { return d_; }

private:
    APIRequestPrivate* d_;
};

extern template APIParameter<long long> APIRequest::GetAndCheckIntegral<long long>(
    const std::string&, PARAM_NECESSITY, bool (*)(long long const&)) const;
extern template APIParameter<unsigned int> APIRequest::GetAndCheckIntegral<unsigned int>(
    const std::string&, PARAM_NECESSITY, bool (*)(unsigned int const&)) const;
extern template APIParameter<unsigned long long> APIRequest::GetAndCheckIntegral<unsigned long long>(
    const std::string&, PARAM_NECESSITY, bool (*)(unsigned long long const&)) const;

}  // namespace VELA

#pragma GCC visibility pop
