// Body, headers, status, redirect, options, callbacks and the Set-Cookie
// lines of APIResponse.
#include <climits>
#include <gtest/gtest.h>
#include <vector>

#include "response/APIResponsePrivate.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/task.h"
#include "vela/vlibc.h"
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

TEST(APIResponseBody, PollingTaskAnswersGoIntoItsRecord)
{
    VELA::Test::TempDir root;
    VELA::Test::ScopedEnv rootEnv("VELA_ROOT", root.Path().c_str());
    VELA::System::RootReset();
    const std::string id = TARN::TaskUtil::getUniqueID("admin", "t-");
    APIRequest req = MakeRequest(R"({"task_id": ")" + id + R"(", "task_user": "admin"})");
    APIResponse resp(&req);
    TARN::Task task("admin", id);
    resp.SetSuccess(J(R"({"n": 1})"));
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

    // Output on and no restart of the web server until a handler says so.
    EXPECT_TRUE(resp.IsEnableOutput());
    EXPECT_FALSE(resp.GetHttpdRestart());
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

APIRequest RequestWithClientTime(const Json::Value& clientTime)
{
    Json::Value json;
    json["getParam"]["client_time"] = clientTime;
    return APIRequest(json);
}

// The single line a cookie with a 10-minute expiry gets under `clientTime`,
// or "" when it was refused.
std::string TenMinuteLine(const Json::Value& clientTime)
{
    APIRequest req = RequestWithClientTime(clientTime);
    APIResponse resp(&req);
    if (!resp.AddCookie("id", "v", "/", 10, "", false, false)) {
        return "";
    }
    return resp.GetCookies()[0].asString();
}

TEST(APIResponseCookie, ExpiryFormsAndNow)
{
    APIResponse resp(nullptr);
    EXPECT_TRUE(resp.AddCookie("sid", "x", "/", -1, "", false, true));
    EXPECT_TRUE(resp.AddCookie("sid", "x", "/", 0, "", false, false));
    EXPECT_TRUE(resp.AddCookie("sid", "x", "/webman", LONG_MIN, "nas.lan", true, false));
    EXPECT_EQ(J(R"(["sid=x; path=/; expires=Thu, 01-Jan-1970 00:00:01 GMT; httponly", "sid=x; path=/",
        "sid=x; path=/webman; expires=Thu, 01-Jan-1970 00:00:01 GMT; domain=nas.lan; secure"])"),
              resp.GetCookies());

    // Without a client time the expiry counts from now.
    APIResponse now(nullptr);
    ASSERT_TRUE(now.AddCookie("id", "v", "/", 1, "", false, false));
    const std::string line = now.GetCookies()[0].asString();
    EXPECT_EQ(0u, line.find("id=v; path=/; expires=")) << line;
    EXPECT_EQ(std::string::npos, line.find("1970")) << line;
}

TEST(APIResponseCookie, ExpiryFromClientTimeOrZero)
{
    APIRequest req = RequestWithClientTime(0);
    APIResponse resp(&req);
    ASSERT_TRUE(resp.AddCookie("id", "a b", "/", 10, "", true, true));
    EXPECT_EQ("id=a%20b; path=/; expires=Thu, 01-Jan-1970 00:10:00 GMT; secure; httponly",
              resp.GetCookies()[0].asString());

    // Read as an integer, like a number sent as text anywhere: blanks around
    // it are skipped and a fraction is dropped; text that is no number
    // counts as 0.
    const struct {
        const char* expires;
        std::vector<Json::Value> clientTimes;
    } cases[] = {
        {"Tue, 14-Nov-2023 22:23:20 GMT",
         {1700000000, 1700000000.9, "1700000000.9", " 1700000000", "\t1700000000 "}},
        {"Sat, 01-Jan-2000 00:10:00 GMT", {"946684800"}},
        {"Thu, 01-Jan-1970 00:11:00 GMT", {"+60", 60.0}},
        {"Thu, 01-Jan-1970 00:09:00 GMT", {"-60", "-60.5"}},
        {"Thu, 01-Jan-1970 00:10:00 GMT",
         {"abc", "12abc", "1e3", "0x10", "5.", ".5", "5 5", std::string("5\0", 2), "", "-", "99999999999999999999",
          1e30, true, Json::Value(), Json::Value(Json::arrayValue)}},
    };
    for (const auto& c : cases) {
        for (const Json::Value& v : c.clientTimes) {
            EXPECT_EQ(std::string("id=v; path=/; expires=") + c.expires, TenMinuteLine(v)) << v.toStyledString();
        }
    }
}

// Refused: an expiry out of range, a missing name or path and a line break
// in path or domain (none of them logged), a name with a character outside
// the token set (logged).
TEST(APIResponseCookie, RefusedCookies)
{
    APIRequest req = RequestWithClientTime(0);
    APIResponse resp(&req);
    EXPECT_FALSE(resp.AddCookie("id", "v", "/", LONG_MAX, "", false, false));
    // Fits time_t, but the year does not fit struct tm.
    EXPECT_FALSE(resp.AddCookie("id", "v", "/", 2000000000000000L, "", false, false));
    EXPECT_EQ("", TenMinuteLine("9223372036854775807"));
    {
        VELA::Test::LogCapture log;
        EXPECT_FALSE(resp.AddCookie("", "v", "/", 0, "", false, false));
        EXPECT_FALSE(resp.AddCookie("id", "v", "", 0, "", false, false));
        EXPECT_TRUE(log.Lines().empty());
    }
    EXPECT_FALSE(resp.AddCookie("id", "v", "/\r\nX-A: 1", 0, "", false, false));
    EXPECT_FALSE(resp.AddCookie("id", "v", "/", 0, "h\n", false, false));
    EXPECT_EQ(0u, resp.GetCookies().size());

    VELA::Test::LogCapture log;
    EXPECT_FALSE(resp.AddCookie("a.b", "v", "/", 0, "", false, false));
    EXPECT_TRUE(log.Contains("APIResponse(84)AddCookie: key[a.b] contains invalid character"));
    EXPECT_FALSE(resp.AddCookie("a b", "v", "/", 0, "", false, false));
    EXPECT_TRUE(log.Contains("key[a b] contains invalid character"));
    EXPECT_FALSE(resp.AddCookie("caf\xc3\xa9", "v", "/", 0, "", false, false));
    EXPECT_FALSE(resp.AddCookie("a;b", "v", "/", 0, "", false, false));
    EXPECT_TRUE(resp.AddCookie("Az_09-x", "v", "/", 0, "", false, false));
    EXPECT_EQ(1u, resp.GetCookies().size());
}

TEST(APIResponseCookie, SameNameTwiceKeepsBothInOrderWithValuesEncoded)
{
    APIResponse resp(nullptr);
    ASSERT_TRUE(resp.AddCookie("id", "1", "/", 0, "", false, false));
    ASSERT_TRUE(resp.AddCookie("id", "x;y=z", "/", 0, "", false, false));
    ASSERT_TRUE(resp.AddCookie("id", "a\r\nSet-Cookie: b", "/", 0, "", false, false));
    EXPECT_EQ(J(R"(["id=1; path=/", "id=x%3By%3Dz; path=/", "id=a%0D%0ASet-Cookie%3A%20b; path=/"])"),
              resp.GetCookies());
}

TEST(APIResponseCookie, SameSiteEndsTheLine)
{
    APIRequest req = RequestWithClientTime(0);
    APIResponse resp(&req);
    ASSERT_TRUE(resp.AddCookie("id", "s", "/", 0, "", true, true, "Strict"));
    ASSERT_TRUE(resp.AddCookie("id", "s", "/", 10, "", false, false, "Lax"));
    ASSERT_TRUE(resp.AddCookie("id", "", "/", -1, "", true, true, ""));
    for (const char* bad : {"strict", "Strict; secure", "Strict\r\nX-A: 1", " None"}) {
        EXPECT_FALSE(resp.AddCookie("id", "s", "/", 0, "", true, true, bad)) << bad;
    }
    EXPECT_EQ(J(R"(["id=s; path=/; secure; httponly; SameSite=Strict",
        "id=s; path=/; expires=Thu, 01-Jan-1970 00:10:00 GMT; SameSite=Lax",
        "id=; path=/; expires=Thu, 01-Jan-1970 00:00:01 GMT; secure; httponly"])"),
              resp.GetCookies());
}

}  // namespace
}  // namespace VELA
