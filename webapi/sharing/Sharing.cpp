// The sharing-link API (description VELA.Sharing.lib).
//
// "VELA.Sharing" is for the owners of links (a login session; the login
// user is the owner):
//   create  path, project [, expires, password, uses, matchIP]: a link to a
//           file or folder of the first data volume that the owner can read.
//           The method runs as the owner ("grantByUser"), so the item is
//           opened with the owner's rights; the database is written with
//           full rights (RunAsRootGuard). At most kMaxLinksPerOwner live
//           links per owner.
//   list    [all]: the caller's links; an administrator may ask for all
//   update  id [, expires, password, uses, matchIP]
//   revoke  id: ends the link and every visitor session of it at once
// update and revoke: the owner's own links, or any for an administrator.
// Another owner's link is answered like an unknown one. Password hashes
// never leave the server: a link answers only whether it has a password.
//
// "VELA.Sharing.Visitor" needs no login:
//   open    link [, password]: opens a visitor session of the link for the
//           client's address and sets the cookie "sharing_sid" (HttpOnly,
//           SameSite=Strict, path /, Secure over HTTPS). A visitor who
//           already holds a valid session of the link keeps it (no use is
//           spent again).
//
// Passwords are taken from the POST body only (a query string that names
// "password" is refused: URLs end up in logs and histories). Numbers come as
// JSON integers or decimal text (forms), switches as booleans or
// "true"/"false". Error codes (besides the framework's 101 for a malformed
// call and 105 for "all" asked by a non-administrator):
//   460  no such link (also: another owner's link)
//   461  the link is revoked (update)
//   462  the path is refused: missing, not a file or folder, or not in the
//        first data volume
//   463  the owner cannot read the path
//   464  the owner has kMaxLinksPerOwner live links already
//   465  the password came in the URL
//   466  the server could not complete the call (logged)
//   470  open: no such link. Deliberately the same for an unknown and a
//        revoked link, so a revoked id cannot be told from a guessed one
//   471  open: the link has expired
//   472  open: every allowed use of the link is spent
//   473  open: the password is missing or wrong
//   474  open: too many wrong passwords from this address: blocked
//   475  open: the link has as many live visitor sessions as it may have
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <json/json.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "vela/log.h"
#include "vela/sharing.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"
#include "webapi/APIUtils.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
namespace sharing = VELA::sharing;
namespace record = VELA::sharing::record;
namespace sdb = VELA::sharing::db;

constexpr int kErrNoLink = 460;
constexpr int kErrRevoked = 461;
constexpr int kErrBadPath = 462;
constexpr int kErrUnreadable = 463;
constexpr int kErrTooManyLinks = 464;
constexpr int kErrPasswordInUrl = 465;
constexpr int kErrServer = 466;
constexpr int kErrOpenNoLink = 470;
constexpr int kErrOpenExpired = 471;
constexpr int kErrOpenUseLimit = 472;
constexpr int kErrOpenBadPassword = 473;
constexpr int kErrOpenBlocked = 474;
constexpr int kErrOpenBusy = 475;

constexpr size_t kMaxLinksPerOwner = 200;
// Ten years: "expires" is counted from now.
constexpr long long kMaxExpireSeconds = 10LL * 366 * 86400;
constexpr size_t kLinkIdLen = 22;

// ---- Parameters -------------------------------------------------------------

bool IsPrintable(const std::string& text)
{
    for (unsigned char c : text) {
        if (c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

// Outcome of reading an optional parameter.
enum class Param { kAbsent, kOk, kBad };

// A string of printable bytes, 1..maxLen long (0..maxLen with allowEmpty).
Param TextParam(const APIRequest* req, const char* name, size_t maxLen, bool allowEmpty, std::string& out)
{
    static const Json::Value kNone;
    const Json::Value& v = req->GetParamRef(name, kNone);
    if (v.isNull()) {
        return Param::kAbsent;
    }
    const char* begin = nullptr;
    const char* end = nullptr;
    if (!v.isString() || !v.getString(&begin, &end)) {
        return Param::kBad;
    }
    const size_t len = static_cast<size_t>(end - begin);
    if (len > maxLen || (len == 0 && !allowEmpty)) {
        return Param::kBad;
    }
    out.assign(begin, len);
    return IsPrintable(out) ? Param::kOk : Param::kBad;
}

// An integer min..max, as a JSON integer or as decimal text.
Param NumberParam(const APIRequest* req, const char* name, long long min, long long max, long long& out)
{
    static const Json::Value kNone;
    const Json::Value& v = req->GetParamRef(name, kNone);
    if (v.isNull()) {
        return Param::kAbsent;
    }
    if (v.isString()) {
        const char* begin = nullptr;
        const char* end = nullptr;
        return v.getString(&begin, &end) &&
                       VELA::System::ParseDecimal(begin, static_cast<size_t>(end - begin), min, max, out)
                   ? Param::kOk
                   : Param::kBad;
    }
    if (!v.isInt64()) {
        return Param::kBad;
    }
    out = v.asInt64();
    return out >= min && out <= max ? Param::kOk : Param::kBad;
}

Param BoolParam(const APIRequest* req, const char* name, bool& out)
{
    static const Json::Value kNone;
    const Json::Value& v = req->GetParamRef(name, kNone);
    if (v.isNull()) {
        return Param::kAbsent;
    }
    if (v.isBool()) {
        out = v.asBool();
        return Param::kOk;
    }
    if (v.isString() && (v.asString() == "true" || v.asString() == "false")) {
        out = v.asString() == "true";
        return Param::kOk;
    }
    return Param::kBad;
}

bool BadParam(APIResponse* resp, const char* name)
{
    resp->SetError(WEBAPI_ERR_BAD_REQUEST, Json::Value(name));
    return false;
}

// The link id: 22 characters of base64url.
bool LinkIdParam(const APIRequest* req, const char* name, std::string& id)
{
    return TextParam(req, name, kLinkIdLen, false, id) == Param::kOk && id.size() == kLinkIdLen &&
           VELA::System::IsCheckedName(id, VELA::System::kNameId, kLinkIdLen);
}

bool IsProjectName(const std::string& name)
{
    return VELA::System::IsCheckedName(name, VELA::System::kNameDotted, sharing::kMaxProjectName) &&
           name[0] != '.' && name.find("..") == std::string::npos;
}

// True when the query string names `secret`. One pass; each name short
// enough to be it is decoded as the form parser decodes names.
bool QueryNames(const APIRequest* req, const std::string& secret)
{
    const Json::Value q = req->GetEnv("QUERY_STRING");
    if (!q.isString()) {
        return false;
    }
    const std::string query = q.asString();
    const size_t maxName = 3 * secret.size();
    size_t start = 0;
    bool inName = true;
    for (size_t i = 0; i <= query.size(); ++i) {
        const bool pairEnd = i == query.size() || query[i] == '&';
        if (inName && (pairEnd || query[i] == '=')) {
            inName = false;
            if (i > start && i - start <= maxName &&
                VELA::WebAPIUtil::URLDecode(query.substr(start, i - start), true) == secret) {
                return true;
            }
        }
        if (pairEnd) {
            start = i + 1;
            inName = true;
        }
    }
    return false;
}

// The password, from the POST body only. False with the error set.
bool PasswordParam(const APIRequest* req, APIResponse* resp, bool allowEmpty, Param& got, std::string& password)
{
    if (QueryNames(req, "password")) {
        VELA_LOG(LOG_AUTHPRIV | LOG_WARNING, "sharing: a link password in the query string refused");
        resp->SetError(kErrPasswordInUrl);
        return false;
    }
    got = TextParam(req, "password", sharing::kMaxPassword, allowEmpty, password);
    return got != Param::kBad || BadParam(resp, "password");
}

// ---- Answers ----------------------------------------------------------------

bool OverHttps(const APIRequest* req) { return req->GetURLProto("") == "https"; }

// Where visitors reach link `id`: the full URL when the request's host can
// be written into one, else the path alone.
std::string LinkURL(const APIRequest* req, const std::string& project, const std::string& id)
{
    std::string url;
    sharing::_tag_SHARING_URL_TYPE type = sharing::SHARING_URL_TYPE_NONE;
    if (!sharing::GetSharingURL(req->GetURLHost(""), req->GetURLPort(0), OverHttps(req), project, url, type)) {
        url = "/sharing/" + project + "/";
    }
    return url + id;
}

std::string BaseName(const std::string& path)
{
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

bool IsExpired(const record::Entry& e, long long now)
{
    return e.get_expire_time() != 0 && e.get_expire_time() <= now;
}

// What an owner sees of a link: no password hash.
Json::Value LinkJson(const APIRequest* req, const record::Entry& e, long long now)
{
    Json::Value out(Json::objectValue);
    out["id"] = e.get_hash();
    out["project"] = e.get_project_name();
    out["path"] = e.get_path();
    out["name"] = BaseName(e.get_path());
    out["owner"] = e.get_user_name();
    out["created"] = static_cast<Json::Int64>(e.get_create_time());
    out["expires"] = static_cast<Json::Int64>(e.get_expire_time());
    out["hasPassword"] = e.has_password();
    out["useLimit"] = static_cast<Json::Int64>(e.get_use_limit());
    out["useCount"] = static_cast<Json::Int64>(e.get_use_count());
    out["matchIP"] = e.get_enable_match_ip();
    out["revoked"] = e.is_revoked();
    out["expired"] = IsExpired(e, now);
    out["url"] = LinkURL(req, e.get_project_name(), e.get_hash());
    return out;
}

// ---- The shared item --------------------------------------------------------

// realpath of `path`, "" when it cannot be resolved (errno set).
std::string RealPath(const std::string& path)
{
    char* real = realpath(path.c_str(), nullptr);
    if (real == nullptr) {
        return "";
    }
    std::string out(real);
    free(real);
    return out;
}

// The system path of `path` (a system path resolved under the root) as the
// caller's identity reaches it: every link on the way resolved, inside the
// first data volume, a file or folder the caller can open for reading.
// 0 with `stored` set, or the error code.
int CheckItem(const std::string& path, std::string& stored)
{
    std::string volume;
    std::string root;
    IF_RUN_AS_ROOT()
    {
        VOLUME_INFO info;
        if (VolumeAvailGet(0, &info, 0, 0) == 1) {
            volume = RealPath(info.szMountPath);
        }
        root = RealPath(VELA::System::Root());
    }
    if (volume.empty() || root.empty()) {
        VELA_LOG_ERR("sharing: no data volume, or the system root cannot be resolved");
        return kErrBadPath;
    }
    const std::string real = RealPath(VELA::System::Path(path));
    if (real.empty()) {
        return errno == EACCES ? kErrUnreadable : kErrBadPath;
    }
    if (real.compare(0, volume.size() + 1, volume + "/") != 0) {
        return kErrBadPath;
    }
    const int fd = open(real.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    if (fd < 0) {
        return errno == EACCES || errno == EPERM ? kErrUnreadable : kErrBadPath;
    }
    struct stat st;
    const bool usable = fstat(fd, &st) == 0 && (S_ISREG(st.st_mode) || S_ISDIR(st.st_mode));
    close(fd);
    if (!usable) {
        return kErrBadPath;
    }
    if (root == "/") {
        stored = real;
    } else if (real.compare(0, root.size() + 1, root + "/") == 0) {
        stored = real.substr(root.size());
    } else {
        return kErrBadPath;  // a volume outside the root cannot be named
    }
    return 0;
}

// The live (neither revoked nor expired) links of `uid`, or -1.
long long LiveLinks(const sdb::EntryDB& entries, uid_t uid, long long now)
{
    std::vector<record::Entry> all;
    if (!entries.ListByOwner(uid, all)) {
        return -1;
    }
    long long live = 0;
    for (const record::Entry& e : all) {
        live += !e.is_revoked() && !IsExpired(e, now);
    }
    return live;
}

// ---- Owner methods ----------------------------------------------------------

// expires, uses and matchIP of create and update. False with the error set.
struct Limits {
    Param expires = Param::kAbsent, uses = Param::kAbsent, matchIP = Param::kAbsent;
    long long expireSeconds = 0, useLimit = 0;
    bool enableMatchIP = false;
};

bool ReadLimits(const APIRequest* req, APIResponse* resp, Limits& out)
{
    out.expires = NumberParam(req, "expires", 0, kMaxExpireSeconds, out.expireSeconds);
    if (out.expires == Param::kBad) {
        return BadParam(resp, "expires");
    }
    out.uses = NumberParam(req, "uses", 0, sharing::kMaxUseLimit, out.useLimit);
    if (out.uses == Param::kBad) {
        return BadParam(resp, "uses");
    }
    out.matchIP = BoolParam(req, "matchIP", out.enableMatchIP);
    return out.matchIP != Param::kBad || BadParam(resp, "matchIP");
}

long long ExpireTime(const Limits& l, long long now) { return l.expireSeconds == 0 ? 0 : now + l.expireSeconds; }

void Create(APIRequest* req, APIResponse* resp)
{
    std::string path;
    std::string project;
    std::string password;
    Param hasPassword = Param::kAbsent;
    Limits limits;
    if (TextParam(req, "path", sharing::kMaxPath, false, path) != Param::kOk || path[0] != '/') {
        BadParam(resp, "path");
        return;
    }
    if (TextParam(req, "project", sharing::kMaxProjectName, false, project) != Param::kOk || !IsProjectName(project)) {
        BadParam(resp, "project");
        return;
    }
    if (!PasswordParam(req, resp, false, hasPassword, password) || !ReadLimits(req, resp, limits)) {
        return;
    }
    const std::string padded = path + "/";
    if (padded.find("/./") != std::string::npos || padded.find("/../") != std::string::npos) {
        BadParam(resp, "path");
        return;
    }
    std::string stored;
    const int refused = CheckItem(path, stored);
    if (refused != 0) {
        resp->SetError(refused);
        return;
    }
    IF_RUN_AS_ROOT()
    {
        const long long now = static_cast<long long>(time(nullptr));
        sdb::EntryDB entries(sdb::SharingDB::Instance());
        const long long live = LiveLinks(entries, req->GetLoginUID(), now);
        if (live < 0) {
            resp->SetError(kErrServer);
            return;
        }
        if (static_cast<size_t>(live) >= kMaxLinksPerOwner) {
            resp->SetError(kErrTooManyLinks);
            return;
        }
        sdb::LinkSpec link;
        link.projectName = project;
        link.path = stored;
        link.uid = req->GetLoginUID();
        link.userName = req->GetLoginUserName();
        link.expireTime = ExpireTime(limits, now);
        link.enableMatchIP = limits.enableMatchIP;
        link.password = password;
        link.useLimit = limits.useLimit;
        record::Entry entry;
        if (!entries.Create(link, entry)) {
            resp->SetError(kErrServer);
            return;
        }
        resp->SetSuccess(LinkJson(req, entry, now));
        return;
    }
    resp->SetError(kErrServer);
}

void List(APIRequest* req, APIResponse* resp)
{
    bool all = false;
    if (BoolParam(req, "all", all) == Param::kBad) {
        BadParam(resp, "all");
        return;
    }
    if (all && !req->IsAdmin()) {
        resp->SetError(WEBAPI_ERR_NO_PERMISSION);
        return;
    }
    sdb::EntryDB entries(sdb::SharingDB::Instance());
    std::vector<record::Entry> links;
    if (!(all ? entries.ListAll(links) : entries.ListByOwner(req->GetLoginUID(), links))) {
        resp->SetError(kErrServer);
        return;
    }
    const long long now = static_cast<long long>(time(nullptr));
    Json::Value data(Json::objectValue);
    Json::Value& out = data["links"] = Json::Value(Json::arrayValue);
    for (const record::Entry& e : links) {
        out.append(LinkJson(req, e, now));
    }
    data["total"] = static_cast<Json::UInt64>(links.size());
    resp->SetSuccess(data);
}

// The link named by "id" that the caller may change: its own, or any for
// an administrator. False with the error set.
bool OwnLink(const APIRequest* req, APIResponse* resp, const sdb::EntryDB& entries, record::Entry& entry)
{
    std::string id;
    if (!LinkIdParam(req, "id", id)) {
        return BadParam(resp, "id");
    }
    if (!entries.GetByHash(id, entry) || (entry.get_uid() != req->GetLoginUID() && !req->IsAdmin())) {
        resp->SetError(kErrNoLink);
        return false;
    }
    return true;
}

void Update(APIRequest* req, APIResponse* resp)
{
    sdb::EntryDB entries(sdb::SharingDB::Instance());
    record::Entry entry;
    std::string password;
    Param hasPassword = Param::kAbsent;
    Limits limits;
    if (!OwnLink(req, resp, entries, entry) || !PasswordParam(req, resp, true, hasPassword, password) ||
        !ReadLimits(req, resp, limits)) {
        return;
    }
    if (entry.is_revoked()) {
        resp->SetError(kErrRevoked);
        return;
    }
    const long long now = static_cast<long long>(time(nullptr));
    sdb::LinkUpdate change;
    change.setExpire = limits.expires == Param::kOk;
    change.expireTime = ExpireTime(limits, now);
    change.setPassword = hasPassword == Param::kOk;
    change.password = password;
    change.setUseLimit = limits.uses == Param::kOk;
    change.useLimit = limits.useLimit;
    change.setMatchIP = limits.matchIP == Param::kOk;
    change.enableMatchIP = limits.enableMatchIP;
    if (!change.setExpire && !change.setPassword && !change.setUseLimit && !change.setMatchIP) {
        BadParam(resp, "nothing to change");
        return;
    }
    record::Entry updated;
    if (!entries.Update(entry.get_hash(), change) || !entries.GetByHash(entry.get_hash(), updated)) {
        resp->SetError(kErrServer);
        return;
    }
    resp->SetSuccess(LinkJson(req, updated, now));
}

void Revoke(APIRequest* req, APIResponse* resp)
{
    sdb::EntryDB entries(sdb::SharingDB::Instance());
    record::Entry entry;
    if (!OwnLink(req, resp, entries, entry)) {
        return;
    }
    // Revoking again is not an error: the link stays ended.
    if (!entry.is_revoked() && !entries.Revoke(entry.get_hash())) {
        resp->SetError(kErrServer);
        return;
    }
    resp->SetSuccess();
}

// ---- Visitor method ---------------------------------------------------------

int OpenError(int status)
{
    switch (status) {
    case sharing::SHARING_STATUS_NO_LINK:
    case sharing::SHARING_STATUS_REVOKED:
        return kErrOpenNoLink;
    case sharing::SHARING_STATUS_EXPIRED:
        return kErrOpenExpired;
    case sharing::SHARING_STATUS_USE_LIMIT:
        return kErrOpenUseLimit;
    case sharing::SHARING_STATUS_BAD_PASSWORD:
        return kErrOpenBadPassword;
    case sharing::SHARING_STATUS_BLOCKED:
        return kErrOpenBlocked;
    case sharing::SHARING_STATUS_BUSY:
        return kErrOpenBusy;
    default:
        return kErrServer;
    }
}

void Open(APIRequest* req, APIResponse* resp)
{
    std::string id;
    std::string password;
    Param hasPassword = Param::kAbsent;
    if (!LinkIdParam(req, "link", id)) {
        BadParam(resp, "link");
        return;
    }
    if (!PasswordParam(req, resp, false, hasPassword, password)) {
        return;
    }
    const std::string clientIP = req->GetRemoteIP();
    sdb::SharingDB& db = sdb::SharingDB::Instance();
    sdb::SessionDB sessions(db);
    record::Session session;
    // A visitor who holds a valid session of this link keeps it.
    const std::string held = req->GetCookie(sharing::SZK_SHARING_SID, "");
    const bool keep = !held.empty() && held.find('\0') == std::string::npos &&
                      sharing::CheckSharing(id, held, clientIP) == sharing::SHARING_STATUS_VALID &&
                      sessions.GetBySessionId(held, session);
    if (!keep) {
        record::Token token;
        const int status = sessions.Create(id, password, clientIP, 0, session, token);
        if (status != sharing::SHARING_STATUS_VALID) {
            resp->SetError(OpenError(status));
            return;
        }
        if (!resp->AddCookie(sharing::SZK_SHARING_SID, session.get_session_id(), "/", 0, "", OverHttps(req), true,
                             "Strict")) {
            resp->SetError(kErrServer);
            return;
        }
    }
    record::Entry entry;
    if (!sdb::EntryDB(db).GetByHash(id, entry)) {
        resp->SetError(kErrServer);
        return;
    }
    Json::Value data(Json::objectValue);
    data["project"] = entry.get_project_name();
    data["name"] = BaseName(entry.get_path());
    data["expires"] = static_cast<Json::Int64>(entry.get_expire_time());
    data["sessionExpires"] = static_cast<Json::Int64>(session.get_timeout());
    data["url"] = LinkURL(req, entry.get_project_name(), id);
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Sharing", 1, "create", VELA::APIGuarded<Create, kErrServer>},
    {"VELA.Sharing", 1, "list", VELA::APIGuarded<List, kErrServer>},
    {"VELA.Sharing", 1, "update", VELA::APIGuarded<Update, kErrServer>},
    {"VELA.Sharing", 1, "revoke", VELA::APIGuarded<Revoke, kErrServer>},
    {"VELA.Sharing.Visitor", 1, "open", VELA::APIGuarded<Open, kErrServer>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
