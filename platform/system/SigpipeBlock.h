// SIGPIPE blocked for a scope (not installed).
#pragma once

#include <cerrno>
#include <csignal>
#include <ctime>

namespace VELA {
namespace System {

// Blocks SIGPIPE for its scope, so a client that goes away makes writes
// fail with EPIPE instead of killing the process; a SIGPIPE raised meanwhile
// is consumed unless one was already pending before.
class SigpipeBlock {
public:
    SigpipeBlock()
    {
        sigemptyset(&pipe_);
        sigaddset(&pipe_, SIGPIPE);
        sigset_t pending;
        sigemptyset(&pending);
        wasPending_ = sigpending(&pending) == 0 && sigismember(&pending, SIGPIPE) == 1;
        blocked_ = sigprocmask(SIG_BLOCK, &pipe_, &old_) == 0;
    }
    ~SigpipeBlock()
    {
        if (!blocked_) {
            return;
        }
        const int saved = errno;
        if (!wasPending_) {
            const struct timespec zero = {0, 0};
            while (sigtimedwait(&pipe_, nullptr, &zero) < 0 && errno == EINTR) {
            }
        }
        sigprocmask(SIG_SETMASK, &old_, nullptr);
        errno = saved;
    }
    SigpipeBlock(const SigpipeBlock&) = delete;
    SigpipeBlock& operator=(const SigpipeBlock&) = delete;

private:
    sigset_t pipe_;
    sigset_t old_;
    bool wasPending_ = false;
    bool blocked_ = false;
};

}  // namespace System
}  // namespace VELA
