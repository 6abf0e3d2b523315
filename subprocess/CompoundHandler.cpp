// Compound requests (see CompoundHandler.h).
#include "subprocess/CompoundHandler.h"

#include <cerrno>
#include <csignal>
#include <ctime>
#include <fcntl.h>
#include <new>
#include <poll.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "dispatcher/Refusal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"
#include "request/APIRequestPrivate.h"

namespace VELA {

namespace {

const char kConfPath[] = "/etc/vela/webapi.conf";
const char kStopText[] = "compound stop when error.";
const char kTransferText[] = "not allow upload or download API.";
// Flags of the children's fork: detached (never a zombie of this process)
// and with default signal handling.
const int kChildForkFlags = VLIBC_FORK_DETACH | VLIBC_FORK_DEFAULT_SIGNALS;
// How often a child with callbacks looks whether its parent is gone.
const useconds_t kParentProbeMicros = 200000;

long long NowMillis()
{
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<long long>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// "compound" as the request carries it: an array, or (from a query string
// or a form) the JSON text of one. Anything else is null.
Json::Value CompoundParam(const APIRequest& req)
{
    Json::Value compound = req.GetParam("compound");
    if (compound.isString()) {
        Json::Value parsed;
        compound = JsonParse(compound.asString(), parsed) ? parsed : Json::Value();
    }
    return compound;
}

// A yes/no parameter sent as a boolean or, from a form, as "true"/"false".
bool FlagParam(const APIRequest& req, const char* name)
{
    const Json::Value value = req.GetParam(name);
    if (value.isString()) {
        return value.asString() == "true";
    }
    return value.isBool() && value.asBool();
}

// The calls of `compound` and of the compounds nested in its entries, up
// to `budget` (counting stops there); false when nesting goes deeper than
// `depthLeft` levels.
bool CountCalls(const Json::Value& compound, long long depthLeft, long long budget, long long& count)
{
    if (depthLeft <= 0) {
        return false;
    }
    for (const Json::Value& entry : compound) {
        if (++count > budget) {
            return true;
        }
        const Json::Value* inner = entry.isObject() ? entry.find("compound", "compound" + 8) : nullptr;
        if (inner != nullptr && inner->isArray() && !CountCalls(*inner, depthLeft - 1, budget, count)) {
            return false;
        }
    }
    return true;
}

// Whether `entry` names its own call. The sub-request is reused from call
// to call and keeps the names of the last call that gave them, so an entry
// without its own would run as the call before it.
bool NamesItsCall(const Json::Value& entry)
{
    return entry.isObject() && entry.isMember("api") && entry.isMember("version") && entry.isMember("method");
}

// Standard input and output of a child point at /dev/null: the child never
// reads the request body nor writes into the reply.
void DetachStandardStreams()
{
    const int null = open("/dev/null", O_RDWR);
    if (null < 0) {
        close(STDIN_FILENO);
        close(STDOUT_FILENO);
        return;
    }
    dup2(null, STDIN_FILENO);
    dup2(null, STDOUT_FILENO);
    if (null > STDERR_FILENO) {
        close(null);
    }
}

}  // namespace

CompoundLimits LoadCompoundLimits()
{
    CompoundLimits limits;
    std::vector<std::pair<std::string, std::string>> settings;
    if (System::ReadKeyValueFile(kConfPath, settings) <= 0) {
        return limits;
    }
    System::NumberSetting(settings, kConfPath, "compound_max_calls", 1, 100000, limits.maxCalls);
    System::NumberSetting(settings, kConfPath, "compound_max_depth", 1, 16, limits.maxDepth);
    System::NumberSetting(settings, kConfPath, "compound_max_children", 1, 1024, limits.maxChildren);
    System::NumberSetting(settings, kConfPath, "compound_child_seconds", 1, 86400, limits.childSeconds);
    return limits;
}

CompoundHandler::CompoundHandler(APIRequest* req, APIResponse* resp, APIRunner* runner)
    : req_(req), resp_(resp), runner_(runner), output_(Json::objectValue), info_(Json::arrayValue)
{
}

CompoundHandler::~CompoundHandler()
{
    for (LiveChild& child : children_) {
        delete child.pipe.first;
        if (child.pidfd >= 0) {
            close(child.pidfd);
        }
    }
    delete subResp_;
    delete subReq_;
}

void CompoundHandler::SetLimits(const CompoundLimits& limits, int depth)
{
    limits_ = limits;
    depth_ = depth;
}

bool CompoundHandler::Process()
{
    _tag_WEBAPI_ERR code = ParseParams();
    if (code != WEBAPI_ERR_NONE) {
        VELA_LOG_ERR("ParseParams failed");
    } else if ((code = PrepareNewCompReqResp()) != WEBAPI_ERR_NONE) {
        VELA_LOG_ERR("PrepareNewCompReqResp failed");
    } else if ((code = CompoundProcess()) != WEBAPI_ERR_NONE) {
        VELA_LOG_ERR("CompoundProcess failed");
    }
    if (code != WEBAPI_ERR_NONE) {
        resp_->SetError(code);
    }
    Output(code);
    return code == WEBAPI_ERR_NONE;
}

_tag_WEBAPI_ERR CompoundHandler::ParseParams()
{
    parallel_ = req_->GetParam("mode", "sequential") == Json::Value("parallel");
    stopWhenError_ = !parallel_ && FlagParam(*req_, "stop_when_error");
    compound_ = CompoundParam(*req_);
    if (!compound_.isArray()) {
        errorText_ = "\"compound\" is not an array of calls";
        return WEBAPI_ERR_COMPOUND_OR_FORK;
    }
    return CheckBounds();
}

// Refuses, before anything runs, a compound of more calls than the limit
// (nested ones counted) or nested deeper than the limit.
_tag_WEBAPI_ERR CompoundHandler::CheckBounds()
{
    long long count = 0;
    if (!CountCalls(compound_, limits_.maxDepth - depth_, limits_.maxCalls, count)) {
        errorText_ = "compound requests nested deeper than " + std::to_string(limits_.maxDepth);
    } else if (count > limits_.maxCalls) {
        errorText_ = "compound of more than " + std::to_string(limits_.maxCalls) + " calls";
    } else {
        return WEBAPI_ERR_NONE;
    }
    VELA_LOG_ERR("refused: %s", errorText_.c_str());
    return WEBAPI_ERR_COMPOUND_OR_FORK;
}

_tag_WEBAPI_ERR CompoundHandler::PrepareNewCompReqResp()
{
    subReq_ = new (std::nothrow) APIRequest(*req_);
    if (subReq_ == nullptr) {
        VELA_LOG_ERR("new APIRequest Fail");
        return WEBAPI_ERR_NO_RESPONSE;
    }
    subReq_->GetPrivate()->ClearData("environ", "QUERY_STRING");
    subReq_->GetPrivate()->SetData("environ", "REQUEST_METHOD", Json::Value("POST"), false);
    Json::Value empty(Json::objectValue);
    empty["postParam"] = Json::Value(Json::objectValue);
    subReq_->InitParam(empty, true);
    subResp_ = new (std::nothrow) APIResponse(subReq_);
    if (subResp_ == nullptr) {
        VELA_LOG_ERR("new APIResponse Fail");
        return WEBAPI_ERR_NO_RESPONSE;
    }
    return WEBAPI_ERR_NONE;
}

// Each call answers into a response of its own, so headers, errors and
// restart requests of one call never show in the next one's answer.
void CompoundHandler::NewSubResponse()
{
    APIResponse* fresh = new (std::nothrow) APIResponse(subReq_);
    if (fresh != nullptr) {
        delete subResp_;
        subResp_ = fresh;
    }
}

void CompoundHandler::PreloadLibs()
{
    for (const Json::Value& entry : compound_) {
        PreloadEntry(entry, depth_);
    }
}

// Describes the call and opens its library, so that every library of the
// compound is loaded before any handler runs; a call that cannot be
// described is left for its own turn to refuse.
void CompoundHandler::PreloadEntry(const Json::Value& entry, int depth)
{
    if (!NamesItsCall(entry)) {
        return;
    }
    Json::Value request(Json::objectValue);
    request["postParam"] = entry;
    subReq_->InitParam(request, true);
    runner_->GetMethod(subReq_->GetAPIClass(), subReq_->GetAPIVersion(), subReq_->GetAPIMethod());
    void* handle = nullptr;
    if (runner_->AddAPIInfo(subReq_)) {
        runner_->CacheLib(subReq_, &handle);
    }
    const Json::Value* inner = entry.find("compound", "compound" + 8);
    if (inner != nullptr && inner->isArray() && depth + 1 < limits_.maxDepth) {
        for (const Json::Value& nested : *inner) {
            PreloadEntry(nested, depth + 1);
        }
    }
}

_tag_WEBAPI_ERR CompoundHandler::CompoundProcess()
{
    output_["result"] = Json::Value(Json::arrayValue);
    if (!parallel_) {
        PreloadLibs();
    }
    for (Json::ArrayIndex index = 0; index < compound_.size(); ++index) {
        if (CompoundProcessEntry(compound_[index], index) != WEBAPI_ERR_NONE) {
            hasFail_ = true;
        }
    }
    for (LiveChild& child : children_) {
        PrepareCompundResponseFromChild(child);
    }
    HandleCompoundInfo();
    return WEBAPI_ERR_NONE;
}

_tag_WEBAPI_ERR CompoundHandler::CompoundProcessEntry(const Json::Value& entry, unsigned int index)
{
    Json::Value request(Json::objectValue);
    request["postParam"] = entry;
    subReq_->InitParam(request, true);
    NewSubResponse();
    _tag_WEBAPI_ERR code = WEBAPI_ERR_NONE;
    const std::string api = subReq_->GetAPIClass();
    const int version = subReq_->GetAPIVersion();
    const std::string method = subReq_->GetAPIMethod();
    ChildPipe child(nullptr, index);
    const Json::Value* attrs = nullptr;
    // One look-up of the method's attributes per call.
    auto flag = [&](const char* name) {
        if (attrs == nullptr) {
            attrs = &runner_->GetMethod(api, version, method);
        }
        return attrs->isObject() && JsonFlag((*attrs)[name]);
    };
    if (stopWhenError_ && hasFail_) {
        errorText_ = kStopText;
        code = WEBAPI_ERR_COMPOUND_STOPPED;
    } else if (!NamesItsCall(entry)) {
        VELA_LOG_ERR("call %u names no api, version and method", index);
        subResp_->SetError(WEBAPI_ERR_BAD_REQUEST);
        output_["result"][index] = subResp_->GetBody();
        info_[index] = Json::Value(Json::objectValue);
        info_[index]["error"] = WEBAPI_ERR_BAD_REQUEST;
        return WEBAPI_ERR_BAD_REQUEST;
    } else if (flag("allowUpload") || flag("allowDownload")) {
        errorText_ = kTransferText;
        code = WEBAPI_ERR_COMPOUND_TRANSFER;
    } else if (!parallel_ && (flag("grantable") || flag("grantByDefault"))) {
        if (!runner_->Process(subReq_, subResp_) || subResp_->GetError() != WEBAPI_ERR_NONE) {
            hasFail_ = true;
        }
        resp_->SetCallbackFuncs(&subResp_->GetCallbackFuncs());
        PrepareCompundResponse(index);
        return WEBAPI_ERR_NONE;
    } else if (!InitNewPipe(child, index)) {
        VELA_LOG_ERR("pipe init Fail");
        code = WEBAPI_ERR_NO_RESPONSE;
    } else if (!ProcessFork(child)) {
        VELA_LOG_ERR("fork Fail");
        delete child.first;
        code = WEBAPI_ERR_NO_RESPONSE;
    } else {
        if (!parallel_) {
            PrepareCompundResponseFromChild(children_.back());
        }
        return WEBAPI_ERR_NONE;
    }
    subResp_->SetError(code);
    PrepareCompundResponse(index);
    return code;
}

bool CompoundHandler::InitNewPipe(ChildPipe& child, unsigned int index)
{
    child.first = new (std::nothrow) Pipe();
    child.second = index;
    if (child.first == nullptr || !child.first->Init()) {
        VELA_LOG_ERR("Pipe init failed");
        delete child.first;
        child.first = nullptr;
        return false;
    }
    return true;
}

bool CompoundHandler::ProcessFork(ChildPipe& child)
{
    // In parallel mode at most maxChildren run at once: the oldest one is
    // read before another starts. Its answer keeps its own index.
    if (parallel_) {
        size_t running = 0;
        for (LiveChild& live : children_) {
            running += live.pipe.first != nullptr && live.pipe.first->ReadFd() >= 0 ? 1 : 0;
        }
        for (size_t i = 0; i < children_.size() && running >= static_cast<size_t>(limits_.maxChildren); ++i) {
            if (children_[i].pipe.first->ReadFd() >= 0) {
                PrepareCompundResponseFromChild(children_[i]);
                --running;
            }
        }
    }
    const pid_t parent = getpid();
    const pid_t pid = VLIBCProcForkEx(kChildForkFlags);
    if (pid < 0) {
        return false;
    }
    if (pid == 0) {
        RunChild(child, parent);
    }
    child.first->ReadOnly(-1);
    const int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    children_.push_back(LiveChild{child, pid, pidfd, NowMillis() + limits_.childSeconds * 1000});
    return true;
}

// The child: one call, its answer on the pipe, then its callbacks once the
// parent (and with it the reply) is gone.
void CompoundHandler::RunChild(ChildPipe& child, pid_t parent)
{
    child.first->WriteOnly(-1);
    for (LiveChild& other : children_) {
        other.pipe.first->Close();
    }
    DetachStandardStreams();
    runner_->Process(subReq_, subResp_);
    Json::Value message(Json::objectValue);
    PrepareCompundResponse(message["result"], message["info"]);
    if (!child.first->WriteJson(message)) {
        VELA_LOG_ERR("write json failed");
    }
    child.first->Close();
    if (!subResp_->GetCallbackFuncs().empty()) {
        while (kill(parent, 0) == 0) {
            usleep(kParentProbeMicros);
        }
        runner_->HandleCallback(subResp_);
    }
    _exit(0);
}

// Waits until the child's answer can be read or its time is up; a child
// past its time is killed (through its pidfd, so a reused pid is never hit).
bool CompoundHandler::WaitForAnswer(LiveChild& child)
{
    struct pollfd fd = {child.pipe.first->ReadFd(), POLLIN, 0};
    for (;;) {
        const long long left = child.deadline - NowMillis();
        const int n = left > 0 ? poll(&fd, 1, left > INT32_MAX ? INT32_MAX : static_cast<int>(left)) : 0;
        if (n > 0) {
            return true;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return true;  // let the read report what is wrong
        }
        break;
    }
    VELA_LOG_ERR("call %u gave no answer in %lld s: killed", child.pipe.second, limits_.childSeconds);
    if (child.pidfd >= 0) {
        syscall(SYS_pidfd_send_signal, child.pidfd, SIGKILL, nullptr, 0);
    }
    return false;
}

void CompoundHandler::PrepareCompundResponseFromChild(LiveChild& child)
{
    Pipe* pipe = child.pipe.first;
    if (pipe == nullptr || pipe->ReadFd() < 0) {
        return;  // read already, to make room for another child
    }
    const unsigned int index = child.pipe.second;
    Json::Value message;
    if (WaitForAnswer(child) && pipe->ReadJson(message) && message.isObject()) {
        const Json::Value& info = message["info"];
        output_["result"][index] = message["result"];
        info_[index] = info;
        if (info.isObject() && info["error"].isInt() && info["error"].asInt() != 0) {
            hasFail_ = true;
        }
    } else {
        VELA_LOG_ERR("read compound json failed");
        // The slot stays null; the call failed all the same.
        output_["result"][index] = Json::Value();
        hasFail_ = true;
    }
    pipe->Close();
}

void CompoundHandler::PrepareCompundResponse(Json::Value& result, Json::Value& info)
{
    result = subResp_->GetBody();
    const std::string api = subReq_->GetAPIClass();
    const int version = subReq_->GetAPIVersion();
    const std::string method = subReq_->GetAPIMethod();
    if (!api.empty() && version > 0 && !method.empty()) {
        if (!result.isObject()) {
            result = Json::Value(Json::objectValue);
        }
        result["api"] = api;
        result["version"] = version;
        result["method"] = method;
    }
    info = Json::Value(Json::objectValue);
    info["error"] = subResp_->GetError();
    if (subResp_->HasServerError()) {
        info["x-request-error"] = subResp_->GetServerError();
    }
    info["restart_httpd"] = subResp_->GetHttpdRestart();
}

void CompoundHandler::PrepareCompundResponse(unsigned int index)
{
    PrepareCompundResponse(output_["result"][index], info_[index]);
}

void CompoundHandler::HandleCompoundInfo()
{
    for (const Json::Value& info : info_) {
        if (!info.isObject()) {
            continue;
        }
        if (info["error"].isInt() && info["error"].asInt() != 0) {
            hasFail_ = true;
        }
        if (info["x-request-error"].isString()) {
            resp_->SetServerError(info["x-request-error"].asString());
        }
        if (info["restart_httpd"].isBool() && info["restart_httpd"].asBool()) {
            resp_->SetHttpdRestart(true);
        }
    }
}

void CompoundHandler::Output(_tag_WEBAPI_ERR code)
{
    output_["has_fail"] = hasFail_;
    if (code == WEBAPI_ERR_NONE) {
        resp_->SetSuccess(output_);
    } else {
        resp_->SetError(code, Json::Value(errorText_));
    }
}

}  // namespace VELA
