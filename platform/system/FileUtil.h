// File helpers shared by the platform sources (not installed).
#pragma once

#include <cstddef>
#include <json/json.h>
#include <string>
#include <sys/stat.h>
#include <sys/types.h>

#include "vela/export.h"

namespace VELA {
namespace System {

// VELA_EXPORT: exported for the tests (see vela/export.h).

// A file descriptor closed at the end of the scope.
class ScopedFd {
public:
    explicit ScopedFd(int fd = -1) : fd_(fd) {}
    ~ScopedFd() { Reset(); }
    ScopedFd(const ScopedFd&) = delete;
    ScopedFd& operator=(const ScopedFd&) = delete;
    int Get() const { return fd_; }
    // Gives the descriptor up without closing it.
    int Release()
    {
        const int fd = fd_;
        fd_ = -1;
        return fd;
    }
    // Closes the descriptor held (close errors ignored) and holds `fd`.
    void Reset(int fd = -1);

private:
    int fd_;
};

// Flags of ReadFileBounded.
enum ReadFlags : unsigned {
    // The last component of the path must not be a symbolic link (ELOOP).
    kReadNoFollow = 1u,
};

// Reads the regular file `path` into `out` when it holds at most `limit`
// bytes. False otherwise, with `err` set to the errno of the failing call,
// EFBIG when the file is (or grows while read) larger than `limit`, EINVAL
// when `path` is not a regular file (a FIFO or device is never read, so the
// call cannot block), ELOOP when `flags` has kReadNoFollow and `path` is a
// symbolic link, ENOMEM when memory runs out. `st`, when given, receives the
// status of the opened file once it is known to be regular. `out` is
// unchanged on failure. Nothing is logged.
bool ReadFileBounded(const std::string& path, size_t limit, std::string& out, int& err, unsigned flags = 0,
                     struct stat* st = nullptr);

// How OpenNoSymlinks resolves a path.
enum class NoSymlinkResolve {
    kAuto,  // openat2(RESOLVE_NO_SYMLINKS) where the kernel has it, else kWalk
    kWalk,  // one component at a time (what kAuto falls back to)
};

// open(2) of `path` with `flags` (O_CLOEXEC and O_NOFOLLOW are added) when no
// component of it is a symbolic link, the last one included; "." and ".."
// are allowed. kWalk starts at "/" for an absolute path and at the working
// directory otherwise, opens every directory with O_PATH | O_NOFOLLOW and
// checks it with fstat before going on, and opens the last component
// relative to its parent, so nothing is looked up twice. The descriptor, or
// -1 with errno set: ELOOP when a component is a symbolic link, ENOTDIR when
// one before the last is not a directory, ENAMETOOLONG when `path` reaches
// PATH_MAX, EINVAL when it is empty or holds a NUL, else the errno of the
// failing open. Nothing is logged.
VELA_EXPORT int OpenNoSymlinks(const std::string& path, int flags, NoSymlinkResolve how = NoSymlinkResolve::kAuto);

// write(2) until all `len` bytes are written, retrying on EINTR. False with
// errno set on failure.
VELA_EXPORT bool WriteAll(int fd, const char* data, size_t len);

// Fills the new temporary file `fd` of an atomic replacement: fchmod to
// `mode` (whatever the umask was), fchown to `uid`/`gid` unless both are -1,
// all `len` bytes of `data`, fsync unless `durable` is false. False with
// errno set and `step` naming the failed call ("chmod", "chown", "write",
// "fsync"). Nothing is logged.
bool FillTempFile(int fd, const char* data, size_t len, mode_t mode, uid_t uid, gid_t gid, const char*& step,
                  bool durable = true);

// Replaces `path` with `len` bytes of `data`: a temporary file
// ".<name>.XXXXXX" in the same directory is filled with FillTempFile,
// closed and renamed over `path`, then the directory is fsynced so the
// rename is durable (a failure of that last step is only logged: the new
// file is in place). False with errno set and `step` naming the failed call
// ("mkstemp", "chmod", "chown", "write", "fsync", "close", "rename"); the
// temporary file is then removed and `path` is unchanged. Nothing else is
// logged.
//
// `durable` false skips both fsyncs, for state that does not outlive a
// reboot anyway (files under /run): the rename still never shows a partial
// file, and a crash can only lose the latest write.
bool WriteFileAtomic(const std::string& path, const char* data, size_t len, mode_t mode, uid_t uid, gid_t gid,
                     const char*& step, bool durable = true);

// `value` as one line of JSON written with WriteFileAtomic (mode `mode`,
// owner unchanged). False (logged) on failure; `path` is then unchanged.
bool WriteJsonAtomic(const std::string& path, const Json::Value& value, mode_t mode, bool durable);

// fsync of the directory `dir` (makes a rename in it durable). Failures are
// logged and otherwise ignored.
void SyncDir(const std::string& dir);

// mkdir -p of the absolute `path`, `mode` for the directories it creates.
// Existing components may be symbolic links to directories (a data volume
// mounted elsewhere); anything that is not a directory fails. False (logged)
// on failure.
bool MakeDirs(const std::string& path, mode_t mode);

// The directory part of `path` ("." when it has no "/", "/" for a file in
// the root) and its last component. Both can throw std::bad_alloc.
std::string DirName(const std::string& path);
std::string BaseName(const std::string& path);

}  // namespace System
}  // namespace VELA
