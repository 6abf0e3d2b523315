// HTTP file output: a file as the CGI answer on standard output, with its
// content headers, single byte ranges (RFC 9110 section 14), the
// attachment disposition (RFC 6266, RFC 8187) and the web server's
// X-Sendfile (or nginx's X-Accel-Redirect) header as the fast path.
// Contracts are in vela/httpoutput.h.
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <iostream>
#include <memory>
#include <mutex>
#include <new>
#include <poll.h>
#include <string>
#include <strings.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "system/SigpipeBlock.h"
#include "vela/httpoutput.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"

namespace {

using VELA::System::ScopedFd;

const char kConfPath[] = "/etc/vela/webapi.conf";
const char kFastOutputKey[] = "xsendfile";
const char kAccelPrefixKey[] = "xaccel_prefix";
const char kEncodedKey[] = "xsendfile_encoded";
// Longest internal prefix taken from the configuration.
constexpr size_t kMaxAccelPrefix = 128;
const char kDefaultType[] = "application/octet-stream";
constexpr int kOut = STDOUT_FILENO;
// Bytes asked of one sendfile call (the kernel moves at most 0x7ffff000).
constexpr size_t kSendfileChunk = 0x40000000;
// Buffer of the read/write fallback.
constexpr size_t kCopyBuffer = 1024 * 1024;
// Longest Range header considered; anything longer is ignored.
constexpr size_t kMaxRangeHeader = 256;
// Longest file name offered to the client, in bytes.
constexpr size_t kMaxDispositionName = 255;

// ---- Fast output switch ----

// How the web server takes the fast output header.
struct FastOutputMode {
    std::string accelPrefix;  // X-Accel-Redirect's internal prefix; empty: X-Sendfile
    bool plainOnly = false;   // it does not decode the path: only paths that need no encoding
};

struct FastOutputState {
    std::mutex lock;
    bool switchedOff = false;
    bool loaded = false;
    std::string confPath;  // the file the cached answer came from
    bool configured = false;
    FastOutputMode mode;
};

FastOutputState& FastOutput()
{
    static FastOutputState* state = new FastOutputState();  // never destroyed: usable until exit
    return *state;
}

// xsendfile of /etc/vela/webapi.conf: "yes", "true", "on" or "1" (any
// case) enables; anything else, a missing key or an unreadable file leaves
// fast output off.
bool ReadFastOutputConfig()
{
    char value[16] = {};
    if (VLIBCFileGetKeyValue(kConfPath, kFastOutputKey, value, sizeof(value)) != 1) {
        return false;
    }
    return strcasecmp(value, "yes") == 0 || strcasecmp(value, "true") == 0 || strcasecmp(value, "on") == 0 ||
           strcmp(value, "1") == 0;
}

// An internal prefix nginx can take as the start of a URI as it is: "/"
// then segments of letters, digits, "-", "_" and "~" (dots allowed only
// inside a segment, so no "." or ".." segment), no empty segment, no
// trailing "/".
bool IsPlainUriPrefix(const char* prefix)
{
    const size_t len = strlen(prefix);
    if (len < 2 || prefix[0] != '/' || prefix[len - 1] == '/') {
        return false;
    }
    for (size_t i = 1; i < len; ++i) {
        const char c = prefix[i];
        const bool segmentStart = prefix[i - 1] == '/';
        const bool segmentEnd = i + 1 == len || prefix[i + 1] == '/';
        if (c == '/') {
            if (segmentStart) {
                return false;
            }
        } else if (c == '.') {
            if (segmentStart || segmentEnd) {
                return false;
            }
        } else if (!((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' ||
                     c == '_' || c == '~')) {
            return false;
        }
    }
    return true;
}

// xaccel_prefix of /etc/vela/webapi.conf: when set, fast output answers
// with "X-Accel-Redirect: <prefix><path>" (nginx, an internal location
// mapping <prefix> to "/") instead of X-Sendfile. False when the key is
// set but unusable (logged): fast output is then off altogether, since the
// web server would not take an X-Sendfile header.
bool ReadAccelPrefix(std::string& prefix)
{
    prefix.clear();
    char value[kMaxAccelPrefix + 1] = {};
    const int found = VLIBCFileGetKeyValue(kConfPath, kAccelPrefixKey, value, sizeof(value));
    if (found == 0 || (found == 1 && value[0] == '\0')) {
        return true;
    }
    if (found != 1 || !IsPlainUriPrefix(value)) {
        VELA_LOG_ERR("%s of %s is not a plain URI prefix of at most %zu bytes: fast output off", kAccelPrefixKey,
                     kConfPath, kMaxAccelPrefix);
        return false;
    }
    prefix = value;
    return true;
}

// ---- Writing to standard output ----

// Waits until a non-blocking `fd` is ready for `events` (POLLIN: has bytes
// to read, POLLOUT: takes more bytes).
bool WaitFor(int fd, short events)
{
    struct pollfd p = {fd, events, 0};
    for (;;) {
        const int n = poll(&p, 1, -1);
        if (n > 0) {
            return true;
        }
        if (n < 0 && errno != EINTR) {
            return false;
        }
    }
}

// write(2) of all `len` bytes, through short writes, EINTR and EAGAIN.
bool WriteOut(int fd, const char* data, size_t len)
{
    while (len > 0) {
        const ssize_t n = write(fd, data, len);
        if (n > 0) {
            data += n;
            len -= static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            if (!WaitFor(fd, POLLOUT)) {
                return false;
            }
            continue;
        }
        if (n == 0) {
            errno = EIO;
        }
        return false;
    }
    return true;
}

void LogWriteFailure(int err)
{
    if (err == EPIPE || err == ECONNRESET) {
        VELA_LOG(LOG_NOTICE, "client went away during a download");
    } else {
        VELA_LOG_ERR("cannot write a download: %s", strerror(err));
    }
}

// One sendfile(2) of what is left of a body: `offset` and `length` move on
// by what was sent; `useSendfile` becomes false for an output sendfile
// cannot write to (an O_APPEND file, ...). False (logged) when writing
// fails or the file ends early (it shrank).
bool SendfileStep(int out, int in, off_t& offset, uint64_t& length, bool& useSendfile)
{
    const size_t want = length < kSendfileChunk ? static_cast<size_t>(length) : kSendfileChunk;
    const ssize_t n = sendfile(out, in, &offset, want);
    if (n > 0) {
        length -= static_cast<uint64_t>(n);
        return true;
    }
    if (n == 0) {
        VELA_LOG_ERR("download cut short: the file shrank while it was sent");
        return false;
    }
    if (errno == EINTR) {
        return true;
    }
    if (errno == EAGAIN || errno == EWOULDBLOCK) {
        if (!WaitFor(out, POLLOUT)) {
            LogWriteFailure(errno);
            return false;
        }
        return true;
    }
    if (errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP) {
        useSendfile = false;
        return true;
    }
    LogWriteFailure(errno);
    return false;
}

// Sends `length` bytes of `in` from `offset` to `out`: sendfile while the
// output takes it, else pread and write through a large buffer. False when
// writing fails or the file ends early (it shrank).
bool SendBody(int out, int in, off_t offset, uint64_t length)
{
    bool useSendfile = true;
    std::unique_ptr<char[]> buffer;
    while (length > 0) {
        if (useSendfile) {
            if (!SendfileStep(out, in, offset, length, useSendfile)) {
                return false;
            }
            continue;
        }
        if (!buffer) {
            buffer.reset(new (std::nothrow) char[kCopyBuffer]);
            if (!buffer) {
                VELA_LOG_ERR("out of memory for a download");
                return false;
            }
        }
        const size_t want = length < kCopyBuffer ? static_cast<size_t>(length) : kCopyBuffer;
        const ssize_t got = pread(in, buffer.get(), want, offset);
        if (got < 0) {
            if (errno == EINTR) {
                continue;
            }
            VELA_LOG_ERR("cannot read a download: %s", strerror(errno));
            return false;
        }
        if (got == 0) {
            VELA_LOG_ERR("download cut short: the file shrank while it was sent");
            return false;
        }
        if (!WriteOut(out, buffer.get(), static_cast<size_t>(got))) {
            LogWriteFailure(errno);
            return false;
        }
        offset += got;
        length -= static_cast<uint64_t>(got);
    }
    return true;
}

// Whatever the caller printed through the C++ and C streams goes out
// before the lines written straight to the descriptor.
void FlushStreams()
{
    std::cout.flush();
    fflush(stdout);
}

// ---- Header values ----

bool HasControlByte(const std::string& text)
{
    for (unsigned char c : text) {
        if (c < 0x20 || c == 0x7f) {
            return true;
        }
    }
    return false;
}

// The caller's type, or application/octet-stream when it is empty or could
// break the header block.
std::string SafeMimeType(const std::string& mimeType)
{
    if (mimeType.empty()) {
        return kDefaultType;
    }
    if (mimeType.size() > 255 || HasControlByte(mimeType)) {
        VELA_LOG_ERR("refused MIME type with control bytes or over 255 bytes; sending %s", kDefaultType);
        return kDefaultType;
    }
    return mimeType;
}

// IMF-fixdate of RFC 9110 section 5.6.7 ("Sun, 06 Nov 1994 08:49:37 GMT"),
// independent of the locale. Empty when the time cannot be converted.
std::string HttpDate(time_t when)
{
    static const char* const kDays[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
    static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                          "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
    struct tm tm;
    if (gmtime_r(&when, &tm) == nullptr || tm.tm_year + 1900 > 9999 || tm.tm_year + 1900 < 0) {
        return std::string();
    }
    char text[40];
    snprintf(text, sizeof(text), "%s, %02d %s %04d %02d:%02d:%02d GMT", kDays[tm.tm_wday], tm.tm_mday,
             kMonths[tm.tm_mon], tm.tm_year + 1900, tm.tm_hour, tm.tm_min, tm.tm_sec);
    return text;
}

// Length of the UTF-8 sequence (RFC 3629) at `s[i]`, 0 when it is not a
// well-formed one (overlong forms, surrogates and values above U+10FFFF
// included).
size_t Utf8SequenceLength(const std::string& s, size_t i)
{
    const unsigned char c = static_cast<unsigned char>(s[i]);
    if (c < 0x80) {
        return 1;
    }
    size_t len = 0;
    unsigned long cp = 0;
    if (c >= 0xc2 && c <= 0xdf) {
        len = 2;
        cp = c & 0x1f;
    } else if (c >= 0xe0 && c <= 0xef) {
        len = 3;
        cp = c & 0x0f;
    } else if (c >= 0xf0 && c <= 0xf4) {
        len = 4;
        cp = c & 0x07;
    } else {
        return 0;
    }
    if (i + len > s.size()) {
        return 0;
    }
    for (size_t k = 1; k < len; ++k) {
        const unsigned char cc = static_cast<unsigned char>(s[i + k]);
        if ((cc & 0xc0) != 0x80) {
            return 0;
        }
        cp = (cp << 6) | (cc & 0x3f);
    }
    if ((len == 3 && cp < 0x800) || (len == 4 && (cp < 0x10000 || cp > 0x10ffff)) ||
        (cp >= 0xd800 && cp <= 0xdfff)) {
        return 0;
    }
    return len;
}

// RFC 8187 attr-char: sent as it is in an ext-value; all else is %XX.
bool IsAttrChar(unsigned char c)
{
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
           strchr("!#$&+-.^_`|~", c) != nullptr;
}

void AppendPercent(std::string& out, unsigned char c)
{
    static const char kHex[] = "0123456789ABCDEF";
    out += '%';
    out += kHex[c >> 4];
    out += kHex[c & 0x0f];
}

// "attachment; filename="<fallback>"; filename*=UTF-8''<encoded>" for the
// offered file name `name` (RFC 6266 section 4.3): control bytes, "/" and
// "\" become "_"; the quoted fallback keeps printable ASCII except the
// quote, "\" and "%" (which some clients decode) and replaces every other
// character by "_"; the extended form is sent when the name is well-formed
// UTF-8. Names are cut to 255 bytes on a character boundary. Empty when
// nothing is left to offer.
std::string DispositionValue(const std::string& name)
{
    std::string clean;
    std::string fallback;
    bool utf8 = true;
    size_t i = 0;
    while (i < name.size() && clean.size() < kMaxDispositionName) {
        const unsigned char c = static_cast<unsigned char>(name[i]);
        const size_t len = Utf8SequenceLength(name, i);
        if (len == 0) {
            utf8 = false;
            clean += '_';
            fallback += '_';
            ++i;
            continue;
        }
        if (len > 1) {
            if (clean.size() + len > kMaxDispositionName) {
                break;
            }
            clean.append(name, i, len);
            fallback += '_';
            i += len;
            continue;
        }
        const bool replace = c < 0x20 || c == 0x7f || c == '/' || c == '\\';
        clean += replace ? '_' : static_cast<char>(c);
        fallback += (replace || c == '"' || c == '%') ? '_' : static_cast<char>(c);
        ++i;
    }
    if (clean.empty()) {
        return std::string();
    }
    std::string value = "attachment; filename=\"" + fallback + "\"";
    if (utf8) {
        value += "; filename*=UTF-8''";
        for (unsigned char c : clean) {
            if (IsAttrChar(c)) {
                value += static_cast<char>(c);
            } else {
                AppendPercent(value, c);
            }
        }
    }
    return value;
}

// The canonical path for X-Sendfile or X-Accel-Redirect, percent-encoded
// (the servers that take the headers decode them; nginx would take a raw
// "?" for the start of a query) except for unreserved characters and "/".
std::string EncodeSendfilePath(const std::string& path)
{
    std::string out;
    out.reserve(path.size());
    for (unsigned char c : path) {
        if ((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
            strchr("-._~/", c) != nullptr) {
            out += static_cast<char>(c);
        } else {
            AppendPercent(out, c);
        }
    }
    return out;
}

// ---- Byte ranges (RFC 9110 section 14) ----

enum class RangeKind { kWhole, kPartial, kUnsatisfiable };

bool IsOws(char c) { return c == ' ' || c == '\t'; }

// Decimal digits of `text` from `pos`; the value saturates at UINT64_MAX
// (a position beyond any file). False when there is no digit.
bool ParseDigits(const std::string& text, size_t& pos, uint64_t& value)
{
    const size_t start = pos;
    while (pos < text.size() && text[pos] >= '0' && text[pos] <= '9') {
        ++pos;
    }
    if (pos == start) {
        return false;
    }
    // The run holds digits only: ParseDecimal refuses it only on overflow.
    long long parsed = 0;
    value = VELA::System::ParseDecimal(text.data() + start, pos - start, 0, LLONG_MAX, parsed)
                ? static_cast<uint64_t>(parsed)
                : UINT64_MAX;
    return true;
}

// The Range header `header` without the blanks around it. False when there
// is none, or when it is over-long (logged): the whole file answers then.
bool TrimmedRange(const char* header, std::string& text)
{
    if (header == nullptr) {
        return false;
    }
    const size_t headerLen = strnlen(header, kMaxRangeHeader + 1);
    if (headerLen > kMaxRangeHeader) {
        VELA_LOG(LOG_NOTICE, "Range header over %zu bytes ignored", kMaxRangeHeader);
        return false;
    }
    size_t begin = 0;
    size_t end = headerLen;
    while (begin < end && IsOws(header[begin])) {
        ++begin;
    }
    while (end > begin && IsOws(header[end - 1])) {
        --end;
    }
    text.assign(header + begin, end - begin);
    return true;
}

// The one byte range at `pos` of the Range text `text` ("a-b", "a-",
// or the suffix range "-n") against a file of `size` bytes, as ParseRange
// answers.
RangeKind ParseRangeSpec(const std::string& text, size_t pos, uint64_t size, uint64_t& first, uint64_t& last)
{
    if (pos < text.size() && text[pos] == '-') {
        ++pos;
        uint64_t suffix = 0;
        if (!ParseDigits(text, pos, suffix) || pos != text.size()) {
            VELA_LOG(LOG_NOTICE, "Range \"%s\" ignored: malformed", text.c_str());
            return RangeKind::kWhole;
        }
        if (suffix == 0 || size == 0) {
            return RangeKind::kUnsatisfiable;
        }
        first = suffix >= size ? 0 : size - suffix;
        last = size - 1;
        return RangeKind::kPartial;
    }
    uint64_t a = 0;
    if (!ParseDigits(text, pos, a) || pos >= text.size() || text[pos] != '-') {
        VELA_LOG(LOG_NOTICE, "Range \"%s\" ignored: malformed", text.c_str());
        return RangeKind::kWhole;
    }
    ++pos;
    uint64_t b = UINT64_MAX;
    if (pos < text.size() && !ParseDigits(text, pos, b)) {
        VELA_LOG(LOG_NOTICE, "Range \"%s\" ignored: malformed", text.c_str());
        return RangeKind::kWhole;
    }
    if (pos != text.size() || b < a) {
        VELA_LOG(LOG_NOTICE, "Range \"%s\" ignored: malformed", text.c_str());
        return RangeKind::kWhole;
    }
    if (a >= size) {
        return RangeKind::kUnsatisfiable;
    }
    first = a;
    last = b >= size ? size - 1 : b;
    return RangeKind::kPartial;
}

// Reads the Range header `header` against a file of `size` bytes. One
// byte range ("a-b", "a-") or suffix range ("-n") gives kPartial with
// the inclusive [first, last], or kUnsatisfiable when it selects no byte of
// the file; no header, several ranges or bad syntax give kWhole (the header
// is ignored, RFC 9110 section 14.2).
RangeKind ParseRange(const char* header, uint64_t size, uint64_t& first, uint64_t& last)
{
    std::string text;
    if (!TrimmedRange(header, text)) {
        return RangeKind::kWhole;
    }
    static const char kUnit[] = "bytes=";
    if (text.size() < sizeof(kUnit) - 1 || strncasecmp(text.c_str(), kUnit, sizeof(kUnit) - 1) != 0) {
        VELA_LOG(LOG_NOTICE, "Range \"%s\" ignored: not a byte range", text.c_str());
        return RangeKind::kWhole;
    }
    if (text.find(',') != std::string::npos) {
        return RangeKind::kWhole;  // several ranges: the whole file answers them all
    }
    size_t pos = sizeof(kUnit) - 1;
    while (pos < text.size() && IsOws(text[pos])) {
        ++pos;
    }
    return ParseRangeSpec(text, pos, size, first, last);
}

bool IsHeadRequest()
{
    const char* method = getenv("REQUEST_METHOD");
    return method != nullptr && strcmp(method, "HEAD") == 0;
}

void AddLine(std::string& block, const char* name, const std::string& value)
{
    block += name;
    block += ": ";
    block += value;
    block += "\r\n";
}

// The answer for the open regular file `fd` (status `st`): headers, then
// the whole file or the requested range.
bool SendOpenFile(int fd, const struct stat& st, const std::string& name, const std::string& mimeType,
                  bool writeDisposition, bool honourRanges)
{
    const uint64_t size = static_cast<uint64_t>(st.st_size);
    const std::string modified = HttpDate(st.st_mtime);
    const char* range = honourRanges ? getenv("HTTP_RANGE") : nullptr;
    const char* ifRange = getenv("HTTP_IF_RANGE");
    if (range != nullptr && ifRange != nullptr && (modified.empty() || modified != ifRange)) {
        range = nullptr;  // the client's copy is another version: it gets the whole file
    }
    uint64_t first = 0;
    uint64_t last = size == 0 ? 0 : size - 1;
    const RangeKind kind = ParseRange(range, size, first, last);

    std::string block;
    if (kind == RangeKind::kUnsatisfiable) {
        AddLine(block, "Status", "416 Range Not Satisfiable");
        AddLine(block, "Content-Range", "bytes */" + std::to_string(size));
        AddLine(block, "Accept-Ranges", "bytes");
        AddLine(block, "Content-Length", "0");
        AddLine(block, "X-Content-Type-Options", "nosniff");
        block += "\r\n";
    } else {
        const uint64_t length = size == 0 ? 0 : last - first + 1;
        if (kind == RangeKind::kPartial) {
            AddLine(block, "Status", "206 Partial Content");
            AddLine(block, "Content-Range",
                    "bytes " + std::to_string(first) + "-" + std::to_string(last) + "/" + std::to_string(size));
        }
        AddLine(block, "Content-Type", SafeMimeType(mimeType));
        const std::string disposition = writeDisposition ? DispositionValue(name) : std::string();
        if (!disposition.empty()) {
            AddLine(block, "Content-Disposition", disposition);
        }
        if (!modified.empty()) {
            AddLine(block, "Last-Modified", modified);
        }
        if (honourRanges) {
            AddLine(block, "Accept-Ranges", "bytes");
        }
        AddLine(block, "Content-Length", std::to_string(length));
        AddLine(block, "X-Content-Type-Options", "nosniff");
        block += "\r\n";
    }

    FlushStreams();
    VELA::System::SigpipeBlock noSigpipe;
    if (!WriteOut(kOut, block.data(), block.size())) {
        LogWriteFailure(errno);
        return false;
    }
    if (kind == RangeKind::kUnsatisfiable || IsHeadRequest() || size == 0) {
        return true;
    }
    return SendBody(kOut, fd, static_cast<off_t>(first), last - first + 1);
}

// ---- Streams that are not regular files ----

// The descriptor in non-blocking mode for its scope, so that a read gives
// what has arrived instead of waiting for a whole buffer; the flags are put
// back afterwards.
class NonBlockingScope {
public:
    explicit NonBlockingScope(int fd) : fd_(fd), flags_(fcntl(fd, F_GETFL))
    {
        changed_ = flags_ >= 0 && (flags_ & O_NONBLOCK) == 0 && fcntl(fd_, F_SETFL, flags_ | O_NONBLOCK) == 0;
    }
    ~NonBlockingScope()
    {
        if (changed_) {
            const int saved = errno;
            fcntl(fd_, F_SETFL, flags_);
            errno = saved;
        }
    }
    NonBlockingScope(const NonBlockingScope&) = delete;
    NonBlockingScope& operator=(const NonBlockingScope&) = delete;

private:
    int fd_;
    int flags_;
    bool changed_ = false;
};

// The rest of `file`, a readable stream that is not a regular file (a
// pipe, a socket, a device): its length is unknown, so no Content-Length
// and no ranges; the content is read through the stream itself, so what
// its buffer already holds goes out first, and sent as it arrives.
bool SendStream(FILE* file, const struct stat& st, const std::string& name, const std::string& mimeType,
                bool writeDisposition)
{
    const int fd = fileno(file);
    const int mode = fcntl(fd, F_GETFL);
    if (S_ISDIR(st.st_mode) || mode < 0 || (mode & O_ACCMODE) == O_WRONLY) {
        VELA_LOG_ERR("refused to send a stream that cannot be read");
        return false;
    }
    std::unique_ptr<char[]> buffer(new (std::nothrow) char[kCopyBuffer]);
    if (!buffer) {
        VELA_LOG_ERR("out of memory for a download");
        return false;
    }
    std::string block;
    AddLine(block, "Content-Type", SafeMimeType(mimeType));
    const std::string disposition = writeDisposition ? DispositionValue(name) : std::string();
    if (!disposition.empty()) {
        AddLine(block, "Content-Disposition", disposition);
    }
    AddLine(block, "Accept-Ranges", "none");
    AddLine(block, "X-Content-Type-Options", "nosniff");
    block += "\r\n";

    FlushStreams();
    VELA::System::SigpipeBlock noSigpipe;
    if (!WriteOut(kOut, block.data(), block.size())) {
        LogWriteFailure(errno);
        return false;
    }
    if (IsHeadRequest()) {
        return true;
    }
    NonBlockingScope nonBlocking(fd);
    for (;;) {
        errno = 0;
        const size_t got = fread(buffer.get(), 1, kCopyBuffer, file);
        if (got > 0 && !WriteOut(kOut, buffer.get(), got)) {
            LogWriteFailure(errno);
            return false;
        }
        if (feof(file)) {
            return true;
        }
        if (!ferror(file)) {
            continue;
        }
        const int err = errno;
        if (err == EINTR || ((err == EAGAIN || err == EWOULDBLOCK) && WaitFor(fd, POLLIN))) {
            clearerr(file);
            continue;
        }
        VELA_LOG_ERR("cannot read the stream of a download: %s", strerror(err));
        return false;
    }
}

// ---- Fast output: which paths the web server may be given ----

// An entry nobody less privileged than the web server can change: owned by
// root or by the web server's own account (the real user id: the
// dispatcher switches only the effective one), and writable neither by its
// group nor by others.
bool ServerOnlyWritable(const struct stat& st, uid_t server, const char*& why)
{
    if (st.st_uid != 0 && st.st_uid != server) {
        why = "owned by another account";
        return false;
    }
    if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        why = "writable by its group or by others";
        return false;
    }
    return true;
}

// The path the web server would open for the open file `fd` (status `st`),
// when it still leads to that file and no one less privileged than the web
// server can change what it leads to: the path the kernel keeps for the
// descriptor (/proc/self/fd), then every directory from "/" down, each
// opened without following links relative to the one before, and the file
// itself must pass ServerOnlyWritable. False, with `why`, otherwise.
bool ServerMayOpen(int fd, const struct stat& st, std::string& canonical, const char*& why)
{
    char link[32];
    snprintf(link, sizeof(link), "/proc/self/fd/%d", fd);
    std::unique_ptr<char[]> buf(new char[PATH_MAX]);
    const ssize_t n = readlink(link, buf.get(), PATH_MAX);
    if (n <= 0 || n >= PATH_MAX || buf[0] != '/') {
        why = "its path is unknown";
        return false;
    }
    canonical.assign(buf.get(), static_cast<size_t>(n));
    if (HasControlByte(canonical)) {
        canonical.clear();  // not for the log either
        why = "its path holds control bytes";
        return false;
    }
    const uid_t server = getuid();
    ScopedFd dir(open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    struct stat entry;
    if (dir.Get() < 0 || fstat(dir.Get(), &entry) != 0) {
        why = "\"/\" cannot be examined";
        return false;
    }
    if (!ServerOnlyWritable(entry, server, why)) {
        return false;
    }
    size_t pos = 1;
    for (;;) {
        const size_t slash = canonical.find('/', pos);
        const std::string name = canonical.substr(pos, slash == std::string::npos ? std::string::npos : slash - pos);
        if (slash == std::string::npos) {
            if (fstatat(dir.Get(), name.c_str(), &entry, AT_SYMLINK_NOFOLLOW) != 0 || entry.st_dev != st.st_dev ||
                entry.st_ino != st.st_ino) {
                why = "its path no longer leads to it";
                return false;
            }
            return ServerOnlyWritable(st, server, why);
        }
        dir.Reset(openat(dir.Get(), name.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (dir.Get() < 0 || fstat(dir.Get(), &entry) != 0) {
            why = "its path no longer leads to it";
            return false;
        }
        if (!ServerOnlyWritable(entry, server, why)) {
            return false;
        }
        pos = slash + 1;
    }
}

// Fast output: the web server sends the file whose canonical path,
// percent-encoded, is `encoded` (X-Sendfile, or X-Accel-Redirect to the
// internal prefix `accelPrefix` when set).
bool SendByServer(const std::string& encoded, const std::string& name, const std::string& mimeType,
                  bool writeDisposition, const std::string& accelPrefix)
{
    std::string block;
    AddLine(block, "Content-Type", SafeMimeType(mimeType));
    const std::string disposition = writeDisposition ? DispositionValue(name) : "";
    if (!disposition.empty()) {
        AddLine(block, "Content-Disposition", disposition);
    }
    AddLine(block, "X-Content-Type-Options", "nosniff");
    if (accelPrefix.empty()) {
        AddLine(block, "X-Sendfile", encoded);
    } else {
        AddLine(block, "X-Accel-Redirect", accelPrefix + encoded);
    }
    block += "\r\n";
    FlushStreams();
    VELA::System::SigpipeBlock noSigpipe;
    if (!WriteOut(kOut, block.data(), block.size())) {
        LogWriteFailure(errno);
        return false;
    }
    return true;
}

// The readable regular file `fd`: status in `st`; false (logged, `what`
// names it) otherwise.
bool CheckReadableRegular(int fd, struct stat& st, const char* what)
{
    if (fd < 0 || fstat(fd, &st) != 0) {
        VELA_LOG_ERR("cannot stat %s for a download: %m", what);
        return false;
    }
    if (!S_ISREG(st.st_mode)) {
        VELA_LOG_ERR("refused to send %s: not a regular file", what);
        return false;
    }
    const int mode = fcntl(fd, F_GETFL);
    if (mode < 0 || (mode & O_ACCMODE) == O_WRONLY || (mode & O_PATH) != 0) {
        VELA_LOG_ERR("refused to send %s: not open for reading", what);
        return false;
    }
    return true;
}

// Whether fast output is on (configured and not switched off), with how
// the web server takes it in `mode`. The configuration is read again when
// the system root changed.
bool FastOutputOn(FastOutputMode& mode)
{
    try {
        FastOutputState& state = FastOutput();
        std::lock_guard<std::mutex> guard(state.lock);
        if (state.switchedOff) {
            return false;
        }
        const std::string path = VELA::System::Path(kConfPath);
        if (!state.loaded || path != state.confPath) {
            state.configured = ReadFastOutputConfig();
            if (state.configured && !ReadAccelPrefix(state.mode.accelPrefix)) {
                state.configured = false;
            }
            // xsendfile_encoded="no": the server takes the header's path as
            // it is (mod_xsendfile before 1.0).
            state.mode.plainOnly = VLIBCFileCheckKeyValue(kConfPath, kEncodedKey, "no", VLIBC_KV_NOCASE) == 1;
            state.confPath = path;
            state.loaded = true;
        }
        if (state.configured) {
            mode = state.mode;
        }
        return state.configured;
    } catch (const std::exception&) {
        return false;
    }
}

}  // namespace

HTTPFileOutputer::HTTPFileOutputer() : writeDisposition_(true), honourRanges_(true), followSymlinks_(false) {}

void HTTPFileOutputer::SetWriteDisposition(bool write) { writeDisposition_ = write; }

void HTTPFileOutputer::SetRangesEnabled(bool enabled) { honourRanges_ = enabled; }

void HTTPFileOutputer::SetFollowSymlinks(bool follow) { followSymlinks_ = follow; }

int HTTPFileOutputer::OpenForOutput(const std::string& path, bool followSymlinks)
{
    try {
        if (path.empty() || path.size() >= PATH_MAX || path.find('\0') != std::string::npos) {
            errno = path.size() >= PATH_MAX ? ENAMETOOLONG : EINVAL;
            return -1;
        }
        // O_NONBLOCK: opening a FIFO must not wait; it is refused below.
        const int flags = O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK;
        ScopedFd fd(followSymlinks ? open(path.c_str(), flags) : VELA::System::OpenNoSymlinks(path, flags));
        struct stat st;
        if (fd.Get() < 0 || fstat(fd.Get(), &st) != 0) {
            return -1;
        }
        if (!S_ISREG(st.st_mode)) {
            errno = EINVAL;
            return -1;
        }
        return fd.Release();
    } catch (const std::exception&) {
        errno = ENOMEM;
        return -1;
    }
}

bool HTTPFileOutputer::Output(const std::string& path, const std::string& mimeType)
{
    try {
        ScopedFd fd(OpenForOutput(path, followSymlinks_));
        if (fd.Get() < 0) {
            if (errno == ELOOP) {
                VELA_LOG_ERR("refused to send %s: a symbolic link is on its path", path.c_str());
            } else if (errno == EINVAL) {
                VELA_LOG_ERR("refused to send %s: empty, holding NUL or not a regular file", path.c_str());
            } else {
                VELA_LOG_ERR("cannot open %s for a download: %m", path.c_str());
            }
            return false;
        }
        return SendDescriptor(fd.Get(), VELA::System::BaseName(path), mimeType, true);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory while sending %s", path.c_str());
        return false;
    }
}

bool HTTPFileOutputer::Output(int fd, const std::string& name, const std::string& mimeType)
{
    return SendDescriptor(fd, name, mimeType, true);
}

bool HTTPFileOutputer::Output(FILE* file, const std::string& name, const std::string& mimeType)
{
    if (file == nullptr) {
        VELA_LOG_ERR("refused download: no file");
        return false;
    }
    struct stat st;
    if (fstat(fileno(file), &st) == 0 && !S_ISREG(st.st_mode)) {
        try {
            return SendStream(file, st, name, mimeType, writeDisposition_);
        } catch (const std::exception&) {
            VELA_LOG_ERR("out of memory while sending a stream");
            return false;
        }
    }
    if (fflush(file) != 0) {
        VELA_LOG_ERR("cannot flush the file of a download: %m");
        return false;
    }
    return SendDescriptor(fileno(file), name, mimeType, false);
}

bool HTTPFileOutputer::SendDescriptor(int fd, const std::string& name, const std::string& mimeType,
                                      bool serverMayOpen)
{
    try {
        struct stat st;
        if (!CheckReadableRegular(fd, st, "the file of a download")) {
            return false;
        }
        FastOutputMode mode;
        if (serverMayOpen && FastOutputOn(mode)) {
            std::string canonical;
            const char* why = "";
            if (ServerMayOpen(fd, st, canonical, why)) {
                const std::string encoded = EncodeSendfilePath(canonical);
                if (!mode.plainOnly || encoded == canonical) {
                    return SendByServer(encoded, name, mimeType, writeDisposition_, mode.accelPrefix);
                }
                why = "the web server takes no percent-encoded path";
            }
            VELA_LOG(LOG_INFO, "X-Sendfile not used for %s: %s; the file is sent directly",
                     canonical.empty() ? name.c_str() : canonical.c_str(), why);
        }
        return SendOpenFile(fd, st, name, mimeType, writeDisposition_, honourRanges_);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory while sending a file");
        return false;
    }
}

namespace VELA {
namespace HTTP {

void FileOutputerHelper::SetFastOutputEnabled(bool enabled)
{
    FastOutputState& state = FastOutput();
    std::lock_guard<std::mutex> guard(state.lock);
    state.switchedOff = !enabled;
}

bool FileOutputerHelper::IsFastOutputEnabled()
{
    FastOutputMode mode;
    return FastOutputOn(mode);
}

}  // namespace HTTP
}  // namespace VELA
