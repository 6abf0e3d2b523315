#include "session/LazyCrypto.h"

#include <cstring>

#include "system/LazyLibrary.h"
#include "vela/log.h"

namespace VELA {
namespace Session {

namespace {

// Resolves every function into `api`. On failure names the missing symbol.
bool Resolve(void* handle, CryptoApi& api, const char*& missing)
{
    VELA_CRYPTO_FUNCTIONS(VELA_LAZY_RESOLVE)
    return true;
}

System::LazyLibrary<CryptoApi> g_crypto("libcrypto.so.3", "encrypted parameters", Resolve);

}  // namespace

const CryptoApi* LazyCrypto() { return g_crypto.Get(); }

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
