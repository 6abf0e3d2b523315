// Private upload directories (vela/uploaddir.h): made, used and removed;
// which base directories are trusted; removal when a signal ends the
// request; the sweep of directories left by processes that are gone.

#include <climits>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <sys/file.h>

#include "platform/transfer/MultipartBody.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/upload.h"
#include "vela/uploaddir.h"

namespace {

using namespace VELA::Transfer;
using namespace VELA::Test;

// The start of a body whose file part is still coming.
const std::string kFileHead = std::string("--") + kBoundary + "\r\n" + PartHead({"f", "", "a.bin", true});

mode_t ModeOf(const std::string& path)
{
    struct stat st;
    return lstat(path.c_str(), &st) == 0 ? st.st_mode : 0;
}

// Sets the modification time of `path` to `age` seconds ago.
void Age(const std::string& path, int age)
{
    const struct timespec times[2] = {{time(nullptr) - age, 0}, {time(nullptr) - age, 0}};
    ASSERT_EQ(0, utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW)) << path;
}

// A directory `name` in `base` holding one file, last changed `age` seconds ago.
void MakeAged(const std::string& base, const std::string& name, int age)
{
    const std::string dir = base + "/" + name;
    ASSERT_EQ(0, mkdir(dir.c_str(), 0700)) << dir;
    WriteFile(dir + "/upload-abcdefghijklmnop", "left behind");
    Age(dir, age);
}

bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// Stores one upload with the multipart reader into `dir`; its stored path.
std::string Store(const std::string& dir, const std::string& content)
{
    Result r;
    ReadAllText(Body({{"f", content, "a.bin", true}}), dir, r);
    return r.rc == 1 ? r.File("f") : "";
}

}  // namespace

TEST(UploadDir, MadeOncePrivateAndRemovedWithItsFiles)
{
    TempDir base;
    MakeAged(base.Path(), "vela-upload-aaaaaaaaaaaa", 2 * VELA_UPLOAD_SWEEP_AGE);  // of a dead process
    char path[PATH_MAX];
    char tiny[8];
    EXPECT_EQ(-1, UploadDirGet(base.Path().c_str(), tiny, sizeof(tiny)));
    ASSERT_EQ(2, UploadDirGet((base.Path() + "/").c_str(), path, sizeof(path)));
    const std::string dir = path;
    EXPECT_EQ(base.Path() + "/" VELA_UPLOAD_DIR_PREFIX, dir.substr(0, base.Path().size() + 13));
    EXPECT_EQ(std::vector<std::string>{dir.substr(base.Path().size() + 1)}, DirEntries(base.Path()));
    EXPECT_EQ(static_cast<mode_t>(S_IFDIR | 0700), ModeOf(dir));

    // Later calls, whatever base they name, get the same directory.
    TempDir other;
    ASSERT_EQ(1, UploadDirGet(other.Path().c_str(), path, sizeof(path)));
    EXPECT_EQ(dir, path);
    EXPECT_TRUE(DirEntries(other.Path()).empty());

    const std::string stored = Store(dir, "data");
    EXPECT_EQ(dir + "/", stored.substr(0, dir.size() + 1));
    EXPECT_EQ("data", ReadText(stored));

    // A child that inherited the handlers dies of the signal without
    // touching its parent's directory.
    ASSERT_EQ(0, UploadCleanupOnExit());
    EXPECT_EQ(std::vector<int>{128 + SIGTERM}, InChildren(1, [](int) { return raise(SIGTERM); }));
    EXPECT_EQ("data", ReadText(stored));

    EXPECT_EQ(0, UploadDirRemove());
    EXPECT_TRUE(DirEntries(base.Path()).empty());
    EXPECT_EQ(0, UploadDirRemove());
}

TEST(UploadDir, OnlyTrustedBasesAreUsed)
{
    TempDir top;
    ASSERT_EQ(0, chmod(top.Path().c_str(), 0755));
    const std::string shared = top.Path() + "/shared";
    ASSERT_EQ(0, mkdir(shared.c_str(), 0700));
    ASSERT_EQ(0, chmod(shared.c_str(), 0777));  // as an earlier version made "@tmp"
    {
        LogCapture log;
        EXPECT_EQ(1, UploadBaseUsable(shared.c_str()));
        EXPECT_EQ(static_cast<mode_t>(S_IFDIR | 01777), ModeOf(shared));
        EXPECT_EQ(LOG_WARNING, log.PriorityOf({shared, "sticky bit"}));
    }
    const std::string file = top.Path() + "/file";
    const std::string link = top.Path() + "/link";
    WriteFile(file, "x");
    ASSERT_EQ(0, symlink(shared.c_str(), link.c_str()));
    char path[PATH_MAX];
    for (const std::string& bad : {file, link, top.Path() + "/missing"}) {
        EXPECT_EQ(0, UploadBaseUsable(bad.c_str())) << bad;
        EXPECT_EQ(-1, UploadDirGet(bad.c_str(), path, sizeof(path))) << bad;
        EXPECT_EQ(VLIBC_ERR_MKDIR, VLIBCErrGet()) << bad;
    }
    if (geteuid() != 0) {
        GTEST_SKIP() << "directories of other users need root";
    }
    // Another user's base: that user could remove or rename what we store,
    // sticky bit or not. Writable by others without the sticky bit and not
    // ours to repair: refused as well.
    ASSERT_EQ(0, chown(shared.c_str(), 65534, 65534));
    EXPECT_EQ(0, UploadBaseUsable(shared.c_str()));
    ASSERT_EQ(0, chown(shared.c_str(), 0, 0));
    ASSERT_EQ(0, chmod(shared.c_str(), 0777));
    EXPECT_EQ(std::vector<int>{0}, InChildren(1, [&](int) {
                  return setresuid(65534, 65534, 65534) == 0 && UploadBaseUsable(shared.c_str()) == 0 ? 0 : 1;
              }));
    EXPECT_EQ(static_cast<mode_t>(S_IFDIR | 0777), ModeOf(shared));
}

// An upload in the middle of a file when a signal ends the process: the
// partial file and the private directory go, and the process dies of that
// signal. A signal ignored beforehand stays ignored. Without a signal (0)
// the body ends early and the process calls exit().
TEST(UploadDir, SignalsAndExitRemoveAPartialUpload)
{
    // `ignored`: ignored before the handlers are installed, sent first.
    const struct { int sig, ignored; } cases[] = {{SIGTERM, 0}, {SIGPIPE, 0}, {SIGHUP, 0},       {SIGINT, 0},
                                                  {SIGALRM, 0}, {SIGXCPU, 0}, {SIGTERM, SIGHUP}, {0, 0}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.sig);
        TempDir base;
        int in[2];
        ASSERT_EQ(0, pipe(in));
        Children child(1, [&](int) {
            close(in[1]);
            if (c.ignored != 0) {
                signal(c.ignored, SIG_IGN);
            }
            char path[PATH_MAX];
            if (UploadCleanupOnExit() != 0 || UploadDirGet(base.Path().c_str(), path, sizeof(path)) != 2) {
                return 2;
            }
            Result r;
            ReadAll(in[0], 1ULL << 30, kType, path, r);  // waits for the rest of the body
            exit(3);
        });
        close(in[0]);
        const std::string part = kFileHead + std::string(256 * 1024, 'p');
        ASSERT_EQ(static_cast<ssize_t>(part.size()), write(in[1], part.data(), part.size()));
        // Wait until the partial file is there, then end the process.
        ASSERT_TRUE(WaitUntil([&] {
            const std::vector<std::string> dirs = DirEntries(base.Path());
            const std::string dir = base.Path() + "/" + (dirs.size() == 1 ? dirs[0] : "");
            struct stat st;
            for (const std::string& f : dirs.size() == 1 ? DirEntries(dir) : std::vector<std::string>()) {
                if (stat((dir + "/" + f).c_str(), &st) == 0 && st.st_size > 0) {
                    return true;
                }
            }
            return false;
        }));
        for (int sig : {c.ignored, c.sig}) {
            if (sig != 0) {
                kill(child.Pid(0), sig);
            }
        }
        close(in[1]);
        EXPECT_EQ(std::vector<int>{c.sig != 0 ? 128 + c.sig : 3}, child.Wait());
        EXPECT_TRUE(DirEntries(base.Path()).empty());
    }
}

// A process that gives up root for good while its directory is root's
// cannot remove it any more: its reaper does, once the process lets go of it
// or is killed.
TEST(UploadDir, ReaperRemovesWhatRootStoredAfterTheDrop)
{
    if (geteuid() != 0) {
        GTEST_SKIP() << "giving up root needs root";
    }
    for (bool killed : {false, true}) {
        SCOPED_TRACE(killed ? "killed" : "lets go");
        TempDir base;
        int ready[2];
        ASSERT_EQ(0, pipe(ready));
        Children child(1, [&](int) {
            char path[PATH_MAX];
            if (UploadDirGet(base.Path().c_str(), path, sizeof(path)) != 2 || Store(path, "root's").empty() ||
                UploadDirReaper() != 1 || setresgid(65534, 65534, 65534) != 0 ||
                setresuid(65534, 65534, 65534) != 0) {
                return 2;
            }
            if (!killed) {
                return UploadDirRemove();
            }
            (void)!write(ready[1], "r", 1);
            pause();
            return 0;
        });
        close(ready[1]);
        char c;
        if (killed && read(ready[0], &c, 1) == 1) {
            kill(child.Pid(0), SIGKILL);
        }
        close(ready[0]);
        EXPECT_EQ(std::vector<int>{killed ? 128 + SIGKILL : 0}, child.Wait());
        EXPECT_TRUE(WaitUntil([&] { return DirEntries(base.Path()).empty(); }));
    }
}

TEST(UploadDir, SweepTakesOnlyStaleUnlockedDirectoriesOfOurs)
{
    TempDir base;
    TempDir elsewhere;
    const std::string& b = base.Path();
    const int old = 2 * VELA_UPLOAD_SWEEP_AGE;
    WriteFile(elsewhere.Path() + "/precious", "keep");
    MakeAged(b, "vela-upload-stalestale22", old);
    ASSERT_EQ(0, symlink((elsewhere.Path() + "/precious").c_str(), (b + "/vela-upload-stalestale22/ln").c_str()));
    Age(b + "/vela-upload-stalestale22", old);
    MakeAged(b, "vela-upload-freshfresh22", 0);
    for (const char* name : {"vela-upload-livelivelive", "vela-upload-short", "other-upload-stalestale"}) {
        MakeAged(b, name, old);
    }
    MakeAged(elsewhere.Path(), "target", old);
    ASSERT_EQ(0, symlink((elsewhere.Path() + "/target").c_str(), (b + "/vela-upload-linklinklink").c_str()));
    WriteFile(b + "/vela-upload-filefilefile", "a file");
    if (geteuid() == 0) {
        MakeAged(b, "vela-upload-foreignforei", old);
        ASSERT_EQ(0, chown((b + "/vela-upload-foreignforei").c_str(), 65534, 65534));
    }
    // A live request holds its directory's lock.
    const int live = open((b + "/vela-upload-livelivelive").c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_EQ(0, flock(live, LOCK_EX));

    EXPECT_EQ(1, UploadSweep(b.c_str(), VELA_UPLOAD_SWEEP_AGE));
    EXPECT_FALSE(Exists(b + "/vela-upload-stalestale22"));
    EXPECT_EQ("keep", ReadText(elsewhere.Path() + "/precious"));
    EXPECT_TRUE(Exists(elsewhere.Path() + "/target/upload-abcdefghijklmnop"));
    EXPECT_EQ(geteuid() == 0 ? 7u : 6u, DirEntries(b).size());

    close(live);  // the request is gone
    EXPECT_EQ(1, UploadSweep(b.c_str(), VELA_UPLOAD_SWEEP_AGE));
    EXPECT_FALSE(Exists(b + "/vela-upload-livelivelive"));

    // Bounded work: eight directories per call.
    for (int i = 0; i < 10; ++i) {
        MakeAged(b, "vela-upload-bulkbulk22" + std::string(1, 'a' + i) + "a", old);
    }
    EXPECT_EQ(8, UploadSweep(b.c_str(), VELA_UPLOAD_SWEEP_AGE));
    EXPECT_EQ(2, UploadSweep(b.c_str(), VELA_UPLOAD_SWEEP_AGE));
    EXPECT_EQ(0, UploadSweep(b.c_str(), VELA_UPLOAD_SWEEP_AGE));
}
