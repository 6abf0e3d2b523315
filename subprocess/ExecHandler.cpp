// Running one web-API method on behalf of a user (see ExecHandler.h): the
// request JSON made by hand, the choice between this process and a child,
// and the child's answer and output read back through pipes.
#include "subprocess/ExecHandler.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fcntl.h>
#include <iostream>
#include <poll.h>
#include <string>
#include <sys/syscall.h>
#include <unistd.h>

#include "dispatcher/Refusal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIUtils.h"

namespace VELA {

namespace {

const char kWebAPIDir[] = "/usr/vela/velaman/webapi";
// Detached (never a zombie of the caller, never waited for) with default
// signal handling.
constexpr int kForkFlags = VLIBC_FORK_DETACH | VLIBC_FORK_DEFAULT_SIGNALS;
// The child's output is read in pieces of at most this many bytes minus one.
constexpr int kChunk = 4096;

void Fail(Json::Value& result, int code)
{
    result = Json::Value(Json::objectValue);
    result["success"] = false;
    result["error"]["code"] = code;
}

bool Given(const char* text)
{
    return text != nullptr && text[0] != '\0';
}

// One environment variable as it was: set or not, and its value.
struct SavedVariable {
    explicit SavedVariable(const char* name) : name(name)
    {
        const char* value = getenv(name);
        isSet = value != nullptr;
        if (isSet) {
            this->value = value;
        }
    }
    void Restore() const
    {
        if (isSet) {
            setenv(name, value.c_str(), 1);
        } else {
            unsetenv(name);
        }
    }
    const char* name;
    bool isSet;
    std::string value;
};

// In a child: `fd` reads (or writes) /dev/null from now on. False when
// /dev/null cannot be opened.
bool ToDevNull(int fd, int flags)
{
    const int null = open("/dev/null", flags | O_CLOEXEC);
    if (null < 0) {
        return false;
    }
    if (null != fd) {
        const bool ok = dup2(null, fd) == fd;
        close(null);
        return ok;
    }
    // /dev/null landed on `fd` itself (it was closed): keep it across exec
    // like any standard stream.
    return fcntl(fd, F_SETFD, 0) == 0;
}

// Writes all of `data` to `fd`, waiting while a non-blocking descriptor is
// full. False on any other failure (a reader that went away included).
bool WriteAll(int fd, const char* data, size_t len)
{
    while (len > 0) {
        const ssize_t n = write(fd, data, len);
        if (n > 0) {
            data += n;
            len -= static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            struct pollfd p = {fd, POLLOUT, 0};
            if (poll(&p, 1, -1) < 0 && errno != EINTR) {
                return false;
            }
            continue;
        }
        return false;
    }
    return true;
}

// The detached child of a call. It is not this process's child, so waitpid
// cannot say when it ends; a pidfd can. Its pipes alone cannot either: a
// process the handler forked (without exec) keeps their write ends open
// after the child has died, and a read would wait for that process.
class Worker {
public:
    explicit Worker(pid_t pid) : pidfd_(static_cast<int>(syscall(SYS_pidfd_open, pid, 0))), ended_(false)
    {
        // Gone already (ESRCH). Without pidfds (an old kernel), reads end
        // at end of file only.
        ended_ = pidfd_ < 0 && errno == ESRCH;
    }
    ~Worker()
    {
        if (pidfd_ >= 0) {
            close(pidfd_);
        }
    }
    Worker(const Worker&) = delete;
    Worker& operator=(const Worker&) = delete;

    // Waits until `fd` has something to read (data or end of file), the
    // child has ended, or `doneFd` (when >= 0) is readable, which says the
    // child is done writing to `fd`. In the last two cases all the child
    // wrote to `fd` is in the pipe: `fd` is made non-blocking, so reads
    // take what is there and then stop.
    void Await(int fd, int doneFd = -1)
    {
        bool done = ended_;
        while (!done) {
            struct pollfd p[3] = {{fd, POLLIN, 0}, {pidfd_, POLLIN, 0}, {doneFd, POLLIN, 0}};
            if (poll(p, 3, -1) < 0) {
                if (errno == EINTR) {
                    continue;
                }
                return;
            }
            ended_ = p[1].revents != 0;
            done = ended_ || p[2].revents != 0;
            if (!done) {
                return;
            }
        }
        const int flags = fcntl(fd, F_GETFL);
        if (flags >= 0 && (flags & O_NONBLOCK) == 0) {
            fcntl(fd, F_SETFL, flags | O_NONBLOCK);
        }
    }

private:
    int pidfd_;
    bool ended_;
};

}  // namespace

ExecHandler::ExecHandler(const char* api, int version, const char* method, const Json::Value& params,
                         const Json::Value& attr, const char* user, int outFd)
    : api_(api), version_(version), method_(method), params_(params), attr_(attr), user_(user), runner_(),
      request_(), outFd_(outFd)
{
}

void ExecHandler::Process(Json::Value& result)
{
    char* cwd = getcwd(nullptr, 0);
    if (cwd == nullptr) {
        VELA_LOG_ERR("cannot read the working directory, it will not be put back [%m]");
    }
    try {
        const std::string dir = System::Path(kWebAPIDir);
        if (chdir(dir.c_str()) != 0) {
            // Descriptions would be looked for wherever the caller stands.
            VELA_LOG_ERR("cannot enter the web-API directory %s [%m]", dir.c_str());
            Fail(result, WEBAPI_ERR_NO_RESPONSE);
            free(cwd);
            return;
        }
        if (!CheckParams(result)) {
            // The working directory stays the web-API directory.
            free(cwd);
            return;
        }
        PrepareReq();
        if (outFd_ < 0) {
            // The call's names are all the look-up needs: no copy of params.
            Json::Value names(Json::objectValue);
            for (const char* key : {"api", "method", "version"}) {
                names["postParam"][key] = request_["postParam"][key];
            }
            APIRequest req(names);
            // A method that switches identity for good runs in a child, so
            // that the switch never touches this process.
            const bool inProcess =
                runner_.GetMethodAttr(&req, "grantable") || runner_.GetMethodAttr(&req, "grantByDefault");
            if (inProcess) {
                Run(result, false);
            } else {
                RunFork(result);
            }
        } else {
            RunForkForStdout(result);
        }
    } catch (const std::exception& e) {
        VELA_LOG_ERR("running %s for a user failed: %s", api_ ? LogSafe(api_).c_str() : "(null)", e.what());
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
    } catch (...) {
        VELA_LOG_ERR("running %s for a user failed", api_ ? LogSafe(api_).c_str() : "(null)");
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
    }
    if (cwd != nullptr) {
        if (chdir(cwd) != 0) {
            VELA_LOG_ERR("cannot go back to %s [%m]", LogSafe(cwd).c_str());
        }
        free(cwd);
    }
}

bool ExecHandler::CheckParams(Json::Value& result)
{
    if (!Given(api_) || !Given(method_) || !Given(user_)) {
        Fail(result, WEBAPI_ERR_BAD_REQUEST);
        VELA_LOG_ERR("missing parameter.");
        return false;
    }
    if (!VELAUserNameIsValid(user_)) {
        Fail(result, WEBAPI_ERR_BAD_REQUEST);
        VELA_LOG_ERR("user name refused: \"%s\"", LogSafe(user_).c_str());
        return false;
    }
    if (!params_.isNull() && !params_.isObject()) {
        Fail(result, WEBAPI_ERR_BAD_REQUEST);
        VELA_LOG_ERR("parameters of %s %s are not an object", LogSafe(api_).c_str(), LogSafe(method_).c_str());
        return false;
    }
    return true;
}

void ExecHandler::PrepareReq()
{
    Json::Value request(Json::objectValue);
    Json::Value& session = request["session"];
    session["username"] = user_;
    session["isAdmin"] = VLIBGroupIsAdminGroupMem(user_, 0) == 1;
    session["isTimeout"] = false;
    session["isAuthorized"] = true;
    request["environ"]["REQUEST_METHOD"] = "POST";
    Json::Value& post = request["postParam"];
    post = params_.isObject() ? params_ : Json::Value(Json::objectValue);
    post["api"] = api_;
    post["method"] = method_;
    post["version"] = version_;
    request["attr"] = attr_;
    request_.swap(request);
}

void ExecHandler::Run(Json::Value& result, bool inChild)
{
    // The caller's own values come back afterwards, also when it had none.
    const SavedVariable saved[] = {SavedVariable("USERNAME"), SavedVariable("VELA_WEBAPI_USERNAME")};
    setenv("USERNAME", user_, 1);
    setenv("VELA_WEBAPI_USERNAME", user_, 1);
    runner_.Run(request_);
    result = runner_.GetResponse();
    if (!inChild) {
        for (const SavedVariable& variable : saved) {
            variable.Restore();
        }
    }
}

void ExecHandler::RunFork(Json::Value& result)
{
    Pipe answer;
    if (!answer.Init()) {
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
        VELA_LOG_ERR("pipe failed [%m]");
        return;
    }
    const pid_t pid = VLIBCProcForkEx(kForkFlags);
    if (pid < 0) {
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
        VELA_LOG_ERR("fork failed");
        return;
    }
    if (pid == 0) {
        // The child never writes into the caller's reply, nor reads its input.
        answer.WriteOnly(-1);
        int status = 1;
        try {
            if (ToDevNull(STDIN_FILENO, O_RDONLY) && ToDevNull(STDOUT_FILENO, O_WRONLY)) {
                Run(result, true);
                status = answer.WriteJson(result) ? 0 : 1;
            }
        } catch (...) {
        }
        _exit(status);
    }
    answer.ReadOnly(-1);
    Worker worker(pid);
    worker.Await(answer.ReadFd());
    if (!answer.ReadJson(result)) {
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
        VELA_LOG_ERR("read json failed");
    }
}

void ExecHandler::RunForkForStdout(Json::Value& result)
{
    Pipe answer;
    Pipe output;
    if (!answer.Init() || !output.Init()) {
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
        VELA_LOG_ERR("pipe failed [%m]");
        return;
    }
    const pid_t pid = VLIBCProcForkEx(kForkFlags);
    if (pid < 0) {
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
        VELA_LOG_ERR("fork failed");
        return;
    }
    if (pid == 0) {
        answer.WriteOnly(-1);
        int status = 1;
        try {
            // Standard output is the only write end of the output pipe left.
            const bool ready = output.WriteOnly(STDOUT_FILENO) == STDOUT_FILENO;
            output.Close();
            if (ready && ToDevNull(STDIN_FILENO, O_RDONLY)) {
                Run(result, true);
                // The output ends before the answer is sent: the parent
                // reads the answer only after the end of the output, and an
                // answer larger than a pipe holds would wait for it forever.
                std::cout.flush();
                fflush(stdout);
                if (ToDevNull(STDOUT_FILENO, O_WRONLY)) {
                    status = answer.WriteJson(result) ? 0 : 1;
                }
            }
        } catch (...) {
        }
        _exit(status);
    }
    answer.ReadOnly(-1);
    output.ReadOnly(-1);
    Worker worker(pid);
    char buf[kChunk];
    bool inBody = false;
    bool forwarding = true;
    for (;;) {
        // The child writes its answer only after its output has ended.
        worker.Await(output.ReadFd(), answer.ReadFd());
        const int n = output.Read(buf, kChunk - 1);
        if (n < 1) {
            break;
        }
        buf[n] = '\0';
        const char* from = buf;
        if (!inBody) {
            // The header block ends at the first empty line; a separator
            // split between two reads is not seen, and the body then never
            // starts.
            const char* end = static_cast<const char*>(memmem(buf, static_cast<size_t>(n), "\r\n\r\n", 4));
            if (end == nullptr) {
                continue;
            }
            from = end + 4;
            inBody = true;
        }
        const size_t len = static_cast<size_t>(buf + n - from);
        // A reader that went away gets nothing more, but the child's output
        // is still read to its end, so that the child is never stuck.
        if (forwarding && len > 0 && !WriteAll(outFd_, from, len)) {
            VELA_LOG_ERR("cannot forward the output of %s %s [%m]", LogSafe(api_).c_str(), LogSafe(method_).c_str());
            forwarding = false;
        }
    }
    worker.Await(answer.ReadFd());
    if (!answer.ReadJson(result)) {
        Fail(result, WEBAPI_ERR_NO_RESPONSE);
        VELA_LOG_ERR("read json failed");
    }
}

}  // namespace VELA
