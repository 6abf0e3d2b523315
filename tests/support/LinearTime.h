// ExpectLinear: a parser of client text must take time linear in its input.
// It is timed on the same hostile pattern at one size and at sixteen times
// that size (up to 16 MiB, the largest form body). A quadratic parser grows
// 256 times from one to the other; a linear one 16 times. The bound below
// leaves room for a noisy machine and for cache effects, never for a
// quadratic parser.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

namespace VELA {
namespace Test {

using LinearParser = std::function<void(const std::string&)>;

constexpr size_t kLinearLarge = 16u << 20;
constexpr double kLinearMaxGrowth = 16.0 * 4;
// Times below this count as this: a parse of a few milliseconds says more
// about caches, page faults and the machine's load than about the parser.
constexpr double kLinearFloor = 0.01;

inline std::string RepeatTo(const std::string& piece, size_t size)
{
    std::string out;
    out.reserve(size + piece.size());
    while (out.size() < size) {
        out += piece;
    }
    out.resize(size);
    return out;
}

// The faster of two runs, in seconds.
inline double BestOfTwoSeconds(const LinearParser& parse, const std::string& input)
{
    double best = 1e9;
    for (int i = 0; i < 2; ++i) {
        const auto start = std::chrono::steady_clock::now();
        parse(input);
        const std::chrono::duration<double> took = std::chrono::steady_clock::now() - start;
        best = std::min(best, took.count());
    }
    return best;
}

// Sizes grow by 16 from large/256 to large. Each larger input is parsed in a
// child that an alarm ends once it has taken far longer than a linear
// parser could after the size before it, so a quadratic parser fails in
// seconds instead of running for hours.
inline void ExpectLinear(const char* name, const LinearParser& parse, const std::string& piece,
                         size_t large = kLinearLarge)
{
    double before = std::max(BestOfTwoSeconds(parse, RepeatTo(piece, large / 256)), kLinearFloor);
    for (size_t size = large / 16; size <= large; size *= 16) {
        const std::string input = RepeatTo(piece, size);
        const unsigned budget = static_cast<unsigned>(before * kLinearMaxGrowth * 2) + 2;
        int fds[2];
        ASSERT_EQ(0, pipe(fds));
        const pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            alarm(budget);
            const double took = std::max(BestOfTwoSeconds(parse, input), kLinearFloor);
            _exit(write(fds[1], &took, sizeof(took)) == sizeof(took) ? 0 : 1);
        }
        close(fds[1]);
        double took = 0;
        const bool reported = read(fds[0], &took, sizeof(took)) == sizeof(took);
        close(fds[0]);
        int status = 0;
        ASSERT_EQ(child, waitpid(child, &status, 0));
        ASSERT_TRUE(reported) << name << " on \"" << piece << "\"*: still running after " << budget << " s for "
                              << size << " bytes (" << before << " s for " << size / 16 << ")";
        EXPECT_LT(took / before, kLinearMaxGrowth) << name << " on \"" << piece << "\"*: " << before << " s for "
                                                   << size / 16 << " bytes, " << took << " s for " << size;
        before = took;
    }
}

}  // namespace Test
}  // namespace VELA
