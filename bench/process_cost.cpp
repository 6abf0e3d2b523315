// Whole-process cost of one request: starts two programs with the same
// argument, side by side, many times, and prints the wall time per run of
// each and their ratio.
//
//   vela-bench-process [--runs N] [--rounds R] [--warmup W] [--any-output] A B ARG
//
// Each round runs A and B N times each, interleaved (A B, then B A, ...) so
// that neither is favoured by the machine's drift; W unmeasured runs of
// each come first (warm file cache and loader). Both must print the same
// standard output; it is compared once before the timing. With --any-output
// the two answers are only printed (programs that answer the same request
// in their own words, a CGI and its baseline); an empty ARG runs both
// without an argument. Every run is a
// posix_spawn and a wait4, its standard output going to /dev/null; the
// wall time is the figure, the children's CPU time is printed beside it
// (their difference is time spent blocked: console, disk, scheduler).
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <numeric>
#include <spawn.h>
#include <string>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

extern char** environ;

namespace {

double NowUs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1e6 + ts.tv_nsec / 1e3;
}

// Runs `program arg` with standard output on `outFd`; false unless it
// exited with status `want`. `cpuUs`, when given, receives the child's user
// and system time.
bool RunOnce(const char* program, const char* arg, int outFd, int want, double* cpuUs = nullptr)
{
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, outFd, STDOUT_FILENO);
    char* argv[] = {const_cast<char*>(program), *arg ? const_cast<char*>(arg) : nullptr, nullptr};
    pid_t pid;
    const int rc = posix_spawn(&pid, program, &actions, nullptr, argv, environ);
    posix_spawn_file_actions_destroy(&actions);
    if (rc != 0) {
        fprintf(stderr, "cannot start %s: %s\n", program, strerror(rc));
        return false;
    }
    int status;
    struct rusage usage;
    while (wait4(pid, &status, 0, &usage) < 0) {
        if (errno != EINTR) {
            return false;
        }
    }
    if (cpuUs) {
        *cpuUs = (usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1e6 + usage.ru_utime.tv_usec +
                 usage.ru_stime.tv_usec;
    }
    return WIFEXITED(status) && WEXITSTATUS(status) == want;
}

// The standard output of one run.
std::string Output(const char* program, const char* arg)
{
    char path[] = "/tmp/vela-bench-out-XXXXXX";
    const int fd = mkstemp(path);
    if (fd < 0) {
        return "";
    }
    unlink(path);
    std::string out;
    if (RunOnce(program, arg, fd, 0)) {
        lseek(fd, 0, SEEK_SET);
        char buf[4096];
        ssize_t n;
        while ((n = read(fd, buf, sizeof(buf))) > 0) {
            out.append(buf, static_cast<size_t>(n));
        }
    }
    close(fd);
    return out;
}

double Median(std::vector<double> v)
{
    std::sort(v.begin(), v.end());
    const size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
}

double Mean(const std::vector<double>& v) { return std::accumulate(v.begin(), v.end(), 0.0) / v.size(); }

int Usage()
{
    fprintf(stderr, "usage: vela-bench-process [--runs N] [--rounds R] [--warmup W] [--any-output] A B ARG\n");
    return 2;
}

}  // namespace

int main(int argc, char** argv)
{
    int runs = 300, rounds = 3, warmup = 20;
    bool anyOutput = false;
    std::vector<const char*> args;
    for (int i = 1; i < argc; ++i) {
        if (strcmp(argv[i], "--any-output") == 0) {
            anyOutput = true;
            continue;
        }
        int* target = strcmp(argv[i], "--runs") == 0     ? &runs
                      : strcmp(argv[i], "--rounds") == 0 ? &rounds
                      : strcmp(argv[i], "--warmup") == 0 ? &warmup
                                                         : nullptr;
        if (target) {
            if (++i >= argc || (*target = atoi(argv[i])) < 0) {
                return Usage();
            }
        } else {
            args.push_back(argv[i]);
        }
    }
    if (args.size() != 3 || runs < 1 || rounds < 1) {
        return Usage();
    }
    const char* a = args[0];
    const char* b = args[1];
    const char* arg = args[2];

    const std::string outA = Output(a, arg);
    const std::string outB = Output(b, arg);
    if (anyOutput) {
        if (outA.empty() || outB.empty()) {
            fprintf(stderr, "a program gave no answer:\n  %s\n  %s\n", outA.c_str(), outB.c_str());
            return 1;
        }
    } else if (outA.empty() || outA != outB) {
        fprintf(stderr, "the two programs do not give the same answer:\n  %s  %s", outA.c_str(), outB.c_str());
        return 1;
    } else {
        printf("both answer: %s", outA.c_str());
    }

    const int devnull = open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (devnull < 0) {
        perror("/dev/null");
        return 1;
    }
    for (int i = 0; i < warmup; ++i) {
        if (!RunOnce(a, arg, devnull, 0) || !RunOnce(b, arg, devnull, 0)) {
            fprintf(stderr, "a warm-up run failed\n");
            return 1;
        }
    }

    std::vector<double> allA, allB, cpuA, cpuB;
    const char* nameA = strrchr(a, '/') ? strrchr(a, '/') + 1 : a;
    const char* nameB = strrchr(b, '/') ? strrchr(b, '/') + 1 : b;
    for (int r = 1; r <= rounds; ++r) {
        std::vector<double> tA, tB;
        for (int i = 0; i < runs; ++i) {
            for (int k = 0; k < 2; ++k) {
                const bool first = (k == 0) == (i % 2 == 0);
                const char* program = first ? a : b;
                double cpu = 0;
                const double start = NowUs();
                if (!RunOnce(program, arg, devnull, 0, &cpu)) {
                    fprintf(stderr, "%s failed\n", program);
                    return 1;
                }
                (first ? tA : tB).push_back(NowUs() - start);
                (first ? cpuA : cpuB).push_back(cpu);
            }
        }
        printf("round %d: %s median %7.0f us mean %7.0f us | %s median %7.0f us mean %7.0f us | ratio %.2fx\n", r,
               nameA, Median(tA), Mean(tA), nameB, Median(tB), Mean(tB), Median(tA) / Median(tB));
        allA.insert(allA.end(), tA.begin(), tA.end());
        allB.insert(allB.end(), tB.begin(), tB.end());
    }
    printf("all %d runs each: %s median %.0f us mean %.0f us | %s median %.0f us mean %.0f us\n",
           runs * rounds, nameA, Median(allA), Mean(allA), nameB, Median(allB), Mean(allB));
    printf("ratio %s/%s: median %.2fx mean %.2fx\n", nameA, nameB, Median(allA) / Median(allB),
           Mean(allA) / Mean(allB));
    printf("cpu time (user+system) per run: %s median %.0f us | %s median %.0f us | ratio %.2fx\n", nameA,
           Median(cpuA), nameB, Median(cpuB), Median(cpuA) / Median(cpuB));
    close(devnull);
    return 0;
}
