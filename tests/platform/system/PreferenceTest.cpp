// Preference directories of users and groups.
#include <gtest/gtest.h>

#include <grp.h>
#include <pwd.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "support/TestSupport.h"
#include "vela/vlibc.h"

namespace {

class Preference : public ::testing::Test {
protected:
    Preference() : env_("VELA_ROOT", root_.Path().c_str()) { VELA::System::RootReset(); }
    ~Preference() override { VELA::System::RootReset(); }

    bool Exists(const std::string& relative)
    {
        struct stat st;
        return lstat((root_.Path() + relative).c_str(), &st) == 0;
    }

    VELA::Test::TempDir root_;
    VELA::Test::ScopedEnv env_;
};

TEST_F(Preference, CreatesPrivateDirectory)
{
    char buf[4096];
    ASSERT_EQ(0, VELAUserPreferenceDirGet("alice", buf, sizeof(buf)));
    const std::string want = root_.Path() + "/var/lib/vela/preference/user/alice";
    EXPECT_EQ(want, buf);
    struct stat st;
    ASSERT_EQ(0, lstat(want.c_str(), &st));
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(0700u, st.st_mode & 07777);

    ASSERT_EQ(0, VELAUserPreferenceDirGet("alice", buf, sizeof(buf)));  // existing is fine
    ASSERT_EQ(0, VELAGroupPreferenceDirGet("staff team", buf, sizeof(buf)));
    EXPECT_EQ(root_.Path() + "/var/lib/vela/preference/group/staff team", buf);
}

TEST_F(Preference, HostileNamesCreateNothing)
{
    char buf[4096];
    const std::string longName(256, 'a');
    for (const char* name : {"", ".", "..", "../x", "a/b", "/", "a\nb", "tab\there", "del\x7f", longName.c_str()}) {
        EXPECT_EQ(-1, VELAUserPreferenceDirGet(name, buf, sizeof(buf))) << name;
        EXPECT_EQ(-1, VELAGroupPreferenceDirGet(name, buf, sizeof(buf))) << name;
    }
    EXPECT_EQ(-1, VELAUserPreferenceDirGet(nullptr, buf, sizeof(buf)));
    EXPECT_FALSE(Exists("/var"));  // validation ran before any path was made

    ASSERT_EQ(0, VELAUserPreferenceDirGet(std::string(255, 'a').c_str(), buf, sizeof(buf)));
    ASSERT_EQ(0, VELAUserPreferenceDirGet("..a", buf, sizeof(buf)));
}

TEST_F(Preference, SmallBufferAndSymlinkLeaf)
{
    const std::string want = root_.Path() + "/var/lib/vela/preference/user/bob";
    char buf[512];
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("bob", buf, want.size()));  // no room for the NUL
    EXPECT_FALSE(Exists("/var"));
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("bob", nullptr, 0));
    ASSERT_EQ(0, VELAUserPreferenceDirGet("bob", buf, want.size() + 1));
    EXPECT_EQ(want, buf);

    // A symbolic link planted as the leaf is refused, not followed.
    const std::string elsewhere = root_.Path() + "/elsewhere";
    ASSERT_EQ(0, mkdir(elsewhere.c_str(), 0755));
    ASSERT_EQ(0, symlink(elsewhere.c_str(), (root_.Path() + "/var/lib/vela/preference/user/eve").c_str()));
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("eve", buf, sizeof(buf)));
}

TEST_F(Preference, OwnedByTheUserWhenRoot)
{
    if (geteuid() != 0) {
        GTEST_SKIP() << "chown needs root";
    }
    struct passwd* pw = getpwnam("nobody");
    if (pw == nullptr) {
        GTEST_SKIP() << "no user nobody";
    }
    const uid_t uid = pw->pw_uid;
    const gid_t gid = pw->pw_gid;
    char buf[4096];
    ASSERT_EQ(0, VELAUserPreferenceDirGet("nobody", buf, sizeof(buf)));
    struct stat st;
    ASSERT_EQ(0, stat(buf, &st));
    EXPECT_EQ(uid, st.st_uid);
    EXPECT_EQ(gid, st.st_gid);

    // Unknown names stay owned by root.
    ASSERT_EQ(0, VELAUserPreferenceDirGet("no-such-user-xyz", buf, sizeof(buf)));
    ASSERT_EQ(0, stat(buf, &st));
    EXPECT_EQ(0u, st.st_uid);

    struct group* gr = getgrnam("nogroup");
    if (gr != nullptr) {
        const gid_t groupId = gr->gr_gid;
        ASSERT_EQ(0, VELAGroupPreferenceDirGet("nogroup", buf, sizeof(buf)));
        ASSERT_EQ(0, stat(buf, &st));
        EXPECT_EQ(0u, st.st_uid);
        EXPECT_EQ(groupId, st.st_gid);
    }
}

}  // namespace
