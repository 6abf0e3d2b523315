// Data volumes from <root>/etc/vela/volumes.conf.

#include <climits>
#include <sys/mount.h>

#include "platform/PlatformTest.h"
#include "vela/sysfile.h"

namespace {

class Volume : public RootTest {
protected:
    Volume()
    {
        mkdir(In("/volume1").c_str(), 0755);
        mkdir(In("/volume2").c_str(), 0755);
    }
    ~Volume() override
    {
        if (!mounted_.empty()) {
            umount2(mounted_.c_str(), MNT_DETACH);
        }
    }

    std::string mounted_;
};

TEST_F(Volume, NoneConfiguredMeansNoVolumeElseTheFirstWithRoom)
{
    VOLUME_INFO info;
    EXPECT_EQ(0, VolumeAvailGet(1, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_STREQ("", info.szMountPath);
    EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
    Conf("volumes.conf", "# nothing here\n\n");
    EXPECT_EQ(0, VolumeAvailGet(1, &info, 0, 0));
    EXPECT_EQ(-1, VolumeAvailGet(1, nullptr, 0, 0));
    EXPECT_EQ(-1, VolumeAvailGet(1, &info, 0, 0x2));
    EXPECT_EQ(-1, VolumeAvailGet(ULLONG_MAX, &info, 1, 0));  // the sum overflows

    // The first listed with room wins.
    Conf("notadir", "");
    Conf("volumes.conf", "relative/path\n/volume1/../..\n/missing\n/etc/vela/notadir\n  /volume2  \n/volume1\n");
    ASSERT_EQ(1, VolumeAvailGet(1, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(In("/volume2"), info.szMountPath);
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
    const std::string small = In("/volume1");
    if (geteuid() != 0 || mount("tmpfs", small.c_str(), "tmpfs", 0, "size=1m") != 0) {
        GTEST_SKIP() << "mounting a tmpfs needs root";
    }
    mounted_ = small;
    Conf("volumes.conf", "/volume1\n/volume2\n");
    VOLUME_INFO info;
    ASSERT_EQ(1, VolumeAvailGet(4096, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(small, info.szMountPath);
    ASSERT_EQ(1, VolumeAvailGet(2 * 1024 * 1024, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(In("/volume2"), info.szMountPath);

    ASSERT_EQ(0, mount("tmpfs", small.c_str(), "tmpfs", MS_REMOUNT | MS_RDONLY, "size=1m"));
    ASSERT_EQ(1, VolumeAvailGet(4096, &info, 0, VOLUME_AVAIL_WRITABLE));
    EXPECT_EQ(In("/volume2"), info.szMountPath);
    ASSERT_EQ(1, VolumeAvailGet(4096, &info, 0, 0));
    EXPECT_EQ(small, info.szMountPath);
    EXPECT_EQ(1, info.blReadOnly);
}

}  // namespace
