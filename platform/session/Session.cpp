// Login sessions: one JSON file per session under <root>/run/vela/sessions/
// (the format is described in vela/session.h), the request-time check
// VelaCgiIsAuthorizedEx and the calls that read the same session.
#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "cgi/CgiContext.h"
#include "session/SessionStore.h"
#include "vela/audit.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/session.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

using VELA::Session::ReadResult;

namespace {

const char kSessionDir[] = "/run/vela/sessions";
constexpr size_t kIdBytes = 24;  // 192 bits, 32 characters
static_assert(VELA::Session::IdLength(kIdBytes) == VELA_SESSION_ID_LEN, "session id length");
static_assert(VELA::Session::IdLength(kIdBytes) == VELA_SESSION_TOKEN_LEN, "token length");
constexpr size_t kMaxSessionFile = 16 * 1024;
constexpr size_t kMaxText = 255;             // app, webapi
constexpr size_t kMaxTokenHeader = 256;      // a longer X-Vela-Token is not ours
constexpr size_t kMaxQueryString = 64 * 1024;
constexpr size_t kMaxAcceptLanguage = 4096;
constexpr int kMaxAcceptEntries = 64;
constexpr long long kMaxTime = 1LL << 40;    // far beyond any real clock
constexpr long long kPurgeGrace = 3600;      // expired sessions kept this long
const int kAuthLog = LOG_AUTHPRIV | LOG_NOTICE;

struct StoredSession {
    std::string id;
    std::string user;
    long long created = 0;
    long long lastUse = 0;
    long long idleTimeout = 0;
    long long lifetime = 0;
    std::string clientIP;
    bool skipIP = false;
    std::string app;
    std::string webapi;
    std::string lang;
    bool tokenProtect = false;
    std::string token;
};

std::string SessionDir() { return VELA::System::Path(kSessionDir); }

std::string SessionPath(const std::string& sid) { return SessionDir() + "/" + sid; }

bool IsPrintable(const std::string& text, size_t maxLen)
{
    if (text.size() > maxLen) {
        return false;
    }
    for (char ch : text) {
        const unsigned char c = static_cast<unsigned char>(ch);
        if (c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

bool IsLang(const std::string& lang)
{
    if (lang.empty()) {
        return true;
    }
    return lang.size() == 3 && std::all_of(lang.begin(), lang.end(), [](char c) { return c >= 'a' && c <= 'z'; });
}

// A short, safe prefix of an id for log lines: enough to tell sessions apart,
// too little to use.
std::string LogId(const std::string& sid) { return sid.substr(0, 6) + "..."; }

// Reads the members of a session file, each checked for type and range.
// False when anything is missing or wrong: such a file is no session.
bool ParseSession(const Json::Value& doc, const std::string& sid, StoredSession& s)
{
    using namespace VELA::Session;
    long long version = 0;
    std::string clientIP;
    if (!GetInt(doc, "version", 1, 1, version) || !GetString(doc, "id", VELA_SESSION_ID_LEN, s.id) ||
        s.id != sid || !GetString(doc, "user", 492, s.user) || !IsUserName(s.user.c_str()) ||
        !GetInt(doc, "created", 0, kMaxTime, s.created) || !GetInt(doc, "lastUse", 0, kMaxTime, s.lastUse) ||
        !GetInt(doc, "idleTimeout", 1, VELA_SESSION_IDLE_MAX, s.idleTimeout) ||
        !GetInt(doc, "lifetime", 1, VELA_SESSION_LIFETIME_MAX, s.lifetime) ||
        !GetString(doc, "clientIP", 64, clientIP) || !GetBool(doc, "skipIP", s.skipIP) ||
        !GetString(doc, "app", kMaxText, s.app) || !IsPrintable(s.app, kMaxText) ||
        !GetString(doc, "webapi", kMaxText, s.webapi) || !IsPrintable(s.webapi, kMaxText) ||
        !GetString(doc, "lang", 3, s.lang) || !IsLang(s.lang) || !GetBool(doc, "tokenProtect", s.tokenProtect) ||
        !GetString(doc, "token", VELA_SESSION_TOKEN_LEN, s.token) ||
        !IsId(s.token.c_str(), VELA_SESSION_TOKEN_LEN)) {
        return false;
    }
    if (clientIP.empty()) {
        s.clientIP.clear();
    } else if (!CanonicalAddress(clientIP, s.clientIP)) {
        return false;
    }
    return true;
}

Json::Value SessionToJson(const StoredSession& s)
{
    Json::Value doc(Json::objectValue);
    doc["version"] = 1;
    doc["id"] = s.id;
    doc["user"] = s.user;
    doc["created"] = static_cast<Json::Int64>(s.created);
    doc["lastUse"] = static_cast<Json::Int64>(s.lastUse);
    doc["idleTimeout"] = static_cast<Json::Int64>(s.idleTimeout);
    doc["lifetime"] = static_cast<Json::Int64>(s.lifetime);
    doc["clientIP"] = s.clientIP;
    doc["skipIP"] = s.skipIP;
    doc["app"] = s.app;
    doc["webapi"] = s.webapi;
    doc["lang"] = s.lang;
    doc["tokenProtect"] = s.tokenProtect;
    doc["token"] = s.token;
    return doc;
}

enum class Load { Ok, NoSession, Error };

// Loads session `sid` (already checked with IsId). `doc` receives the file's
// document when not null.
Load LoadSession(const std::string& sid, StoredSession& s, Json::Value* doc = nullptr)
{
    Json::Value parsed;
    switch (VELA::Session::ReadStateFile(SessionPath(sid), kMaxSessionFile, parsed)) {
    case ReadResult::Ok:
        break;
    case ReadResult::Missing:
    case ReadResult::Corrupt:
        return Load::NoSession;
    case ReadResult::Error:
        return Load::Error;
    }
    if (!ParseSession(parsed, sid, s)) {
        VELA_LOG_ERR("session %s: invalid session file, refused", LogId(sid).c_str());
        return Load::NoSession;
    }
    if (doc != nullptr) {
        doc->swap(parsed);
    }
    return Load::Ok;
}

// The clock may have gone back since a time was written: a time in the future
// counts as now, so that it can never keep a session alive.
long long NotAfter(long long t, long long now) { return t > now ? now : t; }

bool Expired(const StoredSession& s, long long now, long long grace)
{
    return now - NotAfter(s.created, now) > s.lifetime + grace ||
           now - NotAfter(s.lastUse, now) > s.idleTimeout + grace;
}

// The value of the first query-string parameter `name` (URL-decoded), from
// QUERY_STRING of the process environment. False when absent.
bool QueryParameter(const char* name, std::string& value)
{
    const char* query = getenv("QUERY_STRING");
    if (query == nullptr) {
        return false;
    }
    const size_t len = strnlen(query, kMaxQueryString + 1);
    if (len > kMaxQueryString) {
        VELA_LOG_ERR("QUERY_STRING longer than %zu bytes, not searched for %s", kMaxQueryString, name);
        return false;
    }
    const std::string text(query, len);
    size_t start = 0;
    while (start <= text.size()) {
        size_t end = text.find('&', start);
        if (end == std::string::npos) {
            end = text.size();
        }
        const std::string pair = text.substr(start, end - start);
        const size_t eq = pair.find('=');
        if (eq != std::string::npos && VELA::WebAPIUtil::URLDecode(pair.substr(0, eq), true) == name) {
            value = VELA::WebAPIUtil::URLDecode(pair.substr(eq + 1), true);
            return true;
        }
        start = end + 1;
    }
    return false;
}

// True when the request carries the session's anti-forgery token, in the
// X-Vela-Token header or the VelaToken query parameter. Compared in constant
// time.
bool CarriesToken(const std::string& token)
{
    bool found = false;
    const char* header = getenv("HTTP_X_VELA_TOKEN");
    if (header != nullptr && strnlen(header, kMaxTokenHeader + 1) <= kMaxTokenHeader) {
        found = VELA::Session::ConstantTimeEquals(header, token);
    }
    std::string param;
    if (!found && QueryParameter("VelaToken", param)) {
        found = VELA::Session::ConstantTimeEquals(param, token);
    }
    return found;
}

void ClearHandle(VELACGI_CTX* ctx)
{
    if (ctx == nullptr) {
        return;
    }
    ctx->authorized = false;
    ctx->sessionFile.clear();
    ctx->timeout = 0;
    ctx->timeoutText.clear();
    ctx->sessionSkipIP = false;
    ctx->sessionApp.clear();
    ctx->sessionWebAPI.clear();
    ctx->sessionLang.clear();
}

void FillInfo(const StoredSession& s, bool skip, VELACGI_SESSION_INFO* info)
{
    if (info == nullptr) {
        return;
    }
    info->created = s.created;
    info->lastUse = s.lastUse;
    info->idleTimeout = static_cast<int>(s.idleTimeout);
    info->lifetime = static_cast<int>(s.lifetime);
    info->skipCheckIP = skip ? 1 : 0;
    info->tokenProtect = s.tokenProtect ? 1 : 0;
    VELA::Session::CopyOut(s.clientIP, info->clientIP, sizeof(info->clientIP));
    VELA::Session::CopyOut(s.lang, info->lang, sizeof(info->lang));
}

// True when a request at `now` moves a last use of `lastUse` forward: it is
// at least VELA_SESSION_LAST_USE_STEP seconds old.
bool LastUseDue(long long lastUse, long long now) { return now - lastUse >= VELA_SESSION_LAST_USE_STEP; }

// Writes the new last use of session `sid` under the store lock: `now` when
// `touch` and the stored one is due (LastUseDue), else only a last use in
// the future pulled back to now; a creation time in the future becomes now
// as well. The file is read again under the
// lock, so a session removed meanwhile stays removed: Load::NoSession then.
// Load::Error when the lock or the write failed (logged).
Load WriteLastUse(const std::string& sid, long long now, bool touch)
{
    const std::string dir = SessionDir();
    VELA::Session::StoreLock lock(dir);
    if (!lock.Held()) {
        return Load::Error;
    }
    StoredSession cur;
    Json::Value doc;
    const Load loaded = LoadSession(sid, cur, &doc);
    if (loaded != Load::Ok) {
        return loaded;
    }
    const long long lastUse = touch && LastUseDue(cur.lastUse, now) ? now : NotAfter(cur.lastUse, now);
    const long long created = NotAfter(cur.created, now);
    if (lastUse == cur.lastUse && created == cur.created) {
        return Load::Ok;
    }
    doc["lastUse"] = static_cast<Json::Int64>(lastUse);
    doc["created"] = static_cast<Json::Int64>(created);
    // Rewritten often (once per step of a busy session): no fsync (see
    // WriteStateFile).
    return VELA::Session::WriteStateFile(SessionPath(sid), doc, false) ? Load::Ok : Load::Error;
}

// The verdict on the account of session `id`: 0 when it exists,
// AUTH_RESULT_NO_SESSION when it no longer does, AUTH_RESULT_REJECTED when
// the look-up failed.
int CheckUser(const StoredSession& s, const std::string& id)
{
    uid_t uid = 0;
    const int known = VELA::Session::LookupUser(s.user.c_str(), uid);
    if (known < 0) {
        return AUTH_RESULT_REJECTED;
    }
    if (known == 0) {
        VELA_LOG(kAuthLog, "session %s: user \"%s\" no longer exists", LogId(id).c_str(), s.user.c_str());
        return AUTH_RESULT_NO_SESSION;
    }
    return 0;
}

// True when the request comes from the address session `id` is bound to
// (VelaCgiGetRemoteIP, canonical form); the mismatch is logged.
bool FromSessionAddress(const StoredSession& s, const std::string& id)
{
    char remote[64] = "";
    std::string client;
    if (VelaCgiGetRemoteIP(remote, sizeof(remote)) != 0 || !VELA::Session::CanonicalAddress(remote, client) ||
        client != s.clientIP) {
        VELA_LOG(kAuthLog, "session %s of \"%s\": request from %s, session bound to %s", LogId(id).c_str(),
                 s.user.c_str(), remote[0] != '\0' ? remote : "an unknown address",
                 s.clientIP.empty() ? "no address" : s.clientIP.c_str());
        return false;
    }
    return true;
}

// Writes the use of the valid session `id` at `now` when there is anything
// to write: the last use when `touch` and it is due (LastUseDue), a time in
// the future pulled back in any case. False when the session was removed meanwhile (logged). A failed
// write leaves the session as valid as it was read; the error is logged and
// the request goes on.
bool RecordUse(const StoredSession& s, const std::string& id, long long now, bool touch)
{
    if ((touch && LastUseDue(s.lastUse, now)) || s.lastUse > now || s.created > now) {
        if (WriteLastUse(id, now, touch) == Load::NoSession) {
            VELA_LOG(kAuthLog, "session %s: removed during the check", LogId(id).c_str());
            return false;
        }
    }
    return true;
}

// Fills the handle (may be null) from the valid session `id`.
void AuthorizeHandle(VELACGI_CTX* ctx, const StoredSession& s, const std::string& id)
{
    if (ctx == nullptr) {
        return;
    }
    ctx->authorized = true;
    ctx->sessionFile = SessionPath(id);
    ctx->timeout = static_cast<int>(s.idleTimeout);
    ctx->timeoutText = std::to_string(s.idleTimeout);
    ctx->sessionSkipIP = s.skipIP;
    ctx->sessionApp = s.app;
    ctx->sessionWebAPI = s.webapi;
    ctx->sessionLang = s.lang;
    if (s.skipIP) {
        ctx->skipCheckIP = 1;
    }
}

int CheckSession(VELACGI_CTX* ctx, const char* sid, char* user, size_t userSize, VELACGI_SESSION_INFO* info,
                 int flags)
{
    if (!VELA::Session::IsId(sid, VELA_SESSION_ID_LEN)) {
        VELA_LOG(kAuthLog, "session check: malformed session id (%zu bytes), refused",
                 sid == nullptr ? 0 : strnlen(sid, 1024));
        return AUTH_RESULT_NO_SESSION;
    }
    const std::string id(sid);
    StoredSession s;
    const Load loaded = LoadSession(id, s);
    if (loaded != Load::Ok) {
        if (loaded == Load::NoSession) {
            VELA_LOG(kAuthLog, "session check: no session %s", LogId(id).c_str());
        }
        return AUTH_RESULT_NO_SESSION;
    }
    const bool skip = s.skipIP || (ctx != nullptr && ctx->skipCheckIP != 0);
    FillInfo(s, skip, info);
    if (const int verdict = CheckUser(s, id)) {
        return verdict;
    }

    const long long now = VELA::Session::Now();
    if (Expired(s, now, 0)) {
        VELA_LOG(kAuthLog, "session %s of \"%s\": timed out", LogId(id).c_str(), s.user.c_str());
        // Still pull a future time back, so that the next clock step cannot
        // revive the session.
        if (s.lastUse > now || s.created > now) {
            WriteLastUse(id, now, false);
        }
        return AUTH_RESULT_TIMEOUT;
    }
    if (!skip && !FromSessionAddress(s, id)) {
        return AUTH_RESULT_IP_MISMATCH;
    }
    if (s.tokenProtect && !CarriesToken(s.token)) {
        VELA_LOG(kAuthLog, "session %s of \"%s\": anti-forgery token missing or wrong", LogId(id).c_str(),
                 s.user.c_str());
        return AUTH_RESULT_TOKEN_MISSING;
    }

    if (user != nullptr && !VELA::Session::CopyOut(s.user, user, userSize)) {
        VELA_LOG_ERR("session %s: user name of %zu bytes does not fit a buffer of %zu", LogId(id).c_str(),
                     s.user.size(), userSize);
        return AUTH_RESULT_REJECTED;
    }
    if (!RecordUse(s, id, now, (flags & VELACGI_AUTH_NO_REFRESH) == 0)) {
        return AUTH_RESULT_NO_SESSION;
    }
    AuthorizeHandle(ctx, s, id);
    return AUTH_RESULT_AUTHORIZED;
}

// ---- Accept-Language (RFC 7231 section 5.3.5, matched as in RFC 4647 section
// 3.4 "Lookup") --------------------------------------------------------------

struct LangEntry {
    const char* tag;
    const char* code;
};

const LangEntry kLangTable[] = {
    {"en", "enu"},    {"de", "ger"},      {"fr", "fra"},      {"ja", "jpn"},    {"zh-tw", "cht"},
    {"zh-hk", "cht"}, {"zh-mo", "cht"},   {"zh-hant", "cht"}, {"zh", "chs"},    {"zh-cn", "chs"},
    {"zh-sg", "chs"}, {"zh-hans", "chs"}, {"it", "ita"},      {"es", "spn"},    {"nl", "nld"},
    {"sv", "sve"},    {"da", "dan"},      {"nb", "nor"},      {"nn", "nor"},    {"no", "nor"},
    {"fi", "fin"},    {"pl", "plk"},      {"pt-br", "ptb"},   {"pt", "ptg"},    {"ru", "rus"},
    {"ko", "krn"},    {"cs", "csy"},      {"hu", "hun"},      {"tr", "trk"},    {"th", "tha"},
};

// The code of a language tag (lower-cased): the tag itself, else the tag with
// subtags dropped from the end ("zh-hant-tw" -> "zh-hant"). Null when none.
const char* LangCode(std::string tag)
{
    for (;;) {
        for (const LangEntry& entry : kLangTable) {
            if (tag == entry.tag) {
                return entry.code;
            }
        }
        const size_t dash = tag.rfind('-');
        if (dash == std::string::npos) {
            return nullptr;
        }
        tag.resize(dash);
    }
}

std::string Trim(const std::string& text)
{
    const size_t begin = text.find_first_not_of(" \t");
    if (begin == std::string::npos) {
        return std::string();
    }
    const size_t end = text.find_last_not_of(" \t");
    return text.substr(begin, end - begin + 1);
}

// A quality value (RFC 7231 section 5.3.1: qvalue = "0" ["." 0*3DIGIT] /
// "1" ["." 0*3("0")]) in thousandths; -1 when malformed.
int ParseQuality(const std::string& text)
{
    if (text.empty() || text.size() > 5 || (text[0] != '0' && text[0] != '1')) {
        return -1;
    }
    int value = (text[0] - '0') * 1000;
    if (text.size() > 1) {
        if (text[1] != '.') {
            return -1;
        }
        int scale = 100;
        for (size_t i = 2; i < text.size(); ++i) {
            if (text[i] < '0' || text[i] > '9') {
                return -1;
            }
            value += (text[i] - '0') * scale;
            scale /= 10;
        }
    }
    return value > 1000 ? -1 : value;
}

// The code of the preferred known language of an Accept-Language header:
// the highest quality wins, the earlier entry on a tie; "*", unknown tags
// and q=0 are passed over. "" when nothing matches.
std::string LangFromAcceptLanguage(const char* header)
{
    if (header == nullptr) {
        return std::string();
    }
    const size_t len = strnlen(header, kMaxAcceptLanguage + 1);
    if (len > kMaxAcceptLanguage) {
        VELA_LOG_ERR("Accept-Language longer than %zu bytes, ignored", kMaxAcceptLanguage);
        return std::string();
    }
    const std::string text(header, len);
    std::string best;
    int bestQuality = 0;
    size_t start = 0;
    for (int n = 0; n < kMaxAcceptEntries && start <= text.size(); ++n) {
        size_t end = text.find(',', start);
        if (end == std::string::npos) {
            end = text.size();
        }
        const std::string entry = text.substr(start, end - start);
        start = end + 1;
        const size_t semi = entry.find(';');
        std::string tag = Trim(entry.substr(0, semi));
        int quality = 1000;
        if (semi != std::string::npos) {
            const std::string param = Trim(entry.substr(semi + 1));
            if (param.size() < 2 || (param[0] != 'q' && param[0] != 'Q') || param[1] != '=') {
                continue;
            }
            quality = ParseQuality(Trim(param.substr(2)));
        }
        if (quality <= bestQuality || tag.empty() || tag.size() > 35) {
            continue;
        }
        for (char& c : tag) {
            c = static_cast<char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
        }
        const char* code = LangCode(tag);
        if (code != nullptr) {
            best = code;
            bestQuality = quality;
        }
    }
    return best;
}

}  // namespace

// ---- Request-time calls ------------------------------------------------------------

int VelaCgiIsAuthorizedEx(VELACGI_CTX* ctx, const char* sid, char* user, size_t userSize,
                          VELACGI_SESSION_INFO* info, int flags)
{
    if (user != nullptr && userSize > 0) {
        user[0] = '\0';
    }
    if (info != nullptr) {
        memset(info, 0, sizeof(*info));
    }
    ClearHandle(ctx);
    try {
        const int verdict = CheckSession(ctx, sid, user, userSize, info, flags);
        if (verdict != AUTH_RESULT_AUTHORIZED) {
            ClearHandle(ctx);
            if (user != nullptr && userSize > 0) {
                user[0] = '\0';
            }
        }
        return verdict;
    } catch (const std::exception&) {
        VELA_LOG_ERR("session check: out of memory");
        ClearHandle(ctx);
        if (user != nullptr && userSize > 0) {
            user[0] = '\0';
        }
        return AUTH_RESULT_REJECTED;
    }
}

const char* VelaCgiGetOption(VELACGI_CTX* ctx, int option, const char* defaultValue)
{
    if (ctx == nullptr || !ctx->authorized) {
        return defaultValue;
    }
    switch (option) {
    case VELACGI_OPT_SKIP_IP:
        return ctx->sessionSkipIP ? "1" : "0";
    case VELACGI_OPT_WEBAPI:
        return ctx->sessionWebAPI.c_str();
    case VELACGI_OPT_APP:
        return ctx->sessionApp.c_str();
    case VELACGI_OPT_TIMEOUT:
        return ctx->timeoutText.c_str();
    default:
        return defaultValue;
    }
}

int VelaCgiGetLang(VELACGI_CTX* ctx, char* buf, size_t size)
{
    if (buf == nullptr || size < 4) {
        if (buf != nullptr && size > 0) {
            buf[0] = '\0';
        }
        return -1;
    }
    std::string lang;
    try {
        if (ctx != nullptr && ctx->authorized && !ctx->sessionLang.empty()) {
            lang = ctx->sessionLang;
        } else {
            lang = LangFromAcceptLanguage(getenv("HTTP_ACCEPT_LANGUAGE"));
        }
    } catch (const std::exception&) {
        lang.clear();
    }
    if (lang.size() != 3) {
        lang = "enu";
    }
    memcpy(buf, lang.c_str(), 4);
    return 0;
}

int VelaCgiSetSkipCheckIP(VELACGI_CTX* ctx, int skip)
{
    if (ctx == nullptr) {
        return -1;
    }
    ctx->skipCheckIP = skip != 0 ? 1 : 0;
    return 0;
}

int VelaCgiGetSkipCheckIP(VELACGI_CTX* ctx) { return ctx != nullptr && ctx->skipCheckIP != 0 ? 1 : 0; }

const char* VelaCgiGetSessionFile(VELACGI_CTX* ctx)
{
    return ctx != nullptr && ctx->authorized ? ctx->sessionFile.c_str() : "";
}

int VelaCgiGetTimeout(VELACGI_CTX* ctx) { return ctx != nullptr && ctx->authorized ? ctx->timeout : 0; }

int VelaCgiIsTokenEnable(VELACGI_CTX* ctx)
{
    const char* sid = VelaCgiGetCookie(ctx, "id");
    if (sid == nullptr || !VELA::Session::IsId(sid, VELA_SESSION_ID_LEN)) {
        return 0;
    }
    try {
        StoredSession s;
        return LoadSession(sid, s) == Load::Ok && s.tokenProtect ? 1 : 0;
    } catch (const std::exception&) {
        return 0;
    }
}

int VelaCgiUIDGet(const char* sid, const char* user)
{
    if (!VELA::Session::IsId(sid, VELA_SESSION_ID_LEN) || !VELA::Session::IsUserName(user)) {
        return -1;
    }
    try {
        StoredSession s;
        if (LoadSession(sid, s) != Load::Ok || s.user != user) {
            return -1;
        }
        uid_t uid = 0;
        if (VELA::Session::LookupUser(user, uid) != 1 || uid > static_cast<uid_t>(INT_MAX)) {
            return -1;
        }
        return static_cast<int>(uid);
    } catch (const std::exception&) {
        return -1;
    }
}

// ---- Creation, removal, listing ------------------------------------------------------

namespace {

// Fills the new session `s` for `user` (already checked) from `clientIP`
// and the options. False (logged) when a limit or a text is out of range or
// `clientIP` is not an address.
bool FillNewSession(const char* user, const char* clientIP, const VELA::Session::Options& opt, StoredSession& s)
{
    s.user = user;
    s.idleTimeout = opt.idleTimeout == 0 ? VELA_SESSION_IDLE_DEFAULT : opt.idleTimeout;
    s.lifetime = opt.lifetime == 0 ? VELA_SESSION_LIFETIME_DEFAULT : opt.lifetime;
    if (s.idleTimeout < 1 || s.idleTimeout > VELA_SESSION_IDLE_MAX || s.lifetime < 1 ||
        s.lifetime > VELA_SESSION_LIFETIME_MAX) {
        VELA_LOG_ERR("session create: idle timeout %lld or lifetime %lld out of range", s.idleTimeout,
                     s.lifetime);
        return false;
    }
    s.skipIP = opt.skipIP;
    if (clientIP == nullptr || clientIP[0] == '\0') {
        s.skipIP = true;
    } else if (strnlen(clientIP, 64) >= 64 || !VELA::Session::CanonicalAddress(clientIP, s.clientIP)) {
        VELA_LOG_ERR("session create: \"%.64s\" is not an IP address", clientIP);
        return false;
    }
    if (!IsPrintable(opt.app, kMaxText) || !IsPrintable(opt.webapi, kMaxText) || !IsLang(opt.lang)) {
        VELA_LOG_ERR("session create: invalid application, web-API privilege or language");
        return false;
    }
    s.app = opt.app;
    s.webapi = opt.webapi;
    s.lang = opt.lang;
    s.tokenProtect = opt.tokenProtect;
    return true;
}

// Draws the id and the anti-forgery token of `s`, the id one that no file
// of the store has (three tries). Called under the store lock. False
// (logged) when getrandom fails or no free id was drawn.
bool DrawFreeId(StoredSession& s)
{
    for (int attempt = 0; attempt < 3; ++attempt) {
        if (!VELA::Session::RandomId(kIdBytes, s.id) || !VELA::Session::RandomId(kIdBytes, s.token)) {
            return false;
        }
        struct stat st;
        if (lstat(SessionPath(s.id).c_str(), &st) != 0 && errno == ENOENT) {
            return true;
        }
    }
    VELA_LOG_ERR("session create: no free session id");
    return false;
}

// One line of the audit trail about a session of `user` (never its id).
void AuditSession(const char* name, const std::string& user)
{
    VELA::Audit::Event event;
    event.name = name;
    event.user = user;
    VELA::Audit::Record(event);
}

int CreateSession(const char* user, const char* clientIP, const VELA::Session::Options* options, std::string& sid,
                  std::string& token)
{
    using namespace VELA::Session;
    if (!IsUserName(user)) {
        VELA_LOG_ERR("session create: invalid user name");
        return -1;
    }
    uid_t uid = 0;
    const int known = LookupUser(user, uid);
    if (known != 1) {
        if (known == 0) {
            VELA_LOG_ERR("session create: no user \"%s\"", user);
        }
        return -1;
    }
    const VELA::Session::Options defaults;
    StoredSession s;
    if (!FillNewSession(user, clientIP, options != nullptr ? *options : defaults, s)) {
        return -1;
    }

    const std::string dir = SessionDir();
    if (!EnsureStateDir(dir)) {
        return -1;
    }
    VELA::Session::Purge(kPurgeGrace);

    StoreLock lock(dir);
    if (!lock.Held() || !DrawFreeId(s)) {
        return -1;
    }
    s.created = Now();
    s.lastUse = s.created;
    if (!WriteStateFile(SessionPath(s.id), SessionToJson(s))) {
        return -1;
    }
    sid = s.id;
    token = s.token;
    VELA_LOG(LOG_AUTHPRIV | LOG_INFO, "session %s created for \"%s\" from %s", LogId(s.id).c_str(), user,
             s.clientIP.empty() ? "any address" : s.clientIP.c_str());
    AuditSession(options != nullptr && options->auditEvent != nullptr ? options->auditEvent
                                                                        : VELA::Audit::kSessionCreate,
                 s.user);
    return 0;
}

}  // namespace

int VELA::Session::Create(const char* user, const char* clientIP, const VELA::Session::Options* options,
                          std::string& sid, std::string& token)
{
    sid.clear();
    token.clear();
    try {
        return CreateSession(user, clientIP, options, sid, token);
    } catch (const std::exception&) {
        VELA_LOG_ERR("session create: out of memory");
        sid.clear();
        token.clear();
        return -1;
    }
}

int VELA::Session::Remove(const char* sid, const char* auditEvent)
{
    if (!VELA::Session::IsId(sid, VELA_SESSION_ID_LEN)) {
        return -2;
    }
    try {
        const std::string dir = SessionDir();
        const std::string path = SessionPath(sid);
        struct stat st;
        if (lstat(path.c_str(), &st) != 0) {
            return errno == ENOENT ? -2 : -1;
        }
        VELA::Session::StoreLock lock(dir);
        if (!lock.Held()) {
            return -1;
        }
        // Whose session it was, for the audit trail (read before it goes).
        StoredSession s;
        if (LoadSession(sid, s) != Load::Ok) {
            s.user.clear();
        }
        if (unlink(path.c_str()) != 0) {
            if (errno == ENOENT) {
                return -2;
            }
            VELA_LOG_ERR("unlink(%s): %m", path.c_str());
            return -1;
        }
        VELA_LOG(LOG_AUTHPRIV | LOG_INFO, "session %s removed", LogId(sid).c_str());
        AuditSession(auditEvent != nullptr ? auditEvent : VELA::Audit::kSessionRevoke, s.user);
        return 0;
    } catch (const std::exception&) {
        return -1;
    }
}

int VELA::Session::List(std::vector<VELA::Session::Record>& out)
{
    out.clear();
    try {
        std::vector<std::string> ids;
        if (!VELA::Session::ListIds(SessionDir(), VELA_SESSION_ID_LEN, ids)) {
            return -1;
        }
        const long long now = VELA::Session::Now();
        for (const std::string& id : ids) {
            StoredSession s;
            if (LoadSession(id, s) != Load::Ok) {
                continue;
            }
            VELA::Session::Record r;
            r.sid = s.id;
            r.user = s.user;
            r.clientIP = s.clientIP;
            r.created = s.created;
            r.lastUse = s.lastUse;
            r.idleTimeout = static_cast<int>(s.idleTimeout);
            r.lifetime = static_cast<int>(s.lifetime);
            r.skipIP = s.skipIP;
            r.tokenProtect = s.tokenProtect;
            r.app = s.app;
            r.webapi = s.webapi;
            r.lang = s.lang;
            r.expired = Expired(s, now, 0);
            out.push_back(std::move(r));
        }
        std::sort(out.begin(), out.end(), [](const VELA::Session::Record& a, const VELA::Session::Record& b) {
                  return a.created != b.created ? a.created < b.created : a.sid < b.sid;
                  });
        return 0;
    } catch (const std::exception&) {
        out.clear();
        return -1;
    }
}

int VELA::Session::Purge(long long graceSeconds)
{
    if (graceSeconds < 0 || graceSeconds > kMaxTime) {
        return -1;
    }
    try {
        std::vector<std::string> ids;
        if (!VELA::Session::ListIds(SessionDir(), VELA_SESSION_ID_LEN, ids)) {
            return -1;
        }
        const std::string dir = SessionDir();
        int removed = 0;
        for (const std::string& id : ids) {
            StoredSession s;
            if (LoadSession(id, s) != Load::Ok || !Expired(s, VELA::Session::Now(), graceSeconds)) {
                continue;
            }
            // Checked again under the lock: a request may have refreshed it.
            VELA::Session::StoreLock lock(dir);
            if (!lock.Held()) {
                return -1;
            }
            if (LoadSession(id, s) == Load::Ok && Expired(s, VELA::Session::Now(), graceSeconds) &&
                unlink(SessionPath(id).c_str()) == 0) {
                ++removed;
            }
        }
        return removed;
    } catch (const std::exception&) {
        return -1;
    }
}
