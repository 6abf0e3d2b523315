// Host names, domain names (RFC 1123 section 2.1, RFC 1035 section 2.3.4)
// and textual IP addresses (inet_pton).
#include <arpa/inet.h>
#include <cstring>
#include <netinet/in.h>
#include <sys/socket.h>

#include "vela/vlibc.h"

namespace {

constexpr size_t kMaxLabel = 63;
constexpr size_t kMaxDomain = 253;  // without the optional trailing "."

bool IsLabelChar(char c)
{
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-';
}

// RFC 1123 label: 1 to 63 of [A-Za-z0-9-], no "-" at either end.
bool IsLabel(const char* p, size_t len)
{
    if (len == 0 || len > kMaxLabel || p[0] == '-' || p[len - 1] == '-') {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        if (!IsLabelChar(p[i])) {
            return false;
        }
    }
    return true;
}

}  // namespace

int BlVLIBIsHostname(const char* name)
{
    if (name == nullptr) {
        return 0;
    }
    // strnlen bounds the scan: a longer string is invalid whatever follows.
    const size_t len = strnlen(name, kMaxLabel + 1);
    return IsLabel(name, len) ? 1 : 0;
}

int BlVLIBIsDomain(const char* name)
{
    if (name == nullptr) {
        return 0;
    }
    size_t len = strnlen(name, kMaxDomain + 2);
    if (len > 0 && name[len - 1] == '.') {
        --len;  // one trailing "." names the root; it does not count
    }
    if (len == 0 || len > kMaxDomain) {
        return 0;
    }
    size_t start = 0;
    for (size_t i = 0; i <= len; ++i) {
        if (i == len || name[i] == '.') {
            if (!IsLabel(name + start, i - start)) {
                return 0;  // also catches empty labels: "a..b", ".a", "a.."
            }
            start = i + 1;
        }
    }
    return 1;
}

int VELANetGetAddrType(const char* text)
{
    if (text == nullptr) {
        return 0;
    }
    unsigned char addr[sizeof(struct in6_addr)];
    if (inet_pton(AF_INET, text, addr) == 1) {
        return AF_INET;
    }
    if (inet_pton(AF_INET6, text, addr) == 1) {
        return AF_INET6;
    }
    return 0;
}
