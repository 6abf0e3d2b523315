#include "sharing/LinkPassword.h"

#include <cerrno>
#include <cstring>
#include <sys/random.h>

#include "session/LazyCrypto.h"
#include "session/SessionStore.h"
#include "vela/log.h"
#include "vela/vlibc.h"

namespace VELA {
namespace sharing {

namespace {

using Session::CryptoApi;
using Session::SecretBytes;

const char kScheme[] = "pbkdf2-sha256";
constexpr size_t kSaltBytes = 16;
constexpr size_t kKeyBytes = 32;
// Stored hashes with other counts still verify, within these bounds.
constexpr long long kMinIterations = 1000;
constexpr long long kMaxIterations = 10000000;

std::string Hex(const unsigned char* bytes, size_t len)
{
    static const char kDigits[] = "0123456789abcdef";
    std::string out;
    out.reserve(len * 2);
    for (size_t i = 0; i < len; ++i) {
        out.push_back(kDigits[bytes[i] >> 4]);
        out.push_back(kDigits[bytes[i] & 15]);
    }
    return out;
}

bool Unhex(const std::string& text, unsigned char* out, size_t len)
{
    if (text.size() != len * 2) {
        return false;
    }
    for (size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        int v;
        if (c >= '0' && c <= '9') {
            v = c - '0';
        } else if (c >= 'a' && c <= 'f') {
            v = c - 'a' + 10;
        } else {
            return false;
        }
        if (i % 2 == 0) {
            out[i / 2] = static_cast<unsigned char>(v << 4);
        } else {
            out[i / 2] |= static_cast<unsigned char>(v);
        }
    }
    return true;
}

bool Derive(const CryptoApi& api, const std::string& password, const unsigned char* salt, int iterations,
            SecretBytes& key)
{
    if (api.PKCS5_PBKDF2_HMAC(password.data(), static_cast<int>(password.size()), salt, kSaltBytes, iterations,
                              api.EVP_sha256(), static_cast<int>(key.size()), key.data()) != 1) {
        Session::LogCryptoError(api, "sharing link password: PBKDF2 failed");
        return false;
    }
    return true;
}

}  // namespace

bool HashLinkPassword(const std::string& password, std::string& stored)
{
    const CryptoApi* api = Session::LazyCrypto();
    if (api == nullptr) {
        return false;
    }
    unsigned char salt[kSaltBytes];
    if (getrandom(salt, sizeof(salt), 0) != static_cast<ssize_t>(sizeof(salt))) {
        VELA_LOG_ERR("getrandom: %m");
        return false;
    }
    SecretBytes key(kKeyBytes);
    if (!Derive(*api, password, salt, kPasswordIterations, key)) {
        return false;
    }
    stored = std::string(kScheme) + "$" + std::to_string(kPasswordIterations) + "$" + Hex(salt, sizeof(salt)) + "$" +
             Hex(key.data(), key.size());
    return true;
}

int VerifyLinkPassword(const std::string& password, const std::string& stored)
{
    // scheme$iterations$salt$key
    const size_t a = stored.find('$');
    const size_t b = a == std::string::npos ? a : stored.find('$', a + 1);
    const size_t c = b == std::string::npos ? b : stored.find('$', b + 1);
    long long iterations = 0;
    unsigned char salt[kSaltBytes];
    unsigned char want[kKeyBytes];
    if (c == std::string::npos || stored.compare(0, a, kScheme) != 0 ||
        !System::ParseDecimal(stored.data() + a + 1, b - a - 1, kMinIterations, kMaxIterations, iterations) ||
        !Unhex(stored.substr(b + 1, c - b - 1), salt, sizeof(salt)) ||
        !Unhex(stored.substr(c + 1), want, sizeof(want))) {
        VELA_LOG_ERR("sharing link password: the stored hash is malformed");
        return -1;
    }
    const CryptoApi* api = Session::LazyCrypto();
    if (api == nullptr) {
        return -1;
    }
    SecretBytes key(kKeyBytes);
    if (!Derive(*api, password, salt, static_cast<int>(iterations), key)) {
        return -1;
    }
    // Every byte is compared whatever the earlier ones were.
    unsigned char diff = 0;
    for (size_t i = 0; i < sizeof(want); ++i) {
        diff |= static_cast<unsigned char>(key.data()[i] ^ want[i]);
    }
    const bool same = diff == 0;
    explicit_bzero(want, sizeof(want));
    return same ? 1 : 0;
}

}  // namespace sharing
}  // namespace VELA
