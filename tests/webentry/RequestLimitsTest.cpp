// Limits of the process serving one request: the settings, the CPU and
// wall-clock limits as the kernel enforces them, and the per-client slots.
#include <gtest/gtest.h>

#include <csignal>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/StateRootTest.h"
#include "webentry/RequestLimits.h"

namespace {

using VELA::RequestLimits;
using RequestLimitsTest = RootTest;

// The signal that ended a child running `body` under `limits`, 0 when it
// exited.
int EndingSignal(const RequestLimits& limits, void (*body)())
{
    const pid_t pid = fork();
    if (pid == 0) {
        VELA::ArmRequestLimits(limits, 0);
        body();
        _exit(0);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFSIGNALED(status) ? WTERMSIG(status) : 0;
}

TEST_F(RequestLimitsTest, SettingsFromTheConfiguration)
{
    VELA::Test::LogCapture log;
    Conf("webapi.conf", "request_cpu_seconds=\"7\"\nrequest_time_seconds=\"9\"\nrequest_max_per_client=\"0\"\n"
         "request_body_idle_seconds=\" 5\"\nrequest_body_min_rate=\"1e3\"\n");
    const RequestLimits limits = VELA::LoadRequestLimits();
    EXPECT_EQ(7, limits.cpuSeconds);
    EXPECT_EQ(9, limits.timeSeconds);
    EXPECT_EQ(0, limits.maxPerClient);
    // Text that only looks like a number keeps the default, and says so.
    EXPECT_EQ(RequestLimits().bodyIdleSeconds, limits.bodyIdleSeconds);
    EXPECT_EQ(RequestLimits().bodyMinRate, limits.bodyMinRate);
    EXPECT_TRUE(log.Contains("request_body_min_rate=\"1e3\""));

    // The body's allowance comes on top of the request's own time, and the
    // whole is bounded.
    EXPECT_EQ(9u, VELA::RequestWallSeconds(limits, 0));
    EXPECT_EQ(9u + 1025u, VELA::RequestWallSeconds(limits, 16LL << 20 << 0));
    EXPECT_EQ(24u * 3600u, VELA::RequestWallSeconds(limits, 1LL << 60));
}

TEST_F(RequestLimitsTest, CpuAndWallClockEndTheProcess)
{
    RequestLimits limits;
    limits.cpuSeconds = 1;
    limits.timeSeconds = 30;
    EXPECT_EQ(SIGXCPU, EndingSignal(limits, [] {
                  for (volatile unsigned long i = 0;; i = i + 1) {
                  }
              }));
    limits.cpuSeconds = 30;
    limits.timeSeconds = 1;
    EXPECT_EQ(SIGALRM, EndingSignal(limits, [] { pause(); }));
}

TEST_F(RequestLimitsTest, ClientSlots)
{
    RequestLimits limits;
    limits.maxPerClient = 2;
    // Two children hold the slots of one address until told to end.
    int hold[2];
    int ready[2];
    ASSERT_EQ(0, pipe(hold));
    ASSERT_EQ(0, pipe(ready));
    pid_t holders[2];
    for (pid_t& pid : holders) {
        pid = fork();
        if (pid == 0) {
            close(hold[1]);  // so that the parent's close is the end of input
            const char taken = static_cast<char>('0' + VELA::TakeClientSlot(limits, "192.0.2.7"));
            (void)!write(ready[1], &taken, 1);
            char c;
            (void)!read(hold[0], &c, 1);
            _exit(0);
        }
    }
    char taken[2];
    ASSERT_EQ(1, read(ready[0], &taken[0], 1));
    ASSERT_EQ(1, read(ready[0], &taken[1], 1));
    EXPECT_EQ('1', taken[0]);
    EXPECT_EQ('1', taken[1]);

    auto takeInChild = [&limits](const char* address) {
        const pid_t pid = fork();
        if (pid == 0) {
            _exit(VELA::TakeClientSlot(limits, address) + 10);
        }
        int status = 0;
        waitpid(pid, &status, 0);
        return WEXITSTATUS(status) - 10;
    };
    EXPECT_EQ(0, takeInChild("192.0.2.7"));
    EXPECT_EQ(1, takeInChild("192.0.2.8"));
    // IPv6 clients are counted by their /64.
    EXPECT_EQ(1, takeInChild("2001:db8::1"));

    // Ending the holders frees their slots.
    close(hold[1]);
    for (pid_t pid : holders) {
        waitpid(pid, nullptr, 0);
    }
    EXPECT_EQ(1, takeInChild("192.0.2.7"));

    // The lock file is the server's own.
    struct stat st;
    ASSERT_EQ(0, stat(In("/run/vela/clients.lock").c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 07777);
    limits.maxPerClient = 0;
    EXPECT_EQ(1, VELA::TakeClientSlot(limits, "192.0.2.7"));
}

}  // namespace
