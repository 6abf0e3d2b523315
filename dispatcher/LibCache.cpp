// Handler libraries of APIRunner: loaded on first use with the dynamic
// loader, cached by the "lib" path of the description exactly as written,
// kept until the runner is destroyed. The tables of APITable.h are fetched
// anew from the cached handle at every call.
#include <dlfcn.h>
#include <exception>
#include <string>

#include "vela/log.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"

namespace VELA {

bool APIRunner::CacheLib(APIRequest* req, void** handle)
{
    if (!req) {
        return false;
    }
    try {
        const Json::Value lib = req->GetAPIInfo("lib", "");
        const std::string path = lib.isString() ? lib.asString() : std::string();
        if (path.empty()) {
            VELA_LOG_ERR("library path empty");
            return false;
        }
        auto cached = libCache_.find(path);
        if (cached != libCache_.end()) {
            if (handle) {
                *handle = cached->second;
            }
            return true;
        }
        void* opened = dlopen(path.c_str(), RTLD_LAZY);
        if (!opened) {
            if (handle) {
                *handle = nullptr;
            }
            const char* err = dlerror();
            VELA_LOG_ERR("cannot open library: %s. error = %s", path.c_str(), err ? err : "");
            return false;
        }
        libCache_[path] = opened;
        if (handle) {
            *handle = opened;
        }
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

bool APIRunner::GetTableFunc(void* handle, _tag_API_TABLE** table)
{
    if (!handle || !table) {
        return false;
    }
    dlerror();
    void* sym = dlsym(handle, "GetAPITable");
    const char* err = dlerror();
    if (err || !sym) {
        VELA_LOG(LOG_DEBUG, "cannot load table: %s", err ? err : "GetAPITable is null");
        return false;
    }
    _tag_API_TABLE* found = reinterpret_cast<GetAPITableFn>(sym)();
    if (!found) {
        VELA_LOG_ERR("cannot get api table");
        return false;
    }
    *table = found;
    return true;
}

bool APIRunner::GetCheckTableFunc(void* handle, _tag_API_CHECK_TABLE** check)
{
    if (!handle || !check) {
        return false;
    }
    dlerror();
    void* sym = dlsym(handle, "GetAPICheckTable");
    if (dlerror() || !sym) {
        return true;  // a library without a check table is normal
    }
    _tag_API_CHECK_TABLE* found = reinterpret_cast<GetAPICheckTableFn>(sym)();
    if (!found) {
        VELA_LOG_ERR("cannot get api check table");
        return false;
    }
    *check = found;
    return true;
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

void APIRunner::CloseLib()
{
    for (auto& entry : libCache_) {
        if (entry.second) {
            dlclose(entry.second);
        }
    }
    libCache_.clear();
}

}  // namespace VELA
