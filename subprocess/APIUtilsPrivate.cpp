// The JSON pipe between a forked child and its parent (see APIUtils.h).
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <fcntl.h>
#include <new>
#include <string>
#include <unistd.h>

#include "platform/system/FileUtil.h"
#include "vela/log.h"
#include "webapi/APIUtils.h"
#include "webapi/JsonUtil.h"

namespace VELA {

namespace {

// read() until `len` bytes arrived or end of file; the count that arrived,
// or -1 on an error before any byte.
ssize_t ReadAll(int fd, char* data, size_t len)
{
    size_t got = 0;
    while (got < len) {
        const ssize_t n = read(fd, data + got, len - got);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return got > 0 ? static_cast<ssize_t>(got) : -1;
        }
        if (n == 0) {
            break;
        }
        got += static_cast<size_t>(n);
    }
    return static_cast<ssize_t>(got);
}

void CloseEnd(int& fd)
{
    if (fd >= 0) {
        close(fd);
        fd = -1;
    }
}

}  // namespace

Pipe::Pipe() : fds_{-1, -1} {}

Pipe::~Pipe()
{
    Close();
}

bool Pipe::Init()
{
    Close();
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) {
        return false;
    }
    fds_[0] = fds[0];
    fds_[1] = fds[1];
    return true;
}

int Pipe::ReadOnly(int fd)
{
    CloseEnd(fds_[1]);
    if (fd < 0) {
        return 0;
    }
    return dup2(fds_[0], fd);
}

int Pipe::WriteOnly(int fd)
{
    CloseEnd(fds_[0]);
    if (fd < 0) {
        return 0;
    }
    return dup2(fds_[1], fd);
}

void Pipe::Close()
{
    ReadOnly(-1);
    WriteOnly(-1);
}

bool Pipe::WriteJson(const Json::Value& value)
{
    const std::string text = JsonToString(value);
    if (text.size() > kMaxDocument) {
        VELA_LOG_ERR("json of %zu bytes is too large for the pipe", text.size());
        return false;
    }
    const uint32_t len = static_cast<uint32_t>(text.size());
    if (fds_[1] < 0 || !System::WriteAll(fds_[1], reinterpret_cast<const char*>(&len), sizeof(len))) {
        return false;
    }
    // A document above the pipe's buffer goes in several writes while the
    // reader drains it.
    return System::WriteAll(fds_[1], text.data(), text.size());
}

int Pipe::Read(char* buf, int size)
{
    if (buf == nullptr || size <= 0) {
        return -1;
    }
    memset(buf, 0, static_cast<size_t>(size));
    ssize_t n;
    do {
        n = read(fds_[0], buf, static_cast<size_t>(size));
    } while (n < 0 && errno == EINTR);
    return static_cast<int>(n);
}

bool Pipe::ReadJson(Json::Value& out)
{
    uint32_t len = 0;
    if (fds_[0] < 0 || ReadAll(fds_[0], reinterpret_cast<char*>(&len), sizeof(len)) != sizeof(len)) {
        VELA_LOG_ERR("protocol failed");
        return false;
    }
    const unsigned long size = static_cast<unsigned long>(len) + 1;
    char* buf = len > kMaxDocument ? nullptr : new (std::nothrow) char[size];
    if (buf == nullptr) {
        VELA_LOG_ERR("new szBuf[%lu] failed", size);
        return false;
    }
    const ssize_t got = ReadAll(fds_[0], buf, len);
    const size_t have = got > 0 ? static_cast<size_t>(got) : 0;
    if (have < len) {
        VELA_LOG_ERR("read json %lu failed, got %lu", static_cast<unsigned long>(len),
                     static_cast<unsigned long>(have));
    }
    buf[have] = '\0';
    const bool ok = JsonParse(std::string(buf, have), out);
    delete[] buf;
    return ok;
}

}  // namespace VELA
