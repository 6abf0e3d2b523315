#include "relay/LazyCurl.h"

#include <mutex>

#include "system/LazyLibrary.h"
#include "vela/log.h"

namespace VELA {
namespace Relay {

namespace {

bool Resolve(void* handle, CurlApi& api, const char*& missing)
{
    VELA_CURL_FUNCTIONS(VELA_LAZY_RESOLVE)
    return true;
}

System::LazyLibrary<CurlApi> g_curl("libcurl.so.4", "relay to peers", Resolve);
std::once_flag g_globalOnce;
bool g_globalOk = false;

}  // namespace

const CurlApi* LazyCurl()
{
    const CurlApi* api = g_curl.Get();
    if (api == nullptr) {
        return nullptr;
    }
    std::call_once(g_globalOnce, [api] {
        const CURLcode rc = api->curl_global_init(CURL_GLOBAL_DEFAULT);
        g_globalOk = rc == CURLE_OK;
        if (!g_globalOk) {
            VELA_LOG_ERR("relay to peers unavailable: curl_global_init failed[%d]", static_cast<int>(rc));
        }
    });
    return g_globalOk ? api : nullptr;
}

}  // namespace Relay
}  // namespace VELA
