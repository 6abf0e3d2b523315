// Key=value files, files and directories, and file locks of the system
// library. Formats and contracts are in vela/sysfile.h.
#include <cerrno>
#include <climits>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <mutex>
#include <set>
#include <string>
#include <strings.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"

namespace VELA {
namespace System {

namespace {

constexpr size_t kMaxKeyValueFile = 1024 * 1024;
constexpr size_t kMaxLine = 8192;
constexpr size_t kMaxKey = 128;
constexpr size_t kMaxValue = 4096;
const char kInfoPath[] = "/etc/velainfo.conf";

// Handles given out by VLIBCFileLockTimeByFile and not yet released, so an
// unlock of any other descriptor is refused instead of closing it.
std::mutex g_handleLock;
std::set<int> g_lockHandles;

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

std::string Trim(const std::string& s)
{
    size_t begin = 0;
    size_t end = s.size();
    while (begin < end && IsBlank(s[begin])) {
        ++begin;
    }
    while (end > begin && IsBlank(s[end - 1])) {
        --end;
    }
    return s.substr(begin, end - begin);
}

bool HasControlByte(const std::string& s)
{
    for (unsigned char c : s) {
        if ((c < 0x20 && c != '\t') || c == 0x7f) {
            return true;
        }
    }
    return false;
}

// Parses one line into `out`. False when it is neither blank, a comment
// nor a key=value entry.
bool ParseLine(const std::string& raw, KeyValueLine& out)
{
    out.text = raw;
    out.key.clear();
    out.value.clear();
    const std::string line = Trim(raw);
    if (line.empty() || line[0] == '#') {
        return true;
    }
    const size_t eq = line.find('=');
    if (eq == std::string::npos) {
        return false;
    }
    std::string key = Trim(line.substr(0, eq));
    if (!ValidKey(key.c_str())) {
        return false;
    }
    std::string value = Trim(line.substr(eq + 1));
    if (!value.empty() && value[0] == '"') {
        if (value.size() < 2 || value.back() != '"') {
            return false;  // quote never closed: a cut line
        }
        value = value.substr(1, value.size() - 2);
    } else if (value.find('"') != std::string::npos) {
        return false;
    }
    if (value.size() > kMaxValue || HasControlByte(value)) {
        return false;
    }
    out.key.swap(key);
    out.value.swap(value);
    return true;
}

// Writes `text` to `path` through a temporary file in the same directory.
// `mode`, and `uid`/`gid` unless they are -1, are given to the new file.
bool ReplaceFileAtomic(const std::string& path, const std::string& text, mode_t mode, uid_t uid, gid_t gid)
{
    const char* step = nullptr;
    if (WriteFileAtomic(path, text.data(), text.size(), mode, uid, gid, step)) {
        return true;
    }
    if (strcmp(step, "mkstemp") == 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "mkstemp in %.200s: %m", DirName(path).c_str());
        VELA_LOG_ERR("cannot create a temporary file for %s: %m", path.c_str());
    } else {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "%s %.200s: %m", step, path.c_str());
        VELA_LOG_ERR("cannot write %s (%s): %m", path.c_str(), step);
    }
    return false;
}

// The text of `lines` with the first line of `key` replaced by `entry` and
// its later lines dropped (a later duplicate would override the new value);
// `entry` is appended when the key has no line.
std::string WithKeyLine(const std::vector<KeyValueLine>& lines, const char* key, const std::string& entry)
{
    std::string out;
    bool replaced = false;
    for (const KeyValueLine& line : lines) {
        if (line.key == key) {
            if (replaced) {
                continue;
            }
            out += entry;
            replaced = true;
        } else {
            out += line.text;
        }
        out += '\n';
    }
    if (!replaced) {
        out += entry;
        out += '\n';
    }
    return out;
}

int SetKeyValue(const char* rawPath, const char* key, const char* value)
{
    if (!ValidKey(key) || !ValidValue(value)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid key or value");
        VELA_LOG_ERR("refusing to write an invalid key or value");
        return -1;
    }
    const std::string path = ResolvePath(rawPath);
    if (path.empty()) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid path");
        return -1;
    }
    mode_t mode = 0644;
    uid_t uid = static_cast<uid_t>(-1);
    gid_t gid = static_cast<gid_t>(-1);
    std::string text;
    struct stat st;
    int err = 0;
    if (ReadFileBounded(path, kMaxKeyValueFile, text, err, kReadNoFollow, &st)) {
        mode = st.st_mode & 07777;
        if (geteuid() == 0) {
            uid = st.st_uid;
            gid = st.st_gid;
        }
    } else if (err != ENOENT) {
        errno = err == ELOOP ? EINVAL : err;
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "read %.200s: %m", path.c_str());
        VELA_LOG_ERR("cannot read %s: %m", path.c_str());
        return -1;
    }
    std::vector<KeyValueLine> lines;
    if (!ParseKeyValueText(text, lines)) {
        VELA_RECORD_ERROR(VLIBC_ERR_CORRUPT, "corrupt %.200s", path.c_str());
        VELA_LOG_ERR("%s is corrupt, not rewriting it", path.c_str());
        return -1;
    }
    const std::string out = WithKeyLine(lines, key, std::string(key) + "=\"" + value + "\"");
    if (out.size() > kMaxKeyValueFile) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "%.200s would exceed its size limit", path.c_str());
        VELA_LOG_ERR("%s would grow beyond %zu bytes", path.c_str(), kMaxKeyValueFile);
        return -1;
    }
    return ReplaceFileAtomic(path, out, mode, uid, gid) ? 0 : -1;
}

int GetKeyValue(const char* rawPath, const char* key, char* buf, size_t size)
{
    if (buf == nullptr || size == 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "null buffer");
        return -1;
    }
    buf[0] = '\0';
    if (!ValidKey(key)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid key");
        return -1;
    }
    const std::string path = ResolvePath(rawPath);
    if (path.empty()) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid path");
        return -1;
    }
    std::string value;
    const int rc = ReadKeyValue(path, key, value);
    if (rc != 1) {
        return rc;
    }
    if (value.size() + 1 > size) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "buffer too small for %.64s", key);
        return -1;
    }
    memcpy(buf, value.c_str(), value.size() + 1);
    return 1;
}

// Makes the directory `prefix` (mode 0700 until its mode is set) unless a
// directory is there. 1 when this call made it, 0 when it existed, -1
// (recorded and logged) when it is missing and cannot be made, or is no
// directory.
int MakeOneDir(const std::string& prefix)
{
    if (mkdir(prefix.c_str(), 0700) == 0) {
        return 1;
    }
    // EEXIST, or EROFS / EACCES for a directory that exists on a read-only
    // or foreign parent: only the result matters.
    const int mkdirErr = errno;
    struct stat st;
    if (stat(prefix.c_str(), &st) != 0) {
        errno = mkdirErr == EEXIST ? errno : mkdirErr;
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "mkdir %.200s: %m", prefix.c_str());
        VELA_LOG_ERR("mkdir(%s): %m", prefix.c_str());
        return -1;
    }
    if (!S_ISDIR(st.st_mode)) {
        errno = ENOTDIR;
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "%.200s is not a directory", prefix.c_str());
        VELA_LOG_ERR("%s exists and is not a directory", prefix.c_str());
        return -1;
    }
    return 0;
}

// Gives the directory `prefix` the owner `uid`/`gid` (unless both are -1),
// then `mode`, through a descriptor of the directory itself, never through
// a symbolic link put in its place. False (recorded and logged) on failure.
bool SetDirOwnerAndMode(const std::string& prefix, uid_t uid, gid_t gid, mode_t mode)
{
    const bool chownWanted = uid != static_cast<uid_t>(-1) || gid != static_cast<gid_t>(-1);
    ScopedFd fd(open(prefix.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (fd.Get() < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "open %.200s: %m", prefix.c_str());
        VELA_LOG_ERR("open(%s): %m", prefix.c_str());
        return false;
    }
    if (chownWanted && fchown(fd.Get(), uid, gid) != 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "chown %.200s: %m", prefix.c_str());
        VELA_LOG_ERR("chown(%s): %m", prefix.c_str());
        return false;
    }
    if (fchmod(fd.Get(), mode) != 0) {  // after chown, which may clear set-id bits
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "chmod %.200s: %m", prefix.c_str());
        VELA_LOG_ERR("chmod(%s): %m", prefix.c_str());
        return false;
    }
    return true;
}

// mkdir -p of the resolved `path`; see VELAFSMkdirP.
int MkdirP(const std::string& path, bool allWithMode, bool resetExisting, uid_t uid, gid_t gid, mode_t mode)
{
    // Component by component; ".." is refused so the result stays where the
    // path says.
    size_t pos = 0;
    std::string prefix = path[0] == '/' ? "/" : "";
    while (pos < path.size()) {
        while (pos < path.size() && path[pos] == '/') {
            ++pos;
        }
        if (pos >= path.size()) {
            break;
        }
        size_t end = path.find('/', pos);
        if (end == std::string::npos) {
            end = path.size();
        }
        const std::string part = path.substr(pos, end - pos);
        pos = end;
        if (part == "..") {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "\"..\" in %.200s", path.c_str());
            VELA_LOG_ERR("refusing to create %s: it holds \"..\"", path.c_str());
            return -1;
        }
        if (part == ".") {
            continue;
        }
        if (!prefix.empty() && prefix.back() != '/') {
            prefix += '/';
        }
        prefix += part;
        size_t rest = pos;
        while (rest < path.size() && path[rest] == '/') {
            ++rest;
        }
        const bool last = rest >= path.size();
        const int made = MakeOneDir(prefix);
        if (made < 0) {
            return -1;
        }
        if (made == 0 && !(last && resetExisting)) {
            continue;
        }
        if (!SetDirOwnerAndMode(prefix, uid, gid, last || allWithMode ? mode : 0755)) {
            return -1;
        }
    }
    struct stat st;
    if (prefix.empty() || stat(prefix.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
        VELA_RECORD_ERROR(VLIBC_ERR_MKDIR, "%.200s is not a directory", path.c_str());
        return -1;
    }
    return 0;
}

struct timespec Now()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts;
}

bool Before(const struct timespec& a, const struct timespec& b)
{
    return a.tv_sec < b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec < b.tv_nsec);
}

int LockTime(const char* rawPath, int exclusive, int timeoutSec, int* handle)
{
    const std::string path = ResolvePath(rawPath);
    if (path.empty() || timeoutSec < 0 || timeoutSec > 3600) {
        errno = EINVAL;
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid lock file or timeout");
        return -1;
    }
    const int common = O_CLOEXEC | O_NOCTTY | O_NONBLOCK | O_NOFOLLOW;
    ScopedFd fd(open(path.c_str(), O_RDWR | O_CREAT | common, 0600));
    if (fd.Get() < 0 && (errno == EACCES || errno == EROFS)) {
        // Someone else's lock file: a read-only descriptor locks as well.
        fd.Reset(open(path.c_str(), O_RDONLY | common));
    }
    if (fd.Get() < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "open %.200s: %m", path.c_str());
        VELA_LOG_ERR("cannot open lock file %s: %m", path.c_str());
        return -1;
    }
    struct stat st;
    if (fstat(fd.Get(), &st) != 0 || !S_ISREG(st.st_mode)) {
        errno = EINVAL;
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "%.200s is not a regular file", path.c_str());
        VELA_LOG_ERR("lock file %s is not a regular file", path.c_str());
        return -1;
    }
    struct timespec deadline = Now();
    deadline.tv_sec += timeoutSec;
    const int op = (exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB;
    long pauseNs = 2 * 1000 * 1000;
    for (;;) {
        if (flock(fd.Get(), op) == 0) {
            {
                std::lock_guard<std::mutex> guard(g_handleLock);
                g_lockHandles.insert(fd.Get());  // bad_alloc: fd closes, lock released
            }
            *handle = fd.Release();
            return 0;
        }
        if (errno == EINTR) {
            continue;
        }
        if (errno != EWOULDBLOCK) {
            VELA_RECORD_ERROR(VLIBC_ERR_IO, "flock %.200s: %m", path.c_str());
            VELA_LOG_ERR("flock(%s): %m", path.c_str());
            return -1;
        }
        const struct timespec now = Now();
        if (!Before(now, deadline)) {
            errno = ETIMEDOUT;
            VELA_RECORD_ERROR(VLIBC_ERR_TIMEOUT, "lock %.200s held", path.c_str());
            return -1;
        }
        struct timespec pause = {0, pauseNs};
        nanosleep(&pause, nullptr);
        if (pauseNs < 50 * 1000 * 1000) {
            pauseNs *= 2;
        }
    }
}

}  // namespace

std::string ResolvePath(const char* path)
{
    if (path == nullptr) {
        return std::string();
    }
    const size_t len = strnlen(path, PATH_MAX);
    if (len == 0 || len >= PATH_MAX) {
        return std::string();
    }
    std::string p(path, len);
    if (HasControlByte(p) || p.find('\t') != std::string::npos) {
        return std::string();
    }
    if (p[0] != '/') {
        return p;
    }
    const std::string& root = Root();
    if (root == "/") {
        return p;
    }
    if (p.size() > root.size() && p.compare(0, root.size(), root) == 0 && p[root.size()] == '/') {
        return p;  // already inside the root
    }
    std::string resolved = Path(p);
    if (resolved.size() >= PATH_MAX) {
        return std::string();
    }
    return resolved;
}

bool ValidKey(const char* key)
{
    if (key == nullptr) {
        return false;
    }
    return IsCheckedName(key, strnlen(key, kMaxKey + 1), kNameDotted, kMaxKey);
}

bool ValidValue(const char* value)
{
    if (value == nullptr) {
        return false;
    }
    const size_t len = strnlen(value, kMaxValue + 1);
    if (len > kMaxValue) {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        const unsigned char c = static_cast<unsigned char>(value[i]);
        if ((c < 0x20 && c != '\t') || c == 0x7f) {
            return false;
        }
    }
    return true;
}

bool ParseKeyValueText(const std::string& text, std::vector<KeyValueLine>& lines)
{
    if (text.size() > kMaxKeyValueFile || text.find('\0') != std::string::npos) {
        return false;
    }
    std::vector<KeyValueLine> parsed;
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\n', start);
        if (end == std::string::npos) {
            end = text.size();
        }
        std::string raw = text.substr(start, end - start);
        start = end + 1;
        if (!raw.empty() && raw.back() == '\r') {
            raw.pop_back();
        }
        if (raw.size() > kMaxLine) {
            return false;
        }
        KeyValueLine line;
        if (!ParseLine(raw, line)) {
            return false;
        }
        parsed.push_back(std::move(line));
    }
    lines.swap(parsed);
    return true;
}

int ReadKeyValue(const std::string& path, const std::string& key, std::string& value)
{
    std::string text;
    int err = 0;
    if (!ReadFileBounded(path, kMaxKeyValueFile, text, err)) {
        if (err == ENOENT || err == ENOTDIR) {
            errno = err;
            VELA_RECORD_ERROR(VLIBC_ERR_NOT_FOUND, "%.200s missing", path.c_str());
            return 0;
        }
        errno = err;
        VELA_RECORD_ERROR(err == EFBIG ? VLIBC_ERR_CORRUPT : VLIBC_ERR_IO, "read %.200s: %m", path.c_str());
        VELA_LOG_ERR("cannot read %s: %m", path.c_str());
        return -1;
    }
    std::vector<KeyValueLine> lines;
    if (!ParseKeyValueText(text, lines)) {
        VELA_RECORD_ERROR(VLIBC_ERR_CORRUPT, "corrupt %.200s", path.c_str());
        VELA_LOG_ERR("%s is corrupt", path.c_str());
        return -1;
    }
    const KeyValueLine* found = nullptr;
    for (const KeyValueLine& line : lines) {
        if (line.key == key) {
            found = &line;  // the last line of the key wins
        }
    }
    if (found == nullptr) {
        VELA_RECORD_ERROR(VLIBC_ERR_NOT_FOUND, "no key %.64s in %.150s", key.c_str(), path.c_str());
        return 0;
    }
    value = found->value;
    return 1;
}

}  // namespace System
}  // namespace VELA

using namespace VELA::System;

int VLIBCFileCheckKeyValue(const char* path, const char* key, const char* value, int flags)
{
    try {
        if ((flags & ~VLIBC_KV_NOCASE) != 0 || value == nullptr || !ValidKey(key)) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid key, value or flags");
            return 0;
        }
        const std::string resolved = ResolvePath(path);
        if (resolved.empty()) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid path");
            return 0;
        }
        std::string found;
        if (ReadKeyValue(resolved, key, found) != 1) {
            return 0;
        }
        if (flags & VLIBC_KV_NOCASE) {
            return strlen(value) == found.size() && strcasecmp(found.c_str(), value) == 0 ? 1 : 0;
        }
        return found == value ? 1 : 0;
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return 0;
    }
}

int VLIBCFileGetKeyValue(const char* path, const char* key, char* buf, size_t size)
{
    try {
        return GetKeyValue(path, key, buf, size);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VELA::System::ReadKeyValueFile(const char* rawPath, std::vector<std::pair<std::string, std::string>>& out)
{
    out.clear();
    try {
        const std::string path = ResolvePath(rawPath);
        if (path.empty()) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid path");
            return -1;
        }
        std::string text;
        int err = 0;
        if (!ReadFileBounded(path, kMaxKeyValueFile, text, err)) {
            if (err == ENOENT || err == ENOTDIR) {
                return 0;
            }
            errno = err;
            VELA_LOG_ERR("cannot read %s: %m", path.c_str());
            return -1;
        }
        std::vector<KeyValueLine> lines;
        if (!ParseKeyValueText(text, lines)) {
            VELA_LOG_ERR("%s is corrupt", path.c_str());
            return -1;
        }
        for (const KeyValueLine& line : lines) {
            if (!line.key.empty()) {
                out.emplace_back(line.key, line.value);
            }
        }
        return 1;
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        out.clear();
        return -1;
    }
}

int VLIBCFileSetKeyValue(const char* path, const char* key, const char* value)
{
    try {
        return SetKeyValue(path, key, value);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VLIBCINFOSetKeyValue(const char* key, const char* value)
{
    return VLIBCFileSetKeyValue(kInfoPath, key, value);
}

int VLIBCINFOGetKeyValue(const char* key, char* buf, size_t size)
{
    return VLIBCFileGetKeyValue(kInfoPath, key, buf, size);
}

int VLIBCFileExist(const char* path)
{
    try {
        const std::string resolved = ResolvePath(path);
        struct stat st;
        return !resolved.empty() && stat(resolved.c_str(), &st) == 0 && S_ISREG(st.st_mode) ? 1 : 0;
    } catch (const std::exception&) {
        return 0;
    }
}

int VLIBCFileTouch(const char* path)
{
    try {
        const std::string resolved = ResolvePath(path);
        if (resolved.empty()) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid path");
            return -1;
        }
        // O_NONBLOCK: a FIFO never blocks the open (and is refused below).
        ScopedFd fd(open(resolved.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0644));
        if (fd.Get() < 0) {
            VELA_RECORD_ERROR(VLIBC_ERR_IO, "open %.200s: %m", resolved.c_str());
            VELA_LOG_ERR("cannot touch %s: %m", resolved.c_str());
            return -1;
        }
        struct stat st;
        if (fstat(fd.Get(), &st) != 0 || !S_ISREG(st.st_mode)) {
            errno = EINVAL;
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "%.200s is not a regular file", resolved.c_str());
            VELA_LOG_ERR("cannot touch %s: not a regular file", resolved.c_str());
            return -1;
        }
        if (futimens(fd.Get(), nullptr) != 0) {
            VELA_RECORD_ERROR(VLIBC_ERR_IO, "futimens %.200s: %m", resolved.c_str());
            VELA_LOG_ERR("cannot touch %s: %m", resolved.c_str());
            return -1;
        }
        return 0;
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VELAFSMkdirP(const char* path, int allWithMode, int resetExisting, uid_t uid, gid_t gid, mode_t mode)
{
    try {
        const std::string resolved = ResolvePath(path);
        if (resolved.empty() || (mode & ~static_cast<mode_t>(07777)) != 0) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid path or mode");
            return -1;
        }
        return MkdirP(resolved, allWithMode != 0, resetExisting != 0, uid, gid, mode);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VLIBCFileLockTimeByFile(const char* path, int exclusive, int timeoutSec, int* handle)
{
    if (handle == nullptr) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "null handle");
        return -1;
    }
    *handle = -1;
    try {
        return LockTime(path, exclusive, timeoutSec, handle);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VLIBCFileUnlockByFile(int handle)
{
    {
        std::lock_guard<std::mutex> guard(g_handleLock);
        if (handle < 0 || g_lockHandles.erase(handle) == 0) {
            VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid lock handle %d", handle);
            VELA_LOG_ERR("unlock of %d refused: not a lock handle", handle);
            return -1;
        }
    }
    int rc = 0;
    while (flock(handle, LOCK_UN) != 0) {
        if (errno != EINTR) {
            VELA_RECORD_ERROR(VLIBC_ERR_IO, "unlock: %m");
            rc = -1;
            break;
        }
    }
    // close() releases the lock in any case; its EINTR still closed the fd.
    if (close(handle) != 0 && errno != EINTR) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "close of lock handle: %m");
        rc = -1;
    }
    return rc;
}

void VELA::System::NumberSetting(const std::vector<std::pair<std::string, std::string>>& settings,
                                 const char* path, const char* key, long long min, long long max, long long& value)
{
    const std::string* text = nullptr;
    for (const auto& line : settings) {
        if (line.first == key) {
            text = &line.second;
        }
    }
    long long parsed = 0;
    if (text == nullptr) {
        return;
    }
    if (!ParseDecimal(*text, min, max, parsed)) {
        VELA_LOG_ERR("%s: %s=\"%.32s\" is not a number from %lld to %lld, keeping %lld", path, key, text->c_str(),
                     min, max, value);
        return;
    }
    value = parsed;
}
