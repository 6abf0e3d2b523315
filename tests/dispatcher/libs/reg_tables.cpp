// Two APIs in one library, without a check table: the registry tests load it
// under two API names (one handle) and under two spellings of its path.
#include <json/json.h>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

void Name(VELA::APIRequest* req, VELA::APIResponse* resp)
{
    Json::Value data;
    data["api"] = req->GetAPIClass();
    data["method"] = req->GetAPIMethod();
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"Reg.Cache.One", 1, "get", Name},
    {"Reg.Cache.Two", 1, "get", Name},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
