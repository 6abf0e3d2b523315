// Serving one request whose CGI environment and standard streams are this
// process's: what velascgi does for every call, and what every child of
// velafcgi does once it has been given its request.
#pragma once

#include <cstddef>

#include "vela/export.h"

namespace VELA {

class WebEntry;

// Exported for velascgi and velafcgi (VELA_EXPORT: see vela/export.h).

// The reply when a request cannot even start being served: a CGI status
// line, the usual headers and a JSON error (117).
VELA_EXPORT extern const char kSetupFailedReply[];
VELA_EXPORT extern const size_t kSetupFailedReplyLength;
// The reply when no more requests can be taken at the moment (the client's
// own, or the server's): try again shortly.
VELA_EXPORT extern const char kBusyReply[];
VELA_EXPORT extern const size_t kBusyReplyLength;

// Writes `length` bytes to standard output, as far as it takes them.
VELA_EXPORT void WriteReply(const char* text, size_t length);

// Enters the web-API directory, arms the request's CPU and wall-clock limits,
// takes one of its client's slots and runs the call through `entry`, or
// through a WebEntry of its own when `entry` is null. Every failure is
// answered on standard output and logged; nothing throws.
VELA_EXPORT void ServeCgiRequest(int argc, char** argv, WebEntry* entry);

}  // namespace VELA
