// The child of velafcgi that serves one request. It turns the FastCGI
// request into the CGI setting velascgi runs in: the parameters become the
// environment, the request body arrives on standard input through a pipe, and
// what the call writes on standard output goes back to the web server
// through another pipe. Two threads move the bytes; everything else is the
// very road of velascgi, on the warm parent's runner.
#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <iostream>
#include <poll.h>
#include <sys/ioctl.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include "vela/log.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webentry/Fcgi.h"
#include "webentry/Serve.h"
#include "webentry/WebEntry.h"

namespace VELA {
namespace Fcgi {

namespace {

// Bounds on what the web server may hand over as parameters.
constexpr size_t kMaxParams = 1000;
constexpr size_t kMaxParamBytes = 1 << 20;
constexpr size_t kChunk = 256 * 1024;
// Room in the pipe of standard output; the default, 64 KiB, makes a
// download take twice the switches between the call and the thread.
constexpr int kPipeBytes = 1 << 20;

// The names a request's parameters never set: the server's own environment
// (VELA_ROOT and the like), the dynamic loader's, and the proxy variable a
// client's "Proxy" header would become.
bool Protected(const char* entry, size_t nameLen)
{
    auto is = [&](const char* name) { return nameLen == strlen(name) && memcmp(entry, name, nameLen) == 0; };
    auto starts = [&](const char* prefix) { return nameLen >= strlen(prefix) && memcmp(entry, prefix, strlen(prefix)) == 0; };
    return starts("VELA_") || starts("LD_") || is("PATH") || is("HTTP_PROXY") || is("IFS") || is("TZ");
}

// Length of the name of "NAME=value" when NAME is a plain variable name,
// else 0.
size_t NameLength(const char* entry)
{
    const char* eq = strchr(entry, '=');
    if (eq == nullptr || eq == entry) {
        return 0;
    }
    for (const char* p = entry; p < eq; ++p) {
        const unsigned char c = static_cast<unsigned char>(*p);
        const bool ok = c == '_' || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (p > entry && c >= '0' && c <= '9');
        if (!ok) {
            return 0;
        }
    }
    return static_cast<size_t>(eq - entry);
}

// The two directions of the reply and their threads.
struct Bridge {
    FCGX_Request* req = nullptr;
    Slot* slot = nullptr;
    int outRead = -1;      // standard output's pipe, read by the output thread
    int finish = -1;       // eventfd: the call is over, drain and stop
    pthread_t outThread{};
    bool outStarted = false;
    bool outFailed = false;
    bool splice = true;    // the connection takes splice(2) (else read and write)
    int inWrite = -1;      // standard input's pipe, written by the input thread
    long long bodyLeft = 0;
    pthread_t inThread{};
    bool inStarted = false;
    bool finished = false;
};

Bridge g_bridge;

// One stdout record of the `length` bytes waiting in the pipe: its header
// written, its content moved from the pipe to the connection by the kernel
// (splice), or read and written where the connection cannot take a splice.
bool ForwardRecord(Bridge& b, size_t length)
{
    int expected = kNothingSent;
    b.slot->state.compare_exchange_strong(expected, kReplyStarted);
    unsigned char header[8] = {1, 6, static_cast<unsigned char>((b.req->requestId >> 8) & 0xff),
                               static_cast<unsigned char>(b.req->requestId & 0xff),
                               static_cast<unsigned char>((length >> 8) & 0xff),
                               static_cast<unsigned char>(length & 0xff), 0, 0};
    if (!WriteFully(b.req->ipcFd, header, sizeof(header))) {
        return false;
    }
    static char buffer[kChunk];
    while (length > 0) {
        if (b.splice) {
            const ssize_t n = splice(b.outRead, nullptr, b.req->ipcFd, nullptr, length, SPLICE_F_MOVE);
            if (n > 0) {
                length -= static_cast<size_t>(n);
                continue;
            }
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n < 0 && errno == EINVAL) {
                b.splice = false;
                continue;
            }
            return false;
        }
        const ssize_t n = read(b.outRead, buffer, std::min(length, sizeof(buffer)));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0 || !WriteFully(b.req->ipcFd, buffer, static_cast<size_t>(n))) {
            return false;
        }
        length -= static_cast<size_t>(n);
    }
    return true;
}

// Standard output to the web server, as stdout records, until the call is
// over and the pipe holds nothing more.
void* PumpOut(void* arg)
{
    Bridge& b = *static_cast<Bridge*>(arg);
    bool draining = false;
    for (;;) {
        pollfd fds[2] = {{b.outRead, POLLIN, 0}, {b.finish, POLLIN, 0}};
        if (poll(fds, draining ? 1 : 2, draining ? 0 : -1) < 0) {
            if (errno == EINTR) {
                continue;
            }
            break;
        }
        if ((fds[1].revents & POLLIN) != 0) {
            draining = true;
        }
        if ((fds[0].revents & (POLLIN | POLLHUP)) == 0) {
            if (draining) {
                // Over, and nothing waiting: what a process that has not let
                // go of standard output writes later is not waited for.
                break;
            }
            continue;
        }
        int waiting = 0;
        if (ioctl(b.outRead, FIONREAD, &waiting) != 0) {
            break;
        }
        if (waiting <= 0) {
            if ((fds[0].revents & POLLHUP) != 0) {
                break;  // every writer has gone: the end of the output
            }
            continue;
        }
        if (!ForwardRecord(b, std::min<size_t>(static_cast<size_t>(waiting), 65535))) {
            // The web server went away: the call's next write fails, as a
            // CGI program's does when its pipe is gone.
            b.outFailed = true;
            break;
        }
    }
    close(b.outRead);
    b.outRead = -1;
    return nullptr;
}

// The request body from the web server to standard input.
void* PumpIn(void* arg)
{
    Bridge& b = *static_cast<Bridge*>(arg);
    static char buffer[kChunk];
    while (b.bodyLeft > 0) {
        const int want = static_cast<int>(std::min<long long>(b.bodyLeft, sizeof(buffer)));
        const int n = FCGX_GetStr(buffer, want, b.req->in);
        if (n <= 0 || !WriteFully(b.inWrite, buffer, static_cast<size_t>(n))) {
            break;
        }
        b.bodyLeft -= n;
    }
    close(b.inWrite);
    b.inWrite = -1;
    return nullptr;
}

// Ends the reply: standard output closed, the rest of it sent, the request
// ended, the body no longer read. Runs once, at the process's exit (a handler
// that calls exit() still has its reply sent).
void FinishReply()
{
    Bridge& b = g_bridge;
    if (b.finished) {
        return;
    }
    b.finished = true;
    fflush(stdout);
    std::cout.flush();
    const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
    if (null >= 0) {
        dup2(null, STDOUT_FILENO);
    } else {
        close(STDOUT_FILENO);
    }
    if (b.outStarted) {
        const uint64_t one = 1;
        (void)!write(b.finish, &one, sizeof(one));
        pthread_join(b.outThread, nullptr);
    }
    if (!b.outFailed && WriteEndRequest(b.req->ipcFd, b.req->requestId)) {
        b.slot->state.store(kReplyEnded);
    }
    // Standard input goes too, so that an input thread blocked on a full
    // pipe stops; one waiting for the web server is woken by the shutdown.
    if (null >= 0) {
        dup2(null, STDIN_FILENO);
        close(null);
    }
    if (b.inStarted) {
        shutdown(b.req->ipcFd, SHUT_RD);
        pthread_join(b.inThread, nullptr);
    }
    close(b.req->ipcFd);
}

// Standard input and output become the pipes of the bridge. False when the
// system refuses a pipe or a thread.
bool Plumb(Bridge& b, FCGX_Request& req, Slot& slot)
{
    b.req = &req;
    b.slot = &slot;
    const char* text = getenv("CONTENT_LENGTH");
    const long long length = System::ContentLength(text, text != nullptr ? strlen(text) : 0, LLONG_MAX);
    b.bodyLeft = length > 0 ? length : 0;

    // The threads never take SIGPIPE: a write to a reader that has gone
    // fails instead, and the thread stops.
    sigset_t pipeOnly, old;
    sigemptyset(&pipeOnly);
    sigaddset(&pipeOnly, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &pipeOnly, &old);

    int out[2];
    if (pipe2(out, O_CLOEXEC) != 0 || (b.finish = eventfd(0, EFD_CLOEXEC)) < 0) {
        VELA_LOG_ERR("cannot make the reply's pipe[%m]");
        return false;
    }
    fcntl(out[0], F_SETPIPE_SZ, kPipeBytes);  // a smaller pipe only costs speed
    dup2(out[1], STDOUT_FILENO);
    close(out[1]);
    b.outRead = out[0];
    if (pthread_create(&b.outThread, nullptr, PumpOut, &b) != 0) {
        VELA_LOG_ERR("cannot start the reply's thread");
        return false;
    }
    b.outStarted = true;

    if (b.bodyLeft == 0) {
        const int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
        if (null >= 0) {
            dup2(null, STDIN_FILENO);
            close(null);
        }
    } else {
        int in[2];
        if (pipe2(in, O_CLOEXEC) != 0) {
            VELA_LOG_ERR("cannot make the body's pipe[%m]");
            return false;
        }
        dup2(in[0], STDIN_FILENO);
        close(in[0]);
        b.inWrite = in[1];
        if (pthread_create(&b.inThread, nullptr, PumpIn, &b) != 0) {
            VELA_LOG_ERR("cannot start the body's thread");
            return false;
        }
        b.inStarted = true;
    }
    pthread_sigmask(SIG_SETMASK, &old, nullptr);
    return true;
}

}  // namespace

// The environment of the call: the server's own variables, then the
// request's parameters. False when the parameters are out of bounds.
bool SetRequestEnvironment(char** params, const Options& options)
{
    clearenv();
    for (const std::string& kept : options.environment) {
        putenv(const_cast<char*>(kept.c_str()));  // lives as long as the process
    }
    size_t count = 0;
    size_t bytes = 0;
    for (char** p = params; p != nullptr && *p != nullptr; ++p) {
        bytes += strlen(*p) + 1;
        if (++count > kMaxParams || bytes > kMaxParamBytes) {
            VELA_LOG_ERR("request refused: more than %zu parameters or %zu bytes of them", kMaxParams,
                         kMaxParamBytes);
            return false;
        }
        const size_t nameLen = NameLength(*p);
        if (nameLen == 0 || Protected(*p, nameLen)) {
            continue;
        }
        putenv(*p);  // owned by the request, which lives as long as the process
    }
    return true;
}

void ServeChild(FCGX_Request& req, WebEntry& entry, const SlotArea& slots, int own, const Options& options,
                const std::vector<int>& closeFds, int argc, char** argv)
{
    // The other children's slots are no business of this one (nor of the
    // handler it runs, whatever identity that takes).
    if (own > 0) {
        munmap(slots.base, static_cast<size_t>(own) * slots.page);
    }
    if (own + 1 < slots.count) {
        munmap(slots.base + static_cast<size_t>(own + 1) * slots.page,
               static_cast<size_t>(slots.count - own - 1) * slots.page);
    }
    Slot& slot = slots.At(own);
    struct sigaction dfl {};
    dfl.sa_handler = SIG_DFL;
    for (int sig : {SIGTERM, SIGINT, SIGCHLD, SIGALRM, SIGPIPE, SIGHUP, SIGUSR1}) {
        sigaction(sig, &dfl, nullptr);
    }
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    setsid();  // a session of its own, as a CGI program has
    for (int fd : closeFds) {
        close(fd);
    }

    Bridge& b = g_bridge;
    if (!SetRequestEnvironment(req.envp, options) || !Plumb(b, req, slot)) {
        // Answered on the connection itself: standard output may not lead
        // there yet.
        if (WriteWholeReply(req.ipcFd, req.requestId, kSetupFailedReply, kSetupFailedReplyLength)) {
            slot.state.store(kReplyEnded);
        }
        _exit(0);
    }
    atexit(FinishReply);
    ServeCgiRequest(argc, argv, &entry);
    // The API of a call that got as far as its description (its library
    // may have been warm already, opened for another API).
    if (entry.GetRequest() != nullptr && entry.GetRequest()->GetAPIInfo("lib", "").isString() &&
        !entry.GetRequest()->GetAPIInfo("lib", "").asString().empty()) {
        const std::string api = entry.GetRequest()->GetAPIClass();
        if (api.size() < sizeof(slot.api)) {
            memcpy(slot.api, api.c_str(), api.size() + 1);
        }
    }
    exit(0);
}

}  // namespace Fcgi
}  // namespace VELA
