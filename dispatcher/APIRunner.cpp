// The runner pipeline: Run -> Initialize -> SetProcessName -> Process ->
// (CheckRequestParam, AddAPIInfo) -> ProcessEntry or ProcessLib -> handler.
// Every stage returns whether to go on; the stage that refuses sets the
// response's error code, callers never set another.
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <exception>
#include <fcntl.h>
#include <fstream>
#include <iostream>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/ExecContext.h"
#include "dispatcher/Refusal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

extern char** environ;

namespace VELA {

namespace {

const char kLibDefPath[] = "/usr/vela/velaman/webapi/lib.def";
const char kEntryAPI[] = "VELA.Entry.Request";

// The log identity (first 1,024 bytes) and the thread name (last 17). syslog
// keeps the pointer given to openlog, so this outlives every call.
constexpr size_t kIdentSize = 1024;
constexpr size_t kThreadNameSize = 17;
char g_procName[kIdentSize + kThreadNameSize];

char* LogIdent() { return g_procName; }
char* ThreadName() { return g_procName + kIdentSize; }

// Control bytes of a client-chosen name must not reach the log identity or
// ps: they become "?".
void Sanitize(char* text)
{
    for (unsigned char* p = reinterpret_cast<unsigned char*>(text); *p; ++p) {
        if (*p < 0x20 || *p == 0x7f) {
            *p = '?';
        }
    }
}

// What a call changes around its handler and puts back on every way out:
// the standard stream objects, the scheduling priority and the working
// directory.
class CallScope {
public:
    CallScope() = default;
    CallScope(const CallScope&) = delete;
    CallScope& operator=(const CallScope&) = delete;
    ~CallScope() { Restore(); }

    // std::cin reads /dev/null unless `keepIn`; std::cout writes to
    // /dev/null unless `keepOut`. Only the stream objects change; the file
    // descriptors stay as they are.
    void RedirectStreams(bool keepIn, bool keepOut)
    {
        if (!keepIn) {
            if (nullIn_.open("/dev/null", std::ios::in)) {
                oldIn_ = std::cin.rdbuf(&nullIn_);
            } else {
                VELA_LOG_ERR("cannot open /dev/null for reading");
            }
        }
        if (!keepOut) {
            std::cout.flush();
            if (nullOut_.open("/dev/null", std::ios::out | std::ios::trunc)) {
                oldOut_ = std::cout.rdbuf(&nullOut_);
            } else {
                VELA_LOG_ERR("cannot open /dev/null for writing");
            }
        }
    }

    // Sets the nice value `priority` when the process runs with another.
    void SetPriority(int priority)
    {
        errno = 0;
        const int current = getpriority(PRIO_PROCESS, 0);
        if (current == -1 && errno != 0) {
            VELA_LOG_ERR("getpriority failed [%m]");
            return;
        }
        if (current == priority) {
            return;
        }
        if (setpriority(PRIO_PROCESS, 0, priority) != 0) {
            VELA_LOG_ERR("setpriority(%d) failed [%m]", priority);
            return;
        }
        oldPriority_ = current;
        priorityChanged_ = true;
    }

    bool SaveCwd()
    {
        char buf[PATH_MAX];
        if (getcwd(buf, sizeof(buf)) == nullptr) {
            VELA_LOG_ERR("getcwd failed [%m]");
            return false;
        }
        cwd_ = buf;
        return true;
    }

    void Restore()
    {
        if (priorityChanged_) {
            priorityChanged_ = false;
            if (setpriority(PRIO_PROCESS, 0, oldPriority_) != 0) {
                VELA_LOG_ERR("setpriority(%d) failed [%m]", oldPriority_);
            }
        }
        if (oldIn_) {
            std::cin.rdbuf(oldIn_);
            oldIn_ = nullptr;
        }
        if (oldOut_) {
            std::cout.rdbuf(oldOut_);
            oldOut_ = nullptr;
        }
        nullIn_.close();
        nullOut_.close();
        if (!cwd_.empty()) {
            if (chdir(cwd_.c_str()) != 0) {
                VELA_LOG_ERR("cannot change back to %s [%m]", cwd_.c_str());
            }
            cwd_.clear();
        }
    }

private:
    std::filebuf nullIn_;
    std::filebuf nullOut_;
    std::streambuf* oldIn_ = nullptr;
    std::streambuf* oldOut_ = nullptr;
    int oldPriority_ = 0;
    bool priorityChanged_ = false;
    std::string cwd_;
};

bool Matches(const char* api, int version, const char* method, const std::string& wantApi, int wantVersion,
             const std::string& wantMethod)
{
    return version == wantVersion && api != nullptr && method != nullptr && wantApi == api &&
           wantMethod == method;
}

// The check of the entry for the call, or of the terminating entry when none
// names it: a terminating entry's check vets every call no entry names.
APICheckFn FindCheck(const _tag_API_CHECK_TABLE* check, const std::string& api, int version,
                     const std::string& method)
{
    const _tag_API_CHECK_TABLE* e = check;
    while (e->api != nullptr && !Matches(e->api, e->version, e->method, api, version, method)) {
        ++e;
    }
    return e->check;
}

const _tag_API_TABLE* FindEntry(const _tag_API_TABLE* table, const std::string& api, int version,
                                const std::string& method)
{
    for (const _tag_API_TABLE* e = table; e->api != nullptr; ++e) {
        if (Matches(e->api, e->version, e->method, api, version, method)) {
            return e;
        }
    }
    return nullptr;
}

// The answer of the exec calls until the exec handler exists.
void ExecUnavailable(Json::Value& out, const char* api, const char* method)
{
    VELA_LOG_ERR("running %s %s for a user is not available", api ? api : "(null)", method ? method : "(null)");
    out = Json::Value(Json::objectValue);
    out["success"] = false;
    out["error"]["code"] = WEBAPI_ERR_NO_RESPONSE;
}

}  // namespace

// ---- Construction -----------------------------------------------------------------

APIRunner::APIRunner()
    : libDef_(Json::objectValue),
      libDesc_(Json::objectValue),
      request_(new APIRequest()),
      response_(nullptr),
      compoundDepth_(0),
      d_(nullptr)
{
    response_ = new APIResponse(request_);
    d_ = new APIRunnerPrivate(this);
    setsid();
    Json::Value def;
    if (WebAPIUtil::ReadJsonFile(VelaPath(kLibDefPath), def) && def.isObject()) {
        libDef_ = def;
    }
}

APIRunner::~APIRunner()
{
    CloseLib();
    delete response_;
    response_ = nullptr;
    delete request_;
    request_ = nullptr;

    const std::string& orig = d_->GetOrigProcName();
    d_->SetArgv0(orig.c_str());
    closelog();
    snprintf(LogIdent(), kIdentSize, "%s", orig.c_str());
    openlog(LogIdent(), LOG_CONS | LOG_PID, LOG_USER);
    snprintf(ThreadName(), kThreadNameSize, "%.16s", orig.c_str());
    prctl(PR_SET_NAME, ThreadName(), 0, 0, 0);
    delete d_;
}

// ---- Hooks ------------------------------------------------------------------------

bool APIRunner::CheckSharingPermission(APIRequest*, APIResponse*) { return true; }

bool APIRunner::NeedPermission(APIRequest*) { return false; }

bool APIRunner::CheckPermission(APIRequest*, APIResponse*) { return true; }

bool APIRunner::HandleUpload(APIRequest*, APIResponse*) { return true; }

bool APIRunner::SkipPermission(APIRequest*) { return true; }

void APIRunner::SetArgs(int argc, char** argv) { d_->SetArgs(argc, argv); }

// ---- Pipeline -----------------------------------------------------------------------

bool APIRunner::Run(const Json::Value& request)
{
    try {
        if (request.isNull()) {
            VELA_REFUSE(response_, WEBAPI_ERR_BAD_REQUEST, "request refused: no request JSON");
            return false;
        }
        if (!Initialize(request)) {
            return false;
        }
        if (!SetProcessName(request_, response_)) {
            return false;
        }
        // Relayed requests are the front end's business, never run from JSON.
        if (request_->HasParam("relay_ds")) {
            VELA_REFUSE(response_, WEBAPI_ERR_BAD_REQUEST, "request refused: relayed requests are not run from JSON");
            return false;
        }
        return Process(request_, response_);
    } catch (const std::exception& e) {
        VELA_REFUSE(response_, WEBAPI_ERR_NO_RESPONSE, "request failed: %s", e.what());
    } catch (...) {
        VELA_REFUSE(response_, WEBAPI_ERR_NO_RESPONSE, "request failed");
    }
    return false;
}

bool APIRunner::InitEnv(Json::Value& env)
{
    if (!env.isObject()) {
        return false;
    }
    for (char** entry = environ; entry != nullptr && *entry != nullptr; ++entry) {
        const char* eq = strchr(*entry, '=');
        if (eq == nullptr || eq == *entry) {
            continue;
        }
        env[std::string(*entry, static_cast<size_t>(eq - *entry))] = eq + 1;
    }
    return true;
}

bool APIRunner::Initialize(const Json::Value& request)
{
    Json::Value env(Json::objectValue);
    if (!InitEnv(env)) {
        VELA_REFUSE(response_, WEBAPI_ERR_BAD_REQUEST, "request refused: no environment");
        return false;
    }
    request_->InitEnv(env);
    if (request.isObject()) {
        if (const Json::Value* environ_ = request.find("environ", "environ" + 7)) {
            request_->InitEnv(*environ_);
        }
        if (const Json::Value* session = request.find("session", "session" + 7)) {
            request_->InitSession(*session);
        }
        const Json::Value* attr = request.find("attr", "attr" + 4);
        if (attr != nullptr && attr->isObject()) {
            for (Json::Value::const_iterator it = attr->begin(); it != attr->end(); ++it) {
                request_->SetAttr(it.name(), *it);
            }
        }
    }
    if (request.empty()) {
        VELA_REFUSE(response_, WEBAPI_ERR_BAD_REQUEST, "request refused: empty request JSON");
        return false;
    }
    request_->InitParam(request, false);
    return true;
}

bool APIRunner::Process(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    if (!SetProcessName(req, resp)) {
        return false;
    }
    if (!CheckRequestParam(req, resp) || !AddAPIInfo(req)) {
        return false;
    }
    if (req->HasParam("relay_ds")) {
        VELA_REFUSE(resp, WEBAPI_ERR_RELAY_FAILED, "relaying %s to another service is not available",
                    LogSafe(req->GetAPIClass()).c_str());
        return false;
    }
    bool result = false;
    try {
        result = req->GetAPIClass() == kEntryAPI ? ProcessEntry(req, resp) : ProcessLib(req, resp);
    } catch (const std::exception& e) {
        VELA_LOG_ERR("%s failed: %s", req->GetAPIClass().c_str(), e.what());
    } catch (...) {
        VELA_LOG_ERR("%s failed", req->GetAPIClass().c_str());
    }
    // A compound sub-request may have renamed the process.
    SetProcessName(req, resp);
    return result;
}

bool APIRunner::ProcessEntry(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr || req->GetAPIMethod() != "request") {
        return false;
    }
    if (req->HasParam("compound")) {
        ++compoundDepth_;
        const bool result = HandleCompound(req, resp);
        --compoundDepth_;
        return result;
    }
    VELA_REFUSE(resp, WEBAPI_ERR_COMPOUND_OR_FORK, "%s request without \"compound\"", kEntryAPI);
    return false;
}

bool APIRunner::HandleCompound(APIRequest* req, APIResponse* resp)
{
    // Compound requests are not served yet: refuse rather than pretend.
    VELA_REFUSE(resp, WEBAPI_ERR_NO_RESPONSE, "compound requests are not available");
    return false;
}

bool APIRunner::ProcessLib(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    // 1. Permission: a refusal stops the call unless SkipPermission says
    //    to go on.
    bool allowed = true;
    if (req->IsSharing()) {
        allowed = CheckSharingPermission(req, resp);
    } else if (NeedPermission(req)) {
        allowed = CheckPermission(req, resp);
    }
    if (!allowed && !SkipPermission(req)) {
        return false;
    }

    // 2. The call and its method's attributes. The call is fixed here, as
    //    the checks saw it: whatever later steps merge into the request's
    //    parameters (an upload's form fields), the library, the entry and
    //    the identity below are those of this API, version and method.
    const std::string api = req->GetAPIClass();
    const std::string method = req->GetAPIMethod();
    const int version = req->GetAPIVersion();
    const Json::Value attrs = GetMethod(api, version, method);
    auto attr = [&](const char* name) { return GetMethodAttr(api, version, method, name); };
    const bool allowUpload = attr("allowUpload");
    const bool allowDownload = attr("allowDownload");

    // 3. Usage counting.
    if (JsonFlag(request_->GetAttr("_collector_count_webapi"), false) && !attr("allowTimeout") &&
        JsonFlag(req->GetAPIInfo("count"), true)) {
        IncreaseCounter(req);
    }

    // 4. Upload.
    if (req->IsUploadRequest()) {
        if (!allowUpload || !HandleUpload(req, resp)) {
            return false;
        }
    }

    // 5. Handler library and its tables.
    _tag_API_TABLE* table = nullptr;
    _tag_API_CHECK_TABLE* check = nullptr;
    if (!OpenLib(req, &table, &check)) {
        // OpenLib has logged why.
        resp->SetError(WEBAPI_ERR_LOAD_LIBRARY);
        return false;
    }
    if (table == nullptr) {
        VELA_REFUSE(resp, WEBAPI_ERR_LOAD_LIBRARY, "library of %s has no API table", LogSafe(api).c_str());
        return false;
    }

    // 6., 7. Standard streams and priority; put back by `scope` (step 12)
    //    on every way out from here on.
    CallScope scope;
    scope.RedirectStreams(allowUpload, allowDownload);
    const Json::Value priority = req->GetAPIInfo("priority");
    int nice = priority.isInt() ? priority.asInt() : 0;
    nice = nice < -20 ? -20 : (nice > 19 ? 19 : nice);
    scope.SetPriority(nice);

    // 8. Check table, then the API table.
    if (check != nullptr) {
        APICheckFn checkFn = FindCheck(check, api, version, method);
        if (checkFn != nullptr && !checkFn(req, resp)) {
            return false;
        }
    }
    const _tag_API_TABLE* entry = FindEntry(table, api, version, method);
    if (entry == nullptr) {
        VELA_REFUSE(resp, WEBAPI_ERR_METHOD_NOT_IN_TABLE, "%s %d %s is not in its library's API table",
                    LogSafe(api).c_str(), version, LogSafe(method).c_str());
        return false;
    }
    // A handler that answers nothing answers 117.
    resp->SetError(WEBAPI_ERR_NO_RESPONSE);

    // 9. Working directory and ids to come back to.
    ExecContext identity;
    if (!scope.SaveCwd()) {
        return false;  // logged by SaveCwd; the preset 117 answers
    }
    if (!identity.SaveIds()) {
        VELA_REFUSE(resp, WEBAPI_ERR_NO_RESPONSE, "cannot read the ids to come back to");
        return false;
    }

    // 10. Identity of the call.
    ExecIdentity want;
    const Json::Value runAs = req->GetAPIInfo("runAs", VELA_RUNAS_SUPERUSER);
    want.runAs = runAs.isString() ? runAs.asString() : VELA_RUNAS_SUPERUSER;
    if (attrs.isObject()) {
        const Json::Value* methodRunAs = attrs.find("runAs", "runAs" + 5);
        if (methodRunAs != nullptr && methodRunAs->isString()) {
            want.runAs = methodRunAs->asString();
        }
    }
    want.loginName = req->GetLoginUserName();
    want.grantable = attr("grantable");
    want.grantByDefault = attr("grantByDefault");
    want.grantByUser = attr("grantByUser");
    if (!identity.Prepare(want)) {
        return false;
    }

    // 11. The handler, then the identity back.
    if (entry->handler != nullptr) {
        try {
            entry->handler(req, resp);
        } catch (const std::exception& e) {
            VELA_LOG_ERR("handler of %s %s failed: %s", api.c_str(), method.c_str(), e.what());
        } catch (...) {
            VELA_LOG_ERR("handler of %s %s failed", api.c_str(), method.c_str());
        }
    }
    identity.Restore();
    // 12. `scope` puts streams, priority and working directory back.
    return entry->handler != nullptr;
}

bool APIRunner::SetProcessName(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    const std::string api = req->GetAPIClass();
    if (api.empty()) {
        VELA_REFUSE(resp, WEBAPI_ERR_BAD_REQUEST, "request refused: no API name");
        return false;
    }
    const std::string method = req->GetAPIMethod();
    const int version = req->GetAPIVersion();

    snprintf(LogIdent(), kIdentSize, "%s_%s_%d_%s", d_->GetProcName().c_str(), api.c_str(), version,
             method.c_str());
    Sanitize(LogIdent());
    closelog();
    openlog(LogIdent(), LOG_CONS | LOG_PID, LOG_USER);
    d_->SetArgv0(LogIdent());

    snprintf(ThreadName(), kThreadNameSize, "%s_%d_%s", api.c_str(), version, method.c_str());
    Sanitize(ThreadName());
    if (prctl(PR_SET_NAME, ThreadName(), 0, 0, 0) != 0) {
        VELA_REFUSE(resp, WEBAPI_ERR_PROCESS_NAME, "Set process name fail[%m]");
        return false;
    }
    return true;
}

// ---- Answer and after-reply work ----------------------------------------------------

Json::Value APIRunner::GetResponse()
{
    if (response_ == nullptr) {
        return Json::Value();
    }
    Json::Value body = response_->GetBody();
    body["httpd_restart"] = response_->GetHttpdRestart();
    return body;
}

namespace {

bool IsPipeOrSocket(int fd)
{
    struct stat st;
    return fstat(fd, &st) == 0 && (S_ISFIFO(st.st_mode) || S_ISSOCK(st.st_mode));
}

// The descriptors of this process above standard error.
std::vector<int> OpenDescriptors()
{
    std::vector<int> fds;
    DIR* dir = opendir("/proc/self/fd");
    if (dir == nullptr) {
        const long max = sysconf(_SC_OPEN_MAX);
        for (int fd = 3; fd < (max > 0 && max < 65536 ? max : 65536); ++fd) {
            if (fcntl(fd, F_GETFD) >= 0) {
                fds.push_back(fd);
            }
        }
        return fds;
    }
    for (struct dirent* entry; (entry = readdir(dir)) != nullptr;) {
        char* end = nullptr;
        const long fd = strtol(entry->d_name, &end, 10);
        if (end != entry->d_name && *end == '\0' && fd > 2 && fd != dirfd(dir) && fd <= INT_MAX) {
            fds.push_back(static_cast<int>(fd));
        }
    }
    closedir(dir);
    return fds;
}

// In the after-reply child: lets go of every descriptor the web server may
// be waiting on, since a CGI answer ends only when every process holding
// its write end has closed it. Standard input and output go to /dev/null,
// standard error too when it is a pipe or a socket (a log file stays), and
// every other inherited pipe or socket is closed; the system log's socket
// goes with them and is opened again by the next line logged.
void LetGoOfTheReply()
{
    const int null = open("/dev/null", O_RDWR);
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
        if (fd == STDERR_FILENO && !IsPipeOrSocket(fd)) {
            continue;
        }
        if (null < 0) {
            close(fd);
        } else if (null != fd) {
            dup2(null, fd);
        }
    }
    if (null > STDERR_FILENO) {
        close(null);
    }
    closelog();
    for (int fd : OpenDescriptors()) {
        if (IsPipeOrSocket(fd)) {
            close(fd);
        }
    }
    if (LogIdent()[0] != '\0') {
        openlog(LogIdent(), LOG_CONS | LOG_PID, LOG_USER);
    }
}

}  // namespace

void APIRunner::HandleCallback(APIResponse* resp)
{
    if (resp == nullptr || resp->GetCallbackFuncs().empty()) {
        return;
    }
    // The reply is out of this process before the child is made, and the
    // child has no copy of it to write again.
    std::cout.flush();
    std::cerr.flush();
    const pid_t pid = VLIBCProcFork();
    if (pid != 0) {
        if (pid < 0) {
            VELA_LOG_ERR("cannot fork for the callbacks [%m]");
        }
        return;
    }
    // The child: the reply reaches the client first, and is not held open
    // while the callbacks run.
    setsid();
    LetGoOfTheReply();
    sleep(1);
    for (const auto& callback : resp->GetCallbackFuncs()) {
        if (callback.first != nullptr) {
            callback.first(callback.second);
        }
    }
    _exit(0);
}

// ---- Running an API for a user --------------------------------------------------------

void APIRunner::Exec(Json::Value& out, int fd, const char* api, int version, const char* method,
                     const Json::Value& params, const Json::Value& extra, const char* user)
{
    ExecUnavailable(out, api, method);
}

void APIRunner::Exec(Json::Value& out, const char* api, int version, const char* method,
                     const Json::Value& params, const Json::Value& extra, const char* user)
{
    Exec(out, -1, api, version, method, params, extra, user);
}

void APIRunner::Exec(Json::Value& out, const char* api, int version, const char* method,
                     const Json::Value& params, const char* user)
{
    Exec(out, -1, api, version, method, params, Json::Value(Json::objectValue), user);
}

}  // namespace VELA
