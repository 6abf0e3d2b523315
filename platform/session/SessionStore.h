// Helpers shared by the login-session store (Session.cpp) and the access-token
// store (AccessToken.cpp): the clock, random identifiers, state directories,
// bounded reads of state files, the store lock and NSS look-ups. Not
// installed.
#pragma once

#include <cstddef>
#include <ctime>
#include <json/json.h>
#include <string>
#include <sys/types.h>
#include <vector>

namespace VELA {
namespace Session {

// The current time in seconds: time(2), or the clock a test installed with
// SetClockForTest.
long long Now();

// `bytes` random bytes from getrandom(2) as base64url text without padding
// (RFC 4648 section 5). False when getrandom fails or `bytes` is 0 or over 64.
bool RandomId(size_t bytes, std::string& out);

// The length of the base64url text of `bytes` bytes without padding.
constexpr size_t IdLength(size_t bytes) { return (bytes * 4 + 2) / 3; }

// True when `text` (of at most `len + 1` bytes read) is exactly `len`
// characters of the base64url alphabet. Safe on any pointer: null, embedded
// NUL (the text then ends early) and overlong texts give false without
// reading more than `len + 1` bytes.
bool IsId(const char* text, size_t len);

// Appends to `ids` the names in the directory `dir` that are identifiers of
// `len` characters (IsId). At most 100000 entries are looked at; the rest
// are ignored (logged). True for a missing directory (nothing added), false
// (logged) when it cannot be read. Can throw std::bad_alloc.
bool ListIds(const std::string& dir, size_t len, std::vector<std::string>& ids);

// Compares two byte strings in time that depends only on their lengths.
bool ConstantTimeEquals(const std::string& a, const std::string& b);

// A user name as the stores keep it: 1 to 492 bytes (it must fit a 493-byte
// buffer with its terminator), no control byte, no "/" or ":".
bool IsUserName(const char* name);

// Looks `name` up with getpwnam_r. 1 found (`uid` set), 0 unknown, -1 when the
// look-up itself failed.
int LookupUser(const char* name, uid_t& uid);

// The canonical text (inet_ntop) of the IP address `text`, with an
// IPv4-mapped IPv6 address (::ffff:a.b.c.d) written as its IPv4 address.
// False when `text` is not an address.
bool CanonicalAddress(const std::string& text, std::string& out);

// Makes sure the state directory `path` exists: missing parents are created
// with mode 0755, the directory itself with 0700. An existing directory must
// be a real directory (not a symbolic link) owned by the effective user; group
// or other bits on it are removed. False (logged) otherwise.
bool EnsureStateDir(const std::string& path);

enum class ReadResult {
    Ok,       // `out` holds the parsed document
    Missing,  // no such file
    Corrupt,  // not a regular file of ours, too large, or not a JSON object
    Error,    // the file could not be read
};

// Reads the state file `path` (never following a symbolic link; a file must
// be regular, owned by the effective user and at most `limit` bytes) and
// parses it as a JSON object. Logs every outcome but Ok and Missing.
ReadResult ReadStateFile(const std::string& path, size_t limit, Json::Value& out);

// Writes `value` to `path` atomically with mode 0600 (temporary file, fsync,
// rename). False (logged) on failure; `path` is then unchanged. `durable`
// false skips the fsyncs: for what changes on every request and lives under
// /run, where nothing survives a reboot (a session's last use, login-guard
// counts); the rename still never shows a partial file.
bool WriteStateFile(const std::string& path, const Json::Value& value, bool durable = true);

// An exclusive flock(2) on `<dir>/.lock`, waited for at most a few seconds.
// Writers of a store hold it around read-modify-write cycles; readers never
// need it because every write is an atomic rename.
class StoreLock {
public:
    explicit StoreLock(const std::string& dir);
    ~StoreLock();
    StoreLock(const StoreLock&) = delete;
    StoreLock& operator=(const StoreLock&) = delete;
    bool Held() const { return fd_ >= 0; }

private:
    int fd_ = -1;
};

// A JSON member read with type and range checks; false when it is missing or
// of another type or out of range.
bool GetInt(const Json::Value& obj, const char* key, long long min, long long max, long long& out);
bool GetBool(const Json::Value& obj, const char* key, bool& out);
bool GetString(const Json::Value& obj, const char* key, size_t maxLen, std::string& out);

// Copies `text` with its terminator into `buf` of `size` bytes. False (and
// `buf` left empty when it has room for that) when it does not fit.
bool CopyOut(const std::string& text, char* buf, size_t size);

}  // namespace Session
}  // namespace VELA
