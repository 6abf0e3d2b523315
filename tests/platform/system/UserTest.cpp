// Users, administrators and application privileges.
#include <grp.h>
#include <pwd.h>

#include "platform/IdentityTestUtil.h"
#include "vela/user.h"

namespace {

TEST(UserLookup, HostileNamesAreRefusedAndRecordsComeFromNss)
{
    uid_t uid = 1;
    gid_t gid = 1;
    const std::string longName(256, 'a');
    for (const char* name : {"", "a/b", "a:b", "a\nb", "del\x7f", ".", "..", longName.c_str()}) {
        EXPECT_EQ(-1, VELAUserGetUGID(name, &uid, &gid)) << name;
        EXPECT_EQ(-1, VLIBGroupIsAdminGroupMem(name, 0)) << name;
        EXPECT_EQ(0, VLIBAppPrivUserHas(name, "VELA.App", "127.0.0.1")) << name;
        EXPECT_EQ(0, VELAUserNameIsValid(name)) << name;
    }
    EXPECT_EQ(-1, VELAUserGetUGID(nullptr, &uid, &gid));
    EXPECT_EQ(-1, VELAUserGetUGID("root", nullptr, &gid));
    EXPECT_EQ(-1, VLIBGroupIsAdminGroupMem("root", 1));  // unknown flags
    EXPECT_EQ(1, VELAUserNameIsValid("CORP\\bob"));
    EXPECT_EQ(1, VELAUserNameIsValid("bob@realm"));

    // The records come from NSS.
    PVELAUSER user = nullptr;
    ASSERT_EQ(0, VELAUserGetByUID(0, &user));
    EXPECT_STREQ(getpwuid(0)->pw_name, user->szName);
    VELAUserFree(user);
    ASSERT_EQ(0, VELAUserGetByName(getpwuid(0)->pw_name, &user));
    EXPECT_EQ(0u, user->uid);
    VELAUserFree(user);
    EXPECT_EQ(-1, VELAUserGetUGID("vela-no-such-user-x", &uid, &gid));
    EXPECT_EQ(-1, VELAUserGetByName("vela-no-such-user-x", &user));
    EXPECT_EQ(nullptr, user);
}

// "system" is the superuser as a run-as name only; as a user name it is
// looked up like any other, so it is root only if an account of that name
// has uid 0 (no machine of the tests has one).
TEST(UserLookup, SystemIsTheSuperuserOnlyAsRunAsName)
{
    uid_t uid = 1;
    gid_t gid = 1;
    ASSERT_EQ(0, VELA::System::RunAsGetUGID(VELA_RUNAS_SUPERUSER, &uid, &gid));
    EXPECT_EQ(0u, uid + gid);
    EXPECT_EQ(1, VELA::System::RunAsIsSuperuser("system"));
    for (const char* other : {"System", "system ", "root", "", static_cast<const char*>(nullptr)}) {
        EXPECT_EQ(0, VELA::System::RunAsIsSuperuser(other)) << (other ? other : "null");
    }
    ASSERT_EQ(0, VELA::System::RunAsGetUGID("root", &uid, &gid));  // any other run-as name is an account
    EXPECT_EQ(0u, uid);

    uid = 0;
    const bool found = VELAUserGetUGID("system", &uid, &gid) == 0;
    EXPECT_FALSE(found && uid == 0) << "the name \"system\" was taken for root";
    PVELAUSER user = nullptr;
    if (VELAUserGetByName("system", &user) == 0) {
        EXPECT_NE(0u, user->uid);
        EXPECT_STREQ("system", user->szName);
    }
    VELAUserFree(user);
    EXPECT_NE(1, VLIBGroupIsAdminGroupMem("system", 0));
}

// Privileges of an ordinary existing account ("nobody", primary group
// "nogroup" on Debian); no root needed.
class UserAppPriv : public RootTest {
protected:
    void SetUp() override
    {
        const struct passwd* pw = getpwnam("nobody");
        const struct group* gr = getgrnam("nogroup");
        if (pw == nullptr || gr == nullptr || pw->pw_gid != gr->gr_gid) {
            GTEST_SKIP() << "needs the account nobody with primary group nogroup";
        }
    }
};

TEST_F(UserAppPriv, UsersGroupsAndAddresses)
{
    // A missing or corrupt file leaves the administrators only.
    EXPECT_EQ(0, VLIBAppPrivUserHas("nobody", "VELA.Photo", "10.0.0.1"));
    EXPECT_EQ(1, VLIBAppPrivUserHas("root", "VELA.Photo", "10.0.0.1"));
    Conf("app_privileges.json", R"({"applications": {"VELA.Photo": {"users": ["nobody"]})");  // cut short
    EXPECT_EQ(0, VLIBAppPrivUserHas("nobody", "VELA.Photo", "10.0.0.1"));
    EXPECT_EQ(1, VLIBAppPrivUserHas("root", "VELA.Photo", nullptr));

    Conf("app_privileges.json", R"({"applications": {
        "VELA.Users": {"users": ["nobody"]},
        "VELA.Groups": {"groups": ["vela-no-such-group", "nogroup"]},
        "VELA.Lan": {"users": ["nobody"], "allow_from": ["192.168.1.0/24", "fd00::/8", "10.0.0.7"]},
        "VELA.Nowhere": {"users": ["nobody"], "allow_from": []},
        "VELA.Odd": {"users": "nobody", "groups": [7], "allow_from": "10.0.0.0/8"},
        "VELA.Others": {"users": ["root2", "nobodyx"], "groups": ["root"]}
    }})");
    const struct { const char* app; const char* ip; int has; } cases[] = {
        {"VELA.Users", nullptr, 1}, {"VELA.Groups", "", 1}, {"VELA.Others", "10.0.0.7", 0},
        {"VELA.Unlisted", "10.0.0.7", 0}, {"VELA.Odd", "10.0.0.7", 0},  // wrong types grant nothing
        {"VELA.Nowhere", "10.0.0.7", 0}, {"VELA/Users", nullptr, 0}, {"VELA.Lan", "192.168.1.200", 1},
        {"VELA.Lan", "::ffff:192.168.1.5", 1}, {"VELA.Lan", "fd12::1", 1}, {"VELA.Lan", "10.0.0.7", 1},
        {"VELA.Lan", "192.168.2.1", 0}, {"VELA.Lan", "fe80::1", 0}, {"VELA.Lan", "10.0.0.8", 0}, {"VELA.Lan", "", 0},
        {"VELA.Lan", "192.168.1.1/24", 0}, {"VELA.Lan", "junk", 0}, {"VELA.Lan", nullptr, 0},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(c.has, VLIBAppPrivUserHas("nobody", c.app, c.ip)) << c.app << " from " << (c.ip ? c.ip : "null");
    }
    EXPECT_EQ(1, VLIBAppPrivUserHas("root", "VELA.Lan", "203.0.113.9"));  // administrators: everywhere
}

// Membership of the administrators group on a real account. Needs root.
class UserAdminGroup : public AccountTest {
protected:
    void SetUp() override
    {
        AccountTest::SetUp();
        if (!IsSkipped() && !HasFatalFailure()) {
            ASSERT_TRUE(VELA::Test::RunProgram({"/usr/sbin/groupadd", "--system", admins_}));
        }
    }
    void TearDown() override
    {
        AccountTest::TearDown();
        VELA::Test::RunProgram({"/usr/sbin/groupdel", admins_});
    }

    std::string admins_ = "vela-ta-" + std::to_string(getpid());
};

TEST_F(UserAdminGroup, MembershipFollowsTheConfiguredGroup)
{
    const char* user = account_.user.c_str();
    // A supplementary group grants an application.
    Conf("app_privileges.json", "{\"applications\": {\"VELA.Team\": {\"groups\": [\"" + account_.supp + "\"]}}}");
    EXPECT_EQ(1, VLIBAppPrivUserHas(user, "VELA.Team", "10.0.0.1"));
    EXPECT_EQ(0, VLIBAppPrivUserHas("nobody", "VELA.Team", "10.0.0.1"));

    Conf("webapi.conf", "# test\ntrusted_proxies=\"127.0.0.1\"\nadmin_group=\"" + admins_ + "\"\n");
    EXPECT_EQ(0, VLIBGroupIsAdminGroupMem(user, 0));
    EXPECT_EQ(1, VLIBGroupIsAdminGroupMem("root", 0));
    EXPECT_NE(1, VLIBGroupIsAdminGroupMem("system", 0));  // a name, not the run-as superuser
    EXPECT_EQ(0, VLIBAppPrivUserHas("system", "VELA.Any", "10.0.0.1"));
    EXPECT_EQ(0, VLIBAppPrivUserHas(user, "VELA.Any", "10.0.0.1"));

    ASSERT_TRUE(VELA::Test::RunProgram({"/usr/sbin/usermod", "--append", "--groups", admins_, user}));
    EXPECT_EQ(1, VLIBGroupIsAdminGroupMem(user, 0));  // supplementary
    EXPECT_EQ(1, VLIBAppPrivUserHas(user, "VELA.Any", "10.0.0.1"));

    for (const auto& group : {std::make_pair(account_.user, 1), std::make_pair(account_.supp, 1),  // primary, other
                              std::make_pair(std::string("vela-no-such-group"), 0)}) {
        Conf("webapi.conf", "admin_group=\"" + group.first + "\"\n");
        EXPECT_EQ(group.second, VLIBGroupIsAdminGroupMem(user, 0)) << group.first;
    }

    // A configuration that cannot be trusted fails closed; root stays root.
    for (const char* bad : {"admin_group=\"a/b\"\n", "admin_group=\"" "cut\n", "not a line\n"}) {
        Conf("webapi.conf", bad);
        EXPECT_EQ(-1, VLIBGroupIsAdminGroupMem(user, 0)) << bad;
        EXPECT_EQ(0, VLIBAppPrivUserHas(user, "VELA.Any", "10.0.0.1")) << bad;
        EXPECT_EQ(1, VLIBGroupIsAdminGroupMem("root", 0)) << bad;
    }
}

}  // namespace
