// System library of the platform: strings, the string table, name checks,
// address types, preference directories and the system root.
#pragma once

#include <stddef.h>
#include <string>

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// ---- System root -----------------------------------------------------------

namespace VELA {
namespace System {
// The directory under which every absolute path of the system is resolved:
// "/" by default, or the value of VELA_ROOT read with secure_getenv (so a
// set-user-id process ignores it). Read once per process; never ends in "/"
// except when it is "/" itself.
const std::string& Root();
// `absolute` (which starts with "/") resolved under Root():
// Path("/etc/velainfo.conf") is "/etc/velainfo.conf" with the default root
// and "/tmp/r/etc/velainfo.conf" with VELA_ROOT=/tmp/r.
std::string Path(const std::string& absolute);
// Forgets the cached root so the next call reads VELA_ROOT again (tests).
void RootReset();
}  // namespace System
}  // namespace VELA

// ---- Strings -----------------------------------------------------------------

// Lower-cases the ASCII letters of `sz` in place and returns `sz`; other
// bytes stay as they are. A null argument returns null.
char* VLIBCStrCaseLower(char* sz);

namespace VELA {
namespace System {
// The one parser of decimal numbers that come from outside (parameters,
// CGI variables, configuration keys). The whole of `text` must be digits,
// with a leading "-" only when `min` is negative: no blanks, no "+", no
// fraction or exponent, nothing after the digits. The value must lie in
// [min, max]. True and `out` set, or false and `out` untouched; overflow,
// sign, blanks and junk are refused alike.
bool ParseDecimal(const char* text, size_t len, long long min, long long max, long long& out);
inline bool ParseDecimal(const std::string& text, long long min, long long max, long long& out)
{
    return ParseDecimal(text.data(), text.size(), min, max, out);
}
// The integer of a number a client sent as text in a parameter, read as the
// integer conversion of a JSON number reads it: blanks (space, tab) before
// and after it are skipped, a "+" or "-" may lead, and a fraction ("." and
// at least one digit) is dropped, truncating toward zero ("-0.5" is 0).
// Nothing else: no exponent, no hex, no other byte (NUL included), at
// least one digit before any ".". The digits before the "." go through
// ParseDecimal, so the same range check and overflow refusal apply. Linear;
// true and `out` set, or false and `out` untouched.
inline bool ParseNumberText(const char* text, size_t len, long long min, long long max, long long& out)
{
    if (text == nullptr) {
        return false;
    }
    const auto isBlank = [](char c) { return c == ' ' || c == '\t'; };
    const auto isDigit = [](char c) { return c >= '0' && c <= '9'; };
    size_t begin = 0;
    size_t end = len;
    while (begin < end && isBlank(text[begin])) {
        ++begin;
    }
    while (end > begin && isBlank(text[end - 1])) {
        --end;
    }
    size_t sign = begin;  // where the "-" is, when there is one
    if (begin < end && (text[begin] == '+' || text[begin] == '-')) {
        ++begin;
    }
    size_t digits = begin;
    bool zero = true;
    while (digits < end && isDigit(text[digits])) {
        zero = zero && text[digits] == '0';
        ++digits;
    }
    if (digits == begin) {
        return false;
    }
    size_t i = digits;
    if (i < end && text[i] == '.') {
        const size_t fraction = ++i;
        while (i < end && isDigit(text[i])) {
            ++i;
        }
        if (i == fraction) {
            return false;
        }
    }
    if (i != end) {
        return false;
    }
    // A "-" before a zero integer part is no sign at all: "-0.5" is 0.
    const bool negative = sign < begin && text[sign] == '-' && !zero;
    const size_t from = negative ? sign : begin;
    return ParseDecimal(text + from, digits - from, min, max, out);
}
// CONTENT_LENGTH as every reader of the request body sees it: no variable
// (null) or empty text is 0, no body (RFC 3875 section 4.1.2); otherwise the
// whole text must be a ParseDecimal number in [0, max]. -1 for anything
// else (junk, a sign, blanks, overflow, more than `max`).
long long ContentLength(const char* text, size_t len, long long max);

// The one check of a name that comes from outside before it names a file,
// a record or a table entry: 1 to `maxLen` bytes, each an ASCII letter, a
// digit or one of the bytes of `punctuation` (which never admits NUL).
bool IsCheckedName(const char* name, size_t len, const char* punctuation, size_t maxLen);
inline bool IsCheckedName(const std::string& name, const char* punctuation, size_t maxLen)
{
    return IsCheckedName(name.data(), name.size(), punctuation, maxLen);
}
// The punctuation of the usual profiles: API, method and configuration key
// names ("._-"), random ids of sessions and tokens (base64url, "-_").
constexpr const char kNameDotted[] = "._-";
constexpr const char kNameId[] = "-_";
constexpr size_t kMaxAPIName = 128;
// An API name from which file names may be built: 1 to kMaxAPIName bytes of
// kNameDotted characters, not starting with "." and without "..". No "/"
// and no NUL can therefore reach a path.
bool IsAPIName(const std::string& api);
}  // namespace System
}  // namespace VELA

// ---- String table ------------------------------------------------------------
// A table of string keys to string values that keeps insertion order. Keys
// are unique: setting an existing key replaces its value in place.

typedef struct _tag_VLIBCSZHASH_ VLIBCSZHASH, *PVLIBCSZHASH;

// A new empty table sized for about `size` entries (any size >= 0 works);
// null when memory runs out.
PVLIBCSZHASH VLIBCSzHashAlloc(int size);
// Frees the table; null is ignored.
void VLIBCSzHashFree(PVLIBCSZHASH hash);
// Sets `key` to `value`; 0 on success, -1 for a null table, key or value.
int VLIBCSzHashSetValue(PVLIBCSZHASH hash, const char* key, const char* value);
// The value of `key`, or null when absent. Valid until the key is set again
// or the table is freed.
const char* VLIBCSzHashGetValue(PVLIBCSZHASH hash, const char* key);
// Number of entries; 0 for null.
int VLIBCSzHashCount(PVLIBCSZHASH hash);
// Key and value of the entry at `index` (insertion order), null when out of
// range.
const char* VLIBCSzHashKeyAt(PVLIBCSZHASH hash, int index);
const char* VLIBCSzHashValueAt(PVLIBCSZHASH hash, int index);

// ---- Names and addresses -------------------------------------------------------

// Non-zero when `name` is one RFC 1123 host label: 1 to 63 characters of
// letters, digits and "-", neither starting nor ending with "-".
int BlVLIBIsHostname(const char* name);
// Non-zero when `name` is a domain name of RFC 1123 labels joined by ".":
// every label a valid host label, 253 characters at most in all; one
// trailing "." is accepted.
int BlVLIBIsDomain(const char* name);
// inet_pton: 2 (AF_INET) for an IPv4 address, 10 (AF_INET6) for an IPv6
// address, 0 for anything else, null included.
int VELANetGetAddrType(const char* text);

// ---- Preference directories ------------------------------------------------------

// Writes into `buf` (of `size` bytes) the preference directory of the user
// or group, <root>/var/lib/vela/preference/user/<name> or .../group/<name>,
// creating it (mode 0700) when missing. Returns 0 on success, -1 when the name
// is empty, longer than 255 bytes, ".", "..", holds "/" or a control byte,
// the directory cannot be created or the buffer is too small.
int VELAUserPreferenceDirGet(const char* user, char* buf, size_t size);
int VELAGroupPreferenceDirGet(const char* group, char* buf, size_t size);

#pragma GCC visibility pop
