// A shared library opened on first use (not installed): the platform does
// not link libraries that only some processes need (libcrypto, libsqlite3),
// so a process that never uses them does not pay for loading them.
//
//   bool Resolve(void* handle, CryptoApi& api, const char*& missing)
//   {
//       VELA_CRYPTO_FUNCTIONS(VELA_LAZY_RESOLVE)
//       return true;
//   }
//   System::LazyLibrary<CryptoApi> g_crypto("libcrypto.so.3", "encrypted parameters", Resolve);
//   const CryptoApi* api = g_crypto.Get();  // null when it cannot be loaded
//
// The first Get() opens the library (RTLD_NOW | RTLD_LOCAL: nothing else in
// the process binds to this copy by accident) and resolves every function;
// a failure is logged once as "<purpose> unavailable: ..." and every Get()
// answers null. The library stays loaded for the life of the process.
#pragma once

#include <dlfcn.h>
#include <mutex>

#include "vela/log.h"

namespace VELA {
namespace System {

// Inside a resolver whose parameters are named handle, api and missing:
// resolves the function `name` into api.name, or names it and fails.
#define VELA_LAZY_RESOLVE(name)                                   \
    {                                                             \
        void* sym = dlsym(handle, #name);                         \
        if (sym == nullptr) {                                     \
            missing = #name;                                      \
            return false;                                         \
        }                                                         \
        api.name = reinterpret_cast<decltype(api.name)>(sym);     \
    }

template <typename Api>
class LazyLibrary {
public:
    using Resolver = bool (*)(void* handle, Api& api, const char*& missing);

    // Nothing is done before the first Get(): a global costs no start-up.
    constexpr LazyLibrary(const char* file, const char* purpose, Resolver resolve)
        : file_(file), purpose_(purpose), resolve_(resolve)
    {
    }

    const Api* Get()
    {
        std::call_once(once_, [this] { Load(); });
        return loaded_ ? &api_ : nullptr;
    }

private:
    void Load()
    {
        dlerror();
        void* handle = dlopen(file_, RTLD_NOW | RTLD_LOCAL);
        if (handle == nullptr) {
            const char* why = dlerror();
            VELA_LOG_ERR("%s unavailable: cannot load %s: %s", purpose_, file_,
                         why != nullptr ? why : "unknown error");
            return;
        }
        Api api{};
        const char* missing = "";
        if (!resolve_(handle, api, missing)) {
            // The handle is kept: unloading a library that ran its
            // initialisers gains nothing.
            VELA_LOG_ERR("%s unavailable: %s lacks %s", purpose_, file_, missing);
            return;
        }
        api_ = api;
        loaded_ = true;
    }

    const char* file_;
    const char* purpose_;
    Resolver resolve_;
    std::once_flag once_;
    Api api_{};
    bool loaded_ = false;
};

}  // namespace System
}  // namespace VELA
