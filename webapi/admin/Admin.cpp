// The operators' API VELA.Admin: what the caller may call, the usage
// counts, background tasks, login sessions and the login guard's blocks.
// Every method but "apis" is for administrators (the description's
// "allowUser"); all run as the superuser to read the platform's state.
//
// Nothing of a session's credentials leaves the server: a session is named
// by its handle (vela/session.h), never by its id or token. The usage
// counter's files are read as hostile input: bounded in number and size,
// opened without following links, and a member that is not a count is
// skipped.
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "access/APICatalog.h"
#include "vela/log.h"
#include "vela/loginguard.h"
#include "vela/session.h"
#include "vela/sysfile.h"
#include "vela/task.h"
#include "vela/vlibc.h"
#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"
#include "webapi/JsonUtil.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

constexpr int kErrNoSession = 480;
constexpr int kErrServer = 481;

const char kInfoFile[] = "/etc/velainfo.conf";
const char kCounterDir[] = "/var/spool/webapi";
// Bounds of what the usage answer reads: files of the directory, bytes of
// one file, counts answered.
constexpr size_t kMaxCounterFiles = 4096;
constexpr size_t kMaxCounterFile = 1024 * 1024;
constexpr size_t kMaxCounts = 100000;
constexpr size_t kMaxMethodName = 128;
// Tasks answered at most.
constexpr size_t kMaxTasks = 10000;

// ---- apis -----------------------------------------------------------------

void Apis(APIRequest* req, APIResponse* resp)
{
    const std::string user = req->GetLoginUserName();
    if (user.empty()) {
        resp->SetError(WEBAPI_ERR_NO_PERMISSION);
        return;
    }
    VELA::APICatalog catalog;
    Json::Value data(Json::objectValue);
    data["apis"] = catalog.Callable(user, req->GetRemoteIP());
    resp->SetSuccess(data);
}

// ---- usage ----------------------------------------------------------------

struct Count {
    std::string api;
    int version;
    std::string method;
    long long count;
};

// A method name as a description may list it: letters, digits and "._-",
// not empty, bounded.
bool IsMethodName(const std::string& name)
{
    return VELA::System::IsCheckedName(name, VELA::System::kNameDotted, kMaxMethodName);
}

// Splits a counter member "<api>_<version>_<method>". The API name holds
// no "_" before its version in any name the counter writes for a valid
// call; the first "_<digits>_" after a valid API name is taken.
bool SplitMember(const std::string& member, Count& out)
{
    for (size_t cut = member.find('_'); cut != std::string::npos; cut = member.find('_', cut + 1)) {
        const size_t end = member.find('_', cut + 1);
        if (end == std::string::npos) {
            return false;
        }
        long long version = 0;
        const std::string api = member.substr(0, cut);
        if (!VELA::System::IsAPIName(api) || !VELA::System::ParseDecimal(member.substr(cut + 1, end - cut - 1), 1, 1 << 30, version)) {
            continue;
        }
        const std::string method = member.substr(end + 1);
        if (!IsMethodName(method)) {
            return false;
        }
        out.api = api;
        out.version = static_cast<int>(version);
        out.method = method;
        return true;
    }
    return false;
}

// The regular file `name` of the directory `dir`, opened without following
// a link and without blocking, at most `limit` bytes. False otherwise.
bool ReadAt(int dir, const char* name, size_t limit, std::string& out)
{
    const int fd = openat(dir, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
    if (fd < 0) {
        return false;
    }
    struct stat st;
    bool ok = fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && static_cast<unsigned long long>(st.st_size) <= limit;
    out.clear();
    char buf[16384];
    while (ok) {
        const ssize_t n = read(fd, buf, sizeof(buf));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            ok = n == 0;
            break;
        }
        if (out.size() + static_cast<size_t>(n) > limit) {
            ok = false;  // grew while read
            break;
        }
        out.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    return ok;
}

// The counts of one counter file, appended to `counts` up to kMaxCounts.
void ReadCounterFile(int dir, const char* name, std::vector<Count>& counts)
{
    std::string text;
    Json::Value doc;
    if (!ReadAt(dir, name, kMaxCounterFile, text) || !VELA::JsonParse(text, doc) || !doc.isObject()) {
        VELA_LOG_ERR("usage counter file %.255s skipped: not a counter file", name);
        return;
    }
    for (auto it = doc.begin(); it != doc.end() && counts.size() < kMaxCounts; ++it) {
        if (!it->isObject()) {
            continue;
        }
        const Json::Value& count = (*it)["count"];
        Count c;
        if (!count.isInt64() || count.asInt64() < 0 || !SplitMember(it.name(), c)) {
            continue;
        }
        c.count = count.asInt64();
        counts.push_back(c);
    }
}

// Every count of the counter directory; a missing directory has none.
bool ReadCounts(std::vector<Count>& counts)
{
    const std::string path = VELA::System::Path(kCounterDir);
    const int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) {
        if (errno == ENOENT) {
            return true;
        }
        VELA_LOG_ERR("usage: cannot open %s: %m", path.c_str());
        return false;
    }
    DIR* d = fdopendir(fd);
    if (d == nullptr) {
        close(fd);
        return false;
    }
    size_t files = 0;
    for (struct dirent* e = readdir(d); e != nullptr && counts.size() < kMaxCounts; e = readdir(d)) {
        const std::string name = e->d_name;
        const size_t len = name.size();
        if (name[0] == '.' || len <= 5 || name.compare(len - 5, 5, ".json") != 0) {
            continue;
        }
        if (++files > kMaxCounterFiles) {
            VELA_LOG_ERR("usage: more than %zu counter files in %s, the rest skipped", kMaxCounterFiles, path.c_str());
            break;
        }
        ReadCounterFile(dirfd(d), name.c_str(), counts);
    }
    closedir(d);
    return true;
}

void Usage(APIRequest*, APIResponse* resp)
{
    std::vector<Count> counts;
    if (!ReadCounts(counts)) {
        resp->SetError(kErrServer);
        return;
    }
    std::sort(counts.begin(), counts.end(), [](const Count& a, const Count& b) {
        if (a.count != b.count) {
            return a.count > b.count;
        }
        if (a.api != b.api) {
            return a.api < b.api;
        }
        return a.version != b.version ? a.version < b.version : a.method < b.method;
    });
    Json::Value data(Json::objectValue);
    const std::string info = VELA::System::Path(kInfoFile);
    data["enabled"] = VLIBCFileCheckKeyValue(info.c_str(), "enable_data_collect", "yes", 0) != 0;
    data["counts"] = Json::Value(Json::arrayValue);
    for (const Count& c : counts) {
        Json::Value entry(Json::objectValue);
        entry["api"] = c.api;
        entry["version"] = c.version;
        entry["method"] = c.method;
        entry["count"] = static_cast<Json::Int64>(c.count);
        data["counts"].append(entry);
    }
    resp->SetSuccess(data);
}

// ---- tasks ----------------------------------------------------------------

Json::Value TextOrNull(const Json::Value& v) { return v.isString() ? v : Json::Value(); }

void Tasks(APIRequest*, APIResponse* resp)
{
    Json::Value list(Json::arrayValue);
    for (const std::string& owner : TARN::TaskMgr::getAllOwners()) {
        for (const std::string& id : TARN::TaskMgr::getAllTaskId(owner)) {
            if (list.size() >= kMaxTasks) {
                break;
            }
            TARN::Task task(owner, id);
            if (!task.reload()) {
                continue;  // removed meanwhile, or not a record (logged)
            }
            const char* state = task.stateName();
            const Json::Value info = task.getProperty("info");
            const Json::Value progress = task.getProperty("progress");
            Json::Value entry(Json::objectValue);
            entry["id"] = owner + "/" + id;
            entry["owner"] = owner;
            entry["api"] = info.isObject() ? TextOrNull(info["api"]) : Json::Value();
            entry["method"] = info.isObject() ? TextOrNull(info["method"]) : Json::Value();
            entry["state"] = state;
            entry["progress"] = Json::Value();
            if (progress.isObject() && progress["percent"].isInt()) {
                entry["progress"] = std::max(0, std::min(100, progress["percent"].asInt()));
            }
            entry["created"] = static_cast<Json::Int64>(task.getCreated());
            list.append(entry);
        }
    }
    Json::Value data(Json::objectValue);
    data["tasks"] = list;
    resp->SetSuccess(data);
}

// ---- sessions and revoke --------------------------------------------------

void Sessions(APIRequest* req, APIResponse* resp)
{
    std::vector<VELA::Session::Record> records;
    if (VELA::Session::List(records) != 0) {
        resp->SetError(kErrServer);
        return;
    }
    const std::string own = req->GetSessionID();
    Json::Value list(Json::arrayValue);
    for (const VELA::Session::Record& r : records) {
        std::string handle;
        if (r.expired || VELA::Session::HandleOf(r.sid.c_str(), handle) != 0) {
            continue;
        }
        Json::Value entry(Json::objectValue);
        entry["id"] = handle;
        entry["user"] = r.user;
        entry["address"] = r.clientIP;
        entry["created"] = static_cast<Json::Int64>(r.created);
        entry["lastUsed"] = static_cast<Json::Int64>(r.lastUse);
        entry["current"] = !own.empty() && r.sid == own;
        list.append(entry);
    }
    Json::Value data(Json::objectValue);
    data["sessions"] = list;
    resp->SetSuccess(data);
}

void Revoke(APIRequest* req, APIResponse* resp)
{
    const Json::Value& id = req->GetParamRef("id", Json::Value::nullSingleton());
    if (!id.isString() || !VELA::Session::IsHandle(id.asCString())) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST, Json::Value("id"));
        return;
    }
    const std::string handle = id.asString();
    std::vector<VELA::Session::Record> records;
    if (VELA::Session::List(records) != 0) {
        resp->SetError(kErrServer);
        return;
    }
    for (const VELA::Session::Record& r : records) {
        std::string h;
        if (VELA::Session::HandleOf(r.sid.c_str(), h) != 0 || h != handle) {
            continue;
        }
        const int rc = VELA::Session::Remove(r.sid.c_str());
        if (rc == 0) {
            Json::Value data(Json::objectValue);
            data["revoked"] = true;
            resp->SetSuccess(data);
        } else {
            resp->SetError(rc == -2 ? kErrNoSession : kErrServer);
        }
        return;
    }
    resp->SetError(kErrNoSession);
}

// ---- blocked --------------------------------------------------------------

void Blocked(APIRequest*, APIResponse* resp)
{
    VELA::Session::LoginSettings settings;
    VELA::Session::LoginSettingsLoad(&settings);
    std::vector<VELA::Session::LoginGuardEntry> addresses;
    std::vector<VELA::Session::LoginGuardEntry> accounts;
    if (VELA::Session::LoginGuardList(&settings, addresses, accounts) != 0) {
        resp->SetError(kErrServer);
        return;
    }
    Json::Value data(Json::objectValue);
    const struct {
        const char* list;
        const char* key;
        const std::vector<VELA::Session::LoginGuardEntry>& entries;
    } lists[] = {{"addresses", "address", addresses}, {"accounts", "account", accounts}};
    for (const auto& l : lists) {
        data[l.list] = Json::Value(Json::arrayValue);
        for (const VELA::Session::LoginGuardEntry& e : l.entries) {
            Json::Value entry(Json::objectValue);
            entry[l.key] = e.subject;
            entry["until"] = static_cast<Json::Int64>(e.until);
            entry["failures"] = e.failures;
            data[l.list].append(entry);
        }
    }
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Admin", 1, "apis", VELA::APIGuarded<Apis, kErrServer>},
    {"VELA.Admin", 1, "usage", VELA::APIGuarded<Usage, kErrServer>},
    {"VELA.Admin", 1, "tasks", VELA::APIGuarded<Tasks, kErrServer>},
    {"VELA.Admin", 1, "sessions", VELA::APIGuarded<Sessions, kErrServer>},
    {"VELA.Admin", 1, "revoke", VELA::APIGuarded<Revoke, kErrServer>},
    {"VELA.Admin", 1, "blocked", VELA::APIGuarded<Blocked, kErrServer>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
