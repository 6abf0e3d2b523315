// Handlers of the pipeline and identity tests. Each reports what it saw
// through the response, so the tests read the facts of the call itself.
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <grp.h>
#include <iostream>
#include <stdexcept>
#include <string>
#include <sys/resource.h>
#include <unistd.h>
#include <vector>

#include <json/json.h>

#include "webapi/APIDownload.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

std::string Cwd()
{
    char buf[PATH_MAX];
    return getcwd(buf, sizeof(buf)) ? buf : "";
}

void Silent(APIRequest*, APIResponse*) {}

void Echo(APIRequest* req, APIResponse* resp)
{
    Json::Value data(Json::objectValue);
    data["api"] = req->GetAPIClass();
    data["method"] = req->GetAPIMethod();
    data["cwd"] = Cwd();
    data["user"] = req->GetLoginUserName();
    resp->SetSuccess(data);
}

// Writes to std::cout and reads a line from std::cin.
void Print(APIRequest*, APIResponse* resp)
{
    std::cout << "handler output" << std::endl;
    std::string line;
    std::getline(std::cin, line);
    Json::Value data(Json::objectValue);
    data["stdin"] = line;
    resp->SetSuccess(data);
}

void ChangeDir(APIRequest*, APIResponse* resp)
{
    if (chdir("/") != 0) {
        resp->SetError(500);
        return;
    }
    Json::Value data(Json::objectValue);
    data["cwd"] = Cwd();
    resp->SetSuccess(data);
}

void Throws(APIRequest*, APIResponse*) { throw std::runtime_error("handler gave up"); }

// Fails, reporting the nice value it ran with.
void NiceFail(APIRequest*, APIResponse* resp)
{
    errno = 0;
    Json::Value details(Json::objectValue);
    details["nice"] = getpriority(PRIO_PROCESS, 0);
    resp->SetError(555, details);
}

// After the reply: waits the request's "sleep" seconds (0 to 30, default
// 0), then writes the pid of the process that runs the callback into the
// file named by the request's "file" parameter. "restart": "1" asks for a
// restart of the web server as well.
std::string g_callbackFile;
unsigned g_callbackSleep = 0;

void WritePid(void* arg)
{
    for (unsigned left = g_callbackSleep; left > 0;) {
        left = sleep(left);
    }
    const std::string* path = static_cast<const std::string*>(arg);
    const std::string tmp = *path + ".tmp";
    FILE* f = fopen(tmp.c_str(), "w");
    if (f == nullptr) {
        return;
    }
    fprintf(f, "%d", static_cast<int>(getpid()));
    fclose(f);
    rename(tmp.c_str(), path->c_str());
}

void Callback(APIRequest* req, APIResponse* resp)
{
    g_callbackFile = req->GetParam("file", "").asString();
    const long long wait = atoll(req->GetParam("sleep", "0").asString().c_str());
    g_callbackSleep = wait > 0 && wait <= 30 ? static_cast<unsigned>(wait) : 0;
    resp->SetCallbackFunc(WritePid, &g_callbackFile);
    if (req->GetParam("restart", "0").asString() == "1") {
        resp->SetHttpdRestart(true);
    }
    resp->SetSuccess();
}

// A download of generated content: the output of "seq 1 <count>" (count
// from the request, 1 to 10,000,000) read from a pipe.
void Stream(APIRequest* req, APIResponse* resp)
{
    const long long count = atoll(req->GetParam("count", "1").asString().c_str());
    if (count < 1 || count > 10000000) {
        resp->SetError(101);
        return;
    }
    FILE* pipe = popen(("seq 1 " + std::to_string(count)).c_str(), "r");
    if (pipe == nullptr) {
        resp->SetError(500);
        return;
    }
    VELA::APIDownload download(resp);
    download.SetMimeType("text/plain");
    if (!download.Output(pipe)) {
        resp->SetError(500);
    }
    pclose(pipe);
}

// The ids and groups the handler runs with, and the method it serves.
void Ids(APIRequest* req, APIResponse* resp)
{
    uid_t u[3];
    gid_t g[3];
    if (getresuid(&u[0], &u[1], &u[2]) != 0 || getresgid(&g[0], &g[1], &g[2]) != 0) {
        resp->SetError(500);
        return;
    }
    Json::Value data(Json::objectValue);
    for (int i = 0; i < 3; ++i) {
        data["uid"].append(static_cast<Json::UInt>(u[i]));
        data["gid"].append(static_cast<Json::UInt>(g[i]));
    }
    std::vector<gid_t> groups(static_cast<size_t>(getgroups(0, nullptr)));
    groups.resize(static_cast<size_t>(getgroups(static_cast<int>(groups.size()), groups.data())));
    data["groups"] = Json::Value(Json::arrayValue);
    for (gid_t group : groups) {
        data["groups"].append(static_cast<Json::UInt>(group));
    }
    data["method"] = req->GetAPIMethod();
    data["methodParam"] = req->GetParam("method", "");
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Pipe.Test", 1, "silent", Silent},
    {"VELA.Pipe.Test", 1, "echo", Echo},
    {"VELA.Pipe.Test", 1, "print", Print},
    {"VELA.Pipe.Test", 1, "printKept", Print},
    {"VELA.Pipe.Test", 1, "chdir", ChangeDir},
    {"VELA.Pipe.Test", 1, "throws", Throws},
    {"VELA.Pipe.Test", 1, "callback", Callback},
    {"VELA.Pipe.Test", 1, "stream", Stream},
    {"VELA.Pipe.Test", 1, "upload", Echo},
    {"VELA.Pipe.Test", 1, "v1only", Echo},
    {"VELA.Pipe.Test", 1, "timeout", Echo},
    {"VELA.Pipe.Uncounted", 1, "get", Echo},
    {"VELA.Pipe.Nice", 1, "fail", NiceFail},
    {"VELA.Entry.Request", 1, "request", Echo},
    {"VELA.Entry.Request", 1, "other", Echo},
    {"VELA.Pipe.Ids", 1, "grantable", Ids},
    {"VELA.Pipe.Ids", 1, "dropped", Ids},
    {"VELA.Pipe.Ids", 1, "byUser", Ids},
    {"VELA.Pipe.Ids", 1, "byDefault", Ids},
    {"VELA.Pipe.Ids", 1, "unknownUser", Ids},
    {"VELA.Pipe.Ids", 1, "upload", Ids},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
