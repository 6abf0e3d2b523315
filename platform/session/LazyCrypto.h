// libcrypto, loaded on first use (not installed).
//
// The platform library does not link libcrypto: a CGI process that decrypts
// nothing must not pay for loading it. The OpenSSL 3 headers are used only
// for types and prototypes; the first caller of LazyCrypto() opens
// libcrypto.so.3 with dlopen and resolves every function below with dlsym.
// The library stays loaded for the life of the process.
#pragma once

#include <cstddef>
#include <vector>

#include <openssl/bio.h>
#include <openssl/crypto.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>

namespace VELA {
namespace Session {

// Every libcrypto function the platform calls. Only real symbols belong
// here: several OpenSSL names are macros (OPENSSL_free, BIO_get_mem_data,
// EVP_PKEY_size...) and are written in terms of these instead.
#define VELA_CRYPTO_FUNCTIONS(X)          \
    X(OPENSSL_cleanse)                    \
    X(ERR_get_error)                      \
    X(ERR_error_string_n)                 \
    X(ERR_clear_error)                    \
    X(BIO_new)                            \
    X(BIO_s_mem)                          \
    X(BIO_new_mem_buf)                    \
    X(BIO_ctrl)                           \
    X(BIO_free)                           \
    X(EVP_sha256)                         \
    X(EVP_Digest)                         \
    X(EVP_aes_256_gcm)                    \
    X(EVP_PKEY_CTX_new_from_name)         \
    X(EVP_PKEY_CTX_new_from_pkey)         \
    X(EVP_PKEY_CTX_free)                  \
    X(EVP_PKEY_keygen_init)               \
    X(EVP_PKEY_CTX_set_rsa_keygen_bits)   \
    X(EVP_PKEY_generate)                  \
    X(EVP_PKEY_up_ref)                    \
    X(EVP_PKEY_free)                      \
    X(EVP_PKEY_is_a)                      \
    X(EVP_PKEY_get_bits)                  \
    X(EVP_PKEY_get_size)                  \
    X(PEM_write_bio_PrivateKey)           \
    X(PEM_read_bio_PrivateKey)            \
    X(PEM_write_bio_PUBKEY)               \
    X(EVP_PKEY_decrypt_init)              \
    X(EVP_PKEY_CTX_set_rsa_padding)       \
    X(EVP_PKEY_CTX_set_rsa_oaep_md)       \
    X(EVP_PKEY_CTX_set_rsa_mgf1_md)       \
    X(EVP_PKEY_decrypt)                   \
    X(EVP_CIPHER_CTX_new)                 \
    X(EVP_CIPHER_CTX_free)                \
    X(EVP_CIPHER_CTX_ctrl)                \
    X(EVP_DecryptInit_ex)                 \
    X(EVP_DecryptUpdate)                  \
    X(EVP_DecryptFinal_ex)                \
    X(PKCS5_PBKDF2_HMAC)

struct CryptoApi {
#define VELA_CRYPTO_MEMBER(name) decltype(&::name) name = nullptr;
    VELA_CRYPTO_FUNCTIONS(VELA_CRYPTO_MEMBER)
#undef VELA_CRYPTO_MEMBER
};

// The resolved functions, or null when libcrypto.so.3 cannot be opened or
// lacks one of them (logged once per process; every later call fails the
// same way without loading anything again). Thread-safe.
const CryptoApi* LazyCrypto();

// Logs `what` with the reason at the front of libcrypto's error queue, then
// empties the queue so no stale error is reported by a later call.
void LogCryptoError(const CryptoApi& api, const char* what);

// A byte buffer for key material and plaintext: its size is fixed at
// construction (it never reallocates, so no copy is left behind in freed
// memory) and its bytes are wiped with explicit_bzero when it is destroyed
// or wiped. Construction throws std::bad_alloc like any vector.
class SecretBytes {
public:
    explicit SecretBytes(size_t size) : bytes_(size) {}
    ~SecretBytes() { Wipe(); }
    SecretBytes(const SecretBytes&) = delete;
    SecretBytes& operator=(const SecretBytes&) = delete;

    unsigned char* data() { return bytes_.data(); }
    const unsigned char* data() const { return bytes_.data(); }
    size_t size() const { return bytes_.size(); }
    // Wipes every byte; the size stays.
    void Wipe();

private:
    std::vector<unsigned char> bytes_;
};

// Owners of libcrypto objects, freed through the loaded library.
class PkeyRef {
public:
    PkeyRef(const CryptoApi& api, EVP_PKEY* key) : api_(api), key_(key) {}
    ~PkeyRef()
    {
        if (key_ != nullptr) {
            api_.EVP_PKEY_free(key_);
        }
    }
    PkeyRef(const PkeyRef&) = delete;
    PkeyRef& operator=(const PkeyRef&) = delete;
    EVP_PKEY* get() const { return key_; }

private:
    const CryptoApi& api_;
    EVP_PKEY* key_;
};

class PkeyCtxRef {
public:
    PkeyCtxRef(const CryptoApi& api, EVP_PKEY_CTX* ctx) : api_(api), ctx_(ctx) {}
    ~PkeyCtxRef()
    {
        if (ctx_ != nullptr) {
            api_.EVP_PKEY_CTX_free(ctx_);
        }
    }
    PkeyCtxRef(const PkeyCtxRef&) = delete;
    PkeyCtxRef& operator=(const PkeyCtxRef&) = delete;
    EVP_PKEY_CTX* get() const { return ctx_; }

private:
    const CryptoApi& api_;
    EVP_PKEY_CTX* ctx_;
};

// A memory BIO. A writable one (first constructor) has its contents wiped
// before it is freed, since it may hold a private key in PEM form; a
// read-only one reads the caller's buffer, which the caller wipes.
class MemBio {
public:
    explicit MemBio(const CryptoApi& api) : api_(api), bio_(api.BIO_new(api.BIO_s_mem())), writable_(true) {}
    // A read-only BIO over `len` bytes at `data` (not copied).
    MemBio(const CryptoApi& api, const void* data, int len)
        : api_(api), bio_(api.BIO_new_mem_buf(data, len)), writable_(false)
    {
    }
    ~MemBio();
    MemBio(const MemBio&) = delete;
    MemBio& operator=(const MemBio&) = delete;
    BIO* get() const { return bio_; }
    // The bytes written so far (BIO_get_mem_data); null when there are none.
    const char* Data(size_t& len) const;

private:
    const CryptoApi& api_;
    BIO* bio_;
    bool writable_;
};

}  // namespace Session
}  // namespace VELA
