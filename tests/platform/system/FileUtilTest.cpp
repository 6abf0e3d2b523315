// File helpers of the platform: opening a path without following any
// symbolic link on it.
#include <cerrno>
#include <fcntl.h>

#include "platform/PlatformTest.h"
#include "platform/system/FileUtil.h"

namespace {

// A link anywhere on the path, the last component or a directory on the
// way, is refused by both ways of resolving; everything else opens alike.
TEST(FileUtil, OpenNoSymlinksRefusesEveryLinkOnThePath)
{
    VELA::Test::TempDir root;
    const std::string files = root.Path() + "/files";
    ASSERT_EQ(0, mkdir(files.c_str(), 0755));
    VELA::Test::MakeLinkTree(files);
    const std::string target = files + "/target.txt";
    const std::string inDir = files + "/dir/in.txt";

    using VELA::System::NoSymlinkResolve;
    const std::pair<std::string, int> cases[] = {  // the path and its errno, 0 when it opens
        {inDir, 0}, {files + "/dir/../dir/./in.txt", 0}, {files + "//dir///in.txt", 0},
        {"files/dir/in.txt", 0},  // relative to the working directory
        {files + "/last", ELOOP}, {files + "/middle/in.txt", ELOOP}, {"files/relative/in.txt", ELOOP},
        {files + "/middle/../target.txt", ELOOP}, {files + "/dir/in.txt/", ENOTDIR}, {target + "/x", ENOTDIR},
        {files + "/missing/x", ENOENT}, {"", EINVAL}, {std::string(5000, 'a'), ENAMETOOLONG},
    };
    char cwd[4096];
    ASSERT_NE(nullptr, getcwd(cwd, sizeof(cwd)));
    ASSERT_EQ(0, chdir(root.Path().c_str()));
    for (const auto& [path, want] : cases) {
        for (NoSymlinkResolve how : {NoSymlinkResolve::kAuto, NoSymlinkResolve::kWalk}) {
            errno = 0;
            const int fd = VELA::System::OpenNoSymlinks(path, O_RDONLY, how);
            EXPECT_EQ(want, fd < 0 ? errno : 0)
                << path.substr(0, 80) << (how == NoSymlinkResolve::kWalk ? " (walk)" : "");
            if (fd >= 0) {
                char byte = 0;
                EXPECT_EQ(1, read(fd, &byte, 1));
                EXPECT_EQ('i', byte);
                close(fd);
            }
        }
    }
    EXPECT_EQ(0, chdir(cwd));
}

}  // namespace
