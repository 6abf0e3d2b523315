// libcurl, loaded on first use (not installed).
//
// The platform library does not link libcurl: only a process that relays a
// call to a peer opens libcurl.so.4 (dlopen) and resolves the functions
// below; every other request never maps it. curl.h is used for types and
// constants only (its type-checking macros are off: the calls go through
// the pointers of CurlApi).
#pragma once

#ifndef CURL_DISABLE_TYPECHECK
#define CURL_DISABLE_TYPECHECK
#endif
#include <curl/curl.h>

namespace VELA {
namespace Relay {

#define VELA_CURL_FUNCTIONS(X) \
    X(curl_global_init)        \
    X(curl_easy_init)          \
    X(curl_easy_setopt)        \
    X(curl_easy_perform)       \
    X(curl_easy_getinfo)       \
    X(curl_easy_cleanup)       \
    X(curl_easy_strerror)      \
    X(curl_slist_append)       \
    X(curl_slist_free_all)

struct CurlApi {
#define VELA_CURL_MEMBER(name) decltype(&::name) name = nullptr;
    VELA_CURL_FUNCTIONS(VELA_CURL_MEMBER)
#undef VELA_CURL_MEMBER
};

// The resolved functions (curl_global_init done once), or null when
// libcurl.so.4 cannot be opened or lacks one of them (logged once).
const CurlApi* LazyCurl();

}  // namespace Relay
}  // namespace VELA
