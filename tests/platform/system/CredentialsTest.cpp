// Identity switches, checked on a real unprivileged account in a forked
// child (the test process keeps root). Needs root: skipped otherwise.

#include <algorithm>
#include <cstdio>
#include <grp.h>
#include <regex>

#include "platform/IdentityTestUtil.h"
#include "platform/PlatformTest.h"
#include "vela/log.h"
#include "vela/user.h"

namespace {

using VELA::Test::InChild;

std::string Want(uid_t r, uid_t e, uid_t s, gid_t rg, gid_t eg, gid_t sg)
{
    char buf[128];
    snprintf(buf, sizeof(buf), "uid %d/%d/%d gid %d/%d/%d", (int)r, (int)e, (int)s, (int)rg, (int)eg, (int)sg);
    return buf;
}

// The real, effective and saved ids of the process, as Want writes them.
std::string Ids()
{
    uid_t r, e, s;
    gid_t rg, eg, sg;
    getresuid(&r, &e, &s);
    getresgid(&rg, &eg, &sg);
    return Want(r, e, s, rg, eg, sg);
}

std::vector<gid_t> Groups()
{
    std::vector<gid_t> groups(static_cast<size_t>(getgroups(0, nullptr)));
    groups.resize(static_cast<size_t>(getgroups(static_cast<int>(groups.size()), groups.data())));
    return groups;
}

bool Has(const std::vector<gid_t>& groups, gid_t g)
{
    return std::find(groups.begin(), groups.end(), g) != groups.end();
}

// Appends `what` to `errors` when `ok` is false.
void Check(std::string& errors, bool ok, const std::string& what)
{
    if (!ok) {
        errors += what + "; ";
    }
}

class Credentials : public RootTest {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) {
            GTEST_SKIP() << "identity switches need root";
        }
        ASSERT_TRUE(account_.Create()) << "useradd/groupadd failed";
    }
    void TearDown() override
    {
        if (geteuid() == 0) {
            account_.Remove();
        }
    }

    VELA::Test::TestAccount account_;
};

TEST_F(Credentials, SwitchDropsRootForGood)
{
    const VELA::Test::TestAccount& a = account_;
    EXPECT_EQ("", InChild([&] {
        std::string errors;
        if (!ResetCredentialsByName(a.user.c_str(), false)) {
            return std::string("switch failed");
        }
        Check(errors, Ids() == Want(a.uid, a.uid, a.uid, a.gid, a.gid, a.gid), "ids " + Ids());
        const std::vector<gid_t> groups = Groups();
        Check(errors, Has(groups, a.suppGid), "supplementary group missing");
        Check(errors, !Has(groups, 0), "root group kept");
        Check(errors, setresuid(0, 0, 0) != 0, "could return to root");
        Check(errors, setgroups(0, nullptr) != 0, "could change groups");
        return errors;
    }));
}

TEST_F(Credentials, GrantableKeepsTheWayBack)
{
    const VELA::Test::TestAccount& a = account_;
    EXPECT_EQ("", InChild([&] {
        std::string errors;
        if (!ResetCredentialsByName(a.user.c_str(), true)) {
            return std::string("switch failed");
        }
        Check(errors, Ids() == Want(a.uid, a.uid, 0, a.gid, a.gid, a.gid), "ids " + Ids());
        Check(errors, Has(Groups(), a.suppGid), "supplementary group missing");
        Check(errors, setresuid(0, 0, 0) == 0 && geteuid() == 0, "cannot return to root");
        // And back again; the account named "system" is no way to root (it
        // is refused without such an account); the run-as "system" is the
        // superuser with root's groups.
        Check(errors, ResetCredentialsByName(a.user.c_str(), true), "second switch failed");
        Check(errors, Ids() == Want(a.uid, a.uid, 0, a.gid, a.gid, a.gid), "ids after second switch " + Ids());
        if (ResetCredentialsByName("system", true)) {
            Check(errors, geteuid() != 0, "the account name system switched to root");
        }
        Check(errors, ResetCredentialsForRunAs("system", false), "switch to system failed");
        Check(errors, Ids() == Want(0, 0, 0, 0, 0, 0), "ids as system " + Ids());
        Check(errors, !Has(Groups(), a.suppGid), "user's group kept");
        return errors;
    }));
}

// Log lines of the switch go to the authorisation facility in the fixed
// forms; a refused regain of root is logged with the ERROR form.
TEST_F(Credentials, LogsEverySwitch)
{
    const VELA::Test::TestAccount& a = account_;
    const std::string lines = InChild([&] {
        std::string out;
        VELA::System::LogSetSink([](int prio, const char* line, void* arg) {
                                 *static_cast<std::string*>(arg) += std::to_string(prio) + "|" + line + "\n";
                                 }, &out);
        ResetCredentialsByName(a.user.c_str(), false);
        if (ResetCredentialsForRunAs("system", true)) {
            out += "regained root\n";
        }
        VELA::System::LogSetSink(nullptr, nullptr);
        return out;
    });
    const std::string info = std::to_string(LOG_AUTHPRIV | LOG_INFO) + "\\|Credentials:\\d+ WARNING: ";
    const std::string err = std::to_string(LOG_AUTHPRIV | LOG_ERR) + "\\|Credentials:\\d+ ERROR: ";
    const std::string u = std::to_string(a.uid);
    const std::string g = std::to_string(a.gid);
    const std::string gids = "\\(" + g + ", " + g + ", " + g + "\\)\n";
    const std::string uids = "\\(" + u + ", " + u + ", " + u + "\\)\n";
    EXPECT_TRUE(std::regex_search(lines, std::regex(info + "setresgid" + gids))) << lines;
    EXPECT_TRUE(std::regex_search(lines, std::regex(info + "setresuid" + uids))) << lines;
    EXPECT_TRUE(std::regex_search(lines, std::regex(err + "setresuid\\(-1, 0, -1\\) \\[.+\\]\n"))) << lines;
    EXPECT_EQ(std::string::npos, lines.find("regained root")) << lines;
}

// "system" from a process that is plain root already changes and logs
// nothing; root carrying another group still has its groups reset.
TEST_F(Credentials, SystemFromPlainRootIsAlreadyDone)
{
    const VELA::Test::TestAccount& a = account_;
    EXPECT_EQ("", InChild([&] {
        std::string errors;
        const gid_t zero = 0;
        Check(errors, setgroups(1, &zero) == 0 && setresgid(0, 0, 0) == 0, "cannot become plain root");
        std::string lines;
        VELA::System::LogSetSink([](int, const char* line, void* arg) { *static_cast<std::string*>(arg) += line; },
                                 &lines);
        Check(errors, ResetCredentialsForRunAs("system", false), "plain root refused");
        Check(errors, lines.empty(), "logged: " + lines);
        const gid_t extra[] = {0, a.suppGid};
        Check(errors, setgroups(2, extra) == 0, "cannot add a group");
        Check(errors, ResetCredentialsForRunAs("system", false), "root with a group refused");
        Check(errors, !Has(Groups(), a.suppGid), "extra group kept");
        Check(errors, lines.find("WARNING: setresgid(0, 0, 0)") != std::string::npos, "no switch logged: " + lines);
        VELA::System::LogSetSink(nullptr, nullptr);
        return errors;
    }));
}

TEST_F(Credentials, UnknownAndHostileNamesChangeNothing)
{
    EXPECT_EQ("", InChild([] {
        std::string errors;
        const std::string before = Ids();
        const std::string longName(256, 'a');
        for (const char* name : {"vela-no-such-user-x", "", "a/b", "a:b", "a\nb", "..", longName.c_str()}) {
            Check(errors, !ResetCredentialsByName(name, true), std::string("accepted ") + name);
            Check(errors, !ResetCredentialsForRunAs(name, true), std::string("run-as accepted ") + name);
        }
        Check(errors, !ResetCredentialsByName(nullptr, true), "accepted null");
        Check(errors, Ids() == before && geteuid() == 0, "ids changed: " + Ids());
        return errors;
    }));
}

// The owner and group of the file, with the path resolved under the root.
TEST_F(Credentials, ExecutableOwnerAndGroup)
{
    VELA::Test::WriteFile(In("/check.so"), "");
    ASSERT_EQ(0, chown(In("/check.so").c_str(), account_.uid, account_.suppGid));

    const VELA::Test::TestAccount& a = account_;
    EXPECT_EQ("", InChild([&] {
        std::string errors;
        Check(errors, !InitCredentialsByExecutable("/", 1), "accepted a directory");
        Check(errors, !InitCredentialsByExecutable("/missing.so", 1), "accepted a missing file");
        Check(errors, geteuid() == 0, "failed calls changed the ids");
        if (!InitCredentialsByExecutable("/check.so", 1)) {
            return errors + "switch failed";
        }
        Check(errors, Ids() == Want(a.uid, a.uid, 0, a.suppGid, a.suppGid, a.suppGid), "ids " + Ids());
        Check(errors, Has(Groups(), a.gid), "owner's own group missing");
        Check(errors, setresuid(0, 0, 0) == 0, "cannot return to root");
        return errors;
    }));
}

}  // namespace
