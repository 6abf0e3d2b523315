// GetAPICheckTable answers null: fetching the check table fails, the call
// still goes on with the API table.
#include <json/json.h>

#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

void Answer(VELA::APIRequest*, VELA::APIResponse* resp) { resp->SetSuccess(Json::Value("unchecked")); }

_tag_API_TABLE g_table[] = {
    {"Reg.Cache.NullCheck", 1, "get", Answer},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
HANDLER_EXPORT _tag_API_CHECK_TABLE* GetAPICheckTable(void) { return nullptr; }
