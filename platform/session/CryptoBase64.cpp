#include "session/CryptoBase64.h"

#include "session/LazyCrypto.h"

namespace VELA {
namespace Session {

namespace {

// The value of a base64 character, or -1.
int Sextet(unsigned char c)
{
    if (c >= 'A' && c <= 'Z') {
        return c - 'A';
    }
    if (c >= 'a' && c <= 'z') {
        return c - 'a' + 26;
    }
    if (c >= '0' && c <= '9') {
        return c - '0' + 52;
    }
    if (c == '+') {
        return 62;
    }
    if (c == '/') {
        return 63;
    }
    return -1;
}

}  // namespace

long DecodedBase64Size(const std::string& text, size_t maxText)
{
    const size_t len = text.size();
    if (len > maxText || len % 4 != 0) {
        return -1;
    }
    if (len == 0) {
        return 0;
    }
    size_t pad = 0;
    if (text[len - 1] == '=') {
        pad = text[len - 2] == '=' ? 2 : 1;
    }
    for (size_t i = 0; i < len - pad; ++i) {
        if (Sextet(static_cast<unsigned char>(text[i])) < 0) {
            return -1;
        }
    }
    // The bits below the last full byte must be zero, so every byte string
    // has exactly one encoding.
    const int last = Sextet(static_cast<unsigned char>(text[len - pad - 1]));
    if ((pad == 1 && (last & 0x03) != 0) || (pad == 2 && (last & 0x0f) != 0)) {
        return -1;
    }
    return static_cast<long>(len / 4 * 3 - pad);
}

bool DecodeBase64Strict(const std::string& text, SecretBytes& out)
{
    const long size = DecodedBase64Size(text, text.size());
    if (size < 0 || static_cast<size_t>(size) != out.size()) {
        return false;
    }
    unsigned char* dst = out.data();
    size_t used = 0;
    unsigned int acc = 0;
    int bits = 0;
    for (unsigned char c : text) {
        const int v = Sextet(c);
        if (v < 0) {
            break;  // the padding: already checked to be at the end
        }
        acc = (acc << 6) | static_cast<unsigned int>(v);
        bits += 6;
        if (bits >= 8) {
            bits -= 8;
            if (used == out.size()) {
                return false;
            }
            dst[used++] = static_cast<unsigned char>(acc >> bits);
            acc &= (1u << bits) - 1;
        }
    }
    return used == out.size();
}

}  // namespace Session
}  // namespace VELA
