// ASCII string helpers of the platform library.
#include "vela/vlibc.h"

#include <climits>
#include <cstring>

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

bool VELA::System::ParseDecimal(const char* text, size_t len, long long min, long long max, long long& out)
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

long long VELA::System::ContentLength(const char* text, size_t len, long long max)
{
    if (text == nullptr || len == 0) {
        return 0;
    }
    long long value = 0;
    return ParseDecimal(text, len, 0, max, value) ? value : -1;
}

bool VELA::System::IsCheckedName(const char* name, size_t len, const char* punctuation, size_t maxLen)
{
    if (name == nullptr || len == 0 || len > maxLen) {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        const char c = name[i];
        const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                        (c != '\0' && punctuation != nullptr && strchr(punctuation, c) != nullptr);
        if (!ok) {
            return false;
        }
    }
    return true;
}

bool VELA::System::IsAPIName(const std::string& api)
{
    return IsCheckedName(api, kNameDotted, kMaxAPIName) && api[0] != '.' && api.find("..") == std::string::npos;
}
