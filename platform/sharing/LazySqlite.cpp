#include "sharing/LazySqlite.h"

#include <dlfcn.h>
#include <mutex>

#include "vela/log.h"

namespace VELA {
namespace sharing {

namespace {

const char kLibrary[] = "libsqlite3.so.0";

SqliteApi g_api;
bool g_loaded = false;
std::once_flag g_once;

bool Resolve(void* handle, SqliteApi& api, const char*& missing)
{
#define VELA_SQLITE_RESOLVE(name)                             \
    {                                                         \
        void* sym = dlsym(handle, #name);                     \
        if (sym == nullptr) {                                 \
            missing = #name;                                  \
            return false;                                     \
        }                                                     \
        api.name = reinterpret_cast<decltype(api.name)>(sym); \
    }
    VELA_SQLITE_FUNCTIONS(VELA_SQLITE_RESOLVE)
#undef VELA_SQLITE_RESOLVE
    return true;
}

void Load()
{
    dlerror();
    // RTLD_LOCAL: nothing else in the process binds to this copy by accident.
    void* handle = dlopen(kLibrary, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) {
        const char* why = dlerror();
        VELA_LOG_ERR("sharing links unavailable: cannot load %s: %s", kLibrary, why != nullptr ? why : "unknown error");
        return;
    }
    SqliteApi api;
    const char* missing = "";
    if (!Resolve(handle, api, missing)) {
        VELA_LOG_ERR("sharing links unavailable: %s lacks %s", kLibrary, missing);
        return;
    }
    g_api = api;
    g_loaded = true;
}

}  // namespace

const SqliteApi* LazySqlite()
{
    std::call_once(g_once, Load);
    return g_loaded ? &g_api : nullptr;
}

}  // namespace sharing
}  // namespace VELA
