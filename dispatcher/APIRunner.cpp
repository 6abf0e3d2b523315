// The runner: Run -> Initialize -> SetProcessName -> Process, which walks the
// road of Road.cpp. This file holds the runner's life, the default hooks,
// the entry points of the road and the road's stages that ask the hooks.
// The stage that refuses sets the response's error code; callers never set
// another.
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
#include "dispatcher/ProcessName.h"
#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "subprocess/CompoundHandler.h"
#include "subprocess/Detach.h"
#include "subprocess/ExecHandler.h"
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

}  // namespace

// ---- Construction -----------------------------------------------------------------

APIRunner::APIRunner() : request_(new APIRequest()), response_(nullptr), d_(nullptr)
{
    response_ = new APIResponse(request_);
    d_ = new APIRunnerPrivate(this);
    setsid();
    d_->registry.LoadDefaults(VELA::System::Path(kLibDefPath));
}

APIRunner::~APIRunner()
{
    CloseLib();
    delete response_;
    response_ = nullptr;
    delete request_;
    request_ = nullptr;
    RestoreProcessName(*d_);
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
    ResolvedCall call(*this, *d_, req, resp);
    const bool served = WalkRoad(call, RoadStart());
    if (call.named) {
        // A sub-request may have renamed the process.
        NameProcess(*d_, call.name, call.version, call.method, resp);
    }
    return served;
}

bool APIRunner::ProcessEntry(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    if (req->GetAPIMethod() != "request") {
        // No error code of its own: the response stays as it is.
        VELA_LOG_ERR("%s has no method \"%s\" here", kEntryAPI, LogSafe(req->GetAPIMethod()).c_str());
        return false;
    }
    if (req->HasParam("compound")) {
        ++d_->compoundDepth;
        const bool result = HandleCompound(req, resp);
        --d_->compoundDepth;
        return result;
    }
    VELA_REFUSE(resp, WEBAPI_ERR_COMPOUND_OR_FORK, "%s request without \"compound\"", kEntryAPI);
    return false;
}

bool APIRunner::HandleCompound(APIRequest* req, APIResponse* resp)
{
    CompoundHandler handler(req, resp, this);
    handler.SetLimits(LoadCompoundLimits(), d_->compoundDepth > 0 ? d_->compoundDepth - 1 : 0);
    return handler.Process();
}

bool APIRunner::ProcessLib(APIRequest* req, APIResponse* resp)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    ResolvedCall call(*this, *d_, req, resp);
    ResolveFromRequest(call);
    return WalkRoad(call, AskPermission);
}

// ---- Stages that ask the runner's hooks ---------------------------------------------

Step RefuseRelay(ResolvedCall& call)
{
    if (!call.req->HasParam("relay_ds")) {
        return Step::kGoOn;
    }
    VELA_REFUSE(call.resp, WEBAPI_ERR_RELAY_FAILED, "relaying %s to another service is not available",
                LogSafe(call.api).c_str());
    return Step::kStop;
}

Step RunEntryAPI(ResolvedCall& call)
{
    if (call.api != kEntryAPI) {
        return Step::kGoOn;
    }
    return call.runner.ProcessEntry(call.req, call.resp) ? Step::kServed : Step::kStop;
}

// A refusal of the permission hooks stops the call unless SkipPermission
// says to go on; the hook has set the error.
Step AskPermission(ResolvedCall& call)
{
    APIRunner& runner = call.runner;
    bool allowed = true;
    if (call.req->IsSharing()) {
        allowed = runner.CheckSharingPermission(call.req, call.resp);
    } else if (runner.NeedPermission(call.req)) {
        allowed = runner.CheckPermission(call.req, call.resp);
    }
    if (!allowed && !runner.SkipPermission(call.req)) {
        return Step::kStop;
    }
    return Step::kGoOn;
}

Step ReceiveUpload(ResolvedCall& call)
{
    if (!call.req->IsUploadRequest()) {
        return Step::kGoOn;
    }
    if (!call.Flag("allowUpload")) {
        // Only a call that skipped the description check gets here.
        VELA_LOG_ERR("upload to %s %d %s refused: no \"allowUpload\"", LogSafe(call.api).c_str(), call.version,
                     LogSafe(call.method).c_str());
        return Step::kStop;
    }
    return call.runner.HandleUpload(call.req, call.resp) ? Step::kGoOn : Step::kStop;
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
    try {
        ExecHandler handler(api, version, method, params, extra, user, fd);
        handler.Process(out);
    } catch (const std::exception& e) {
        // Out of memory before the call could start.
        VELA_LOG_ERR("running %s for a user failed: %s", api ? LogSafe(api).c_str() : "(null)", e.what());
        out = Json::Value(Json::objectValue);
        out["success"] = false;
        out["error"]["code"] = WEBAPI_ERR_NO_RESPONSE;
    } catch (...) {
        VELA_LOG_ERR("running %s for a user failed", api ? LogSafe(api).c_str() : "(null)");
        out = Json::Value(Json::objectValue);
        out["success"] = false;
        out["error"]["code"] = WEBAPI_ERR_NO_RESPONSE;
    }
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
