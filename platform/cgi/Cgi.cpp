// CGI library: the handle with the request's cookies (RFC 6265), the client
// address (REMOTE_ADDR, X-Forwarded-For behind a configured trusted proxy)
// and the one decision whether the peer is such a proxy.
#include <arpa/inet.h>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <netinet/in.h>
#include <new>
#include <string>
#include <sys/socket.h>
#include <vector>

#include "cgi/CgiContext.h"
#include "system/FileUtil.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"


namespace {

constexpr size_t kMaxCookieHeader = 64 * 1024;
constexpr int kMaxCookies = 256;
constexpr size_t kMaxForwardedHeader = 64 * 1024;
constexpr size_t kMaxConfFile = 64 * 1024;
const char kConfPath[] = "/etc/vela/webapi.conf";

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

std::string Trim(const std::string& text)
{
    size_t begin = 0;
    size_t end = text.size();
    while (begin < end && IsBlank(text[begin])) {
        ++begin;
    }
    while (end > begin && IsBlank(text[end - 1])) {
        --end;
    }
    return text.substr(begin, end - begin);
}

// RFC 7230 section 3.2.6 tchar, the characters of a cookie name (RFC 6265
// section 4.1.1 cookie-name = token).
bool IsTokenChar(unsigned char c)
{
    if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) {
        return true;
    }
    return c != 0 && strchr("!#$%&'*+-.^_`|~", c) != nullptr;
}

bool IsCookieName(const std::string& name)
{
    if (name.empty()) {
        return false;
    }
    for (char c : name) {
        if (!IsTokenChar(static_cast<unsigned char>(c))) {
            return false;
        }
    }
    return true;
}

// Cookie values are kept as sent (no percent-decoding: RFC 6265 treats them
// as opaque), but control bytes are refused.
bool IsCookieValue(const std::string& value)
{
    for (char ch : value) {
        const unsigned char c = static_cast<unsigned char>(ch);
        if (c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

// Parses a Cookie header (RFC 6265 section 4.2.1: cookie-pair *( ";" SP
// cookie-pair )) into `table`, leniently: blanks around pieces are dropped,
// pieces without "=" or with an invalid name or value are skipped, a value
// may hold "=", one pair of surrounding double quotes is removed. The first
// pair of a name wins (user agents send the most specific cookie first,
// RFC 6265 section 5.4). At most kMaxCookies are kept. False when memory
// runs out.
bool ParseCookieHeader(const char* header, PVLIBCSZHASH table)
{
    const Json::Value pieces = VELA::WebAPIUtil::ParseToArray(header, ";");
    bool warned = false;
    for (Json::ArrayIndex i = 0; i < pieces.size(); ++i) {
        const std::string piece = Trim(pieces[i].asString());
        const size_t eq = piece.find('=');
        if (eq == std::string::npos) {
            continue;
        }
        const std::string name = Trim(piece.substr(0, eq));
        std::string value = Trim(piece.substr(eq + 1));
        if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
            value = value.substr(1, value.size() - 2);
        }
        if (!IsCookieName(name) || !IsCookieValue(value)) {
            continue;
        }
        if (VLIBCSzHashGetValue(table, name.c_str()) != nullptr) {
            continue;
        }
        if (VLIBCSzHashCount(table) >= kMaxCookies) {
            if (!warned) {
                VELA_LOG_ERR("more than %d cookies, the rest are ignored", kMaxCookies);
                warned = true;
            }
            break;
        }
        if (VLIBCSzHashSetValue(table, name.c_str(), value.c_str()) != 0) {
            return false;
        }
    }
    return true;
}

// An IP address in binary form, compared with IPv4-mapped IPv6 addresses
// (::ffff:a.b.c.d, RFC 4291 section 2.5.5.2) taken as their IPv4 address.
struct Address {
    int family = 0;
    unsigned char bytes[sizeof(struct in6_addr)] = {};
};

bool ParseAddress(const std::string& text, Address& out)
{
    if (inet_pton(AF_INET, text.c_str(), out.bytes) == 1) {
        out.family = AF_INET;
        return true;
    }
    if (inet_pton(AF_INET6, text.c_str(), out.bytes) == 1) {
        out.family = AF_INET6;
        return true;
    }
    return false;
}

Address Unmapped(const Address& addr)
{
    struct in6_addr v6;
    memcpy(&v6, addr.bytes, sizeof(v6));
    if (addr.family != AF_INET6 || !IN6_IS_ADDR_V4MAPPED(&v6)) {
        return addr;
    }
    Address v4;
    v4.family = AF_INET;
    memcpy(v4.bytes, addr.bytes + 12, 4);
    return v4;
}

bool SameAddress(const Address& a, const Address& b)
{
    const Address x = Unmapped(a);
    const Address y = Unmapped(b);
    const size_t len = x.family == AF_INET ? 4 : sizeof(struct in6_addr);
    return x.family == y.family && memcmp(x.bytes, y.bytes, len) == 0;
}

struct TrustedProxies {
    std::vector<Address> list;

    bool Contains(const Address& addr) const
    {
        for (const Address& proxy : list) {
            if (SameAddress(proxy, addr)) {
                return true;
            }
        }
        return false;
    }
};

// <root>/etc/vela/webapi.conf: lines of key="value" (or key=value), blank
// lines and "#" comments ignored. trusted_proxies holds addresses separated
// by blanks or commas. Without the key, and with a missing or unreadable
// file, no proxy is trusted: not even loopback, where any local user can
// connect. Invalid entries are logged and skipped.
TrustedProxies LoadTrustedProxies()
{
    TrustedProxies trusted;
    bool configured = false;
    const std::string path = VELA::System::Path(kConfPath);
    std::string text;
    int err = 0;
    if (!VELA::System::ReadFileBounded(path, kMaxConfFile, text, err)) {
        if (err != ENOENT) {
            VELA_LOG_ERR("cannot read %s: %s", path.c_str(), strerror(err));
        }
        return trusted;
    }
    std::string value;
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\n', start);
        if (end == std::string::npos) {
            end = text.size();
        }
        std::string line = text.substr(start, end - start);
        start = end + 1;
        if (!line.empty() && line.back() == '\r') {
            line.pop_back();
        }
        line = Trim(line);
        if (line.empty() || line[0] == '#') {
            continue;
        }
        const size_t eq = line.find('=');
        if (eq == std::string::npos || Trim(line.substr(0, eq)) != "trusted_proxies") {
            continue;
        }
        value = Trim(line.substr(eq + 1));
        if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
            value = value.substr(1, value.size() - 2);
        }
        configured = true;  // the last line of the key wins
    }
    if (!configured) {
        return trusted;
    }
    size_t pos = 0;
    while (pos < value.size()) {
        const size_t next = value.find_first_of(" \t,", pos);
        const size_t stop = next == std::string::npos ? value.size() : next;
        if (stop > pos) {
            const std::string entry = value.substr(pos, stop - pos);
            Address addr;
            if (ParseAddress(entry, addr)) {
                trusted.list.push_back(addr);
            } else {
                VELA_LOG_ERR("%s: ignoring invalid trusted proxy \"%.64s\"", path.c_str(), entry.c_str());
            }
        }
        pos = stop + 1;
    }
    return trusted;
}

// The peer address `text` (REMOTE_ADDR), bounded and parsed. False when it
// is missing, too long or not an address.
bool PeerAddress(const char* text, Address& out)
{
    return text != nullptr && strnlen(text, INET6_ADDRSTRLEN) < INET6_ADDRSTRLEN && ParseAddress(text, out);
}

// The client address: REMOTE_ADDR, or behind a trusted proxy the right-most
// X-Forwarded-For entry that is not itself a trusted proxy (entries to its
// left are written by the client and cannot be believed). When every entry
// is a trusted proxy the left-most one is the client. An invalid entry met
// on the way gives false: the chain cannot be followed.
bool ClientAddress(Address& out)
{
    const char* remote = getenv("REMOTE_ADDR");
    Address remoteAddr;
    if (!PeerAddress(remote, remoteAddr)) {
        VELA_LOG_ERR("REMOTE_ADDR \"%.46s\" is missing, too long or not an IP address", remote ? remote : "");
        return false;
    }
    out = remoteAddr;
    const char* forwarded = getenv("HTTP_X_FORWARDED_FOR");
    if (forwarded == nullptr) {
        return true;
    }
    const TrustedProxies trusted = LoadTrustedProxies();
    if (!trusted.Contains(remoteAddr)) {
        return true;  // a direct client: its X-Forwarded-For means nothing
    }
    if (strnlen(forwarded, kMaxForwardedHeader + 1) > kMaxForwardedHeader) {
        VELA_LOG_ERR("X-Forwarded-For longer than %zu bytes", kMaxForwardedHeader);
        return false;
    }
    const std::string header(forwarded);
    if (Trim(header).empty()) {
        return true;
    }
    std::vector<std::string> entries;
    size_t start = 0;
    for (;;) {
        const size_t comma = header.find(',', start);
        if (comma == std::string::npos) {
            entries.push_back(header.substr(start));
            break;
        }
        entries.push_back(header.substr(start, comma - start));
        start = comma + 1;
    }
    for (size_t i = entries.size(); i-- > 0;) {
        const std::string entry = Trim(entries[i]);
        Address addr;
        if (!ParseAddress(entry, addr)) {
            VELA_LOG_ERR("invalid X-Forwarded-For entry \"%.64s\"", entry.c_str());
            return false;
        }
        out = addr;
        if (!trusted.Contains(addr)) {
            return true;
        }
    }
    return true;  // every entry is a trusted proxy: the left-most is the client
}

}  // namespace

int VelaCgiInit(const char* app, VELACGI_CTX** ctx)
{
    if (ctx == nullptr) {
        return -1;
    }
    *ctx = nullptr;
    VELACGI_CTX* handle = new (std::nothrow) VELACGI_CTX();
    if (handle == nullptr) {
        return -1;
    }
    try {
        handle->app = app != nullptr ? app : "";
    } catch (const std::exception&) {
        delete handle;
        return -1;
    }
    handle->cookies = VLIBCSzHashAlloc(16);
    if (handle->cookies == nullptr) {
        delete handle;
        return -1;
    }
    *ctx = handle;
    return 0;
}

int VelaCgiLoadInCookies(VELACGI_CTX* ctx)
{
    if (ctx == nullptr) {
        return -1;
    }
    PVLIBCSZHASH table = VLIBCSzHashAlloc(16);
    if (table == nullptr) {
        return -1;
    }
    const char* header = getenv("HTTP_COOKIE");
    if (header != nullptr) {
        if (strnlen(header, kMaxCookieHeader + 1) > kMaxCookieHeader) {
            VELA_LOG_ERR("Cookie header longer than %zu bytes", kMaxCookieHeader);
            VLIBCSzHashFree(table);
            return -1;
        }
        bool parsed = false;
        try {
            parsed = ParseCookieHeader(header, table);
        } catch (const std::exception&) {
            parsed = false;
        }
        if (!parsed) {
            VELA_LOG_ERR("out of memory parsing cookies");
            VLIBCSzHashFree(table);
            return -1;
        }
    }
    VLIBCSzHashFree(ctx->cookies);
    ctx->cookies = table;
    return 0;
}

const char* VelaCgiGetCookie(VELACGI_CTX* ctx, const char* name)
{
    if (ctx == nullptr || name == nullptr) {
        return nullptr;
    }
    return VLIBCSzHashGetValue(ctx->cookies, name);
}

void VelaCgiFree(VELACGI_CTX* ctx)
{
    if (ctx == nullptr) {
        return;
    }
    VLIBCSzHashFree(ctx->cookies);
    delete ctx;
}

int VelaCgiIsTrustedProxy(const char* peer)
{
    Address addr;
    if (!PeerAddress(peer, addr)) {
        return 0;
    }
    try {
        return LoadTrustedProxies().Contains(addr) ? 1 : 0;
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory reading the trusted proxies");
        return 0;
    }
}

int VelaCgiGetRemoteIP(char* buf, size_t size)
{
    if (buf == nullptr || size == 0) {
        return -1;
    }
    buf[0] = '\0';
    Address addr;
    try {
        if (!ClientAddress(addr)) {
            return -1;
        }
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory finding the client address");
        return -1;
    }
    // The canonical text (inet_ntop), so equal addresses compare equal as
    // strings whatever spelling the header used.
    char text[INET6_ADDRSTRLEN];
    if (inet_ntop(addr.family, addr.bytes, text, sizeof(text)) == nullptr) {
        VELA_LOG_ERR("inet_ntop: %m");
        return -1;
    }
    const size_t len = strlen(text);
    if (len + 1 > size) {
        return -1;
    }
    memcpy(buf, text, len + 1);
    return 0;
}
