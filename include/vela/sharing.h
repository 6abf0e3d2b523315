// Sharing links: a link lets a visitor without an account reach one shared
// item of its owner.
//
// A link (an entry) is named by its hash, 128 random bits from getrandom as
// 22 characters of base64url. A visitor who opens a link gets a visitor
// session (a second random id, sent back in the cookie SZK_SHARING_SID) and a
// token that binds the session to the link; every later request names the
// link in the header SZ_X_SHARING_HEADER and the session in the cookie.
//
// The records live in an SQLite database, <root>/var/lib/vela/sharing/
// sharing.db (directory 0700, file 0600, WAL journal, busy timeout, so any
// number of CGI processes use it at once). The platform library does not
// link libsqlite3: the first call that needs the database opens
// libsqlite3.so.0 with dlopen, so a request that never touches a sharing
// link does not pay for it. When the library or the database cannot be
// used, SharingDB::IsGood() is false and every call fails (logged): a
// look-up finds nothing, a change is refused, a validation answers
// SHARING_STATUS_ERROR.
//
// Every text is bounded and checked before it reaches the database, and
// reaches it only as a bound parameter of a prepared statement. Times are
// seconds since the epoch (the session store's clock, so tests can set it).
#pragma once

#include <string>
#include <sys/types.h>
#include <vector>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// The sharing-link header "X-Vela-Sharing" as the CGI environment presents it.
#define SZ_X_SHARING_HEADER "HTTP_X_VELA_SHARING"

namespace VELA {
namespace sharing {

// The cookie that carries the visitor session id.
constexpr char SZK_SHARING_SID[] = "sharing_sid";

// Bounds of the texts a link keeps.
constexpr size_t kMaxProjectName = 64;   // kNameDotted characters, no leading "."
constexpr size_t kMaxPath = 4096;        // absolute, no control byte, no ".." part
constexpr size_t kMaxPassword = 256;     // bytes; "" means no password
constexpr long long kMaxUseLimit = 1000000000;
// Visitor sessions last this long unless the caller asks for less, and never
// beyond the link's expiry.
constexpr long long kSessionLifetimeDefault = 3600;
constexpr long long kSessionLifetimeMax = 7 * 86400;
// Live visitor sessions one link may have at once by default (sessions that
// ended are removed before counting); the key sharing_max_sessions of
// /etc/vela/webapi.conf sets another bound.
constexpr long long kMaxLiveSessions = 1024;

namespace record {

// One sharing link. Default-constructed: empty().
class VELA_EXPORT Entry {
public:
    bool empty() const { return hash_.empty(); }
    const std::string& get_hash() const { return hash_; }
    // The application that made the link; names its permission library.
    const std::string& get_project_name() const { return project_; }
    // The shared item.
    const std::string& get_path() const { return path_; }
    // The owner: the visitor acts with this user's rights, narrowed by the
    // application's check.
    uid_t get_uid() const { return uid_; }
    const std::string& get_user_name() const { return user_; }
    long long get_create_time() const { return created_; }
    // 0: never expires.
    long long get_expire_time() const { return expire_; }
    // A visitor session is used only from the address that opened it.
    bool get_enable_match_ip() const { return matchIP_; }
    bool has_password() const { return !password_.empty(); }
    // The salted hash of the password ("" without one), never the password.
    const std::string& get_password_hash() const { return password_; }
    // 0: no limit. A use is the opening of a visitor session.
    long long get_use_limit() const { return useLimit_; }
    long long get_use_count() const { return uses_; }
    bool is_revoked() const { return revoked_; }

private:
    friend class Access;
    std::string hash_, project_, path_, user_, password_;
    uid_t uid_ = static_cast<uid_t>(-1);
    long long created_ = 0, expire_ = 0, useLimit_ = 0, uses_ = 0;
    bool matchIP_ = false, revoked_ = false;
};

// A visitor session. Default-constructed: empty().
class VELA_EXPORT Session {
public:
    bool empty() const { return sid_.empty(); }
    const std::string& get_session_id() const { return sid_; }
    // The link the session was opened for.
    const std::string& get_hash() const { return hash_; }
    // The owner of that link.
    uid_t get_uid() const { return uid_; }
    // The canonical address of the client that opened it.
    const std::string& get_client_ip() const { return ip_; }
    long long get_create_time() const { return created_; }
    // The absolute time at which the session ends.
    long long get_timeout() const { return timeout_; }

private:
    friend class Access;
    std::string sid_, hash_, ip_;
    uid_t uid_ = static_cast<uid_t>(-1);
    long long created_ = 0, timeout_ = 0;
};

// The binding of a visitor session to a link. Default-constructed: empty().
class VELA_EXPORT Token {
public:
    bool empty() const { return sid_.empty(); }
    const std::string& get_session_id() const { return sid_; }
    const std::string& get_hash() const { return hash_; }
    long long get_create_time() const { return created_; }

private:
    friend class Access;
    std::string sid_, hash_;
    long long created_ = 0;
};

}  // namespace record

// Answers of CheckSharing and SessionDB::Create.
enum _tag_SHARING_STATUS {
    SHARING_STATUS_ERROR = 0,            // database unusable or arguments malformed (logged)
    SHARING_STATUS_VALID = 1,            // the visitor may go on
    SHARING_STATUS_NO_LINK = 2,          // no link with this id (or a malformed id)
    SHARING_STATUS_REVOKED = 3,          // the owner revoked the link
    SHARING_STATUS_EXPIRED = 4,          // the link's expiry has passed
    SHARING_STATUS_USE_LIMIT = 5,        // every allowed use is spent and no session of the link is held
    SHARING_STATUS_NO_SESSION = 6,       // no, an unknown, or another link's visitor session
    SHARING_STATUS_SESSION_EXPIRED = 7,  // the visitor session ended
    SHARING_STATUS_IP_MISMATCH = 8,      // match-ip link, request from another address than the session's
    SHARING_STATUS_BAD_PASSWORD = 9,     // Create only: password missing or wrong
    SHARING_STATUS_BLOCKED = 10,         // Create only: the brute-force guard refused the address
    SHARING_STATUS_BUSY = 11,            // Create only: the link has as many live sessions as it may
};

// Whether a request that names link `sharingId` and visitor session
// `sharingSid` from `clientIP` may go on. The checks, in order: the link
// exists (NO_LINK), is not revoked (REVOKED) and has not expired (EXPIRED);
// the session exists and belongs to this link with its token (else
// USE_LIMIT when the link has no use left, so the visitor cannot get a
// session either, otherwise NO_SESSION); the session has not ended
// (SESSION_EXPIRED); for a match-ip link the canonical client address is
// the session's (IP_MISMATCH). VALID when all hold. A session that was
// opened with the last allowed use stays valid until it ends.
int CheckSharing(const std::string& sharingId, const std::string& sharingSid, const std::string& clientIP);

// Kinds of sharing URL.
enum _tag_SHARING_URL_TYPE {
    SHARING_URL_TYPE_NONE = 0,    // no URL: the host, port or name was refused ("" written)
    SHARING_URL_TYPE_DIRECT = 1,  // the scheme's default port, left out of the URL
    SHARING_URL_TYPE_PORT = 2,    // another port, written into the URL
};

// The URL under which visitors reach the sharing page of this server:
// "http[s]://HOST[:PORT]/sharing/" and, when `appName` is not empty,
// "APPNAME/" after it. `host` is a DNS name (letters, digits, "-" and ".",
// at most 253 bytes), an IPv4 address or an IPv6 address (with or without
// brackets; written in brackets). `port` 0 or the scheme's default (80,
// 443) is left out; 1..65535 otherwise written. `appName` must be a name
// of kNameDotted characters (at most kMaxProjectName bytes). True with `url`
// and `type` set; false with `url` "" and SHARING_URL_TYPE_NONE for
// anything else.
bool GetSharingURL(const std::string& host, int port, bool https, const std::string& appName, std::string& url,
                   _tag_SHARING_URL_TYPE& type);

namespace db {

// The database handle, one per process, opened on the first Instance() (and
// opened again in a child after fork, or when the system root changed).
class VELA_EXPORT SharingDB {
public:
    static SharingDB& Instance();
    // True when the database is open and usable.
    bool IsGood() const { return handle_ != nullptr; }

    SharingDB(const SharingDB&) = delete;
    SharingDB& operator=(const SharingDB&) = delete;

private:
    friend class Table;
    SharingDB() = default;
    void Open();
    void* handle_ = nullptr;  // sqlite3*
    pid_t pid_ = 0;
    std::string path_;
};

// Base of the table objects: opened on the handle, closed by Close() or
// when destroyed.
class VELA_EXPORT Table {
public:
    explicit Table(SharingDB& db) : db_(&db) {}
    virtual ~Table() { Close(); }
    Table(const Table&) = delete;
    Table& operator=(const Table&) = delete;
    void Close() { db_ = nullptr; }

protected:
    // The open sqlite3*, or null (logged) when the table is closed or the
    // database is not usable.
    void* Handle(const char* what) const;

private:
    friend struct TableAccess;
    SharingDB* db_;
};

// What a new link is made of.
struct VELA_EXPORT LinkSpec {
    std::string projectName;
    std::string path;
    uid_t uid = static_cast<uid_t>(-1);
    std::string userName;
    long long expireTime = 0;  // 0: never; else in the future
    bool enableMatchIP = false;
    std::string password;      // "" : none
    long long useLimit = 0;    // 0: none
};

// A change of a link: only the members whose set* flag is true change.
struct VELA_EXPORT LinkUpdate {
    bool setExpire = false;
    long long expireTime = 0;
    bool setPassword = false;
    std::string password;  // "" removes the password
    bool setUseLimit = false;
    long long useLimit = 0;  // the uses so far stay
    bool setMatchIP = false;
    bool enableMatchIP = false;
};

class VELA_EXPORT EntryDB : public Table {
public:
    using Table::Table;
    // The link `hash`; false (entry empty) when there is none.
    bool GetByHash(const std::string& hash, record::Entry& entry) const;
    // A new link with a fresh hash. False (logged) when the link is
    // refused (bounds, names, an expiry in the past) or on a database error.
    bool Create(const LinkSpec& link, record::Entry& entry) const;
    // The links of `uid`, or all of them, oldest first; revoked ones too.
    bool ListByOwner(uid_t uid, std::vector<record::Entry>& out) const;
    bool ListAll(std::vector<record::Entry>& out) const;
    // A new or removed password also deletes every visitor session and
    // token of the link (visitors enter the new one). False for an unknown
    // or revoked link, a refused value, or an error.
    bool Update(const std::string& hash, const LinkUpdate& change) const;
    // Marks the link revoked and deletes every visitor session and token of
    // it in the same transaction. False for an unknown link or an error.
    bool Revoke(const std::string& hash) const;
};

class VELA_EXPORT SessionDB : public Table {
public:
    using Table::Table;
    bool GetBySessionId(const std::string& sid, record::Session& session) const;
    // Opens a visitor session of link `hash` for `clientIP`, lasting
    // `lifetime` seconds (1..kSessionLifetimeMax; 0 the default) but never
    // beyond the link's expiry. The link must exist, not be revoked or
    // expired, have a use left (this counts one) and, when it has a
    // password, `password` must match: the attempt goes through the login
    // brute-force guard under the account "link:<hash>". The link's ended
    // sessions are removed first, and a link with as many live ones as the bound
    // opens no more (BUSY, no use counted). Returns a
    // _tag_SHARING_STATUS; on VALID, `session` and `token` are the new records.
    int Create(const std::string& hash, const std::string& password, const std::string& clientIP,
               long long lifetime, record::Session& session, record::Token& token) const;
    // Deletes the sessions (and their tokens) that ended more than
    // `graceSeconds` ago. The number deleted, or -1.
    int PurgeExpired(long long graceSeconds) const;
};

class VELA_EXPORT TokenDB : public Table {
public:
    using Table::Table;
    // The token binding `session` to `entry`; false (token empty) when
    // either record is empty or there is none.
    bool GetBySessionEntry(const record::Session& session, const record::Entry& entry, record::Token& token) const;
};

}  // namespace db
}  // namespace sharing
}  // namespace VELA

#pragma GCC visibility pop
