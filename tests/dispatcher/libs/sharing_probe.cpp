// A sharing check library for the tests: its table skips two broken entries
// (an empty api pattern, an empty method pattern), then lets "probe" calls
// of any API whose name starts with "VELA.Test." through while recording
// the effective ids the check ran with and the effective user id the
// library was loaded with; "deny" is refused with code 1234.
#include <json/json.h>
#include <unistd.h>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

namespace {

// Set while the library is loaded, by its constructors.
const int g_loadEuid = static_cast<int>(geteuid());

bool Probe(VELA::APIRequest* req, VELA::APIResponse*)
{
    req->SetAttr("loadEuid", g_loadEuid);
    req->SetAttr("checkEuid", static_cast<int>(geteuid()));
    req->SetAttr("checkEgid", static_cast<int>(getegid()));
    return true;
}

bool Deny(VELA::APIRequest*, VELA::APIResponse* resp)
{
    resp->SetError(1234);
    return false;
}

_tag_API_SHARING_CHECK_TABLE g_table[] = {
    {"", 0, "*", Deny},
    {"*", 0, "", Deny},
    {"^VELA\\.Test\\.", 0, "^probe$", Probe},
    {"^VELA\\.Test\\.", 1, "^deny$", Deny},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

extern "C" __attribute__((visibility("default"))) int GetAPISharingCheckTable(_tag_API_SHARING_CHECK_TABLE** t)
{
    *t = g_table;
    return 1;
}
