#include "dispatcher/APIRunnerPrivate.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

namespace VELA {

namespace {

const char kCgiName[] = "velascgi";

// The first word of the command line (up to the first NUL or blank), cut
// to its last path component; "" when /proc is not readable.
std::string CommandName()
{
    const int fd = open("/proc/self/cmdline", O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return "";
    }
    char buf[4096];
    ssize_t n;
    do {
        n = read(fd, buf, sizeof(buf) - 1);
    } while (n < 0 && errno == EINTR);
    close(fd);
    if (n <= 0) {
        return "";
    }
    buf[n] = '\0';
    std::string first(buf, strnlen(buf, static_cast<size_t>(n)));
    const size_t blank = first.find(' ');
    if (blank != std::string::npos) {
        first.resize(blank);
    }
    const size_t slash = first.rfind('/');
    return slash == std::string::npos ? first : first.substr(slash + 1);
}

}  // namespace

APIRunnerPrivate::APIRunnerPrivate(APIRunner* owner) : owner_(owner)
{
    procName_ = program_invocation_short_name ? program_invocation_short_name : "";
    origProcName_ = procName_;
    const std::string name = CommandName();
    if (!name.empty()) {
        procName_ = name;
        origProcName_ = name;
    }
}

void APIRunnerPrivate::SetArgs(int argc, char** argv)
{
    if (argc < 1 || argv == nullptr || argv[0] == nullptr) {
        return;
    }
    if (origProcName_.find("velascgi_") != std::string::npos) {
        procName_ = kCgiName;
    }
    argv0_ = argv[0];
    argv0Len_ = strlen(argv0_);
    shown_ = kCgiName;
    memset(argv0_, 0, argv0Len_);
    memcpy(argv0_, kCgiName, std::min(argv0Len_, sizeof(kCgiName) - 1));
}

void APIRunnerPrivate::SetArgv0(const char* name)
{
    if (argv0_ == nullptr || name == nullptr) {
        return;
    }
    memset(argv0_, 0, argv0Len_);
    // The byte after the area is argv[0]'s own terminator.
    snprintf(argv0_, argv0Len_ + 1, "%s", name);
    shown_ = name;
}

bool APIRunnerPrivate::ShowsName(const char* name) const { return argv0_ == nullptr || shown_ == name; }

bool APIRunnerPrivate::CheckName(const std::string& api, APIName& out)
{
    if (!api.empty() && api == lastChecked_.Text()) {
        out = lastChecked_;
        return true;
    }
    if (!APIName::Check(api, out)) {
        return false;
    }
    lastChecked_ = out;
    return true;
}

}  // namespace VELA
