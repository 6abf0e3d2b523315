// Runs a program and appends its peak resident set size (KiB, the ru_maxrss
// of wait4) as one line to a log file: the memory figure of the web
// benchmarks. The program keeps this process's standard streams, so it can
// stand in for a CGI program.
//
// lighttpd ends a CGI process with SIGTERM once the answer is complete, which
// for an answer with a Content-Length can come before the program has
// exited; this process holds SIGTERM (and SIGINT, SIGHUP) back until it has
// written the figure, while the program itself runs with the signal mask it
// was given.
//
// usage: vela-bench-peak-rss LOG PROGRAM [ARG...]
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

int main(int argc, char** argv)
{
    if (argc < 3) {
        std::fprintf(stderr, "usage: %s LOG PROGRAM [ARG...]\n", argv[0]);
        return 2;
    }
    sigset_t held;
    sigset_t original;
    sigemptyset(&held);
    sigaddset(&held, SIGTERM);
    sigaddset(&held, SIGINT);
    sigaddset(&held, SIGHUP);
    sigprocmask(SIG_BLOCK, &held, &original);

    const pid_t pid = fork();
    if (pid < 0) {
        std::perror("fork");
        return 1;
    }
    if (pid == 0) {
        sigprocmask(SIG_SETMASK, &original, nullptr);
        execv(argv[2], argv + 2);
        std::fprintf(stderr, "%s: %s: %s\n", argv[0], argv[2], std::strerror(errno));
        _exit(127);
    }

    int status = 0;
    struct rusage usage{};
    while (wait4(pid, &status, 0, &usage) < 0) {
        if (errno != EINTR) {
            std::perror("wait4");
            return 1;
        }
    }
    const std::string line = std::to_string(usage.ru_maxrss) + "\n";
    const int fd = open(argv[1], O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    if (fd >= 0) {
        if (write(fd, line.data(), line.size()) != static_cast<ssize_t>(line.size())) {
            std::perror("write");
        }
        close(fd);
    }
    if (WIFEXITED(status)) {
        return WEXITSTATUS(status);
    }
    return 128 + (WIFSIGNALED(status) ? WTERMSIG(status) : 0);
}
