// velascgi: the CGI program the web server runs for every web-API call.
// It works in the web-API directory, where the API descriptions and handler
// libraries are named relative to, and hands the call to one WebEntry.
//
//   velascgi            (run by the web server, with a CGI environment)
//   velascgi --help     (run by hand)
//
// A web server that runs CGI programs only under its own account (Apache's
// mod_cgid) reaches it as a set-user-id root program, reserved to the
// server's group: root:www-data, mode 4750.
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/auxv.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "webentry/Serve.h"

namespace {

const char kUsage[] =
    "usage: velascgi             (run by the web server as a CGI program)\n"
    "       velascgi --help\n"
    "  Serves one web-API call from the CGI environment (REQUEST_METHOD,\n"
    "  QUERY_STRING, CONTENT_TYPE, CONTENT_LENGTH, HTTP_COOKIE, REMOTE_ADDR, ...)\n"
    "  and standard input, and writes the CGI answer to standard output. It\n"
    "  works in <VELA_ROOT>/usr/vela/velaman/webapi and takes its settings from\n"
    "  <VELA_ROOT>/etc/vela/webapi.conf. VELA_LOG_STDERR=1 copies the log lines\n"
    "  to standard error. Installed set-user-id root (mode 4750, group of the\n"
    "  web server) it serves as root with the root \"/\" and ignores VELA_*.\n"
    "\n"
    "  -h, --help  print this text (only outside a CGI environment: with\n"
    "              GATEWAY_INTERFACE set every run serves a call)\n";

// An option given by hand: --help answers, anything else is a usage error.
int HandOption(const char* option)
{
    if (strcmp(option, "--help") == 0 || strcmp(option, "-h") == 0) {
        fputs(kUsage, stdout);
        return 0;
    }
    fprintf(stderr, "velascgi: unknown option %s\nTry 'velascgi --help' for more information.\n", option);
    return 2;
}

// Started set-user-id root: the caller chose the environment, the open
// descriptors, the signal dispositions, the mask and the limits. The library
// already reads VELA_ROOT and VELA_LOG_STDERR with secure_getenv, so the root
// is "/"; here the process becomes root wholly, as under a server that runs
// it as root, and takes back what the caller could have bent. False when any
// of it fails: nothing is served then.
bool SettleSetUidStart()
{
    if (getauxval(AT_SECURE) == 0 || geteuid() != 0) {
        return true;
    }
    // Standard input, output and error open, so that no file opened later
    // becomes one of them (and an answer lands in it).
    for (int fd = 0; fd < 3; ++fd) {
        if (fcntl(fd, F_GETFD) < 0 && errno == EBADF) {
            const int opened = open("/dev/null", fd == 0 ? O_RDONLY : O_WRONLY);
            if (opened != fd) {
                return false;
            }
        }
    }
    if (setgroups(0, nullptr) != 0 || setresgid(0, 0, 0) != 0 || setresuid(0, 0, 0) != 0) {
        return false;
    }
    // The programs it starts as root read the environment without the
    // loader's care: the caller's settings of this project go.
    std::vector<std::string> ours;
    for (char** e = environ; *e != nullptr; ++e) {
        if (strncmp(*e, "VELA_", 5) == 0) {
            ours.emplace_back(*e, strcspn(*e, "="));
        }
    }
    for (const std::string& name : ours) {
        unsetenv(name.c_str());
    }
    struct sigaction dfl {};
    dfl.sa_handler = SIG_DFL;
    for (int sig = 1; sig < NSIG; ++sig) {
        if (sig != SIGKILL && sig != SIGSTOP) {
            sigaction(sig, &dfl, nullptr);  // fails only for the C library's own
        }
    }
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    umask(022);
    // A small file-size limit would stop a write half-way with SIGXFSZ.
    const struct rlimit unlimited = {RLIM_INFINITY, RLIM_INFINITY};
    return setrlimit(RLIMIT_FSIZE, &unlimited) == 0;
}

}  // namespace

int main(int argc, char** argv)
{
    // A web server runs it without arguments, so a call costs one compare;
    // the environment is looked at only when an option was given.
    if (argc > 1 && argv[1][0] == '-' && getenv("GATEWAY_INTERFACE") == nullptr) {
        return HandOption(argv[1]);
    }
    if (!SettleSetUidStart()) {
        VELA::WriteReply(VELA::kSetupFailedReply, VELA::kSetupFailedReplyLength);
        return 1;
    }
    VELA::ServeCgiRequest(argc, argv, nullptr);
    return 0;
}
