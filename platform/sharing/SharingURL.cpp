// The public URL of the sharing page.
#include <arpa/inet.h>
#include <netinet/in.h>

#include "vela/sharing.h"
#include "vela/vlibc.h"

namespace VELA {
namespace sharing {

namespace {

constexpr size_t kMaxHostName = 253;

// A DNS name: labels of letters, digits and "-" (not at either end of a
// label) separated by single dots; a final dot is allowed.
bool IsHostName(const std::string& host)
{
    if (host.empty() || host.size() > kMaxHostName) {
        return false;
    }
    size_t label = 0;
    for (size_t i = 0; i < host.size(); ++i) {
        const char c = host[i];
        if (c == '.') {
            if (label == 0 || host[i - 1] == '-') {
                return false;
            }
            label = 0;
            continue;
        }
        const bool alnum = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
        if (!alnum && !(c == '-' && label > 0)) {
            return false;
        }
        if (++label > 63) {
            return false;
        }
    }
    return label == 0 || host.back() != '-';
}

// The host as the URL writes it, or "" when it is refused.
std::string UrlHost(const std::string& host)
{
    std::string bare = host;
    if (bare.size() >= 2 && bare.front() == '[' && bare.back() == ']') {
        bare = bare.substr(1, bare.size() - 2);
    } else if (IsHostName(bare)) {
        return bare;
    }
    unsigned char bytes[sizeof(struct in6_addr)];
    if (bare.size() < INET6_ADDRSTRLEN && bare.find('%') == std::string::npos &&
        inet_pton(AF_INET6, bare.c_str(), bytes) == 1) {
        return "[" + bare + "]";
    }
    return "";
}

}  // namespace

bool GetSharingURL(const std::string& host, int port, bool https, const std::string& appName, std::string& url,
                   _tag_SHARING_URL_TYPE& type)
{
    url.clear();
    type = SHARING_URL_TYPE_NONE;
    const std::string urlHost = UrlHost(host);
    if (urlHost.empty() || port < 0 || port > 65535) {
        return false;
    }
    if (!appName.empty() && (!System::IsCheckedName(appName, System::kNameDotted, kMaxProjectName) ||
                             appName[0] == '.' || appName.find("..") != std::string::npos)) {
        return false;
    }
    const int defaultPort = https ? 443 : 80;
    const bool direct = port == 0 || port == defaultPort;
    std::string out = https ? "https://" : "http://";
    out += urlHost;
    if (!direct) {
        out += ":" + std::to_string(port);
    }
    out += "/sharing/";
    if (!appName.empty()) {
        out += appName + "/";
    }
    url.swap(out);
    type = direct ? SHARING_URL_TYPE_DIRECT : SHARING_URL_TYPE_PORT;
    return true;
}

}  // namespace sharing
}  // namespace VELA
