// Background tasks over the platform's task records.
#include "webapi/APIPolling.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <ctime>
#include <memory>
#include <sys/resource.h>
#include <unistd.h>
#include <vector>

#include "polling/APIPollingPrivate.h"
#include "request/APIRequestPrivate.h"
#include "polling/TaskAccess.h"
#include "subprocess/Detach.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/task.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

namespace VELA {

namespace {

const char kSection[] = "polling_attribute";
const char kConfPath[] = "/etc/vela/webapi.conf";
// How long the request waits for the worker's first report, in seconds.
const int kFirstReportSeconds = 60;
// A record without a worker after this long belongs to a start that died
// between making the record and forking.
const long long kForkGraceSeconds = 120;
// Parameters kept in "info" at most (serialised); larger ones are dropped.
const size_t kMaxStoredParams = 64 * 1024;
const size_t kMaxDescription = 256;
const Json::ArrayIndex kMaxStatusIds = 256;

struct TaskSettings {
    long long maxRunning = 8;        // running tasks one user may have
    long long keepSeconds = 604800;  // finished tasks are kept this long
    long long maxKept = 256;         // records of one owner at most
};

TaskSettings LoadTaskSettings()
{
    TaskSettings settings;
    std::vector<std::pair<std::string, std::string>> lines;
    if (System::ReadKeyValueFile(kConfPath, lines) > 0) {
        System::NumberSetting(lines, kConfPath, "task_max_running", 1, 10000, settings.maxRunning);
        System::NumberSetting(lines, kConfPath, "task_keep_seconds", 0, 315360000, settings.keepSeconds);
        System::NumberSetting(lines, kConfPath, "task_max_kept", 1, 100000, settings.maxKept);
    }
    return settings;
}

// The request's parameters as a task record keeps them: without the names
// of the call, and never with the caller's credentials.
Json::Value StoredParams(APIRequest* req, bool* dropped)
{
    static const char* const kNeverKept[] = {"api", "version", "method", "_sid", "tid", "_sharing_id", "_sharing_sid"};
    Json::Value params(Json::objectValue);
    const Json::Value& all = req->GetPrivate()->GetData("param", "", Json::Value(Json::objectValue));
    if (all.isObject()) {
        for (const std::string& name : all.getMemberNames()) {
            if (std::find_if(std::begin(kNeverKept), std::end(kNeverKept),
                             [&](const char* n) { return name == n; }) == std::end(kNeverKept)) {
                params[name] = all[name];
            }
        }
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    *dropped = Json::writeString(builder, params).size() > kMaxStoredParams;
    return *dropped ? Json::Value(Json::objectValue) : params;
}

// A task that is not finished, and whose worker is gone (or never came),
// will never finish by itself.
bool WorkerLost(const TARN::Task& task)
{
    if (task.isFinished()) {
        return false;
    }
    if (task.getCreatePid() > 0) {
        return !task.isWorkerAlive();
    }
    return static_cast<long long>(time(nullptr)) - task.getCreated() > kForkGraceSeconds;
}

// Marks a lost task finished with error 117 in its body. The record as it
// is afterwards stays in `task`.
void ReapLostWorker(TARN::Task& task)
{
    if (!WorkerLost(task) || !task.beginUpdate()) {
        return;
    }
    if (WorkerLost(task)) {
        Json::Value body(Json::objectValue);
        body["success"] = false;
        body["error"]["code"] = WEBAPI_ERR_NO_RESPONSE;
        body["error"]["errors"]["reason"] = "the worker ended without finishing";
        task.setProperty("body", body);
        task.setProperty("task_run", true);
        task.finish(false);
        VELA_LOG_ERR("task [%s/%s] lost its worker (pid %d)", task.getOwner().c_str(), task.getId().c_str(),
                     static_cast<int>(task.getCreatePid()));
    }
    task.endUpdate();
}

// Housekeeping of one owner's records: finished tasks older than the
// keeping time go, and the oldest finished ones while the owner has more
// records than it may keep (running tasks are never removed).
void Housekeep(const std::string& owner, const TaskSettings& settings)
{
    TARN::TaskMgr::removeFinished(owner, settings.keepSeconds);
    const std::vector<std::string> ids = TARN::TaskMgr::getAllTaskId(owner);
    if (static_cast<long long>(ids.size()) < settings.maxKept) {
        return;
    }
    std::vector<std::pair<long long, std::string>> finished;
    for (const std::string& id : ids) {
        TARN::Task task(owner, id);
        if (task.reload() && task.isFinished()) {
            finished.emplace_back(task.getFinishedAt(), id);
        }
    }
    std::sort(finished.begin(), finished.end());
    long long excess = static_cast<long long>(ids.size()) - settings.maxKept + 1;
    for (auto it = finished.begin(); it != finished.end() && excess > 0; ++it, --excess) {
        TARN::Task(owner, it->second).remove();
    }
}

bool DoKill(pid_t pid)
{
    if (pid < 1) {
        VELA_LOG_ERR("invalid process id");
        return false;
    }
    if (kill(pid, SIGTERM) != 0 && errno != ESRCH) {
        const int err = errno;
        VELA_LOG_ERR("Failed to kill %d, reason=%s(%d)", static_cast<int>(pid), strerror(err), err);
        return false;
    }
    return true;
}

// The worker is not bound by the limits of the request that started it:
// its CPU time is only limited as the web server's own processes are.
void LiftRequestLimits()
{
    struct rlimit cpu;
    if (getrlimit(RLIMIT_CPU, &cpu) != 0) {
        return;
    }
    cpu.rlim_cur = cpu.rlim_max = RLIM_INFINITY;
    TaskAccess access;
    if (setrlimit(RLIMIT_CPU, &cpu) != 0) {
        getrlimit(RLIMIT_CPU, &cpu);
        cpu.rlim_cur = cpu.rlim_max;
        setrlimit(RLIMIT_CPU, &cpu);
    }
}

// A description cut to `max` bytes without splitting a UTF-8 sequence.
std::string CutText(const std::string& text, size_t max)
{
    if (text.size() <= max) {
        return text;
    }
    size_t end = max;
    while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) {
        --end;
    }
    return text.substr(0, end);
}

}  // namespace

TaskAccess::TaskAccess()
{
    if (geteuid() == 0) {
        return;
    }
    uid_t real = 0, effective = 0, saved = 0;
    if (getresuid(&real, &effective, &saved) == 0 && (real == 0 || saved == 0)) {
        guard_.reset(new RunAsRootGuard(__FILE__, __LINE__, "IF_RUN_AS"));
        ok_ = guard_->Ok();
    }
}

// ---- Attributes -------------------------------------------------------------------

APIPolling::APIPolling() : d_(new APIPollingPrivate(this)) {}

APIPolling::APIPolling(APIRequest* request) : d_(new APIPollingPrivate(this, request)) {}

APIPolling::~APIPolling() { delete d_; }

void APIPolling::SetRequest(APIRequest* request) { d_->request_ = request; }

int APIPolling::GetError() const { return d_->error_; }

void APIPolling::SetError(int code) { d_->error_ = code; }

bool APIPolling::SetPrefixAttr(const std::string& prefix)
{
    if (!TARN::TaskUtil::isValidPrefix(prefix)) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    return d_->SetData(kSection, "task_id_prefix", Json::Value(prefix), true);
}

bool APIPolling::SetGroupAttr(const std::string& group)
{
    if (!group.empty() && group != "admin" && group != "everyone") {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    if (group == "admin" && (d_->request_ == nullptr || !d_->request_->IsAdmin())) {
        VELA_LOG_ERR("No permission");
        SetError(WEBAPI_ERR_POLLING_NO_ADMIN_PERMISSION);
        return false;
    }
    return d_->SetData(kSection, "share_to_group", Json::Value(group), true);
}

bool APIPolling::SetRemoveAttr(bool remove) { return d_->SetData(kSection, "auto_remove", Json::Value(remove), false); }

bool APIPolling::SetRemoveParam(bool remove)
{
    return d_->SetData(kSection, "auto_remove_params", Json::Value(remove), false);
}

// ---- Start ------------------------------------------------------------------------

bool APIPolling::Start(APIResponse* resp, void (*work)(APIRequest*, APIResponse*, void*), void* data)
{
    APIRequest* const req = d_->request_;
    if (req == nullptr) {
        VELA_LOG_ERR("unknown request");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    if (resp == nullptr || work == nullptr) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    const Json::Value none;
    const std::string group = d_->GetData(kSection, "share_to_group", none).asString();
    const std::string prefix = d_->GetData(kSection, "task_id_prefix", none).asString();
    const bool autoRemove = d_->GetData(kSection, "auto_remove", none).asBool();
    const bool removeParams = d_->GetData(kSection, "auto_remove_params", none).asBool();
    const std::string user = req->GetLoginUserName();

    std::string owner;
    if (group == "admin") {
        if (!req->IsAdmin()) {
            VELA_LOG_ERR("No permission");
            resp->SetError(WEBAPI_ERR_NO_PERMISSION);
            return false;
        }
        owner = TARN::TaskUtil::kAdminOwner;
    } else if (group == "everyone") {
        owner = TARN::TaskUtil::kUsersOwner;
    } else if (!group.empty()) {
        VELA_LOG_ERR("bad parameters");
        resp->SetError(WEBAPI_ERR_TASK_ACCESS);
        return false;
    } else {
        owner = user;
    }
    // Every task has a user to answer for it: the one whose running tasks
    // are counted, and who owns it when no group does.
    if (!TARN::TaskUtil::isValidOwner(user) || user[0] == '@') {
        VELA_LOG_ERR("a task needs a login user");
        resp->SetError(WEBAPI_ERR_NO_PERMISSION);
        return false;
    }

    // Held for the records only: released before the fork, so the worker
    // runs as the handler does.
    std::unique_ptr<TaskAccess> access(new TaskAccess);
    if (!access->Ok()) {
        VELA_LOG_ERR("Failed to set property.");
        return false;
    }
    const TaskSettings settings = LoadTaskSettings();
    Housekeep(owner, settings);
    long long running = 0;
    for (const std::string& o : {user, std::string(TARN::TaskUtil::kUsersOwner), std::string(TARN::TaskUtil::kAdminOwner)}) {
        for (const std::string& id : TARN::TaskMgr::getAllTaskId(o)) {
            TARN::Task other(o, id);
            if (other.reload() && !other.isFinished() && !WorkerLost(other) &&
                other.getProperty("user").asString() == user) {
                ++running;
            }
        }
    }
    if (running >= settings.maxRunning) {
        VELA_LOG_ERR("too many running tasks of [%s] (%lld)", user.c_str(), running);
        Json::Value errors(Json::objectValue);
        errors["max_running"] = static_cast<Json::Int64>(settings.maxRunning);
        resp->SetError(WEBAPI_ERR_COMPOUND_OR_FORK, errors);
        return false;
    }

    const std::string id = TARN::TaskUtil::getUniqueID(owner, prefix);
    TARN::Task task(owner, id);
    Json::Value info(Json::objectValue);
    info["api"] = req->GetAPIClass();
    info["version"] = req->GetAPIVersion();
    info["method"] = req->GetAPIMethod();
    if (!removeParams) {
        bool dropped = false;
        info["param"] = StoredParams(req, &dropped);
        if (dropped) {
            info["param_dropped"] = true;
        }
    }
    info["group"] = group;
    info["prefix"] = prefix;
    if (id.empty() || !task.beginUpdate()) {
        VELA_LOG_ERR("Failed to set property.");
        task.remove();
        return false;
    }
    task.setProperty("info", info);
    task.setProperty("auto_remove", autoRemove);
    task.setProperty("user", user);
    if (!task.endUpdate()) {
        VELA_LOG_ERR("Failed to set property.");
        task.remove();
        return false;
    }
    const std::string fullId = owner + "/" + id;

    // The worker is detached (its parent exits at once), so it is never a
    // zombie of this process, and it outlives the web server's request.
    access.reset();
    const pid_t pid = VLIBCProcForkEx(VLIBC_FORK_DETACH | VLIBC_FORK_DEFAULT_SIGNALS);
    if (pid < 0) {
        const int err = errno;
        TaskAccess recordAccess;
        task.remove();
        VELA_LOG_ERR("Failed to fork(). %s", strerror(err));
        resp->SetError(WEBAPI_ERR_COMPOUND_OR_FORK);
        return false;
    }
    if (pid == 0) {
        setsid();
        LetGoOfTheReply();
        LiftRequestLimits();
        Json::Value env(Json::objectValue);
        env["task_id"] = id;
        env["task_user"] = owner;
        env["full_task_id"] = fullId;
        req->InitEnv(env);
        {
            TaskAccess recordAccess;
            task.setCreatePid(getpid());
        }
        work(req, resp, data);
        {
            TaskAccess recordAccess;
            task.reload();
            task.finish(task.getBoolProperty("auto_remove", false));
        }
        _exit(0);
    }
    // The pid is recorded here as well: a worker that dies before it
    // records itself is then still seen as gone.
    access.reset(new TaskAccess);
    task.setCreatePid(pid);
    task.waitForDataReady("task_run", kFirstReportSeconds);
    Json::Value answer(Json::objectValue);
    answer["task_id"] = fullId;
    resp->SetSuccess(answer);
    return true;
}

// ---- Status, stop, list ---------------------------------------------------------

namespace {

// The owner check: the login user's own tasks, every user's "@users" tasks,
// and "@administrators" tasks for administrators.
bool CheckTaskUser(APIRequest* req, const std::string& owner)
{
    if (!owner.empty() && owner == req->GetLoginUserName()) {
        return true;
    }
    if (owner == TARN::TaskUtil::kUsersOwner) {
        return true;
    }
    if (owner == TARN::TaskUtil::kAdminOwner) {
        if (req->IsAdmin()) {
            return true;
        }
        VELA_LOG_ERR("Permission denied");
        return false;
    }
    VELA_LOG_ERR("Invalid task id");
    return false;
}

Json::Value StatusOf(const TARN::Task& task)
{
    Json::Value out = task.getProperty("body");
    if (!out.isObject()) {
        out = Json::Value(Json::objectValue);
    }
    out["finish"] = task.isFinished();
    out["auto_remove"] = task.getBoolProperty("auto_remove", false);
    if (task.hasProperty("info")) {
        out["info"] = task.getProperty("info");
    }
    if (task.hasProperty("progress")) {
        out["progress"] = task.getProperty("progress");
    }
    return out;
}

// Steps shared by Status and Stop: the request, the id's shape, the owner
// and the record. Fills `task` (read) or sets the error.
bool OpenTask(APIPolling* self, APIRequest* req, const std::string& fullId,
                     std::unique_ptr<TARN::Task>& task)
{
    if (req == nullptr) {
        VELA_LOG_ERR("unknown request");
        self->SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    if (fullId.empty()) {
        VELA_LOG_ERR("bad parameters");
        self->SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    std::string owner, id;
    if (!TARN::TaskUtil::splitFullId(fullId, owner, id)) {
        VELA_LOG_ERR("Invalid task id[%s]", fullId.c_str());
        self->SetError(WEBAPI_ERR_POLLING_BAD_TASK_ID);
        return false;
    }
    if (!CheckTaskUser(req, owner)) {
        self->SetError(WEBAPI_ERR_POLLING_BAD_TASK_ID);
        return false;
    }
    task.reset(new TARN::Task(owner, id));
    if (!TARN::TaskUtil::checkTaskExists(owner, id) || !task->reload()) {
        VELA_LOG_ERR("No such task id[%s]", fullId.c_str());
        self->SetError(WEBAPI_ERR_POLLING_NO_SUCH_TASK);
        return false;
    }
    return true;
}

}  // namespace

bool APIPolling::Status(const std::string& fullTaskId, Json::Value& out)
{
    TaskAccess access;
    std::unique_ptr<TARN::Task> task;
    if (!OpenTask(this, d_->request_, fullTaskId, task)) {
        return false;
    }
    ReapLostWorker(*task);
    out = StatusOf(*task);
    return true;
}

bool APIPolling::Status(const char* fullTaskId, Json::Value& out)
{
    return Status(std::string(fullTaskId != nullptr ? fullTaskId : ""), out);
}

bool APIPolling::Status(const Json::Value& ids, Json::Value& out)
{
    Json::Value list = ids;
    if (ids.isString()) {
        list = Json::Value(Json::arrayValue);
        list.append(ids);
    }
    if (!list.isArray() || list.empty() || list.size() > kMaxStatusIds) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    out = Json::Value(Json::objectValue);
    bool all = true;
    int lastError = 0;
    for (const Json::Value& id : list) {
        if (!id.isString()) {
            VELA_LOG_ERR("bad parameters");
            lastError = WEBAPI_ERR_POLLING_BAD_PARAMETER;
            all = false;
            continue;
        }
        Json::Value one;
        if (Status(id.asString(), one)) {
            out[id.asString()] = one;
        } else {
            Json::Value refused(Json::objectValue);
            refused["error"] = GetError();
            out[id.asString()] = refused;
            lastError = GetError();
            all = false;
        }
    }
    SetError(lastError);
    return all;
}

bool APIPolling::Stop(const std::string& fullTaskId, bool removeRecord)
{
    TaskAccess access;
    std::unique_ptr<TARN::Task> task;
    if (!OpenTask(this, d_->request_, fullTaskId, task)) {
        return false;
    }
    // Only a worker that still runs under the recorded start time is
    // signalled: a pid taken by another process since is never touched.
    const pid_t pid = task->getCreatePid();
    if (pid > 0 && task->isWorkerAlive() && !DoKill(pid)) {
        VELA_LOG_ERR("send SIGTERM to task id[%s] fail", fullTaskId.c_str());
        SetError(WEBAPI_ERR_POLLING_SIGNAL_FAILED);
        return false;
    }
    if (!task->finish(removeRecord)) {
        VELA_LOG_ERR("set task id[%s] to finish fail", fullTaskId.c_str());
        SetError(WEBAPI_ERR_POLLING_FINISH_FAILED);
        return false;
    }
    return true;
}

bool APIPolling::List(const std::string& api, const Json::Value& filter, Json::Value& out)
{
    APIRequest* const req = d_->request_;
    if (req == nullptr) {
        VELA_LOG_ERR("unknown request");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    if (!filter.isNull() && !filter.isObject()) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    // The groups asked for; by default every group the requester may see.
    Json::Value groups = filter.isObject() ? filter.get("group", Json::Value()) : Json::Value();
    const bool explicitGroups = !groups.isNull();
    if (groups.isString()) {
        Json::Value one = groups;
        groups = Json::Value(Json::arrayValue);
        groups.append(one);
    } else if (groups.isNull()) {
        groups = Json::Value(Json::arrayValue);
        groups.append("user");
        groups.append("everyone");
        groups.append("admin");
    }
    if (!groups.isArray() || groups.size() > 3) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    std::vector<std::string> owners;
    for (const Json::Value& group : groups) {
        const std::string name = group.isString() ? group.asString() : "";
        if (name == "user") {
            const std::string user = req->GetLoginUserName();
            if (TARN::TaskUtil::isValidOwner(user) && user[0] != '@') {
                owners.push_back(user);
            }
        } else if (name == "everyone") {
            owners.push_back(TARN::TaskUtil::kUsersOwner);
        } else if (name == "admin") {
            if (req->IsAdmin()) {
                owners.push_back(TARN::TaskUtil::kAdminOwner);
            } else if (explicitGroups) {
                VELA_LOG_ERR("No permission");
                SetError(WEBAPI_ERR_POLLING_NO_ADMIN_PERMISSION);
                return false;
            }
        } else {
            VELA_LOG_ERR("bad parameters");
            SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
            return false;
        }
    }
    const Json::Value method = filter.isObject() ? filter.get("method", Json::Value()) : Json::Value();
    const Json::Value finish = filter.isObject() ? filter.get("finish", Json::Value()) : Json::Value();
    if ((!method.isNull() && !method.isString()) || (!finish.isNull() && !finish.isBool())) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }

    TaskAccess access;
    const TaskSettings settings = LoadTaskSettings();
    std::vector<std::pair<long long, Json::Value>> found;
    for (const std::string& owner : owners) {
        Housekeep(owner, settings);
        for (const std::string& id : TARN::TaskMgr::getAllTaskId(owner)) {
            TARN::Task task(owner, id);
            if (!task.reload()) {
                continue;
            }
            const Json::Value info = task.getProperty("info");
            if ((!api.empty() && info["api"] != api) || (!method.isNull() && info["method"] != method)) {
                continue;
            }
            ReapLostWorker(task);
            if (!finish.isNull() && task.isFinished() != finish.asBool()) {
                continue;
            }
            Json::Value entry(Json::objectValue);
            entry["task_id"] = owner + "/" + id;
            entry["finish"] = task.isFinished();
            entry["created"] = static_cast<Json::Int64>(task.getCreated());
            entry["info"] = info;
            if (task.hasProperty("progress")) {
                entry["progress"] = task.getProperty("progress");
            }
            found.emplace_back(task.getCreated(), entry);
        }
    }
    std::stable_sort(found.begin(), found.end(),
                     [](const auto& a, const auto& b) { return a.first > b.first; });
    out = Json::Value(Json::objectValue);
    out["tasks"] = Json::Value(Json::arrayValue);
    for (auto& entry : found) {
        out["tasks"].append(entry.second);
    }
    out["total"] = static_cast<Json::UInt>(found.size());
    return true;
}

bool APIPolling::SetProgress(int percent, const std::string& description)
{
    APIRequest* const req = d_->request_;
    if (req == nullptr || !req->IsPollingTask()) {
        VELA_LOG_ERR("bad parameters");
        SetError(WEBAPI_ERR_POLLING_BAD_PARAMETER);
        return false;
    }
    TaskAccess access;
    TARN::Task task(req->GetEnv("task_user").asString(), req->GetEnv("task_id").asString());
    if (!task.beginUpdate()) {
        return false;
    }
    Json::Value progress(Json::objectValue);
    progress["percent"] = std::max(0, std::min(100, percent));
    progress["description"] = CutText(description, kMaxDescription);
    progress["updated"] = static_cast<Json::Int64>(time(nullptr));
    task.setProperty("progress", progress);
    // Progress is a first report too: the request that started the task
    // does not have to wait for a result.
    task.setProperty("task_run", true);
    return task.endUpdate();
}

}  // namespace VELA
