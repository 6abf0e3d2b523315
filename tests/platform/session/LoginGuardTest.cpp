// The brute-force guard of logins against real record files under a
// temporary VELA_ROOT, with the test clock: the limit per address, the
// account's owner never locked out, the sliding window, the end of a block,
// a success clearing its own pair only, hostile accounts, the log lines,
// the purge and the bound of the store, parallel processes, and the
// settings file. "daemon" and "bin" are accounts every machine has; the
// other names are no accounts.
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
        const int verdict = VELA::Session::LoginGuardBegin(&settings_, account, ip, nullptr);
        if (verdict == VELA_LOGIN_GUARD_ALLOW) {
            VELA::Session::LoginGuardFailed(&settings_, account, ip, "Authentication failure");
        }
        return verdict;
    }
    // Begin alone; `wait` receives the seconds to wait.
    int Try(const char* account, const char* ip, int* wait = nullptr)
    {
        return VELA::Session::LoginGuardBegin(&settings_, account, ip, wait);
    }
    // Begin and Succeeded: a login with the right password.
    int Succeed(const char* account, const char* ip)
    {
        const int verdict = VELA::Session::LoginGuardBegin(&settings_, account, ip, nullptr);
        if (verdict == VELA_LOGIN_GUARD_ALLOW) {
            EXPECT_EQ(0, VELA::Session::LoginGuardSucceeded(&settings_, account, ip));
        }
        return verdict;
    }
    std::string GuardDir() const { return root_.Path() + "/run/vela/login-guard"; }
    // The record files, by kind ("addr-" or "acct-").
    size_t Records(const std::string& kind) const
    {
        size_t n = 0;
        for (const std::string& name : DirEntries(GuardDir())) {
            n += name.compare(0, kind.size(), kind) == 0 ? 1 : 0;
        }
        return n;
    }

    VELA::Session::LoginSettings settings_;
};

// Strangers' failures never lock the owner out: the addresses that failed
// are blocked, each on its own; the account is not.
TEST_F(LoginGuard, OwnerIsNeverLockedOutByOtherAddresses)
{
    VELA::Test::LogCapture log;
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.66")) << i;
        EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("DAEMON", ("198.51.100." + std::to_string(i)).c_str())) << i;
    }
    int wait = 0;
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("daemon", "192.0.2.66", &wait));
    EXPECT_EQ(15 * 60, wait);
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Succeed("daemon", "203.0.113.5"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("daemon", "198.51.100.0"));  // one failure there only
    // Accounts ignore ASCII case; the count is logged once it reaches the limit.
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE,
              log.PriorityOf({"failures for account \"daemon\" reached 3", "the last from 192.0.2.66"}));
    size_t notices = 0;
    for (const std::string& line : log.Lines()) {
        notices += line.find("failures for account") != std::string::npos ? 1 : 0;
    }
    EXPECT_EQ(1u, notices) << "logged once, not at every failure after";
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

// A success clears the failures of its own (account, address) pair and no
// others: an attacker's own account does not reset the address's count.
TEST_F(LoginGuard, SuccessClearsItsOwnPairOnly)
{
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("victim", "192.0.2.1"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("victim", "192.0.2.1"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Succeed("bin", "192.0.2.1"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Succeed("bin", "192.0.2.1"));  // its own attempts never pile up
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("other", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("bin", "192.0.2.1"));

    // The owner who mistyped: the success forgives the pair's failures, not
    // those of the account from another address.
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.2"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.2"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.3"));
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Succeed("daemon", "192.0.2.2"));
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.2")) << i;
    }
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("daemon", "192.0.2.2"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.3"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", "192.0.2.3"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("x", "192.0.2.3"));
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
          longName, std::string("daemon")}) {
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
    // The lock, the unknown address, and an account record for the one
    // account that exists: names that are no accounts get none.
    std::vector<std::string> files = DirEntries(GuardDir());
    EXPECT_EQ(3u, files.size());
    EXPECT_EQ(1u, Records("addr-"));
    EXPECT_EQ(1u, Records("acct-"));
    for (const std::string& name : files) {
        if (name == ".lock") {
            continue;
        }
        EXPECT_EQ(69u, name.size()) << name;
        EXPECT_EQ(std::string::npos, name.find_first_not_of("0123456789abcdef", 5)) << name;
        ASSERT_EQ(0, stat((GuardDir() + "/" + name).c_str(), &st));
        EXPECT_EQ(0600u, st.st_mode & 07777) << name;
    }
}

// Expired records go at the next failure; the bound holds address records
// to login_guard_max_records, and a full store never lifts a limit.
TEST_F(LoginGuard, ExpiredRecordsArePurgedAndTheStoreIsBounded)
{
    for (int i = 0; i < 20; ++i) {
        ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("x", ("192.0.2." + std::to_string(i)).c_str()));
    }
    EXPECT_EQ(20u, Records("addr-"));
    Now() += 10 * 60;  // the window has passed for all of them
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("x", "192.0.2.99"));
    EXPECT_EQ(std::vector<std::string>({".lock", "addr-"}), [this] {
        std::vector<std::string> kinds;
        for (const std::string& name : DirEntries(GuardDir())) {
            kinds.push_back(name.substr(0, 5));
        }
        return kinds;
    }());

    settings_.maxRecords = 3;
    for (int i = 0; i < 3; ++i) {
        ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("x", "198.51.100.1")) << i;  // blocked: 15 minutes
    }
    Now() += 60;
    ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("x", "198.51.100.2"));
    // Full: an untracked address with no account to count on is refused
    // until the earliest record expires (192.0.2.99, nine minutes on).
    int wait = 0;
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("x", "203.0.113.1", &wait));
    EXPECT_EQ(9 * 60, wait);
    // An existing account counts on its own record: three failures from
    // untracked addresses, then they are refused; a tracked address still
    // decides by its own count, and the blocked one stays blocked.
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("daemon", ("203.0.113." + std::to_string(i)).c_str())) << i;
    }
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("daemon", "203.0.113.9"));
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("daemon", "198.51.100.2"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("bin", "198.51.100.1"));
    EXPECT_EQ(3u, Records("addr-"));
    Now() += 15 * 60;  // everything expired: new addresses are tracked again
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Fail("x", "203.0.113.1"));
    EXPECT_EQ(1u, Records("addr-"));
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
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE,
              log.PriorityOf({"blocked for 15 minutes", "3 failures from 192.0.2.66", "account \"mallory"}));
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
    EXPECT_EQ(VELA_LOGIN_GUARD_ALLOW, Try("grace", "192.0.2.1"));
    EXPECT_EQ(VELA_LOGIN_GUARD_BLOCKED, Try("grace", "192.0.2.1"));

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
    VELA::System::RootReset();
    VELA::Session::LoginSettings s;
    VELA::Session::LoginSettingsLoad(&s);  // no file: the defaults
    EXPECT_EQ(5, s.maxFailures);
    EXPECT_EQ(10, s.windowMinutes);
    EXPECT_EQ(15, s.blockMinutes);
    EXPECT_EQ(10000, s.maxRecords);
    EXPECT_EQ(0, s.idleTimeout);

    ASSERT_EQ(0, mkdir((root.Path() + "/etc").c_str(), 0755));
    ASSERT_EQ(0, mkdir((root.Path() + "/etc/vela").c_str(), 0755));
    std::ofstream(root.Path() + "/etc/vela/webapi.conf") << "login_max_failures=\"7\"\n"
                                                           "login_window_minutes=\"0\"\n"
                                                           "login_block_minutes=\"-3\"\n"
                                                           "login_guard_max_records=\"250\"\n"
                                                           "session_idle_timeout=\"600\"\n"
                                                           "session_lifetime=\"12h\"\n";
    VELA::Test::LogCapture log;
    VELA::Session::LoginSettingsLoad(&s);
    EXPECT_EQ(7, s.maxFailures);
    EXPECT_EQ(10, s.windowMinutes);
    EXPECT_EQ(15, s.blockMinutes);
    EXPECT_EQ(250, s.maxRecords);
    EXPECT_EQ(600, s.idleTimeout);
    EXPECT_EQ(0, s.lifetime);
    EXPECT_TRUE(log.Contains("login_window_minutes=\"0\" is not a number from 1 to 10080"));
    EXPECT_TRUE(log.Contains("session_lifetime=\"12h\""));
    VELA::System::RootReset();
}

}  // namespace
