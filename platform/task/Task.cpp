// Task records: one JSON file per task under <root>/var/lib/vela/tasks/OWNER/.
#include "vela/task.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace TARN {

const char* const TaskUtil::kAdminOwner = "@administrators";
const char* const TaskUtil::kUsersOwner = "@users";

namespace {

const char kTaskDir[] = "/var/lib/vela/tasks";
const size_t kMaxRecord = 4u << 20;
const size_t kMaxId = 96;
const size_t kMaxPrefix = 32;
const int kRecordVersion = 1;

bool IsNameChar(char c)
{
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' || c == '-' ||
           c == '.';
}

bool IsName(const std::string& text, size_t maxLen)
{
    return text.size() <= maxLen && (text.empty() || text[0] != '.') &&
           std::all_of(text.begin(), text.end(), IsNameChar);
}

std::string TasksRoot() { return VELA::System::Path(kTaskDir); }

std::string OwnerDir(const std::string& owner) { return TasksRoot() + "/" + owner; }

Json::Int64 Now() { return static_cast<Json::Int64>(time(nullptr)); }

// An integer field of a record, `def` when it is missing, not an integer or
// out of range (the accessors never throw on a damaged record).
long long IntField(const Json::Value& record, const char* key, long long def)
{
    const Json::Value& value = record[key];
    return value.isInt64() ? value.asInt64() : def;
}

// The kernel's start time of process `pid` (clock ticks since boot), or -1
// when it does not exist or is a zombie.
long long ProcessStart(pid_t pid)
{
    if (pid <= 0) {
        return -1;
    }
    std::string stat;
    int err = 0;
    if (!VELA::System::ReadFileBounded("/proc/" + std::to_string(pid) + "/stat", 4096, stat, err)) {
        return -1;
    }
    // The command name may hold anything, ")" included: the fields that
    // follow start after the last ")".
    const size_t close = stat.rfind(')');
    if (close == std::string::npos) {
        return -1;
    }
    const char* p = stat.c_str() + close + 1;
    while (*p == ' ') {
        ++p;
    }
    if (*p == 'Z' || *p == 'X' || *p == '\0') {
        return -1;
    }
    // The state is field 3; the start time is field 22.
    for (int field = 3; field < 22; ++field) {
        p = strchr(p, ' ');
        if (p == nullptr) {
            return -1;
        }
        ++p;
    }
    char* end = nullptr;
    errno = 0;
    const long long start = strtoll(p, &end, 10);
    return (end == p || errno != 0) ? -1 : start;
}

bool EnsureOwnerDir(const std::string& owner)
{
    return VELA::System::MakeDirs(OwnerDir(owner), 0700);
}

bool WriteRecord(const std::string& path, const Json::Value& record)
{
    // A record that could not be read back is never written.
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    if (Json::writeString(builder, record).size() >= kMaxRecord) {
        VELA_LOG_ERR("task record %s would be larger than %zu bytes; not written", path.c_str(), kMaxRecord);
        return false;
    }
    // Task state does not need to outlive a crash of the machine: the
    // workers do not either. The rename still never shows a partial record.
    return VELA::System::WriteJsonAtomic(path, record, 0600, false);
}

}  // namespace

// ---- TaskUtil ---------------------------------------------------------------------

bool TaskUtil::isValidOwner(const std::string& owner)
{
    if (owner == kAdminOwner || owner == kUsersOwner) {
        return true;
    }
    // A NUL inside would end the name early in every path made from it.
    return !owner.empty() && owner[0] != '@' && owner[0] != '.' && owner.find('\0') == std::string::npos &&
           VELA::System::ValidAccountName(owner.c_str());
}

bool TaskUtil::isValidId(const std::string& id) { return !id.empty() && IsName(id, kMaxId); }

bool TaskUtil::isValidPrefix(const std::string& prefix) { return IsName(prefix, kMaxPrefix); }

std::string TaskUtil::getUniqueID(const std::string& owner, const std::string& prefix)
{
    if (!isValidOwner(owner) || !isValidPrefix(prefix)) {
        VELA_LOG_ERR("invalid task owner or prefix");
        return "";
    }
    if (!EnsureOwnerDir(owner)) {
        return "";
    }
    for (int attempt = 0; attempt < 4; ++attempt) {
        unsigned char bytes[8];
        if (getrandom(bytes, sizeof(bytes), 0) != static_cast<ssize_t>(sizeof(bytes))) {
            VELA_LOG_ERR("getrandom failed[%m]");
            return "";
        }
        static const char hex[] = "0123456789abcdef";
        std::string id = prefix;
        for (unsigned char b : bytes) {
            id += hex[b >> 4];
            id += hex[b & 15];
        }
        // The record is written aside and linked to its name: link() fails
        // when the name exists, so an id is never handed out twice.
        const std::string path = OwnerDir(owner) + "/" + id;
        const std::string aside = OwnerDir(owner) + "/." + id + ".new";
        Json::Value record(Json::objectValue);
        record["version"] = kRecordVersion;
        record["owner"] = owner;
        record["id"] = id;
        record["created"] = Now();
        record["updated"] = Now();
        record["finished"] = false;
        record["finished_at"] = 0;
        record["create_pid"] = 0;
        record["create_start"] = -1;
        record["properties"] = Json::Value(Json::objectValue);
        if (!WriteRecord(aside, record)) {
            return "";
        }
        const int rc = link(aside.c_str(), path.c_str());
        const int err = errno;
        unlink(aside.c_str());
        if (rc == 0) {
            return id;
        }
        if (err != EEXIST) {
            VELA_LOG_ERR("cannot create task record %s: %s", path.c_str(), strerror(err));
            return "";
        }
    }
    VELA_LOG_ERR("no unused task id after 4 attempts");
    return "";
}

bool TaskUtil::checkTaskExists(const std::string& owner, const std::string& id)
{
    if (!isValidOwner(owner) || !isValidId(id)) {
        return false;
    }
    struct stat st;
    return lstat((OwnerDir(owner) + "/" + id).c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

bool TaskUtil::splitFullId(const std::string& full, std::string& owner, std::string& id)
{
    const size_t slash = full.find('/');
    if (slash == std::string::npos) {
        return false;
    }
    owner = full.substr(0, slash);
    id = full.substr(slash + 1);
    return isValidOwner(owner) && isValidId(id);
}

// ---- TaskMgr ----------------------------------------------------------------------

namespace {

std::vector<std::string> ListDir(const std::string& dir, bool (*keep)(const std::string&))
{
    std::vector<std::string> names;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    for (struct dirent* entry; (entry = readdir(d)) != nullptr;) {
        const std::string name = entry->d_name;
        if (name != "." && name != ".." && keep(name)) {
            names.push_back(name);
        }
    }
    closedir(d);
    std::sort(names.begin(), names.end());
    return names;
}

}  // namespace

std::vector<std::string> TaskMgr::getAllTaskId(const std::string& owner)
{
    if (!TaskUtil::isValidOwner(owner)) {
        return {};
    }
    return ListDir(OwnerDir(owner), TaskUtil::isValidId);
}

std::vector<std::string> TaskMgr::getAllOwners() { return ListDir(TasksRoot(), TaskUtil::isValidOwner); }

int TaskMgr::removeFinished(const std::string& owner, long long maxAgeSeconds)
{
    int removed = 0;
    const long long now = Now();
    for (const std::string& id : getAllTaskId(owner)) {
        Task task(owner, id);
        if (task.reload() && task.isFinished() && now - task.getFinishedAt() > maxAgeSeconds && task.remove()) {
            ++removed;
        }
    }
    return removed;
}

// ---- Task -------------------------------------------------------------------------

Task::Task(const std::string& owner, const std::string& id)
    : owner_(owner), id_(id), valid_(TaskUtil::isValidOwner(owner) && TaskUtil::isValidId(id)),
      record_(Json::objectValue)
{
    record_["properties"] = Json::Value(Json::objectValue);
}

Task::~Task()
{
    if (lockFd_ >= 0) {
        VLIBCFileUnlockByFile(lockFd_);
    }
}

std::string Task::RecordPath() const { return OwnerDir(owner_) + "/" + id_; }

bool Task::reload()
{
    if (!valid_) {
        return false;
    }
    std::string text;
    int err = 0;
    if (!VELA::System::ReadFileBounded(RecordPath(), kMaxRecord, text, err, VELA::System::kReadNoFollow)) {
        if (err != ENOENT) {
            VELA_LOG_ERR("cannot read task record %s: %s", RecordPath().c_str(), strerror(err));
        }
        return false;
    }
    Json::Value record;
    if (!VELA::WebAPIUtil::ParseJson(text, record) || !record.isObject() || record["owner"] != owner_ ||
        record["id"] != id_ || !record["properties"].isObject()) {
        VELA_LOG_ERR("task record %s is not valid", RecordPath().c_str());
        return false;
    }
    record_.swap(record);
    return true;
}

bool Task::beginUpdate(int timeoutSec)
{
    if (!valid_ || lockFd_ >= 0) {
        return false;
    }
    if (VLIBCFileLockTimeByFile((OwnerDir(owner_) + "/.lock").c_str(), 1, timeoutSec, &lockFd_) != 0) {
        VELA_LOG_ERR("cannot lock the tasks of [%s]", owner_.c_str());
        lockFd_ = -1;
        return false;
    }
    if (!reload()) {
        VLIBCFileUnlockByFile(lockFd_);
        lockFd_ = -1;
        return false;
    }
    return true;
}

bool Task::endUpdate()
{
    if (lockFd_ < 0) {
        return false;
    }
    // A record removed while this process was not holding the lock stays
    // removed: only a record that is still there is replaced.
    struct stat st;
    bool ok = lstat(RecordPath().c_str(), &st) == 0 && S_ISREG(st.st_mode);
    if (ok) {
        record_["updated"] = Now();
        ok = WriteRecord(RecordPath(), record_);
    }
    VLIBCFileUnlockByFile(lockFd_);
    lockFd_ = -1;
    return ok;
}

bool Task::hasProperty(const std::string& key) const { return record_["properties"].isMember(key); }

Json::Value Task::getProperty(const std::string& key) const { return record_["properties"].get(key, Json::Value()); }

bool Task::getBoolProperty(const std::string& key, bool def) const
{
    const Json::Value value = getProperty(key);
    return value.isBool() ? value.asBool() : def;
}

bool Task::setProperty(const std::string& key, const Json::Value& value)
{
    if (!valid_ || key.empty()) {
        return false;
    }
    if (inUpdate()) {
        record_["properties"][key] = value;
        return true;
    }
    if (!beginUpdate()) {
        return false;
    }
    record_["properties"][key] = value;
    return endUpdate();
}

bool Task::removeProperty(const std::string& key)
{
    if (!valid_) {
        return false;
    }
    const bool own = !inUpdate();
    if (own && !beginUpdate()) {
        return false;
    }
    record_["properties"].removeMember(key);
    return own ? endUpdate() : true;
}

bool Task::setCreatePid(pid_t pid)
{
    if (!valid_ || pid <= 0) {
        return false;
    }
    const bool own = !inUpdate();
    if (own && !beginUpdate()) {
        return false;
    }
    record_["create_pid"] = static_cast<Json::Int64>(pid);
    record_["create_start"] = static_cast<Json::Int64>(ProcessStart(pid));
    return own ? endUpdate() : true;
}

pid_t Task::getCreatePid() const
{
    const long long pid = IntField(record_, "create_pid", 0);
    return pid > 0 && pid < (1LL << 31) ? static_cast<pid_t>(pid) : 0;
}

bool Task::isWorkerAlive() const
{
    const pid_t pid = getCreatePid();
    if (pid <= 0) {
        return false;
    }
    const long long start = ProcessStart(pid);
    return start >= 0 && IntField(record_, "create_start", -1) == start;
}

const char* Task::stateName() const
{
    if (isFinished()) {
        return "finished";
    }
    return getCreatePid() > 0 && !isWorkerAlive() ? "lost" : "running";
}

bool Task::finish(bool remove)
{
    if (!valid_) {
        return false;
    }
    if (remove) {
        return this->remove();
    }
    const bool own = !inUpdate();
    if (own && !beginUpdate()) {
        return false;
    }
    if (!isFinished()) {
        record_["finished"] = true;
        record_["finished_at"] = Now();
    }
    return own ? endUpdate() : true;
}

bool Task::isFinished() const { return record_["finished"].isBool() && record_["finished"].asBool(); }

long long Task::getCreated() const { return IntField(record_, "created", 0); }

long long Task::getFinishedAt() const { return IntField(record_, "finished_at", 0); }

bool Task::remove()
{
    if (!valid_) {
        return false;
    }
    // Under the lock, unless this process holds it already: an update that
    // checked the record is still there must not write it back after the
    // unlink.
    int lockFd = -1;
    if (lockFd_ < 0) {
        struct stat st;
        if (lstat(OwnerDir(owner_).c_str(), &st) != 0 && errno == ENOENT) {
            return true;  // no task of this owner at all
        }
        if (VLIBCFileLockTimeByFile((OwnerDir(owner_) + "/.lock").c_str(), 1, 10, &lockFd) != 0) {
            VELA_LOG_ERR("cannot lock the tasks of [%s] to remove %s", owner_.c_str(), id_.c_str());
            return false;
        }
    }
    const bool ok = unlink(RecordPath().c_str()) == 0 || errno == ENOENT;
    if (!ok) {
        VELA_LOG_ERR("cannot remove task record %s[%m]", RecordPath().c_str());
    }
    if (lockFd >= 0) {
        VLIBCFileUnlockByFile(lockFd);
    }
    return ok;
}

bool Task::waitForDataReady(const std::string& key, int seconds)
{
    if (!valid_ || seconds < 0) {
        return false;
    }
    struct timespec start;
    clock_gettime(CLOCK_MONOTONIC, &start);
    long pauseMs = 2;
    for (;;) {
        if (!reload()) {
            return false;
        }
        if (hasProperty(key)) {
            return true;
        }
        // A worker that was recorded and is gone will never write it; it
        // may have written it just before it ended, after the read above.
        if (isFinished() || (getCreatePid() > 0 && !isWorkerAlive())) {
            return reload() && hasProperty(key);
        }
        struct timespec now;
        clock_gettime(CLOCK_MONOTONIC, &now);
        const long long elapsedMs =
            (now.tv_sec - start.tv_sec) * 1000LL + (now.tv_nsec - start.tv_nsec) / 1000000LL;
        if (elapsedMs >= seconds * 1000LL) {
            return false;
        }
        const struct timespec pause = {0, pauseMs * 1000000L};
        nanosleep(&pause, nullptr);
        pauseMs = std::min(pauseMs * 2, 100L);
    }
}

}  // namespace TARN
