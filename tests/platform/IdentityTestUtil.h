// Helpers of the identity tests: real accounts made with useradd/groupadd
// (root only) and checks run in a forked child, so the test process keeps
// its own identity whatever the code under test does.
#pragma once

#include <functional>
#include <grp.h>
#include <pwd.h>
#include <string>
#include <vector>

#include "platform/PlatformTest.h"

namespace VELA {
namespace Test {

// Runs a program (no shell), its output discarded. True when it exits 0.
inline bool RunProgram(const std::vector<std::string>& args) { return Exited0(RunTool(args)); }

// Runs `body` in a forked child and returns what it returned ("" means every
// check passed), or a description of how the child died. The report file is
// opened before `body` runs, so the child may give up its identity.
inline std::string InChild(const std::function<std::string()>& body)
{
    TempDir io;
    const std::string report = io.Path() + "/report";
    const std::vector<int> codes = InChildren(1, [&](int) {
        std::ofstream out(report, std::ios::binary);
        out << body();
        return out ? 0 : 1;
    });
    const bool died = codes != std::vector<int>{0};
    return ReadText(report) + (died ? " [child died, status " + std::to_string(codes[0]) + "]" : "");
}

// An unprivileged system user vela-t-<pid> with its own primary group and
// the supplementary group vela-tg-<pid>. Remove() deletes both (and is safe
// to call after a partial Create()).
struct TestAccount {
    std::string user = "vela-t-" + std::to_string(getpid());
    std::string supp = "vela-tg-" + std::to_string(getpid());
    uid_t uid = 0;
    gid_t gid = 0;
    gid_t suppGid = 0;

    bool Create()
    {
        if (!RunProgram({"/usr/sbin/groupadd", "--system", supp}) ||
            !RunProgram({"/usr/sbin/useradd", "--system", "--no-create-home", "--shell", "/usr/sbin/nologin",
                         "--user-group", "--groups", supp, user})) {
            return false;
        }
        const struct passwd* pw = getpwnam(user.c_str());
        const struct group* gr = getgrnam(supp.c_str());
        if (pw == nullptr || gr == nullptr) {
            return false;
        }
        uid = pw->pw_uid;
        gid = pw->pw_gid;
        suppGid = gr->gr_gid;
        return uid != 0 && gid != 0;
    }

    void Remove()
    {
        RunProgram({"/usr/sbin/userdel", user});
        RunProgram({"/usr/sbin/groupdel", user});  // the user's own group, if userdel left it
        RunProgram({"/usr/sbin/groupdel", supp});
    }
};

}  // namespace Test
}  // namespace VELA

// A fresh root and a test account (TestAccount); skipped without root.
class AccountTest : public RootTest {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) {
            GTEST_SKIP() << "test accounts need root";
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
