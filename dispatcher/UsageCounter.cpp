// Usage counter: calls per API, version and method, in JSON files under
// /var/spool/webapi, when the owner agreed to usage data collection
// (enable_data_collect="yes" in /etc/velainfo.conf). A failure never fails
// the call: the count is skipped, and every count lost is logged.
//
// File <dir>/<stem>.json, where <stem> is the API name cut before its fourth
// dot; one member per call kind:
//   {"VELA.Core.Share.List_1_get": {"count": 12, "ctime": 1700000000}}
// The read-modify-write is serialised by an flock on <file>.lock.
#include "dispatcher/UsageCounter.h"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <mutex>
#include <string>
#include <unistd.h>

#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "platform/system/FileUtil.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace VELA {

namespace {

const char kInfoFile[] = "/etc/velainfo.conf";
const char kCounterDir[] = "/var/spool/webapi";
// Only the server's own account uses the directory, and a directory it
// cannot search is one it cannot create files in.
const mode_t kCounterDirMode = 0700;
const int kLockWaitSeconds = 2;
const size_t kMaxStem = 200;

// Why a count was lost: what failed on `path`, with the error of that call.
std::string Failed(const char* what, const std::string& path)
{
    const int err = errno;
    return std::string(what) + " " + path + " [" + strerror(err) + "]";
}

// Replaces `file` with `value`: a temporary file in the same directory,
// renamed over it, so a reader or a crash never sees a cut file. No fsync:
// the counts are statistics, and the lock is held while this runs.
bool WriteCounters(const std::string& file, const Json::Value& value)
{
    const std::string text = JsonToString(value) + "\n";
    const size_t slash = file.rfind('/');
    std::string tmp = file.substr(0, slash + 1) + "." + file.substr(slash + 1) + ".XXXXXX";
    System::ScopedFd fd(mkostemp(&tmp[0], O_CLOEXEC));
    if (fd.Get() < 0) {
        return false;
    }
    const bool ok = System::WriteAll(fd.Get(), text.data(), text.size()) && close(fd.Release()) == 0 &&
                    rename(tmp.c_str(), file.c_str()) == 0;
    if (!ok) {
        const int err = errno;
        unlink(tmp.c_str());
        errno = err;
    }
    return ok;
}

// Per-process answers, taken on first use.
struct CounterState {
    std::mutex lock;
    int enabled = -1;  // -1 not read yet
    bool dirReady = false;
};

CounterState& State()
{
    static CounterState state;
    return state;
}

bool CollectEnabled()
{
    CounterState& state = State();
    std::lock_guard<std::mutex> guard(state.lock);
    if (state.enabled < 0) {
        const std::string path = VELA::System::Path(kInfoFile);
        state.enabled = VLIBCFileCheckKeyValue(path.c_str(), "enable_data_collect", "yes", 0) != 0 ? 1 : 0;
    }
    return state.enabled == 1;
}

// Creates the counter directory once per process and touches its marker.
// False, with `why`, when there is no directory.
bool CounterDirReady(const std::string& dir, std::string& why)
{
    CounterState& state = State();
    std::lock_guard<std::mutex> guard(state.lock);
    if (state.dirReady) {
        return true;
    }
    if (VELAFSMkdirP(dir.c_str(), 0, 0, static_cast<uid_t>(-1), static_cast<gid_t>(-1), kCounterDirMode) != 0) {
        why = Failed("cannot create", dir);
        return false;
    }
    VLIBCFileTouch((dir + "/.timestamp").c_str());
    state.dirReady = true;
    return true;
}

// The API name up to its fourth dot. Empty when the result cannot name a
// file of the counter directory (the name comes from the client).
std::string FileStem(const std::string& api)
{
    size_t cut = std::string::npos;
    size_t from = 0;
    for (int dots = 0; dots < 4; ++dots) {
        cut = api.find('.', from);
        if (cut == std::string::npos) {
            break;
        }
        from = cut + 1;
    }
    const std::string stem = api.substr(0, cut);
    if (stem == "." || stem == ".." || !System::IsCheckedName(stem, System::kNameDotted, kMaxStem)) {
        return "";
    }
    return stem;
}

// Counts one call; false, with `why`, when the count is lost.
bool Count(const std::string& dir, const std::string& api, const std::string& method, int version,
           std::string& why)
{
    const std::string stem = FileStem(api);
    if (stem.empty()) {
        why = "the API name cannot name a counter file";
        return false;
    }
    const std::string file = dir + "/" + stem + ".json";
    const std::string lockFile = file + ".lock";
    int handle = -1;
    if (VLIBCFileLockTimeByFile(lockFile.c_str(), 1, kLockWaitSeconds, &handle) != 0) {
        why = Failed("cannot lock", lockFile);
        return false;
    }
    bool written = false;
    try {
        Json::Value counters;
        if (!JsonReadFile(file, counters) || !counters.isObject()) {
            counters = Json::Value(Json::objectValue);
        }
        const std::string member = api + "_" + std::to_string(version) + "_" + method;
        Json::Value* entry = counters.isMember(member) ? &counters[member] : nullptr;
        if (entry == nullptr || !entry->isObject() || !(*entry)["count"].isIntegral()) {
            Json::Value fresh(Json::objectValue);
            fresh["count"] = 1;
            fresh["ctime"] = static_cast<Json::Int64>(time(nullptr));
            counters[member] = fresh;
        } else {
            Json::Value& count = (*entry)["count"];
            if (count.isInt64() && count.asInt64() < INT64_MAX) {
                count = static_cast<Json::Int64>(count.asInt64() + 1);
            }
        }
        written = WriteCounters(file, counters);
        if (!written) {
            why = Failed("cannot write", file);
        }
    } catch (...) {
        why = "out of memory";  // a count is never worth failing the call
    }
    VLIBCFileUnlockByFile(handle);
    return written;
}

}  // namespace

void ResetUsageCounterState()
{
    CounterState& state = State();
    std::lock_guard<std::mutex> guard(state.lock);
    state.enabled = -1;
    state.dirReady = false;
}

// Counts one call when usage data collection is on.
static void CountCall(const std::string& api, int version, const std::string& method)
{
    if (!CollectEnabled()) {
        return;
    }
    try {
        const std::string dir = VELA::System::Path(kCounterDir);
        std::string why;
        if (!CounterDirReady(dir, why) || !Count(dir, api, method, version, why)) {
            VELA_LOG_ERR("usage count of %.200s_%d_%.200s lost: %s", api.c_str(), version, method.c_str(),
                         why.c_str());
        }
    } catch (const std::exception&) {
        VELA_LOG_ERR("usage count lost: out of memory");
    }
}

void APIRunner::IncreaseCounter(APIRequest* req)
{
    if (req == nullptr) {
        return;
    }
    CountCall(req->GetAPIClass(), req->GetAPIVersion(), req->GetAPIMethod());
}

// The road counts what the front end marked for counting ("_collector_count_
// webapi" on the runner's own request), never a method with "allowTimeout"
// nor an API with "count": false.
Step CountUsage(ResolvedCall& call)
{
    const APIRequest* own = call.runner.GetRequest();
    if (own != nullptr && JsonFlag(own->GetAttr("_collector_count_webapi"), false) && !call.Flag("allowTimeout") &&
        call.counted) {
        CountCall(call.api, call.version, call.method);
    }
    return Step::kGoOn;
}

}  // namespace VELA
