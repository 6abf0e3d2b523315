// The CGI reply of WebEntry on standard output: the response's headers and
// cookies, the fixed security and cache headers, an empty line, then the
// JSON body (CGI, RFC 3875 section 6).
#include <cstring>
#include <iostream>
#include <string>

#include "vela/log.h"
#include "webapi/APIResponse.h"
#include "webapi/JsonUtil.h"
#include "webentry/WebEntry.h"

namespace VELA {

namespace {

// Written after the response's own headers; a handler cannot remove them.
// "Accept-Ranges: none": a JSON answer is whole or nothing. Without it the
// web server cuts a short answer that is complete before it starts sending
// to the byte range the client asked for, so a refused ranged download
// would get a piece of its error as "206 Partial Content".
const char* const kFixedHeaders[] = {
    "Accept-Ranges: none",
    "X-Content-Type-Options: nosniff",
    "X-XSS-Protection: 1; mode=block",
    "Cache-Control: max-age=0, no-cache, no-store, must-revalidate",
    "Pragma: no-cache",
    "Expires: 0",
};

// The response refuses CR and LF when a header or cookie is set; this keeps
// a line that got past it from splitting the header block.
bool OneLine(const std::string& text)
{
    return text.find_first_of("\r\n") == std::string::npos;
}

}  // namespace

void WebEntry::OutputHeader()
{
    std::ostream& out = std::cout;
    const Json::Value headers = response_->GetHeaders();
    if (headers.isObject()) {
        for (Json::Value::const_iterator it = headers.begin(); it != headers.end(); ++it) {
            if (!it->isString()) {
                continue;
            }
            const std::string name = it.name();
            const std::string value = it->asString();
            if (!OneLine(name) || !OneLine(value)) {
                VELA_LOG_ERR("header %.64s dropped: it holds a line break", name.c_str());
                continue;
            }
            out << name << ": " << value << "\r\n";
        }
    }
    const Json::Value cookies = response_->GetCookies();
    if (cookies.isArray()) {
        for (const Json::Value& cookie : cookies) {
            if (!cookie.isString()) {
                continue;
            }
            const std::string line = cookie.asString();
            if (!OneLine(line)) {
                VELA_LOG_ERR("cookie dropped: it holds a line break");
                continue;
            }
            out << "Set-Cookie: " << line << "\r\n";
        }
    }
    for (const char* line : kFixedHeaders) {
        out << line << "\r\n";
    }
    out << "\r\n";
}

void WebEntry::OutputBody()
{
    std::cout << JsonToString(response_->GetBody());
    std::cout.flush();
}

}  // namespace VELA
