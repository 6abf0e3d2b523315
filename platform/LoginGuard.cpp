// The brute-force guard of the login API and the login settings (the
// contract is in vela/loginguard.h).
//
// A record is the JSON object {"version":1, "attempts":[t, ...],
// "blockedUntil":T}: the times of the attempts counted within the window
// (in progress or failed) and the end of the block, 0 for none. A record
// that holds nothing is removed rather than written.
#include <arpa/inet.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <unistd.h>
#include <vector>

#include "LazyCrypto.h"
#include "SessionStore.h"
#include "vela/log.h"
#include "vela/loginguard.h"
#include "vela/session.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"

namespace {

using VELA::Platform::Now;

const char kGuardDir[] = "/run/vela/login-guard";
const char kConfPath[] = "/etc/vela/webapi.conf";
constexpr size_t kMaxRecordFile = 64 * 1024;
constexpr int kLockSeconds = 5;
constexpr size_t kMaxLoggedAccount = 64;
const int kFailureLog = LOG_AUTHPRIV | LOG_WARNING;
const int kBlockLog = LOG_AUTHPRIV | LOG_NOTICE;

// ---- Settings ------------------------------------------------------------------------

// A decimal number of at most nine digits, nothing else, within min .. max.
bool ParseSetting(const char* text, int min, int max, int& out)
{
    const size_t len = strlen(text);
    if (len == 0 || len > 9) {
        return false;
    }
    int value = 0;
    for (size_t i = 0; i < len; ++i) {
        if (text[i] < '0' || text[i] > '9') {
            return false;
        }
        value = value * 10 + (text[i] - '0');
    }
    if (value < min || value > max) {
        return false;
    }
    out = value;
    return true;
}

void LoadSetting(const char* key, int min, int max, int& value)
{
    char buf[64];
    const int found = VLIBCFileGetKeyValue(kConfPath, key, buf, sizeof(buf));
    if (found == 0) {
        return;
    }
    if (found < 0) {
        VELA_LOG_ERR("%s: %s unreadable, keeping %d", kConfPath, key, value);
        return;
    }
    if (!ParseSetting(buf, min, max, value)) {
        VELA_LOG_ERR("%s: %s=\"%.32s\" is not a number from %d to %d, keeping %d", kConfPath, key, buf, min, max,
                     value);
    }
}

// ---- Names of the records --------------------------------------------------------------

// The account as logs show it: printable ASCII as it is (but for the quote
// and the backslash), every other byte as \xHH, at most kMaxLoggedAccount
// bytes of it.
std::string LoggedAccount(const char* account)
{
    std::string out;
    const size_t len = strnlen(account, VELA_LOGIN_ACCOUNT_MAX + 1);
    for (size_t i = 0; i < len && i < kMaxLoggedAccount; ++i) {
        const unsigned char c = static_cast<unsigned char>(account[i]);
        if (c >= 0x20 && c < 0x7f && c != '"' && c != '\\') {
            out.push_back(static_cast<char>(c));
        } else {
            char hex[5];
            snprintf(hex, sizeof(hex), "\\x%02x", c);
            out += hex;
        }
    }
    if (len > kMaxLoggedAccount) {
        out += "...";
    }
    return out;
}

// The key an address counts under: the canonical IPv4 address, the /64
// prefix of an IPv6 address, "?" for an unknown client. False for text that
// is not an address.
bool AddressKey(const char* clientIP, std::string& key)
{
    if (clientIP == nullptr || clientIP[0] == '\0') {
        key = "addr:?";
        return true;
    }
    std::string canonical;
    if (strnlen(clientIP, INET6_ADDRSTRLEN) >= INET6_ADDRSTRLEN ||
        !VELA::Platform::CanonicalAddress(clientIP, canonical)) {
        return false;
    }
    struct in6_addr v6;
    if (inet_pton(AF_INET6, canonical.c_str(), &v6) == 1) {
        memset(v6.s6_addr + 8, 0, 8);
        char buf[INET6_ADDRSTRLEN];
        if (inet_ntop(AF_INET6, &v6, buf, sizeof(buf)) == nullptr) {
            return false;
        }
        canonical = std::string(buf) + "/64";
    }
    key = "addr:" + canonical;
    return true;
}

// The key an account counts under: its text with ASCII letters lowered.
bool AccountKey(const char* account, std::string& key)
{
    const size_t len = account == nullptr ? 0 : strnlen(account, VELA_LOGIN_ACCOUNT_MAX + 1);
    if (len == 0 || len > VELA_LOGIN_ACCOUNT_MAX) {
        return false;
    }
    key = "acct:";
    for (size_t i = 0; i < len; ++i) {
        const char c = account[i];
        key.push_back(c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c);
    }
    return true;
}

std::string GuardDir() { return VELA::VelaPath(kGuardDir); }

// The record file of `key`: the hex SHA-256 of the key.
bool RecordPath(const std::string& key, std::string& path)
{
    const VELA::Platform::CryptoApi* api = VELA::Platform::LazyCrypto();
    if (api == nullptr) {
        return false;
    }
    unsigned char md[32];
    unsigned int mdLen = 0;
    if (api->EVP_Digest(key.data(), key.size(), md, &mdLen, api->EVP_sha256(), nullptr) != 1 ||
        mdLen != sizeof(md)) {
        VELA::Platform::LogCryptoError(*api, "login guard: SHA-256 failed");
        return false;
    }
    static const char kHex[] = "0123456789abcdef";
    path = GuardDir() + "/";
    for (unsigned char b : md) {
        path.push_back(kHex[b >> 4]);
        path.push_back(kHex[b & 15]);
    }
    return true;
}

// ---- Records ---------------------------------------------------------------------------

struct Record {
    std::string path;
    std::vector<long long> attempts;  // oldest first
    long long blockedUntil = 0;
};

struct Limits {
    int maxFailures;
    long long window;  // seconds
    long long block;   // seconds
};

// The settings' limits, each forced into its bounds.
Limits LimitsOf(const VelaLoginSettings* settings)
{
    const VelaLoginSettings defaults;
    const VelaLoginSettings& s = settings != nullptr ? *settings : defaults;
    auto clamp = [](int v, int max) { return v < 1 ? 1 : (v > max ? max : v); };
    return Limits{clamp(s.maxFailures, VELA_LOGIN_MAX_FAILURES_MAX),
                  60LL * clamp(s.windowMinutes, VELA_LOGIN_MINUTES_MAX),
                  60LL * clamp(s.blockMinutes, VELA_LOGIN_MINUTES_MAX)};
}

// Reads the record at `rec.path`. A missing file is an empty record, and
// so is a corrupt one (logged by the reader): it is overwritten. False
// when the file cannot be read.
bool LoadRecord(Record& rec)
{
    using VELA::Platform::ReadResult;
    Json::Value doc;
    const ReadResult r = VELA::Platform::ReadStateFile(rec.path, kMaxRecordFile, doc);
    if (r == ReadResult::Error) {
        return false;
    }
    if (r != ReadResult::Ok) {
        return true;
    }
    const Json::Value& attempts = doc["attempts"];
    long long until = 0;
    if (!attempts.isArray() || !VELA::Platform::GetInt(doc, "blockedUntil", 0, 1LL << 40, until)) {
        VELA_LOG_ERR("%s is not a login-guard record, starting afresh", rec.path.c_str());
        return true;
    }
    rec.blockedUntil = until;
    for (const Json::Value& t : attempts) {
        if (t.isInt64() && rec.attempts.size() < VELA_LOGIN_MAX_FAILURES_MAX) {
            rec.attempts.push_back(t.asInt64());
        }
    }
    return true;
}

// Drops attempts that left the window and a block that is over. Times in
// the future (the clock went back) count as now, and a block never lasts
// longer than `limits.block` from now.
void Prune(Record& rec, long long now, const Limits& limits)
{
    std::vector<long long> kept;
    for (long long t : rec.attempts) {
        if (t > now) {
            t = now;
        }
        if (t > now - limits.window) {
            kept.push_back(t);
        }
    }
    rec.attempts.swap(kept);
    if (rec.blockedUntil <= now) {
        rec.blockedUntil = 0;
    } else if (rec.blockedUntil > now + limits.block) {
        rec.blockedUntil = now + limits.block;
    }
}

// Seconds until `rec` lets an attempt through: the rest of its block, or,
// when the counted attempts have reached the limit, until the oldest leaves
// the window. 0 when it lets one through now.
long long WaitOf(const Record& rec, long long now, const Limits& limits)
{
    if (rec.blockedUntil > now) {
        return rec.blockedUntil - now;
    }
    if (rec.attempts.size() >= static_cast<size_t>(limits.maxFailures)) {
        const long long wait = rec.attempts.front() + limits.window - now;
        return wait > 0 ? wait : 1;
    }
    return 0;
}

bool SaveRecord(const Record& rec)
{
    if (rec.attempts.empty() && rec.blockedUntil == 0) {
        if (unlink(rec.path.c_str()) != 0 && errno != ENOENT) {
            VELA_LOG_ERR("unlink(%s): %m", rec.path.c_str());
            return false;
        }
        return true;
    }
    Json::Value doc(Json::objectValue);
    doc["version"] = 1;
    doc["attempts"] = Json::Value(Json::arrayValue);
    for (long long t : rec.attempts) {
        doc["attempts"].append(static_cast<Json::Int64>(t));
    }
    doc["blockedUntil"] = static_cast<Json::Int64>(rec.blockedUntil);
    return VELA::Platform::WriteStateFile(rec.path, doc, false);
}

// The exclusive lock of the guard directory, created on the way.
class GuardLock {
public:
    GuardLock()
    {
        const std::string dir = GuardDir();
        if (!VELA::Platform::EnsureStateDir(dir)) {
            return;
        }
        if (VLIBCFileLockTimeByFile((dir + "/.lock").c_str(), 1, kLockSeconds, &handle_) != 0) {
            VELA_LOG_ERR("login guard: cannot lock %s: %m", dir.c_str());
            handle_ = -1;
        }
    }
    ~GuardLock()
    {
        if (handle_ >= 0) {
            VLIBCFileUnlockByFile(handle_);
        }
    }
    GuardLock(const GuardLock&) = delete;
    GuardLock& operator=(const GuardLock&) = delete;
    bool Held() const { return handle_ >= 0; }

private:
    int handle_ = -1;
};

// The two records of one login: [0] the account's, [1] the address's.
struct Pair {
    Record rec[2];
    std::string loggedAccount;
    std::string loggedAddress;
};

// Checks the arguments and names the two records. False (logged) for an
// invalid account or address.
bool NameRecords(const char* account, const char* clientIP, Pair& pair)
{
    std::string accountKey;
    std::string addressKey;
    if (!AccountKey(account, accountKey)) {
        VELA_LOG_ERR("login guard: refused an account of no or more than %d bytes", VELA_LOGIN_ACCOUNT_MAX);
        return false;
    }
    pair.loggedAccount = LoggedAccount(account);
    if (!AddressKey(clientIP, addressKey)) {
        VELA_LOG_ERR("login guard: the client address of \"%s\" is not an address", pair.loggedAccount.c_str());
        return false;
    }
    pair.loggedAddress = clientIP != nullptr && clientIP[0] != '\0' ? clientIP : "an unknown address";
    return RecordPath(accountKey, pair.rec[0].path) && RecordPath(addressKey, pair.rec[1].path);
}

bool LoadPair(Pair& pair, long long now, const Limits& limits)
{
    for (Record& rec : pair.rec) {
        if (!LoadRecord(rec)) {
            return false;
        }
        Prune(rec, now, limits);
    }
    return true;
}

int Begin(const VelaLoginSettings* settings, const char* account, const char* clientIP, int* waitSeconds)
{
    const Limits limits = LimitsOf(settings);
    Pair pair;
    if (!NameRecords(account, clientIP, pair)) {
        return VELA_LOGIN_GUARD_ERROR;
    }
    GuardLock lock;
    if (!lock.Held()) {
        return VELA_LOGIN_GUARD_ERROR;
    }
    const long long now = Now();
    if (!LoadPair(pair, now, limits)) {
        return VELA_LOGIN_GUARD_ERROR;
    }
    long long wait = 0;
    for (const Record& rec : pair.rec) {
        const long long w = WaitOf(rec, now, limits);
        wait = w > wait ? w : wait;
    }
    if (wait > 0) {
        if (waitSeconds != nullptr) {
            *waitSeconds = static_cast<int>(wait);
        }
        VELA_LOG(kBlockLog,
                 "login refused without a password check: account \"%s\" from %s, blocked for %lld more seconds",
                 pair.loggedAccount.c_str(), pair.loggedAddress.c_str(), wait);
        return VELA_LOGIN_GUARD_BLOCKED;
    }
    for (Record& rec : pair.rec) {
        rec.attempts.push_back(now);
        if (!SaveRecord(rec)) {
            return VELA_LOGIN_GUARD_ERROR;
        }
    }
    return VELA_LOGIN_GUARD_ALLOW;
}

void Failed(const VelaLoginSettings* settings, const char* account, const char* clientIP, const char* reason)
{
    const Limits limits = LimitsOf(settings);
    Pair pair;
    if (!NameRecords(account, clientIP, pair)) {
        return;
    }
    VELA_LOG(kFailureLog, "login failed: account \"%s\" from %s%s%.128s%s", pair.loggedAccount.c_str(),
             pair.loggedAddress.c_str(), reason != nullptr ? " (" : "", reason != nullptr ? reason : "",
             reason != nullptr ? ")" : "");
    GuardLock lock;
    const long long now = Now();
    if (!lock.Held() || !LoadPair(pair, now, limits)) {
        return;
    }
    for (int i = 0; i < 2; ++i) {
        Record& rec = pair.rec[i];
        if (rec.blockedUntil != 0 || rec.attempts.size() < static_cast<size_t>(limits.maxFailures)) {
            continue;
        }
        const size_t failures = rec.attempts.size();
        rec.attempts.clear();
        rec.blockedUntil = now + limits.block;
        if (!SaveRecord(rec)) {
            continue;
        }
        if (i == 0) {
            VELA_LOG(kBlockLog,
                     "login blocked for %lld minutes: %zu failures for account \"%s\" within %lld minutes "
                     "(the last from %s)",
                     limits.block / 60, failures, pair.loggedAccount.c_str(), limits.window / 60,
                     pair.loggedAddress.c_str());
        } else {
            VELA_LOG(kBlockLog,
                     "login blocked for %lld minutes: %zu failures from %s within %lld minutes "
                     "(the last for account \"%s\")",
                     limits.block / 60, failures, pair.loggedAddress.c_str(), limits.window / 60,
                     pair.loggedAccount.c_str());
        }
    }
}

int Succeeded(const char* account, const char* clientIP)
{
    Pair pair;
    if (!NameRecords(account, clientIP, pair)) {
        return -1;
    }
    GuardLock lock;
    if (!lock.Held()) {
        return -1;
    }
    int rc = 0;
    for (const Record& rec : pair.rec) {
        if (!SaveRecord(rec)) {  // empty: removes the file
            rc = -1;
        }
    }
    return rc;
}

}  // namespace

void VelaLoginSettingsLoad(VelaLoginSettings* settings)
{
    if (settings == nullptr) {
        return;
    }
    *settings = VelaLoginSettings();
    LoadSetting("login_max_failures", 1, VELA_LOGIN_MAX_FAILURES_MAX, settings->maxFailures);
    LoadSetting("login_window_minutes", 1, VELA_LOGIN_MINUTES_MAX, settings->windowMinutes);
    LoadSetting("login_block_minutes", 1, VELA_LOGIN_MINUTES_MAX, settings->blockMinutes);
    LoadSetting("session_idle_timeout", 1, VELA_SESSION_IDLE_MAX, settings->idleTimeout);
    LoadSetting("session_lifetime", 1, VELA_SESSION_LIFETIME_MAX, settings->lifetime);
}

int VelaLoginGuardBegin(const VelaLoginSettings* settings, const char* account, const char* clientIP,
                        int* waitSeconds)
{
    if (waitSeconds != nullptr) {
        *waitSeconds = 0;
    }
    try {
        return Begin(settings, account, clientIP, waitSeconds);
    } catch (const std::exception&) {
        VELA_LOG_ERR("login guard: out of memory");
        return VELA_LOGIN_GUARD_ERROR;
    }
}

void VelaLoginGuardFailed(const VelaLoginSettings* settings, const char* account, const char* clientIP,
                          const char* reason)
{
    try {
        Failed(settings, account, clientIP, reason);
    } catch (const std::exception&) {
        VELA_LOG_ERR("login guard: out of memory");
    }
}

int VelaLoginGuardSucceeded(const char* account, const char* clientIP)
{
    try {
        return Succeeded(account, clientIP);
    } catch (const std::exception&) {
        VELA_LOG_ERR("login guard: out of memory");
        return -1;
    }
}
