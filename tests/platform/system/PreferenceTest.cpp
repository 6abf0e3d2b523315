// Preference directories of users and groups.

#include <grp.h>
#include <pwd.h>

#include "platform/PlatformTest.h"

namespace {

class Preference : public RootTest {
protected:
    bool Exists(const std::string& relative) { return access(In(relative).c_str(), F_OK) == 0; }
};

// Names and buffers are checked before any path is made; a valid name gets a
// private directory, a symbolic link planted as the leaf is refused.
TEST_F(Preference, PrivateDirectoryOnlyForValidNames)
{
    char buf[4096];
    const std::string longName(256, 'a');
    for (const char* name : {"", ".", "..", "../x", "a/b", "/", "a\nb", "tab\there", "del\x7f", longName.c_str()}) {
        EXPECT_EQ(-1, VELAUserPreferenceDirGet(name, buf, sizeof(buf))) << name;
        EXPECT_EQ(-1, VELAGroupPreferenceDirGet(name, buf, sizeof(buf))) << name;
    }
    EXPECT_EQ(-1, VELAUserPreferenceDirGet(nullptr, buf, sizeof(buf)));
    const std::string bob = In("/var/lib/vela/preference/user/bob");
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("bob", buf, bob.size()));  // no room for the NUL
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("bob", nullptr, 0));
    EXPECT_FALSE(Exists("/var"));

    ASSERT_EQ(0, VELAUserPreferenceDirGet("bob", buf, bob.size() + 1));
    EXPECT_EQ(bob, buf);
    struct stat st;
    ASSERT_EQ(0, lstat(bob.c_str(), &st));
    EXPECT_EQ(static_cast<mode_t>(S_IFDIR | 0700), st.st_mode & (S_IFMT | 07777));
    ASSERT_EQ(0, VELAUserPreferenceDirGet("bob", buf, sizeof(buf)));  // existing is fine
    ASSERT_EQ(0, VELAGroupPreferenceDirGet("staff team", buf, sizeof(buf)));
    EXPECT_EQ(In("/var/lib/vela/preference/group/staff team"), buf);
    ASSERT_EQ(0, VELAUserPreferenceDirGet(std::string(255, 'a').c_str(), buf, sizeof(buf)));
    ASSERT_EQ(0, VELAUserPreferenceDirGet("..a", buf, sizeof(buf)));

    ASSERT_EQ(0, mkdir(In("/elsewhere").c_str(), 0755));
    ASSERT_EQ(0, symlink(In("/elsewhere").c_str(), In("/var/lib/vela/preference/user/eve").c_str()));
    EXPECT_EQ(-1, VELAUserPreferenceDirGet("eve", buf, sizeof(buf)));
}

TEST_F(Preference, OwnedByTheUserWhenRoot)
{
    const struct passwd* pw = getpwnam("nobody");
    const struct group* gr = getgrnam("nogroup");
    if (geteuid() != 0 || pw == nullptr || gr == nullptr) {
        GTEST_SKIP() << "chown needs root, and the user nobody and group nogroup";
    }
    const std::pair<uid_t, gid_t> user(pw->pw_uid, pw->pw_gid), group(0, gr->gr_gid);
    const auto owner = [](int (*get)(const char*, char*, size_t), const char* name) {
        char buf[4096];
        struct stat st;
        EXPECT_EQ(0, get(name, buf, sizeof(buf))) << name;
        return stat(buf, &st) == 0 ? std::make_pair(st.st_uid, st.st_gid) : std::make_pair(uid_t(-1), gid_t(-1));
    };
    EXPECT_EQ(user, owner(VELAUserPreferenceDirGet, "nobody"));
    EXPECT_EQ(0u, owner(VELAUserPreferenceDirGet, "no-such-user-xyz").first);  // unknown names stay root's
    EXPECT_EQ(group, owner(VELAGroupPreferenceDirGet, "nogroup"));
}

}  // namespace
