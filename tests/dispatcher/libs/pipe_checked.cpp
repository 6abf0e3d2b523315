// A library with a check table: one named check, and a check on the
// terminating entry that vets every call no entry names.
#include <json/json.h>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

void Answer(APIRequest*, APIResponse* resp) { resp->SetSuccess(Json::Value("handled")); }

bool RefuseGuarded(APIRequest*, APIResponse* resp)
{
    resp->SetError(105, Json::Value("guarded"));
    return false;
}

// Refuses calls whose "deny" parameter is true; marks the others.
bool CatchAll(APIRequest* req, APIResponse* resp)
{
    if (req->GetParam("deny", false) == Json::Value(true)) {
        resp->SetError(499, Json::Value("catch-all"));
        return false;
    }
    resp->SetHeader("X-Checked", "catch-all");
    return true;
}

_tag_API_TABLE g_table[] = {
    {"VELA.Pipe.Checked", 1, "open", Answer},
    {"VELA.Pipe.Checked", 1, "guarded", Answer},
    {nullptr, 0, nullptr, nullptr},
};

_tag_API_CHECK_TABLE g_checks[] = {
    {"VELA.Pipe.Checked", 1, "guarded", RefuseGuarded, nullptr, nullptr},
    {nullptr, 0, nullptr, CatchAll, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
HANDLER_EXPORT _tag_API_CHECK_TABLE* GetAPICheckTable(void) { return g_checks; }
