// Logging for the framework and the platform layer.
//
// Every line goes to syslog. Two switches exist beside it:
//  - a sink installed with VELA::System::LogSetSink() receives each
//    formatted line instead of syslog (tests use it to read what was logged);
//  - when the environment variable VELA_LOG_STDERR is set (read with
//    secure_getenv), each line is also written to standard error, for people
//    running the server by hand.
#pragma once

#include <syslog.h>

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {
namespace System {

typedef void (*LogSinkFn)(int priority, const char* line, void* arg);

// Formats like printf (glibc's %m included) and delivers the line.
// `priority` may carry a facility (LOG_AUTHPRIV | LOG_INFO).
void Log(int priority, const char* fmt, ...) __attribute__((format(printf, 2, 3)));

// Installs (or, with a null sink, removes) the process-wide sink.
void LogSetSink(LogSinkFn sink, void* arg);

// "%s:%d <message>": the usual line of the framework, where %s is the source
// file name of `file` without directory and extension ("APIRunner") and %d
// is `line`.
void LogAt(int priority, const char* file, int line, const char* fmt, ...) __attribute__((format(printf, 4, 5)));

}  // namespace System
}  // namespace VELA

#define VELA_LOG(priority, fmt, ...) ::VELA::System::LogAt((priority), __FILE__, __LINE__, fmt, ##__VA_ARGS__)
#define VELA_LOG_ERR(fmt, ...) VELA_LOG(LOG_ERR, fmt, ##__VA_ARGS__)

#pragma GCC visibility pop
