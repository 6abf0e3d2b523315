// Identity switches, checked on a real unprivileged account in a forked
// child (the test process keeps root). Needs root: skipped otherwise.

#include <algorithm>
#include <cstdio>
#include <grp.h>
#include <regex>

#include "platform/IdentityTestUtil.h"
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

bool HasGroup(gid_t g)
{
    std::vector<gid_t> groups(static_cast<size_t>(getgroups(0, nullptr)));
    groups.resize(static_cast<size_t>(getgroups(static_cast<int>(groups.size()), groups.data())));
    return std::find(groups.begin(), groups.end(), g) != groups.end();
}

// The checks that failed in a child, "what; " each; a check gives back `ok`.
struct Errors {
    std::string text;
    bool operator()(bool ok, const std::string& what)
    {
        text += ok ? "" : what + "; ";
        return ok;
    }
};

class Credentials : public AccountTest {
protected:
    // Runs `checks` in a forked child: "" when every check held.
    static std::string InChildChecks(const std::function<void(Errors&)>& checks)
    {
        return InChild([&] {
            Errors check;
            checks(check);
            return check.text;
        });
    }

    const VELA::Test::TestAccount& a = account_;
};

TEST_F(Credentials, SwitchDropsRootForGood)
{
    EXPECT_EQ("", InChildChecks([&](Errors& check) {
        if (check(ResetCredentialsByName(a.user.c_str(), false), "switch failed")) {
            check(Ids() == Want(a.uid, a.uid, a.uid, a.gid, a.gid, a.gid), "ids " + Ids());
            check(HasGroup(a.suppGid), "supplementary group missing");
            check(!HasGroup(0), "root group kept");
            check(setresuid(0, 0, 0) != 0, "could return to root");
            check(setgroups(0, nullptr) != 0, "could change groups");
        }
    }));
}

TEST_F(Credentials, GrantableKeepsTheWayBack)
{
    EXPECT_EQ("", InChildChecks([&](Errors& check) {
        if (!check(ResetCredentialsByName(a.user.c_str(), true), "switch failed")) {
            return;
        }
        check(Ids() == Want(a.uid, a.uid, 0, a.gid, a.gid, a.gid), "ids " + Ids());
        check(HasGroup(a.suppGid), "supplementary group missing");
        check(setresuid(0, 0, 0) == 0 && geteuid() == 0, "cannot return to root");
        // And back again; the account named "system" is no way to root (it
        // is refused without such an account); the run-as "system" is the
        // superuser with root's groups.
        check(ResetCredentialsByName(a.user.c_str(), true), "second switch failed");
        check(Ids() == Want(a.uid, a.uid, 0, a.gid, a.gid, a.gid), "ids after second switch " + Ids());
        if (ResetCredentialsByName("system", true)) {
            check(geteuid() != 0, "the account name system switched to root");
        }
        check(ResetCredentialsForRunAs("system", false), "switch to system failed");
        check(Ids() == Want(0, 0, 0, 0, 0, 0), "ids as system " + Ids());
        check(!HasGroup(a.suppGid), "user's group kept");
    }));
}

// Log lines of the switch go to the authorisation facility in the fixed
// forms; a refused regain of root is logged with the ERROR form.
TEST_F(Credentials, LogsEverySwitch)
{
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
    EXPECT_EQ("", InChildChecks([&](Errors& check) {
        const gid_t zero = 0;
        check(setgroups(1, &zero) == 0 && setresgid(0, 0, 0) == 0, "cannot become plain root");
        std::string lines;
        VELA::System::LogSetSink([](int, const char* line, void* arg) { *static_cast<std::string*>(arg) += line; },
                                 &lines);
        check(ResetCredentialsForRunAs("system", false), "plain root refused");
        check(lines.empty(), "logged: " + lines);
        const gid_t extra[] = {0, a.suppGid};
        check(setgroups(2, extra) == 0, "cannot add a group");
        check(ResetCredentialsForRunAs("system", false), "root with a group refused");
        check(!HasGroup(a.suppGid), "extra group kept");
        check(lines.find("WARNING: setresgid(0, 0, 0)") != std::string::npos, "no switch logged: " + lines);
        VELA::System::LogSetSink(nullptr, nullptr);
    }));
}

TEST_F(Credentials, UnknownAndHostileNamesChangeNothing)
{
    EXPECT_EQ("", InChildChecks([](Errors& check) {
        const std::string before = Ids();
        const std::string longName(256, 'a');
        for (const char* name : {"vela-no-such-user-x", "", "a/b", "a:b", "a\nb", "..", longName.c_str()}) {
            check(!ResetCredentialsByName(name, true), std::string("accepted ") + name);
            check(!ResetCredentialsForRunAs(name, true), std::string("run-as accepted ") + name);
        }
        check(!ResetCredentialsByName(nullptr, true), "accepted null");
        check(Ids() == before && geteuid() == 0, "ids changed: " + Ids());
    }));
}

// The owner and group of the file, with the path resolved under the root.
TEST_F(Credentials, ExecutableOwnerAndGroup)
{
    VELA::Test::WriteFile(In("/check.so"), "");
    ASSERT_EQ(0, chown(In("/check.so").c_str(), a.uid, a.suppGid));
    EXPECT_EQ("", InChildChecks([&](Errors& check) {
        check(!InitCredentialsByExecutable("/", 1), "accepted a directory");
        check(!InitCredentialsByExecutable("/missing.so", 1), "accepted a missing file");
        check(geteuid() == 0, "failed calls changed the ids");
        if (check(InitCredentialsByExecutable("/check.so", 1), "switch failed")) {
            check(Ids() == Want(a.uid, a.uid, 0, a.suppGid, a.suppGid, a.suppGid), "ids " + Ids());
            check(HasGroup(a.gid), "owner's own group missing");
            check(setresuid(0, 0, 0) == 0, "cannot return to root");
        }
    }));
}

}  // namespace
