// Preference directories of users and groups.

#include <grp.h>
#include <pwd.h>

#include "platform/PlatformTest.h"

namespace {

class Preference : public RootTest {
protected:
    bool Exists(const std::string& relative) { return access(In(relative).c_str(), F_OK) == 0; }
};

TEST_F(Preference, CreatesPrivateDirectory)
{
    char buf[4096];
    ASSERT_EQ(0, VELAUserPreferenceDirGet("alice", buf, sizeof(buf)));
    const std::string want = In("/var/lib/vela/preference/user/alice");
    EXPECT_EQ(want, buf);
    struct stat st;
    ASSERT_EQ(0, lstat(want.c_str(), &st));
    EXPECT_EQ(static_cast<mode_t>(S_IFDIR | 0700), st.st_mode & (S_IFMT | 07777));

    ASSERT_EQ(0, VELAUserPreferenceDirGet("alice", buf, sizeof(buf)));  // existing is fine
    ASSERT_EQ(0, VELAGroupPreferenceDirGet("staff team", buf, sizeof(buf)));
    EXPECT_EQ(In("/var/lib/vela/preference/group/staff team"), buf);
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
    const std::string want = In("/var/lib/vela/preference/user/bob");
    char buf[512];
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("bob", buf, want.size()));  // no room for the NUL
    EXPECT_FALSE(Exists("/var"));
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("bob", nullptr, 0));
    ASSERT_EQ(0, VELAUserPreferenceDirGet("bob", buf, want.size() + 1));
    EXPECT_EQ(want, buf);

    // A symbolic link planted as the leaf is refused, not followed.
    ASSERT_EQ(0, mkdir(In("/elsewhere").c_str(), 0755));
    ASSERT_EQ(0, symlink(In("/elsewhere").c_str(), In("/var/lib/vela/preference/user/eve").c_str()));
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
