// The system root: VELA_ROOT, read once, and the paths resolved under it.
#include "platform/PlatformTest.h"
#include "vela/sysfile.h"

namespace {

TEST(Root, DefaultAndTrailingSlashes)
{
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", nullptr);
        VELA::System::RootReset();
        EXPECT_EQ("/", VELA::System::Root());
        EXPECT_EQ("/etc/velainfo.conf", VELA::System::Path("/etc/velainfo.conf"));
        EXPECT_EQ(1, VLIBCFileExist("/proc/self/status"));  // a path of the system, used as it is
    }
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", "/tmp/r//");
        VELA::System::RootReset();
        EXPECT_EQ("/tmp/r", VELA::System::Root());
        EXPECT_EQ("/tmp/r/etc/velainfo.conf", VELA::System::Path("/etc/velainfo.conf"));
    }
    {
        // Cached until reset.
        VELA::Test::ScopedEnv env("VELA_ROOT", "relative/dir");
        EXPECT_EQ("/tmp/r", VELA::System::Root());
        VELA::System::RootReset();
        EXPECT_EQ("/", VELA::System::Root());
    }
    VELA::System::RootReset();
}

}  // namespace
