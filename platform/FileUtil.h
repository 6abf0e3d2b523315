// File helpers shared by the platform sources (not installed).
#pragma once

#include <cstddef>
#include <string>

namespace VELA {
namespace Platform {

// Reads the regular file `path` into `out` when it holds at most `limit`
// bytes. False otherwise, with `err` set to the errno of the failing call,
// EFBIG when the file is larger than `limit`, or EINVAL when `path` is not a
// regular file (a FIFO or device is never read, so the call cannot block).
// `out` is unchanged on failure. Never throws.
bool ReadFileBounded(const std::string& path, size_t limit, std::string& out, int& err);

// write(2) until all `len` bytes are written, retrying on EINTR. False with
// errno set on failure.
bool WriteAll(int fd, const char* data, size_t len);

}  // namespace Platform
}  // namespace VELA
