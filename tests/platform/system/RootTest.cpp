// The system root: VELA_ROOT, read once, and the paths resolved under it.
#include <gtest/gtest.h>

#include <string>

#include "support/TestSupport.h"
#include "vela/vlibc.h"

namespace {

TEST(Root, DefaultAndTrailingSlashes)
{
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", nullptr);
        VELA::VelaRootReset();
        EXPECT_EQ("/", VELA::VelaRoot());
        EXPECT_EQ("/etc/velainfo.conf", VELA::VelaPath("/etc/velainfo.conf"));
    }
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", "/tmp/r//");
        VELA::VelaRootReset();
        EXPECT_EQ("/tmp/r", VELA::VelaRoot());
        EXPECT_EQ("/tmp/r/etc/velainfo.conf", VELA::VelaPath("/etc/velainfo.conf"));
    }
    {
        // Cached until reset.
        VELA::Test::ScopedEnv env("VELA_ROOT", "relative/dir");
        EXPECT_EQ("/tmp/r", VELA::VelaRoot());
        VELA::VelaRootReset();
        EXPECT_EQ("/", VELA::VelaRoot());
    }
    VELA::VelaRootReset();
}

}  // namespace
