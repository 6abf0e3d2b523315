// Web-server control: the graceful restart of the configured server by a
// signal to the pid in its pid file. Contracts are in vela/webserver.h.
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstring>
#include <string>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "vela/webserver.h"

namespace {

using VELA::System::ReadFileBounded;
using VELA::System::ScopedFd;

const char kConfPath[] = "/etc/vela/webapi.conf";
const char kDefaultName[] = "lighttpd";
const char kDefaultPidFile[] = "/run/lighttpd.pid";
const char kDefaultSignal[] = "USR1";
// The kernel keeps 15 bytes of a process name (TASK_COMM_LEN - 1).
constexpr size_t kMaxName = 15;
constexpr size_t kMaxPidFile = 32;
constexpr size_t kMaxComm = 64;

struct SignalName {
    const char* name;
    int number;
};
const SignalName kSignals[] = {{"HUP", SIGHUP}, {"USR1", SIGUSR1}, {"USR2", SIGUSR2}};

const char* SignalText(int number)
{
    for (const SignalName& s : kSignals) {
        if (s.number == number) {
            return s.name;
        }
    }
    return "?";
}

bool ValidName(const std::string& name)
{
    return VELA::System::IsCheckedName(name, VELA::System::kNameDotted, kMaxName);
}

// An absolute path without "." or ".." components.
bool ValidPidFilePath(const std::string& path)
{
    if (path.size() < 2 || path[0] != '/' || path.size() >= PATH_MAX) {
        return false;
    }
    size_t start = 1;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) {
            end = path.size();
        }
        const std::string part = path.substr(start, end - start);
        if (part == "." || part == "..") {
            return false;
        }
        start = end + 1;
    }
    return true;
}

// The value of `key` in the configuration, or `fallback` when the key or
// the file is missing. False when the file cannot be read or is corrupt.
bool ConfValue(const char* key, const char* fallback, std::string& value)
{
    char buf[PATH_MAX];
    const int rc = VLIBCFileGetKeyValue(kConfPath, key, buf, sizeof(buf));
    if (rc < 0) {
        VELA_LOG_ERR("web server: cannot read %s from %s", key, kConfPath);
        return false;
    }
    value = rc == 1 ? buf : fallback;
    return true;
}

// The pid written in a pid file: decimal digits, optionally followed by
// blanks and a line end; above 1 (never init) and within pid_t.
bool ParsePid(const std::string& text, pid_t& pid)
{
    size_t end = text.size();
    while (end > 0 && (text[end - 1] == '\n' || text[end - 1] == '\r' || text[end - 1] == ' ' ||
                       text[end - 1] == '\t')) {
        --end;
    }
    long long value = 0;
    if (!VELA::System::ParseDecimal(text.data(), end, 2, INT_MAX, value)) {
        return false;
    }
    pid = static_cast<pid_t>(value);
    return true;
}

// The pid in the pid file `pidFile`: a regular file, not a symbolic link,
// owned by root or by this process's user and writable by nobody else.
// False (logged) otherwise.
bool ReadServerPid(const std::string& pidFile, pid_t& pid)
{
    std::string text;
    int err = 0;
    struct stat st;
    if (!ReadFileBounded(pidFile, kMaxPidFile, text, err, VELA::System::kReadNoFollow, &st)) {
        VELA_LOG_ERR("web server not restarted: cannot read pid file %s: %s", pidFile.c_str(), strerror(err));
        return false;
    }
    if ((st.st_uid != 0 && st.st_uid != geteuid()) || (st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        VELA_LOG_ERR("web server not restarted: pid file %s is writable by others or has a foreign owner",
                     pidFile.c_str());
        return false;
    }
    if (!ParsePid(text, pid)) {
        VELA_LOG_ERR("web server not restarted: pid file %s does not hold a process id", pidFile.c_str());
        return false;
    }
    return true;
}

// True when process `pid` (named in `pidFile`) exists and the kernel shows
// it under `name`; false (logged) otherwise.
bool CarriesName(pid_t pid, const std::string& name, const std::string& pidFile)
{
    std::string comm;
    int err = 0;
    const std::string commPath = "/proc/" + std::to_string(pid) + "/comm";
    if (!ReadFileBounded(commPath, kMaxComm, comm, err)) {
        VELA_LOG_ERR("web server not restarted: no process %d (%s)", static_cast<int>(pid), strerror(err));
        return false;
    }
    if (!comm.empty() && comm.back() == '\n') {
        comm.pop_back();
    }
    if (comm != name) {
        VELA_LOG_ERR("web server not restarted: process %d named in %s is \"%.16s\", not %s",
                     static_cast<int>(pid), pidFile.c_str(), comm.c_str(), name.c_str());
        return false;
    }
    return true;
}

}  // namespace

namespace velaw3 {

Engine::Engine() : valid_(false), restartSignal_(SIGUSR1)
{
    try {
        std::string name;
        std::string pidFile;
        std::string signal;
        if (!ConfValue("httpd_name", kDefaultName, name) || !ConfValue("httpd_pidfile", kDefaultPidFile, pidFile) ||
            !ConfValue("httpd_restart_signal", kDefaultSignal, signal)) {
            return;
        }
        if (!ValidName(name)) {
            VELA_LOG_ERR("web server: httpd_name \"%s\" is not a process name", name.c_str());
            return;
        }
        if (!ValidPidFilePath(pidFile)) {
            VELA_LOG_ERR("web server: httpd_pidfile \"%s\" is not an absolute path", pidFile.c_str());
            return;
        }
        const char* bare = strncmp(signal.c_str(), "SIG", 3) == 0 ? signal.c_str() + 3 : signal.c_str();
        int number = 0;
        for (const SignalName& s : kSignals) {
            if (strcmp(bare, s.name) == 0) {
                number = s.number;
            }
        }
        if (number == 0) {
            VELA_LOG_ERR("web server: httpd_restart_signal \"%s\" is not HUP, USR1 or USR2", signal.c_str());
            return;
        }
        name_ = name;
        pidFile_ = VELA::System::Path(pidFile);
        restartSignal_ = number;
        valid_ = true;
    } catch (const std::exception&) {
        VELA_LOG_ERR("web server: out of memory reading the configuration");
        valid_ = false;
    }
}

TARN::TARN(Engine& engine) : engine_(engine) {}

bool TARN::RestartService()
{
    try {
        if (!engine_.IsValid()) {
            VELA_LOG_ERR("web server not restarted: its configuration is not usable");
            return false;
        }
        const std::string& pidFile = engine_.GetPidFile();
        pid_t pid = 0;
        if (!ReadServerPid(pidFile, pid)) {
            return false;
        }
        // The pidfd pins the process: if it exits and its pid is reused
        // after the name check, the signal fails instead of reaching the
        // newcomer.
        ScopedFd pidfd(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
        if (pidfd.Get() < 0 && errno != ENOSYS) {
            VELA_LOG_ERR("web server not restarted: process %d of %s: %m", static_cast<int>(pid), pidFile.c_str());
            return false;
        }
        if (!CarriesName(pid, engine_.GetName(), pidFile)) {
            return false;
        }
        const int sig = engine_.GetRestartSignal();
        const long rc = pidfd.Get() >= 0 ? syscall(SYS_pidfd_send_signal, pidfd.Get(), sig, nullptr, 0)
                                         : static_cast<long>(kill(pid, sig));
        if (rc != 0) {
            VELA_LOG_ERR("web server not restarted: SIG%s to %d: %m", SignalText(sig), static_cast<int>(pid));
            return false;
        }
        VELA_LOG(LOG_INFO, "web server %s (pid %d) sent SIG%s to restart", engine_.GetName().c_str(),
                 static_cast<int>(pid), SignalText(sig));
        return true;
    } catch (const std::exception&) {
        VELA_LOG_ERR("web server not restarted: out of memory");
        return false;
    }
}

}  // namespace velaw3
