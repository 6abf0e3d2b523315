// The audit trail (vela/audit.h): one JSON line per event, to syslog
// (LOG_AUTHPRIV) and appended to <root>/var/log/vela/audit.log.
#include "vela/audit.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <json/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/vlibc.h"
#include "webapi/APIUtils.h"

namespace VELA {
namespace Audit {

const char kLogin[] = "login";
const char kLoginFailed[] = "login-failed";
const char kLoginBlocked[] = "login-blocked";
const char kLogout[] = "logout";
const char kSessionCreate[] = "session-create";
const char kSessionRevoke[] = "session-revoke";
const char kTokenCreate[] = "token-create";
const char kTokenRevoke[] = "token-revoke";
const char kCall[] = "call";

namespace {

const char kLogDir[] = "/var/log/vela";
const char kLogFile[] = "/var/log/vela/audit.log";
constexpr mode_t kDirMode = 0750;
constexpr mode_t kFileMode = 0640;

// Bounds of each text before it is escaped (a user name's own bound is 255
// bytes; the longest address text, IPv6 with a zone, is well below 64).
constexpr size_t kMaxName = 255;
constexpr size_t kMaxAddress = 64;
constexpr size_t kMaxApi = 128;
constexpr size_t kMaxEvent = 32;
constexpr size_t kMaxTokenId = 64;

CallSource g_source;

// The first bytes of `text`, at most `max`, not cutting a UTF-8 sequence
// (a cut falls before the continuation bytes of a character). `cut` is set
// when anything was dropped.
std::string Cut(const std::string& text, size_t max, bool& cut)
{
    if (text.size() <= max) {
        return text;
    }
    size_t n = max;
    while (n > 0 && (static_cast<unsigned char>(text[n]) & 0xC0) == 0x80) {
        --n;
    }
    cut = true;
    return text.substr(0, n);
}

std::string IsoTime(long long epoch)
{
    const time_t t = static_cast<time_t>(epoch);
    struct tm tm;
    char buf[32];
    if (gmtime_r(&t, &tm) == nullptr || strftime(buf, sizeof(buf), "%Y-%m-%dT%H:%M:%SZ", &tm) == 0) {
        return "";
    }
    return buf;
}

// Compact JSON in ASCII only: JsonCpp escapes quotes, backslashes, control
// bytes and every non-ASCII character (invalid UTF-8 becomes U+FFFD); DEL,
// which it leaves as it is, is escaped here.
std::string Compact(const Json::Value& value)
{
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = false;
    const std::string text = Json::writeString(builder, value);
    std::string out;
    out.reserve(text.size());
    for (char c : text) {
        if (c == '\x7f') {
            out += "\\u007f";
        } else {
            out += c;
        }
    }
    return out;
}

// The account of the real user id ("" when it has none).
std::string RealUserName()
{
    std::string name;
    gid_t gid = 0;
    if (VELA::System::LookupUserByUID(getuid(), name, gid) != 1) {
        return "";
    }
    return name;
}

// `event` with what the caller left empty taken from the call being served.
Event Complete(const Event& event)
{
    Event e = event;
    if (e.name == nullptr) {
        e.name = "";
    }
    const bool needCall = e.actor.empty() || e.address.empty() || e.api.empty() || e.method.empty();
    if (needCall && g_source.fn != nullptr) {
        CallFacts facts;
        g_source.fn(g_source.arg, facts);
        if (e.actor.empty()) {
            e.actor = facts.actor;
        }
        if (e.address.empty()) {
            e.address = facts.address;
        }
        if (e.api.empty()) {
            e.api = facts.api;
        }
        if (e.method.empty()) {
            e.method = facts.method;
        }
    } else if (e.actor.empty() && g_source.fn == nullptr) {
        e.actor = RealUserName();
    }
    if (e.actor == e.user) {
        e.actor.clear();
    }
    return e;
}

std::string Line(const Event& e, long long epoch)
{
    // Every text with its bound; halved, longest first, until the line fits.
    struct Field {
        const char* key;
        const std::string* text;
        size_t max;
    };
    const std::string name(e.name);
    Field fields[] = {
        {"event", &name, kMaxEvent},
        {"user", &e.user, kMaxName},
        {"actor", &e.actor, kMaxName},
        {"address", &e.address, kMaxAddress},
        {"api", &e.api, kMaxApi},
        {"method", &e.method, kMaxApi},
        {"tokenId", &e.tokenId, kMaxTokenId},
    };
    for (;;) {
        bool cut = false;
        Json::Value v(Json::objectValue);
        for (const Field& f : fields) {
            if (f.text == &e.tokenId && e.tokenId.empty()) {
                continue;
            }
            v[f.key] = Cut(*f.text, f.max, cut);
        }
        v["result"] = e.result;
        v["epoch"] = static_cast<Json::Int64>(epoch);
        v["time"] = IsoTime(epoch);
        if (cut) {
            v["truncated"] = true;
        }
        std::string line = Compact(v);
        if (line.size() <= kMaxLine) {
            return line;
        }
        Field* longest = &fields[0];
        for (Field& f : fields) {
            if (std::min(f.text->size(), f.max) > std::min(longest->text->size(), longest->max)) {
                longest = &f;
            }
        }
        const size_t now = std::min(longest->text->size(), longest->max);
        if (now == 0) {
            return line.substr(0, kMaxLine);  // cannot happen: the fixed part is far below the bound
        }
        longest->max = now / 2;
    }
}

// True when the process gave up root for another identity that it can
// take back (the saved user id is 0).
bool SwitchedIdentity()
{
    uid_t r = 0;
    uid_t e = 0;
    uid_t s = 0;
    return getresuid(&r, &e, &s) == 0 && (e != 0 || getegid() != 0) && (r == 0 || s == 0);
}

// Makes <root>/var/log/vela (0750) when it is missing.
bool EnsureDir(const std::string& dir)
{
    struct stat st;
    if (lstat(dir.c_str(), &st) == 0) {
        return S_ISDIR(st.st_mode);
    }
    if (!VELA::System::MakeDirs(VELA::System::DirName(dir), 0755)) {
        return false;
    }
    if (mkdir(dir.c_str(), kDirMode) != 0 && errno != EEXIST) {
        VELA_LOG_ERR("audit: mkdir(%s): %m", dir.c_str());
        return false;
    }
    if (chmod(dir.c_str(), kDirMode) != 0) {  // whatever the umask was
        VELA_LOG_ERR("audit: chmod(%s): %m", dir.c_str());
    }
    return true;
}

// Appends `line` to audit.log with one write(2). The file is opened anew
// each time, never through a symbolic link, never blocking on a FIFO.
void Append(const std::string& line)
{
    const std::string path = VELA::System::Path(kLogFile);
    if (!EnsureDir(VELA::System::Path(kLogDir))) {
        VELA_LOG_ERR("audit: %s is not a directory, event not written", VELA::System::Path(kLogDir).c_str());
        return;
    }
    VELA::System::ScopedFd fd(
        open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK | O_NOCTTY, kFileMode));
    if (fd.Get() < 0) {
        VELA_LOG_ERR("audit: open(%s): %m", path.c_str());
        return;
    }
    struct stat st;
    if (fstat(fd.Get(), &st) != 0 || !S_ISREG(st.st_mode)) {
        VELA_LOG_ERR("audit: %s is not a regular file, event not written", path.c_str());
        return;
    }
    if ((st.st_mode & 07777) != kFileMode && fchmod(fd.Get(), kFileMode) != 0) {
        VELA_LOG_ERR("audit: chmod(%s): %m", path.c_str());
    }
    const std::string text = line + "\n";
    const ssize_t n = write(fd.Get(), text.data(), text.size());
    if (n != static_cast<ssize_t>(text.size())) {
        VELA_LOG_ERR("audit: write(%s): %s", path.c_str(), n < 0 ? strerror(errno) : "short write");
    }
}

}  // namespace

std::string FormatLine(const Event& event, long long epoch) { return Line(Complete(event), epoch); }

void Record(const Event& event)
{
    try {
        const int saved = errno;
        const std::string line = FormatLine(event, static_cast<long long>(time(nullptr)));
        VELA::System::Log(LOG_AUTHPRIV | LOG_NOTICE, "audit: %s", line.c_str());
        if (SwitchedIdentity()) {
            VELA::RunAsRootGuard guard(__FILE__, __LINE__, "IF_RUN_AS");
            if (guard.Ok()) {
                Append(line);
            }
        } else {
            Append(line);
        }
        errno = saved;
    } catch (const std::exception&) {
        VELA_LOG_ERR("audit: out of memory, event not written");
    }
}

CallSource SetCallSource(CallSource source)
{
    const CallSource old = g_source;
    g_source = source;
    return old;
}

}  // namespace Audit
}  // namespace VELA
