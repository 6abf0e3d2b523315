// Limits of the process serving one request (see RequestLimits.h).
#include "webentry/RequestLimits.h"

#include <arpa/inet.h>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/random.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"

namespace VELA {

namespace {

const char kConfPath[] = "/etc/vela/webapi.conf";
const char kSlotDir[] = "/run/vela";
const char kSlotFile[] = "/run/vela/clients.lock";

// The slots of all addresses live in one lock file: a key of kKeyBytes
// random bytes, then kBuckets buckets of maxPerClient lockable bytes. An
// address falls in a bucket by a hash keyed with the file's key, so a
// client cannot choose addresses that share a bucket with another's.
constexpr size_t kKeyBytes = 16;
constexpr uint64_t kBuckets = 4096;
constexpr unsigned kMaxWallSeconds = 24u * 3600u;
constexpr int kCpuGraceSeconds = 5;

using Settings = std::vector<std::pair<std::string, std::string>>;

template <typename T>
void Setting(const Settings& settings, const char* key, long long min, long long max, T& value)
{
    long long number = static_cast<long long>(value);
    System::NumberSetting(settings, kConfPath, key, min, max, number);
    value = static_cast<T>(number);
}

uint64_t KeyedHash(const unsigned char* key, const unsigned char* data, size_t len)
{
    uint64_t h = 1469598103934665603ULL;  // FNV-1a, seeded with the key
    for (size_t i = 0; i < kKeyBytes; ++i) {
        h = (h ^ key[i]) * 1099511628211ULL;
    }
    for (size_t i = 0; i < len; ++i) {
        h = (h ^ data[i]) * 1099511628211ULL;
    }
    return h ^ (h >> 29);
}

// The bytes that name a client: an IPv4 address whole, an IPv6 address by
// its /64 (one subscriber's prefix), other text as it is.
std::string ClientKey(const char* address)
{
    unsigned char raw[16];
    if (inet_pton(AF_INET, address, raw) == 1) {
        return std::string(reinterpret_cast<const char*>(raw), 4);
    }
    if (inet_pton(AF_INET6, address, raw) == 1) {
        return std::string(reinterpret_cast<const char*>(raw), 8);
    }
    return std::string(address, strnlen(address, 64));
}

bool ReadKey(int fd, unsigned char* key)
{
    size_t got = 0;
    while (got < kKeyBytes) {
        const ssize_t n = pread(fd, key + got, kKeyBytes - got, static_cast<off_t>(got));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        got += static_cast<size_t>(n);
    }
    return true;
}

// Opens the lock file, creating it with a fresh key when there is none:
// the key is written to a file of this process first and linked into place,
// so no process ever reads a file without its whole key.
int OpenSlotFile(unsigned char* key)
{
    const std::string path = VELA::System::Path(kSlotFile);
    for (int attempt = 0; attempt < 2; ++attempt) {
        const int fd = open(path.c_str(), O_RDWR | O_NOFOLLOW | O_CLOEXEC);
        if (fd >= 0) {
            struct stat st;
            if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() && ReadKey(fd, key)) {
                return fd;
            }
            VELA_LOG_ERR("%s is not a key file of this server", path.c_str());
            close(fd);
            return -1;
        }
        if (errno != ENOENT) {
            VELA_LOG_ERR("cannot open %s[%m]", path.c_str());
            return -1;
        }
        const std::string dir = VELA::System::Path(kSlotDir);
        if (VELAFSMkdirP(dir.c_str(), 0, 0, static_cast<uid_t>(-1), static_cast<gid_t>(-1), 0755) != 0) {
            VELA_LOG_ERR("cannot create %s", dir.c_str());
            return -1;
        }
        const std::string tmp = path + "." + std::to_string(getpid());
        const int out = open(tmp.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
        if (out < 0) {
            VELA_LOG_ERR("cannot create %s[%m]", tmp.c_str());
            return -1;
        }
        unsigned char fresh[kKeyBytes];
        const bool written = getrandom(fresh, sizeof(fresh), 0) == static_cast<ssize_t>(sizeof(fresh)) &&
                             write(out, fresh, sizeof(fresh)) == static_cast<ssize_t>(sizeof(fresh));
        const bool linked = written && link(tmp.c_str(), path.c_str()) == 0;
        const int linkErr = errno;
        unlink(tmp.c_str());
        if (linked) {
            memcpy(key, fresh, sizeof(fresh));
            return out;
        }
        close(out);
        if (!written || linkErr != EEXIST) {
            VELA_LOG_ERR("cannot create %s", path.c_str());
            return -1;
        }
        // Another process created it meanwhile: open theirs.
    }
    return -1;
}

}  // namespace

RequestLimits LoadRequestLimits()
{
    RequestLimits limits;
    Settings settings;
    if (System::ReadKeyValueFile(kConfPath, settings) <= 0) {
        return limits;  // missing (defaults) or unreadable (logged)
    }
    Setting(settings, "request_cpu_seconds", 1, 86400, limits.cpuSeconds);
    Setting(settings, "request_time_seconds", 1, 86400, limits.timeSeconds);
    Setting(settings, "request_body_idle_seconds", 1, 3600, limits.bodyIdleSeconds);
    Setting(settings, "request_body_min_rate", 1, 1LL << 40, limits.bodyMinRate);
    Setting(settings, "request_max_per_client", 0, 4096, limits.maxPerClient);
    Setting(settings, "fcgi_parents", 0, 64, limits.fcgiParents);
    Setting(settings, "fcgi_max_children", 1, 4096, limits.fcgiMaxChildren);
    Setting(settings, "fcgi_param_seconds", 1, 3600, limits.fcgiParamSeconds);
    return limits;
}

unsigned RequestWallSeconds(const RequestLimits& limits, long long contentLength)
{
    unsigned long long seconds = static_cast<unsigned long long>(limits.timeSeconds);
    if (contentLength > 0 && limits.bodyMinRate > 0) {
        seconds += static_cast<unsigned long long>(contentLength / limits.bodyMinRate) + 1;
    }
    return seconds > kMaxWallSeconds ? kMaxWallSeconds : static_cast<unsigned>(seconds);
}

bool ArmRequestLimits(const RequestLimits& limits, long long contentLength)
{
    bool ok = true;
    struct rlimit cpu;
    if (getrlimit(RLIMIT_CPU, &cpu) == 0) {
        const rlim_t soft = static_cast<rlim_t>(limits.cpuSeconds);
        const rlim_t hard = soft + kCpuGraceSeconds;
        if (cpu.rlim_max == RLIM_INFINITY || cpu.rlim_max > hard) {
            cpu.rlim_max = hard;
        }
        cpu.rlim_cur = soft < cpu.rlim_max ? soft : cpu.rlim_max;
        if (setrlimit(RLIMIT_CPU, &cpu) != 0) {
            VELA_LOG_ERR("cannot limit the request's CPU time[%m]");
            ok = false;
        }
    }
    alarm(RequestWallSeconds(limits, contentLength));
    return ok;
}

int TakeClientSlot(const RequestLimits& limits, const char* address)
{
    if (limits.maxPerClient <= 0) {
        return 1;
    }
    unsigned char key[kKeyBytes];
    // The descriptor stays open for the life of the process: its locks go
    // with it, and with the process when it ends (however it ends).
    const int fd = OpenSlotFile(key);
    if (fd < 0) {
        return -1;
    }
    const std::string client = ClientKey(address != nullptr ? address : "");
    const uint64_t bucket =
        KeyedHash(key, reinterpret_cast<const unsigned char*>(client.data()), client.size()) % kBuckets;
    const off_t first = static_cast<off_t>(kKeyBytes + bucket * static_cast<uint64_t>(limits.maxPerClient));
    for (int slot = 0; slot < limits.maxPerClient; ++slot) {
        struct flock lock;
        memset(&lock, 0, sizeof(lock));
        lock.l_type = F_WRLCK;
        lock.l_whence = SEEK_SET;
        lock.l_start = first + slot;
        lock.l_len = 1;
        if (fcntl(fd, F_SETLK, &lock) == 0) {
            return 1;
        }
        if (errno != EACCES && errno != EAGAIN) {
            VELA_LOG_ERR("cannot lock a client slot[%m]");
            close(fd);
            return -1;
        }
    }
    close(fd);
    return 0;
}

}  // namespace VELA
