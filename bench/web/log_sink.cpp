// A stand-in for the system log daemon during the web benchmarks: binds a
// datagram socket at the path given (run.sh uses /dev/log inside a private
// mount namespace) and appends every message it receives, one per line, to
// the output file, until it is terminated.
//
// Without a daemon the C library writes each syslog line to /dev/console,
// a serial device that costs milliseconds per line and serialises every
// process that logs; that is not the cost of a production machine, where a
// log line is one datagram.
//
// usage: vela-bench-log-sink SOCKET OUTPUT
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace {

volatile sig_atomic_t g_stop = 0;

void OnSignal(int) { g_stop = 1; }

bool WriteAll(int fd, const char* p, size_t n)
{
    while (n > 0) {
        const ssize_t w = write(fd, p, n);
        if (w < 0 && errno == EINTR) {
            continue;
        }
        if (w <= 0) {
            return false;
        }
        p += w;
        n -= static_cast<size_t>(w);
    }
    return true;
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc != 3) {
        std::fprintf(stderr, "usage: %s SOCKET OUTPUT\n", argv[0]);
        return 2;
    }
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    if (std::strlen(argv[1]) >= sizeof(addr.sun_path)) {
        std::fprintf(stderr, "%s: socket path too long\n", argv[0]);
        return 2;
    }
    std::strcpy(addr.sun_path, argv[1]);

    const int out = open(argv[2], O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    if (out < 0) {
        std::fprintf(stderr, "%s: %s: %s\n", argv[0], argv[2], std::strerror(errno));
        return 1;
    }
    const int sock = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    unlink(addr.sun_path);
    if (sock < 0 || bind(sock, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        std::fprintf(stderr, "%s: %s: %s\n", argv[0], argv[1], std::strerror(errno));
        return 1;
    }
    chmod(addr.sun_path, 0666);

    struct sigaction sa{};
    sa.sa_handler = OnSignal;  // no SA_RESTART: recv returns EINTR
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGINT, &sa, nullptr);

    char buf[8192];
    while (!g_stop) {
        const ssize_t n = recv(sock, buf, sizeof(buf) - 1, 0);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            break;
        }
        size_t len = static_cast<size_t>(n);
        if (len == 0 || buf[len - 1] != '\n') {
            buf[len++] = '\n';
        }
        if (!WriteAll(out, buf, len)) {
            break;
        }
    }
    unlink(addr.sun_path);
    close(sock);
    close(out);
    return 0;
}
