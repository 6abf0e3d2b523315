#include "session/ServerKey.h"

#include <cerrno>
#include <ctime>
#include <fcntl.h>
#include <mutex>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "vela/log.h"
#include "vela/vlibc.h"

namespace VELA {
namespace Session {

using System::FillTempFile;
using System::MakeDirs;
using System::ReadFileBounded;
using System::ScopedFd;

namespace {

constexpr int kKeyBits = 3072;
constexpr int kMinKeyBits = 2048;
constexpr int kMaxKeyBits = 16384;
constexpr size_t kMaxKeyFile = 64 * 1024;
// Generating a 3072-bit key takes under a second on a desktop CPU and some
// seconds on a slow one; a creator that holds the lock longer than this is
// stuck, and waiting on it forever would hang every request behind it.
constexpr long kLockWaitMs = 120 * 1000;
constexpr long kLockPollMs = 20;

const char kKeyDir[] = "/var/lib/vela/keys";
const char kStateParent[] = "/var/lib/vela";
const char kPrivateName[] = "param_rsa.pem";
const char kPublicName[] = "param_rsa.pub.pem";
const char kPrivateTemp[] = ".param_rsa.pem.tmp";
const char kPublicTemp[] = ".param_rsa.pub.pem.tmp";
const char kLockName[] = ".lock";

// The key of the process, for the key directory it was read from (the
// system root can change between calls in tests).
std::mutex g_cacheLock;
std::string g_cacheDir;
EVP_PKEY* g_cacheKey = nullptr;
const CryptoApi* g_cacheApi = nullptr;

// A passphrase is never asked for: without this callback OpenSSL would
// prompt on the terminal for an encrypted key.
int NoPassphrase(char*, int, int, void*)
{
    return -1;
}

long ElapsedMs(const struct timespec& start)
{
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return (now.tv_sec - start.tv_sec) * 1000L + (now.tv_nsec - start.tv_nsec) / 1000000L;
}

// Opens the key directory; with `create`, creates it (and its parents)
// when missing. It must be a real directory owned by the process's user;
// group and other permissions found on it are removed. -1 with errno ENOENT
// (not logged) when it is missing and `create` is false.
int OpenKeyDir(const std::string& dir, bool create)
{
    if (create) {
        if (!MakeDirs(System::Path(kStateParent), 0755)) {
            return -1;
        }
        if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
            VELA_LOG_ERR("mkdir(%s): %m", dir.c_str());
            return -1;
        }
    }
    ScopedFd fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (fd.Get() < 0) {
        if (errno == ENOENT && !create) {
            return -1;
        }
        VELA_LOG_ERR("open(%s): %m", dir.c_str());
        return -1;
    }
    struct stat st;
    if (fstat(fd.Get(), &st) != 0) {
        VELA_LOG_ERR("stat(%s): %m", dir.c_str());
        return -1;
    }
    if (st.st_uid != geteuid()) {
        VELA_LOG_ERR("%s is owned by uid %u, not by this process's user", dir.c_str(),
                     static_cast<unsigned>(st.st_uid));
        return -1;
    }
    if ((st.st_mode & 07777) != 0700 && fchmod(fd.Get(), 0700) != 0) {
        VELA_LOG_ERR("chmod(%s): %m", dir.c_str());
        return -1;
    }
    return fd.Release();
}

enum class KeyFile { Loaded, Missing, Unusable };

// Fills `pem` (sized from fstat) from the key file `fd` (`path` for the log
// lines). False (logged) when reading fails or the file shrank meanwhile.
bool ReadKeyText(int fd, const std::string& path, SecretBytes& pem)
{
    size_t used = 0;
    while (used < pem.size()) {
        ssize_t got = read(fd, pem.data() + used, pem.size() - used);
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got < 0) {
            VELA_LOG_ERR("read(%s): %m", path.c_str());
            return false;
        }
        if (got == 0) {
            VELA_LOG_ERR("%s shrank while being read", path.c_str());
            return false;
        }
        used += static_cast<size_t>(got);
    }
    return true;
}

// The private key in the PEM text `pem` of `path`, which is wiped: an
// unencrypted RSA key of kMinKeyBits to kMaxKeyBits bits. Null (logged)
// otherwise.
EVP_PKEY* ParsePrivateKey(const CryptoApi& api, const std::string& path, SecretBytes& pem)
{
    EVP_PKEY* key = nullptr;
    {
        MemBio bio(api, pem.data(), static_cast<int>(pem.size()));
        if (bio.get() != nullptr) {
            key = api.PEM_read_bio_PrivateKey(bio.get(), nullptr, NoPassphrase, nullptr);
        }
    }
    pem.Wipe();
    if (key == nullptr) {
        LogCryptoError(api, ("cannot read the private key in " + path).c_str());
        return nullptr;
    }
    const int bits = api.EVP_PKEY_get_bits(key);
    if (api.EVP_PKEY_is_a(key, "RSA") != 1 || bits < kMinKeyBits || bits > kMaxKeyBits) {
        VELA_LOG_ERR("%s is not an RSA key of %d to %d bits", path.c_str(), kMinKeyBits, kMaxKeyBits);
        api.EVP_PKEY_free(key);
        return nullptr;
    }
    return key;
}

KeyFile ReadPrivateKey(const CryptoApi& api, int dirFd, const std::string& dir, EVP_PKEY*& out)
{
    out = nullptr;
    const std::string path = dir + "/" + kPrivateName;
    ScopedFd fd(openat(dirFd, kPrivateName, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (fd.Get() < 0) {
        if (errno == ENOENT) {
            return KeyFile::Missing;
        }
        VELA_LOG_ERR("open(%s): %m", path.c_str());
        return KeyFile::Unusable;
    }
    struct stat st;
    if (fstat(fd.Get(), &st) != 0) {
        VELA_LOG_ERR("stat(%s): %m", path.c_str());
        return KeyFile::Unusable;
    }
    if (!S_ISREG(st.st_mode) || st.st_size <= 0 || static_cast<unsigned long long>(st.st_size) > kMaxKeyFile) {
        VELA_LOG_ERR("%s is not a regular file of at most %zu bytes", path.c_str(), kMaxKeyFile);
        return KeyFile::Unusable;
    }
    if (st.st_uid != geteuid() || (st.st_mode & 077) != 0) {
        VELA_LOG_ERR("%s must be owned by uid %u and have mode 0600; refusing it", path.c_str(),
                     static_cast<unsigned>(geteuid()));
        return KeyFile::Unusable;
    }
    SecretBytes pem(static_cast<size_t>(st.st_size));
    if (!ReadKeyText(fd.Get(), path, pem)) {
        return KeyFile::Unusable;
    }
    out = ParsePrivateKey(api, path, pem);
    return out != nullptr ? KeyFile::Loaded : KeyFile::Unusable;
}

EVP_PKEY* GenerateKey(const CryptoApi& api)
{
    PkeyCtxRef ctx(api, api.EVP_PKEY_CTX_new_from_name(nullptr, "RSA", nullptr));
    EVP_PKEY* key = nullptr;
    if (ctx.get() == nullptr || api.EVP_PKEY_keygen_init(ctx.get()) <= 0 ||
        api.EVP_PKEY_CTX_set_rsa_keygen_bits(ctx.get(), kKeyBits) <= 0 ||
        api.EVP_PKEY_generate(ctx.get(), &key) <= 0 || key == nullptr) {
        LogCryptoError(api, "RSA key generation failed");
        return nullptr;
    }
    return key;
}

// Writes `len` bytes as `name` in the directory: a temporary file of `mode`
// written, flushed to disk and renamed over `name`. Nothing is left behind
// on failure.
bool PublishFile(int dirFd, const std::string& dir, const char* temp, const char* name, const char* data,
                 size_t len, mode_t mode)
{
    if (unlinkat(dirFd, temp, 0) != 0 && errno != ENOENT) {
        VELA_LOG_ERR("unlink(%s/%s): %m", dir.c_str(), temp);
        return false;
    }
    ScopedFd fd(openat(dirFd, temp, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
    if (fd.Get() < 0) {
        VELA_LOG_ERR("open(%s/%s): %m", dir.c_str(), temp);
        return false;
    }
    const char* step = nullptr;
    bool ok = FillTempFile(fd.Get(), data, len, mode, static_cast<uid_t>(-1), static_cast<gid_t>(-1), step);
    if (ok && renameat(dirFd, temp, dirFd, name) != 0) {
        ok = false;
    }
    if (!ok) {
        VELA_LOG_ERR("writing %s/%s: %m", dir.c_str(), name);
        unlinkat(dirFd, temp, 0);
    }
    return ok;
}

bool LockBounded(int fd, const std::string& what)
{
    struct timespec start;
    clock_gettime(CLOCK_MONOTONIC, &start);
    for (;;) {
        if (flock(fd, LOCK_EX | LOCK_NB) == 0) {
            return true;
        }
        if (errno == EINTR) {
            continue;
        }
        if (errno != EWOULDBLOCK) {
            VELA_LOG_ERR("flock(%s): %m", what.c_str());
            return false;
        }
        if (ElapsedMs(start) >= kLockWaitMs) {
            VELA_LOG_ERR("%s: still locked after %ld s, giving up", what.c_str(), kLockWaitMs / 1000);
            return false;
        }
        struct timespec pause = {0, kLockPollMs * 1000000L};
        nanosleep(&pause, nullptr);
    }
}

// Opens the creation lock of the key directory and takes it (bounded
// wait). The descriptor, or -1; closing it releases the lock.
int TakeLock(int dirFd, const std::string& dir)
{
    const std::string lockPath = dir + "/" + kLockName;
    ScopedFd lock(openat(dirFd, kLockName, O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600));
    if (lock.Get() < 0) {
        VELA_LOG_ERR("open(%s): %m", lockPath.c_str());
        return -1;
    }
    struct stat st;
    if (fstat(lock.Get(), &st) != 0 || !S_ISREG(st.st_mode)) {
        VELA_LOG_ERR("%s is not a regular file", lockPath.c_str());
        return -1;
    }
    if ((st.st_mode & 07777) != 0600 && fchmod(lock.Get(), 0600) != 0) {  // whatever the umask was
        VELA_LOG_ERR("chmod(%s): %m", lockPath.c_str());
        return -1;
    }
    if (!LockBounded(lock.Get(), lockPath)) {
        return -1;
    }
    return lock.Release();
}

// Creates the pair, or loads the one that another process created while
// this one waited for the lock.
EVP_PKEY* CreateUnderLock(const CryptoApi& api, int dirFd, const std::string& dir)
{
    ScopedFd lock(TakeLock(dirFd, dir));
    if (lock.Get() < 0) {
        return nullptr;
    }
    EVP_PKEY* loaded = nullptr;
    switch (ReadPrivateKey(api, dirFd, dir, loaded)) {
    case KeyFile::Loaded:
        return loaded;
    case KeyFile::Unusable:
        return nullptr;
    case KeyFile::Missing:
        break;
    }

    PkeyRef key(api, GenerateKey(api));
    if (key.get() == nullptr) {
        return nullptr;
    }
    std::string pub;
    if (!PublicKeyPEM(api, key.get(), pub)) {
        return nullptr;
    }
    MemBio priv(api);
    size_t privLen = 0;
    const char* privData = nullptr;
    if (priv.get() == nullptr ||
        api.PEM_write_bio_PrivateKey(priv.get(), key.get(), nullptr, nullptr, 0, nullptr, nullptr) != 1 ||
        (privData = priv.Data(privLen)) == nullptr) {
        LogCryptoError(api, "cannot encode the new private key");
        return nullptr;
    }
    // The public key first: the private key is what marks a complete pair.
    if (!PublishFile(dirFd, dir, kPublicTemp, kPublicName, pub.data(), pub.size(), 0644) ||
        !PublishFile(dirFd, dir, kPrivateTemp, kPrivateName, privData, privLen, 0600)) {
        return nullptr;
    }
    if (fsync(dirFd) != 0) {
        VELA_LOG_ERR("fsync(%s): %m", dir.c_str());
        return nullptr;
    }
    VELA_LOG(LOG_NOTICE, "created the %d-bit key pair for encrypted parameters in %s", kKeyBits, dir.c_str());
    if (api.EVP_PKEY_up_ref(key.get()) != 1) {
        return nullptr;
    }
    return key.get();
}

EVP_PKEY* LoadOrCreate(const CryptoApi& api, const std::string& dir, bool create)
{
    const int rawFd = OpenKeyDir(dir, create);
    if (rawFd < 0) {
        if (errno == ENOENT && !create) {
            VELA_LOG_ERR("no key pair for encrypted parameters in %s yet", dir.c_str());
        }
        return nullptr;
    }
    ScopedFd dirFd(rawFd);
    EVP_PKEY* key = nullptr;
    switch (ReadPrivateKey(api, dirFd.Get(), dir, key)) {
    case KeyFile::Loaded:
        return key;
    case KeyFile::Unusable:
        return nullptr;
    case KeyFile::Missing:
        break;
    }
    if (!create) {
        VELA_LOG_ERR("no key pair for encrypted parameters in %s yet", dir.c_str());
        return nullptr;
    }
    return CreateUnderLock(api, dirFd.Get(), dir);
}

}  // namespace

EVP_PKEY* AcquireServerKey(const CryptoApi& api, bool create)
{
    std::lock_guard<std::mutex> guard(g_cacheLock);
    std::string dir = System::Path(kKeyDir);
    if (g_cacheKey == nullptr || g_cacheDir != dir || g_cacheApi != &api) {
        EVP_PKEY* key = LoadOrCreate(api, dir, create);
        if (key == nullptr) {
            return nullptr;
        }
        if (g_cacheKey != nullptr) {
            g_cacheApi->EVP_PKEY_free(g_cacheKey);
        }
        g_cacheKey = key;
        g_cacheApi = &api;
        g_cacheDir.swap(dir);  // cannot throw, unlike a copy
    }
    if (api.EVP_PKEY_up_ref(g_cacheKey) != 1) {
        return nullptr;
    }
    return g_cacheKey;
}

void RefreshPublicKeyFile(const std::string& pem)
{
    const std::string dir = System::Path(kKeyDir);
    std::string onDisk;
    int err = 0;
    if (ReadFileBounded(dir + "/" + kPublicName, kMaxKeyFile, onDisk, err) && onDisk == pem) {
        return;
    }
    const int rawFd = OpenKeyDir(dir, true);
    if (rawFd < 0) {
        return;
    }
    ScopedFd dirFd(rawFd);
    ScopedFd lock(TakeLock(dirFd.Get(), dir));
    if (lock.Get() < 0) {
        return;
    }
    if (PublishFile(dirFd.Get(), dir, kPublicTemp, kPublicName, pem.data(), pem.size(), 0644)) {
        VELA_LOG(LOG_NOTICE, "rewrote %s/%s from the private key", dir.c_str(), kPublicName);
    }
}

bool PublicKeyPEM(const CryptoApi& api, EVP_PKEY* key, std::string& pem)
{
    MemBio bio(api);
    size_t len = 0;
    const char* data = nullptr;
    if (bio.get() == nullptr || api.PEM_write_bio_PUBKEY(bio.get(), key) != 1 || (data = bio.Data(len)) == nullptr) {
        LogCryptoError(api, "cannot encode the public key");
        return false;
    }
    pem.assign(data, len);
    return true;
}

}  // namespace Session
}  // namespace VELA
