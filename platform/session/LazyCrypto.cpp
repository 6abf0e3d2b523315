#include "session/LazyCrypto.h"

#include <cstring>
#include <dlfcn.h>
#include <mutex>

#include "vela/log.h"

namespace VELA {
namespace Session {

namespace {

const char kLibrary[] = "libcrypto.so.3";

CryptoApi g_api;
bool g_loaded = false;
std::once_flag g_once;

// Resolves every function into `api`. On failure names the missing symbol.
bool Resolve(void* handle, CryptoApi& api, const char*& missing)
{
#define VELA_CRYPTO_RESOLVE(name)                                        \
    {                                                                    \
        void* sym = dlsym(handle, #name);                                \
        if (sym == nullptr) {                                            \
            missing = #name;                                             \
            return false;                                                \
        }                                                                \
        api.name = reinterpret_cast<decltype(api.name)>(sym);            \
    }
    VELA_CRYPTO_FUNCTIONS(VELA_CRYPTO_RESOLVE)
#undef VELA_CRYPTO_RESOLVE
    return true;
}

void Load()
{
    dlerror();
    // RTLD_LOCAL: the symbols stay out of the global namespace, so nothing
    // else in the process binds to this copy by accident.
    void* handle = dlopen(kLibrary, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) {
        const char* why = dlerror();
        VELA_LOG_ERR("encrypted parameters unavailable: cannot load %s: %s", kLibrary,
                     why != nullptr ? why : "unknown error");
        return;
    }
    CryptoApi api;
    const char* missing = "";
    if (!Resolve(handle, api, missing)) {
        VELA_LOG_ERR("encrypted parameters unavailable: %s lacks %s", kLibrary, missing);
        // The handle is kept: unloading a library that ran its initialisers
        // gains nothing in a process that lives for one request.
        return;
    }
    g_api = api;
    g_loaded = true;
}

}  // namespace

const CryptoApi* LazyCrypto()
{
    std::call_once(g_once, Load);
    return g_loaded ? &g_api : nullptr;
}

void LogCryptoError(const CryptoApi& api, const char* what)
{
    unsigned long code = api.ERR_get_error();
    if (code == 0) {
        VELA_LOG_ERR("%s", what);
    } else {
        char reason[256];
        api.ERR_error_string_n(code, reason, sizeof(reason));
        reason[sizeof(reason) - 1] = '\0';
        VELA_LOG_ERR("%s: %s", what, reason);
    }
    api.ERR_clear_error();
}

void SecretBytes::Wipe()
{
    if (!bytes_.empty()) {
        explicit_bzero(bytes_.data(), bytes_.size());
    }
}

MemBio::~MemBio()
{
    if (bio_ == nullptr) {
        return;
    }
    if (writable_) {
        size_t len = 0;
        char* data = const_cast<char*>(Data(len));
        if (data != nullptr && len > 0) {
            api_.OPENSSL_cleanse(data, len);
        }
    }
    api_.BIO_free(bio_);
}

const char* MemBio::Data(size_t& len) const
{
    len = 0;
    if (bio_ == nullptr) {
        return nullptr;
    }
    char* data = nullptr;
    long n = api_.BIO_ctrl(bio_, BIO_CTRL_INFO, 0, &data);
    if (n <= 0 || data == nullptr) {
        return nullptr;
    }
    len = static_cast<size_t>(n);
    return data;
}

}  // namespace Session
}  // namespace VELA
