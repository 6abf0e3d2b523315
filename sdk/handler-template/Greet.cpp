// VELA.Greet: a handler library with one method, "greet". It reads a
// required name and an optional port (default 5000) and answers them with
// the name of the user who called.
#include <json/json.h>

#include <webapi/APIError.h>
#include <webapi/APIGuard.h>
#include <webapi/APIRequest.h>
#include <webapi/APIResponse.h>
#include <webapi/APITable.h>
#include <webapi/APIValidator.h>

using VELA::APIRequest;
using VELA::APIResponse;

namespace {

void Greet(APIRequest* request, APIResponse* response)
{
    auto name = request->GetAndCheckString("name", APIRequest::REQUIRED);
    auto port = request->GetAndCheckInt("port", APIRequest::OPTIONAL, VELA::APIValidator::IsPort);
    port.SetDefault(5000);
    if (name.IsInvalid() || port.IsInvalid()) {
        response->SetError(WEBAPI_ERR_BAD_REQUEST, Json::Value(name.IsInvalid() ? "name" : "port"));
        return;
    }
    Json::Value data(Json::objectValue);
    data["hello"] = name.Get();
    data["port"] = port.Get();
    data["user"] = request->GetLoginUserName();
    response->SetSuccess(data);
}

// The methods of the library; the description VELA.Greet.lib lists the
// same ones. APIGuarded answers 117 for an exception that escapes.
_tag_API_TABLE table[] = {
    {"VELA.Greet", 1, "greet", VELA::APIGuarded<Greet>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

extern "C" __attribute__((visibility("default"))) _tag_API_TABLE* GetAPITable(void) { return table; }
