#include "dispatcher/Refusal.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>

#include "vela/log.h"
#include "webapi/APIResponse.h"

namespace VELA {

namespace {

// Bytes of client text shown in a log line.
constexpr size_t kMaxLogged = 64;

}  // namespace

void RefuseAt(APIResponse* resp, int code, const char* file, int line, const char* fmt, ...)
{
    const int saved = errno;  // for a %m of the message
    if (resp != nullptr) {
        resp->SetError(code);
    }
    char message[1024];
    errno = saved;
    va_list args;
    va_start(args, fmt);
    vsnprintf(message, sizeof(message), fmt, args);
    va_end(args);
    VELA::System::LogAt(LOG_ERR, file, line, "%s", message);
}

std::string LogSafe(const std::string& text)
{
    std::string out;
    const size_t n = text.size() < kMaxLogged ? text.size() : kMaxLogged;
    for (size_t i = 0; i < n; ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        if (c < 0x20 || c >= 0x7f || c == '\\') {
            char hex[5];
            snprintf(hex, sizeof(hex), "\\x%02x", c);
            out += hex;
        } else {
            out += static_cast<char>(c);
        }
    }
    if (text.size() > n) {
        out += "...";
    }
    return out;
}

}  // namespace VELA
