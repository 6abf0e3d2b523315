// Handlers of the compound-request tests. Each answers with the process it
// ran in and its effective ids, so the tests see where and as whom a call ran.
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <string>
#include <unistd.h>

#include <json/json.h>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

Json::Value Facts(APIRequest* req)
{
    Json::Value data(Json::objectValue);
    data["pid"] = static_cast<Json::Int>(getpid());
    data["euid"] = static_cast<Json::UInt>(geteuid());
    data["n"] = req->GetParam("n");
    return data;
}

// Creates the file named by "mark" (the tests' witness that a call ran).
void Mark(APIRequest* req)
{
    const std::string mark = req->GetParam("mark", "").asString();
    if (!mark.empty()) {
        close(open(mark.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    }
}

void Echo(APIRequest* req, APIResponse* resp)
{
    Mark(req);
    resp->SetSuccess(Facts(req));
}

void Fail(APIRequest* req, APIResponse* resp)
{
    Mark(req);
    resp->SetError(1001, Facts(req));
}

void Crash(APIRequest*, APIResponse*)
{
    abort();
}

// Sleeps "ms" milliseconds (at most 10 s), writing its pid to "mark" first.
void Sleep(APIRequest* req, APIResponse* resp)
{
    const std::string mark = req->GetParam("mark", "").asString();
    if (FILE* f = mark.empty() ? nullptr : fopen(mark.c_str(), "we")) {
        fprintf(f, "%d\n", static_cast<int>(getpid()));
        fclose(f);
    }
    const int ms = req->GetParam("ms", 0).asInt();
    usleep(static_cast<useconds_t>(ms > 0 && ms <= 10000 ? ms : 0) * 1000u);
    resp->SetSuccess(Facts(req));
}

void Restart(APIRequest* req, APIResponse* resp)
{
    resp->SetHttpdRestart(true);
    resp->SetServerError("disk busy");
    resp->SetSuccess(Facts(req));
}

// An answer larger than a pipe's buffer.
void Big(APIRequest* req, APIResponse* resp)
{
    Json::Value data = Facts(req);
    data["blob"] = std::string(256 * 1024, 'b');
    resp->SetSuccess(data);
}

void Noop(void*) {}

void Later(APIRequest* req, APIResponse* resp)
{
    resp->SetCallbackFunc(Noop, nullptr);
    resp->SetSuccess(Facts(req));
}

_tag_API_TABLE g_table[] = {
    {"VELA.Comp", 1, "echo", Echo},
    {"VELA.Comp", 1, "here", Echo},
    {"VELA.Comp", 1, "asNobody", Echo},
    {"VELA.Comp", 1, "adminonly", Echo},
    {"VELA.Comp", 1, "fail", Fail},
    {"VELA.Comp", 1, "crash", Crash},
    {"VELA.Comp", 1, "sleep", Sleep},
    {"VELA.Comp", 1, "restart", Restart},
    {"VELA.Comp", 1, "big", Big},
    {"VELA.Comp", 1, "later", Later},
    {"VELA.Comp", 1, "download", Echo},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
