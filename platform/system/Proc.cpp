// Process creation of the system library: a plain fork and a detached one
// (double fork) that never leaves a zombie behind. Contracts are in
// vela/sysfile.h.
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include "system/SysInternal.h"
#include "vela/sysfile.h"

namespace {

constexpr int kKnownFlags = VLIBC_FORK_DETACH | VLIBC_FORK_NEW_SESSION | VLIBC_FORK_DEFAULT_SIGNALS;

// Runs in the new child (the worker when detached) before it returns 0.
void ChildSetup(int flags)
{
    if (flags & VLIBC_FORK_DEFAULT_SIGNALS) {
        struct sigaction sa = {};
        sa.sa_handler = SIG_DFL;
        sigemptyset(&sa.sa_mask);
        for (int sig = 1; sig < NSIG; ++sig) {
            if (sig != SIGKILL && sig != SIGSTOP) {
                sigaction(sig, &sa, nullptr);  // fails only for numbers the kernel reserves
            }
        }
        sigset_t none;
        sigemptyset(&none);
        sigprocmask(SIG_SETMASK, &none, nullptr);
    }
    if (flags & VLIBC_FORK_NEW_SESSION) {
        setsid();  // a fresh child is never a group leader, so this succeeds
    }
}

bool WriteFull(int fd, const void* data, size_t len)
{
    const char* p = static_cast<const char*>(data);
    while (len > 0) {
        const ssize_t n = write(fd, p, len);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        p += n;
        len -= static_cast<size_t>(n);
    }
    return true;
}

bool ReadFull(int fd, void* data, size_t len)
{
    char* p = static_cast<char*>(data);
    while (len > 0) {
        const ssize_t n = read(fd, p, len);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        if (n == 0) {
            errno = EPIPE;
            return false;
        }
        p += n;
        len -= static_cast<size_t>(n);
    }
    return true;
}

// Double fork. The intermediate child forks the worker, reports its pid (or
// -errno) through a pipe and exits; the caller reaps the intermediate only.
pid_t ForkDetached(int flags)
{
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "pipe: %m");
        return -1;
    }
    const pid_t mid = fork();
    if (mid < 0) {
        const int err = errno;
        close(fds[0]);
        close(fds[1]);
        errno = err;
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "fork: %m");
        return -1;
    }
    if (mid == 0) {
        // Intermediate child: only async-signal-safe calls from here on.
        close(fds[0]);
        const pid_t worker = fork();
        if (worker == 0) {
            close(fds[1]);
            ChildSetup(flags);
            return 0;
        }
        const long report = worker > 0 ? static_cast<long>(worker) : -static_cast<long>(errno);
        const bool sent = WriteFull(fds[1], &report, sizeof(report));
        _exit(worker > 0 && sent ? 0 : 1);
    }
    close(fds[1]);
    long report = 0;
    const bool got = ReadFull(fds[0], &report, sizeof(report));
    const int readErr = errno;
    close(fds[0]);
    // The intermediate child exits right after its report: this wait is
    // short. ECHILD: SIGCHLD is ignored and the kernel reaped it already.
    int status = 0;
    while (waitpid(mid, &status, 0) < 0 && errno == EINTR) {
    }
    if (!got) {
        errno = readErr;
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "no report from the intermediate child: %m");
        return -1;
    }
    if (report <= 0) {
        errno = static_cast<int>(-report);
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "fork of the worker: %m");
        return -1;
    }
    return static_cast<pid_t>(report);
}

}  // namespace

pid_t VLIBCProcFork(void)
{
    fflush(nullptr);  // buffered output must not be written by both processes
    const pid_t pid = fork();
    if (pid < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "fork: %m");
    }
    return pid;
}

pid_t VLIBCProcForkEx(int flags)
{
    if ((flags & ~kKnownFlags) != 0) {
        errno = EINVAL;
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "unknown fork flags %#x", static_cast<unsigned>(flags));
        return -1;
    }
    fflush(nullptr);
    if (flags & VLIBC_FORK_DETACH) {
        return ForkDetached(flags);
    }
    const pid_t pid = fork();
    if (pid < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "fork: %m");
    } else if (pid == 0) {
        ChildSetup(flags);
    }
    return pid;
}
