// Body, headers, status, redirect, options and callbacks of APIResponse.
#include <gtest/gtest.h>

#include "response/APIResponsePrivate.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

namespace VELA {
namespace {

// A request whose environment is the JSON object `environ`.
APIRequest MakeRequest(const std::string& environ) { return APIRequest(J(R"({"environ": )" + environ + "}")); }

// A fresh response has an empty body and the JSON content type; an error,
// then a success, each replace the whole body.
TEST(APIResponseBody, FreshThenErrorThenSuccessReplacesWholeBody)
{
    APIResponse resp(nullptr);
    EXPECT_EQ(Json::Value(Json::objectValue), resp.GetBody());
    EXPECT_EQ(0, resp.GetError());
    EXPECT_EQ("application/json; charset=\"UTF-8\"", resp.GetHeader("Content-type"));
    EXPECT_EQ(Json::Value(Json::arrayValue), resp.GetCookies());

    resp.SetError(WEBAPI_ERR_NO_PERMISSION);
    EXPECT_EQ(J(R"({"success": false, "error": {"code": 105}})"), resp.GetBody());
    EXPECT_EQ(105, resp.GetError());
    resp.SetError(120, J(R"({"name": "x"})"));
    EXPECT_EQ(J(R"({"success": false, "error": {"code": 120, "errors": {"name": "x"}}})"), resp.GetBody());
    resp.SetSuccess(J(R"({"a": 1})"));
    EXPECT_EQ(J(R"({"success": true, "data": {"a": 1}})"), resp.GetBody());
    EXPECT_EQ(0, resp.GetError());
    resp.SetSuccess();
    EXPECT_EQ(J(R"({"success": true})"), resp.GetBody());
}

TEST(APIResponseBody, PollingTaskAnswerReachesTheHookOnly)
{
    APIRequest req = MakeRequest(R"({"task_id": "7", "task_user": "admin"})");
    APIResponse resp(&req);
    VELA::Test::LogCapture log;
    resp.SetSuccess(J(R"({"n": 1})"));
    EXPECT_TRUE(log.Contains("polling task records are not available yet"));
    EXPECT_EQ(Json::Value(true), resp.GetBody()["success"]);
}

TEST(APIResponseHeader, LineBreaksAndEmptyNamesAreRefusedServerError)
{
    APIResponse resp(nullptr);
    const Json::Value before = resp.GetHeaders();
    EXPECT_FALSE(resp.SetHeader("", "v"));
    EXPECT_FALSE(resp.SetHeader("X-A\r\nSet-Cookie", "v"));
    EXPECT_FALSE(resp.SetHeader("X-A", "v\nSet-Cookie: a=b"));
    EXPECT_FALSE(resp.SetHeader("X-A", "v\r"));
    EXPECT_FALSE(resp.SetServerError("bad\r\nX-B: 1"));
    EXPECT_FALSE(resp.SetStatus(HTTP_STATUS_NOT_FOUND, "Not\r\nX-B: 1"));
    EXPECT_EQ(before, resp.GetHeaders());
    EXPECT_FALSE(resp.GetPrivate()->HasData("option", "statusMsg"));

    EXPECT_TRUE(resp.SetHeader("X-A", "1"));
    EXPECT_TRUE(resp.SetHeader("X-A", "2"));
    EXPECT_EQ("2", resp.GetHeader("X-A", "none"));
    EXPECT_EQ("none", resp.GetHeader("X-B", "none"));
    EXPECT_TRUE(resp.HasHeader("X-A"));

    EXPECT_FALSE(resp.HasServerError());
    EXPECT_EQ("", resp.GetServerError());
    EXPECT_TRUE(resp.SetServerError("disk full"));
    EXPECT_TRUE(resp.HasServerError());
    EXPECT_EQ("disk full", resp.GetHeader("x-request-error"));
}

TEST(APIResponseStatus, DefaultSetUnreadableAndOptions)
{
    APIResponse resp(nullptr);
    EXPECT_EQ(200, resp.GetStatus());
    EXPECT_TRUE(resp.SetStatus(HTTP_STATUS_NOT_FOUND, "Not Found"));
    EXPECT_EQ(404, resp.GetStatus());
    EXPECT_EQ("404", resp.GetHeader("Status"));
    EXPECT_EQ(Json::Value("Not Found"),
              resp.GetPrivate()->GetData("option", "statusMsg", Json::Value()));
    ASSERT_TRUE(resp.SetHeader("Status", "abc"));
    EXPECT_EQ(0, resp.GetStatus());

    // Output and restart options.
    EXPECT_TRUE(resp.IsEnableOutput());
    EXPECT_FALSE(resp.GetHttpdRestart());
    EXPECT_TRUE(resp.SetEnableOutput(false));
    EXPECT_TRUE(resp.SetHttpdRestart(true));
    EXPECT_FALSE(resp.IsEnableOutput());
    EXPECT_TRUE(resp.GetHttpdRestart());
}

TEST(APIResponseRedirect, BuildsLocationOnCurrentHostOrIsRefused)
{
    APIRequest req = MakeRequest(R"({"HTTPS": "on", "HTTP_HOST": "h"})");
    APIResponse resp(&req);
    EXPECT_TRUE(resp.Redirect("p"));
    EXPECT_EQ("https://h/p", resp.GetHeader("Location"));
    EXPECT_EQ(302, resp.GetStatus());
    EXPECT_TRUE(resp.Redirect("/q?x=1"));
    EXPECT_EQ("https://h/q?x=1", resp.GetHeader("Location"));

    APIRequest plainReq = MakeRequest(R"({"HTTP_HOST": "h:5000"})");
    APIResponse plain(&plainReq);
    EXPECT_TRUE(plain.Redirect("/"));
    EXPECT_EQ("http://h:5000/", plain.GetHeader("Location"));

    // Refused without a request, with an empty path or a line break.
    APIResponse none(nullptr);
    EXPECT_FALSE(none.Redirect("/p"));
    APIRequest hReq = MakeRequest(R"({"HTTP_HOST": "h"})");
    APIResponse refused(&hReq);
    EXPECT_FALSE(refused.Redirect(""));
    EXPECT_FALSE(refused.Redirect("/p\r\nSet-Cookie: a=b"));
    EXPECT_FALSE(refused.HasHeader("Location"));
    EXPECT_FALSE(refused.HasHeader("Status"));
}

int g_a, g_b;
void CallbackF(void*) {}
void CallbackG(void*) {}

TEST(APIResponseCallback, DuplicatesAndNullAreDroppedOrderKept)
{
    APIResponse resp(nullptr);
    resp.SetCallbackFunc(CallbackF, &g_a);
    resp.SetCallbackFunc(CallbackF, &g_a);
    resp.SetCallbackFunc(nullptr, &g_a);
    resp.SetCallbackFunc(CallbackF, &g_b);
    const APICallbackList expected = {{CallbackF, &g_a}, {CallbackF, &g_b}};
    EXPECT_EQ(expected, resp.GetCallbackFuncs());

    // A list from another response keeps its order.
    APIResponse from(nullptr);
    from.SetCallbackFunc(CallbackF, &g_a);
    from.SetCallbackFunc(CallbackG, &g_b);
    from.SetCallbackFunc(CallbackG, nullptr);
    APIResponse to(nullptr);
    to.SetCallbackFunc(CallbackG, &g_b);
    to.SetCallbackFuncs(&from.GetCallbackFuncs());
    to.SetCallbackFuncs(nullptr);
    to.SetCallbackFuncs(&to.GetCallbackFuncs());
    const APICallbackList merged = {{CallbackG, &g_b}, {CallbackF, &g_a}, {CallbackG, nullptr}};
    EXPECT_EQ(merged, to.GetCallbackFuncs());
}

}  // namespace
}  // namespace VELA
