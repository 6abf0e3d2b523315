// Private upload directories: made and checked, removed after the reply, at
// exit, on the signals that end a request and by a reaper that keeps root,
// and the sweep of those left by processes that are gone.
// Contract: vela/uploaddir.h.
#include "vela/uploaddir.h"

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdlib>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <string>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "transfer/UploadDir.h"
#include "vela/log.h"
#include "vela/sysfile.h"

using VELA::System::ScopedFd;

namespace {

constexpr size_t kPrefixLength = sizeof(VELA_UPLOAD_DIR_PREFIX) - 1;
constexpr size_t kRandomChars = 12;
constexpr size_t kNameLength = kPrefixLength + kRandomChars;
const char kAlphabet[] = "abcdefghijklmnopqrstuvwxyz234567";  // 32 symbols, 5 bits each
constexpr int kCreateAttempts = 32;
constexpr int kSweepScanLimit = 1024;
constexpr int kSweepDirLimit = 8;
constexpr long kSweepFileLimit = 4096;
constexpr int kEmptyPasses = 8;
const int kSignals[] = {SIGTERM, SIGPIPE, SIGHUP, SIGINT, SIGALRM, SIGXCPU};

// The private directory of the process: plain memory the signal handler
// reads. It is written only with the cleanup signals blocked, and `active`
// is set last and cleared first, so the handler sees either no directory or
// a complete record.
struct PrivateDir {
    volatile sig_atomic_t active;
    pid_t owner;       // the process that made it; a forked child does not remove it
    uid_t uid;         // its owner
    int baseFd;        // the base it is in
    int dirFd;         // the directory itself, holding the exclusive flock
    char name[kNameLength + 1];
    char path[PATH_MAX];
};
PrivateDir g_dir;
// The write end of the pipe a reaper (VELA::Transfer::UploadDirReaper)
// waits on; -1 without one.
int g_reaperFd = -1;

// The cleanup signals blocked for the scope.
class SignalBlock {
public:
    SignalBlock()
    {
        sigset_t set;
        sigemptyset(&set);
        for (int sig : kSignals) {
            sigaddset(&set, sig);
        }
        pthread_sigmask(SIG_BLOCK, &set, &old_);
    }
    ~SignalBlock() { pthread_sigmask(SIG_SETMASK, &old_, nullptr); }
    SignalBlock(const SignalBlock&) = delete;
    SignalBlock& operator=(const SignalBlock&) = delete;

private:
    sigset_t old_;
};

// The fixed head of a getdents64(2) record; the name follows it.
struct Dirent64Head {
    uint64_t ino;
    int64_t off;
    unsigned short reclen;
    unsigned char type;
};
constexpr size_t kDirentName = offsetof(Dirent64Head, type) + 1;

bool IsDots(const char* name)
{
    return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

// Unlinks the entries of the directory `dirFd` (a symbolic link is removed,
// never followed; a subdirectory stays), pass after pass, since removing
// entries while reading a directory may skip some. True when the directory
// is empty. At most `budget` unlink calls (decremented). Async-signal-safe:
// system calls only, on a buffer of the stack.
bool EmptyDir(int dirFd, long& budget)
{
    alignas(Dirent64Head) char buf[4096];
    for (int pass = 0; pass < kEmptyPasses; ++pass) {
        if (lseek(dirFd, 0, SEEK_SET) != 0) {
            return false;
        }
        bool seen = false;
        bool removed = false;
        for (;;) {
            const long n = syscall(SYS_getdents64, dirFd, buf, sizeof(buf));
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n < 0) {
                return false;
            }
            if (n == 0) {
                break;
            }
            for (long at = 0; at < n;) {
                const char* record = buf + at;
                unsigned short reclen = 0;
                memcpy(&reclen, record + offsetof(Dirent64Head, reclen), sizeof(reclen));
                const char* name = record + kDirentName;
                at += reclen > 0 ? reclen : n;
                if (IsDots(name)) {
                    continue;
                }
                seen = true;
                if (budget <= 0) {
                    return false;
                }
                --budget;
                if (unlinkat(dirFd, name, 0) == 0 || errno == ENOENT) {
                    removed = true;
                }
            }
        }
        if (!seen) {
            return true;
        }
        if (!removed) {
            return false;  // errno: why the last entry stayed
        }
    }
    return false;
}

// Removes the registered directory (async-signal-safe). True when it is gone.
bool RemoveRegistered()
{
    long budget = LONG_MAX;
    return EmptyDir(g_dir.dirFd, budget) &&
           (unlinkat(g_dir.baseFd, g_dir.name, AT_REMOVEDIR) == 0 || errno == ENOENT);
}

void OnCleanupSignal(int sig)
{
    const int saved = errno;
    if (g_dir.active && g_dir.owner == getpid()) {
        g_dir.active = 0;
        RemoveRegistered();
    }
    // Die of the signal as without this handler: the signal is blocked
    // while the handler runs, so it arrives again, with the default action,
    // as soon as the handler returns.
    struct sigaction dfl = {};
    dfl.sa_handler = SIG_DFL;
    sigemptyset(&dfl.sa_mask);
    sigaction(sig, &dfl, nullptr);
    errno = saved;
    raise(sig);
}

void RemoveAtExit()
{
    if (g_dir.active && g_dir.owner == getpid()) {
        SignalBlock block;
        g_dir.active = 0;
        RemoveRegistered();
    }
}

// `base` without trailing slashes ("/" stays "/").
std::string Trimmed(const char* base)
{
    std::string dir = base;
    while (dir.size() > 1 && dir.back() == '/') {
        dir.pop_back();
    }
    return dir;
}

// Opens the base directory `dir` (never through a symbolic link) and checks
// it as VELA::Transfer::UploadBaseUsable describes. The descriptor, or -1 (logged and
// recorded).
int OpenBase(const std::string& dir)
{
    ScopedFd fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    struct stat st;
    if (fd.Get() < 0 || fstat(fd.Get(), &st) != 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "open %.200s: %m", dir.c_str());
        VELA_LOG_ERR("upload directory %s cannot be opened: %m", dir.c_str());
        return -1;
    }
    const uid_t me = geteuid();
    if (st.st_uid != 0 && st.st_uid != me) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "%.200s belongs to uid %u", dir.c_str(), static_cast<unsigned>(st.st_uid));
        VELA_LOG_ERR("upload directory %s not used: it belongs to uid %u, neither root nor uid %u", dir.c_str(),
                     static_cast<unsigned>(st.st_uid), static_cast<unsigned>(me));
        return -1;
    }
    if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0 && (st.st_mode & S_ISVTX) == 0) {
        if (st.st_uid != me || fchmod(fd.Get(), (st.st_mode & 07777) | S_ISVTX) != 0) {
            VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "%.200s is shared without the sticky bit", dir.c_str());
            VELA_LOG_ERR("upload directory %s not used: others may write to it and it has no sticky bit",
                         dir.c_str());
            return -1;
        }
        VELA_LOG(LOG_WARNING, "upload directory %s was writable by others without the sticky bit: bit added",
                 dir.c_str());
    }
    return fd.Release();
}

bool IsPrivateName(const char* name)
{
    if (strncmp(name, VELA_UPLOAD_DIR_PREFIX, kPrefixLength) != 0 || strlen(name) != kNameLength) {
        return false;
    }
    for (const char* p = name + kPrefixLength; *p != '\0'; ++p) {
        if (strchr(kAlphabet, *p) == nullptr) {
            return false;
        }
    }
    return true;
}

int Sweep(int baseFd, const std::string& base, unsigned minAgeSeconds)
{
    const int scanFd = openat(baseFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    DIR* scan = scanFd >= 0 ? fdopendir(scanFd) : nullptr;
    if (scan == nullptr) {
        if (scanFd >= 0) {
            close(scanFd);
        }
        VELA_LOG_ERR("cannot read the upload directory %s: %m", base.c_str());
        return -1;
    }
    const uid_t me = geteuid();
    const time_t now = time(nullptr);
    long budget = kSweepFileLimit;
    int removed = 0;
    int scanned = 0;
    const struct dirent* entry;
    while (removed < kSweepDirLimit && budget > 0 && scanned++ < kSweepScanLimit &&
           (entry = readdir(scan)) != nullptr) {
        if (!IsPrivateName(entry->d_name) || (entry->d_type != DT_DIR && entry->d_type != DT_UNKNOWN)) {
            continue;
        }
        ScopedFd dir(openat(baseFd, entry->d_name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        struct stat st;
        if (dir.Get() < 0 || fstat(dir.Get(), &st) != 0 || !S_ISDIR(st.st_mode) || st.st_uid != me ||
            st.st_mtime > now || now - st.st_mtime < static_cast<time_t>(minAgeSeconds)) {
            continue;
        }
        // A live request holds the lock for as long as it lives.
        if (flock(dir.Get(), LOCK_EX | LOCK_NB) != 0) {
            continue;
        }
        if (!EmptyDir(dir.Get(), budget) || unlinkat(baseFd, entry->d_name, AT_REMOVEDIR) != 0) {
            VELA_LOG_ERR("cannot remove the stale upload directory %s/%s: %m", base.c_str(), entry->d_name);
            continue;
        }
        ++removed;
        VELA_LOG(LOG_NOTICE, "removed the upload directory %s/%s of a request that is gone", base.c_str(),
                 entry->d_name);
    }
    closedir(scan);
    return removed;
}

// Makes a new private directory in `baseFd`; its name in `name`.
bool MakePrivateDir(int baseFd, char (&name)[kNameLength + 1])
{
    memcpy(name, VELA_UPLOAD_DIR_PREFIX, kPrefixLength);
    for (int attempt = 0; attempt < kCreateAttempts; ++attempt) {
        unsigned char random[kRandomChars];
        size_t got = 0;
        while (got < sizeof(random)) {
            const ssize_t n = getrandom(random + got, sizeof(random) - got, 0);
            if (n < 0 && errno != EINTR) {
                return false;
            }
            got += n > 0 ? static_cast<size_t>(n) : 0;
        }
        for (size_t i = 0; i < kRandomChars; ++i) {
            name[kPrefixLength + i] = kAlphabet[random[i] & 31];
        }
        name[kNameLength] = '\0';
        if (mkdirat(baseFd, name, 0700) == 0) {
            return true;
        }
        if (errno != EEXIST) {
            return false;
        }
    }
    return false;
}

// Makes the private directory in the base `dir` (open as `baseFd`, which
// the record takes over on success; `parent` is `dir`, "" for "/"), takes
// its lock and records it in g_dir, the cleanup signals blocked meanwhile.
// Its path goes to `path`, which the caller made large enough. False
// (recorded and logged, nothing left behind) on failure. Can throw
// std::bad_alloc.
bool MakeAndRecord(ScopedFd& baseFd, const std::string& dir, const std::string& parent, char* path)
{
    SignalBlock block;
    char name[kNameLength + 1];
    if (!MakePrivateDir(baseFd.Get(), name)) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "mkdir in %.200s: %m", dir.c_str());
        VELA_LOG_ERR("cannot make a private upload directory in %s: %m", dir.c_str());
        return false;
    }
    ScopedFd dirFd(openat(baseFd.Get(), name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    struct stat st;
    if (dirFd.Get() < 0 || fstat(dirFd.Get(), &st) != 0 || st.st_uid != geteuid() ||
        fchmod(dirFd.Get(), 0700) != 0 || flock(dirFd.Get(), LOCK_EX | LOCK_NB) != 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "open %.200s/%s: %m", dir.c_str(), name);
        VELA_LOG_ERR("cannot take the private upload directory %s/%s: %m", dir.c_str(), name);
        unlinkat(baseFd.Get(), name, AT_REMOVEDIR);
        return false;
    }
    const std::string made = parent + "/" + name;
    g_dir.owner = getpid();
    g_dir.uid = st.st_uid;
    g_dir.baseFd = baseFd.Release();
    g_dir.dirFd = dirFd.Release();
    memcpy(g_dir.name, name, sizeof(name));
    memcpy(g_dir.path, made.c_str(), made.size() + 1);
    g_dir.active = 1;
    memcpy(path, made.c_str(), made.size() + 1);
    return true;
}

}  // namespace

namespace VELA {
namespace Transfer {

int DupUploadDir(const std::string& path)
{
    if (!g_dir.active || path != g_dir.path) {
        return -1;
    }
    return fcntl(g_dir.dirFd, F_DUPFD_CLOEXEC, 0);
}

}  // namespace Transfer
}  // namespace VELA

int VELA::Transfer::UploadBaseUsable(const char* base)
{
    if (base == nullptr || base[0] == '\0') {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "no upload directory");
        return 0;
    }
    try {
        const int fd = OpenBase(Trimmed(base));
        if (fd < 0) {
            return 0;
        }
        close(fd);
        return 1;
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return 0;
    }
}

int VELA::Transfer::UploadDirGet(const char* base, char* path, size_t pathSize)
{
    if (path == nullptr || pathSize == 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "no buffer");
        return -1;
    }
    path[0] = '\0';
    if (g_dir.active) {
        const size_t len = strlen(g_dir.path);
        if (len >= pathSize) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "buffer too small");
            return -1;
        }
        memcpy(path, g_dir.path, len + 1);
        return 1;
    }
    if (base == nullptr || base[0] == '\0') {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "no upload directory");
        return -1;
    }
    try {
        const std::string dir = Trimmed(base);
        const std::string parent = dir == "/" ? "" : dir;
        if (parent.size() + 1 + kNameLength >= pathSize || parent.size() + 1 + kNameLength >= sizeof(g_dir.path)) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "upload directory path too long");
            VELA_LOG_ERR("upload directory path too long: %.200s", dir.c_str());
            return -1;
        }
        ScopedFd baseFd(OpenBase(dir));
        if (baseFd.Get() < 0) {
            return -1;
        }
        Sweep(baseFd.Get(), dir, VELA_UPLOAD_SWEEP_AGE);

        return MakeAndRecord(baseFd, dir, parent, path) ? 2 : -1;
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VELA::Transfer::UploadDirRemove(void)
{
    if (!g_dir.active) {
        return 0;
    }
    SignalBlock block;
    g_dir.active = 0;
    const bool removed = RemoveRegistered() || g_reaperFd >= 0;  // the reaper takes what is left
    if (!removed) {
        VELA_LOG_ERR("cannot remove the upload directory %s: %m; the sweep of a later upload will", g_dir.path);
    }
    close(g_dir.dirFd);
    close(g_dir.baseFd);
    g_dir.dirFd = g_dir.baseFd = -1;
    g_dir.name[0] = g_dir.path[0] = '\0';
    if (g_reaperFd >= 0) {
        close(g_reaperFd);  // the reaper removes what this process could not
        g_reaperFd = -1;
    }
    return removed ? 0 : -1;
}

int VELA::Transfer::UploadDirReaper(void)
{
    if (!g_dir.active || g_dir.uid != 0 || geteuid() != 0 || g_reaperFd >= 0) {
        return 0;
    }
    int hold[2];
    if (pipe2(hold, O_CLOEXEC) != 0) {
        VELA_LOG_ERR("cannot start the upload directory's reaper: pipe: %m");
        return -1;
    }
    const pid_t pid = fork();
    if (pid < 0) {
        VELA_LOG_ERR("cannot start the upload directory's reaper: fork: %m");
        close(hold[0]);
        close(hold[1]);
        return -1;
    }
    if (pid == 0) {
        // The reaper keeps nothing of the request but the pipe and the two
        // directories (as descriptors 3, 4, 5), outlives the signals that
        // end the request, and waits until the request lets go.
        struct sigaction ignore = {};
        ignore.sa_handler = SIG_IGN;
        sigemptyset(&ignore.sa_mask);
        for (int sig : kSignals) {
            sigaction(sig, &ignore, nullptr);
        }
        const int moved[3] = {fcntl(hold[0], F_DUPFD, 10), fcntl(g_dir.baseFd, F_DUPFD, 10),
                              fcntl(g_dir.dirFd, F_DUPFD, 10)};
        const int null = open("/dev/null", O_RDWR);
        if (moved[0] < 0 || moved[1] < 0 || moved[2] < 0 || null < 0 || dup2(null, 0) < 0 || dup2(null, 1) < 0 ||
            dup2(null, 2) < 0 || dup2(moved[0], 3) < 0 || dup2(moved[1], 4) < 0 || dup2(moved[2], 5) < 0) {
            _exit(1);
        }
        close_range(6, ~0U, 0);
        g_dir.baseFd = 4;
        g_dir.dirFd = 5;
        char byte;
        while (read(3, &byte, 1) < 0 && errno == EINTR) {
        }
        RemoveRegistered();
        _exit(0);
    }
    close(hold[0]);
    g_reaperFd = hold[1];
    return 1;
}

const char* VELA::Transfer::UploadDirPath(void) { return g_dir.active ? g_dir.path : ""; }

int VELA::Transfer::UploadCleanupOnExit(void)
{
    static bool registered = false;
    int rc = 0;
    if (!registered) {
        registered = atexit(RemoveAtExit) == 0;
        if (!registered) {
            VELA_LOG_ERR("cannot register the upload clean-up at exit");
            rc = -1;
        }
    }
    for (int sig : kSignals) {
        struct sigaction old = {};
        if (sigaction(sig, nullptr, &old) != 0) {
            VELA_LOG_ERR("cannot read the action of signal %d: %m", sig);
            rc = -1;
            continue;
        }
        if ((old.sa_flags & SA_SIGINFO) == 0 && old.sa_handler == SIG_IGN) {
            continue;
        }
        struct sigaction action = {};
        action.sa_handler = OnCleanupSignal;
        sigemptyset(&action.sa_mask);
        for (int other : kSignals) {
            sigaddset(&action.sa_mask, other);
        }
        action.sa_flags = SA_RESTART;
        if (sigaction(sig, &action, nullptr) != 0) {
            VELA_LOG_ERR("cannot install the upload clean-up on signal %d: %m", sig);
            rc = -1;
        }
    }
    return rc;
}

int VELA::Transfer::UploadSweep(const char* base, unsigned minAgeSeconds)
{
    if (base == nullptr || base[0] == '\0') {
        return -1;
    }
    try {
        const std::string dir = Trimmed(base);
        ScopedFd fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (fd.Get() < 0) {
            VELA_LOG_ERR("cannot open the upload directory %s: %m", dir.c_str());
            return -1;
        }
        return Sweep(fd.Get(), dir, minAgeSeconds);
    } catch (const std::exception&) {
        return -1;
    }
}
