// Handlers of the dispatcher tests (VELA.Pipe.*), of the exec handler and
// compound tests (VELA.Pipe.Sub) and of the end-to-end tests. Each reports what it saw from inside the call through the
// response, so the tests read the facts of the call itself, or misbehaves
// on purpose.
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <iostream>
#include <stdexcept>
#include <string>
#include <sys/resource.h>
#include <unistd.h>

#include <json/json.h>

#include "webapi/APIDownload.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#include "ProcessIds.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

std::string Cwd()
{
    char buf[PATH_MAX];
    return getcwd(buf, sizeof(buf)) ? buf : "";
}

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

// "pad" bytes of padding, to make an answer as large as a test needs.
std::string Pad(APIRequest* req)
{
    return std::string(static_cast<size_t>(Count(req, "pad", 0)), 'p');
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
    // "error": a server error for the reply's header as well.
    if (req->HasParam("error")) {
        resp->SetServerError(req->GetParam("error").asString());
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

// The ids, groups, process and environment of the call, and what it was
// given, with "pad" bytes of padding. With a "marker" parameter, first
// creates that file (the tests' witness that a call ran).
void Report(APIRequest* req, APIResponse* resp)
{
    const std::string marker = req->GetParam("marker", "").asString();
    if (!marker.empty()) {
        close(open(marker.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    }
    Json::Value data = ProcessIds();
    if (data.empty()) {
        resp->SetError(500);
        return;
    }
    data["pid"] = static_cast<Json::Int>(getpid());
    data["USERNAME"] = Env("USERNAME");
    data["VELA_WEBAPI_USERNAME"] = Env("VELA_WEBAPI_USERNAME");
    data["user"] = req->GetLoginUserName();
    data["isAdmin"] = req->IsAdmin();
    data["api"] = req->GetAPIClass();
    data["version"] = req->GetAPIVersion();
    data["method"] = req->GetAPIMethod();
    data["params"] = req->GetParam("", Json::Value(Json::objectValue));
    data["methodParam"] = req->GetParam("method", "");
    data["attr"] = req->GetAttr("mark");
    data["requestMethod"] = req->GetRequestMethod();
    data["cwd"] = Cwd();
    data["pad"] = Pad(req);
    resp->SetSuccess(data);
}

void Fail(APIRequest*, APIResponse* resp) { resp->SetError(1001); }

// Writes its pid into the file named by "pidfile", sleeps "ms"
// milliseconds (at most 10 s), then reports.
void Sleep(APIRequest* req, APIResponse* resp)
{
    const std::string pidfile = req->GetParam("pidfile", "").asString();
    if (FILE* f = pidfile.empty() ? nullptr : fopen(pidfile.c_str(), "we")) {
        fprintf(f, "%d\n", static_cast<int>(getpid()));
        fclose(f);
    }
    const Json::Value given = req->GetParam("ms", 0);  // a number, or the text of one from a query
    const int ms = given.isString() ? atoi(given.asCString()) : given.asInt();
    usleep(static_cast<useconds_t>(ms > 0 && ms <= 10000 ? ms : 0) * 1000u);
    Report(req, resp);
}

// Writes to its standard output, both through the descriptor and the stream
// object, and reads what its standard input holds.
void Noisy(APIRequest*, APIResponse* resp)
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
// the header block (one write, ending in an empty line) followed by "size"
// bytes of body. Answers with its pid and "pad" bytes of padding.
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
    data["pad"] = Pad(req);
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
    data["pad"] = Pad(req);
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
    {"VELA.Pipe.Ids", 1, "grantable", Report},
    {"VELA.Pipe.Ids", 1, "dropped", Report},
    {"VELA.Pipe.Ids", 1, "byUser", Report},
    {"VELA.Pipe.Ids", 1, "byDefault", Report},
    {"VELA.Pipe.Ids", 1, "unknownUser", Report},
    {"VELA.Pipe.Ids", 1, "upload", Report},
    {"VELA.Pipe.Sub", 1, "report", Report},
    {"VELA.Pipe.Sub", 1, "reportGrantable", Report},
    {"VELA.Pipe.Sub", 1, "reportDefault", Report},
    {"VELA.Pipe.Sub", 1, "fail", Fail},
    {"VELA.Pipe.Sub", 1, "sleep", Sleep},
    {"VELA.Pipe.Sub", 1, "callback", Callback},
    {"VELA.Pipe.Sub", 1, "noisy", Noisy},
    {"VELA.Pipe.Sub", 1, "crash", Crash},
    {"VELA.Pipe.Sub", 1, "output", Output},
    {"VELA.Pipe.Sub", 1, "orphan", Orphan},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
