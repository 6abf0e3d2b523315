// Data volumes from <root>/etc/vela/volumes.conf.
#include <gtest/gtest.h>

#include <climits>
#include <cstdio>
#include <string>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include "support/TestSupport.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"

namespace {

class Volume : public ::testing::Test {
protected:
    Volume() : env_("VELA_ROOT", root_.Path().c_str())
    {
        VELA::System::RootReset();
        for (const char* dir : {"/etc", "/etc/vela", "/volume1", "/volume2"}) {
            mkdir((root_.Path() + dir).c_str(), 0755);
        }
    }
    ~Volume() override
    {
        if (!mounted_.empty()) {
            umount2(mounted_.c_str(), MNT_DETACH);
        }
        VELA::System::RootReset();
    }

    void Conf(const std::string& text)
    {
        FILE* f = fopen((root_.Path() + "/etc/vela/volumes.conf").c_str(), "w");
        ASSERT_NE(nullptr, f);
        fputs(text.c_str(), f);
        fclose(f);
    }

    VELA::Test::TempDir root_;
    VELA::Test::ScopedEnv env_;
    std::string mounted_;
};

TEST_F(Volume, NoneConfiguredMeansNoVolume)
{
    VOLUME_INFO info;
    EXPECT_EQ(0, VolumeAvailGet(1, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_STREQ("", info.szMountPath);
    EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
    Conf("# nothing here\n\n");
    EXPECT_EQ(0, VolumeAvailGet(1, &info, 0, 0));
    EXPECT_EQ(-1, VolumeAvailGet(1, nullptr, 0, 0));
    EXPECT_EQ(-1, VolumeAvailGet(1, &info, 0, 0x2));
    EXPECT_EQ(-1, VolumeAvailGet(ULLONG_MAX, &info, 1, 0));  // the sum overflows
}

TEST_F(Volume, FirstListedWithRoomWins)
{
    FILE* f = fopen((root_.Path() + "/etc/vela/notadir").c_str(), "w");
    ASSERT_NE(nullptr, f);
    fclose(f);
    Conf("relative/path\n/volume1/../..\n/missing\n/etc/vela/notadir\n  /volume2  \n/volume1\n");
    VOLUME_INFO info;
    ASSERT_EQ(1, VolumeAvailGet(1, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(root_.Path() + "/volume2", info.szMountPath);
    EXPECT_GT(info.ullFreeBytes, 0u);
    EXPECT_GE(info.ullTotalBytes, info.ullFreeBytes);

    EXPECT_EQ(0, VolumeAvailGet(info.ullTotalBytes + 1, &info, 0, 0));
    EXPECT_EQ(VLIBC_ERR_NO_SPACE, VLIBCErrGet());
    EXPECT_EQ(0, VolumeAvailGet(1, &info, ULLONG_MAX - 1, 0));  // the reserve counts too
}

// Distinct free space needs a file system of its own: a small tmpfs (root
// only).
TEST_F(Volume, SkipsFullAndReadOnlyVolumes)
{
    const std::string small = root_.Path() + "/volume1";
    if (geteuid() != 0 || mount("tmpfs", small.c_str(), "tmpfs", 0, "size=1m") != 0) {
        GTEST_SKIP() << "mounting a tmpfs needs root";
    }
    mounted_ = small;
    Conf("/volume1\n/volume2\n");
    VOLUME_INFO info;
    ASSERT_EQ(1, VolumeAvailGet(4096, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(small, info.szMountPath);
    ASSERT_EQ(1, VolumeAvailGet(2 * 1024 * 1024, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(root_.Path() + "/volume2", info.szMountPath);

    ASSERT_EQ(0, mount("tmpfs", small.c_str(), "tmpfs", MS_REMOUNT | MS_RDONLY, "size=1m"));
    ASSERT_EQ(1, VolumeAvailGet(4096, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(root_.Path() + "/volume2", info.szMountPath);
    ASSERT_EQ(1, VolumeAvailGet(4096, &info, 0, 0));
    EXPECT_EQ(small, info.szMountPath);
    EXPECT_EQ(1, info.blReadOnly);
}

}  // namespace
