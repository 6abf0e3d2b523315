// Process creation: the plain fork and the detached double fork.
#include <cerrno>
#include <csignal>
#include <cstdio>

#include "platform/PlatformTest.h"
#include "vela/sysfile.h"

namespace {

// The parent pid of `pid` from /proc, or -1 when it is gone.
pid_t ParentOf(pid_t pid)
{
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.compare(0, 5, "PPid:") == 0) {
            return static_cast<pid_t>(std::stol(line.substr(5)));
        }
    }
    return -1;
}

bool NoChildren()
{
    errno = 0;
    return waitpid(-1, nullptr, WNOHANG) == -1 && errno == ECHILD;
}

// The worker of the detached double fork: the caller gets its pid, the
// intermediate child was reaped and the worker belongs to someone else, so
// nothing is left to become our zombie; the worker may have a session of its
// own and the default signal dispositions and mask.
TEST(Proc, DetachedWorkerIsNeverOursAndGetsSessionAndDefaultSignals)
{
    ASSERT_TRUE(NoChildren()) << "a child of an earlier test is still around";
    struct sigaction ignore = {};
    ignore.sa_handler = SIG_IGN;
    struct sigaction oldUsr1;
    sigaction(SIGUSR1, &ignore, &oldUsr1);
    sigset_t block, oldMask;
    sigemptyset(&block);
    sigaddset(&block, SIGUSR2);
    sigprocmask(SIG_BLOCK, &block, &oldMask);

    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    const pid_t pid = VLIBCProcForkEx(VLIBC_FORK_DETACH | VLIBC_FORK_NEW_SESSION | VLIBC_FORK_DEFAULT_SIGNALS);
    if (pid == 0) {
        struct sigaction now;
        sigaction(SIGUSR1, nullptr, &now);
        sigset_t mask;
        sigprocmask(SIG_SETMASK, nullptr, &mask);
        const std::string report = std::to_string(getpid()) + (getsid(0) == getpid() ? " s" : " -") +
                                   (now.sa_handler == SIG_DFL ? "d" : "-") + (sigismember(&mask, SIGUSR2) ? "-" : "u");
        (void)!write(fds[1], report.data(), report.size());
        _exit(0);
    }
    sigaction(SIGUSR1, &oldUsr1, nullptr);
    sigprocmask(SIG_SETMASK, &oldMask, nullptr);
    ASSERT_GT(pid, 0);
    close(fds[1]);
    char report[64] = {};
    EXPECT_GT(read(fds[0], report, sizeof(report) - 1), 0);
    EXPECT_EQ(0, read(fds[0], report + 63, 1));  // the worker has exited
    close(fds[0]);
    EXPECT_EQ(std::to_string(pid) + " sdu", report);
    EXPECT_TRUE(NoChildren());
    EXPECT_NE(getpid(), ParentOf(pid));
}

// Output buffered before the fork is written once, although the child
// leaves through exit(), which flushes its copy of the buffers.
TEST(Proc, PlainForkFlushesBuffersAndIsReapedByTheCaller)
{
    VELA::Test::TempDir dir;
    const std::string path = dir.Path() + "/out";
    FILE* f = fopen(path.c_str(), "w");
    ASSERT_NE(nullptr, f);
    setvbuf(f, nullptr, _IOFBF, 4096);
    fputs("once", f);
    const pid_t pid = VLIBCProcFork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        exit(7);
    }
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 7);
    fclose(f);
    EXPECT_EQ("once", VELA::Test::ReadText(path));

    // Unknown flags create no process.
    errno = 0;
    EXPECT_EQ(-1, VLIBCProcForkEx(0x100));
    EXPECT_EQ(EINVAL, errno);
    EXPECT_TRUE(NoChildren());
}

}  // namespace
