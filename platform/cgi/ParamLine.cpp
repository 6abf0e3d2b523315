// Raw parameter lines of the CGI library: the query string and the
// application/x-www-form-urlencoded body, checked before anything splits
// them, and decrypted when the client encrypted the whole line.
#include <cstring>
#include <string>

#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/webapiutil.h"

namespace {

const char kCipherPrefix[] = "__cIpHeRtExT=";

bool IsHexDigit(char c)
{
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

// The line is short enough, holds no control byte and every "%" starts a
// percent-encoded octet (RFC 3986 section 2.1: "%" HEXDIG HEXDIG). Logs one
// line naming the first fault and its offset.
bool CheckLine(const std::string& line, const char* what)
{
    if (line.size() > VELACGI_MAX_PARAM_LINE) {
        VELA_LOG_ERR("%s refused: %zu bytes, more than %u", what, line.size(), VELACGI_MAX_PARAM_LINE);
        return false;
    }
    const size_t n = line.size();
    for (size_t i = 0; i < n; ++i) {
        const unsigned char c = static_cast<unsigned char>(line[i]);
        if (c < 0x20 || c == 0x7f) {
            VELA_LOG_ERR("%s refused: control byte 0x%02x at offset %zu", what, c, i);
            return false;
        }
        if (c == '%' && (i + 2 >= n || !IsHexDigit(line[i + 1]) || !IsHexDigit(line[i + 2]))) {
            VELA_LOG_ERR("%s refused: broken percent-encoding at offset %zu", what, i);
            return false;
        }
    }
    return true;
}

}  // namespace

bool VelaCgiDetectAndDecryptParamLine(std::string& line)
{
    if (!CheckLine(line, "parameter line")) {
        return false;
    }
    const size_t prefixLen = sizeof(kCipherPrefix) - 1;
    if (line.compare(0, prefixLen, kCipherPrefix) != 0 || line.find('&') != std::string::npos) {
        return true;  // plain parameters, or encrypted members the request decrypts
    }
    try {
        // Base64 never holds a blank, so "+" is kept as "+" whether or not
        // the client percent-encoded it.
        std::string text = VELA::WebAPIUtil::URLDecode(line.substr(prefixLen), false);
        if (VelaCgiDecryptParam(text) != 0) {
            VELA_LOG_ERR("parameter line refused: __cIpHeRtExT does not decrypt");
            return false;
        }
        if (!CheckLine(text, "decrypted parameter line")) {
            return false;
        }
        line.swap(text);
        return true;
    } catch (...) {
        VELA_LOG_ERR("parameter line refused: out of memory");
        return false;
    }
}
