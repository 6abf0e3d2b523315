// The brute-force guard of logins against real record files under a
// temporary VELA_ROOT, with the test clock: the limit per address, the
// account's owner never locked out, the sliding window, the end of a block,
// a success clearing its own pair only, hostile accounts, the log lines,
// the purge and the bound of the store, parallel processes, and the
// settings file. "daemon" and "bin" are accounts every machine has; the
// other names are no accounts.

#include <algorithm>
#include <numeric>

#include "platform/PlatformTest.h"
#include "vela/log.h"
#include "vela/loginguard.h"

namespace {

using VELA::Test::DirEntries;

constexpr int kAllow = VELA_LOGIN_GUARD_ALLOW;
constexpr int kBlocked = VELA_LOGIN_GUARD_BLOCKED;

// One step of a script: 'F' a login whose password check fails, 'S' one that
// succeeds, 'T' one only begun; `verdict` is what the guard's Begin answers,
// `advance` the seconds the clock moves before the step, `wait` the seconds
// Begin tells to wait (-1: not checked).
struct Step { char what; const char* account; const char* ip; int verdict; long long advance = 0; int wait = -1; };

class LoginGuard : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        settings_.maxFailures = 3;
        settings_.windowMinutes = 10;
        settings_.blockMinutes = 15;
    }

    // Begin, then the password check fails (or with `ok` succeeds). The
    // result of Begin.
    int Fail(const char* account, const char* ip, bool ok = false)
    {
        const int verdict = VELA::Session::LoginGuardBegin(&settings_, account, ip, nullptr);
        if (verdict == VELA_LOGIN_GUARD_ALLOW && ok) {
            EXPECT_EQ(0, VELA::Session::LoginGuardSucceeded(&settings_, account, ip));
        } else if (verdict == VELA_LOGIN_GUARD_ALLOW) {
            VELA::Session::LoginGuardFailed(&settings_, account, ip, "Authentication failure");
        }
        return verdict;
    }
    void Run(const std::vector<Step>& steps)
    {
        for (size_t i = 0; i < steps.size(); ++i) {
            const Step& s = steps[i];
            Now() += s.advance;
            int wait = -1;
            const int got = s.what == 'T' ? VELA::Session::LoginGuardBegin(&settings_, s.account, s.ip, &wait)
                                          : Fail(s.account, s.ip, s.what == 'S');
            const std::string what =
                "step " + std::to_string(i) + ": " + s.what + " " + (s.account ? s.account : "null");
            EXPECT_EQ(s.verdict, got) << what << " from " << s.ip;
            EXPECT_TRUE(s.wait < 0 || s.wait == wait) << what << ": waits " << wait << ", not " << s.wait;
        }
    }
    std::string GuardDir() const { return In("/run/vela/login-guard"); }
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
        EXPECT_EQ(kAllow, Fail("daemon", "192.0.2.66")) << i;
        EXPECT_EQ(kAllow, Fail("DAEMON", ("198.51.100." + std::to_string(i)).c_str())) << i;
    }
    Run({{'T', "daemon", "192.0.2.66", kBlocked, 0, 15 * 60}, {'S', "daemon", "203.0.113.5", kAllow},
         {'T', "daemon", "198.51.100.0", kAllow}});  // one failure there only
    // Accounts ignore ASCII case; the count is logged once it reaches the limit.
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE,
              log.PriorityOf({"failures for account \"daemon\" reached 3", "the last from 192.0.2.66"}));
    EXPECT_EQ(1, std::count_if(log.Lines().begin(), log.Lines().end(), [](const std::string& line) {
                  return line.find("failures for account") != std::string::npos;
              })) << "logged once, not at every failure after";
}

TEST_F(LoginGuard, LimitPerAddressForAnyAccount)
{
    Run({{'F', "a1", "192.0.2.1", kAllow}, {'F', "a2", "::ffff:192.0.2.1", kAllow},  // the same IPv4 client
         {'F', "a3", "192.0.2.1", kAllow}, {'T', "a4", "192.0.2.1", kBlocked}, {'T', "a4", "192.0.2.2", kAllow},
         // IPv6 clients count per /64: another host of the prefix is the same client.
         {'F', "b1", "2001:db8:1:2::1", kAllow}, {'F', "b2", "2001:db8:1:2::2", kAllow},
         {'F', "b3", "2001:db8:1:2:ffff::3", kAllow}, {'T', "b4", "2001:db8:1:2::9", kBlocked},
         {'T', "b4", "2001:db8:1:3::1", kAllow}});
}

// Failures leave the window; attempts in progress count against the limit.
TEST_F(LoginGuard, FailuresLeaveTheWindowAttemptsInProgressCount)
{
    // After the second step the first failure is older than 10 minutes.
    Run({{'F', "carol", "192.0.2.1", kAllow}, {'F', "carol", "192.0.2.1", kAllow, 6 * 60},
         {'F', "carol", "192.0.2.1", kAllow, 4 * 60 + 1}, {'F', "carol", "192.0.2.1", kAllow},
         {'T', "carol", "192.0.2.1", kBlocked}});

    // Three checks started and not finished: a fourth gets no check, and
    // waits until the oldest leaves the window.
    Run({{'T', "frank", "192.0.2.2", kAllow}, {'T', "frank", "192.0.2.2", kAllow, 60},
         {'T', "frank", "192.0.2.2", kAllow, 60}, {'T', "frank", "192.0.2.2", kBlocked, 60, 7 * 60}});
}

TEST_F(LoginGuard, BlockEndsAndStartsAfresh)
{
    const Step fail = {'F', "dave", "192.0.2.1", kAllow};
    Run({fail, fail, fail, {'T', "dave", "192.0.2.1", kBlocked, 15 * 60 - 1, 1},
         // The failures before the block are forgotten: a full series again.
         {'F', "dave", "192.0.2.1", kAllow, 1}, fail, fail, {'T', "dave", "192.0.2.1", kBlocked},
         // The clock went back a day: the block still ends at most 15 minutes on.
         {'T', "dave", "192.0.2.1", kBlocked, -86400, 15 * 60}});
}

// A success clears the failures of its own (account, address) pair and no
// others: an attacker's own account does not reset the address's count.
TEST_F(LoginGuard, SuccessClearsItsOwnPairOnly)
{
    Run({{'F', "victim", "192.0.2.1", kAllow}, {'F', "victim", "192.0.2.1", kAllow},
         {'S', "bin", "192.0.2.1", kAllow}, {'S', "bin", "192.0.2.1", kAllow},  // its own attempts never pile up
         {'F', "other", "192.0.2.1", kAllow}, {'T', "bin", "192.0.2.1", kBlocked}});

    // The owner who mistyped: the success forgives the pair's failures, not
    // those of the account from another address.
    const Step mistyped = {'F', "daemon", "192.0.2.2", kAllow}, elsewhere = {'F', "daemon", "192.0.2.3", kAllow};
    Run({mistyped, mistyped, elsewhere, {'S', "daemon", "192.0.2.2", kAllow}, mistyped, mistyped, mistyped,
         {'T', "daemon", "192.0.2.2", kBlocked}, elsewhere, elsewhere, {'T', "x", "192.0.2.3", kBlocked}});
}

TEST_F(LoginGuard, RecordsAreHashedPrivateFiles)
{
    settings_.maxFailures = 10;
    const std::string longName(VELA_LOGIN_ACCOUNT_MAX, 'x');
    for (const std::string& account :
         {std::string("../../../etc/passwd"), std::string("a/b"), std::string(".."), std::string("x\n\x01\"y"),
          longName, std::string("daemon")}) {
        EXPECT_EQ(kAllow, Fail(account.c_str(), "")) << account;
    }
    const std::string tooLong(VELA_LOGIN_ACCOUNT_MAX + 1, 'x');
    Run({{'T', tooLong.c_str(), "192.0.2.1", VELA_LOGIN_GUARD_ERROR}, {'T', "", "192.0.2.1", VELA_LOGIN_GUARD_ERROR},
         {'T', nullptr, "192.0.2.1", VELA_LOGIN_GUARD_ERROR}, {'T', "x", "../etc", VELA_LOGIN_GUARD_ERROR}});

    EXPECT_EQ(0700u, VELA::Test::Mode(GuardDir()));
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
        EXPECT_EQ(0600u, VELA::Test::Mode(GuardDir() + "/" + name)) << name;
    }
}

// The list of blocks: blocked addresses (an IPv6 client as its /64) and
// accounts whose count from every address reached the limit, until when
// and after how many failures; nothing below the limit, nothing expired,
// no file that is not the guard's own record.
TEST_F(LoginGuard, ListShowsWhatRefusesAttemptsNow)
{
    using Entries = std::vector<VELA::Session::LoginGuardEntry>;
    Entries addresses, accounts;
    const auto list = [&] {
        EXPECT_EQ(0, VELA::Session::LoginGuardList(&settings_, addresses, accounts));
        std::string text;
        for (const Entries* l : {&addresses, &accounts}) {
            for (const auto& e : *l) {
                text += e.subject + " " + std::to_string(e.until - kStart) + " " + std::to_string(e.failures) + "; ";
            }
            text += "| ";
        }
        return text;
    };
    EXPECT_EQ("| | ", list()) << "no store yet";

    Run({{'F', "nosuch", "192.0.2.1", kAllow}, {'F', "nosuch", "192.0.2.1", kAllow},
         {'F', "nosuch", "192.0.2.1", kAllow},                                          // blocked
         {'F', "bin", "2001:db8::1", kAllow}, {'F', "bin", "2001:db8::1", kAllow},      // its /64 at 2
         {'F', "daemon", "192.0.2.3", kAllow, 60}, {'F', "daemon", "192.0.2.4", kAllow},
         {'F', "daemon", "192.0.2.5", kAllow}});                                       // the account at 3
    EXPECT_EQ("192.0.2.1 900 3; | daemon 660 3; | ", list());
    Run({{'F', "nosuch", "2001:db8::2", kAllow}});
    EXPECT_EQ("192.0.2.1 900 3; 2001:db8::/64 960 3; | daemon 660 3; | ", list());

    // A copy of a record under another name, a link to one and a stray
    // file are not listed.
    std::string blocked;
    for (const std::string& name : DirEntries(GuardDir())) {
        if (name.compare(0, 5, "addr-") == 0) {
            blocked = GuardDir() + "/" + name;
        }
    }
    const std::string forged = GuardDir() + "/addr-" + std::string(64, 'a');
    ASSERT_EQ(0, system(("cp -p '" + blocked + "' '" + forged + "'").c_str()));
    ASSERT_EQ(0, symlink(blocked.c_str(), (GuardDir() + "/addr-" + std::string(64, 'b')).c_str()));
    ASSERT_EQ(0, system(("cp -p '" + blocked + "' '" + GuardDir() + "/addr-x'").c_str()));
    const std::string before = list();
    EXPECT_EQ(2u, addresses.size()) << before;

    // The account's count leaves the window; the blocks end.
    Now() += 11 * 60;
    EXPECT_EQ("192.0.2.1 900 3; 2001:db8::/64 960 3; | | ", list());
    Now() += 5 * 60;
    EXPECT_EQ("| | ", list());

    // A store that is a link is not read.
    ASSERT_EQ(0, system(("mv '" + GuardDir() + "' '" + GuardDir() + ".real' && ln -s '" + GuardDir() +
                         ".real' '" + GuardDir() + "'").c_str()));
    EXPECT_EQ(-1, VELA::Session::LoginGuardList(&settings_, addresses, accounts));
}

// Expired records go at the next failure; the bound holds address records
// to login_guard_max_records, and a full store never lifts a limit.
TEST_F(LoginGuard, ExpiredRecordsArePurgedAndTheStoreIsBounded)
{
    for (int i = 0; i < 20; ++i) {
        ASSERT_EQ(kAllow, Fail("x", ("192.0.2." + std::to_string(i)).c_str()));
    }
    EXPECT_EQ(20u, Records("addr-"));
    Now() += 10 * 60;  // the window has passed for all of them
    EXPECT_EQ(kAllow, Fail("x", "192.0.2.99"));
    EXPECT_EQ(2u, DirEntries(GuardDir()).size());  // the lock and one address record
    EXPECT_EQ(1u, Records(".lock"));
    EXPECT_EQ(1u, Records("addr-"));

    settings_.maxRecords = 3;
    for (int i = 0; i < 3; ++i) {
        ASSERT_EQ(kAllow, Fail("x", "198.51.100.1")) << i;  // blocked: 15 minutes
    }
    Now() += 60;
    ASSERT_EQ(kAllow, Fail("x", "198.51.100.2"));
    // Full: an untracked address with no account to count on is refused
    // until the earliest record expires (192.0.2.99, nine minutes on).
    Run({{'T', "x", "203.0.113.1", kBlocked, 0, 9 * 60}});
    // An existing account counts on its own record: three failures from
    // untracked addresses, then they are refused; a tracked address still
    // decides by its own count, and the blocked one stays blocked.
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(kAllow, Fail("daemon", ("203.0.113." + std::to_string(i)).c_str())) << i;
    }
    Run({{'T', "daemon", "203.0.113.9", kBlocked}, {'T', "daemon", "198.51.100.2", kAllow},
         {'T', "bin", "198.51.100.1", kBlocked}});
    EXPECT_EQ(3u, Records("addr-"));
    Now() += 15 * 60;  // everything expired: new addresses are tracked again
    EXPECT_EQ(kAllow, Fail("x", "203.0.113.1"));
    EXPECT_EQ(1u, Records("addr-"));
}

TEST_F(LoginGuard, FailuresAndBlocksAreLoggedToAuthpriv)
{
    VELA::Test::LogCapture log;
    Run({{'F', "mallory\x1b[2J", "192.0.2.66", kAllow}, {'F', "mallory\x1b[2J", "192.0.2.66", kAllow},
         {'F', "mallory\x1b[2J", "192.0.2.66", kAllow}, {'T', "mallory\x1b[2J", "192.0.2.66", kBlocked}});
    EXPECT_EQ(LOG_AUTHPRIV | LOG_WARNING,
              log.PriorityOf({"login failed", "\"mallory\\x1b[2J\"", "192.0.2.66", "Authentication failure"}));
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE,
              log.PriorityOf({"blocked for 15 minutes", "3 failures from 192.0.2.66", "account \"mallory"}));
    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE, log.PriorityOf({"refused without a password check", "192.0.2.66"}));
    for (const std::string& line : log.Lines()) {
        EXPECT_EQ(std::string::npos, line.find('\x1b')) << line;
    }
}

TEST_F(LoginGuard, ParallelProcessesCountExactly)
{
    constexpr int kChildren = 8;
    constexpr int kEach = 10;
    settings_.maxFailures = kChildren * kEach + 1;
    const std::vector<int> allowed = VELA::Test::InChildren(kChildren, [this](int) {
        int n = 0;
        for (int i = 0; i < kEach; ++i) {
            n += Fail("grace", "192.0.2.1") == kAllow ? 1 : 0;
        }
        return n;
    });
    EXPECT_EQ(std::vector<int>(kChildren, kEach), allowed);
    // No failure was lost: exactly one more attempt fits under the limit.
    Run({{'T', "grace", "192.0.2.1", kAllow}, {'T', "grace", "192.0.2.1", kBlocked}});

    // Attempts racing for the last places: never more checks than the limit.
    settings_.maxFailures = 4;
    const std::vector<int> started = VELA::Test::InChildren(kChildren, [this](int) {
        int n = 0;
        for (int i = 0; i < 3; ++i) {
            n += VELA::Session::LoginGuardBegin(&settings_, "heidi", "192.0.2.9", nullptr) == kAllow ? 1 : 0;
        }
        return n;
    });
    EXPECT_EQ(4, std::accumulate(started.begin(), started.end(), 0));
}

class LoginSettings : public RootTest {};

TEST_F(LoginSettings, ReadFromWebapiConf)
{
    VELA::Session::LoginSettings s;
    const auto fields = [&s] {
        return std::vector<int>{s.maxFailures, s.windowMinutes, s.blockMinutes,
                                s.maxRecords,  s.idleTimeout,   s.lifetime};
    };
    VELA::Session::LoginSettingsLoad(&s);  // no file: the defaults
    EXPECT_EQ((std::vector<int>{5, 10, 15, 10000, 0, 0}), fields());

    Conf("webapi.conf", "login_max_failures=\"7\"\nlogin_window_minutes=\"0\"\nlogin_block_minutes=\"-3\"\n"
                        "login_guard_max_records=\"250\"\nsession_idle_timeout=\"600\"\nsession_lifetime=\"12h\"\n");
    VELA::Test::LogCapture log;
    VELA::Session::LoginSettingsLoad(&s);
    EXPECT_EQ((std::vector<int>{7, 10, 15, 250, 600, 0}), fields());
    EXPECT_TRUE(log.Contains("login_window_minutes=\"0\" is not a number from 1 to 10080"));
    EXPECT_TRUE(log.Contains("session_lifetime=\"12h\""));
}

}  // namespace
