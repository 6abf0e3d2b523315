// A handler library written the way an outside handler is: only the public
// headers, JsonCpp and the two framework libraries. The driver opens it with
// dlopen() and calls the functions below.
#include <json/json.h>
#include <string>

#include "webapi/APIError.h"
#include "webapi/APIParameter.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIParameter;
using VELA::APIRequest;

bool IsPositive(int const& v) { return v > 0; }

// A handler picks a background-task code by its name; the client reads the
// number. Each name must give the number of its meaning.
static_assert(WEBAPI_ERR_POLLING_FINISH_FAILED == 501 && WEBAPI_ERR_POLLING_BAD_PARAMETER == 502 &&
                  WEBAPI_ERR_POLLING_BAD_TASK_ID == 503 && WEBAPI_ERR_POLLING_NO_ADMIN_PERMISSION == 505 &&
                  WEBAPI_ERR_POLLING_SIGNAL_FAILED == 506 && WEBAPI_ERR_POLLING_NO_SUCH_TASK == 508,
              "background-task error codes");

// [value, flags]: S set, R reset, I invalid, D default.
template <typename T>
Json::Value Describe(APIParameter<T> const& p, Json::Value const& value)
{
    Json::Value out(Json::arrayValue);
    out.append(value);
    out.append(std::string(p.IsSet() ? "S" : "") + (p.IsReset() ? "R" : "") + (p.IsInvalid() ? "I" : "") +
               (p.IsDefault() ? "D" : ""));
    return out;
}

template <typename T> Json::Value Describe(APIParameter<T> const& p)
{
    return Describe(p, Json::Value(p.Get()));
}

Json::Value ReadParams(APIRequest* req)
{
    Json::Value data(Json::objectValue);
    data["count"] = Describe(req->GetAndCheckInt("count", APIRequest::REQUIRED, IsPositive));
    data["negative"] = Describe(req->GetAndCheckInt("negative", APIRequest::REQUIRED, IsPositive));
    data["wrongtype"] = Describe(req->GetAndCheckInt("wrongtype", APIRequest::OPTIONAL));
    data["enabled"] = Describe(req->GetAndCheckBool("enabled", APIRequest::OPTIONAL));
    data["ratio"] = Describe(req->GetAndCheckReal("ratio", APIRequest::OPTIONAL));
    data["name"] = Describe(req->GetAndCheckString("name", APIRequest::REQUIRED));
    data["cleared"] = Describe(req->GetAndCheckString("cleared", APIRequest::OPTIONAL));
    data["missing_req"] = Describe(req->GetAndCheckString("missing_req", APIRequest::REQUIRED));
    data["ids"] = Describe(req->GetAndCheckArray("ids", APIRequest::OPTIONAL));
    data["opts"] = Describe(req->GetAndCheckObject("opts", APIRequest::OPTIONAL));
    data["paths"] = Describe(req->GetAndCheckUnitArray("paths", APIRequest::OPTIONAL));

    APIParameter<int> limit = req->GetAndCheckInt("limit", APIRequest::OPTIONAL);
    if (!limit.SetDefault(7)) {
        limit.MarkInvalid();
    }
    data["limit"] = Describe(limit);

    APIParameter<long long> big = req->GetAndCheckIntegral<long long>("big", APIRequest::REQUIRED);
    data["big"] = Describe(big, Json::Value(static_cast<Json::Int64>(big.Get())));
    APIParameter<unsigned int> mask = req->GetAndCheckIntegral<unsigned int>("mask", APIRequest::REQUIRED);
    data["mask"] = Describe(mask, Json::Value(static_cast<Json::Int64>(mask.Get())));
    APIParameter<unsigned long long> size =
        req->GetAndCheckIntegral<unsigned long long>("size", APIRequest::REQUIRED);
    data["size"] = Describe(size, Json::Value(static_cast<Json::UInt64>(size.Get())));
    return data;
}

}  // namespace

// Answers every parameter it read, with its flags, as the data of a success.
HANDLER_EXPORT void HandlerParams(VELA::APIRequest* req, VELA::APIResponse* resp)
{
    try {
        resp->SetSuccess(ReadParams(req));
    } catch (...) {
        resp->SetError(WEBAPI_ERR_NO_RESPONSE);
    }
}

// Refuses the call: error body with details, status, server error.
HANDLER_EXPORT void HandlerRefuse(VELA::APIRequest* req, VELA::APIResponse* resp)
{
    try {
        Json::Value details(Json::objectValue);
        details["reason"] = "not admin";
        // The verdict type under both of its spellings.
        const _tag_authorized_result verdict = req->GetAuthResult();
        const _tag_authorized_result_ same = verdict;
        details["verdict"] = static_cast<int>(same);
        resp->SetError(WEBAPI_ERR_NO_PERMISSION, details);
        if (!resp->SetStatus(HTTP_STATUS_FORBIDDEN, "Forbidden") ||
            !resp->SetServerError("admin only")) {
            resp->SetError(WEBAPI_ERR_NO_RESPONSE);
        }
    } catch (...) {
        resp->SetError(WEBAPI_ERR_NO_RESPONSE);
    }
}

// Logs the client in: session cookie, a header of its own, a redirect.
HANDLER_EXPORT void HandlerLogin(VELA::APIRequest* req, VELA::APIResponse* resp)
{
    try {
        if (!resp->AddCookie("id", "s 1", "/", 10, "", true, true) ||
            !resp->SetHeader("X-Handler", "login") || !resp->Redirect("index.html")) {
            resp->SetError(WEBAPI_ERR_NO_RESPONSE);
            return;
        }
        Json::Value data(Json::objectValue);
        data["injection_refused"] = !resp->SetHeader("X-Evil", "a\r\nSet-Cookie: x=y");
        resp->SetSuccess(data);
    } catch (...) {
        resp->SetError(WEBAPI_ERR_NO_RESPONSE);
    }
}
