// Usage counter: calls per API, version and method, in JSON files under
// /var/spool/webapi, when the owner agreed to usage data collection
// (enable_data_collect="yes" in /etc/velainfo.conf). Nothing is logged and
// every failure only skips the count.
//
// File <dir>/<stem>.json, where <stem> is the API name cut before its fourth
// dot; one member per call kind:
//   {"VELA.Core.Share.List_1_get": {"count": 12, "ctime": 1700000000}}
// The read-modify-write is serialised by an flock on <file>.lock.
#include "dispatcher/UsageCounter.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fcntl.h>
#include <mutex>
#include <string>
#include <unistd.h>

#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "platform/system/FileUtil.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace VELA {

namespace {

const char kInfoFile[] = "/etc/velainfo.conf";
const char kCounterDir[] = "/var/spool/webapi";
const int kLockWaitSeconds = 2;
const size_t kMaxStem = 200;

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
        unlink(tmp.c_str());
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
bool CounterDirReady(const std::string& dir)
{
    CounterState& state = State();
    std::lock_guard<std::mutex> guard(state.lock);
    if (state.dirReady) {
        return true;
    }
    if (VELAFSMkdirP(dir.c_str(), 0, 0, static_cast<uid_t>(-1), static_cast<gid_t>(-1), 0600) != 0) {
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

void Count(const std::string& dir, const std::string& api, const std::string& method, int version)
{
    const std::string stem = FileStem(api);
    if (stem.empty()) {
        return;
    }
    const std::string file = dir + "/" + stem + ".json";
    const std::string lockFile = file + ".lock";
    int handle = -1;
    if (VLIBCFileLockTimeByFile(lockFile.c_str(), 1, kLockWaitSeconds, &handle) != 0) {
        return;
    }
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
        WriteCounters(file, counters);
    } catch (...) {
        // A count is never worth failing the call.
    }
    VLIBCFileUnlockByFile(handle);
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
    const std::string dir = VELA::System::Path(kCounterDir);
    if (!CounterDirReady(dir)) {
        return;
    }
    Count(dir, api, method, version);
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
