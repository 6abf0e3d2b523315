// What one child of a compound request costs in forks alone, on this
// machine: a process that has loaded the same libraries as velascgi (the
// framework, the platform and the handler libraries named on the command
// line) forks N children in three ways and prints the median wall time of
// one, in microseconds:
//
//   fork         fork(), the child exits at once, the parent waits for it;
//   fork+pipe    the same, the child first writes one byte into a pipe that
//                the parent reads (a child that answers, reaped by its parent);
//   detached     VLIBCProcForkEx with the flags of a compound's children
//                (detached: a double fork through an intermediate child),
//                the worker writes one byte that the parent reads.
//
// usage: vela-bench-fork-cost [-n COUNT] [LIBRARY...]   (COUNT 1 to 100000)
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dlfcn.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "vela/sysfile.h"
#include "webapi/APIRunner.h"

namespace {

long long NowNanos()
{
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<long long>(now.tv_sec) * 1000000000LL + now.tv_nsec;
}

bool ReadByte(int fd)
{
    char c = 0;
    ssize_t n;
    while ((n = read(fd, &c, 1)) < 0 && errno == EINTR) {
    }
    return n == 1;
}

void WriteByteAndExit(int fd)
{
    const char c = 'x';
    const bool ok = write(fd, &c, 1) == 1;
    _exit(ok ? 0 : 1);
}

void Reap(pid_t pid)
{
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
}

enum class Kind { kFork, kForkPipe, kDetached };

// One child of `kind`; its wall time in nanoseconds, -1 on failure.
long long OneChild(Kind kind)
{
    int fds[2];
    if (kind != Kind::kFork && pipe(fds) != 0) {
        return -1;
    }
    const long long start = NowNanos();
    pid_t pid;
    if (kind == Kind::kDetached) {
        pid = VLIBCProcForkEx(VLIBC_FORK_DETACH | VLIBC_FORK_DEFAULT_SIGNALS);
    } else {
        pid = fork();
    }
    if (pid == 0) {
        if (kind == Kind::kFork) {
            _exit(0);
        }
        close(fds[0]);
        WriteByteAndExit(fds[1]);
    }
    bool ok = pid > 0;
    if (kind != Kind::kFork) {
        close(fds[1]);
        ok = ok && ReadByte(fds[0]);
        close(fds[0]);
    }
    if (pid > 0 && kind != Kind::kDetached) {
        Reap(pid);
    }
    const long long took = NowNanos() - start;
    return ok ? took : -1;
}

double MedianMicros(std::vector<long long>& nanos)
{
    std::sort(nanos.begin(), nanos.end());
    const size_t n = nanos.size();
    const double mid = n % 2 ? nanos[n / 2] : (nanos[n / 2 - 1] + nanos[n / 2]) / 2.0;
    return mid / 1000.0;
}

}  // namespace

int main(int argc, char** argv)
{
    long count = 200;
    int first = 1;
    if (argc > 2 && std::strcmp(argv[1], "-n") == 0) {
        char* end = nullptr;
        count = std::strtol(argv[2], &end, 10);
        if (end == argv[2] || *end != '\0' || count < 1 || count > 100000) {
            std::fprintf(stderr, "vela-bench-fork-cost: -n takes 1 to 100000\n");
            return 2;
        }
        first = 3;
    }
    // The framework's runner, as velascgi has one, and the handler libraries.
    VELA::APIRunner runner;
    for (int i = first; i < argc; ++i) {
        if (dlopen(argv[i], RTLD_NOW | RTLD_GLOBAL) == nullptr) {
            std::fprintf(stderr, "vela-bench-fork-cost: %s\n", dlerror());
            return 1;
        }
    }
    const Kind kinds[] = {Kind::kFork, Kind::kForkPipe, Kind::kDetached};
    const char* names[] = {"fork", "fork+pipe", "detached"};
    std::vector<long long> times[3];
    // Alternating, so that the machine's load falls on all three alike.
    for (long round = 0; round < count; ++round) {
        for (int k = 0; k < 3; ++k) {
            const long long t = OneChild(kinds[k]);
            if (t < 0) {
                std::fprintf(stderr, "vela-bench-fork-cost: %s failed: %s\n", names[k], std::strerror(errno));
                return 1;
            }
            times[k].push_back(t);
        }
    }
    for (int k = 0; k < 3; ++k) {
        std::printf("%s %.1f\n", names[k], MedianMicros(times[k]));
    }
    return 0;
}
