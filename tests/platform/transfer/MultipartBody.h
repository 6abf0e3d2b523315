// Multipart bodies for the tests of the upload reader: parts, bodies, bytes
// that look like delimiters, and the reader run over a memfd or a pipe.
#pragma once

#include <map>
#include <sys/mman.h>
#include <thread>

#include "platform/PlatformTest.h"
#include "vela/upload.h"

namespace VELA {
namespace Test {

inline const char kBoundary[] = "----VelaFormBoundary7MA4YWxk";
inline const std::string kType = std::string("multipart/form-data; boundary=") + kBoundary;

struct Part {
    std::string name;
    std::string content;
    std::string fileName = "";
    bool isFile = false;  // false: a plain field
};

inline std::string PartHead(const Part& p)
{
    std::string head = "Content-Disposition: form-data; name=\"" + p.name + "\"";
    if (p.isFile) {
        head += "; filename=\"" + p.fileName + "\"\r\nContent-Type: application/octet-stream";
    }
    return head + "\r\n\r\n";
}

inline std::string Body(const std::vector<Part>& parts)
{
    std::string body;
    for (const Part& p : parts) {
        body += std::string("--") + kBoundary + "\r\n" + PartHead(p) + p.content + "\r\n";
    }
    return body + "--" + kBoundary + "--\r\n";
}

// Bytes that look like delimiters without being one.
inline std::string Tricky()
{
    std::string s("line1\r\nline2\r\n--\r\n\0\r\n", 20);
    const std::string b(kBoundary);
    s += "\r\n--" + b.substr(0, b.size() - 1) + "Y";  // last character differs
    s += std::string("\r\n-") + kBoundary;         // one dash short
    s += std::string("--") + kBoundary + "\r\n";   // no CR LF before it
    for (int i = 0; i < 256; ++i) {
        s += static_cast<char>(i);
    }
    return s + "\r\n\r";
}

inline int MemFd(const std::string& data)
{
    const int fd = memfd_create("body", MFD_CLOEXEC);
    EXPECT_GE(fd, 0);
    EXPECT_EQ(static_cast<ssize_t>(data.size()), write(fd, data.data(), data.size()));
    lseek(fd, 0, SEEK_SET);
    return fd;
}

struct Result {
    int rc = 0;
    PVLIBCSZHASH fields = VLIBCSzHashAlloc(8);
    PVLIBCSZHASH files = VLIBCSzHashAlloc(8);
    ~Result()
    {
        VLIBCSzHashFree(fields);
        VLIBCSzHashFree(files);
    }
    std::string Field(const char* k) const { return Get(fields, k); }
    std::string File(const char* k) const { return Get(files, k); }
    // Every field, name and value.
    std::map<std::string, std::string> Fields() const
    {
        std::map<std::string, std::string> out;
        for (int i = 0; i < VLIBCSzHashCount(fields); ++i) {
            out[VLIBCSzHashKeyAt(fields, i)] = VLIBCSzHashValueAt(fields, i);
        }
        return out;
    }
    static std::string Get(PVLIBCSZHASH hash, const char* k)
    {
        const char* v = VLIBCSzHashGetValue(hash, k);
        return v ? v : "<none>";
    }
};

// Runs Transfer::UploadReadAll over `fd`.
inline void ReadAll(int fd, unsigned long long length, const std::string& type, const std::string& dir, Result& out,
             Transfer::UploadProgressFn progress = nullptr)
{
    Transfer::UploadReader* reader = nullptr;
    out.rc = Transfer::UploadReaderOpen(fd, length, type.c_str(), &reader);
    if (out.rc == 1) {
        out.rc = Transfer::UploadReadAll(reader, out.fields, out.files, dir.c_str(), 0, progress);
    }
    Transfer::UploadReaderFree(reader);
}

inline void ReadAllText(const std::string& body, const std::string& dir, Result& out, long long lengthDelta = 0)
{
    const int fd = MemFd(body);
    ReadAll(fd, body.size() + lengthDelta, kType, dir, out);
    close(fd);
}

// Writes `data` into a pipe from a thread, in pieces of 1 to 13 bytes.
class SlowPipe {
public:
    explicit SlowPipe(const std::string& data)
    {
        EXPECT_EQ(0, pipe(fds_));
        writer_ = std::thread([this, data] {
            size_t pos = 0;
            for (size_t step = 1; pos < data.size(); step = step % 13 + 1) {
                const size_t n = std::min(step, data.size() - pos);
                if (write(fds_[1], data.data() + pos, n) != static_cast<ssize_t>(n)) {
                    break;
                }
                pos += n;
            }
            close(fds_[1]);
        });
    }
    ~SlowPipe()
    {
        close(fds_[0]);  // a reader that stopped early makes the writer fail
        writer_.join();
    }
    int Fd() const { return fds_[0]; }

private:
    int fds_[2];
    std::thread writer_;
};

}  // namespace Test
}  // namespace VELA
