// Helpers of the session and access-token stores: clock, random identifiers,
// state directories and files, the store lock, NSS look-ups.
#include "session/SessionStore.h"

#include <arpa/inet.h>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>
#include <vector>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/session.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace {

std::atomic<long long (*)(void)> g_clock{nullptr};

constexpr size_t kMaxUserName = 492;
constexpr int kLockWaitMs = 3000;
constexpr size_t kMaxDirEntries = 100000;  // bound of one directory scan

const char kBase64Url[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_";

long long MonotonicMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

}  // namespace

void VELA::Session::SetClockForTest(long long (*now)(void)) { g_clock.store(now); }

namespace VELA {
namespace Session {

using System::DirName;
using System::FindUserByName;
using System::MakeDirs;
using System::ReadFileBounded;
using System::WriteJsonAtomic;
using System::kReadNoFollow;

long long Now()
{
    long long (*clock)(void) = g_clock.load();
    if (clock != nullptr) {
        return clock();
    }
    return static_cast<long long>(time(nullptr));
}

bool RandomId(size_t bytes, std::string& out)
{
    unsigned char raw[64];
    if (bytes == 0 || bytes > sizeof(raw)) {
        return false;
    }
    size_t got = 0;
    while (got < bytes) {
        const ssize_t n = getrandom(raw + got, bytes - got, 0);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            VELA_LOG_ERR("getrandom: %m");
            return false;
        }
        got += static_cast<size_t>(n);
    }
    std::string text;
    try {
        text.reserve(IdLength(bytes));
        for (size_t i = 0; i < bytes; i += 3) {
            const unsigned v = (raw[i] << 16) | ((i + 1 < bytes ? raw[i + 1] : 0) << 8) |
                               (i + 2 < bytes ? raw[i + 2] : 0);
            text.push_back(kBase64Url[(v >> 18) & 63]);
            text.push_back(kBase64Url[(v >> 12) & 63]);
            if (i + 1 < bytes) {
                text.push_back(kBase64Url[(v >> 6) & 63]);
            }
            if (i + 2 < bytes) {
                text.push_back(kBase64Url[v & 63]);
            }
        }
    } catch (const std::exception&) {
        explicit_bzero(raw, sizeof(raw));
        return false;
    }
    explicit_bzero(raw, sizeof(raw));
    out.swap(text);
    return true;
}

bool IsId(const char* text, size_t len)
{
    return text != nullptr && strnlen(text, len + 1) == len && System::IsCheckedName(text, len, System::kNameId, len);
}

bool ListIds(const std::string& dir, size_t len, std::vector<std::string>& ids)
{
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        if (errno == ENOENT) {
            return true;
        }
        VELA_LOG_ERR("opendir(%s): %m", dir.c_str());
        return false;
    }
    try {
        size_t seen = 0;
        while (struct dirent* ent = readdir(d)) {
            if (++seen > kMaxDirEntries) {
                VELA_LOG_ERR("%s holds more than %zu entries, the rest are ignored", dir.c_str(), kMaxDirEntries);
                break;
            }
            if (IsId(ent->d_name, len)) {
                ids.emplace_back(ent->d_name);
            }
        }
    } catch (...) {
        closedir(d);
        throw;
    }
    closedir(d);
    return true;
}

bool ConstantTimeEquals(const std::string& a, const std::string& b)
{
    if (a.size() != b.size()) {
        return false;
    }
    volatile unsigned char diff = 0;
    for (size_t i = 0; i < a.size(); ++i) {
        diff = diff | static_cast<unsigned char>(a[i] ^ b[i]);
    }
    return diff == 0;
}

bool IsUserName(const char* name)
{
    if (name == nullptr) {
        return false;
    }
    const size_t len = strnlen(name, kMaxUserName + 1);
    if (len == 0 || len > kMaxUserName) {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        const unsigned char c = static_cast<unsigned char>(name[i]);
        if (c < 0x20 || c == 0x7f || c == '/' || c == ':') {
            return false;
        }
    }
    return true;
}

int LookupUser(const char* name, uid_t& uid)
{
    gid_t gid = 0;
    int found = -1;
    try {
        found = FindUserByName(name, uid, gid, nullptr);
    } catch (const std::exception&) {
        return -1;
    }
    if (found < 0) {
        VELA_LOG_ERR("getpwnam_r(%.64s): %m", name);
    }
    return found;
}

bool CanonicalAddress(const std::string& text, std::string& out)
{
    if (text.size() >= INET6_ADDRSTRLEN) {
        return false;
    }
    unsigned char bytes[sizeof(struct in6_addr)];
    int family = AF_INET;
    if (inet_pton(AF_INET, text.c_str(), bytes) != 1) {
        family = AF_INET6;
        if (inet_pton(AF_INET6, text.c_str(), bytes) != 1) {
            return false;
        }
        struct in6_addr v6;
        memcpy(&v6, bytes, sizeof(v6));
        if (IN6_IS_ADDR_V4MAPPED(&v6)) {
            family = AF_INET;
            memmove(bytes, bytes + 12, 4);
        }
    }
    char buf[INET6_ADDRSTRLEN];
    if (inet_ntop(family, bytes, buf, sizeof(buf)) == nullptr) {
        return false;
    }
    try {
        out = buf;
    } catch (const std::exception&) {
        return false;
    }
    return true;
}

bool EnsureStateDir(const std::string& path)
{
    if (path.empty() || path[0] != '/') {
        return false;
    }
    if (!MakeDirs(DirName(path), 0755)) {
        return false;
    }
    if (mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) {
        VELA_LOG_ERR("mkdir(%s): %m", path.c_str());
        return false;
    }
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) {
        VELA_LOG_ERR("lstat(%s): %m", path.c_str());
        return false;
    }
    if (!S_ISDIR(st.st_mode)) {
        VELA_LOG_ERR("%s is not a directory", path.c_str());
        return false;
    }
    if (st.st_uid != geteuid()) {
        VELA_LOG_ERR("%s is owned by uid %u, not by uid %u", path.c_str(), static_cast<unsigned>(st.st_uid),
                     static_cast<unsigned>(geteuid()));
        return false;
    }
    if ((st.st_mode & 077) != 0) {
        VELA_LOG(LOG_WARNING, "%s had mode %03o, setting 0700", path.c_str(), static_cast<unsigned>(st.st_mode & 0777));
        if (chmod(path.c_str(), 0700) != 0) {
            VELA_LOG_ERR("chmod(%s): %m", path.c_str());
            return false;
        }
    }
    return true;
}

ReadResult ReadStateFile(const std::string& path, size_t limit, Json::Value& out)
{
    std::string text;
    struct stat st;
    int err = 0;
    if (!ReadFileBounded(path, limit, text, err, kReadNoFollow, &st)) {
        switch (err) {
        case ENOENT:
            return ReadResult::Missing;
        case ELOOP:
            VELA_LOG_ERR("%s is a symbolic link, refused", path.c_str());
            return ReadResult::Corrupt;
        case EINVAL:
            VELA_LOG_ERR("%s is not a regular file, refused", path.c_str());
            return ReadResult::Corrupt;
        case EFBIG:
            VELA_LOG_ERR("%s is larger than %zu bytes, refused", path.c_str(), limit);
            return ReadResult::Corrupt;
        default:
            VELA_LOG_ERR("cannot read %s: %s", path.c_str(), strerror(err));
            return ReadResult::Error;
        }
    }
    if (st.st_uid != geteuid()) {
        VELA_LOG_ERR("%s is not a regular file owned by uid %u, refused", path.c_str(),
                     static_cast<unsigned>(geteuid()));
        return ReadResult::Corrupt;
    }
    Json::Value doc;
    if (!VELA::WebAPIUtil::ParseJson(text, doc) || !doc.isObject()) {
        VELA_LOG_ERR("%s is not a valid state file", path.c_str());
        return ReadResult::Corrupt;
    }
    out.swap(doc);
    return ReadResult::Ok;
}

bool WriteStateFile(const std::string& path, const Json::Value& value, bool durable)
{
    return WriteJsonAtomic(path, value, 0600, durable);
}

StoreLock::StoreLock(const std::string& dir)
{
    const std::string path = dir + "/.lock";
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY, 0600);
    if (fd < 0) {
        VELA_LOG_ERR("open(%s): %m", path.c_str());
        return;
    }
    const long long deadline = MonotonicMs() + kLockWaitMs;
    for (;;) {
        if (flock(fd, LOCK_EX | LOCK_NB) == 0) {
            fd_ = fd;
            return;
        }
        if (errno != EWOULDBLOCK && errno != EINTR) {
            VELA_LOG_ERR("flock(%s): %m", path.c_str());
            break;
        }
        if (MonotonicMs() >= deadline) {
            VELA_LOG_ERR("flock(%s): still held by another process after %d ms", path.c_str(), kLockWaitMs);
            break;
        }
        struct timespec pause = {0, 2 * 1000 * 1000};
        nanosleep(&pause, nullptr);
    }
    close(fd);
}

StoreLock::~StoreLock()
{
    if (fd_ >= 0) {
        close(fd_);  // releases the flock
    }
}

bool GetInt(const Json::Value& obj, const char* key, long long min, long long max, long long& out)
{
    const Json::Value* v = obj.find(key, key + strlen(key));
    if (v == nullptr || !(v->isInt64() && (v->isIntegral()))) {
        return false;
    }
    const long long n = v->asInt64();
    if (n < min || n > max) {
        return false;
    }
    out = n;
    return true;
}

bool GetBool(const Json::Value& obj, const char* key, bool& out)
{
    const Json::Value* v = obj.find(key, key + strlen(key));
    if (v == nullptr || !v->isBool()) {
        return false;
    }
    out = v->asBool();
    return true;
}

bool GetString(const Json::Value& obj, const char* key, size_t maxLen, std::string& out)
{
    const Json::Value* v = obj.find(key, key + strlen(key));
    if (v == nullptr || !v->isString()) {
        return false;
    }
    const char* begin = nullptr;
    const char* end = nullptr;
    if (!v->getString(&begin, &end) || static_cast<size_t>(end - begin) > maxLen) {
        return false;
    }
    try {
        out.assign(begin, end);
    } catch (const std::exception&) {
        return false;
    }
    return out.find('\0') == std::string::npos;
}

bool CopyOut(const std::string& text, char* buf, size_t size)
{
    if (buf == nullptr || size == 0) {
        return false;
    }
    if (text.size() + 1 > size) {
        buf[0] = '\0';
        return false;
    }
    memcpy(buf, text.c_str(), text.size() + 1);
    return true;
}

}  // namespace Session
}  // namespace VELA
