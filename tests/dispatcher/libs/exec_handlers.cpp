// Handlers of the exec handler tests (tests/subprocess/ExecHandlerTest.cpp).
// Each reports what it saw from inside the call, or misbehaves on purpose.
#include <climits>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <iostream>
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

std::string Env(const char* name)
{
    const char* value = getenv(name);
    return value ? value : "(unset)";
}

// A bounded count from a parameter; `def` when absent or out of range.
long long Count(APIRequest* req, const char* name, long long def)
{
    const Json::Value value = req->GetParam(name, static_cast<Json::Int64>(def));
    if (!value.isIntegral()) {
        return def;
    }
    const long long n = value.asInt64();
    return n >= 0 && n <= (64LL << 20) ? n : def;
}

bool WriteAll(int fd, const char* data, size_t len)
{
    while (len > 0) {
        const ssize_t n = write(fd, data, len);
        if (n <= 0) {
            return false;
        }
        data += n;
        len -= static_cast<size_t>(n);
    }
    return true;
}

// The process, identity and environment of the call, and what it was given.
// With a "marker" parameter, first creates that file.
void Report(APIRequest* req, APIResponse* resp)
{
    const std::string marker = req->GetParam("marker", "").asString();
    if (!marker.empty()) {
        const int fd = open(marker.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
        if (fd >= 0) {
            close(fd);
        }
    }
    char cwd[PATH_MAX];
    Json::Value data(Json::objectValue);
    data["pid"] = static_cast<Json::Int>(getpid());
    data["euid"] = static_cast<Json::UInt>(geteuid());
    data["egid"] = static_cast<Json::UInt>(getegid());
    data["USERNAME"] = Env("USERNAME");
    data["VELA_WEBAPI_USERNAME"] = Env("VELA_WEBAPI_USERNAME");
    data["user"] = req->GetLoginUserName();
    data["isAdmin"] = req->IsAdmin();
    data["api"] = req->GetAPIClass();
    data["version"] = req->GetAPIVersion();
    data["method"] = req->GetAPIMethod();
    data["params"] = req->GetParam("", Json::Value(Json::objectValue));
    data["attr"] = req->GetAttr("mark");
    data["requestMethod"] = req->GetRequestMethod();
    data["cwd"] = getcwd(cwd, sizeof(cwd)) ? cwd : "";
    data["pad"] = std::string(static_cast<size_t>(Count(req, "pad", 0)), 'p');
    resp->SetSuccess(data);
}

// Writes to its standard output, both through the descriptor and the stream
// object, and reads a line from its standard input.
void Noisy(APIRequest* req, APIResponse* resp)
{
    WriteAll(STDOUT_FILENO, "noise on fd 1\n", 14);
    std::cout << "noise on std::cout" << std::endl;
    char buf[256] = {0};
    const ssize_t n = read(STDIN_FILENO, buf, sizeof(buf) - 1);
    Json::Value data(Json::objectValue);
    data["stdin"] = std::string(buf, n > 0 ? static_cast<size_t>(n) : 0);
    resp->SetSuccess(data);
}

// Dies before answering: killed by SIGKILL ("how": "kill", the default) or
// by SIGSEGV ("segv"), or exiting at once ("exit").
void Crash(APIRequest* req, APIResponse*)
{
    const std::string how = req->GetParam("how", "kill").asString();
    if (how == "exit") {
        _exit(3);
    }
    raise(how == "segv" ? SIGSEGV : SIGKILL);
    _exit(4);
}

// A CGI reply on standard output: "raw" alone, exactly as given; otherwise
// the header block (one write, "Content-Type: application/octet-stream",
// an empty line) followed by "size" bytes of Body(). Answers with "pad"
// bytes of padding.
void Output(APIRequest* req, APIResponse* resp)
{
    if (req->HasParam("raw")) {
        const std::string raw = req->GetParam("raw", "").asString();
        WriteAll(STDOUT_FILENO, raw.data(), raw.size());
    } else {
        const std::string header = "Status: 200 OK\r\nContent-Type: application/octet-stream\r\n\r\n";
        WriteAll(STDOUT_FILENO, header.data(), header.size());
        const long long size = Count(req, "size", 0);
        std::string chunk;
        for (long long at = 0; at < size;) {
            chunk.clear();
            for (int i = 0; i < 65536 && at < size; ++i, ++at) {
                // Every byte value, NUL included, and now and then an empty
                // line inside the body.
                chunk += at % 1000 < 4 ? "\r\n\r\n"[at % 1000] : static_cast<char>((at * 7 + at / 251) & 0xff);
            }
            if (!WriteAll(STDOUT_FILENO, chunk.data(), chunk.size())) {
                break;
            }
        }
    }
    Json::Value data(Json::objectValue);
    data["pid"] = static_cast<Json::Int>(getpid());
    data["pad"] = std::string(static_cast<size_t>(Count(req, "pad", 0)), 'p');
    resp->SetSuccess(data);
}

// Leaves a process behind that holds every descriptor of the call (its
// standard output and its answer pipe) until someone opens the FIFO named
// by "fifo" for writing and closes it. Then dies ("how": "kill"), or writes
// a CGI reply ("X: 1", an empty line, "before") and answers with "pad"
// bytes of padding.
void Orphan(APIRequest* req, APIResponse* resp)
{
    const std::string fifo = req->GetParam("fifo", "").asString();
    const pid_t pid = fork();
    if (pid == 0) {
        const int fd = open(fifo.c_str(), O_RDONLY);
        char c;
        while (fd >= 0 && read(fd, &c, 1) > 0) {
        }
        _exit(0);
    }
    if (pid < 0 || req->GetParam("how", "kill").asString() == "kill") {
        raise(SIGKILL);
    }
    const std::string reply = "X: 1\r\n\r\nbefore";
    WriteAll(STDOUT_FILENO, reply.data(), reply.size());
    Json::Value data(Json::objectValue);
    data["pad"] = std::string(static_cast<size_t>(Count(req, "pad", 0)), 'p');
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Exec.Test", 1, "report", Report},
    {"VELA.Exec.Test", 1, "reportGrantable", Report},
    {"VELA.Exec.Test", 1, "reportDefault", Report},
    {"VELA.Exec.Test", 1, "noisy", Noisy},
    {"VELA.Exec.Test", 1, "crash", Crash},
    {"VELA.Exec.Test", 1, "output", Output},
    {"VELA.Exec.Test", 1, "orphan", Orphan},
    {"VELA.Exec.Ids", 1, "report", Report},
    {"VELA.Exec.Ids", 1, "reportGrantable", Report},
    {"VELA.Exec.Ids", 1, "reportDefault", Report},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
