#include "vela/log.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

namespace {

std::mutex g_sinkLock;
VELA::System::LogSinkFn g_sink = nullptr;
void* g_sinkArg = nullptr;

bool StderrWanted()
{
    static const bool wanted = [] {
        const char* v = secure_getenv("VELA_LOG_STDERR");
        return v && *v && strcmp(v, "0") != 0;
    }();
    return wanted;
}

void Deliver(int priority, const char* line)
{
    {
        std::lock_guard<std::mutex> guard(g_sinkLock);
        if (g_sink) {
            g_sink(priority, line, g_sinkArg);
            return;
        }
    }
    syslog(priority, "%s", line);
    if (StderrWanted()) {
        fprintf(stderr, "%s\n", line);
    }
}

void DeliverV(int priority, const char* prefix, const char* fmt, va_list ap)
{
    char line[2048];
    size_t used = prefix ? strlen(prefix) : 0;
    if (used >= sizeof(line)) {
        used = sizeof(line) - 1;
    }
    memcpy(line, prefix ? prefix : "", used);
    line[used] = '\0';
    vsnprintf(line + used, sizeof(line) - used, fmt, ap);
    Deliver(priority, line);
}

}  // namespace

void VELA::System::Log(int priority, const char* fmt, ...)
{
    int saved = errno;
    va_list ap;
    va_start(ap, fmt);
    errno = saved;
    DeliverV(priority, nullptr, fmt, ap);
    va_end(ap);
    errno = saved;
}

void VELA::System::LogSetSink(LogSinkFn sink, void* arg)
{
    std::lock_guard<std::mutex> guard(g_sinkLock);
    g_sink = sink;
    g_sinkArg = arg;
}

void VELA::System::LogAt(int priority, const char* file, int line, const char* fmt, ...)
{
    int saved = errno;
    const char* base = file ? strrchr(file, '/') : nullptr;
    base = base ? base + 1 : (file ? file : "");
    const char* dot = strrchr(base, '.');
    int stemLen = dot ? static_cast<int>(dot - base) : static_cast<int>(strlen(base));
    char prefix[320];
    snprintf(prefix, sizeof(prefix), "%.*s:%d ", stemLen > 255 ? 255 : stemLen, base, line);
    va_list ap;
    va_start(ap, fmt);
    errno = saved;  // keep %m meaningful
    DeliverV(priority, prefix, fmt, ap);
    va_end(ap);
    errno = saved;
}
