// A handler wrapper for API tables: no exception may leave a handler into
// the framework, so one that escapes `Handler` is logged and the call is
// answered with error `code` instead.
//
//   #include <webapi/APIGuard.h>
//   _tag_API_TABLE table[] = {
//       {"VELA.Sample", 1, "echo", VELA::APIGuarded<Echo>},
//       {"VELA.Sample", 1, "login", VELA::APIGuarded<Login, 402>},
//       {nullptr, 0, nullptr, nullptr},
//   };
#pragma once

#include <exception>

#include "vela/log.h"
#include "webapi/APIError.h"
#include "webapi/APIResponse.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

template <void (*Handler)(APIRequest*, APIResponse*), int code = WEBAPI_ERR_NO_RESPONSE>
void APIGuarded(APIRequest* req, APIResponse* resp)
{
    try {
        Handler(req, resp);
    } catch (const std::exception& e) {
        VELA_LOG_ERR("handler failed: %s", e.what());
        resp->SetError(code);
    } catch (...) {
        VELA_LOG_ERR("handler failed");
        resp->SetError(code);
    }
}

}  // namespace VELA

#pragma GCC visibility pop
