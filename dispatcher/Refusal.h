// One refusal of a call: the error code on the response and one log line,
// "<source>:<line> <message>", the framework's usual line (vela/log.h).
#pragma once

#include <string>

namespace VELA {

class APIResponse;

// Sets `code` on `resp` (when not null) and logs one LOG_ERR line stamped
// with `file` (directory and extension dropped) and `line`.
void RefuseAt(APIResponse* resp, int code, const char* file, int line, const char* fmt, ...)
    __attribute__((format(printf, 5, 6)));

// `text` cut to 64 bytes, with every byte outside printable ASCII (and the
// backslash) written as \xHH: client text fit for one log line.
std::string LogSafe(const std::string& text);

}  // namespace VELA

#define VELA_REFUSE(resp, code, fmt, ...) ::VELA::RefuseAt((resp), (code), __FILE__, __LINE__, fmt, ##__VA_ARGS__)
