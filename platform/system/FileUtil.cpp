#include "system/FileUtil.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#if defined(SYS_openat2) && __has_include(<linux/openat2.h>)
#include <linux/openat2.h>
#define VELA_HAVE_OPENAT2 1
#endif

#include "vela/log.h"

namespace VELA {
namespace System {

void ScopedFd::Reset(int fd)
{
    if (fd_ >= 0) {
        close(fd_);
    }
    fd_ = fd;
}

namespace {

// The walk of OpenNoSymlinks: each directory opened with O_PATH and checked
// on its descriptor, the last component opened relative to it.
int OpenWalkingNoSymlinks(const std::string& path, int flags)
{
    ScopedFd dir(open(path[0] == '/' ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (dir.Get() < 0) {
        return -1;
    }
    // A trailing "/" makes the last component a directory.
    const bool trailingSlash = path.back() == '/';
    size_t pos = 0;
    std::string name;
    for (;;) {
        while (pos < path.size() && path[pos] == '/') {
            ++pos;
        }
        const size_t end = std::min(path.find('/', pos), path.size());
        size_t next = end;
        while (next < path.size() && path[next] == '/') {
            ++next;
        }
        name.assign(path, pos, end - pos);
        if (next >= path.size()) {
            break;  // `name` is the last component ("" for "/")
        }
        const int sub = openat(dir.Get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC);
        if (sub < 0) {
            return -1;
        }
        dir.Reset(sub);
        struct stat st;
        if (fstat(dir.Get(), &st) != 0) {
            return -1;
        }
        if (!S_ISDIR(st.st_mode)) {
            errno = S_ISLNK(st.st_mode) ? ELOOP : ENOTDIR;
            return -1;
        }
        pos = next;
    }
    return openat(dir.Get(), name.empty() ? "." : name.c_str(),
                  flags | O_NOFOLLOW | O_CLOEXEC | (trailingSlash ? O_DIRECTORY : 0));
}

}  // namespace

int OpenNoSymlinks(const std::string& path, int flags, NoSymlinkResolve how)
{
    if (path.empty() || path.find('\0') != std::string::npos) {
        errno = EINVAL;
        return -1;
    }
    if (path.size() >= PATH_MAX) {
        errno = ENAMETOOLONG;
        return -1;
    }
#ifdef VELA_HAVE_OPENAT2
    if (how == NoSymlinkResolve::kAuto) {
        struct open_how request = {};
        request.flags = static_cast<unsigned long long>(flags | O_NOFOLLOW | O_CLOEXEC);
        request.resolve = RESOLVE_NO_SYMLINKS;
        const long fd = syscall(SYS_openat2, AT_FDCWD, path.c_str(), &request, sizeof(request));
        // ENOSYS: a kernel before 5.6; EPERM: a sandbox that filters the call.
        if (fd >= 0 || (errno != ENOSYS && errno != EPERM)) {
            return static_cast<int>(fd);
        }
    }
#endif
    try {
        return OpenWalkingNoSymlinks(path, flags);
    } catch (const std::exception&) {
        errno = ENOMEM;
        return -1;
    }
}

namespace {

// Reads `fd` to its end into `data`, sized for the `expected` bytes fstat
// gave and grown, up to `limit`, for a file that grows meanwhile. False with
// `err` set: EFBIG beyond `limit`, else the errno of the failed read. Can
// throw std::bad_alloc.
bool ReadToEnd(int fd, size_t expected, size_t limit, std::string& data, int& err)
{
    data.resize(expected + 1);
    size_t used = 0;
    for (;;) {
        if (used == data.size()) {
            // The file grew after fstat: allow it up to the limit.
            if (data.size() > limit) {
                err = EFBIG;
                return false;
            }
            data.resize(data.size() + 4096 > limit + 1 ? limit + 1 : data.size() + 4096);
        }
        ssize_t got = read(fd, &data[used], data.size() - used);
        if (got < 0) {
            if (errno == EINTR) {
                continue;
            }
            err = errno;
            return false;
        }
        if (got == 0) {
            break;
        }
        used += static_cast<size_t>(got);
    }
    if (used > limit) {
        err = EFBIG;
        return false;
    }
    data.resize(used);
    return true;
}

}  // namespace

bool ReadFileBounded(const std::string& path, size_t limit, std::string& out, int& err, unsigned flags,
                     struct stat* st)
{
    // O_NONBLOCK: opening a FIFO must not wait for a writer; the S_ISREG
    // check below then refuses it.
    int openFlags = O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK;
    if ((flags & kReadNoFollow) != 0) {
        openFlags |= O_NOFOLLOW;
    }
    ScopedFd fd(open(path.c_str(), openFlags));
    if (fd.Get() < 0) {
        err = errno;
        return false;
    }
    struct stat own;
    struct stat& info = st != nullptr ? *st : own;
    if (fstat(fd.Get(), &info) != 0) {
        err = errno;
        return false;
    }
    if (!S_ISREG(info.st_mode)) {
        err = EINVAL;
        return false;
    }
    if (info.st_size < 0 || static_cast<unsigned long long>(info.st_size) > limit) {
        err = EFBIG;
        return false;
    }
    std::string data;
    try {
        if (!ReadToEnd(fd.Get(), static_cast<size_t>(info.st_size), limit, data, err)) {
            return false;
        }
    } catch (const std::exception&) {
        err = ENOMEM;
        return false;
    }
    out.swap(data);
    return true;
}

bool WriteAll(int fd, const char* data, size_t len)
{
    while (len > 0) {
        ssize_t done = write(fd, data, len);
        if (done < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        data += done;
        len -= static_cast<size_t>(done);
    }
    return true;
}

bool FillTempFile(int fd, const char* data, size_t len, mode_t mode, uid_t uid, gid_t gid, const char*& step,
                  bool durable)
{
    if (fchmod(fd, mode & 07777) != 0) {
        step = "chmod";
    } else if ((uid != static_cast<uid_t>(-1) || gid != static_cast<gid_t>(-1)) && fchown(fd, uid, gid) != 0) {
        step = "chown";
    } else if (!WriteAll(fd, data, len)) {
        step = "write";
    } else if (durable && fsync(fd) != 0) {
        step = "fsync";
    } else {
        return true;
    }
    return false;
}

bool WriteFileAtomic(const std::string& path, const char* data, size_t len, mode_t mode, uid_t uid, gid_t gid,
                     const char*& step, bool durable)
{
    std::string dir;
    std::string tmpl;
    try {
        dir = DirName(path);
        // Cut the name so the temporary one stays within NAME_MAX.
        tmpl = dir + "/." + BaseName(path).substr(0, 200) + ".XXXXXX";
    } catch (const std::exception&) {
        step = "mkstemp";
        errno = ENOMEM;
        return false;
    }
    ScopedFd fd(mkostemp(&tmpl[0], O_CLOEXEC));
    if (fd.Get() < 0) {
        step = "mkstemp";
        return false;
    }
    bool ok = FillTempFile(fd.Get(), data, len, mode, uid, gid, step, durable);
    // close() can report a deferred write error (NFS): it counts.
    if (ok && close(fd.Release()) != 0) {
        step = "close";
        ok = false;
    }
    if (ok && rename(tmpl.c_str(), path.c_str()) != 0) {
        step = "rename";
        ok = false;
    }
    if (!ok) {
        const int saved = errno;
        fd.Reset();
        unlink(tmpl.c_str());
        errno = saved;
        return false;
    }
    if (durable) {
        SyncDir(dir);
    }
    return true;
}

void SyncDir(const std::string& dir)
{
    ScopedFd fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (fd.Get() < 0) {
        VELA_LOG_ERR("open(%s) for fsync: %m", dir.c_str());
        return;
    }
    if (fsync(fd.Get()) != 0) {
        VELA_LOG_ERR("fsync(%s): %m", dir.c_str());
    }
}

bool MakeDirs(const std::string& path, mode_t mode)
{
    try {
        for (size_t pos = 1; pos <= path.size(); ++pos) {
            if (pos != path.size() && path[pos] != '/') {
                continue;
            }
            const std::string prefix = path.substr(0, pos);
            struct stat st;
            if (stat(prefix.c_str(), &st) != 0) {
                if (errno != ENOENT) {
                    VELA_LOG_ERR("stat(%s): %m", prefix.c_str());
                    return false;
                }
                if (mkdir(prefix.c_str(), mode) != 0 && errno != EEXIST) {
                    VELA_LOG_ERR("mkdir(%s): %m", prefix.c_str());
                    return false;
                }
                if (stat(prefix.c_str(), &st) != 0) {  // EEXIST: made by someone else meanwhile
                    VELA_LOG_ERR("stat(%s): %m", prefix.c_str());
                    return false;
                }
            }
            if (!S_ISDIR(st.st_mode)) {
                VELA_LOG_ERR("%s exists and is not a directory", prefix.c_str());
                return false;
            }
        }
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory creating %s", path.c_str());
        return false;
    }
    return true;
}

std::string DirName(const std::string& path)
{
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos) {
        return ".";
    }
    if (slash == 0) {
        return "/";
    }
    return path.substr(0, slash);
}

std::string BaseName(const std::string& path)
{
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

}  // namespace System
}  // namespace VELA
