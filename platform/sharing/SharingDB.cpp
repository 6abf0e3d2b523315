// The sharing-link database: links, visitor sessions and their tokens.
//
// One connection per process, serialised by g_lock inside the process and by
// SQLite's locks (WAL journal, busy timeout) between processes. Every
// statement is a constant text with bound parameters; every change of more
// than one row runs in a BEGIN IMMEDIATE transaction, so a reader never sees
// half a change and two processes never count the same use twice.
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>

#include "session/SessionStore.h"
#include "sharing/LazySqlite.h"
#include "sharing/LinkPassword.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/loginguard.h"
#include "vela/sharing.h"
#include "vela/vlibc.h"

namespace VELA {
namespace sharing {

namespace record {
// Fills records from result rows (the records' only writer).
class Access {
public:
    // Columns of kEntryColumns.
    static void Fill(Entry& e, const std::vector<std::string>& t, const std::vector<long long>& n)
    {
        e.hash_ = t[0];
        e.project_ = t[1];
        e.path_ = t[2];
        e.uid_ = static_cast<uid_t>(n[3]);
        e.user_ = t[4];
        e.created_ = n[5];
        e.expire_ = n[6];
        e.matchIP_ = n[7] != 0;
        e.password_ = t[8];
        e.useLimit_ = n[9];
        e.uses_ = n[10];
        e.revoked_ = n[11] != 0;
    }
    static void Fill(Session& s, const std::vector<std::string>& t, const std::vector<long long>& n)
    {
        s.sid_ = t[0];
        s.hash_ = t[1];
        s.uid_ = static_cast<uid_t>(n[2]);
        s.ip_ = t[3];
        s.created_ = n[4];
        s.timeout_ = n[5];
    }
    static void Fill(Token& k, const std::vector<std::string>& t, const std::vector<long long>& n)
    {
        k.sid_ = t[0];
        k.hash_ = t[1];
        k.created_ = n[2];
    }
};
}  // namespace record

namespace {

using record::Entry;
using record::Session;
using record::Token;

constexpr size_t kIdBytes = 16;  // 128 bits
const size_t kIdLen = VELA::Session::IdLength(kIdBytes);
constexpr int kBusyTimeoutMs = 5000;
constexpr size_t kMaxListed = 100000;

std::recursive_mutex g_lock;

const char kSchema[] =
    "CREATE TABLE IF NOT EXISTS entry(hash TEXT PRIMARY KEY NOT NULL, project TEXT NOT NULL, path TEXT NOT NULL,"
    " uid INTEGER NOT NULL, owner TEXT NOT NULL, created INTEGER NOT NULL, expire INTEGER NOT NULL,"
    " match_ip INTEGER NOT NULL, password TEXT NOT NULL, use_limit INTEGER NOT NULL, uses INTEGER NOT NULL,"
    " revoked INTEGER NOT NULL);"
    "CREATE INDEX IF NOT EXISTS entry_uid ON entry(uid);"
    "CREATE TABLE IF NOT EXISTS session(sid TEXT PRIMARY KEY NOT NULL, hash TEXT NOT NULL, uid INTEGER NOT NULL,"
    " ip TEXT NOT NULL, created INTEGER NOT NULL, timeout INTEGER NOT NULL);"
    "CREATE INDEX IF NOT EXISTS session_hash ON session(hash);"
    "CREATE INDEX IF NOT EXISTS session_timeout ON session(timeout);"
    "CREATE TABLE IF NOT EXISTS token(sid TEXT NOT NULL, hash TEXT NOT NULL, created INTEGER NOT NULL,"
    " PRIMARY KEY(sid, hash));"
    "CREATE INDEX IF NOT EXISTS token_hash ON token(hash);";

#define ENTRY_COLUMNS "hash, project, path, uid, owner, created, expire, match_ip, password, use_limit, uses, revoked"
const char kConfPath[] = "/etc/vela/webapi.conf";

#define SESSION_COLUMNS "sid, hash, uid, ip, created, timeout"

// One prepared statement; a failed prepare, bind or step is logged once and
// makes every later call on it fail.
class Stmt {
public:
    Stmt(const SqliteApi& api, sqlite3* db, const char* sql) : api_(api), db_(db)
    {
        if (api_.sqlite3_prepare_v2(db_, sql, -1, &st_, nullptr) != SQLITE_OK) {
            Fail("prepare");
        }
    }
    ~Stmt()
    {
        if (st_ != nullptr) {
            api_.sqlite3_finalize(st_);
        }
    }
    Stmt(const Stmt&) = delete;
    Stmt& operator=(const Stmt&) = delete;

    Stmt& Text(int i, const std::string& s)
    {
        if (good_ && api_.sqlite3_bind_text(st_, i, s.data(), static_cast<int>(s.size()), SQLITE_TRANSIENT) != SQLITE_OK) {
            Fail("bind");
        }
        return *this;
    }
    Stmt& Int(int i, long long v)
    {
        if (good_ && api_.sqlite3_bind_int64(st_, i, v) != SQLITE_OK) {
            Fail("bind");
        }
        return *this;
    }
    // 1 a row, 0 done, -1 error (logged).
    int Step()
    {
        if (!good_) {
            return -1;
        }
        const int rc = api_.sqlite3_step(st_);
        if (rc == SQLITE_ROW) {
            return 1;
        }
        if (rc == SQLITE_DONE) {
            return 0;
        }
        Fail("step");
        return -1;
    }
    // The current row's first `columns` columns, each as text and as integer.
    void Row(int columns, std::vector<std::string>& t, std::vector<long long>& n) const
    {
        t.assign(columns, std::string());
        n.assign(columns, 0);
        for (int i = 0; i < columns; ++i) {
            const unsigned char* text = api_.sqlite3_column_text(st_, i);
            const int len = api_.sqlite3_column_bytes(st_, i);
            if (text != nullptr && len > 0) {
                t[i].assign(reinterpret_cast<const char*>(text), static_cast<size_t>(len));
            }
            n[i] = api_.sqlite3_column_int64(st_, i);
        }
    }
    // Rows changed by the last step.
    int Changes() const { return api_.sqlite3_changes(db_); }

private:
    void Fail(const char* what)
    {
        VELA_LOG_ERR("sharing database: %s failed: %s", what, api_.sqlite3_errmsg(db_));
        good_ = false;
    }
    const SqliteApi& api_;
    sqlite3* db_;
    sqlite3_stmt* st_ = nullptr;
    bool good_ = true;
};

bool Exec(const SqliteApi& api, sqlite3* db, const char* sql)
{
    char* err = nullptr;
    if (api.sqlite3_exec(db, sql, nullptr, nullptr, &err) != SQLITE_OK) {
        VELA_LOG_ERR("sharing database: \"%.40s\" failed: %s", sql, api.sqlite3_errmsg(db));
        return false;
    }
    return true;
}

// BEGIN IMMEDIATE ... COMMIT, rolled back unless committed.
class Txn {
public:
    Txn(const SqliteApi& api, sqlite3* db) : api_(api), db_(db), open_(Exec(api, db, "BEGIN IMMEDIATE")) {}
    ~Txn()
    {
        if (open_) {
            Exec(api_, db_, "ROLLBACK");
        }
    }
    bool Open() const { return open_; }
    bool Commit()
    {
        if (!open_ || !Exec(api_, db_, "COMMIT")) {
            return false;
        }
        open_ = false;
        return true;
    }

private:
    const SqliteApi& api_;
    sqlite3* db_;
    bool open_;
};

// ---- Checks of what comes from outside ------------------------------------

bool IsLinkId(const std::string& id)
{
    return id.size() == kIdLen && System::IsCheckedName(id, System::kNameId, kIdLen);
}

bool IsProjectName(const std::string& name)
{
    return System::IsCheckedName(name, System::kNameDotted, kMaxProjectName) && name[0] != '.' &&
           name.find("..") == std::string::npos;
}

// An absolute path of printable bytes without "." or ".." parts.
bool IsItemPath(const std::string& path)
{
    if (path.empty() || path.size() > kMaxPath || path[0] != '/') {
        return false;
    }
    for (unsigned char c : path) {
        if (c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    const std::string padded = path + "/";
    return padded.find("/./") == std::string::npos && padded.find("/../") == std::string::npos;
}

bool IsOwnerName(const std::string& name)
{
    return name.find('\0') == std::string::npos && VELA::Session::IsUserName(name.c_str());
}

// 0 or a time after now, below the year 10000.
bool IsExpiry(long long t, long long now) { return t == 0 || (t > now && t < 253402300800LL); }

bool IsUseLimit(long long n) { return n >= 0 && n <= kMaxUseLimit; }

// ---- Access to the open connection -----------------------------------------

struct Conn {
    const SqliteApi* api = nullptr;
    sqlite3* db = nullptr;
    explicit operator bool() const { return db != nullptr; }
};

// Row loaders: 1 found, 0 none, -1 error.
int LoadEntry(const Conn& c, const std::string& hash, Entry& out)
{
    Stmt st(*c.api, c.db, "SELECT " ENTRY_COLUMNS " FROM entry WHERE hash = ?1");
    const int rc = st.Text(1, hash).Step();
    if (rc == 1) {
        std::vector<std::string> t;
        std::vector<long long> n;
        st.Row(12, t, n);
        record::Access::Fill(out, t, n);
    }
    return rc;
}

int LoadSession(const Conn& c, const std::string& sid, Session& out)
{
    Stmt st(*c.api, c.db, "SELECT " SESSION_COLUMNS " FROM session WHERE sid = ?1");
    const int rc = st.Text(1, sid).Step();
    if (rc == 1) {
        std::vector<std::string> t;
        std::vector<long long> n;
        st.Row(6, t, n);
        record::Access::Fill(out, t, n);
    }
    return rc;
}

int LoadToken(const Conn& c, const std::string& sid, const std::string& hash, Token& out)
{
    Stmt st(*c.api, c.db, "SELECT sid, hash, created FROM token WHERE sid = ?1 AND hash = ?2");
    const int rc = st.Text(1, sid).Text(2, hash).Step();
    if (rc == 1) {
        std::vector<std::string> t;
        std::vector<long long> n;
        st.Row(3, t, n);
        record::Access::Fill(out, t, n);
    }
    return rc;
}

bool List(const Conn& c, bool all, uid_t uid, std::vector<Entry>& out)
{
    out.clear();
    Stmt st(*c.api, c.db,
            all ? "SELECT " ENTRY_COLUMNS " FROM entry ORDER BY created, rowid"
                : "SELECT " ENTRY_COLUMNS " FROM entry WHERE uid = ?1 ORDER BY created, rowid");
    if (!all) {
        st.Int(1, static_cast<long long>(uid));
    }
    std::vector<std::string> t;
    std::vector<long long> n;
    int rc;
    while ((rc = st.Step()) == 1) {
        if (out.size() >= kMaxListed) {
            VELA_LOG_ERR("sharing database: more than %zu links, the rest are not listed", kMaxListed);
            break;
        }
        st.Row(12, t, n);
        out.emplace_back();
        record::Access::Fill(out.back(), t, n);
    }
    if (rc < 0) {
        out.clear();
        return false;
    }
    return true;
}

bool DeleteVisitors(const Conn& c, const std::string& hash)
{
    Stmt tokens(*c.api, c.db, "DELETE FROM token WHERE hash = ?1");
    Stmt sessions(*c.api, c.db, "DELETE FROM session WHERE hash = ?1");
    return tokens.Text(1, hash).Step() == 0 && sessions.Text(1, hash).Step() == 0;
}

// Why `e` (loaded at `now`) gives no new session, or VALID.
int EntryStatus(const Entry& e, long long now)
{
    if (e.is_revoked()) {
        return SHARING_STATUS_REVOKED;
    }
    if (e.get_expire_time() != 0 && e.get_expire_time() <= now) {
        return SHARING_STATUS_EXPIRED;
    }
    if (e.get_use_limit() != 0 && e.get_use_count() >= e.get_use_limit()) {
        return SHARING_STATUS_USE_LIMIT;
    }
    return SHARING_STATUS_VALID;
}

}  // namespace

// ---- The handle ------------------------------------------------------------

namespace db {

SharingDB& SharingDB::Instance()
{
    // Never destroyed: tables may be used by destructors of other statics.
    static SharingDB* instance = new SharingDB;
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const std::string path = System::Path("/var/lib/vela/sharing") + "/sharing.db";
    if (instance->pid_ != getpid() || instance->path_ != path) {
        // A connection inherited through fork must not be used (nor closed:
        // that could release the parent's locks); a changed root means
        // another database.
        instance->handle_ = nullptr;
        instance->pid_ = getpid();
        instance->path_ = path;
        instance->Open();
    }
    return *instance;
}

void SharingDB::Open()
{
    const SqliteApi* api = LazySqlite();
    if (api == nullptr) {
        return;
    }
    const std::string dir = System::Path("/var/lib/vela/sharing");
    if (!VELA::Session::EnsureStateDir(dir)) {
        VELA_LOG_ERR("sharing links unavailable: no directory %s", dir.c_str());
        return;
    }
    // Create the file with its mode ourselves and check it is ours; SQLite
    // gives its journal files the mode of the database file.
    const int fd = open(path_.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0) {
        VELA_LOG_ERR("sharing links unavailable: open(%s): %m", path_.c_str());
        return;
    }
    struct stat st;
    const bool ours = fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() &&
                      ((st.st_mode & 077) == 0 || fchmod(fd, 0600) == 0);
    close(fd);
    if (!ours) {
        VELA_LOG_ERR("sharing links unavailable: %s is not a private regular file of uid %u", path_.c_str(),
                     static_cast<unsigned>(geteuid()));
        return;
    }
    sqlite3* db = nullptr;
    if (api->sqlite3_open_v2(path_.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOFOLLOW | SQLITE_OPEN_FULLMUTEX,
                             nullptr) != SQLITE_OK) {
        VELA_LOG_ERR("sharing links unavailable: cannot open %s: %s", path_.c_str(),
                     db != nullptr ? api->sqlite3_errmsg(db) : "out of memory");
        if (db != nullptr) {
            api->sqlite3_close_v2(db);
        }
        return;
    }
    api->sqlite3_busy_timeout(db, kBusyTimeoutMs);
    bool wal = false;
    {
        Stmt mode(*api, db, "PRAGMA journal_mode = WAL");
        if (mode.Step() == 1) {
            std::vector<std::string> t;
            std::vector<long long> n;
            mode.Row(1, t, n);
            wal = t[0] == "wal";
        }
    }
    if (!wal || !Exec(*api, db, "PRAGMA synchronous = NORMAL; PRAGMA trusted_schema = OFF") ||
        !Exec(*api, db, kSchema)) {
        VELA_LOG_ERR("sharing links unavailable: %s cannot be set up%s", path_.c_str(),
                     wal ? "" : " (no WAL journal)");
        api->sqlite3_close_v2(db);
        return;
    }
    handle_ = db;
}

void* Table::Handle(const char* what) const
{
    if (db_ == nullptr || db_->handle_ == nullptr) {
        VELA_LOG_ERR("sharing database unavailable: %s refused", what);
        return nullptr;
    }
    return db_->handle_;
}

// The connection of a table.
struct TableAccess {
    static Conn Get(const Table& table, const char* what)
    {
        Conn c;
        c.db = static_cast<sqlite3*>(table.Handle(what));
        if (c.db != nullptr) {
            c.api = LazySqlite();
        }
        return c;
    }
};

}  // namespace db

namespace {
Conn ConnOf(const db::Table& table, const char* what) { return db::TableAccess::Get(table, what); }
}  // namespace

namespace db {

// ---- Links -----------------------------------------------------------------

bool EntryDB::GetByHash(const std::string& hash, Entry& entry) const
{
    entry = Entry();
    if (!IsLinkId(hash)) {
        return false;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "link look-up");
    return c && LoadEntry(c, hash, entry) == 1;
}

bool EntryDB::Create(const LinkSpec& link, Entry& entry) const
{
    entry = Entry();
    const long long now = VELA::Session::Now();
    if (!IsProjectName(link.projectName) || !IsItemPath(link.path) || !IsOwnerName(link.userName) ||
        link.uid == static_cast<uid_t>(-1) || !IsExpiry(link.expireTime, now) || !IsUseLimit(link.useLimit) ||
        link.password.size() > kMaxPassword) {
        VELA_LOG_ERR("sharing link refused: project, path, owner, expiry, use limit or password out of bounds");
        return false;
    }
    std::string password;
    if (!link.password.empty() && !HashLinkPassword(link.password, password)) {
        return false;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "link creation");
    if (!c) {
        return false;
    }
    // A hash already taken (never seen with 128 random bits) draws again.
    for (int attempt = 0; attempt < 3; ++attempt) {
        std::string hash;
        if (!VELA::Session::RandomId(kIdBytes, hash)) {
            return false;
        }
        Stmt st(*c.api, c.db,
                "INSERT OR IGNORE INTO entry(" ENTRY_COLUMNS ") VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10, 0, 0)");
        st.Text(1, hash).Text(2, link.projectName).Text(3, link.path).Int(4, static_cast<long long>(link.uid));
        st.Text(5, link.userName).Int(6, now).Int(7, link.expireTime).Int(8, link.enableMatchIP ? 1 : 0);
        st.Text(9, password).Int(10, link.useLimit);
        if (st.Step() != 0) {
            return false;
        }
        if (st.Changes() == 1) {
            return LoadEntry(c, hash, entry) == 1;
        }
    }
    VELA_LOG_ERR("sharing link refused: no free hash drawn");
    return false;
}

bool EntryDB::ListByOwner(uid_t uid, std::vector<Entry>& out) const
{
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "link list");
    out.clear();
    return c && List(c, false, uid, out);
}

bool EntryDB::ListAll(std::vector<Entry>& out) const
{
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "link list");
    out.clear();
    return c && List(c, true, 0, out);
}

bool EntryDB::Update(const std::string& hash, const LinkUpdate& change) const
{
    const long long now = VELA::Session::Now();
    if (!IsLinkId(hash) || (change.setExpire && !IsExpiry(change.expireTime, now)) ||
        (change.setUseLimit && !IsUseLimit(change.useLimit)) ||
        (change.setPassword && change.password.size() > kMaxPassword)) {
        VELA_LOG_ERR("sharing link change refused: link id, expiry, use limit or password out of bounds");
        return false;
    }
    std::string password;
    if (change.setPassword && !change.password.empty() && !HashLinkPassword(change.password, password)) {
        return false;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "link change");
    if (!c) {
        return false;
    }
    Txn txn(*c.api, c.db);
    Entry e;
    if (!txn.Open() || LoadEntry(c, hash, e) != 1 || e.is_revoked()) {
        return false;
    }
    if (change.setExpire) {
        Stmt st(*c.api, c.db, "UPDATE entry SET expire = ?2 WHERE hash = ?1");
        if (st.Text(1, hash).Int(2, change.expireTime).Step() != 0) {
            return false;
        }
    }
    if (change.setUseLimit) {
        Stmt st(*c.api, c.db, "UPDATE entry SET use_limit = ?2 WHERE hash = ?1");
        if (st.Text(1, hash).Int(2, change.useLimit).Step() != 0) {
            return false;
        }
    }
    if (change.setMatchIP) {
        Stmt st(*c.api, c.db, "UPDATE entry SET match_ip = ?2 WHERE hash = ?1");
        if (st.Text(1, hash).Int(2, change.enableMatchIP ? 1 : 0).Step() != 0) {
            return false;
        }
    }
    if (change.setPassword) {
        // Visitors who got in with the old password have to enter the new one.
        Stmt st(*c.api, c.db, "UPDATE entry SET password = ?2 WHERE hash = ?1");
        if (st.Text(1, hash).Text(2, password).Step() != 0 || !DeleteVisitors(c, hash)) {
            return false;
        }
    }
    return txn.Commit();
}

bool EntryDB::Revoke(const std::string& hash) const
{
    if (!IsLinkId(hash)) {
        return false;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "link revocation");
    if (!c) {
        return false;
    }
    Txn txn(*c.api, c.db);
    Stmt st(*c.api, c.db, "UPDATE entry SET revoked = 1 WHERE hash = ?1");
    if (!txn.Open() || st.Text(1, hash).Step() != 0 || st.Changes() != 1 || !DeleteVisitors(c, hash)) {
        return false;
    }
    return txn.Commit();
}

// ---- Visitor sessions --------------------------------------------------------

bool SessionDB::GetBySessionId(const std::string& sid, Session& session) const
{
    session = Session();
    if (!IsLinkId(sid)) {
        return false;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "visitor session look-up");
    return c && LoadSession(c, sid, session) == 1;
}

int SessionDB::Create(const std::string& hash, const std::string& password, const std::string& clientIP,
                      long long lifetime, Session& session, Token& token) const
{
    session = Session();
    token = Token();
    if (!IsLinkId(hash)) {
        return SHARING_STATUS_NO_LINK;
    }
    std::string ip;
    if (!VELA::Session::CanonicalAddress(clientIP, ip) || lifetime < 0 || lifetime > kSessionLifetimeMax ||
        password.size() > kMaxPassword) {
        VELA_LOG_ERR("visitor session refused: client address, lifetime or password out of bounds");
        return SHARING_STATUS_ERROR;
    }
    if (lifetime == 0) {
        lifetime = kSessionLifetimeDefault;
    }
    Entry e;
    {
        std::lock_guard<std::recursive_mutex> hold(g_lock);
        const Conn c = ConnOf(*this, "visitor session");
        if (!c) {
            return SHARING_STATUS_ERROR;
        }
        const int rc = LoadEntry(c, hash, e);
        if (rc != 1) {
            return rc == 0 ? SHARING_STATUS_NO_LINK : SHARING_STATUS_ERROR;
        }
    }
    const int status = EntryStatus(e, VELA::Session::Now());
    if (status != SHARING_STATUS_VALID) {
        return status;
    }
    if (e.has_password()) {
        // Checked outside the database lock: the hash takes a while.
        VELA::Session::LoginSettings settings;
        VELA::Session::LoginSettingsLoad(&settings);
        const std::string account = "link:" + hash;
        const int guard = VELA::Session::LoginGuardBegin(&settings, account.c_str(), ip.c_str(), nullptr);
        if (guard != VELA_LOGIN_GUARD_ALLOW) {
            return guard == VELA_LOGIN_GUARD_BLOCKED ? SHARING_STATUS_BLOCKED : SHARING_STATUS_ERROR;
        }
        const int match = VerifyLinkPassword(password, e.get_password_hash());
        if (match != 1) {
            if (match == 0) {
                VELA::Session::LoginGuardFailed(&settings, account.c_str(), ip.c_str(), "wrong sharing link password");
            }
            return match == 0 ? SHARING_STATUS_BAD_PASSWORD : SHARING_STATUS_ERROR;
        }
        VELA::Session::LoginGuardSucceeded(&settings, account.c_str(), ip.c_str());
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "visitor session");
    if (!c) {
        return SHARING_STATUS_ERROR;
    }
    const long long now = VELA::Session::Now();
    Txn txn(*c.api, c.db);
    if (!txn.Open()) {
        return SHARING_STATUS_ERROR;
    }
    // Sessions of this link that ended go; those still live are bounded, so
    // visitors who drop their cookie cannot grow the database without end.
    {
        Stmt tokens(*c.api, c.db,
                    "DELETE FROM token WHERE sid IN (SELECT sid FROM session WHERE hash = ?1 AND timeout <= ?2)");
        Stmt sessions(*c.api, c.db, "DELETE FROM session WHERE hash = ?1 AND timeout <= ?2");
        Stmt live(*c.api, c.db, "SELECT COUNT(*) FROM session WHERE hash = ?1");
        if (tokens.Text(1, hash).Int(2, now).Step() != 0 || sessions.Text(1, hash).Int(2, now).Step() != 0 ||
            live.Text(1, hash).Step() != 1) {
            return SHARING_STATUS_ERROR;
        }
        std::vector<std::string> t;
        std::vector<long long> n;
        live.Row(1, t, n);
        long long bound = kMaxLiveSessions;
        std::vector<std::pair<std::string, std::string>> settings;
        if (VELA::System::ReadKeyValueFile(kConfPath, settings) > 0) {
            VELA::System::NumberSetting(settings, kConfPath, "sharing_max_sessions", 1, 1000000, bound);
        }
        if (n[0] >= bound) {
            VELA_LOG_ERR("sharing link %s has %lld live visitor sessions; no more opened", hash.c_str(), n[0]);
            return SHARING_STATUS_BUSY;
        }
    }
    // The link may have changed since it was read: count the use only when
    // it still allows one, in the transaction that makes the session.
    {
        Stmt use(*c.api, c.db,
                 "UPDATE entry SET uses = uses + 1 WHERE hash = ?1 AND revoked = 0 AND (expire = 0 OR expire > ?2)"
                 " AND (use_limit = 0 OR uses < use_limit)");
        if (use.Text(1, hash).Int(2, now).Step() != 0) {
            return SHARING_STATUS_ERROR;
        }
        if (use.Changes() != 1) {
            const int rc = LoadEntry(c, hash, e);
            return rc == 1 ? EntryStatus(e, now) : rc == 0 ? SHARING_STATUS_NO_LINK : SHARING_STATUS_ERROR;
        }
    }
    long long timeout = now + lifetime;
    if (e.get_expire_time() != 0 && e.get_expire_time() < timeout) {
        timeout = e.get_expire_time();
    }
    std::string sid;
    if (!VELA::Session::RandomId(kIdBytes, sid)) {
        return SHARING_STATUS_ERROR;
    }
    Stmt addSession(*c.api, c.db, "INSERT INTO session(" SESSION_COLUMNS ") VALUES(?1, ?2, ?3, ?4, ?5, ?6)");
    addSession.Text(1, sid).Text(2, hash).Int(3, static_cast<long long>(e.get_uid())).Text(4, ip).Int(5, now);
    Stmt addToken(*c.api, c.db, "INSERT INTO token(sid, hash, created) VALUES(?1, ?2, ?3)");
    addToken.Text(1, sid).Text(2, hash).Int(3, now);
    if (addSession.Int(6, timeout).Step() != 0 || addToken.Step() != 0 || !txn.Commit()) {
        return SHARING_STATUS_ERROR;
    }
    if (LoadSession(c, sid, session) != 1 || LoadToken(c, sid, hash, token) != 1) {
        session = Session();
        token = Token();
        return SHARING_STATUS_ERROR;
    }
    return SHARING_STATUS_VALID;
}

int SessionDB::PurgeExpired(long long graceSeconds) const
{
    if (graceSeconds < 0 || graceSeconds > kSessionLifetimeMax) {
        return -1;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "visitor session purge");
    if (!c) {
        return -1;
    }
    const long long before = VELA::Session::Now() - graceSeconds;
    Txn txn(*c.api, c.db);
    Stmt tokens(*c.api, c.db, "DELETE FROM token WHERE sid IN (SELECT sid FROM session WHERE timeout <= ?1)");
    Stmt sessions(*c.api, c.db, "DELETE FROM session WHERE timeout <= ?1");
    if (!txn.Open() || tokens.Int(1, before).Step() != 0 || sessions.Int(1, before).Step() != 0) {
        return -1;
    }
    const int removed = sessions.Changes();
    return txn.Commit() ? removed : -1;
}

// ---- Tokens ------------------------------------------------------------------

bool TokenDB::GetBySessionEntry(const Session& session, const Entry& entry, Token& token) const
{
    const std::string sid = session.get_session_id();
    const std::string hash = entry.get_hash();
    token = Token();
    if (!IsLinkId(sid) || !IsLinkId(hash)) {
        return false;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    const Conn c = ConnOf(*this, "token look-up");
    return c && LoadToken(c, sid, hash, token) == 1;
}

}  // namespace db

// ---- Validation ----------------------------------------------------------------

int CheckSharing(const std::string& sharingId, const std::string& sharingSid, const std::string& clientIP)
{
    if (!IsLinkId(sharingId)) {
        return SHARING_STATUS_NO_LINK;
    }
    std::lock_guard<std::recursive_mutex> hold(g_lock);
    db::EntryDB table(db::SharingDB::Instance());
    const Conn c = ConnOf(table, "sharing check");
    if (!c) {
        return SHARING_STATUS_ERROR;
    }
    Entry e;
    int rc = LoadEntry(c, sharingId, e);
    if (rc != 1) {
        return rc == 0 ? SHARING_STATUS_NO_LINK : SHARING_STATUS_ERROR;
    }
    const long long now = VELA::Session::Now();
    const int status = EntryStatus(e, now);
    if (status == SHARING_STATUS_REVOKED || status == SHARING_STATUS_EXPIRED) {
        return status;
    }
    Session s;
    Token k;
    if (IsLinkId(sharingSid)) {
        rc = LoadSession(c, sharingSid, s);
        if (rc == 1 && s.get_hash() == sharingId) {
            rc = LoadToken(c, sharingSid, sharingId, k);
        }
        if (rc < 0) {
            return SHARING_STATUS_ERROR;
        }
    }
    if (s.empty() || s.get_hash() != sharingId || k.empty()) {
        return status == SHARING_STATUS_USE_LIMIT ? SHARING_STATUS_USE_LIMIT : SHARING_STATUS_NO_SESSION;
    }
    if (s.get_timeout() <= now) {
        return SHARING_STATUS_SESSION_EXPIRED;
    }
    if (e.get_enable_match_ip()) {
        std::string ip;
        if (!VELA::Session::CanonicalAddress(clientIP, ip) || ip != s.get_client_ip()) {
            return SHARING_STATUS_IP_MISMATCH;
        }
    }
    return SHARING_STATUS_VALID;
}

}  // namespace sharing
}  // namespace VELA
