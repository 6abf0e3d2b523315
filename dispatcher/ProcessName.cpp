// The names under which the process shows the call it serves: the log
// identity, argument 0 (ps) and the thread name, "<prefix>_<api>_<version>_
// <method>". Only an API name that passed the name check is ever shown.
#include "dispatcher/ProcessName.h"

#include <cstdio>
#include <cstring>
#include <sys/prctl.h>
#include <syslog.h>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"

namespace VELA {

namespace {

// The log identity (first 1,024 bytes) and the thread name (last 17). syslog
// keeps the pointer given to openlog, so this outlives every call.
constexpr size_t kIdentSize = 1024;
constexpr size_t kThreadNameSize = 17;
char g_procName[kIdentSize + kThreadNameSize];

char* LogIdent() { return g_procName; }
char* ThreadName() { return g_procName + kIdentSize; }

// Control bytes of client text (the method) must not reach the log identity
// or ps: they become "?".
void Sanitize(char* text)
{
    for (unsigned char* p = reinterpret_cast<unsigned char*>(text); *p; ++p) {
        if (*p < 0x20 || *p == 0x7f) {
            *p = '?';
        }
    }
}

}  // namespace

const char* ProcessLogIdent() { return LogIdent(); }

bool NameProcess(APIRunnerPrivate& d, const APIName& api, int version, const std::string& method,
                 APIResponse* resp)
{
    char ident[kIdentSize];
    snprintf(ident, sizeof(ident), "%s_%s_%d_%s", d.GetProcName().c_str(), api.Text().c_str(), version,
             method.c_str());
    Sanitize(ident);
    char thread[kThreadNameSize];
    snprintf(thread, sizeof(thread), "%s_%d_%s", api.Text().c_str(), version, method.c_str());
    Sanitize(thread);
    if (strcmp(ident, LogIdent()) == 0 && strcmp(thread, ThreadName()) == 0 && d.ShowsName(ident)) {
        return true;  // the process already shows this call
    }
    memcpy(LogIdent(), ident, sizeof(ident));
    closelog();
    openlog(LogIdent(), LOG_CONS | LOG_PID, LOG_USER);
    d.SetArgv0(LogIdent());

    memcpy(ThreadName(), thread, sizeof(thread));
    if (prctl(PR_SET_NAME, ThreadName(), 0, 0, 0) != 0) {
        ThreadName()[0] = '\0';  // named again at the next call
        VELA_REFUSE(resp, WEBAPI_ERR_PROCESS_NAME, "Set process name fail[%m]");
        return false;
    }
    return true;
}

void RestoreProcessName(APIRunnerPrivate& d)
{
    const std::string& orig = d.GetOrigProcName();
    d.SetArgv0(orig.c_str());
    closelog();
    snprintf(LogIdent(), kIdentSize, "%s", orig.c_str());
    openlog(LogIdent(), LOG_CONS | LOG_PID, LOG_USER);
    snprintf(ThreadName(), kThreadNameSize, "%.16s", orig.c_str());
    prctl(PR_SET_NAME, ThreadName(), 0, 0, 0);
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
    APIName name;
    if (!d_->CheckName(api, name)) {
        return true;  // never shown; the road refuses the call
    }
    return NameProcess(*d_, name, req->GetAPIVersion(), req->GetAPIMethod(), resp);
}

Step NameProcessAfterCall(ResolvedCall& call)
{
    if (!NameProcess(call.d, call.name, call.version, call.method, call.resp)) {
        return Step::kStop;
    }
    call.named = true;
    return Step::kGoOn;
}

}  // namespace VELA
