// The multipart/form-data parser behind the upload calls (not installed).
// RFC 2046 section 5.1.1 for the body (delimiters, transport padding,
// preamble and epilogue), RFC 7578 for the form-data parts, RFC 7230 for the
// header-field syntax. Format accepted and limits: vela/upload.h.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include "vela/upload.h"
#include "vela/export.h"

namespace VELA {
namespace Transfer {

// Size of the one buffer a reader owns: the body goes through it in pieces
// this large, and stored files are written in pieces of nearly this size.
constexpr size_t kMultipartBufferSize = 256 * 1024;
constexpr size_t kMaxBoundaryLength = 70;
constexpr size_t kMaxPartHeaderLine = 8192;
constexpr int kMaxPartHeaderLines = 16;
constexpr size_t kMaxPartNameLength = 255;
constexpr size_t kMaxTransportPadding = 256;

// The boundary of a Content-Type value "multipart/form-data; boundary=..."
// (type and parameter names case-insensitive, the value a token or a quoted
// string, other parameters ignored). False (and logged) for another type, a
// missing or repeated boundary, or one that is not 1 to 70 RFC 2046 bchars
// ending in a non-space.
// Exported for the tests (vela/export.h).
VELA_EXPORT bool ParseMultipartContentType(const char* contentType, std::string& boundary);

// What the headers of one part say.
struct MultipartPart {
    std::string name;          // the "name" parameter, validated
    bool hasFileName = false;  // a "filename" parameter was present
    std::string fileName;      // its value as sent (not yet reduced)
};

// Receives the content of a part. Write returns 0, or a VELA_UPLOAD_ERR_*
// code that stops the reader (the sink logs why).
class MultipartSink {
public:
    virtual ~MultipartSink() = default;
    virtual int Write(const char* data, size_t len) = 0;
};

// Pulls parts from a body of a known length on a file descriptor. Every
// failure is final: the reader keeps its code and returns it from every
// later call. Nothing here throws.
class MultipartReader {
public:
    MultipartReader() = default;
    MultipartReader(const MultipartReader&) = delete;
    MultipartReader& operator=(const MultipartReader&) = delete;

    // Takes `fd` (not owned), the body length (> 0) and the boundary
    // (validated). 1, or VELA_UPLOAD_ERR_MEMORY.
    int Open(int fd, uint64_t length, const std::string& boundary);

    // Skips what is left of the current part and reads the next part's
    // headers. 1 with `part` filled; 0 at the end of the body (the close
    // delimiter was read, and the epilogue up to the body length); a
    // negative code on failure.
    int NextPart(MultipartPart& part);

    // Streams the current part's content into `sink` (null discards it) up
    // to the delimiter that ends it. 1, or a negative code.
    // VELA_UPLOAD_ERR_STATE (not final) when no part is open.
    int ReadContent(MultipartSink* sink);

    // Records a failure found by the caller; returns `code`.
    int Fail(int code);
    int Failure() const { return failure_; }
    bool AtEnd() const { return state_ == kDone; }

    void SetProgress(UploadProgressFn progress) { progress_ = progress; }
    uint64_t Consumed() const { return consumed_; }
    uint64_t Length() const { return length_; }

private:
    enum State { kStart, kContent, kAfterDelimiter, kDone, kFailed };

    int Fill();
    int Ensure(size_t n);
    const char* FindDelimiter(const char* data, size_t len) const;
    int ScanToDelimiter(MultipartSink* sink);
    int ReadDelimiterLine();
    int ReadHeaderLine(std::string& line);
    int ReadHeaders(MultipartPart& part);
    int Drain();
    size_t Available() const { return end_ - begin_; }
    const char* Data() const { return buf_.get() + begin_; }

    int fd_ = -1;
    uint64_t length_ = 0;
    uint64_t remaining_ = 0;  // bytes of the body not read from fd_ yet
    uint64_t consumed_ = 0;
    std::string delimiter_;   // CR LF "--" boundary
    struct Free {
        void operator()(char* p) const { free(p); }
    };
    std::unique_ptr<char, Free> buf_;  // page-aligned
    size_t begin_ = 0;        // unread data is buf_[begin_, end_)
    size_t end_ = 0;
    uint64_t partBytes_ = 0;  // content of the current part handed on so far
    State state_ = kStart;
    int failure_ = 0;
    UploadProgressFn progress_ = nullptr;
};

}  // namespace Transfer
}  // namespace VELA
