// A warm parent of velafcgi: accepts requests, reads their parameters and
// forks one child per request; reaps its children and answers for a child
// that died before answering; warms up the libraries its children opened;
// builds its runner anew when a description or a library changes.
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <poll.h>
#include <set>
#include <string>
#include <iostream>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "vela/log.h"
#include "vela/webapiutil.h"
#include "webentry/Fcgi.h"
#include "webentry/Serve.h"
#include "webentry/WebEntry.h"

namespace VELA {
namespace Fcgi {

namespace {

volatile sig_atomic_t g_stop = 0;

void OnStop(int) { g_stop = 1; }
void OnWake(int) {}

// FastCGI record types and the header of a record.
constexpr unsigned char kStdout = 6;
constexpr unsigned char kEndRequest = 3;

void Header(unsigned char* h, unsigned char type, int requestId, size_t length)
{
    h[0] = 1;  // version
    h[1] = type;
    h[2] = static_cast<unsigned char>((requestId >> 8) & 0xff);
    h[3] = static_cast<unsigned char>(requestId & 0xff);
    h[4] = static_cast<unsigned char>((length >> 8) & 0xff);
    h[5] = static_cast<unsigned char>(length & 0xff);
    h[6] = 0;  // padding
    h[7] = 0;
}

// What one child is doing.
struct Child {
    pid_t pid = -1;
    int fd = -1;         // the request's connection, kept to answer for a child that dies
    int requestId = 0;
    int slot = -1;
};

// The files whose change makes the runner be built anew: lib.def, the
// description files and the libraries warmed up, by name, inode, size and
// modification time.
std::string Signature(const std::vector<std::string>& libs)
{
    std::string sig;
    auto add = [&sig](const std::string& name) {
        struct stat st {};
        if (stat(name.c_str(), &st) != 0) {
            sig += name + ":-;";
            return;
        }
        sig += name + ":" + std::to_string(st.st_ino) + "," + std::to_string(st.st_size) + "," +
               std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec) + ";";
    };
    std::vector<std::string> names;
    if (DIR* dir = opendir(".")) {
        while (const dirent* e = readdir(dir)) {
            const std::string name = e->d_name;
            if (name == "lib.def" || (name.size() > 4 && name.compare(name.size() - 4, 4, ".lib") == 0)) {
                names.push_back(name);
            }
        }
        closedir(dir);
    }
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) {
        add(name);
    }
    for (const std::string& lib : libs) {
        add(lib);
    }
    return sig;
}

class Parent {
public:
    Parent(int listenFd, const Options& options, int argc, char** argv)
        : listenFd_(listenFd), options_(options), argc_(argc), argv_(argv)
    {
    }

    int Run();

private:
    void Rebuild();
    void RefreshIfChanged();
    void Reap(bool wait);
    void Ended(Child& child, int status);
    void Accept();
    int FreeSlot() const;
    bool InProcess(FCGX_Request& req) const;
    void ServeHere(FCGX_Request& req);
    void KeepOwnEnvironment();

    int listenFd_;
    const Options& options_;
    int argc_;
    char** argv_;
    int cap_ = 1;
    SlotArea slots_;
    std::vector<Child> children_;
    std::unique_ptr<WebEntry> entry_;
    std::set<std::string> warmApis_;
    std::vector<std::string> warmLibs_;
    std::string signature_;
    time_t checked_ = 0;
};

void Parent::Rebuild()
{
    entry_.reset();
    entry_.reset(new WebEntry());
    warmLibs_.clear();
    for (const std::string& api : warmApis_) {
        std::string lib;
        if (entry_->WarmUp(api, &lib)) {
            warmLibs_.push_back(lib);
        }
    }
    signature_ = Signature(warmLibs_);
}

void Parent::RefreshIfChanged()
{
    const time_t now = time(nullptr);
    if (now == checked_) {
        return;  // at most once a second
    }
    checked_ = now;
    if (Signature(warmLibs_) != signature_) {
        VELA_LOG(LOG_INFO, "the web-API descriptions or libraries changed: loading them anew");
        Rebuild();
    }
}

int Parent::FreeSlot() const
{
    for (int i = 0; i < cap_; ++i) {
        if (std::none_of(children_.begin(), children_.end(), [i](const Child& c) { return c.slot == i; })) {
            return i;
        }
    }
    return -1;
}

void Parent::Ended(Child& child, int status)
{
    Slot& slot = slots_.At(child.slot);
    const int state = slot.state.load();
    if (state != kReplyEnded) {
        const std::string how = WIFSIGNALED(status) ? "was killed by signal " + std::to_string(WTERMSIG(status))
                                                    : "ended with status " + std::to_string(WEXITSTATUS(status));
        if (state == kNothingSent) {
            VELA_LOG_ERR("request child %d %s before answering: answered with error 117", static_cast<int>(child.pid),
                         how.c_str());
            WriteWholeReply(child.fd, child.requestId, kSetupFailedReply, kSetupFailedReplyLength);
        } else {
            VELA_LOG_ERR("request child %d %s in the middle of its reply", static_cast<int>(child.pid), how.c_str());
        }
    }
    char api[sizeof(slot.api)];
    memcpy(api, slot.api, sizeof(api));
    api[sizeof(api) - 1] = '\0';
    close(child.fd);
    child.fd = -1;
    if (api[0] != '\0' && warmApis_.count(api) == 0 && warmApis_.size() < 256) {
        // The child's word is only a name: the description and the library
        // are this process's own, found as any request finds them.
        std::string lib;
        warmApis_.insert(api);
        if (entry_->WarmUp(api, &lib)) {
            warmLibs_.push_back(lib);
            signature_ = Signature(warmLibs_);
        }
    }
}

void Parent::Reap(bool wait)
{
    for (;;) {
        int status = 0;
        const pid_t pid = waitpid(-1, &status, wait ? 0 : WNOHANG);
        if (pid < 0 && errno == EINTR) {
            continue;
        }
        if (pid <= 0) {
            return;
        }
        auto it = std::find_if(children_.begin(), children_.end(), [pid](const Child& c) { return c.pid == pid; });
        if (it != children_.end()) {
            Ended(*it, status);
            children_.erase(it);
        }
        if (wait && children_.empty()) {
            return;
        }
    }
}

// The parent's environment is only the server's own variables, the same
// every request starts from.
void Parent::KeepOwnEnvironment()
{
    clearenv();
    for (const std::string& kept : options_.environment) {
        putenv(const_cast<char*>(kept.c_str()));
    }
}

// Whether the request names, in its query string, a method this process may
// serve itself: a GET without a body, of an API already warm, not relayed to
// a peer (a relay waits on the network and loads libcurl: a child's work).
bool Parent::InProcess(FCGX_Request& req) const
{
    const char* method = FCGX_GetParam("REQUEST_METHOD", req.envp);
    const char* length = FCGX_GetParam("CONTENT_LENGTH", req.envp);
    const char* query = FCGX_GetParam("QUERY_STRING", req.envp);
    if (geteuid() != 0 || method == nullptr || strcmp(method, "GET") != 0 || query == nullptr ||
        strlen(query) > 8192 || (length != nullptr && length[0] != '\0' && strcmp(length, "0") != 0)) {
        return false;
    }
    try {
        Json::Value params(Json::objectValue);
        if (!WebAPIUtil::strPairToJsonObj(query, params, true, true) || params.isMember("relay_ds")) {
            return false;
        }
        const Json::Value& api = params["api"];
        const Json::Value& version = params["version"];
        const Json::Value& name = params["method"];
        if (!api.isString() || !version.isString() || !name.isString() || warmApis_.count(api.asString()) == 0) {
            return false;
        }
        const std::string v = version.asString();
        if (v.empty() || v.size() > 6 || v.find_first_not_of("0123456789") != std::string::npos) {
            return false;
        }
        return entry_->ServesInProcess(api.asString(), std::stoi(v), name.asString());
    } catch (const std::exception&) {
        return false;
    }
}

// Serves a request in this process: its environment, standard input from
// /dev/null, the reply gathered in memory, then everything put back (the
// environment, the standard streams, the signal actions the call changed).
// The process's road restores identity, priority and working directory on
// its own; the per-client slots and the time limits of a child do not apply.
void Parent::ServeHere(FCGX_Request& req)
{
    // The signals whose actions the road sets (the upload clean-up, the
    // request limits) or this process relies on.
    static const int kKept[] = {SIGTERM, SIGINT, SIGHUP, SIGPIPE, SIGALRM, SIGXCPU, SIGCHLD, SIGUSR1};
    struct sigaction saved[sizeof(kKept) / sizeof(kKept[0])];
    for (size_t i = 0; i < sizeof(kKept) / sizeof(kKept[0]); ++i) {
        sigaction(kKept[i], nullptr, &saved[i]);
    }
    const int reply = memfd_create("velafcgi-reply", MFD_CLOEXEC);
    const int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
    const int savedIn = fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 3);
    const int savedOut = fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 3);
    if (reply < 0 || null < 0 || savedIn < 0 || savedOut < 0 || !SetRequestEnvironment(req.envp, options_)) {
        VELA_LOG_ERR("cannot serve a request in process[%m]");
        WriteWholeReply(req.ipcFd, req.requestId, kSetupFailedReply, kSetupFailedReplyLength);
    } else {
        dup2(null, STDIN_FILENO);
        dup2(reply, STDOUT_FILENO);
        {
            WebEntry serving;
            serving.SwapWarmState(*entry_);
            try {
                serving.Run(Json::Value());
            } catch (...) {
                VELA_LOG_ERR("request aborted");
            }
            fflush(stdout);
            std::cout.flush();
            serving.SwapWarmState(*entry_);
        }
        dup2(savedIn, STDIN_FILENO);
        dup2(savedOut, STDOUT_FILENO);
        static char buffer[64 * 1024];
        lseek(reply, 0, SEEK_SET);
        ssize_t n;
        bool sent = true;
        while (sent && (n = read(reply, buffer, sizeof(buffer))) > 0) {
            sent = WriteStdout(req.ipcFd, req.requestId, buffer, static_cast<size_t>(n));
        }
        if (sent) {
            WriteEndRequest(req.ipcFd, req.requestId);
        }
    }
    KeepOwnEnvironment();
    for (size_t i = 0; i < sizeof(kKept) / sizeof(kKept[0]); ++i) {
        sigaction(kKept[i], &saved[i], nullptr);
    }
    for (int fd : {reply, null, savedIn, savedOut}) {
        if (fd >= 0) {
            close(fd);
        }
    }
    close(req.ipcFd);
    req.ipcFd = -1;
    FCGX_Free(&req, 0);
}

void Parent::Accept()
{
    FCGX_Request req;
    if (FCGX_InitRequest(&req, listenFd_, FCGI_FAIL_ACCEPT_ON_INTR) != 0) {
        return;
    }
    // The parameters must arrive in time; the alarm interrupts the read.
    alarm(static_cast<unsigned>(options_.paramSeconds));
    const int rc = FCGX_Accept_r(&req);
    alarm(0);
    if (rc < 0) {
        if (req.ipcFd >= 0) {
            close(req.ipcFd);
            req.ipcFd = -1;
        }
        FCGX_Free(&req, 0);
        return;
    }
    if (InProcess(req)) {
        ServeHere(req);
        return;
    }
    const int slot = FreeSlot();
    if (slot < 0) {
        VELA_LOG_ERR("refused: %d requests under way in this process", cap_);
        WriteWholeReply(req.ipcFd, req.requestId, kBusyReply, kBusyReplyLength);
        close(req.ipcFd);
        req.ipcFd = -1;
        FCGX_Free(&req, 0);
        return;
    }
    slots_.At(slot).state.store(kNothingSent);
    slots_.At(slot).api[0] = '\0';
    std::vector<int> closeFds{listenFd_};
    for (const Child& c : children_) {
        closeFds.push_back(c.fd);
    }
    const pid_t pid = fork();
    if (pid == 0) {
        ServeChild(req, *entry_, slots_, slot, options_, closeFds, argc_, argv_);
    }
    if (pid < 0) {
        VELA_LOG_ERR("cannot fork the request's child[%m]");
        WriteWholeReply(req.ipcFd, req.requestId, kSetupFailedReply, kSetupFailedReplyLength);
        close(req.ipcFd);
    } else {
        Child child;
        child.pid = pid;
        child.fd = req.ipcFd;
        child.requestId = req.requestId;
        child.slot = slot;
        children_.push_back(child);
    }
    req.ipcFd = -1;
    FCGX_Free(&req, 0);
}

int Parent::Run()
{
    cap_ = std::max(1, options_.maxChildren);
    const long pageSize = sysconf(_SC_PAGESIZE);
    slots_.page = pageSize > static_cast<long>(sizeof(Slot)) ? static_cast<size_t>(pageSize) : 4096;
    slots_.count = cap_;
    void* area = mmap(nullptr, slots_.page * static_cast<size_t>(cap_), PROT_READ | PROT_WRITE,
                      MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (area == MAP_FAILED) {
        VELA_LOG_ERR("cannot map the children's slots[%m]");
        return 1;
    }
    slots_.base = static_cast<char*>(area);
    for (int i = 0; i < cap_; ++i) {
        new (&slots_.At(i)) Slot();
    }
    children_.reserve(static_cast<size_t>(cap_));

    // Stop and child signals only while waiting for work, so that no
    // signal falls between a check and the wait; the alarm interrupts the
    // reading of a request's parameters.
    sigset_t blocked, waiting;
    CatchStopAndChildren(OnStop, OnWake, blocked, waiting);
    struct sigaction alarmAction {};
    sigemptyset(&alarmAction.sa_mask);
    alarmAction.sa_handler = OnWake;
    sigaction(SIGALRM, &alarmAction, nullptr);

    KeepOwnEnvironment();
    Rebuild();
    while (!g_stop) {
        Reap(false);
        RefreshIfChanged();
        // A full parent leaves new requests to the others for a moment;
        // when they are full too, it takes the request to refuse it.
        const bool full = children_.size() >= static_cast<size_t>(cap_);
        pollfd fd{listenFd_, POLLIN, 0};
        timespec wait{1, 0};
        if (full) {
            wait = {0, 50 * 1000 * 1000};
        }
        const int n = ppoll(full ? nullptr : &fd, full ? 0 : 1, &wait, &waiting);
        if (full) {
            if (n == 0) {
                pollfd again{listenFd_, POLLIN, 0};
                if (poll(&again, 1, 0) == 1 && (again.revents & POLLIN) != 0) {
                    Accept();
                }
            }
            continue;
        }
        if (n == 1 && (fd.revents & POLLIN) != 0) {
            Accept();
        }
    }
    // Stop: no new request; every child under way finishes.
    close(listenFd_);
    sigprocmask(SIG_UNBLOCK, &blocked, nullptr);
    if (!children_.empty()) {
        Reap(true);
    }
    entry_.reset();
    return 0;
}

}  // namespace

bool WriteFully(int fd, const void* data, size_t left)
{
    const char* p = static_cast<const char*>(data);
    while (left > 0) {
        const ssize_t n = write(fd, p, left);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        p += n;
        left -= static_cast<size_t>(n);
    }
    return true;
}

void CatchStopAndChildren(void (*onStop)(int), void (*onChild)(int), sigset_t& blocked, sigset_t& waiting)
{
    struct sigaction sa {};
    sigemptyset(&sa.sa_mask);
    sa.sa_handler = onStop;
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGINT, &sa, nullptr);
    sa.sa_handler = onChild;
    sigaction(SIGCHLD, &sa, nullptr);
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGTERM);
    sigaddset(&blocked, SIGINT);
    sigaddset(&blocked, SIGCHLD);
    sigprocmask(SIG_BLOCK, &blocked, &waiting);
    sigdelset(&waiting, SIGTERM);
    sigdelset(&waiting, SIGINT);
    sigdelset(&waiting, SIGCHLD);
}

bool WriteStdout(int fd, int requestId, const char* data, size_t length)
{
    unsigned char h[8];
    while (length > 0) {
        const size_t part = std::min<size_t>(length, 65535);
        Header(h, kStdout, requestId, part);
        iovec iov[2] = {{h, sizeof(h)}, {const_cast<char*>(data), part}};
        int at = 0;
        while (at < 2) {
            const ssize_t n = writev(fd, iov + at, 2 - at);
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n <= 0) {
                return false;
            }
            size_t done = static_cast<size_t>(n);
            while (at < 2 && done >= iov[at].iov_len) {
                done -= iov[at].iov_len;
                ++at;
            }
            if (at < 2) {
                iov[at].iov_base = static_cast<char*>(iov[at].iov_base) + done;
                iov[at].iov_len -= done;
            }
        }
        data += part;
        length -= part;
    }
    return true;
}

bool WriteEndRequest(int fd, int requestId)
{
    unsigned char end[24];
    Header(end, kStdout, requestId, 0);
    Header(end + 8, kEndRequest, requestId, 8);
    memset(end + 16, 0, 8);
    return WriteFully(fd, end, sizeof(end));
}

bool WriteWholeReply(int fd, int requestId, const char* text, size_t length)
{
    const timeval timeout{3, 0};
    setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof(timeout));
    return WriteStdout(fd, requestId, text, length) && WriteEndRequest(fd, requestId);
}

int RunParent(int listenFd, const Options& options, int argc, char** argv)
{
    Parent parent(listenFd, options, argc, argv);
    return parent.Run();
}

}  // namespace Fcgi
}  // namespace VELA
