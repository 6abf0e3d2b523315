// The handler library of the compound benchmark, "VELA.Bench.Compound".
// run.sh installs it, with its description, only in its temporary state
// root:
//
//   sleep  sleeps "ms" milliseconds (0 to 2000: a JSON integer, or text of
//          decimal digits as a query string gives it) and answers
//          {"ms": asked, "slept_us": measured}; anything else is refused
//          with 101. Ten of them in one parallel compound show whether the
//          calls really run at once.
//   echo   answers its parameters as they arrived, like the sample's echo;
//          its description marks it "grantable", so a sequential compound
//          runs it in the request's own process: beside the sample's echo,
//          which is forked, it shows what a forked call costs.
#include <cerrno>
#include <ctime>
#include <json/json.h>
#include <string>

#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

constexpr long long kMaxSleepMillis = 2000;

// "ms" as a JSON integer or as 1 to 4 decimal digits; -1 when it is
// missing, of another kind, or above kMaxSleepMillis.
long long SleepMillis(const Json::Value& ms)
{
    long long value = -1;
    if (ms.isInt64()) {
        value = ms.asInt64();
    } else if (ms.isString()) {
        const std::string text = ms.asString();
        if (text.empty() || text.size() > 4 || text.find_first_not_of("0123456789") != std::string::npos) {
            return -1;
        }
        value = std::stoll(text);
    }
    return value >= 0 && value <= kMaxSleepMillis ? value : -1;
}

long long NowMicros()
{
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<long long>(now.tv_sec) * 1000000 + now.tv_nsec / 1000;
}

void Sleep(APIRequest* req, APIResponse* resp)
{
    const long long ms = SleepMillis(req->GetParam("ms"));
    if (ms < 0) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST, Json::Value("\"ms\": 0 to 2000 milliseconds"));
        return;
    }
    const long long start = NowMicros();
    struct timespec left = {static_cast<time_t>(ms / 1000), static_cast<long>(ms % 1000) * 1000000};
    while (nanosleep(&left, &left) != 0 && errno == EINTR) {
    }
    Json::Value data(Json::objectValue);
    data["ms"] = static_cast<Json::Int64>(ms);
    data["slept_us"] = static_cast<Json::Int64>(NowMicros() - start);
    resp->SetSuccess(data);
}

void Echo(APIRequest* req, APIResponse* resp)
{
    resp->SetSuccess(req->GetParam("", Json::Value(Json::objectValue)));
}

_tag_API_TABLE g_table[] = {
    {"VELA.Bench.Compound", 1, "sleep", VELA::APIGuarded<Sleep>},
    {"VELA.Bench.Compound", 1, "echo", VELA::APIGuarded<Echo>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

extern "C" __attribute__((visibility("default"))) _tag_API_TABLE* GetAPITable(void) { return g_table; }
