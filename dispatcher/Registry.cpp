// The API description registry of APIRunner: description files ("*.lib")
// merged with the defaults of lib.def, the attribute object of one method,
// and the first check of a request against the descriptions.
//
// Every relative name (the "*.lib" pattern, the candidates of one API) is
// resolved against the working directory, the web-API directory. API names
// come from the client: they are checked for length and characters before
// any file name is built from them.
#include "dispatcher/Registry.h"

#include <exception>
#include <glob.h>
#include <mutex>
#include <sys/stat.h>
#include <set>
#include <string>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace VELA {

namespace {

// Candidate description files tried for one API name.
constexpr int kMaxCandidates = 4;

const Json::Value& NullValue()
{
    static const Json::Value kNull;
    return kNull;
}

// `api` as an APIName; a name that fails the check is one line and, with
// `resp`, error 102 on `resp`.
bool CheckedName(APIRunnerPrivate& d, const std::string& api, APIName& out, APIResponse* resp)
{
    if (d.CheckName(api, out)) {
        return true;
    }
    VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_API, "WebAPI name refused: \"%s\"", LogSafe(api).c_str());
    return false;
}

}  // namespace

const Json::Value& JsonMember(const Json::Value& v, const std::string& key)
{
    if (!v.isObject()) {
        return NullValue();
    }
    const Json::Value* found = v.find(key.data(), key.data() + key.size());
    return found ? *found : NullValue();
}

bool APIName::Check(const std::string& text, APIName& out)
{
    if (!System::IsAPIName(text)) {
        return false;
    }
    out.text_ = text;
    return true;
}

bool ResolvedCall::Flag(const std::string& attr) const
{
    return flags != nullptr && JsonFlag(JsonMember(*flags, attr));
}

// ---- Descriptions -------------------------------------------------------------

Registry::Registry() : defaults_(Json::objectValue), table_(Json::objectValue) {}

// The last lib.def read by this process, known by its file's identity, size
// and modification time: a process that makes many runners (a warm front
// end) reads and parses the file again only when it changed.
namespace {
struct ReadDefaults {
    std::mutex lock;
    std::string path;
    struct stat st {};
    bool kept = false;  // `value` holds the file (from the second read on)
    Json::Value value;
};

bool SameFile(const struct stat& a, const struct stat& b)
{
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino && a.st_size == b.st_size &&
           a.st_mtim.tv_sec == b.st_mtim.tv_sec && a.st_mtim.tv_nsec == b.st_mtim.tv_nsec;
}
}  // namespace

void Registry::LoadDefaults(const std::string& path)
{
    static ReadDefaults last;
    struct stat st {};
    const bool known = stat(path.c_str(), &st) == 0;
    {
        std::lock_guard<std::mutex> hold(last.lock);
        if (known && last.kept && last.path == path && SameFile(last.st, st)) {
            defaults_ = last.value;
            return;
        }
    }
    Json::Value def;
    if (WebAPIUtil::ReadJsonFile(path, def) && def.isObject()) {
        defaults_ = def;
        if (known) {
            // A process that makes one runner (velascgi) never pays for the
            // copy: the file is kept once it has been read twice.
            std::lock_guard<std::mutex> hold(last.lock);
            const bool again = last.path == path && SameFile(last.st, st);
            last.path = path;
            last.st = st;
            last.kept = again;
            if (again) {
                last.value = def;
            }
        }
    }
}

Json::Value& Registry::ApplyLibDef(Json::Value& desc) const
{
    if (!desc.isObject()) {
        return desc;
    }
    try {
        if (!desc.isMember("authLevel")) {
            desc["authLevel"] = JsonMember(defaults_, "authLevel");
        }
        if (!desc.isMember("allowUser")) {
            desc["allowUser"] = JsonMember(defaults_, "allowUser");
        }
        if (!desc.isMember("requestFormat")) {
            desc["requestFormat"] = "JSON";
        }
        if (!desc.isMember("priority")) {
            desc["priority"] = JsonMember(defaults_, "priority");
        }
    } catch (const std::exception&) {
        // Out of memory: the description keeps what it had.
    }
    return desc;
}

bool Registry::CheckLibDescription(const Json::Value& desc)
{
    if (!desc.isObject()) {
        return false;
    }
    const Json::Value& lib = JsonMember(desc, "lib");
    if (!lib.isString() || lib.asString().empty()) {
        return false;
    }
    if (!JsonMember(desc, "minVersion").isInt() || !JsonMember(desc, "maxVersion").isInt()) {
        return false;
    }
    if (!JsonMember(desc, "methods").isObject()) {
        return false;
    }
    if (desc.isMember("priority")) {
        const Json::Value& priority = desc["priority"];
        if (!priority.isInt() || priority.asInt() > 10 || priority.asInt() < -10) {
            return false;
        }
    }
    return true;
}

// Adds the valid descriptions of one file's object to `table`. A name added
// earlier in the same load (`added`) is replaced by the later file; an entry
// that was in the table before the load is kept, since entries live, and
// references to them stay valid, for the runner's whole life.
static void AddDescriptions(const Registry& registry, Json::Value& table, const Json::Value& file,
                            std::set<std::string>& added)
{
    for (Json::Value::const_iterator it = file.begin(); it != file.end(); ++it) {
        const std::string name = it.name();
        if (table.isMember(name) && added.count(name) == 0) {
            continue;
        }
        Json::Value desc = *it;
        if (!Registry::CheckLibDescription(desc)) {
            VELA_LOG_ERR("WebAPI description %s is not valid.", LogSafe(name).c_str());
            continue;
        }
        table[name] = registry.ApplyLibDef(desc);
        added.insert(name);
    }
}

bool Registry::LoadAll(Json::Value& table) const
{
    if (!table.isNull() && !table.isObject()) {
        return false;
    }
    glob_t files{};
    if (glob("*.lib", 0, nullptr, &files) != 0) {
        globfree(&files);
        return false;
    }
    try {
        std::set<std::string> added;
        for (size_t i = 0; i < files.gl_pathc; ++i) {
            Json::Value file;
            if (!WebAPIUtil::ReadJsonFile(files.gl_pathv[i], file) || !file.isObject()) {
                VELA_LOG_ERR("WebAPI description file %s is not valid", files.gl_pathv[i]);
                continue;
            }
            AddDescriptions(*this, table, file, added);
        }
    } catch (const std::exception&) {
        globfree(&files);
        return false;
    }
    globfree(&files);
    return true;
}

// The description file of `api`: the prefixes ending before the second,
// third, ... dot, then the whole name: for A.B.C.D the files A.B.lib,
// A.B.C.lib, A.B.C.D.lib. The first component alone is never tried; the
// longest existing file wins; at most kMaxCandidates names are tried. Empty
// when none exists.
static std::string DescriptionFile(const std::string& api)
{
    std::string chosen;
    size_t dot = api.find('.');
    for (int i = 0; i < kMaxCandidates; ++i) {
        const size_t next = dot == std::string::npos ? std::string::npos : api.find('.', dot + 1);
        const std::string candidate = (next == std::string::npos ? api : api.substr(0, next)) + ".lib";
        if (VLIBCFileExist(candidate.c_str())) {
            chosen = candidate;
        }
        if (next == std::string::npos) {
            break;
        }
        dot = next;
    }
    return chosen;
}

bool Registry::Load(Json::Value& table, const APIName& name, APIResponse* resp) const
{
    const std::string& api = name.Text();
    if (!table.isNull() && !table.isObject()) {
        return false;
    }
    if (table.isMember(api)) {
        return true;
    }
    try {
        const std::string chosen = DescriptionFile(api);
        if (chosen.empty()) {
            VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_API, "WebAPI %s is not valid", api.c_str());
            return false;
        }
        Json::Value file;
        if (!WebAPIUtil::ReadJsonFile(chosen, file) || !file.isObject()) {
            VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_API, "WebAPI description file %s is not valid", chosen.c_str());
            return false;
        }
        std::set<std::string> added;
        AddDescriptions(*this, table, file, added);
        return true;
    } catch (const std::exception& e) {
        VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_API, "WebAPI %s could not be loaded: %s", api.c_str(), e.what());
        return false;
    }
}

const Json::Value* Registry::Find(const std::string& api) const
{
    if (!table_.isObject()) {
        return nullptr;
    }
    return table_.find(api.data(), api.data() + api.size());
}

// ---- Methods ------------------------------------------------------------------

const Json::Value& Registry::MethodOf(const Json::Value& desc, int version, const std::string& method) const
{
    const Json::Value& defaults = JsonMember(defaults_, "methods");
    const Json::Value& list = JsonMember(JsonMember(desc, "methods"), std::to_string(version));
    if (!list.isArray()) {
        return defaults;
    }
    // Members of an object are kept sorted, so begin() is the smallest name:
    // only that one receives the entry's attributes.
    for (const Json::Value& entry : list) {
        if (!entry.isObject() || entry.empty()) {
            continue;
        }
        Json::Value::const_iterator first = entry.begin();
        if (first.name() == method) {
            return *first;
        }
    }
    return defaults;
}

bool Registry::Lists(const Json::Value& desc, int version, const std::string& method)
{
    // Any member of an object entry makes its method callable, though only
    // the first member gets the entry's attributes (MethodOf).
    const Json::Value& list = JsonMember(JsonMember(desc, "methods"), std::to_string(version));
    if (!list.isArray()) {
        return false;
    }
    for (const Json::Value& entry : list) {
        if ((entry.isString() && entry.asString() == method) || (entry.isObject() && entry.isMember(method))) {
            return true;
        }
    }
    return false;
}

const Json::Value& Registry::FlagsOf(const Json::Value& method) const
{
    return method.isObject() ? method : JsonMember(defaults_, "methods");
}

// ---- The members of APIRunner that ask the registry --------------------------------

Json::Value& APIRunner::ApplyLibDef(Json::Value& desc) { return d_->registry.ApplyLibDef(desc); }

bool APIRunner::CheckLibDescription(Json::Value& desc) { return Registry::CheckLibDescription(desc); }

bool APIRunner::InitLibDesc(Json::Value& table) { return d_->registry.LoadAll(table); }

bool APIRunner::InitLibDesc(Json::Value& table, const std::string& api)
{
    APIName name;
    if (api.empty() || !CheckedName(*d_, api, name, nullptr)) {
        return false;
    }
    return d_->registry.Load(table, name, nullptr);
}

bool APIRunner::InitLibDesc(Json::Value& table, APIRequest* req)
{
    if (!req) {
        return false;
    }
    return InitLibDesc(table, req->GetAPIClass());
}

const Json::Value& APIRunner::GetMethod(const std::string& api, int version, const std::string& method)
{
    // The call on the road has its answer already.
    const ResolvedCall* call = d_->Current();
    if (call != nullptr && call->methodAttrs != nullptr && call->version == version && call->api == api &&
        call->method == method) {
        return *call->methodAttrs;
    }
    Registry& registry = d_->registry;
    const Json::Value* desc = nullptr;
    if (InitLibDesc(registry.Table(), api)) {
        desc = registry.Find(api);
    }
    return registry.MethodOf(desc != nullptr ? *desc : NullValue(), version, method);
}

bool APIRunner::GetMethodAttr(const std::string& api, int version, const std::string& method,
                              const std::string& attr)
{
    try {
        return JsonFlag(JsonMember(d_->registry.FlagsOf(GetMethod(api, version, method)), attr));
    } catch (const std::exception&) {
        return false;
    }
}

bool APIRunner::GetMethodAttr(APIRequest* req, const std::string& attr)
{
    if (!req || attr.empty()) {
        return false;
    }
    const ResolvedCall* call = d_->Current();
    if (call != nullptr && call->req == req && call->flags != nullptr) {
        return call->Flag(attr);
    }
    return GetMethodAttr(req->GetAPIClass(), req->GetAPIVersion(), req->GetAPIMethod(), attr);
}

bool APIRunner::AddAPIInfo(APIRequest* req)
{
    if (!req) {
        return false;
    }
    const Json::Value* desc = d_->registry.Find(req->GetAPIClass());
    if (desc == nullptr) {
        return false;
    }
    req->InitAPIInfo(*desc);
    return true;
}

bool APIRunner::ServesInProcess(const std::string& api, int version, const std::string& method) const
{
    try {
        const Registry& registry = d_->registry;
        const Json::Value* desc = registry.Find(api);
        if (desc == nullptr || !Registry::Lists(*desc, version, method)) {
            return false;
        }
        const Json::Value& attrs = registry.MethodOf(*desc, version, method);
        const Json::Value& flags = registry.FlagsOf(attrs);
        auto flag = [&flags](const char* name) { return JsonFlag(JsonMember(flags, name)); };
        if (!flag("inProcess") || flag("grantByUser") || flag("grantByDefault") || flag("allowUpload")) {
            return false;
        }
        const Json::Value& methodRunAs = JsonMember(attrs, "runAs");
        const Json::Value& apiRunAs = JsonMember(*desc, "runAs");
        const std::string runAs = methodRunAs.isString() ? methodRunAs.asString()
                                  : apiRunAs.isString()  ? apiRunAs.asString()
                                                         : std::string(VELA_RUNAS_SUPERUSER);
        return runAs == VELA_RUNAS_SUPERUSER;
    } catch (const std::exception&) {
        return false;
    }
}

void APIRunner::SwapWarmState(APIRunner& other)
{
    d_->registry.Swap(other.d_->registry);
    d_->libs.Swap(other.d_->libs);
}

// ---- The first check of a request -----------------------------------------------

// The description of the call: the file of its (checked) API loaded, the
// version in range, the method listed, the method's attributes found, the
// upload and demo rules kept. One refusal, with its code, on failure.
static bool CheckDescribed(ResolvedCall& call)
{
    Registry& registry = call.d.registry;
    APIResponse* resp = call.resp;
    try {
        if (!registry.Load(registry.Table(), call.name, resp)) {
            return false;
        }
        const Json::Value* desc = registry.Find(call.api);
        if (desc == nullptr) {
            VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_API, "WebAPI %s is not described", LogSafe(call.api).c_str());
            return false;
        }
        const Json::Value& minVersion = JsonMember(*desc, "minVersion");
        const Json::Value& maxVersion = JsonMember(*desc, "maxVersion");
        if (!minVersion.isInt() || !maxVersion.isInt() || call.version < minVersion.asInt() ||
            call.version > maxVersion.asInt()) {
            VELA_REFUSE(resp, WEBAPI_ERR_NOT_SUPPORTED_VERSION, "WebAPI %s has no version %d",
                        LogSafe(call.api).c_str(), call.version);
            return false;
        }
        if (!Registry::Lists(*desc, call.version, call.method)) {
            VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_METHOD, "WebAPI %s version %d has no method \"%s\"",
                        LogSafe(call.api).c_str(), call.version, LogSafe(call.method).c_str());
            return false;
        }
        call.description = desc;
        call.methodAttrs = &registry.MethodOf(*desc, call.version, call.method);
        call.flags = &registry.FlagsOf(*call.methodAttrs);
        if (!call.Flag("allowUpload") && call.req->IsUploadRequest()) {
            VELA_REFUSE(resp, WEBAPI_ERR_UPLOAD_NOT_ALLOWED, "WebAPI %s %d %s takes no upload",
                        LogSafe(call.api).c_str(), call.version, LogSafe(call.method).c_str());
            return false;
        }
        if (!call.Flag("allowDemo") && call.req->IsDemoMode()) {
            VELA_REFUSE(resp, WEBAPI_ERR_DEMO_MODE, "WebAPI %s %d %s is not served in demo mode",
                        LogSafe(call.api).c_str(), call.version, LogSafe(call.method).c_str());
            return false;
        }
        return true;
    } catch (const std::exception& e) {
        VELA_REFUSE(resp, WEBAPI_ERR_BAD_REQUEST, "request check failed: %s", e.what());
        return false;
    }
}

// What the road takes from the API's description `info` (the registry's, or
// the one handed to the request): the library, the priority, the identity
// and whether calls are counted.
static void TakeDescription(ResolvedCall& call, const Json::Value& info)
{
    const Json::Value& lib = JsonMember(info, "lib");
    call.lib = lib.isString() ? lib.asString() : std::string();
    const Json::Value& priority = JsonMember(info, "priority");
    const int nice = priority.isInt() ? priority.asInt() : 0;
    call.priority = nice < -20 ? -20 : (nice > 19 ? 19 : nice);
    const Json::Value& runAs = JsonMember(info, "runAs");
    call.runAs = runAs.isString() ? runAs.asString() : VELA_RUNAS_SUPERUSER;
    const Json::Value& methodRunAs = JsonMember(*call.methodAttrs, "runAs");
    if (methodRunAs.isString()) {
        call.runAs = methodRunAs.asString();
    }
    call.counted = JsonFlag(JsonMember(info, "count"), true);
}

bool APIRunner::CheckRequestParam(APIRequest* req, APIResponse* resp)
{
    if (!req || !resp) {
        return false;
    }
    try {
        ResolvedCall call(*this, *d_, req, resp);
        return CheckCallNames(call) == Step::kGoOn && CheckDescribed(call);
    } catch (const std::exception& e) {
        VELA_REFUSE(resp, WEBAPI_ERR_BAD_REQUEST, "request check failed: %s", e.what());
        return false;
    }
}

Step CheckCallNames(ResolvedCall& call)
{
    call.api = call.req->GetAPIClass();
    call.version = call.req->GetAPIVersion();
    call.method = call.req->GetAPIMethod();
    if (call.api.empty()) {
        VELA_REFUSE(call.resp, WEBAPI_ERR_BAD_REQUEST, "request refused: no API name");
        return Step::kStop;
    }
    if (call.version < 1 || call.method.empty()) {
        VELA_REFUSE(call.resp, WEBAPI_ERR_BAD_REQUEST, "request refused: %s without a version from 1 and a method",
                    LogSafe(call.api).c_str());
        return Step::kStop;
    }
    return CheckedName(call.d, call.api, call.name, call.resp) ? Step::kGoOn : Step::kStop;
}

Step DescribeCall(ResolvedCall& call)
{
    if (!CheckDescribed(call)) {
        return Step::kStop;
    }
    TakeDescription(call, *call.description);
    // Hands the request its API's description (AddAPIInfo).
    call.req->InitAPIInfo(*call.description);
    return Step::kGoOn;
}

void ResolveFromRequest(ResolvedCall& call)
{
    APIRequest* req = call.req;
    call.api = req->GetAPIClass();
    call.version = req->GetAPIVersion();
    call.method = req->GetAPIMethod();
    call.methodAttrs = &call.runner.GetMethod(call.api, call.version, call.method);
    call.flags = &call.d.registry.FlagsOf(*call.methodAttrs);
    Json::Value info(Json::objectValue);
    for (const char* key : {"lib", "priority", "runAs", "count"}) {
        info[key] = req->GetAPIInfo(key);
    }
    TakeDescription(call, info);
}

}  // namespace VELA
