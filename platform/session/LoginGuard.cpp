// The brute-force guard of the login API and the login settings (the
// contract and the policy are in vela/loginguard.h).
//
// A record is the JSON object {"version":2, "subject":"192.0.2.7",
// "attempts":[[t, "tag"], ...], "blockedUntil":T, "blockFailures":N}: what
// it counts (the address key or the account key without its "addr:" or
// "acct:"), the attempts counted within the window (in progress or
// failed), each with the tag of the other side of its (account, address)
// pair, the end of the block, 0 for none, and the failures that started
// the block. A tag is the first 16 hex
// digits of the other record's name. A record that holds nothing is removed
// rather than written. The file's modification time is set to the moment
// the record will hold nothing any more (its expiry), so the purge finds
// expired records without reading them.
#include <arpa/inet.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <algorithm>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "session/LazyCrypto.h"
#include "session/SessionStore.h"
#include "vela/log.h"
#include "vela/loginguard.h"
#include "vela/session.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"

namespace {

using VELA::Session::LoginSettings;
using VELA::Session::Now;

const char kGuardDir[] = "/run/vela/login-guard";
const char kConfPath[] = "/etc/vela/webapi.conf";
const char kAddressPrefix[] = "addr-";
const char kAccountPrefix[] = "acct-";
constexpr size_t kTagLen = 16;
// An account record keeps at most this many attempts (the newest); an
// address record never holds more than the limit, since the address is
// blocked on reaching it.
constexpr size_t kMaxAttempts = VELA_LOGIN_MAX_FAILURES_MAX;
constexpr size_t kMaxRecordFile = 128 * 1024;
constexpr int kLockSeconds = 5;
constexpr size_t kMaxLoggedAccount = 64;
constexpr size_t kMaxSubject = VELA_LOGIN_ACCOUNT_MAX;
constexpr size_t kDigestHexLen = 64;
const int kFailureLog = LOG_AUTHPRIV | LOG_WARNING;
const int kBlockLog = LOG_AUTHPRIV | LOG_NOTICE;

// ---- Settings ------------------------------------------------------------------------

// A decimal number, nothing else, within min .. max.
bool ParseSetting(const char* text, int min, int max, int& out)
{
    long long value = 0;
    if (!VELA::System::ParseDecimal(text, strlen(text), min, max, value)) {
        return false;
    }
    out = static_cast<int>(value);
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
        !VELA::Session::CanonicalAddress(clientIP, canonical)) {
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

std::string GuardDir() { return VELA::System::Path(kGuardDir); }

// The hex SHA-256 of `key`.
bool Digest(const std::string& key, std::string& hex)
{
    const VELA::Session::CryptoApi* api = VELA::Session::LazyCrypto();
    if (api == nullptr) {
        return false;
    }
    unsigned char md[32];
    unsigned int mdLen = 0;
    if (api->EVP_Digest(key.data(), key.size(), md, &mdLen, api->EVP_sha256(), nullptr) != 1 ||
        mdLen != sizeof(md)) {
        VELA::Session::LogCryptoError(*api, "login guard: SHA-256 failed");
        return false;
    }
    static const char kHex[] = "0123456789abcdef";
    hex.clear();
    for (unsigned char b : md) {
        hex.push_back(kHex[b >> 4]);
        hex.push_back(kHex[b & 15]);
    }
    return true;
}

// ---- Records ---------------------------------------------------------------------------

struct Attempt {
    long long t;
    std::string tag;  // the other side of the (account, address) pair
};

struct Record {
    std::string path;
    std::string subject;  // the key without its "addr:" or "acct:"
    std::string tag;      // this record's tag, as the other record knows it
    bool exists = false;  // a file was found
    std::vector<Attempt> attempts;  // oldest first
    long long blockedUntil = 0;
    long long blockFailures = 0;  // the failures that started the block
};

struct Limits {
    int maxFailures;
    long long window;  // seconds
    long long block;   // seconds
    int maxRecords;
};

// The settings' limits, each forced into its bounds.
Limits LimitsOf(const LoginSettings* settings)
{
    const LoginSettings defaults;
    const LoginSettings& s = settings != nullptr ? *settings : defaults;
    auto clamp = [](int v, int max) { return v < 1 ? 1 : (v > max ? max : v); };
    return Limits{clamp(s.maxFailures, VELA_LOGIN_MAX_FAILURES_MAX),
                  60LL * clamp(s.windowMinutes, VELA_LOGIN_MINUTES_MAX),
                  60LL * clamp(s.blockMinutes, VELA_LOGIN_MINUTES_MAX),
                  clamp(s.maxRecords, VELA_LOGIN_GUARD_RECORDS_MAX)};
}

// The counts of the record document `doc` into `rec`. False, `rec`
// untouched, when it is not a record.
bool ParseRecord(const Json::Value& doc, Record& rec)
{
    const Json::Value& attempts = doc["attempts"];
    long long until = 0;
    long long version = 0;
    if (!attempts.isArray() || !VELA::Session::GetInt(doc, "version", 2, 2, version) ||
        !VELA::Session::GetInt(doc, "blockedUntil", 0, 1LL << 40, until)) {
        return false;
    }
    rec.blockedUntil = until;
    long long failures = 0;
    if (VELA::Session::GetInt(doc, "blockFailures", 0, kMaxAttempts, failures)) {
        rec.blockFailures = failures;
    }
    for (const Json::Value& a : attempts) {
        if (rec.attempts.size() >= kMaxAttempts) {
            break;
        }
        if (a.isArray() && a.size() == 2 && a[0].isInt64() && a[1].isString() && a[1].asString().size() == kTagLen) {
            rec.attempts.push_back(Attempt{a[0].asInt64(), a[1].asString()});
        }
    }
    return true;
}

// Reads the record at `rec.path`. A missing file is an empty record, and
// so is a corrupt one (logged): it is overwritten. False when the file
// cannot be read.
bool LoadRecord(Record& rec)
{
    using VELA::Session::ReadResult;
    Json::Value doc;
    const ReadResult r = VELA::Session::ReadStateFile(rec.path, kMaxRecordFile, doc);
    if (r == ReadResult::Error) {
        return false;
    }
    rec.exists = r != ReadResult::Missing;
    if (r == ReadResult::Ok && !ParseRecord(doc, rec)) {
        VELA_LOG_ERR("%s is not a login-guard record, starting afresh", rec.path.c_str());
    }
    return true;
}

// Drops attempts that left the window and a block that is over. Times in
// the future (the clock went back) count as now, and a block never lasts
// longer than `limits.block` from now.
void Prune(Record& rec, long long now, const Limits& limits)
{
    std::vector<Attempt> kept;
    for (Attempt& a : rec.attempts) {
        if (a.t > now) {
            a.t = now;
        }
        if (a.t > now - limits.window) {
            kept.push_back(std::move(a));
        }
    }
    rec.attempts.swap(kept);
    if (rec.blockedUntil <= now) {
        rec.blockedUntil = 0;
        rec.blockFailures = 0;
    } else if (rec.blockedUntil > now + limits.block) {
        rec.blockedUntil = now + limits.block;
    }
}

// Seconds until `rec` lets an attempt through: the rest of its block, or,
// when the counted attempts have reached the limit, until the one that
// brings them under it leaves the window. 0 when it lets one through now.
long long WaitOf(const Record& rec, long long now, const Limits& limits)
{
    if (rec.blockedUntil > now) {
        return rec.blockedUntil - now;
    }
    const size_t limit = static_cast<size_t>(limits.maxFailures);
    if (rec.attempts.size() >= limit) {
        const long long wait = rec.attempts[rec.attempts.size() - limit].t + limits.window - now;
        return wait > 0 ? wait : 1;
    }
    return 0;
}

// When the record will hold nothing any more.
long long ExpiryOf(const Record& rec, const Limits& limits)
{
    long long expiry = rec.blockedUntil;
    for (const Attempt& a : rec.attempts) {
        expiry = a.t + limits.window > expiry ? a.t + limits.window : expiry;
    }
    return expiry;
}

// Writes the record with its expiry as the file's modification time, or
// removes the file of an empty record.
bool SaveRecord(const Record& rec, const Limits& limits)
{
    if (rec.attempts.empty() && rec.blockedUntil == 0) {
        if (unlink(rec.path.c_str()) != 0 && errno != ENOENT) {
            VELA_LOG_ERR("unlink(%s): %m", rec.path.c_str());
            return false;
        }
        return true;
    }
    Json::Value doc(Json::objectValue);
    doc["version"] = 2;
    doc["subject"] = rec.subject;
    doc["attempts"] = Json::Value(Json::arrayValue);
    for (const Attempt& a : rec.attempts) {
        Json::Value pair(Json::arrayValue);
        pair.append(static_cast<Json::Int64>(a.t));
        pair.append(a.tag);
        doc["attempts"].append(pair);
    }
    doc["blockedUntil"] = static_cast<Json::Int64>(rec.blockedUntil);
    if (rec.blockedUntil != 0) {
        doc["blockFailures"] = static_cast<Json::Int64>(rec.blockFailures);
    }
    if (!VELA::Session::WriteStateFile(rec.path, doc, false)) {
        return false;
    }
    const struct timespec times[2] = {{static_cast<time_t>(ExpiryOf(rec, limits)), 0},
                                      {static_cast<time_t>(ExpiryOf(rec, limits)), 0}};
    if (utimensat(AT_FDCWD, rec.path.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) {
        // A record without its expiry would be purged as expired.
        VELA_LOG_ERR("utimensat(%s): %m", rec.path.c_str());
        unlink(rec.path.c_str());
        return false;
    }
    return true;
}

// Adds an attempt at `now` tagged `tag`, dropping the oldest beyond
// kMaxAttempts.
void AddAttempt(Record& rec, long long now, const std::string& tag)
{
    if (rec.attempts.size() >= kMaxAttempts) {
        rec.attempts.erase(rec.attempts.begin(), rec.attempts.begin() + (rec.attempts.size() - kMaxAttempts + 1));
    }
    rec.attempts.push_back(Attempt{now, tag});
}

// Removes the attempts of the pair whose other side is `tag`. True when
// some were removed.
bool RemovePair(Record& rec, const std::string& tag)
{
    const size_t before = rec.attempts.size();
    std::vector<Attempt> kept;
    for (Attempt& a : rec.attempts) {
        if (a.tag != tag) {
            kept.push_back(std::move(a));
        }
    }
    rec.attempts.swap(kept);
    return rec.attempts.size() != before;
}

// ---- The store ---------------------------------------------------------------------------

// What the purge saw of the records that remain.
struct StoreState {
    int addressRecords = 0;
    long long earliestExpiry = 0;  // of an address record; 0 for none
};

// Removes every expired record (and any other file but the lock that the
// store holds: a temporary file a dead writer left). No file is read: the
// expiry is the modification time. The work is one pass over the
// directory, whose address records are bounded by login_guard_max_records
// and whose account records by the accounts of the machine. Runs under the
// lock.
bool Purge(long long now, StoreState& state)
{
    const std::string dir = GuardDir();
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        VELA_LOG_ERR("login guard: opendir(%s): %m", dir.c_str());
        return false;
    }
    const int fd = dirfd(d);
    size_t purged = 0;
    for (struct dirent* e = readdir(d); e != nullptr; e = readdir(d)) {
        const char* name = e->d_name;
        if (strcmp(name, ".") == 0 || strcmp(name, "..") == 0 || strcmp(name, ".lock") == 0) {
            continue;
        }
        struct stat st;
        if (fstatat(fd, name, &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(st.st_mode)) {
            continue;
        }
        if (st.st_mtime <= now) {
            if (unlinkat(fd, name, 0) == 0) {
                ++purged;
            }
            continue;
        }
        if (strncmp(name, kAddressPrefix, sizeof(kAddressPrefix) - 1) == 0) {
            ++state.addressRecords;
            if (state.earliestExpiry == 0 || st.st_mtime < state.earliestExpiry) {
                state.earliestExpiry = st.st_mtime;
            }
        }
    }
    closedir(d);
    if (purged > 0) {
        VELA_LOG(LOG_AUTHPRIV | LOG_INFO, "login guard: %zu expired records removed", purged);
    }
    return true;
}

// The exclusive lock of the guard directory, created on the way.
class GuardLock {
public:
    GuardLock()
    {
        const std::string dir = GuardDir();
        if (!VELA::Session::EnsureStateDir(dir)) {
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

// The two records of one login.
struct Pair {
    Record account;
    Record address;
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
    std::string accountHex;
    std::string addressHex;
    if (!Digest(accountKey, accountHex) || !Digest(addressKey, addressHex)) {
        return false;
    }
    const std::string dir = GuardDir() + "/";
    pair.account.subject = accountKey.substr(5);
    pair.address.subject = addressKey.substr(5);
    pair.account.path = dir + kAccountPrefix + accountHex;
    pair.account.tag = accountHex.substr(0, kTagLen);
    pair.address.path = dir + kAddressPrefix + addressHex;
    pair.address.tag = addressHex.substr(0, kTagLen);
    return true;
}

bool LoadPair(Pair& pair, long long now, const Limits& limits)
{
    for (Record* rec : {&pair.account, &pair.address}) {
        if (!LoadRecord(*rec)) {
            return false;
        }
        Prune(*rec, now, limits);
    }
    return true;
}

// True unless NSS says there is no account `account`: only accounts that
// exist get a record of their own, so their number is the machine's, never
// the client's choice.
bool AccountMayExist(const char* account)
{
    uid_t uid = 0;
    return VELA::Session::LookupUser(account, uid) != 0;
}

// Logs an attempt that Begin refuses for `wait` seconds: by the block of its
// address, or, when the address has no record (`byAddress` false), because
// the store is full.
void LogRefusal(const Pair& pair, const StoreState& store, bool byAddress, long long wait)
{
    if (!byAddress) {
        VELA_LOG(kBlockLog,
                 "login guard: %d address records, the most login_guard_max_records allows: account \"%s\" from "
                 "%s refused without a password check for %lld seconds",
                 store.addressRecords, pair.loggedAccount.c_str(), pair.loggedAddress.c_str(), wait);
    } else {
        VELA_LOG(kBlockLog,
                 "login refused without a password check: account \"%s\" from %s, blocked for %lld more seconds",
                 pair.loggedAccount.c_str(), pair.loggedAddress.c_str(), wait);
    }
}

// Counts the attempt let through at `now` in the records that count it,
// each tagged with the other side of the pair. False when a record could
// not be written.
bool CountAttempt(Pair& pair, long long now, const Limits& limits, bool byAddress, bool byAccount)
{
    if (byAddress) {
        AddAttempt(pair.address, now, pair.account.tag);
        if (!SaveRecord(pair.address, limits)) {
            return false;
        }
    }
    if (byAccount) {
        AddAttempt(pair.account, now, pair.address.tag);
        if (!SaveRecord(pair.account, limits)) {
            return false;
        }
    }
    return true;
}

int Begin(const LoginSettings* settings, const char* account, const char* clientIP, int* waitSeconds)
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
    // Which records count this attempt: the address's whenever it has or
    // may get one; the account's when the account exists.
    bool byAddress = pair.address.exists;
    StoreState store;
    if (!byAddress) {
        if (!Purge(now, store)) {
            return VELA_LOGIN_GUARD_ERROR;
        }
        byAddress = store.addressRecords < limits.maxRecords;
    }
    const bool byAccount = pair.account.exists || AccountMayExist(account);
    long long wait = 0;
    if (byAddress) {
        wait = WaitOf(pair.address, now, limits);
    } else if (byAccount) {
        // The store is full: this address is not tracked, so the account's
        // count from every address decides.
        wait = WaitOf(pair.account, now, limits);
    } else {
        // Nothing could count the attempt: no password check goes uncounted.
        wait = store.earliestExpiry > now ? store.earliestExpiry - now : 1;
    }
    if (wait > 0) {
        if (waitSeconds != nullptr) {
            *waitSeconds = static_cast<int>(wait);
        }
        LogRefusal(pair, store, byAddress, wait);
        return VELA_LOGIN_GUARD_BLOCKED;
    }
    return CountAttempt(pair, now, limits, byAddress, byAccount) ? VELA_LOGIN_GUARD_ALLOW : VELA_LOGIN_GUARD_ERROR;
}

void Failed(const LoginSettings* settings, const char* account, const char* clientIP, const char* reason)
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
    const size_t limit = static_cast<size_t>(limits.maxFailures);
    Record& address = pair.address;
    if (address.blockedUntil == 0 && address.attempts.size() >= limit) {
        // The block is the whole penalty: the counted attempts go.
        const size_t failures = address.attempts.size();
        address.attempts.clear();
        address.blockedUntil = now + limits.block;
        address.blockFailures = static_cast<long long>(failures);
        if (SaveRecord(address, limits)) {
            VELA_LOG(kBlockLog,
                     "login blocked for %lld minutes: %zu failures from %s within %lld minutes "
                     "(the last for account \"%s\")",
                     limits.block / 60, failures, pair.loggedAddress.c_str(), limits.window / 60,
                     pair.loggedAccount.c_str());
        }
    }
    if (pair.account.attempts.size() == limit) {
        VELA_LOG(kBlockLog,
                 "login failures for account \"%s\" reached %zu within %lld minutes (the last from %s); each "
                 "address is blocked on its own, the account is not",
                 pair.loggedAccount.c_str(), limit, limits.window / 60, pair.loggedAddress.c_str());
    }
    StoreState store;
    Purge(now, store);
}

int Succeeded(const LoginSettings* settings, const char* account, const char* clientIP)
{
    const Limits limits = LimitsOf(settings);
    Pair pair;
    if (!NameRecords(account, clientIP, pair)) {
        return -1;
    }
    GuardLock lock;
    const long long now = Now();
    if (!lock.Held() || !LoadPair(pair, now, limits)) {
        return -1;
    }
    // Only this pair's attempts go: other accounts' failures from the
    // address, and the account's failures from other addresses, stay.
    int rc = 0;
    if (RemovePair(pair.address, pair.account.tag) && !SaveRecord(pair.address, limits)) {
        rc = -1;
    }
    if (RemovePair(pair.account, pair.address.tag) && !SaveRecord(pair.account, limits)) {
        rc = -1;
    }
    return rc;
}

// ---- Listing ---------------------------------------------------------------------------

// Whether `name` is a record's file name with `prefix`: the prefix and 64
// lower-case hex digits.
bool IsRecordName(const char* name, const char* prefix, size_t prefixLen)
{
    if (strncmp(name, prefix, prefixLen) != 0 || strnlen(name, prefixLen + kDigestHexLen + 1) != prefixLen + kDigestHexLen) {
        return false;
    }
    for (size_t i = prefixLen; i < prefixLen + kDigestHexLen; ++i) {
        const char c = name[i];
        if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'))) {
            return false;
        }
    }
    return true;
}

// Reads the record file `name` of the store and, when it refuses attempts
// now, gives its entry. A record must name its subject, and the subject
// must hash to the file's name, so nothing but the guard's own writing
// shows up in the list.
bool ListedEntry(const std::string& dir, const char* name, bool isAddress, long long now, const Limits& limits,
                 VELA::Session::LoginGuardEntry& entry)
{
    Record rec;
    rec.path = dir + "/" + name;
    Json::Value doc;
    if (VELA::Session::ReadStateFile(rec.path, kMaxRecordFile, doc) != VELA::Session::ReadResult::Ok) {
        return false;
    }
    std::string subject;
    if (!VELA::Session::GetString(doc, "subject", kMaxSubject, subject) || subject.empty() ||
        !ParseRecord(doc, rec)) {
        return false;
    }
    std::string hex;
    if (!Digest((isAddress ? "addr:" : "acct:") + subject, hex) ||
        hex != std::string(name + (isAddress ? sizeof(kAddressPrefix) : sizeof(kAccountPrefix)) - 1)) {
        return false;
    }
    Prune(rec, now, limits);
    if (!isAddress && rec.attempts.size() < static_cast<size_t>(limits.maxFailures)) {
        return false;  // an account refuses only on its count
    }
    const long long wait = WaitOf(rec, now, limits);
    if (wait <= 0) {
        return false;
    }
    entry.subject = subject;
    entry.until = now + wait;
    entry.failures = static_cast<int>(rec.blockedUntil > now ? rec.blockFailures
                                                              : static_cast<long long>(rec.attempts.size()));
    return true;
}

int ListBlocked(const LoginSettings* settings, std::vector<VELA::Session::LoginGuardEntry>& addresses,
         std::vector<VELA::Session::LoginGuardEntry>& accounts)
{
    const Limits limits = LimitsOf(settings);
    const std::string dir = GuardDir();
    const int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) {
        if (errno == ENOENT) {
            return 0;
        }
        VELA_LOG_ERR("login guard: cannot open %s: %m", dir.c_str());
        return -1;
    }
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISDIR(st.st_mode) || st.st_uid != geteuid()) {
        VELA_LOG_ERR("login guard: %s is not a directory of uid %u, not listed", dir.c_str(),
                     static_cast<unsigned>(geteuid()));
        close(fd);
        return -1;
    }
    DIR* d = fdopendir(fd);
    if (d == nullptr) {
        VELA_LOG_ERR("login guard: fdopendir(%s): %m", dir.c_str());
        close(fd);
        return -1;
    }
    const long long now = Now();
    size_t read = 0;
    for (struct dirent* e = readdir(d); e != nullptr; e = readdir(d)) {
        const char* name = e->d_name;
        const bool isAddress = IsRecordName(name, kAddressPrefix, sizeof(kAddressPrefix) - 1);
        if (!isAddress && !IsRecordName(name, kAccountPrefix, sizeof(kAccountPrefix) - 1)) {
            continue;
        }
        // The modification time is the record's expiry: an expired one is
        // not read.
        if (fstatat(dirfd(d), name, &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(st.st_mode) || st.st_mtime <= now) {
            continue;
        }
        if (++read > VELA_LOGIN_GUARD_LIST_MAX) {
            VELA_LOG_ERR("login guard: more than %d records, the rest not listed", VELA_LOGIN_GUARD_LIST_MAX);
            break;
        }
        VELA::Session::LoginGuardEntry entry;
        if (ListedEntry(dir, name, isAddress, now, limits, entry)) {
            (isAddress ? addresses : accounts).push_back(entry);
        }
    }
    closedir(d);
    auto bySubject = [](const VELA::Session::LoginGuardEntry& a, const VELA::Session::LoginGuardEntry& b) {
        return a.subject < b.subject;
    };
    std::sort(addresses.begin(), addresses.end(), bySubject);
    std::sort(accounts.begin(), accounts.end(), bySubject);
    return 0;
}

}  // namespace

int VELA::Session::LoginGuardList(const LoginSettings* settings, std::vector<LoginGuardEntry>& addresses,
                                  std::vector<LoginGuardEntry>& accounts)
{
    addresses.clear();
    accounts.clear();
    try {
        if (ListBlocked(settings, addresses, accounts) == 0) {
            return 0;
        }
    } catch (const std::exception&) {
        VELA_LOG_ERR("login guard: out of memory");
    }
    addresses.clear();
    accounts.clear();
    return -1;
}

void VELA::Session::LoginSettingsLoad(LoginSettings* settings)
{
    if (settings == nullptr) {
        return;
    }
    *settings = LoginSettings();
    LoadSetting("login_max_failures", 1, VELA_LOGIN_MAX_FAILURES_MAX, settings->maxFailures);
    LoadSetting("login_window_minutes", 1, VELA_LOGIN_MINUTES_MAX, settings->windowMinutes);
    LoadSetting("login_block_minutes", 1, VELA_LOGIN_MINUTES_MAX, settings->blockMinutes);
    LoadSetting("login_guard_max_records", 1, VELA_LOGIN_GUARD_RECORDS_MAX, settings->maxRecords);
    LoadSetting("session_idle_timeout", 1, VELA_SESSION_IDLE_MAX, settings->idleTimeout);
    LoadSetting("session_lifetime", 1, VELA_SESSION_LIFETIME_MAX, settings->lifetime);
}

int VELA::Session::LoginGuardBegin(const LoginSettings* settings, const char* account, const char* clientIP,
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

void VELA::Session::LoginGuardFailed(const LoginSettings* settings, const char* account, const char* clientIP,
                                     const char* reason)
{
    try {
        Failed(settings, account, clientIP, reason);
    } catch (const std::exception&) {
        VELA_LOG_ERR("login guard: out of memory");
    }
}

int VELA::Session::LoginGuardSucceeded(const LoginSettings* settings, const char* account, const char* clientIP)
{
    try {
        return Succeeded(settings, account, clientIP);
    } catch (const std::exception&) {
        VELA_LOG_ERR("login guard: out of memory");
        return -1;
    }
}
