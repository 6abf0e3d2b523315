// The last-error record of the process (VLIBCErrSetEx and its readers).
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <mutex>

#include "system/SysInternal.h"
#include "vela/sysfile.h"

namespace {

std::mutex g_errLock;
VLIBC_ERR_INFO g_err;  // zero-initialised: VLIBC_ERR_NONE

// Copies the stem of `file` ("dir/APIUpload.cpp" -> "APIUpload") into `out`.
void CopyStem(const char* file, char* out, size_t size)
{
    out[0] = '\0';
    if (file == nullptr) {
        return;
    }
    const char* base = strrchr(file, '/');
    base = base ? base + 1 : file;
    const char* dot = strrchr(base, '.');
    size_t len = dot ? static_cast<size_t>(dot - base) : strlen(base);
    if (len >= size) {
        len = size - 1;
    }
    memcpy(out, base, len);
    out[len] = '\0';
}

void Store(int code, const char* file, int line, const char* message, int sysErrno)
{
    VLIBC_ERR_INFO rec;
    memset(&rec, 0, sizeof(rec));
    rec.code = code;
    rec.sysErrno = sysErrno;
    rec.line = line;
    CopyStem(file, rec.szFile, sizeof(rec.szFile));
    if (message != nullptr) {
        snprintf(rec.szMessage, sizeof(rec.szMessage), "%s", message);
    }
    std::lock_guard<std::mutex> guard(g_errLock);
    g_err = rec;
}

}  // namespace

void VLIBCErrSetEx(int code, const char* file, int line)
{
    const int saved = errno;
    Store(code, file, line, nullptr, saved);
    errno = saved;
}

void VLIBCErrSetEx(int code, const char* file, int line, const char* message)
{
    const int saved = errno;
    Store(code, file, line, message, saved);
    errno = saved;
}

int VLIBCErrGet(void)
{
    std::lock_guard<std::mutex> guard(g_errLock);
    return g_err.code;
}

int VLIBCErrGetEx(VLIBC_ERR_INFO* info)
{
    if (info == nullptr) {
        return -1;
    }
    std::lock_guard<std::mutex> guard(g_errLock);
    *info = g_err;
    return 0;
}

void VLIBCErrClear(void)
{
    std::lock_guard<std::mutex> guard(g_errLock);
    memset(&g_err, 0, sizeof(g_err));
}

namespace VELA {
namespace System {

void RecordError(int code, const char* file, int line, const char* fmt, ...)
{
    const int saved = errno;
    char message[256];
    va_list ap;
    va_start(ap, fmt);
    vsnprintf(message, sizeof(message), fmt, ap);
    va_end(ap);
    Store(code, file, line, message, saved);
    errno = saved;
}

}  // namespace System
}  // namespace VELA
