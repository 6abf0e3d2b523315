// Body, headers, status, redirect, options and callbacks of APIResponse.
#include <gtest/gtest.h>

#include "response/APIResponsePrivate.h"
#include "support/TestSupport.h"
#include "vela/task.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

namespace VELA {
namespace {

APIRequest MakeRequest(const Json::Value& environ)
{
    Json::Value json;
    json["environ"] = environ;
    return APIRequest(json);
}

Json::Value Obj(const char* key, const Json::Value& value)
{
    Json::Value v(Json::objectValue);
    v[key] = value;
    return v;
}

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
    Json::Value error = Obj("success", false);
    error["error"] = Obj("code", 105);
    EXPECT_EQ(error, resp.GetBody());
    EXPECT_EQ(105, resp.GetError());

    resp.SetError(120, Obj("name", "x"));
    error["error"] = Obj("code", 120);
    error["error"]["errors"] = Obj("name", "x");
    EXPECT_EQ(error, resp.GetBody());

    resp.SetSuccess(Obj("a", 1));
    Json::Value success = Obj("success", true);
    success["data"] = Obj("a", 1);
    EXPECT_EQ(success, resp.GetBody());
    EXPECT_EQ(0, resp.GetError());

    resp.SetSuccess();
    EXPECT_EQ(Obj("success", true), resp.GetBody());
}

TEST(APIResponseBody, PollingTaskAnswersGoIntoItsRecord)
{
    VELA::Test::TempDir root;
    VELA::Test::ScopedEnv rootEnv("VELA_ROOT", root.Path().c_str());
    VELA::System::RootReset();
    const std::string id = TARN::TaskUtil::getUniqueID("admin", "t-");
    Json::Value env = Obj("task_id", id);
    env["task_user"] = "admin";
    APIRequest req = MakeRequest(env);
    APIResponse resp(&req);
    TARN::Task task("admin", id);
    resp.SetSuccess(Obj("n", 1));
    ASSERT_TRUE(task.reload());
    EXPECT_EQ(1, task.getProperty("body")["data"]["n"].asInt());
    EXPECT_TRUE(task.getBoolProperty("task_run", false));
    resp.SetError(1001);
    ASSERT_TRUE(task.reload());
    EXPECT_EQ(1001, task.getProperty("body")["error"]["code"].asInt());
    EXPECT_EQ(Json::Value(false), resp.GetBody()["success"]);

    // A removed record is not made again by a later answer.
    ASSERT_TRUE(task.remove());
    VELA::Test::LogCapture log;
    resp.SetSuccess();
    EXPECT_TRUE(log.Contains("cannot record the answer of task"));
    EXPECT_FALSE(TARN::TaskUtil::checkTaskExists("admin", id));
    VELA::System::RootReset();
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
    Json::Value env = Obj("HTTPS", "on");
    env["HTTP_HOST"] = "h";
    APIRequest req = MakeRequest(env);
    APIResponse resp(&req);
    EXPECT_TRUE(resp.Redirect("p"));
    EXPECT_EQ("https://h/p", resp.GetHeader("Location"));
    EXPECT_EQ(302, resp.GetStatus());
    EXPECT_TRUE(resp.Redirect("/q?x=1"));
    EXPECT_EQ("https://h/q?x=1", resp.GetHeader("Location"));

    APIRequest plainReq = MakeRequest(Obj("HTTP_HOST", "h:5000"));
    APIResponse plain(&plainReq);
    EXPECT_TRUE(plain.Redirect("/"));
    EXPECT_EQ("http://h:5000/", plain.GetHeader("Location"));

    // Refused without a request, with an empty path or a line break.
    APIResponse none(nullptr);
    EXPECT_FALSE(none.Redirect("/p"));
    APIRequest hReq = MakeRequest(Obj("HTTP_HOST", "h"));
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
