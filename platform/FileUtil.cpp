#include "FileUtil.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace VELA {
namespace Platform {

namespace {

class Fd {
public:
    explicit Fd(int fd) : fd_(fd) {}
    ~Fd()
    {
        if (fd_ >= 0) {
            close(fd_);
        }
    }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }

private:
    int fd_;
};

}  // namespace

bool ReadFileBounded(const std::string& path, size_t limit, std::string& out, int& err)
{
    // O_NONBLOCK: opening a FIFO must not wait for a writer; the S_ISREG
    // check below then refuses it.
    Fd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (fd.get() < 0) {
        err = errno;
        return false;
    }
    struct stat st;
    if (fstat(fd.get(), &st) != 0) {
        err = errno;
        return false;
    }
    if (!S_ISREG(st.st_mode)) {
        err = EINVAL;
        return false;
    }
    if (st.st_size < 0 || static_cast<unsigned long long>(st.st_size) > limit) {
        err = EFBIG;
        return false;
    }
    std::string data;
    try {
        data.resize(static_cast<size_t>(st.st_size) + 1);
        size_t used = 0;
        for (;;) {
            if (used == data.size()) {
                // The file grew after fstat: allow it up to the limit.
                if (data.size() > limit) {
                    err = EFBIG;
                    return false;
                }
                data.resize(data.size() + 4096 > limit + 1 ? limit + 1 : data.size() + 4096);
            }
            ssize_t got = read(fd.get(), &data[used], data.size() - used);
            if (got < 0) {
                if (errno == EINTR) {
                    continue;
                }
                err = errno;
                return false;
            }
            if (got == 0) {
                break;
            }
            used += static_cast<size_t>(got);
        }
        if (used > limit) {
            err = EFBIG;
            return false;
        }
        data.resize(used);
    } catch (const std::exception&) {
        err = ENOMEM;
        return false;
    }
    out.swap(data);
    return true;
}

bool WriteAll(int fd, const char* data, size_t len)
{
    while (len > 0) {
        ssize_t done = write(fd, data, len);
        if (done < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        data += done;
        len -= static_cast<size_t>(done);
    }
    return true;
}

}  // namespace Platform
}  // namespace VELA
