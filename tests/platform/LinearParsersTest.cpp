// Every parser of client text takes time linear in its input: the same
// hostile patterns at one size and at sixteen times that size (up to 16 MiB,
// the largest form body). A quadratic parser grows 256 times from one to
// the other; a linear one 16 times. The bound below
// leaves room for a noisy machine and for cache effects, never for a
// quadratic parser.
#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

#include "vela/cgi.h"
#include "vela/webapiutil.h"
#include "webapi/APIRequest.h"

namespace {

using Parser = std::function<void(const std::string&)>;

constexpr size_t kLarge = 16u << 20;
constexpr double kMaxGrowth = 16.0 * 4;
// Times below this count as this: a parse of a few milliseconds says more
// about caches, page faults and the machine's load than about the parser.
constexpr double kFloor = 0.01;

std::string Repeat(const std::string& piece, size_t size)
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
double Seconds(const Parser& parse, const std::string& input)
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
void ExpectLinear(const char* name, const Parser& parse, const std::string& piece, size_t large = kLarge)
{
    double before = std::max(Seconds(parse, Repeat(piece, large / 256)), kFloor);
    for (size_t size = large / 16; size <= large; size *= 16) {
        const std::string input = Repeat(piece, size);
        const unsigned budget = static_cast<unsigned>(before * kMaxGrowth * 2) + 2;
        int fds[2];
        ASSERT_EQ(0, pipe(fds));
        const pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            alarm(budget);
            const double took = std::max(Seconds(parse, input), kFloor);
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
        EXPECT_LT(took / before, kMaxGrowth) << name << " on \"" << piece << "\"*: " << before << " s for "
                                             << size / 16 << " bytes, " << took << " s for " << size;
        before = took;
    }
}

TEST(LinearParsers, FormAndQueryText)
{
    const Parser form = [](const std::string& text) {
        Json::Value out;
        VELA::WebAPIUtil::strPairToJsonObj(text, out, true, true);
    };
    const Parser line = [](const std::string& text) {
        std::string copy = text;
        VelaCgiDetectAndDecryptParamLine(copy);
    };
    const Parser decode = [](const std::string& text) { VELA::WebAPIUtil::URLDecode(text, true); };
    // "&" alone was the quadratic case: each piece looked for "=" to the
    // end of the body.
    for (const char* piece : {"&", "&&=", "=", "a=b&", "%4"}) {
        ExpectLinear("strPairToJsonObj", form, piece);
        ExpectLinear("URLDecode", decode, piece);
    }
    for (const char* piece : {"&", "%41&", "__cIpHeRtExT=&"}) {
        ExpectLinear("VelaCgiDetectAndDecryptParamLine", line, piece);
    }
}

TEST(LinearParsers, ListsAndJson)
{
    const Parser list = [](const std::string& text) { VELA::WebAPIUtil::ParseToArray(text.c_str(), ", "); };
    const Parser json = [](const std::string& text) {
        Json::Value out;
        VELA::WebAPIUtil::ParseJson(text, out);
    };
    for (const char* piece : {", ", ",,  "}) {
        ExpectLinear("ParseToArray", list, piece, 4u << 20);
    }
    for (const char* piece : {"[1,", "\"\\\\", "{\"a\":"}) {
        ExpectLinear("ParseJson", json, piece);
    }
}

// Cookies reach the process in one environment variable, which the kernel
// caps at 128 KiB; the request JSON of velarun has no cap, so the cookie
// parser is held to the same rule as the body parsers.
TEST(LinearParsers, CookieHeader)
{
    const Parser cookies = [](const std::string& text) {
        Json::Value request;
        request["environ"]["HTTP_COOKIE"] = text;
        VELA::APIRequest req(request);
        req.GetCookie("id", "");
    };
    for (const char* piece : {";", "a=;", "id=%41"}) {
        ExpectLinear("cookie header", cookies, piece, 2u << 20);
    }
}

}  // namespace
