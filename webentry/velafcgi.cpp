// velafcgi: the web API as a FastCGI server, for web servers that speak
// FastCGI (lighttpd's mod_fastcgi, nginx's fastcgi_pass, Apache's
// mod_proxy_fcgi). The master process listens and keeps the warm parents
// running; each parent forks one child per request (see Fcgi.h).
//
//   velafcgi [--socket PATH [--socket-mode MODE] [--socket-group GROUP]]
//            [--tcp 127.0.0.1:PORT] [--parents N] [--max-children N]
//            [--param-seconds N] [--stderr FILE] [--keep-env NAME]...
//   velafcgi --help
//
// The numbers default to fcgi_parents, fcgi_max_children and
// fcgi_param_seconds of /etc/vela/webapi.conf, else one parent per core, 64
// children and 10 seconds.
// Without --socket or --tcp the listening socket is standard input, as a
// web server that starts FastCGI programs itself hands it over.
#include <arpa/inet.h>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <grp.h>
#include <netinet/in.h>
#include <string>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include <fcgiapp.h>

#include "vela/log.h"
#include "vela/vlibc.h"
#include "webentry/Fcgi.h"
#include "webentry/RequestLimits.h"

namespace {

volatile sig_atomic_t g_stop = 0;
void OnStop(int) { g_stop = 1; }
void OnChild(int) {}

const char kUsage[] =
    "usage: velafcgi [--socket PATH [--socket-mode MODE] [--socket-group GROUP]] [--tcp ADDRESS:PORT]\n"
    "                [--parents N] [--max-children N] [--param-seconds N] [--stderr FILE]\n"
    "                [--keep-env NAME]...\n"
    "       velafcgi --help\n"
    "  Serves the web API over FastCGI. Without --socket or --tcp the listening\n"
    "  socket is standard input, as a web server that starts FastCGI programs\n"
    "  hands it over.\n"
    "\n"
    "  --socket PATH         listen on the Unix socket PATH (absolute)\n"
    "  --socket-mode MODE    its mode, octal, nothing for others (default 0660)\n"
    "  --socket-group GROUP  its group (the web server's)\n"
    "  --tcp ADDRESS:PORT    listen on TCP, 127.0.0.1:PORT or [::1]:PORT only\n"
    "  --parents N           warm parents, 1 to 64 (default fcgi_parents of\n"
    "                        /etc/vela/webapi.conf, else one per core, 16 at most)\n"
    "  --max-children N      requests served at once in all, 1 to 4096\n"
    "                        (default fcgi_max_children, else 64)\n"
    "  --param-seconds N     seconds a request's parameters may take to arrive,\n"
    "                        1 to 3600 (default fcgi_param_seconds, else 10)\n"
    "  --stderr FILE         append standard error to FILE\n"
    "  --keep-env NAME       pass the variable NAME on to the requests (PATH,\n"
    "                        VELA_ROOT, VELA_LOG_STDERR, TZ, LANG, LC_ALL always)\n"
    "  -h, --help            print this text\n"
    "\n"
    "  SIGTERM or SIGINT stops it once the requests under way have finished.\n"
    "  Exit status: 0 stopped, 1 it could not start, 2 a usage error.\n";

// A usage error: one line saying what is wrong, and where help is.
int Usage(const std::string& problem)
{
    fprintf(stderr, "velafcgi: %s\nTry 'velafcgi --help' for more information.\n", problem.c_str());
    return 2;
}

bool Number(const char* text, int low, int high, int& out)
{
    char* end = nullptr;
    errno = 0;
    const long v = strtol(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || v < low || v > high) {
        return false;
    }
    out = static_cast<int>(v);
    return true;
}

// A Unix socket at `path`: a stale socket there is replaced, anything else
// is refused. The socket gets `mode` and, when given, the group `group`.
int ListenUnix(const std::string& path, mode_t mode, const std::string& group)
{
    sockaddr_un addr{};
    if (path.empty() || path[0] != '/' || path.size() >= sizeof(addr.sun_path)) {
        fprintf(stderr, "velafcgi: --socket needs an absolute path shorter than %zu bytes\n", sizeof(addr.sun_path));
        return -1;
    }
    struct stat st {};
    if (lstat(path.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode)) {
            fprintf(stderr, "velafcgi: %s exists and is not a socket\n", path.c_str());
            return -1;
        }
        unlink(path.c_str());
    }
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -1;
    }
    addr.sun_family = AF_UNIX;
    memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    // Nobody but the owner can connect before the mode is set.
    const mode_t old = umask(0077);
    const int bound = bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
    umask(old);
    if (bound != 0 || listen(fd, 128) != 0) {
        fprintf(stderr, "velafcgi: cannot listen on %s: %s\n", path.c_str(), strerror(errno));
        close(fd);
        return -1;
    }
    if (!group.empty()) {
        const struct group* g = getgrnam(group.c_str());
        if (g == nullptr || chown(path.c_str(), static_cast<uid_t>(-1), g->gr_gid) != 0) {
            fprintf(stderr, "velafcgi: cannot give %s to the group %s\n", path.c_str(), group.c_str());
            close(fd);
            return -1;
        }
    }
    if (chmod(path.c_str(), mode) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// TCP on the loopback address only: 127.0.0.1:PORT or [::1]:PORT.
int ListenLoopback(const std::string& address)
{
    const size_t colon = address.rfind(':');
    int port = 0;
    if (colon == std::string::npos || !Number(address.c_str() + colon + 1, 1, 65535, port)) {
        fprintf(stderr, "velafcgi: --tcp takes 127.0.0.1:PORT or [::1]:PORT\n");
        return -1;
    }
    const std::string host = address.substr(0, colon);
    int fd = -1;
    if (host == "127.0.0.1") {
        sockaddr_in a{};
        a.sin_family = AF_INET;
        a.sin_port = htons(static_cast<uint16_t>(port));
        a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        const int one = 1;
        setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
        if (fd >= 0 && bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof(a)) != 0) {
            close(fd);
            fd = -1;
        }
    } else if (host == "[::1]") {
        sockaddr_in6 a{};
        a.sin6_family = AF_INET6;
        a.sin6_port = htons(static_cast<uint16_t>(port));
        a.sin6_addr = in6addr_loopback;
        fd = socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0);
        const int one = 1;
        setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
        if (fd >= 0 && bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof(a)) != 0) {
            close(fd);
            fd = -1;
        }
    } else {
        fprintf(stderr, "velafcgi: --tcp listens on the loopback address only (127.0.0.1 or [::1])\n");
        return -1;
    }
    if (fd < 0 || listen(fd, 128) != 0) {
        fprintf(stderr, "velafcgi: cannot listen on %s: %s\n", address.c_str(), strerror(errno));
        if (fd >= 0) {
            close(fd);
        }
        return -1;
    }
    return fd;
}

bool IsListening(int fd)
{
    int accepting = 0;
    socklen_t len = sizeof(accepting);
    return getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &accepting, &len) == 0 && accepting != 0;
}

}  // namespace

int main(int argc, char** argv)
{
    std::string socketPath, socketGroup, tcp, errFile;
    int socketMode = 0660;
    VELA::Fcgi::Options options;
    const VELA::RequestLimits conf = VELA::LoadRequestLimits();
    options.parents = conf.fcgiParents;
    options.maxChildren = conf.fcgiMaxChildren;
    options.paramSeconds = conf.fcgiParamSeconds;
    std::vector<std::string> keep = {"PATH", "VELA_ROOT", "VELA_LOG_STDERR", "TZ", "LANG", "LC_ALL"};
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--help" || arg == "-h") {
            fputs(kUsage, stdout);
            return 0;
        }
        static const char* const kWithValue[] = {"--socket",        "--socket-group",  "--socket-mode",
                                                 "--tcp",           "--parents",       "--max-children",
                                                 "--param-seconds", "--stderr",        "--keep-env"};
        bool known = false;
        for (const char* name : kWithValue) {
            known = known || arg == name;
        }
        if (!known) {
            return Usage((arg.compare(0, 1, "-") == 0 ? "unknown option " : "unexpected argument ") + arg);
        }
        if (i + 1 >= argc) {
            return Usage(arg + " needs a value");
        }
        const char* value = argv[++i];
        bool ok = true;
        if (arg == "--socket") {
            socketPath = value;
        } else if (arg == "--socket-group") {
            socketGroup = value;
        } else if (arg == "--socket-mode") {
            char* end = nullptr;
            const long m = strtol(value, &end, 8);
            ok = end != value && *end == '\0' && m >= 0 && m <= 0777 && (m & 0007) == 0;
            socketMode = static_cast<int>(m);
        } else if (arg == "--tcp") {
            tcp = value;
        } else if (arg == "--parents") {
            ok = Number(value, 1, 64, options.parents);
        } else if (arg == "--max-children") {
            ok = Number(value, 1, 4096, options.maxChildren);
        } else if (arg == "--param-seconds") {
            ok = Number(value, 1, 3600, options.paramSeconds);
        } else if (arg == "--stderr") {
            errFile = value;
        } else if (arg == "--keep-env") {
            keep.push_back(value);
        }
        if (!ok) {
            return Usage("bad value for " + arg + ": " + value);
        }
    }
    if (!errFile.empty()) {
        const int fd = open(errFile.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0640);
        if (fd < 0) {
            fprintf(stderr, "velafcgi: cannot open %s: %s\n", errFile.c_str(), strerror(errno));
            return 1;
        }
        dup2(fd, STDERR_FILENO);
        close(fd);
    }

    int listenFd = -1;
    if (!socketPath.empty() && !tcp.empty()) {
        return Usage("--socket and --tcp exclude each other");
    }
    if (!socketPath.empty()) {
        listenFd = ListenUnix(socketPath, static_cast<mode_t>(socketMode), socketGroup);
    } else if (!tcp.empty()) {
        listenFd = ListenLoopback(tcp);
    } else if (IsListening(STDIN_FILENO)) {
        listenFd = STDIN_FILENO;
    } else {
        return Usage("no listening socket: give --socket or --tcp, or start it from a web server");
    }
    if (listenFd < 0) {
        return 1;
    }
    fcntl(listenFd, F_SETFL, fcntl(listenFd, F_GETFL) | O_NONBLOCK);
    if (listenFd == STDIN_FILENO) {
        // Standard input is the socket: the requests' own standard input
        // comes from elsewhere, and descriptor 0 must not stay the socket.
        listenFd = fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 3);
        const int null = open("/dev/null", O_RDONLY);
        dup2(null, STDIN_FILENO);
        if (null > STDIN_FILENO) {
            close(null);
        }
    }

    const std::string dir = VELA::System::Path("/usr/vela/velaman/webapi");
    if (chdir(dir.c_str()) != 0) {
        fprintf(stderr, "velafcgi: cannot enter the web-API directory %s: %s\n", dir.c_str(), strerror(errno));
        return 1;
    }
    for (const std::string& name : keep) {
        if (const char* v = getenv(name.c_str())) {
            options.environment.push_back(name + "=" + v);
        }
    }
    int parents = options.parents;
    if (parents <= 0) {
        const long cores = sysconf(_SC_NPROCESSORS_ONLN);
        parents = cores < 1 ? 1 : (cores > 16 ? 16 : static_cast<int>(cores));
    }
    VELA::Fcgi::Options each = options;
    each.maxChildren = (options.maxChildren + parents - 1) / parents;

    signal(SIGPIPE, SIG_IGN);
    signal(SIGUSR1, SIG_IGN);  // libfcgi's own stop signal: stopping is SIGTERM here
    signal(SIGHUP, SIG_IGN);
    if (FCGX_Init() != 0) {
        fprintf(stderr, "velafcgi: the FastCGI library does not start\n");
        return 1;
    }

    sigset_t blocked, waiting;
    VELA::Fcgi::CatchStopAndChildren(OnStop, OnChild, blocked, waiting);

    std::vector<pid_t> running(static_cast<size_t>(parents), -1);
    std::vector<time_t> started(static_cast<size_t>(parents), 0);
    auto spawn = [&](size_t i) {
        const pid_t pid = fork();
        if (pid == 0) {
            sigprocmask(SIG_SETMASK, &waiting, nullptr);
            struct sigaction dfl {};
            dfl.sa_handler = SIG_DFL;
            sigaction(SIGTERM, &dfl, nullptr);
            sigaction(SIGINT, &dfl, nullptr);
            sigaction(SIGCHLD, &dfl, nullptr);
            exit(VELA::Fcgi::RunParent(listenFd, each, argc, argv));
        }
        if (pid < 0) {
            VELA_LOG_ERR("cannot fork a parent[%m]");
        }
        running[i] = pid;
        started[i] = time(nullptr);
    };
    for (size_t i = 0; i < running.size(); ++i) {
        spawn(i);
    }
    VELA_LOG(LOG_INFO, "serving with %d parents, at most %d children each", parents, each.maxChildren);

    while (!g_stop) {
        // Waits for a stop or a parent's end, or a second. The signal is
        // taken here, without its handler running.
        timespec wait{1, 0};
        const int sig = sigtimedwait(&blocked, nullptr, &wait);
        if (sig == SIGTERM || sig == SIGINT) {
            g_stop = 1;
        }
        int status = 0;
        pid_t pid;
        while ((pid = waitpid(-1, &status, WNOHANG)) > 0) {
            for (size_t i = 0; i < running.size(); ++i) {
                if (running[i] == pid) {
                    if (!g_stop) {
                        VELA_LOG_ERR("parent %d ended (%s %d): starting another", static_cast<int>(pid),
                                     WIFSIGNALED(status) ? "signal" : "status",
                                     WIFSIGNALED(status) ? WTERMSIG(status) : WEXITSTATUS(status));
                    }
                    running[i] = -1;
                }
            }
        }
        for (size_t i = 0; i < running.size() && !g_stop; ++i) {
            if (running[i] < 0 && time(nullptr) - started[i] >= 1) {
                spawn(i);  // a parent that keeps dying is started again once a second at most
            }
        }
    }
    for (pid_t pid : running) {
        if (pid > 0) {
            kill(pid, SIGTERM);
        }
    }
    for (pid_t pid : running) {
        if (pid > 0) {
            while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
            }
        }
    }
    if (!socketPath.empty()) {
        unlink(socketPath.c_str());
    }
    VELA_LOG(LOG_INFO, "stopped");
    return 0;
}
