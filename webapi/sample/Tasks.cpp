// Background-task methods of the sample library.
//
// "checksum" starts a task that walks a folder of the first data volume and
// answers the cksum of every regular file in it, reporting its progress as
// it goes. It runs as the login user ("grantByUser"), so it reads only what
// that user may read; symbolic links are never followed. SIGTERM (a stop)
// ends the walk between two blocks: the task then answers "stopped" and
// leaves nothing behind. "taskstatus", "taskstop" and "tasklist" query,
// stop and list the tasks of this API.
#include "Tasks.h"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "Cksum.h"
#include "vela/sysfile.h"
#include "webapi/APIError.h"
#include "webapi/APIParameter.h"
#include "webapi/APIPolling.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

namespace Sample {

namespace {

using VELA::APIPolling;
using VELA::APIRequest;
using VELA::APIResponse;

constexpr int kSampleFailure = 1001;
constexpr size_t kMaxPath = 1024;
constexpr size_t kMaxComponent = 128;
constexpr size_t kMaxFiles = 100000;
constexpr size_t kMaxDepth = 32;
constexpr size_t kMaxListed = 1000;
constexpr int kMaxPaceMs = 1000;

volatile sig_atomic_t g_stop = 0;

void OnTerm(int) { g_stop = 1; }

// "a/b/c" under the volume: components of letters, digits, ".", "_", "-",
// none starting with "." (so no "..", no hidden file); "" is the volume.
bool IsFolderPath(const std::string& path)
{
    if (path.size() > kMaxPath) {
        return false;
    }
    size_t start = 0;
    while (start < path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) {
            end = path.size();
        }
        const std::string part = path.substr(start, end - start);
        if (part.empty() || part.size() > kMaxComponent || part[0] == '.') {
            return false;
        }
        for (char c : part) {
            if (!((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
                  c == '_' || c == '-')) {
                return false;
            }
        }
        start = end + 1;
    }
    return true;
}

struct Job {
    std::string root;  // the folder, resolved
    int paceMs = 0;
};

struct Entry {
    std::string path;  // relative to the folder
    unsigned long long size;
};

// Regular files under the open directory `dir` (depth first, names sorted
// by the directory's order), never through a symbolic link.
void Collect(int dir, const std::string& prefix, size_t depth, std::vector<Entry>& out, unsigned long long& total)
{
    DIR* d = fdopendir(dir);
    if (d == nullptr) {
        close(dir);
        return;
    }
    for (struct dirent* e; !g_stop && out.size() < kMaxFiles && (e = readdir(d)) != nullptr;) {
        const std::string name = e->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        struct stat st;
        if (fstatat(dirfd(d), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
            continue;
        }
        if (S_ISREG(st.st_mode)) {
            out.push_back({prefix + name, static_cast<unsigned long long>(st.st_size)});
            total += static_cast<unsigned long long>(st.st_size);
        } else if (S_ISDIR(st.st_mode) && depth < kMaxDepth) {
            const int sub = openat(dirfd(d), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            if (sub >= 0) {
                Collect(sub, prefix + name + "/", depth + 1, out, total);
            }
        }
    }
    closedir(d);
}

double Seconds()
{
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// The worker: counts, then checksums, reporting at most five times a second.
void ChecksumWork(APIRequest* req, APIResponse* resp, void* data)
{
    const Job* job = static_cast<const Job*>(data);
    struct sigaction term;
    memset(&term, 0, sizeof(term));
    term.sa_handler = OnTerm;
    sigaction(SIGTERM, &term, nullptr);

    APIPolling polling(req);
    polling.SetProgress(0, "counting files");
    std::vector<Entry> files;
    unsigned long long total = 0;
    const int top = open(job->root.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (top < 0) {
        Json::Value errors(Json::objectValue);
        errors["reason"] = std::string("cannot open the folder: ") + strerror(errno);
        resp->SetError(kSampleFailure, errors);
        return;
    }
    Collect(top, "", 0, files, total);

    Json::Value listed(Json::arrayValue);
    unsigned long long done = 0;
    double lastReport = 0;
    PosixCksum all;
    for (size_t i = 0; i < files.size() && !g_stop; ++i) {
        const std::string path = job->root + "/" + files[i].path;
        const int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK);
        PosixCksum sum;
        bool readable = fd >= 0;
        unsigned char buf[65536];
        while (readable && !g_stop) {
            const ssize_t n = read(fd, buf, sizeof(buf));
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n <= 0) {
                readable = n == 0;
                break;
            }
            sum.Add(buf, static_cast<size_t>(n));
            all.Add(buf, static_cast<size_t>(n));
            done += static_cast<unsigned long long>(n);
            if (job->paceMs > 0) {
                usleep(static_cast<useconds_t>(job->paceMs) * 1000);
            }
            if (Seconds() - lastReport >= 0.2) {
                lastReport = Seconds();
                const int percent = total > 0 ? static_cast<int>(done * 100 / total) : 0;
                polling.SetProgress(percent, "file " + std::to_string(i + 1) + " of " + std::to_string(files.size()));
            }
        }
        if (fd >= 0) {
            close(fd);
        }
        if (listed.size() < kMaxListed) {
            Json::Value file(Json::objectValue);
            file["path"] = files[i].path;
            file["size"] = static_cast<Json::UInt64>(sum.Length());
            if (readable) {
                file["cksum"] = static_cast<Json::UInt>(sum.Finish());
            } else {
                file["error"] = "unreadable";
            }
            listed.append(file);
        }
    }
    if (g_stop) {
        Json::Value errors(Json::objectValue);
        errors["reason"] = "stopped";
        errors["bytes_done"] = static_cast<Json::UInt64>(done);
        resp->SetError(kSampleFailure, errors);
        return;
    }
    polling.SetProgress(100, "done");
    Json::Value result(Json::objectValue);
    result["files"] = static_cast<Json::UInt64>(files.size());
    result["bytes"] = static_cast<Json::UInt64>(done);
    result["cksum"] = static_cast<Json::UInt>(all.Finish());
    result["list"] = listed;
    resp->SetSuccess(result);
}

// A parameter given as JSON or as form text: true/false, or a number in
// [0, max]. -1 when it is neither.
int Flag(APIRequest* req, const char* name)
{
    const Json::Value v = req->GetParam(name);
    if (v.isNull()) {
        return 0;
    }
    if (v.isBool() || v == "true" || v == "false") {
        return (v.isBool() ? v.asBool() : v == "true") ? 1 : 0;
    }
    return -1;
}

int Number(APIRequest* req, const char* name, int max)
{
    const Json::Value v = req->GetParam(name);
    if (v.isNull()) {
        return 0;
    }
    if (v.isIntegral()) {
        return v.asLargestInt() >= 0 && v.asLargestInt() <= max ? static_cast<int>(v.asLargestInt()) : -1;
    }
    const std::string text = v.isString() ? v.asString() : "";
    if (text.empty() || text.size() > 9 || text.find_first_not_of("0123456789") != std::string::npos) {
        return -1;
    }
    const int n = std::stoi(text);
    return n <= max ? n : -1;
}

void AnswerPollingError(APIResponse* resp, const APIPolling& polling)
{
    resp->SetError(polling.GetError() != 0 ? polling.GetError() : WEBAPI_ERR_NO_RESPONSE);
}

}  // namespace

void Checksum(APIRequest* req, APIResponse* resp)
{
    VELA::APIParameter<std::string> path = req->GetAndCheckString("path", APIRequest::OPTIONAL, IsFolderPath);
    VELA::APIParameter<std::string> share = req->GetAndCheckString("share", APIRequest::OPTIONAL);
    const int autoRemove = Flag(req, "auto_remove");
    const int pace = Number(req, "pace_ms", kMaxPaceMs);
    if (path.IsInvalid() || share.IsInvalid() || autoRemove < 0 || pace < 0) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
        return;
    }
    VOLUME_INFO volume;
    if (VolumeAvailGet(0, &volume, 0, 0) != 1) {
        Json::Value errors(Json::objectValue);
        errors["reason"] = "no data volume";
        resp->SetError(kSampleFailure, errors);
        return;
    }
    // The job lives in this process's memory, which the worker gets a copy of.
    static Job job;
    job.root = volume.szMountPath;
    if (path.IsSet() && !path.Get().empty()) {
        job.root += "/" + path.Get();
    }
    job.paceMs = pace;

    APIPolling polling(req);
    polling.SetPrefixAttr("cksum-");
    if ((share.IsSet() && !polling.SetGroupAttr(share.Get())) ||
        !polling.SetRemoveAttr(autoRemove == 1)) {
        AnswerPollingError(resp, polling);
        return;
    }
    polling.Start(resp, ChecksumWork, &job);
}

void TaskStatus(APIRequest* req, APIResponse* resp)
{
    const Json::Value ids = req->GetParam("task_id");
    APIPolling polling(req);
    Json::Value out;
    const bool ok = ids.isArray() ? polling.Status(ids, out) : polling.Status(ids.isString() ? ids.asString() : "", out);
    if (!ok && !ids.isArray()) {
        AnswerPollingError(resp, polling);
        return;
    }
    resp->SetSuccess(out);
}

void TaskStop(APIRequest* req, APIResponse* resp)
{
    VELA::APIParameter<std::string> id = req->GetAndCheckString("task_id", APIRequest::REQUIRED);
    const int remove = Flag(req, "remove");
    if (id.IsInvalid() || remove < 0) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
        return;
    }
    APIPolling polling(req);
    if (!polling.Stop(id.Get(), remove == 1)) {
        AnswerPollingError(resp, polling);
        return;
    }
    resp->SetSuccess();
}

void TaskList(APIRequest* req, APIResponse* resp)
{
    const int finish = Flag(req, "finish");
    if (finish < 0) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST);
        return;
    }
    Json::Value filter(Json::objectValue);
    if (req->HasParam("group")) {
        filter["group"] = req->GetParam("group");
    }
    if (req->HasParam("finish")) {
        filter["finish"] = finish == 1;
    }
    APIPolling polling(req);
    Json::Value out;
    if (!polling.List(req->GetAPIClass(), filter, out)) {
        AnswerPollingError(resp, polling);
        return;
    }
    resp->SetSuccess(out);
}

}  // namespace Sample
