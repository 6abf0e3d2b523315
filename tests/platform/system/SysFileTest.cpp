// Key=value files, files and directories, and locks.

#include <cstdlib>
#include <fcntl.h>

#include "platform/PlatformTest.h"
#include "vela/sysfile.h"

namespace {

using namespace VELA::Test;

// A system root with etc/; a second directory stands for the rest of the
// machine, which nothing may touch.
class SysFile : public RootTest {
protected:
    SysFile() { mkdir(In("/etc").c_str(), 0755); }

    TempDir outside_;
};

TEST_F(SysFile, SetReplacesOneLineAndKeepsTheRest)
{
    const std::string file = In("/etc/velainfo.conf");
    WriteFile(file, "# comment\nmodel=\"X1\"\n\nenable_data_collect=\"no\"\nother=plain\nenable_data_collect=\"maybe\"",
              0640);

    EXPECT_EQ(1, VLIBCFileCheckKeyValue("/etc/velainfo.conf", "enable_data_collect", "maybe", 0));  // last wins
    ASSERT_EQ(0, VLIBCINFOSetKeyValue("enable_data_collect", "yes"));
    EXPECT_EQ("# comment\nmodel=\"X1\"\n\nenable_data_collect=\"yes\"\nother=plain\n", ReadText(file));
    ASSERT_EQ(0, VLIBCINFOSetKeyValue("new.key-1", " a \"quoted\" value\t"));
    char buf[64];
    ASSERT_EQ(1, VLIBCINFOGetKeyValue("new.key-1", buf, sizeof(buf)));
    EXPECT_STREQ(" a \"quoted\" value\t", buf);

    EXPECT_EQ(0640u, Mode(file));
    // A path already under the root is used as it is; unknown flags match nothing.
    const struct { const char* value; int flags, match; } checks[] = {
        {"yes", 0, 1}, {"YES", 0, 0}, {"YES", VLIBC_KV_NOCASE, 1}, {"yes", 0x80, 0}};
    for (const auto& c : checks) {
        EXPECT_EQ(c.match, VLIBCFileCheckKeyValue(file.c_str(), "enable_data_collect", c.value, c.flags)) << c.value;
    }
    EXPECT_EQ(-1, VLIBCFileGetKeyValue(file.c_str(), "new.key-1", buf, 5));  // does not fit
    EXPECT_EQ(0, VLIBCFileGetKeyValue(file.c_str(), "absent", buf, sizeof(buf)));
    EXPECT_STREQ("", buf);

    EXPECT_EQ(0, VLIBCFileGetKeyValue("/etc/none.conf", "a", buf, sizeof(buf)));
    EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
    ASSERT_EQ(0, VLIBCFileSetKeyValue("/etc/new.conf", "a", ""));  // created
    EXPECT_EQ("a=\"\"\n", ReadText(In("/etc/new.conf")));
}

TEST_F(SysFile, InvalidKeysAndValuesAreRefused)
{
    const std::string file = In("/etc/velainfo.conf");
    WriteFile(file, "a=\"1\"\n");
    const std::string longKey(129, 'k');
    const std::string longValue(4097, 'v');
    for (const char* key :
         {"", "a=b", "a\nb", "a b", "#a", "a\"", "a/b", longKey.c_str(), static_cast<const char*>(nullptr)}) {
        EXPECT_EQ(-1, VLIBCINFOSetKeyValue(key, "x")) << (key ? key : "null");
    }
    for (const char* value : {"x\ny", "x\rb", "x\x01", longValue.c_str(), static_cast<const char*>(nullptr)}) {
        EXPECT_EQ(-1, VLIBCINFOSetKeyValue("a", value)) << (value ? value : "null");
    }
    EXPECT_EQ("a=\"1\"\n", ReadText(file));
    EXPECT_EQ(std::vector<std::string>{"velainfo.conf"}, DirEntries(In("/etc")));  // no temporary file left
}

TEST_F(SysFile, CorruptOrTruncatedFilesAreNotUsedNorRewritten)
{
    const std::string file = In("/etc/velainfo.conf");
    const std::vector<std::string> corrupt = {
        "a=\"1\"\nb=\"cut",                    // cut in the middle of a value
        "a=\"1\"\njust words\n",              // neither comment nor entry
        std::string("a=\"1\"\nb=\"2\0\"\n", 13),  // NUL byte
        "a=\"1\"\nb=" + std::string(9000, 'x') + "\n",
        "a=\"1\"\nb=x\"y\n",
        "a=\"1\"\nbad key=\"2\"\n",
        "a=\"1\x01\"\n",
    };
    for (const std::string& text : corrupt) {
        WriteFile(file, text);
        char buf[16];
        EXPECT_EQ(-1, VLIBCINFOGetKeyValue("a", buf, sizeof(buf))) << text.substr(0, 40);
        EXPECT_EQ(VLIBC_ERR_CORRUPT, VLIBCErrGet());
        EXPECT_EQ(0, VLIBCFileCheckKeyValue("/etc/velainfo.conf", "a", "1", 0));
        EXPECT_EQ(-1, VLIBCINFOSetKeyValue("a", "2"));
        EXPECT_EQ(text, ReadText(file));
    }
    WriteFile(file, std::string(1024 * 1024 + 1, '#'));
    EXPECT_EQ(0, VLIBCFileCheckKeyValue("/etc/velainfo.conf", "a", "1", 0));
    EXPECT_EQ(-1, VLIBCINFOSetKeyValue("a", "2"));
    EXPECT_EQ(std::vector<std::string>{"velainfo.conf"}, DirEntries(In("/etc")));
}

// Symbolic links pointing outside the root are never written through.
TEST_F(SysFile, LinksOutOfTheRootAreNotFollowed)
{
    const std::string victim = outside_.Path() + "/victim";
    WriteFile(victim, "a=\"1\"\n");
    ASSERT_EQ(0, symlink(victim.c_str(), In("/etc/velainfo.conf").c_str()));
    ASSERT_EQ(0, symlink((outside_.Path() + "/created").c_str(), In("/etc/dangling").c_str()));
    ASSERT_EQ(0, symlink(victim.c_str(), In("/etc/lock").c_str()));
    ASSERT_EQ(0, symlink(outside_.Path().c_str(), In("/etc/dir").c_str()));

    EXPECT_EQ(-1, VLIBCINFOSetKeyValue("a", "2"));
    EXPECT_EQ(-1, VLIBCFileTouch("/etc/dangling"));
    EXPECT_EQ(-1, VLIBCFileTouch("/etc/velainfo.conf"));
    int handle = 7;
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/dangling", 1, 0, &handle));
    EXPECT_EQ(-1, handle);
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/lock", 1, 0, &handle));
    EXPECT_EQ(-1, VELAFSMkdirP("/etc/dir", 0, 1, (uid_t)-1, (gid_t)-1, 0777));  // reset through a link
    EXPECT_EQ(-1, VELAFSMkdirP("/etc/../../escape", 0, 0, (uid_t)-1, (gid_t)-1, 0755));

    EXPECT_EQ("a=\"1\"\n", ReadText(victim));
    EXPECT_EQ(std::vector<std::string>{"victim"}, DirEntries(outside_.Path()));
    EXPECT_EQ(0700u, Mode(outside_.Path()));
}

TEST_F(SysFile, MkdirPCreatesParentsWithExactModes)
{
    const mode_t old = umask(077);
    EXPECT_EQ(0, VELAFSMkdirP("/var/spool/webapi", 0, 0, (uid_t)-1, (gid_t)-1, 0751));
    EXPECT_EQ(0, VELAFSMkdirP("/a//b/./c/", 1, 0, (uid_t)-1, (gid_t)-1, 0711));
    umask(old);
    EXPECT_EQ(0755u, Mode(In("/var")));
    EXPECT_EQ(0751u, Mode(In("/var/spool/webapi")));
    EXPECT_EQ(0711u, Mode(In("/a/b")));
    // An existing directory keeps its mode unless asked.
    EXPECT_EQ(0, VELAFSMkdirP("/var/spool/webapi", 0, 0, (uid_t)-1, (gid_t)-1, 0700));
    EXPECT_EQ(0751u, Mode(In("/var/spool/webapi")));
    EXPECT_EQ(0, VELAFSMkdirP("/var/spool/webapi", 0, 1, (uid_t)-1, (gid_t)-1, 0700));
    EXPECT_EQ(0700u, Mode(In("/var/spool/webapi")));

    WriteFile(In("/etc/file"), "");
    EXPECT_EQ(-1, VELAFSMkdirP("/etc/file/sub", 0, 0, (uid_t)-1, (gid_t)-1, 0755));
    EXPECT_EQ(VLIBC_ERR_MKDIR, VLIBCErrGet());
    EXPECT_EQ(-1, VELAFSMkdirP("/x\n", 0, 0, (uid_t)-1, (gid_t)-1, 0755));
}

TEST_F(SysFile, TouchAndExist)
{
    const std::string marker = In("/etc/.timestamp");
    EXPECT_EQ(0, VLIBCFileExist("/etc/.timestamp"));
    ASSERT_EQ(0, VLIBCFileTouch("/etc/.timestamp"));
    EXPECT_EQ(1, VLIBCFileExist("/etc/.timestamp"));
    EXPECT_EQ(0, VLIBCFileExist("/etc"));  // a directory is not a file
    EXPECT_EQ(0, VLIBCFileExist(nullptr));

    const struct timespec past[2] = {{1000, 0}, {1000, 0}};
    ASSERT_EQ(0, utimensat(AT_FDCWD, marker.c_str(), past, 0));
    ASSERT_EQ(0, VLIBCFileTouch(marker.c_str()));
    struct stat st;
    ASSERT_EQ(0, stat(marker.c_str(), &st));
    EXPECT_GT(st.st_mtime, 1000);

    ASSERT_EQ(0, mkfifo(In("/etc/fifo").c_str(), 0600));
    EXPECT_EQ(-1, VLIBCFileTouch("/etc/fifo"));  // refused, without blocking
    EXPECT_EQ(-1, VLIBCFileTouch("/etc"));
}

TEST_F(SysFile, UnlockRefusesWhatIsNotALockHandle)
{
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    EXPECT_EQ(-1, VLIBCFileUnlockByFile(fds[0]));
    EXPECT_NE(-1, fcntl(fds[0], F_GETFD));  // still open
    close(fds[0]);
    close(fds[1]);
    EXPECT_EQ(-1, VLIBCFileUnlockByFile(-1));
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/lock", 1, 0, nullptr));
    int handle = 0;
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/lock", 1, -1, &handle));
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/lock", 1, 3601, &handle));
    ASSERT_EQ(0, VLIBCFileLockTimeByFile("/etc/lock", 1, 0, &handle));
    EXPECT_EQ(0, VLIBCFileUnlockByFile(handle));
    EXPECT_EQ(-1, VLIBCFileUnlockByFile(handle));  // already released
}

// Another process holds the lock: the wait ends with a failure.
TEST_F(SysFile, LockWaitIsBounded)
{
    const Gate ready, release;
    Children holder(1, [&](int) {
        int handle = -1;
        ready.Post(VLIBCFileLockTimeByFile("/etc/counter.lock", 1, 5, &handle) == 0 ? 'y' : 'n');
        release.Wait();  // hold the lock until told
        return 0;
    });
    ASSERT_EQ('y', ready.Wait());

    int handle = 7;
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/counter.lock", 1, 1, &handle));
    EXPECT_EQ(-1, handle);
    EXPECT_EQ(VLIBC_ERR_TIMEOUT, VLIBCErrGet());
    EXPECT_EQ(-1, VLIBCFileLockTimeByFile("/etc/counter.lock", 0, 0, &handle));  // shared waits too

    release.Post();
    ASSERT_EQ(std::vector<int>{0}, holder.Wait());
    ASSERT_EQ(0, VLIBCFileLockTimeByFile("/etc/counter.lock", 1, 0, &handle));  // free again
    EXPECT_EQ(0, VLIBCFileUnlockByFile(handle));
}

// Processes incrementing one counter under the lock lose no update.
TEST_F(SysFile, LockedCounterLosesNoUpdate)
{
    constexpr int kProcesses = 8;
    constexpr int kRounds = 200;
    const std::vector<int> codes = InChildren(kProcesses, [](int) {
        for (int i = 0; i < kRounds; ++i) {
            int handle = -1;
            while (VLIBCFileLockTimeByFile("/etc/counter.lock", 1, 2, &handle) != 0) {
                if (VLIBCErrGet() != VLIBC_ERR_TIMEOUT) {
                    return 1;
                }
            }
            char buf[32];
            const int found = VLIBCFileGetKeyValue("/etc/counter", "count", buf, sizeof(buf));
            const long next = (found == 1 ? strtol(buf, nullptr, 10) : 0) + 1;
            if (found < 0 || VLIBCFileSetKeyValue("/etc/counter", "count", std::to_string(next).c_str()) != 0 ||
                VLIBCFileUnlockByFile(handle) != 0) {
                return 2;
            }
        }
        return 0;
    });
    EXPECT_EQ(std::vector<int>(kProcesses, 0), codes);
    char buf[32];
    ASSERT_EQ(1, VLIBCFileGetKeyValue("/etc/counter", "count", buf, sizeof(buf)));
    EXPECT_EQ(std::to_string(kProcesses * kRounds), buf);
}

}  // namespace
