// The sharing check library of the project "sample-share": which calls a
// visitor of one of its links may make. Installed as
// /usr/lib/sharing/permission_lib/sample-share.so; the framework runs the
// checks as the owner of that file.
//
// "download" needs the file's "path"; "list" is open to every visitor; any
// other method of the share API, and every other API, is refused (the
// framework also refuses a method whose description lacks "allowSharing").
#include <json/json.h>

#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

bool CheckDownload(APIRequest* req, APIResponse* resp)
{
    if (!req->GetParam("path").isString()) {
        resp->SetError(WEBAPI_ERR_SHARING_REFUSED, Json::Value("path"));
        return false;
    }
    return true;
}

bool CheckBrowse(APIRequest* req, APIResponse* /*resp*/) { return req->GetAPIMethod() == "list"; }

_tag_API_SHARING_CHECK_TABLE g_table[] = {
    {"^VELA\\.Sample\\.Share$", 1, "^download$", CheckDownload},
    {"^VELA\\.Sample\\.Share$", 0, "*", CheckBrowse},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT int GetAPISharingCheckTable(_tag_API_SHARING_CHECK_TABLE** table)
{
    if (table == nullptr) {
        return 0;
    }
    *table = g_table;
    return 1;
}
