// Handler libraries of APIRunner: loaded on first use with the dynamic
// loader, cached by the "lib" path of the description exactly as written,
// kept until the runner is destroyed. The tables of APITable.h are fetched
// anew from the cached handle at every call.
#include "dispatcher/LibCache.h"

#include <dlfcn.h>
#include <exception>
#include <string>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "vela/log.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace VELA {

namespace {

// The check table of a loaded library into `check`; true, `check` untouched,
// when the library has none (that is normal).
bool FetchCheckTable(void* handle, _tag_API_CHECK_TABLE** check)
{
    if (!handle || !check) {
        return false;
    }
    dlerror();
    void* sym = dlsym(handle, "GetAPICheckTable");
    if (dlerror() || !sym) {
        return true;
    }
    _tag_API_CHECK_TABLE* found = reinterpret_cast<GetAPICheckTableFn>(sym)();
    if (!found) {
        VELA_LOG_ERR("cannot get api check table");
        return false;
    }
    *check = found;
    return true;
}

bool Matches(const char* api, int version, const char* method, const std::string& wantApi, int wantVersion,
             const std::string& wantMethod)
{
    return version == wantVersion && api != nullptr && method != nullptr && wantApi == api &&
           wantMethod == method;
}

// The check of the entry for the call, or of the terminating entry when none
// names it: a terminating entry's check vets every call no entry names.
APICheckFn CheckOf(const _tag_API_CHECK_TABLE* check, const ResolvedCall& call)
{
    const _tag_API_CHECK_TABLE* e = check;
    while (e->api != nullptr && !Matches(e->api, e->version, e->method, call.api, call.version, call.method)) {
        ++e;
    }
    return e->check;
}

const _tag_API_TABLE* EntryOf(const _tag_API_TABLE* table, const ResolvedCall& call)
{
    for (const _tag_API_TABLE* e = table; e->api != nullptr; ++e) {
        if (Matches(e->api, e->version, e->method, call.api, call.version, call.method)) {
            return e;
        }
    }
    return nullptr;
}

}  // namespace

// ---- The cache ------------------------------------------------------------------------

void* LibCache::Open(const std::string& path, APIResponse* resp, int mode)
{
    if (path.empty()) {
        VELA_REFUSE(resp, WEBAPI_ERR_LOAD_LIBRARY, "library path empty");
        return nullptr;
    }
    auto cached = handles_.find(path);
    if (cached != handles_.end()) {
        return cached->second;
    }
    void* opened = dlopen(path.c_str(), mode);
    if (!opened) {
        const char* err = dlerror();
        VELA_REFUSE(resp, WEBAPI_ERR_LOAD_LIBRARY, "cannot open library: %s. error = %s", path.c_str(),
                    err ? err : "");
        return nullptr;
    }
    handles_[path] = opened;
    return opened;
}

void LibCache::CloseAll()
{
    for (auto& entry : handles_) {
        if (entry.second) {
            dlclose(entry.second);
        }
    }
    handles_.clear();
}

_tag_API_TABLE* FetchAPITable(void* handle, std::string& why, int& priority)
{
    dlerror();
    void* sym = dlsym(handle, "GetAPITable");
    const char* err = dlerror();
    if (err || !sym) {
        why = std::string("cannot load table: ") + (err ? err : "GetAPITable is null");
        priority = LOG_DEBUG;
        return nullptr;
    }
    _tag_API_TABLE* found = reinterpret_cast<GetAPITableFn>(sym)();
    if (!found) {
        why = "cannot get api table";
        priority = LOG_ERR;
    }
    return found;
}

// ---- The members of APIRunner that reach the cache --------------------------------------

bool APIRunner::WarmUp(const std::string& api, std::string* lib)
{
    try {
        APIName name;
        if (!APIName::Check(api, name) || !d_->registry.Load(d_->registry.Table(), name, nullptr)) {
            return false;
        }
        const Json::Value* desc = d_->registry.Find(api);
        if (desc == nullptr) {
            return false;
        }
        const Json::Value& path = JsonMember(*desc, "lib");
        if (!path.isString() || d_->libs.Open(path.asString(), nullptr, RTLD_NOW) == nullptr) {
            return false;
        }
        if (lib != nullptr) {
            *lib = path.asString();
        }
        return true;
    } catch (const std::exception& e) {
        VELA_LOG_ERR("cannot warm up %s: %s", LogSafe(api).c_str(), e.what());
        return false;
    }
}

bool APIRunner::CacheLib(APIRequest* req, void** handle)
{
    if (!req) {
        return false;
    }
    try {
        const Json::Value lib = req->GetAPIInfo("lib", "");
        void* opened = d_->libs.Open(lib.isString() ? lib.asString() : std::string(), nullptr);
        if (handle) {
            *handle = opened;
        }
        return opened != nullptr;
    } catch (const std::exception&) {
        return false;
    }
}

bool APIRunner::GetTableFunc(void* handle, _tag_API_TABLE** table)
{
    if (!handle || !table) {
        return false;
    }
    std::string why;
    int priority = LOG_ERR;
    _tag_API_TABLE* found = FetchAPITable(handle, why, priority);
    if (!found) {
        VELA_LOG(priority, "%s", why.c_str());
        return false;
    }
    *table = found;
    return true;
}

bool APIRunner::GetCheckTableFunc(void* handle, _tag_API_CHECK_TABLE** check)
{
    return FetchCheckTable(handle, check);
}

bool APIRunner::OpenLib(APIRequest* req, _tag_API_TABLE** table, _tag_API_CHECK_TABLE** check)
{
    if (!req || !table) {
        VELA_LOG_ERR("Bad parameters");
        return false;
    }
    void* handle = nullptr;
    if (!CacheLib(req, &handle)) {
        return false;
    }
    if (check) {
        // A library without a usable check table still serves its calls;
        // the caller has set *check to null, so none reads as none.
        GetCheckTableFunc(handle, check);
    }
    if (!GetTableFunc(handle, table)) {
        VELA_LOG_ERR("Get API Table Fail");
        return false;
    }
    return true;
}

void APIRunner::CloseLib() { d_->libs.CloseAll(); }

// ---- Stages -------------------------------------------------------------------------

Step OpenLibrary(ResolvedCall& call)
{
    void* handle = call.d.libs.Open(call.lib, call.resp);
    if (handle == nullptr) {
        return Step::kStop;
    }
    // A library without a usable check table still serves its calls.
    call.check = nullptr;
    FetchCheckTable(handle, &call.check);
    std::string why;
    int priority = LOG_ERR;
    call.table = FetchAPITable(handle, why, priority);
    if (call.table == nullptr) {
        VELA_REFUSE(call.resp, WEBAPI_ERR_LOAD_LIBRARY, "Get API Table Fail: %s", why.c_str());
        return Step::kStop;
    }
    return Step::kGoOn;
}

Step FindEntry(ResolvedCall& call)
{
    if (call.check != nullptr) {
        APICheckFn checkFn = CheckOf(call.check, call);
        if (checkFn != nullptr && !checkFn(call.req, call.resp)) {
            return Step::kStop;  // the check has answered
        }
    }
    call.entry = EntryOf(call.table, call);
    if (call.entry == nullptr) {
        VELA_REFUSE(call.resp, WEBAPI_ERR_METHOD_NOT_IN_TABLE, "%s %d %s is not in its library's API table",
                    LogSafe(call.api).c_str(), call.version, LogSafe(call.method).c_str());
        return Step::kStop;
    }
    // A handler that answers nothing answers 117.
    call.resp->SetError(WEBAPI_ERR_NO_RESPONSE);
    return Step::kGoOn;
}

}  // namespace VELA
