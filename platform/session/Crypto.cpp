// Encrypted parameters.
//
// Formats (all base64 is the standard alphabet with "=" padding, RFC 4648
// section 4, canonical, no blanks or line breaks; a client puts it into a
// URL or form body percent-encoded):
//  - The public key: SubjectPublicKeyInfo PEM of the server's RSA key
//    (ServerKey.h), what WebCrypto imports as "spki" once the PEM armour is
//    removed and the base64 decoded.
//  - "__cIpHeRtExT": base64 of RSA-OAEP ciphertext under that key, SHA-256
//    as the OAEP digest and for MGF1, no label (WebCrypto "RSA-OAEP" with
//    hash "SHA-256"). The plaintext is the query string itself, at most
//    key bytes - 66 (318 with the 3072-bit key).
//  - "__nEkOtReHpIc": the same RSA-OAEP encryption of the client's AES key:
//    1 to 32 printable ASCII characters (0x20 to 0x7e); clients send 32,
//    and only a 32-character key decrypts anything.
//  - "__tXeTrEhPiC": base64 of IV (12 bytes) | ciphertext | tag (16 bytes),
//    AES-256-GCM with the 32 bytes of the key text as the key and no
//    additional data (WebCrypto "AES-GCM" with a 12-byte iv and the default
//    128-bit tag, which it appends to the ciphertext), at most 1 MiB of
//    base64.
// A plaintext holding a NUL byte is refused: it is a query string.
//
// Nothing here loads libcrypto until a call gets past the checks that need
// no cryptography (sizes, base64), so hostile junk costs nothing and a
// process that decrypts nothing never maps the library (LazyCrypto.h).
// Decryption only loads the key pair; VelaCgiPublicKeyPEM is what creates
// it (ServerKey.h).
#include <cstring>
#include <memory>
#include <string>

#include "session/CryptoBase64.h"
#include "session/LazyCrypto.h"
#include "session/ServerKey.h"
#include "vela/cgi.h"
#include "vela/log.h"

using VELA::Session::CryptoApi;
using VELA::Session::LogCryptoError;
using VELA::Session::PkeyCtxRef;
using VELA::Session::PkeyRef;
using VELA::Session::SecretBytes;

namespace {

// RSA ciphertext is as long as the key: 256 bytes for the weakest key
// accepted (2048 bits), 2048 for the largest (16384 bits, 2732 characters
// of base64).
constexpr long kMinRsaBytes = 256;
constexpr long kMaxRsaBytes = 2048;
constexpr size_t kMaxRsaBase64 = 4096;
constexpr size_t kMaxAesBase64 = 1024 * 1024;
constexpr size_t kAesKeyLen = 32;
constexpr size_t kGcmIvLen = 12;
constexpr size_t kGcmTagLen = 16;
constexpr size_t kMaxTokenKey = 32;
constexpr size_t kTokenKeyBuffer = kMaxTokenKey + 1;

class CipherCtx {
public:
    explicit CipherCtx(const CryptoApi& api) : api_(api), ctx_(api.EVP_CIPHER_CTX_new()) {}
    ~CipherCtx()
    {
        if (ctx_ != nullptr) {
            api_.EVP_CIPHER_CTX_free(ctx_);  // wipes the key schedule
        }
    }
    CipherCtx(const CipherCtx&) = delete;
    CipherCtx& operator=(const CipherCtx&) = delete;
    EVP_CIPHER_CTX* get() const { return ctx_; }

private:
    const CryptoApi& api_;
    EVP_CIPHER_CTX* ctx_;
};

// RSA-OAEP (SHA-256, MGF1 with SHA-256) decryption of `in` with `key` into
// `out`, which holds at least the key's size in bytes.
bool RsaOaepDecrypt(const CryptoApi& api, EVP_PKEY* key, const SecretBytes& in, SecretBytes& out, size_t& outLen)
{
    PkeyCtxRef ctx(api, api.EVP_PKEY_CTX_new_from_pkey(nullptr, key, nullptr));
    if (ctx.get() == nullptr || api.EVP_PKEY_decrypt_init(ctx.get()) <= 0 ||
        api.EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_OAEP_PADDING) <= 0 ||
        api.EVP_PKEY_CTX_set_rsa_oaep_md(ctx.get(), api.EVP_sha256()) <= 0 ||
        api.EVP_PKEY_CTX_set_rsa_mgf1_md(ctx.get(), api.EVP_sha256()) <= 0) {
        LogCryptoError(api, "cannot set up RSA-OAEP decryption");
        return false;
    }
    size_t len = out.size();
    if (api.EVP_PKEY_decrypt(ctx.get(), out.data(), &len, in.data(), in.size()) <= 0 || len > out.size()) {
        out.Wipe();
        LogCryptoError(api, "RSA-OAEP decryption failed");
        return false;
    }
    outLen = len;
    return true;
}

// Decrypts `text`, base64 of RSA-OAEP ciphertext under the server key. On
// success `plain` holds the plaintext in its first `plainLen` bytes.
bool OpenRsaText(const std::string& text, const char* what, std::unique_ptr<SecretBytes>& plain, size_t& plainLen)
{
    const long cipherLen = VELA::Session::DecodedBase64Size(text, kMaxRsaBase64);
    if (cipherLen < kMinRsaBytes || cipherLen > kMaxRsaBytes) {
        VELA_LOG_ERR("%s: not base64 of an RSA ciphertext of %ld to %ld bytes", what, kMinRsaBytes, kMaxRsaBytes);
        return false;
    }
    const CryptoApi* api = VELA::Session::LazyCrypto();
    if (api == nullptr) {
        return false;
    }
    PkeyRef key(*api, VELA::Session::AcquireServerKey(*api, false));
    if (key.get() == nullptr) {
        return false;
    }
    const int keySize = api->EVP_PKEY_get_size(key.get());
    if (keySize <= 0 || cipherLen != keySize) {
        VELA_LOG_ERR("%s: %ld bytes of ciphertext for a %d-byte key", what, cipherLen, keySize);
        return false;
    }
    SecretBytes cipher(static_cast<size_t>(cipherLen));
    if (!VELA::Session::DecodeBase64Strict(text, cipher)) {
        return false;
    }
    std::unique_ptr<SecretBytes> out(new SecretBytes(static_cast<size_t>(keySize)));
    size_t len = 0;
    if (!RsaOaepDecrypt(*api, key.get(), cipher, *out, len)) {
        return false;
    }
    plain = std::move(out);
    plainLen = len;
    return true;
}

bool HasNul(const unsigned char* data, size_t len)
{
    return len > 0 && memchr(data, 0, len) != nullptr;
}

bool IsTokenKey(const unsigned char* data, size_t len)
{
    if (len == 0 || len > kMaxTokenKey) {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        if (data[i] < 0x20 || data[i] > 0x7e) {
            return false;
        }
    }
    return true;
}

int DecryptParam(std::string& text)
{
    std::unique_ptr<SecretBytes> plain;
    size_t len = 0;
    if (!OpenRsaText(text, "__cIpHeRtExT", plain, len)) {
        return -1;
    }
    if (HasNul(plain->data(), len)) {
        VELA_LOG_ERR("__cIpHeRtExT: the plaintext holds a NUL byte");
        return -1;
    }
    // The base64 text is longer than any plaintext of its key, so this
    // reuses the string's buffer.
    text.assign(reinterpret_cast<const char*>(plain->data()), len);
    return 0;
}

int GenerateToken(const char* token, char* key, size_t size)
{
    if (key == nullptr || size == 0) {
        VELA_LOG_ERR("__nEkOtReHpIc: no key buffer");
        return -1;
    }
    explicit_bzero(key, size < kTokenKeyBuffer ? size : kTokenKeyBuffer);
    if (size < kTokenKeyBuffer) {
        VELA_LOG_ERR("__nEkOtReHpIc: key buffer of %zu bytes, %zu needed", size, kTokenKeyBuffer);
        return -1;
    }
    if (token == nullptr) {
        VELA_LOG_ERR("__nEkOtReHpIc: no token");
        return -1;
    }
    const size_t tokenLen = strnlen(token, kMaxRsaBase64 + 1);
    if (tokenLen > kMaxRsaBase64) {
        VELA_LOG_ERR("__nEkOtReHpIc: longer than %zu characters", kMaxRsaBase64);
        return -1;
    }
    std::unique_ptr<SecretBytes> plain;
    size_t len = 0;
    if (!OpenRsaText(std::string(token, tokenLen), "__nEkOtReHpIc", plain, len)) {
        return -1;
    }
    if (!IsTokenKey(plain->data(), len)) {
        VELA_LOG_ERR("__nEkOtReHpIc: the key is not 1 to %zu printable characters", kMaxTokenKey);
        return -1;
    }
    memcpy(key, plain->data(), len);
    key[len] = '\0';
    return 0;
}

// AES-256-GCM decryption of the `bodyLen` bytes at `body` under the 32
// bytes of `key`, with the kGcmIvLen bytes at `iv` and the tag `tag`, into
// `out` (bodyLen + 1 bytes). False (logged) when libcrypto fails or the tag
// does not authenticate key, IV and body: nothing of the plaintext is kept
// then.
bool OpenGcm(const CryptoApi& api, const std::string& key, const unsigned char* iv, const unsigned char* body,
             size_t bodyLen, unsigned char* tag, SecretBytes& out)
{
    SecretBytes aesKey(kAesKeyLen);
    memcpy(aesKey.data(), key.data(), kAesKeyLen);
    CipherCtx ctx(api);
    int outLen = 0;
    int finalLen = 0;
    if (ctx.get() == nullptr ||
        api.EVP_DecryptInit_ex(ctx.get(), api.EVP_aes_256_gcm(), nullptr, nullptr, nullptr) != 1 ||
        api.EVP_CIPHER_CTX_ctrl(ctx.get(), EVP_CTRL_GCM_SET_IVLEN, static_cast<int>(kGcmIvLen), nullptr) != 1 ||
        api.EVP_DecryptInit_ex(ctx.get(), nullptr, nullptr, aesKey.data(), iv) != 1 ||
        api.EVP_CIPHER_CTX_ctrl(ctx.get(), EVP_CTRL_GCM_SET_TAG, static_cast<int>(kGcmTagLen), tag) != 1) {
        LogCryptoError(api, "cannot set up AES-GCM decryption");
        return false;
    }
    aesKey.Wipe();
    // bodyLen is below 1 MiB (the base64 bound), so it fits an int.
    if (bodyLen > 0 &&
        (api.EVP_DecryptUpdate(ctx.get(), out.data(), &outLen, body, static_cast<int>(bodyLen)) != 1 ||
         outLen < 0 || static_cast<size_t>(outLen) > bodyLen)) {
        out.Wipe();
        LogCryptoError(api, "AES-GCM decryption failed");
        return false;
    }
    if (api.EVP_DecryptFinal_ex(ctx.get(), out.data() + outLen, &finalLen) != 1 || finalLen != 0 ||
        static_cast<size_t>(outLen) != bodyLen) {
        // A wrong key, IV, body or tag.
        out.Wipe();
        LogCryptoError(api, "__tXeTrEhPiC: authentication failed");
        return false;
    }
    return true;
}

bool DecryptAES(const std::string& key, const std::string& cipher, std::string& plain)
{
    if (key.size() != kAesKeyLen) {
        VELA_LOG_ERR("__tXeTrEhPiC: the key has %zu characters, not %zu", key.size(), kAesKeyLen);
        return false;
    }
    const long rawLen = VELA::Session::DecodedBase64Size(cipher, kMaxAesBase64);
    if (rawLen < 0) {
        VELA_LOG_ERR("__tXeTrEhPiC: not base64 of at most %zu characters", kMaxAesBase64);
        return false;
    }
    if (static_cast<size_t>(rawLen) < kGcmIvLen + kGcmTagLen) {
        VELA_LOG_ERR("__tXeTrEhPiC: %ld bytes, shorter than the IV and the tag", rawLen);
        return false;
    }
    const CryptoApi* api = VELA::Session::LazyCrypto();
    if (api == nullptr) {
        return false;
    }
    SecretBytes raw(static_cast<size_t>(rawLen));
    if (!VELA::Session::DecodeBase64Strict(cipher, raw)) {
        return false;
    }
    const size_t bodyLen = raw.size() - kGcmIvLen - kGcmTagLen;
    const unsigned char* iv = raw.data();
    const unsigned char* body = iv + kGcmIvLen;
    unsigned char tag[kGcmTagLen];
    memcpy(tag, body + bodyLen, kGcmTagLen);

    // One spare byte: the buffer is never empty, so its pointer is valid
    // even for an empty plaintext.
    SecretBytes out(bodyLen + 1);
    if (!OpenGcm(*api, key, iv, body, bodyLen, tag, out)) {
        return false;
    }
    if (HasNul(out.data(), bodyLen)) {
        out.Wipe();
        VELA_LOG_ERR("__tXeTrEhPiC: the plaintext holds a NUL byte");
        return false;
    }
    plain.assign(reinterpret_cast<const char*>(out.data()), bodyLen);
    return true;
}

int PublicKeyPEM(std::string& pem)
{
    const CryptoApi* api = VELA::Session::LazyCrypto();
    if (api == nullptr) {
        return -1;
    }
    PkeyRef key(*api, VELA::Session::AcquireServerKey(*api, true));
    if (key.get() == nullptr) {
        return -1;
    }
    std::string out;
    if (!VELA::Session::PublicKeyPEM(*api, key.get(), out)) {
        return -1;
    }
    VELA::Session::RefreshPublicKeyFile(out);
    pem.swap(out);
    return 0;
}

}  // namespace

int VelaCgiDecryptParam(std::string& text)
{
    try {
        return DecryptParam(text);
    } catch (...) {
        VELA_LOG_ERR("__cIpHeRtExT: out of memory");
        return -1;
    }
}

int VELACloudServiceHubtokenGenerateToken(const char* token, char* key, size_t size)
{
    try {
        return GenerateToken(token, key, size);
    } catch (...) {
        if (key != nullptr && size > 0) {
            key[0] = '\0';
        }
        VELA_LOG_ERR("__nEkOtReHpIc: out of memory");
        return -1;
    }
}

int VelaCgiPublicKeyPEM(std::string& pem)
{
    pem.clear();
    try {
        return PublicKeyPEM(pem);
    } catch (...) {
        pem.clear();
        VELA_LOG_ERR("public key: out of memory");
        return -1;
    }
}

namespace VELA {
namespace CredRequestUtil {

bool GetDecryptAESString(const std::string& key, const std::string& cipher, std::string& plain)
{
    try {
        // `plain` is written last: it may be the same string as `cipher`.
        if (DecryptAES(key, cipher, plain)) {
            return true;
        }
        plain.clear();
        return false;
    } catch (...) {
        plain.clear();
        VELA_LOG_ERR("__tXeTrEhPiC: out of memory");
        return false;
    }
}

}  // namespace CredRequestUtil
}  // namespace VELA
