// One in-process dispatch of the sample's echo, beside the same answer built
// with JsonCpp alone.
//
//   BM_ProcessEcho   a request object from the request JSON, its response,
//                    APIRunner::Process (description check, library table,
//                    process name, identity of the call, handler) and the
//                    response body
//   BM_JsonOnlyEcho  the body {"success": true, "data": <parameters>,
//                    "httpd_restart": false} built from the same JSON
//
// The runner serves the staged web-API directory: VELA_ROOT (default the
// build's stage root) and its usr/vela/velaman/webapi as working directory.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <unistd.h>

#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace {

Json::Value EchoRequest()
{
    Json::Value request;
    VELA::JsonParse(R"({"getParam": {"api": "VELA.Sample", "version": 1, "method": "echo",
                                    "text": "hello", "count": 3}})",
                    request);
    return request;
}

void BM_ProcessEcho(benchmark::State& state)
{
    static VELA::APIRunner runner;
    const Json::Value request = EchoRequest();
    for (auto _ : state) {
        VELA::APIRequest req(request);
        VELA::APIResponse resp(&req);
        if (!runner.Process(&req, &resp)) {
            state.SkipWithError("the echo call failed");
            break;
        }
        Json::Value body = resp.GetBody();
        body["httpd_restart"] = false;
        benchmark::DoNotOptimize(body);
    }
}
BENCHMARK(BM_ProcessEcho);

void BM_JsonOnlyEcho(benchmark::State& state)
{
    const Json::Value request = EchoRequest();
    for (auto _ : state) {
        Json::Value body(Json::objectValue);
        body["success"] = true;
        body["data"] = request["getParam"];
        body["httpd_restart"] = false;
        benchmark::DoNotOptimize(body);
    }
}
BENCHMARK(BM_JsonOnlyEcho);

}  // namespace

int main(int argc, char** argv)
{
    setenv("VELA_ROOT", VELA_BENCH_STAGE_ROOT, 0);
    const std::string dir = VELA::System::Path("/usr/vela/velaman/webapi");
    if (chdir(dir.c_str()) != 0) {
        perror(dir.c_str());
        return 1;
    }
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
