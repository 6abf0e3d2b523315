// The login-session check that every call of a method needing a login pays,
// beside the least any check must do: read the session file and parse it.
//
//   BM_ReadSessionFile      open, read and parse the session's JSON file
//                           (the baseline)
//   BM_CheckNoRefresh       VelaCgiIsAuthorizedEx with VELACGI_AUTH_NO_REFRESH,
//                           as for "allowTimeout" methods: id check, read,
//                           parse, user look-up, address and token checks
//   BM_CheckAndRefresh      the same for an ordinary method, whose last use
//                           moves to now: the clock advances one second per
//                           call, so every call rewrites the file under its
//                           lock (temporary file and rename)
//
// Works in a fresh temporary VELA_ROOT with one session of root.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <json/json.h>
#include <string>
#include <unistd.h>

#include "vela/cgi.h"
#include "vela/session.h"
#include "webapi/JsonUtil.h"

namespace {

std::string g_sid;
std::string g_token;
std::string g_file;
long long g_clock = 1700000000;

long long BenchClock() { return g_clock; }

void BM_ReadSessionFile(benchmark::State& state)
{
    char buf[4096];
    for (auto _ : state) {
        const int fd = open(g_file.c_str(), O_RDONLY | O_CLOEXEC);
        const ssize_t n = fd >= 0 ? read(fd, buf, sizeof(buf)) : -1;
        if (fd >= 0) {
            close(fd);
        }
        Json::Value doc;
        if (n <= 0 || !VELA::JsonParse(std::string(buf, static_cast<size_t>(n)), doc)) {
            state.SkipWithError("cannot read the session file");
            break;
        }
        benchmark::DoNotOptimize(doc);
    }
}
BENCHMARK(BM_ReadSessionFile);

void Check(benchmark::State& state, int flags, bool advance)
{
    VELACGI_CTX* ctx = nullptr;
    if (VelaCgiInit("", &ctx) != 0) {
        state.SkipWithError("VelaCgiInit failed");
        return;
    }
    char user[493];
    for (auto _ : state) {
        if (advance) {
            ++g_clock;
        }
        VELACGI_SESSION_INFO info;
        if (VelaCgiIsAuthorizedEx(ctx, g_sid.c_str(), user, sizeof(user), &info, flags) != 1) {
            state.SkipWithError("the session check refused the session");
            break;
        }
        benchmark::DoNotOptimize(user);
    }
    VelaCgiFree(ctx);
}

void BM_CheckNoRefresh(benchmark::State& state) { Check(state, VELACGI_AUTH_NO_REFRESH, false); }
BENCHMARK(BM_CheckNoRefresh);

void BM_CheckAndRefresh(benchmark::State& state) { Check(state, 0, true); }
BENCHMARK(BM_CheckAndRefresh);

}  // namespace

int main(int argc, char** argv)
{
    char dir[] = "/tmp/vela-session-bench-XXXXXX";
    if (mkdtemp(dir) == nullptr) {
        perror("mkdtemp");
        return 1;
    }
    setenv("VELA_ROOT", dir, 1);
    setenv("REMOTE_ADDR", "192.0.2.7", 1);
    VELA::Session::SetClockForTest(BenchClock);
    VELA::Session::Options options;
    options.idleTimeout = 3600;
    options.lifetime = 30 * 86400;  // outlasts the clock's steps
    options.tokenProtect = true;
    if (VELA::Session::Create("root", "192.0.2.7", &options, g_sid, g_token) != 0) {
        fprintf(stderr, "cannot create a session under %s\n", dir);
        return 1;
    }
    setenv("HTTP_X_VELA_TOKEN", g_token.c_str(), 1);
    g_file = std::string(dir) + "/run/vela/sessions/" + g_sid;

    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    const std::string cleanup = std::string("rm -rf '") + dir + "'";
    return system(cleanup.c_str()) == 0 ? 0 : 1;
}
