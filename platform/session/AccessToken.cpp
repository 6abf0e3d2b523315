// Access tokens: one JSON file per token under <root>/var/lib/vela/tokens/
// (the format is described in vela/token.h). Tokens are only ever created,
// read and removed, never rewritten, so the store needs no lock.
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "session/SessionStore.h"
#include "vela/audit.h"
#include "vela/log.h"
#include "vela/token.h"
#include "vela/vlibc.h"

using VELA::Session::ReadResult;

namespace {

const char kTokenDir[] = "/var/lib/vela/tokens";
constexpr size_t kIdBytes = 16;
constexpr size_t kSecretBytes = 32;
static_assert(VELA::Session::IdLength(kIdBytes) == VELA_TOKEN_ID_LEN, "token id length");
static_assert(VELA::Session::IdLength(kSecretBytes) == VELA_TOKEN_SECRET_LEN, "token secret length");
constexpr size_t kMaxTokenFile = 16 * 1024;
constexpr size_t kMaxPattern = 128;
constexpr long long kMaxTime = 1LL << 40;
const int kAuthLog = LOG_AUTHPRIV | LOG_NOTICE;

struct Token {
    std::string id;
    std::string secret;
    std::string user;
    std::vector<std::string> apis;
    std::vector<std::string> methods;
    long long created = 0;
    long long expires = 0;
};

std::string TokenDir() { return VELA::System::Path(kTokenDir); }

std::string TokenPath(const std::string& id) { return TokenDir() + "/" + id; }

// An api or method name as the caller passes it: 1 to kMaxPattern name
// characters.
bool IsName(const char* name)
{
    if (name == nullptr) {
        return false;
    }
    return VELA::System::IsCheckedName(name, strnlen(name, kMaxPattern + 1), VELA::System::kNameDotted, kMaxPattern);
}

bool IsPattern(const std::string& pattern)
{
    if (pattern.empty() || pattern.size() > kMaxPattern) {
        return false;
    }
    const size_t stem = pattern.back() == '*' ? pattern.size() - 1 : pattern.size();
    // "*" alone stands for every name.
    return stem == 0 || VELA::System::IsCheckedName(pattern.data(), stem, VELA::System::kNameDotted, kMaxPattern);
}

bool Matches(const std::string& pattern, const char* name)
{
    if (!pattern.empty() && pattern.back() == '*') {
        return strncmp(name, pattern.c_str(), pattern.size() - 1) == 0;
    }
    return pattern == name;
}

bool MatchesAny(const std::vector<std::string>& patterns, const char* name)
{
    return std::any_of(patterns.begin(), patterns.end(), [name](const std::string& p) { return Matches(p, name); });
}

bool GetPatterns(const Json::Value& doc, const char* key, std::vector<std::string>& out)
{
    const Json::Value* list = doc.find(key, key + strlen(key));
    if (list == nullptr || !list->isArray() || list->empty() || list->size() > VELA_TOKEN_MAX_PATTERNS) {
        return false;
    }
    for (const Json::Value& item : *list) {
        if (!item.isString() || !IsPattern(item.asString())) {
            return false;
        }
        out.push_back(item.asString());
    }
    return true;
}

bool ParseToken(const Json::Value& doc, const std::string& id, Token& t)
{
    using namespace VELA::Session;
    long long version = 0;
    return GetInt(doc, "version", 1, 1, version) && GetString(doc, "id", VELA_TOKEN_ID_LEN, t.id) && t.id == id &&
           GetString(doc, "secret", VELA_TOKEN_SECRET_LEN, t.secret) &&
           IsId(t.secret.c_str(), VELA_TOKEN_SECRET_LEN) && GetString(doc, "user", 492, t.user) &&
           IsUserName(t.user.c_str()) && GetPatterns(doc, "apis", t.apis) &&
           GetPatterns(doc, "methods", t.methods) && GetInt(doc, "created", 0, kMaxTime, t.created) &&
           GetInt(doc, "expires", 0, kMaxTime, t.expires);
}

Json::Value TokenToJson(const Token& t)
{
    Json::Value doc(Json::objectValue);
    doc["version"] = 1;
    doc["id"] = t.id;
    doc["secret"] = t.secret;
    doc["user"] = t.user;
    doc["apis"] = Json::Value(Json::arrayValue);
    for (const std::string& p : t.apis) {
        doc["apis"].append(p);
    }
    doc["methods"] = Json::Value(Json::arrayValue);
    for (const std::string& p : t.methods) {
        doc["methods"].append(p);
    }
    doc["created"] = static_cast<Json::Int64>(t.created);
    doc["expires"] = static_cast<Json::Int64>(t.expires);
    return doc;
}

enum class Load { Ok, NoToken, Error };

// Loads token `id` (already checked with IsId).
Load LoadToken(const std::string& id, Token& t)
{
    Json::Value doc;
    switch (VELA::Session::ReadStateFile(TokenPath(id), kMaxTokenFile, doc)) {
    case ReadResult::Ok:
        break;
    case ReadResult::Missing:
    case ReadResult::Corrupt:
        return Load::NoToken;
    case ReadResult::Error:
        return Load::Error;
    }
    if (!ParseToken(doc, id, t)) {
        VELA_LOG_ERR("access token %s: invalid token file, refused", id.c_str());
        return Load::NoToken;
    }
    return Load::Ok;
}

// Splits "<id>.<secret>" after checking its exact form.
bool SplitToken(const char* token, std::string& id, std::string& secret)
{
    if (token == nullptr || strnlen(token, VELA_TOKEN_LEN + 1) != VELA_TOKEN_LEN ||
        token[VELA_TOKEN_ID_LEN] != '.') {
        return false;
    }
    id.assign(token, VELA_TOKEN_ID_LEN);
    secret.assign(token + VELA_TOKEN_ID_LEN + 1);
    return VELA::Session::IsId(id.c_str(), VELA_TOKEN_ID_LEN) &&
           VELA::Session::IsId(secret.c_str(), VELA_TOKEN_SECRET_LEN);
}

int Grant(const char* token, const char* api, const char* method, char* user, size_t userSize)
{
    std::string id;
    std::string secret;
    if (!SplitToken(token, id, secret)) {
        VELA_LOG(kAuthLog, "access token: malformed token (%zu bytes), refused",
                 token == nullptr ? 0 : strnlen(token, 1024));
        return -1;
    }
    if (!IsName(api) || !IsName(method)) {
        VELA_LOG(kAuthLog, "access token %s: invalid api or method name, refused", id.c_str());
        return -3;
    }
    Token t;
    const Load loaded = LoadToken(id, t);
    if (loaded == Load::Error) {
        return -5;
    }
    if (loaded == Load::NoToken || !VELA::Session::ConstantTimeEquals(secret, t.secret)) {
        VELA_LOG(kAuthLog, "access token %s: unknown token, refused", id.c_str());
        return -1;
    }
    if (VELA::Session::Now() >= t.expires) {
        VELA_LOG(kAuthLog, "access token %s of \"%s\": expired", id.c_str(), t.user.c_str());
        return -2;
    }
    if (!MatchesAny(t.apis, api) || !MatchesAny(t.methods, method)) {
        VELA_LOG(kAuthLog, "access token %s of \"%s\": %s method %s not granted", id.c_str(), t.user.c_str(),
                 api, method);
        return -3;
    }
    uid_t uid = 0;
    const int known = VELA::Session::LookupUser(t.user.c_str(), uid);
    if (known < 0) {
        return -5;
    }
    if (known == 0) {
        VELA_LOG(kAuthLog, "access token %s: user \"%s\" no longer exists", id.c_str(), t.user.c_str());
        return -4;
    }
    if (!VELA::Session::CopyOut(t.user, user, userSize)) {
        VELA_LOG_ERR("access token %s: user name does not fit a buffer of %zu bytes", id.c_str(), userSize);
        return -5;
    }
    return 0;
}

void PurgeExpired()
{
    std::vector<std::string> ids;
    if (!VELA::Session::ListIds(TokenDir(), VELA_TOKEN_ID_LEN, ids)) {
        return;
    }
    const long long now = VELA::Session::Now();
    for (const std::string& id : ids) {
        Token t;
        if (LoadToken(id, t) == Load::Ok && now >= t.expires) {
            if (unlink(TokenPath(id).c_str()) == 0) {
                VELA_LOG(LOG_AUTHPRIV | LOG_INFO, "access token %s of \"%s\" expired, removed", id.c_str(),
                         t.user.c_str());
            }
        }
    }
}

bool CheckPatterns(const std::vector<std::string>& patterns, const char* what)
{
    if (patterns.empty() || patterns.size() > VELA_TOKEN_MAX_PATTERNS) {
        VELA_LOG_ERR("access token create: 1 to %d %s patterns needed", VELA_TOKEN_MAX_PATTERNS, what);
        return false;
    }
    for (const std::string& p : patterns) {
        if (!IsPattern(p)) {
            VELA_LOG_ERR("access token create: invalid %s pattern \"%.140s\"", what, p.c_str());
            return false;
        }
    }
    return true;
}

// One line of the audit trail about token `id` of `user` (never its secret).
void AuditToken(const char* name, const std::string& user, const std::string& id)
{
    VELA::Audit::Event event;
    event.name = name;
    event.user = user;
    event.tokenId = id;
    VELA::Audit::Record(event);
}

int Create(const char* user, const std::vector<std::string>& apis, const std::vector<std::string>& methods,
           long long lifetime, std::string& token, std::string& id)
{
    using namespace VELA::Session;
    if (!IsUserName(user)) {
        VELA_LOG_ERR("access token create: invalid user name");
        return -1;
    }
    uid_t uid = 0;
    const int known = LookupUser(user, uid);
    if (known != 1) {
        if (known == 0) {
            VELA_LOG_ERR("access token create: no user \"%s\"", user);
        }
        return -1;
    }
    if (!CheckPatterns(apis, "api") || !CheckPatterns(methods, "method")) {
        return -1;
    }
    if (lifetime == 0) {
        lifetime = VELA_TOKEN_LIFETIME_DEFAULT;
    }
    if (lifetime < 1 || lifetime > VELA_TOKEN_LIFETIME_MAX) {
        VELA_LOG_ERR("access token create: lifetime %lld out of range", lifetime);
        return -1;
    }
    const std::string dir = TokenDir();
    if (!EnsureStateDir(dir)) {
        return -1;
    }
    PurgeExpired();

    Token t;
    t.user = user;
    t.apis = apis;
    t.methods = methods;
    for (int attempt = 0;; ++attempt) {
        if (attempt == 3) {
            VELA_LOG_ERR("access token create: no free token id");
            return -1;
        }
        if (!RandomId(kIdBytes, t.id) || !RandomId(kSecretBytes, t.secret)) {
            return -1;
        }
        struct stat st;
        if (lstat(TokenPath(t.id).c_str(), &st) != 0 && errno == ENOENT) {
            break;
        }
    }
    t.created = Now();
    t.expires = t.created + lifetime;
    if (!WriteStateFile(TokenPath(t.id), TokenToJson(t))) {
        return -1;
    }
    token = t.id + "." + t.secret;
    id = t.id;
    VELA_LOG(LOG_AUTHPRIV | LOG_INFO, "access token %s created for \"%s\", expires %lld", t.id.c_str(), user,
             t.expires);
    AuditToken(VELA::Audit::kTokenCreate, t.user, t.id);
    return 0;
}

}  // namespace

bool VelaAccessTokenIsPattern(const std::string& pattern) { return IsPattern(pattern); }

int VelaAccessTokenGrant(const char* token, const char* api, const char* method, char* user, size_t userSize)
{
    if (user != nullptr && userSize > 0) {
        user[0] = '\0';
    }
    try {
        const int rc = Grant(token, api, method, user, userSize);
        if (rc != 0 && user != nullptr && userSize > 0) {
            user[0] = '\0';
        }
        return rc;
    } catch (const std::exception&) {
        VELA_LOG_ERR("access token: out of memory");
        if (user != nullptr && userSize > 0) {
            user[0] = '\0';
        }
        return -5;
    }
}

int VelaAccessTokenCreate(const char* user, const std::vector<std::string>& apis,
                          const std::vector<std::string>& methods, long long lifetime, std::string& token,
                          std::string& id)
{
    token.clear();
    id.clear();
    try {
        return Create(user, apis, methods, lifetime, token, id);
    } catch (const std::exception&) {
        VELA_LOG_ERR("access token create: out of memory");
        token.clear();
        id.clear();
        return -1;
    }
}

int VelaAccessTokenList(std::vector<VelaAccessTokenRecord>& out)
{
    out.clear();
    try {
        std::vector<std::string> ids;
        if (!VELA::Session::ListIds(TokenDir(), VELA_TOKEN_ID_LEN, ids)) {
            return -1;
        }
        const long long now = VELA::Session::Now();
        for (const std::string& id : ids) {
            Token t;
            if (LoadToken(id, t) != Load::Ok) {
                continue;
            }
            VelaAccessTokenRecord r;
            r.id = t.id;
            r.user = t.user;
            r.apis = t.apis;
            r.methods = t.methods;
            r.created = t.created;
            r.expires = t.expires;
            r.expired = now >= t.expires;
            out.push_back(std::move(r));
        }
        std::sort(out.begin(), out.end(), [](const VelaAccessTokenRecord& a, const VelaAccessTokenRecord& b) {
            return a.created != b.created ? a.created < b.created : a.id < b.id;
        });
        return 0;
    } catch (const std::exception&) {
        out.clear();
        return -1;
    }
}

int VelaAccessTokenRevoke(const char* id)
{
    try {
        std::string name;
        std::string secret;
        if (SplitToken(id, name, secret)) {
            // A whole token was given: its id part names the file.
        } else if (VELA::Session::IsId(id, VELA_TOKEN_ID_LEN)) {
            name = id;
        } else {
            return -2;
        }
        const std::string path = TokenPath(name);
        Token t;  // whose token it was, for the audit trail
        if (LoadToken(name, t) != Load::Ok) {
            t.user.clear();
        }
        if (unlink(path.c_str()) != 0) {
            if (errno == ENOENT) {
                return -2;
            }
            VELA_LOG_ERR("unlink(%s): %m", path.c_str());
            return -1;
        }
        VELA_LOG(LOG_AUTHPRIV | LOG_INFO, "access token %s revoked", name.c_str());
        AuditToken(VELA::Audit::kTokenRevoke, t.user, name);
        return 0;
    } catch (const std::exception&) {
        return -1;
    }
}
