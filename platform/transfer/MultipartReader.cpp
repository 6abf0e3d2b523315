// The multipart/form-data parser: RFC 2046 section 5.1.1 body structure,
// RFC 7578 form-data parts. One fixed buffer; content is handed to a sink
// in large pieces, the delimiter found with memmem.
#include "transfer/MultipartReader.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#if defined(__SSE2__)
#include <emmintrin.h>
#endif
#include <poll.h>
#include <string>
#include <unistd.h>

#include "vela/log.h"

namespace VELA {
namespace Transfer {

namespace {

constexpr size_t kPage = 4096;

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

char Lower(char c) { return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c; }

bool EqualsNoCase(const std::string& a, const char* b)
{
    const size_t n = strlen(b);
    if (a.size() != n) {
        return false;
    }
    for (size_t i = 0; i < n; ++i) {
        if (Lower(a[i]) != Lower(b[i])) {
            return false;
        }
    }
    return true;
}

// RFC 7230 section 3.2.6 tchar.
bool IsTokenChar(unsigned char c)
{
    if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) {
        return true;
    }
    return c != 0 && strchr("!#$%&'*+-.^_`|~", c) != nullptr;
}

// RFC 2046 section 5.1.1 bcharsnospace.
bool IsBoundaryChar(unsigned char c)
{
    if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) {
        return true;
    }
    return c != 0 && strchr("'()+_,-./:=?", c) != nullptr;
}

bool HasControlByte(const std::string& s)
{
    for (unsigned char c : s) {
        if (c < 0x20 || c == 0x7f) {
            return true;
        }
    }
    return false;
}

size_t SkipBlanks(const std::string& text, size_t pos)
{
    while (pos < text.size() && IsBlank(text[pos])) {
        ++pos;
    }
    return pos;
}

// The token (RFC 7230 tchars) at `pos` of `text` into `out`, `pos` moved
// past it. False when there is none.
bool ReadToken(const std::string& text, size_t& pos, std::string& out)
{
    const size_t start = pos;
    while (pos < text.size() && IsTokenChar(static_cast<unsigned char>(text[pos]))) {
        ++pos;
    }
    if (pos == start) {
        return false;
    }
    out = text.substr(start, pos - start);
    return true;
}

// One parameter name "=" ( token / quoted-string ) at `pos` of `text`,
// `pos` moved past it; `name` lower-cased. A quoted string runs to the next
// double quote. False on a syntax error.
bool ReadParameter(const std::string& text, size_t& pos, std::string& name, std::string& value)
{
    if (!ReadToken(text, pos, name)) {
        return false;
    }
    for (char& c : name) {
        c = Lower(c);
    }
    pos = SkipBlanks(text, pos);
    if (pos >= text.size() || text[pos] != '=') {
        return false;
    }
    pos = SkipBlanks(text, pos + 1);
    if (pos < text.size() && text[pos] == '"') {
        const size_t close = text.find('"', pos + 1);
        if (close == std::string::npos) {
            return false;
        }
        value = text.substr(pos + 1, close - pos - 1);
        pos = close + 1;
        return true;
    }
    return ReadToken(text, pos, value);
}

// A header-field parameter list (RFC 7231 section 3.1.1.1 / RFC 6266
// section 4.1): *( OWS ";" OWS name "=" ( token / quoted-string ) ),
// starting at `pos` of `text`. Calls `take(name, value)` for each, `name`
// lower-cased; `take` returns false to refuse the header. An empty
// parameter after a trailing ";" is tolerated. False on a syntax error.
template <typename Take>
bool ForEachParameter(const std::string& text, size_t pos, Take take)
{
    for (;;) {
        pos = SkipBlanks(text, pos);
        if (pos >= text.size()) {
            return true;
        }
        if (text[pos] != ';') {
            return false;
        }
        pos = SkipBlanks(text, pos + 1);
        if (pos >= text.size()) {
            return true;
        }
        std::string name;
        std::string value;
        if (!ReadParameter(text, pos, name, value) || !take(name, value)) {
            return false;
        }
    }
}

// The media type at the start of a header value, up to ";" or a blank.
size_t TypeEnd(const std::string& text)
{
    size_t pos = 0;
    while (pos < text.size() && text[pos] != ';' && !IsBlank(text[pos])) {
        ++pos;
    }
    return pos;
}

// Content-Disposition of a form-data part (RFC 7578 section 4.2).
// 1, or VELA_UPLOAD_ERR_HEADER (logged).
int ParseDisposition(const std::string& value, MultipartPart& part)
{
    const size_t typeEnd = TypeEnd(value);
    if (!EqualsNoCase(value.substr(0, typeEnd), "form-data")) {
        VELA_LOG_ERR("multipart part refused: Content-Disposition \"%.64s\" is not form-data", value.c_str());
        return VELA_UPLOAD_ERR_HEADER;
    }
    bool haveName = false;
    bool repeated = false;
    const bool ok = ForEachParameter(value, typeEnd, [&](const std::string& name, const std::string& v) {
        if (name == "name") {
            repeated = repeated || haveName;
            haveName = true;
            part.name = v;
        } else if (name == "filename") {
            repeated = repeated || part.hasFileName;
            part.hasFileName = true;
            part.fileName = v;
        }
        return !repeated;
    });
    if (!ok) {
        VELA_LOG_ERR("multipart part refused: malformed or repeated parameter in Content-Disposition \"%.128s\"",
                     value.c_str());
        return VELA_UPLOAD_ERR_HEADER;
    }
    if (!haveName || part.name.empty() || part.name.size() > kMaxPartNameLength || HasControlByte(part.name)) {
        VELA_LOG_ERR("multipart part refused: missing, empty, over-long or invalid field name in \"%.128s\"",
                     value.c_str());
        return VELA_UPLOAD_ERR_HEADER;
    }
    return 1;
}

// One header line of a part (not the empty one that ends them): its field
// name checked, and a Content-Disposition parsed into `part`; every other
// field is ignored (Content-Type and the rest say nothing we use).
// `haveDisposition` tells whether an earlier line was one. 1, or a negative
// code (logged).
int TakeHeaderLine(const std::string& line, bool& haveDisposition, MultipartPart& part)
{
    const size_t colon = line.find(':');
    bool validName = colon != std::string::npos && colon > 0;
    for (size_t i = 0; validName && i < colon; ++i) {
        validName = IsTokenChar(static_cast<unsigned char>(line[i]));
    }
    if (!validName) {
        VELA_LOG_ERR("upload refused: malformed part header line \"%.64s\"", line.c_str());
        return VELA_UPLOAD_ERR_HEADER;
    }
    if (!EqualsNoCase(line.substr(0, colon), "content-disposition")) {
        return 1;
    }
    if (haveDisposition) {
        VELA_LOG_ERR("upload refused: a part has two Content-Disposition headers");
        return VELA_UPLOAD_ERR_HEADER;
    }
    haveDisposition = true;
    size_t start = colon + 1;
    while (start < line.size() && IsBlank(line[start])) {
        ++start;
    }
    size_t stop = line.size();
    while (stop > start && IsBlank(line[stop - 1])) {
        --stop;
    }
    try {
        return ParseDisposition(line.substr(start, stop - start), part);
    } catch (const std::exception&) {
        return VELA_UPLOAD_ERR_MEMORY;
    }
}

}  // namespace

bool ParseMultipartContentType(const char* contentType, std::string& boundary)
{
    boundary.clear();
    if (contentType == nullptr) {
        VELA_LOG_ERR("upload refused: no Content-Type");
        return false;
    }
    if (strnlen(contentType, kMaxPartHeaderLine + 1) > kMaxPartHeaderLine) {
        VELA_LOG_ERR("upload refused: Content-Type longer than %zu bytes", kMaxPartHeaderLine);
        return false;
    }
    try {
        std::string text(contentType);
        size_t start = 0;
        while (start < text.size() && IsBlank(text[start])) {
            ++start;
        }
        text.erase(0, start);
        const size_t typeEnd = TypeEnd(text);
        if (!EqualsNoCase(text.substr(0, typeEnd), "multipart/form-data")) {
            VELA_LOG_ERR("upload refused: Content-Type \"%.64s\" is not multipart/form-data", text.c_str());
            return false;
        }
        bool have = false;
        bool repeated = false;
        const bool ok = ForEachParameter(text, typeEnd, [&](const std::string& name, const std::string& value) {
            if (name == "boundary") {
                repeated = repeated || have;
                have = true;
                boundary = value;
            }
            return !repeated;
        });
        bool valid = ok && have && !boundary.empty() && boundary.size() <= kMaxBoundaryLength &&
                     boundary.back() != ' ';
        for (size_t i = 0; valid && i < boundary.size(); ++i) {
            const unsigned char c = static_cast<unsigned char>(boundary[i]);
            valid = c == ' ' || IsBoundaryChar(c);
        }
        if (!valid) {
            VELA_LOG_ERR("upload refused: missing, repeated or invalid boundary in Content-Type \"%.128s\"",
                         text.c_str());
            boundary.clear();
            return false;
        }
        return true;
    } catch (const std::exception&) {
        VELA_LOG_ERR("upload refused: out of memory reading Content-Type");
        boundary.clear();
        return false;
    }
}

int MultipartReader::Open(int fd, uint64_t length, const std::string& boundary)
{
    void* mem = nullptr;
    if (posix_memalign(&mem, kPage, kMultipartBufferSize) != 0) {
        mem = nullptr;
    }
    buf_.reset(static_cast<char*>(mem));
    if (!buf_) {
        return Fail(VELA_UPLOAD_ERR_MEMORY);
    }
    try {
        delimiter_ = "\r\n--" + boundary;
    } catch (const std::exception&) {
        return Fail(VELA_UPLOAD_ERR_MEMORY);
    }
    fd_ = fd;
    length_ = length;
    remaining_ = length;
    consumed_ = 0;
    begin_ = end_ = 0;
    state_ = kStart;
    failure_ = 0;
    return 1;
}

int MultipartReader::Fail(int code)
{
    if (state_ != kFailed) {
        state_ = kFailed;
        failure_ = code;
    }
    return failure_;
}

// Moves the unread data to the front and reads until the buffer is full or
// the body is all read, so that pieces handed on are large. 1 when bytes
// were read, 0 when the body is all read already, or a negative code.
int MultipartReader::Fill()
{
    if (remaining_ == 0) {
        return 0;
    }
    // The unread bytes move to the front, placed so that reads land on a
    // page boundary (the kernel copies fastest to aligned memory).
    const size_t unread = end_ - begin_;
    const size_t front = (kPage - unread % kPage) % kPage;
    if (begin_ != front && front + unread < kMultipartBufferSize) {
        memmove(buf_.get() + front, buf_.get() + begin_, unread);
        begin_ = front;
        end_ = front + unread;
    } else if (begin_ > 0) {
        memmove(buf_.get(), buf_.get() + begin_, unread);
        begin_ = 0;
        end_ = unread;
    }
    if (end_ == kMultipartBufferSize) {
        return VELA_UPLOAD_ERR_STATE;  // callers never ask with a full buffer
    }
    while (end_ < kMultipartBufferSize && remaining_ > 0) {
        size_t want = kMultipartBufferSize - end_;
        if (want > remaining_) {
            want = static_cast<size_t>(remaining_);
        }
        const ssize_t got = read(fd_, buf_.get() + end_, want);
        if (got < 0) {
            if (errno == EINTR) {
                continue;
            }
            if (errno == EAGAIN || errno == EWOULDBLOCK) {
                struct pollfd pfd = {fd_, POLLIN, 0};
                (void)poll(&pfd, 1, -1);
                continue;
            }
            VELA_LOG_ERR("upload failed: reading the body after %llu of %llu bytes: %m",
                         static_cast<unsigned long long>(consumed_), static_cast<unsigned long long>(length_));
            return VELA_UPLOAD_ERR_READ;
        }
        if (got == 0) {
            VELA_LOG_ERR("upload refused: the body ended after %llu of the %llu bytes of CONTENT_LENGTH",
                         static_cast<unsigned long long>(consumed_), static_cast<unsigned long long>(length_));
            return VELA_UPLOAD_ERR_TRUNCATED;
        }
        end_ += static_cast<size_t>(got);
        remaining_ -= static_cast<uint64_t>(got);
        consumed_ += static_cast<uint64_t>(got);
    }
    if (progress_ != nullptr) {
        progress_(consumed_, length_);
    }
    return 1;
}

// At least `n` (<= buffer size) unread bytes: 1; the body ends before: 0;
// or a negative code.
int MultipartReader::Ensure(size_t n)
{
    while (Available() < n) {
        const int rc = Fill();
        if (rc <= 0) {
            return rc;
        }
    }
    return 1;
}

// The first delimiter in `data`, or null. Candidates are the places where
// CR LF starts (with SSE2 sixteen places at a time, else memchr to each CR);
// each is confirmed by one comparison. Linear on any content: binary data
// holds about one CR LF in 65536 bytes, and a candidate costs at most one
// delimiter's length.
const char* MultipartReader::FindDelimiter(const char* data, size_t len) const
{
    const size_t dlen = delimiter_.size();
    if (len < dlen) {
        return nullptr;
    }
    const char* const last = data + (len - dlen);  // the last place a delimiter can start
    const char* const rest = delimiter_.data() + 2;
    const char* p = data;
#if defined(__SSE2__)
    // Places p .. p + 15 are tested with two loads, p .. p + 15 and
    // p + 1 .. p + 16, which stay inside the data while p + 15 <= last.
    const __m128i cr = _mm_set1_epi8('\r');
    const __m128i lf = _mm_set1_epi8('\n');
#define VELA_CRLF16(q)                                                                          \
    _mm_and_si128(_mm_cmpeq_epi8(_mm_loadu_si128(reinterpret_cast<const __m128i*>(q)), cr), \
                  _mm_cmpeq_epi8(_mm_loadu_si128(reinterpret_cast<const __m128i*>((q) + 1)), lf))
    while (last - p >= 15) {
        if (last - p >= 63) {
            const __m128i any = _mm_or_si128(_mm_or_si128(VELA_CRLF16(p), VELA_CRLF16(p + 16)),
                                             _mm_or_si128(VELA_CRLF16(p + 32), VELA_CRLF16(p + 48)));
            if (_mm_movemask_epi8(any) == 0) {
                p += 64;
                continue;
            }
        }
        for (unsigned mask = static_cast<unsigned>(_mm_movemask_epi8(VELA_CRLF16(p))); mask != 0; mask &= mask - 1) {
            const char* q = p + __builtin_ctz(mask);
            if (memcmp(q + 2, rest, dlen - 2) == 0) {
                return q;
            }
        }
        p += 16;
    }
#undef VELA_CRLF16
    for (; p <= last; ++p) {
        if (p[0] == '\r' && p[1] == '\n' && memcmp(p + 2, rest, dlen - 2) == 0) {
            return p;
        }
    }
#else
    while (p <= last) {
        p = static_cast<const char*>(memchr(p, '\r', static_cast<size_t>(last - p) + 1));
        if (p == nullptr) {
            return nullptr;
        }
        if (p[1] == '\n' && memcmp(p + 2, rest, dlen - 2) == 0) {
            return p;
        }
        ++p;
    }
#endif
    return nullptr;
}

// Hands the bytes before the next delimiter to `sink` and consumes the
// delimiter. While no delimiter is found the last (delimiter length - 1)
// bytes stay buffered, as they may begin one, and a few more so that what is
// handed on ends on a page boundary of the part's content.
int MultipartReader::ScanToDelimiter(MultipartSink* sink)
{
    const size_t dlen = delimiter_.size();
    for (;;) {
        const size_t avail = Available();
        if (avail >= dlen) {
            const char* data = Data();
            const char* hit = FindDelimiter(data, avail);
            size_t take = hit != nullptr ? static_cast<size_t>(hit - data) : avail - (dlen - 1);
            if (hit == nullptr && take > kPage) {
                // Keep the part's bytes handed on a multiple of the page size,
                // so a file is written in whole pages.
                take -= (partBytes_ + take) % kPage;
            }
            if (take > 0 && sink != nullptr) {
                const int rc = sink->Write(data, take);
                if (rc < 0) {
                    return Fail(rc);
                }
            }
            begin_ += take;
            partBytes_ += take;
            if (hit != nullptr) {
                begin_ += dlen;
                partBytes_ = 0;
                return 1;
            }
        }
        const int rc = Fill();
        if (rc < 0) {
            return Fail(rc);
        }
        if (rc == 0) {
            VELA_LOG_ERR("upload refused: no delimiter \"--%.70s\" before the end of the body",
                         delimiter_.c_str() + 4);
            return Fail(VELA_UPLOAD_ERR_SYNTAX);
        }
    }
}

// After "--boundary": "--" (the close delimiter: the epilogue is read and
// the reader is at its end, 0), or transport padding and CR LF (1).
int MultipartReader::ReadDelimiterLine()
{
    int rc = Ensure(2);
    if (rc < 0) {
        return Fail(rc);
    }
    if (rc > 0 && Data()[0] == '-' && Data()[1] == '-') {
        begin_ += 2;
        return Drain();
    }
    size_t padding = 0;
    for (;;) {
        rc = Ensure(1);
        if (rc <= 0 || !IsBlank(Data()[0])) {
            break;
        }
        ++begin_;
        if (++padding > kMaxTransportPadding) {
            VELA_LOG_ERR("upload refused: more than %zu blanks after a delimiter", kMaxTransportPadding);
            return Fail(VELA_UPLOAD_ERR_SYNTAX);
        }
    }
    if (rc >= 0) {
        rc = Ensure(2);
    }
    if (rc < 0) {
        return Fail(rc);
    }
    if (rc == 0 || Data()[0] != '\r' || Data()[1] != '\n') {
        VELA_LOG_ERR("upload refused: a delimiter is followed by neither CR LF nor \"--\"%s",
                     rc == 0 ? " (the body ends there)" : "");
        return Fail(VELA_UPLOAD_ERR_SYNTAX);
    }
    begin_ += 2;
    return 1;
}

// Reads and discards the rest of the body (the epilogue). 0 at the end, or
// a negative code when the input is short.
int MultipartReader::Drain()
{
    for (;;) {
        begin_ = end_;
        const int rc = Fill();
        if (rc < 0) {
            return Fail(rc);
        }
        if (rc == 0) {
            begin_ = end_ = 0;
            state_ = kDone;
            return 0;
        }
    }
}

// One header line of a part, without its CR LF, at most
// kMaxPartHeaderLine bytes. 1, or a negative code (the reader has failed).
int MultipartReader::ReadHeaderLine(std::string& line)
{
    for (;;) {
        const size_t avail = Available();
        const size_t window = avail < kMaxPartHeaderLine + 2 ? avail : kMaxPartHeaderLine + 2;
        const char* data = Data();
        const void* crlf = memmem(data, window, "\r\n", 2);
        if (crlf == nullptr) {
            if (avail >= kMaxPartHeaderLine + 2) {
                VELA_LOG_ERR("upload refused: part header line longer than %zu bytes", kMaxPartHeaderLine);
                return Fail(VELA_UPLOAD_ERR_HEADER);
            }
            const int rc = Fill();
            if (rc < 0) {
                return Fail(rc);
            }
            if (rc == 0) {
                VELA_LOG_ERR("upload refused: the body ends inside the headers of a part");
                return Fail(VELA_UPLOAD_ERR_SYNTAX);
            }
            continue;
        }
        const size_t len = static_cast<size_t>(static_cast<const char*>(crlf) - data);
        if (len > kMaxPartHeaderLine) {
            VELA_LOG_ERR("upload refused: part header line longer than %zu bytes", kMaxPartHeaderLine);
            return Fail(VELA_UPLOAD_ERR_HEADER);
        }
        try {
            line.assign(data, len);
        } catch (const std::exception&) {
            return Fail(VELA_UPLOAD_ERR_MEMORY);
        }
        begin_ += len + 2;
        return 1;
    }
}

// Part header fields up to the empty line (RFC 7230 section 3.2 syntax,
// CR LF line ends, no obsolete folding). 1, or a negative code.
int MultipartReader::ReadHeaders(MultipartPart& part)
{
    part = MultipartPart();
    bool haveDisposition = false;
    int lines = 0;
    for (;;) {
        std::string line;
        const int rc = ReadHeaderLine(line);
        if (rc < 0) {
            return rc;
        }
        if (line.empty()) {
            break;
        }
        if (++lines > kMaxPartHeaderLines) {
            VELA_LOG_ERR("upload refused: a part has more than %d header lines", kMaxPartHeaderLines);
            return Fail(VELA_UPLOAD_ERR_HEADER);
        }
        const int taken = TakeHeaderLine(line, haveDisposition, part);
        if (taken < 0) {
            return Fail(taken);
        }
    }
    if (!haveDisposition) {
        VELA_LOG_ERR("upload refused: a part has no Content-Disposition header");
        return Fail(VELA_UPLOAD_ERR_HEADER);
    }
    return 1;
}

int MultipartReader::NextPart(MultipartPart& part)
{
    int rc;
    switch (state_) {
    case kFailed:
        return failure_;
    case kDone:
        return 0;
    case kStart: {
        // The first delimiter may open the body without the CR LF before it.
        const size_t dashLen = delimiter_.size() - 2;
        rc = Ensure(dashLen);
        if (rc < 0) {
            return Fail(rc);
        }
        if (rc > 0 && memcmp(Data(), delimiter_.data() + 2, dashLen) == 0) {
            begin_ += dashLen;
        } else if ((rc = ScanToDelimiter(nullptr)) < 0) {
            return rc;
        }
        break;
    }
    case kContent:
        if ((rc = ScanToDelimiter(nullptr)) < 0) {
            return rc;
        }
        break;
    case kAfterDelimiter:
        break;
    }
    state_ = kAfterDelimiter;
    rc = ReadDelimiterLine();
    if (rc <= 0) {
        return rc;
    }
    rc = ReadHeaders(part);
    if (rc < 0) {
        return rc;
    }
    state_ = kContent;
    return 1;
}

int MultipartReader::ReadContent(MultipartSink* sink)
{
    if (state_ == kFailed) {
        return failure_;
    }
    if (state_ != kContent) {
        return VELA_UPLOAD_ERR_STATE;
    }
    const int rc = ScanToDelimiter(sink);
    if (rc < 0) {
        return rc;
    }
    state_ = kAfterDelimiter;
    return 1;
}

}  // namespace Transfer
}  // namespace VELA
