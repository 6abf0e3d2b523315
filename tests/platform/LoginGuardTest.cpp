// The brute-force guard of logins against real record files under a
// temporary VELA_ROOT, with the test clock: limits per address and per
// account, the sliding window, the end of a block, success, hostile
// accounts, the log lines, parallel processes, and the settings file.
#include <gtest/gtest.h>

#include "platform/StateRootTest.h"

#include <fstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "support/TestSupport.h"
#include "vela/log.h"
#include "vela/loginguard.h"
#include "vela/vlibc.h"

namespace {

using VELA::Test::DirEntries;

class LoginGuard : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        settings_.maxFailures = 3;
        settings_.windowMinutes = 10;
        settings_.blockMinutes = 15;
    }

    // Begin, then the password check fails. The result of Begin.
    int Fail(const char* account, const char* ip)
    {
        const int verdict = VelaLoginGuardBegin(&settings_, account, ip, nullptr);
        if (verdict == VELA_LOGIN_GUARD_ALLOW) {
            VelaLoginGuardFailed(&settings_, account, ip, "Authentication failure");
        }
        return verdict;
    }
    // Begin alone; `wait` receives the seconds to wait.
    int Try(const char* account, const char* ip, int* wait = nullptr)
    {
        return VelaLoginGuardBegin(&settings_, account, ip, wait);
    }
    std::string GuardDir() const { return root_.Path() + "/run/vela/login-guard"; }

    VelaLoginSettings settings_;
};

TEST_F(LoginGuard, LimitPerAccountFromAnyAddress)
{
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("alice", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("alice", "192.0.2.2"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("ALICE", "2001:db8::1"));  // accounts ignore ASCII case
    int wait = 0;
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("alice", "198.51.100.9", &wait));
    EXPECT_EQ(15 * 60, wait);
    // The addresses have one failure each: other accounts go on.
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("bob", "192.0.2.1"));
}

TEST_F(LoginGuard, LimitPerAddressForAnyAccount)
{
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("a1", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("a2", "::ffff:192.0.2.1"));  // the same IPv4 client
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("a3", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("a4", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("a4", "192.0.2.2"));

    // IPv6 clients count per /64: another host of the prefix is the same client.
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("b1", "2001:db8:1:2::1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("b2", "2001:db8:1:2::2"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("b3", "2001:db8:1:2:ffff::3"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("b4", "2001:db8:1:2::9"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("b4", "2001:db8:1:3::1"));
}

TEST_F(LoginGuard, FailuresLeaveTheWindow)
{
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("carol", "192.0.2.1"));
    Now() += 6 * 60;
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("carol", "192.0.2.1"));
    Now() += 4 * 60 + 1;  // the first failure is now older than 10 minutes
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("carol", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("carol", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("carol", "192.0.2.1"));
}

TEST_F(LoginGuard, BlockEndsAndStartsAfresh)
{
    for (int i = 0; i < 3; ++i) {
        ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("dave", "192.0.2.1"));
    }
    Now() += 15 * 60 - 1;
    int wait = 0;
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("dave", "192.0.2.1", &wait));
    EXPECT_EQ(1, wait);
    Now() += 1;
    // The failures before the block are forgotten: a full series again.
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("dave", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("dave", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("dave", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("dave", "192.0.2.1"));

    // The clock went back a day: the block still ends at most 15 minutes on.
    Now() -= 86400;
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("dave", "192.0.2.1", &wait));
    EXPECT_EQ(15 * 60, wait);
}

TEST_F(LoginGuard, SuccessClearsAccountAndAddress)
{
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("erin", "192.0.2.1"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("other", "192.0.2.1"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("erin", "192.0.2.1"));
    EXPECT_EQ(0, VelaLoginGuardSucceeded("erin", "192.0.2.1"));
    EXPECT_EQ(2u, DirEntries(GuardDir()).size()) << "the lock and the record of \"other\" stay";
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("erin", "192.0.2.1")) << i;
    }
}

TEST_F(LoginGuard, AttemptsInProgressCountAgainstTheLimit)
{
    // Three checks started and not finished: a fourth gets no check, and
    // waits until the oldest leaves the window.
    for (int i = 0; i < 3; ++i) {
        ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("frank", "192.0.2.1"));
        Now() += 60;
    }
    int wait = 0;
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("frank", "192.0.2.1", &wait));
    EXPECT_EQ(7 * 60, wait);
}

TEST_F(LoginGuard, RecordsAreHashedPrivateFiles)
{
    settings_.maxFailures = 10;
    const std::string longName(VELA_LOGIN_ACCOUNT_MAX, 'x');
    for (const std::string& account :
         {std::string("../../../etc/passwd"), std::string("a/b"), std::string(".."), std::string("x\n\x01\"y"),
          longName}) {
        EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail(account.c_str(), "")) << account;
    }
    EXPECT_EQ(VELA_LOGIN_GUARD_ERROR, Try(std::string(VELA_LOGIN_ACCOUNT_MAX + 1, 'x').c_str(), "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ERROR, Try("", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ERROR, Try(nullptr, "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ERROR, Try("x", "../etc"));

    struct stat st;
    ASSERT_EQ(0, stat(GuardDir().c_str(), &st));
    EXPECT_EQ(0700u, st.st_mode & 07777);
    EXPECT_EQ(std::vector<std::string>({"run"}), DirEntries(root_.Path()));
    std::vector<std::string> files = DirEntries(GuardDir());
    EXPECT_EQ(7u, files.size());  // five accounts, the unknown address, the lock
    for (const std::string& name : files) {
        if (name == ".lock") {
            continue;
        }
        EXPECT_EQ(64u, name.size()) << name;
        EXPECT_EQ(std::string::npos, name.find_first_not_of("0123456789abcdef")) << name;
        ASSERT_EQ(0, stat((GuardDir() + "/" + name).c_str(), &st));
        EXPECT_EQ(0600u, st.st_mode & 07777) << name;
    }
}

TEST_F(LoginGuard, FailuresAndBlocksAreLoggedToAuthpriv)
{
    VELA::Test::LogCapture log;
    Fail("mallory\x1b[2J", "192.0.2.66");
    Fail("mallory\x1b[2J", "192.0.2.66");
    Fail("mallory\x1b[2J", "192.0.2.66");
    Try("mallory\x1b[2J", "192.0.2.66");
    EXPECT_EQ(LOG_AUTHPRIV | LOG_WARNING,
              log.PriorityOf({"login failed", "\"mallory\\x1b[2J\"", "192.0.2.66", "Authentication failure"}));
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE, log.PriorityOf({"blocked for 15 minutes", "3 failures for account \"mallory"}));
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE, log.PriorityOf({"blocked for 15 minutes", "3 failures from 192.0.2.66"}));
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE, log.PriorityOf({"refused without a password check", "192.0.2.66"}));
    for (const std::string& line : log.Lines()) {
        EXPECT_EQ(std::string::npos, line.find('\x1b')) << line;
    }
}

// Forks `children` processes that each run `body` and exit with its result;
// the sum of the exit codes.
template <typename Body>
int InChildren(int children, Body body)
{
    std::vector<pid_t> pids;
    for (int i = 0; i < children; ++i) {
        const pid_t pid = fork();
        if (pid == 0) {
            _exit(body());
        }
        pids.push_back(pid);
    }
    int sum = 0;
    for (pid_t pid : pids) {
        int status = 0;
        waitpid(pid, &status, 0);
        sum += WIFEXITED(status) ? WEXITSTATUS(status) : 1000;
    }
    return sum;
}

TEST_F(LoginGuard, ParallelProcessesCountExactly)
{
    constexpr int kChildren = 8;
    constexpr int kEach = 10;
    settings_.maxFailures = kChildren * kEach + 1;
    const int allowed = InChildren(kChildren, [this] {
        int n = 0;
        for (int i = 0; i < kEach; ++i) {
            n += Fail("grace", "192.0.2.1") == VELA_LOGIN_GUARD_ALLOW ? 1 : 0;
        }
        return n;
    });
    EXPECT_EQ(kChildren * kEach, allowed);
    // No failure was lost: exactly one more attempt fits under the limit.
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("grace", "192.0.2.2"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("grace", "192.0.2.3"));

    // Attempts racing for the last places: never more checks than the limit.
    settings_.maxFailures = 4;
    const int started = InChildren(kChildren, [this] {
        int n = 0;
        for (int i = 0; i < 3; ++i) {
            n += Try("heidi", "192.0.2.9") == VELA_LOGIN_GUARD_ALLOW ? 1 : 0;
        }
        return n;
    });
    EXPECT_EQ(4, started);
}

TEST(LoginSettings, ReadFromWebapiConf)
{
    VELA::Test::TempDir root;
    VELA::Test::ScopedEnv env("VELA_ROOT", root.Path().c_str());
    VELA::VelaRootReset();
    VelaLoginSettings s;
    VelaLoginSettingsLoad(&s);  // no file: the defaults
    EXPECT_EQ(5, s.maxFailures);
    EXPECT_EQ(10, s.windowMinutes);
    EXPECT_EQ(15, s.blockMinutes);
    EXPECT_EQ(0, s.idleTimeout);

    ASSERT_EQ(0, mkdir((root.Path() + "/etc").c_str(), 0755));
    ASSERT_EQ(0, mkdir((root.Path() + "/etc/vela").c_str(), 0755));
    std::ofstream(root.Path() + "/etc/vela/webapi.conf") << "login_max_failures=\"7\"\n"
                                                           "login_window_minutes=\"0\"\n"
                                                           "login_block_minutes=\"-3\"\n"
                                                           "session_idle_timeout=\"600\"\n"
                                                           "session_lifetime=\"12h\"\n";
    VELA::Test::LogCapture log;
    VelaLoginSettingsLoad(&s);
    EXPECT_EQ(7, s.maxFailures);
    EXPECT_EQ(10, s.windowMinutes);
    EXPECT_EQ(15, s.blockMinutes);
    EXPECT_EQ(600, s.idleTimeout);
    EXPECT_EQ(0, s.lifetime);
    EXPECT_TRUE(log.Contains("login_window_minutes=\"0\" is not a number from 1 to 10080"));
    EXPECT_TRUE(log.Contains("session_lifetime=\"12h\""));
    VELA::VelaRootReset();
}

}  // namespace
