#include "request/APIRequestPrivate.h"

#include <climits>
#include <cstring>
#include <mutex>
#include <regex.h>
#include <strings.h>

#include "request/EncryptedParams.h"
#include "request/RequestFacts.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace VELA {

namespace {

// A link id as the sharing store makes them: 22 characters of base64url.
bool IsLinkId(const std::string& id)
{
    if (id.size() != 22) {
        return false;
    }
    for (char c : id) {
        if (!((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '_')) {
            return false;
        }
    }
    return true;
}

const char* const kCategories[] = {"environ", "cookie", "reqLib", "session", "param", "attr", "url", "userAgent"};

const char kMobilePattern[] =
    "(SymbianOS|Windows CE|PalmOS|BlackBerry|Vodafone|Opera Mobi|Opera Mini|UP\\.Browser|AvantGo|"
    "EudoraWeb|PLink|Plucker|NetFront|Xiino|Blazer|WebPro|ProxiNet|Elaine)";

// The mobile-browser expression, compiled once per process.
const regex_t* MobilePattern()
{
    static regex_t compiled;
    static bool ok = false;
    static std::once_flag once;
    std::call_once(once, [] {
        ok = regcomp(&compiled, kMobilePattern, REG_EXTENDED | REG_ICASE | REG_NOSUB) == 0;
        if (!ok) {
            VELA_LOG_ERR("Invalid pattern");
        }
    });
    return ok ? &compiled : nullptr;
}

bool Contains(const std::string& text, const char* needle)
{
    return text.find(needle) != std::string::npos;
}

// The "forceDesktop" cookie read as a decimal integer: true when it is
// non-zero. Leading blanks and a sign are allowed; no digits counts as 0.
bool NonZeroDecimal(const std::string& s)
{
    size_t i = 0;
    while (i < s.size() && (s[i] == ' ' || s[i] == '\t')) {
        ++i;
    }
    if (i < s.size() && (s[i] == '+' || s[i] == '-')) {
        ++i;
    }
    for (; i < s.size() && s[i] >= '0' && s[i] <= '9'; ++i) {
        if (s[i] != '0') {
            return true;
        }
    }
    return false;
}

}  // namespace

APIRequestPrivate::APIRequestPrivate(APIRequest* owner_) : owner(owner_)
{
    for (const char* name : kCategories) {
        data_[name] = Json::Value(Json::objectValue);
    }
}

APIRequestPrivate::APIRequestPrivate(const APIRequestPrivate& other, APIRequest* owner_)
    : APIBase(other),
      apiClass(other.apiClass),
      apiVersion(other.apiVersion),
      apiMethod(other.apiMethod),
      requestMethod(other.requestMethod),
      owner(owner_),
      sharingInfo(other.sharingInfo),
      sharingID(other.sharingID),
      sharingSID(other.sharingSID),
      sharingEntry(other.sharingEntry),
      sharingSession(other.sharingSession),
      sharingToken(other.sharingToken),
      sharingURLType(other.sharingURLType)
{
}

APIRequestPrivate::~APIRequestPrivate() = default;

std::string APIRequestPrivate::GetText(const char* section, const char* key)
{
    static const Json::Value kNull;
    return RequestFacts::Text(GetData(section, key, kNull));
}

bool APIRequestPrivate::GetBool(const char* section, const char* key, bool def)
{
    if (!HasData(section, key)) {
        return def;
    }
    static const Json::Value kNull;
    return RequestFacts::Truthy(GetData(section, key, kNull));
}

// ---- Set-up ---------------------------------------------------------------

void APIRequestPrivate::InitEnv(const Json::Value& env)
{
    SetData("environ", env, true);
    InitCookie();
    InitRequestMethod();
    InitSharing();
}

void APIRequestPrivate::InitParam(const Json::Value& request, bool reset)
{
    if (reset) {
        ClearData("param", "");
    }
    if (!request.isObject()) {
        return;
    }
    for (const char* member : {"getParam", "postParam"}) {
        const Json::Value* found = request.find(member, member + strlen(member));
        if (!found) {
            continue;
        }
        Json::Value params = *found;  // the caller's object stays as it is
        if (!params.isObject()) {
            continue;
        }
        // A failed decryption keeps what is left; the encrypted members are
        // gone either way, and the dispatcher goes on.
        DecryptParam(params);
        SetData("param", params, false);
        SetAPIDesc(params);
    }
}

void APIRequestPrivate::InitAPIInfo(const Json::Value& info)
{
    ClearData("reqLib", "");
    SetData("reqLib", info, false);
}

void APIRequestPrivate::InitSession(const Json::Value& session)
{
    ClearData("session", "");
    SetData("session", session, false);
}

void APIRequestPrivate::SetAPIDesc(const Json::Value& params)
{
    if (!params.isObject()) {
        return;
    }
    if (const Json::Value* api = params.find("api", "api" + 3)) {
        apiClass = RequestFacts::Text(*api);
    }
    if (const Json::Value* version = params.find("version", "version" + 7)) {
        // Only an integer or exact decimal text names a version: "1e0",
        // " 1", "1.0" or "1%00" name none (0), which the registry refuses.
        apiVersion = static_cast<int>(RequestFacts::ExactInteger(*version, INT_MIN, INT_MAX, 0));
    }
    if (const Json::Value* method = params.find("method", "method" + 6)) {
        apiMethod = RequestFacts::Text(*method);
    }
}

// Cookie header (RFC 6265 section 5.4): pieces separated by ";", each
// name=value; a piece without "=" is skipped; the value is URL-decoded; a
// later cookie of the same name wins.
void APIRequestPrivate::InitCookie()
{
    if (!HasData("environ", "HTTP_COOKIE")) {
        return;
    }
    static const Json::Value kNull;
    const Json::Value& header = GetData("environ", "HTTP_COOKIE", kNull);
    if (!header.isString()) {
        return;
    }
    const std::string text = header.asString();
    const Json::Value pieces = WebAPIUtil::ParseToArray(text.c_str(), ";");
    for (const Json::Value& piece : pieces) {
        const std::string s = RequestFacts::Text(piece);
        const size_t eq = s.find('=');
        if (eq == std::string::npos) {
            continue;
        }
        SetData("cookie", s.substr(0, eq), WebAPIUtil::URLDecode(s.substr(eq + 1), true), true);
    }
}

void APIRequestPrivate::InitRequestMethod()
{
    if (!HasData("environ", "REQUEST_METHOD")) {
        return;
    }
    const std::string method = GetText("environ", "REQUEST_METHOD");
    if (method == "GET") {
        requestMethod = REQUEST_METHOD_GET;
    } else if (method == "POST") {
        requestMethod = REQUEST_METHOD_POST;
    } else if (method == "HEAD") {
        requestMethod = REQUEST_METHOD_HEAD;
    }
}

// The sharing identifiers are re-read at every environment merge. Only a
// request that names a link opens the sharing database (and so loads
// libsqlite3); the records are judged by the permission check, a record
// that is not found stays empty.
void APIRequestPrivate::InitSharing()
{
    sharingID = GetText("environ", SZ_X_SHARING_HEADER);
    sharingSID = GetText("cookie", sharing::SZK_SHARING_SID);
    if (sharingID.empty()) {
        return;
    }
    if (!IsLinkId(sharingID)) {
        // Names no link: the database is not opened for it.
        sharingEntry = sharing::record::Entry();
        sharingSession = sharing::record::Session();
        sharingToken = sharing::record::Token();
        return;
    }
    sharing::db::SharingDB& db = sharing::db::SharingDB::Instance();
    sharing::db::EntryDB entries(db);
    sharing::db::SessionDB sessions(db);
    sharing::db::TokenDB tokens(db);
    if (db.IsGood()) {
        entries.GetByHash(sharingID, sharingEntry);
        sessions.GetBySessionId(sharingSID, sharingSession);
        tokens.GetBySessionEntry(sharingSession, sharingEntry, sharingToken);
    }
    tokens.Close();
    sessions.Close();
    entries.Close();
}

// The application named by the virtual host ("HOST"), else by the rewrite
// rule that brought the request ("REWRITE_APP"). The platform refuses a
// host, port or name it does not accept and leaves the URL empty; whatever
// it left is kept, so the URL is derived once per request.
void APIRequestPrivate::InitSharingURL()
{
    if (HasData("url", "urlSharing")) {
        return;
    }
    std::string app = GetText("environ", "HOST");
    if (app.empty()) {
        app = GetText("environ", "REWRITE_APP");
    }
    const std::string host = owner->GetURLHost("");
    const int port = owner->GetURLPort(0);
    const bool https = owner->GetURLProto("http") == "https";
    std::string url;
    sharing::_tag_SHARING_URL_TYPE type = sharing::SHARING_URL_TYPE_NONE;
    sharing::GetSharingURL(host, port, https, app, url, type);
    SetData("url", "urlSharing", Json::Value(url), true);
    sharingURLType = type;
}

// ---- URL ------------------------------------------------------------------

void APIRequestPrivate::InitURL()
{
    if (HasData("url", "initialized")) {
        return;
    }
    SetData("url", "initialized", true, false);
    ParseProtocol();
    ParseHostAndPort();
    ParsePathAndName();
}

// "https" when the web server says so (HTTPS=on), or when a trusted proxy
// (VelaCgiIsTrustedProxy of REMOTE_ADDR) forwards X-Forwarded-Proto: https;
// a client's own X-Forwarded-Proto means nothing.
bool APIRequestPrivate::ParseProtocol()
{
    std::string proto = "http";
    if (strcasecmp(GetText("environ", "HTTPS").c_str(), "on") == 0 ||
        (strcasecmp(GetText("environ", "HTTP_X_FORWARDED_PROTO").c_str(), "https") == 0 &&
         VelaCgiIsTrustedProxy(GetText("environ", "REMOTE_ADDR").c_str()) == 1)) {
        proto = "https";
    }
    return SetData("url", "urlProto", proto, true);
}

// Host header (RFC 7230 section 5.4, RFC 3986 section 3.2.2): host, or
// host:port, or [IPv6]:port. The port is taken as it comes; an empty one is
// the scheme's default.
bool APIRequestPrivate::ParseHostAndPort()
{
    const std::string text = GetText("environ", "HTTP_HOST");
    if (text.empty()) {
        return false;
    }
    std::string host;
    std::string port;
    if (text[0] == '[') {
        const size_t close = text.rfind(']');
        if (close == std::string::npos) {
            return false;
        }
        host = text.substr(0, close + 1);
        const size_t colon = text.find(':', close);
        if (colon != std::string::npos) {
            port = text.substr(colon + 1);
        }
    } else {
        const size_t colon = text.rfind(':');
        if (colon == std::string::npos) {
            host = text;
        } else {
            host = text.substr(0, colon);
            port = text.substr(colon + 1);
        }
    }
    if (port.empty()) {
        port = GetText("url", "urlProto") == "https" ? "443" : "80";
    }
    if (!SetData("url", "urlHost", host, true)) {
        return false;
    }
    return SetData("url", "urlPort", port, true);
}

bool APIRequestPrivate::ParsePathAndName()
{
    std::string uri = GetText("environ", "REQUEST_URI");
    const size_t query = uri.find('?');
    if (query != std::string::npos) {
        uri.erase(query);
    }
    const size_t slash = uri.rfind('/');
    if (slash == std::string::npos) {
        return true;
    }
    if (!SetData("url", "urlPath", uri.substr(0, slash + 1), true)) {
        return false;
    }
    return SetData("url", "urlName", uri.substr(slash + 1), true);
}

// ---- Client kind -----------------------------------------------------------

namespace {

// What the user agent text says of the client. `mobileOutcome` tells whether
// the mobile flags are decided by the text (then the "forceDesktop" cookie
// has its say) or left false.
struct UAKind {
    bool iPhone = false, android = false, iPad = false, playBook = false, blackBerry6 = false;
    bool webKit = false, webApp = false;
    bool mobileOutcome = true;
};

// `ua` in lower case; `otherMobile` is asked only for a text that names no
// known device.
template <typename OtherMobile> UAKind ClassifyUA(const std::string& ua, OtherMobile otherMobile)
{
    UAKind k;
    const bool webkit = Contains(ua, "webkit");
    const bool hasIPad = Contains(ua, "ipad");
    const bool hasIPhone = Contains(ua, "iphone") || Contains(ua, "ipod");
    const bool hasAndroid = Contains(ua, "android");
    if (hasIPad || hasIPhone || hasAndroid) {
        k.iPad = hasIPad;
        k.iPhone = hasIPad || hasIPhone;
        k.android = !k.iPhone && hasAndroid;
        k.webKit = k.webApp = webkit;
    } else if (Contains(ua, "playbook")) {
        k.playBook = true;
        k.webKit = k.webApp = webkit;
    } else if (webkit && Contains(ua, "blackberry")) {
        k.blackBerry6 = k.webKit = k.webApp = true;
    } else {
        k.webKit = webkit;
        k.mobileOutcome = otherMobile();
    }
    return k;
}

}  // namespace

void APIRequestPrivate::InitUA()
{
    if (HasData("userAgent", "initialized")) {
        return;
    }
    SetData("userAgent", "initialized", true, false);
    const regex_t* mobilePattern = MobilePattern();
    if (!HasData("environ", "HTTP_USER_AGENT")) {
        return;
    }
    std::string ua = GetText("environ", "HTTP_USER_AGENT");
    if (!ua.empty()) {
        VLIBCStrCaseLower(&ua[0]);
    }
    const UAKind k = ClassifyUA(ua, [&] {
        const bool patternMatch =
            mobilePattern && !ua.empty() && regexec(mobilePattern, ua.c_str(), 0, nullptr, 0) == 0;
        return patternMatch || HasData("environ", "HTTP_UA_OS") || HasData("environ", "HTTP_X_WAP_PROFILE");
    });
    bool mobile = false, mobileDevice = false, ieMobile = false;
    if (k.mobileOutcome) {
        ieMobile = Contains(ua, "msie") || Contains(ua, "iemobile");
        mobileDevice = true;
        static const Json::Value kZero("0");
        const Json::Value& force = GetData("cookie", "forceDesktop", kZero);
        mobile = !NonZeroDecimal(force.isString() ? force.asString() : "0");
    }
    SetData("userAgent", "uaMobile", mobile, false);
    SetData("userAgent", "uaMobileDevice", mobileDevice, false);
    SetData("userAgent", "uaIPhone", k.iPhone, false);
    SetData("userAgent", "uaAndroid", k.android, false);
    SetData("userAgent", "uaIEMobile", ieMobile, false);
    SetData("userAgent", "uaIPad", k.iPad, false);
    SetData("userAgent", "uaPlayBook", k.playBook, false);
    SetData("userAgent", "uaBlackBerry6", k.blackBerry6, false);
    SetData("userAgent", "uaWebKit", k.webKit, false);
    SetData("userAgent", "uaSupportWebAPP", k.webApp, false);
}

// ---- Session ---------------------------------------------------------------

uid_t APIRequestPrivate::GetLoginUID()
{
    static const Json::Value kNull;
    if (HasData("session", "uid")) {
        const Json::Value& uid = GetData("session", "uid", kNull);
        if (uid.isInt64()) {
            return static_cast<uid_t>(uid.asInt64());
        }
        if (uid.isUInt64()) {
            return static_cast<uid_t>(uid.asUInt64());
        }
        return static_cast<uid_t>(-1);
    }
    const std::string sessionId = GetText("cookie", "id");
    const std::string userName = GetText("session", "username");
    if (userName.empty()) {
        return static_cast<uid_t>(-1);
    }
    const int uid = VelaCgiUIDGet(sessionId.c_str(), userName.c_str());
    SetData("session", "uid", Json::Value(uid), false);
    return static_cast<uid_t>(uid);
}

// ---- Encrypted parameters --------------------------------------------------

bool APIRequestPrivate::DecryptParam(Json::Value& params) { return EncryptedParams::DecryptMembers(params); }

bool APIRequestPrivate::DecryptAESParam(Json::Value& params) { return EncryptedParams::DecryptAES(params); }

}  // namespace VELA
