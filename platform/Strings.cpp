// ASCII string helpers of the platform library.
#include "vela/vlibc.h"

#include <climits>

char* VLIBCStrCaseLower(char* sz)
{
    if (sz == nullptr) {
        return nullptr;
    }
    // ASCII only: bytes >= 0x80 (UTF-8 sequences) and the locale are left
    // alone, so the result never depends on LC_CTYPE.
    for (char* p = sz; *p != '\0'; ++p) {
        if (*p >= 'A' && *p <= 'Z') {
            *p = static_cast<char>(*p - 'A' + 'a');
        }
    }
    return sz;
}

bool VELA::ParseDecimal(const char* text, size_t len, long long min, long long max, long long& out)
{
    if (text == nullptr || len == 0 || min > max) {
        return false;
    }
    size_t i = 0;
    const bool negative = text[0] == '-';
    if (negative) {
        if (min >= 0) {
            return false;
        }
        i = 1;
    }
    if (i == len) {
        return false;
    }
    // The magnitude is gathered as unsigned so that LLONG_MIN fits.
    const unsigned long long limit =
        negative ? static_cast<unsigned long long>(LLONG_MAX) + 1ULL : static_cast<unsigned long long>(LLONG_MAX);
    unsigned long long magnitude = 0;
    for (; i < len; ++i) {
        const char c = text[i];
        if (c < '0' || c > '9') {
            return false;
        }
        const unsigned digit = static_cast<unsigned>(c - '0');
        if (magnitude > (limit - digit) / 10) {
            return false;
        }
        magnitude = magnitude * 10 + digit;
    }
    long long value = 0;
    if (negative) {
        value = magnitude == limit ? LLONG_MIN : -static_cast<long long>(magnitude);
    } else {
        value = static_cast<long long>(magnitude);
    }
    if (value < min || value > max) {
        return false;
    }
    out = value;
    return true;
}
