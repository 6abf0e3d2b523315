// PermissionCheck against real login sessions and access tokens under a
// fresh VELA_ROOT: verdicts and their error codes, the session facts, the
// verdict cache, user classes and application privileges; and the same
// check behind WebEntry's permission hooks after Initialize.
#include <gtest/gtest.h>

#include <algorithm>
#include <stdlib.h>
#include <string>

#include "access/PermissionCheck.h"
#include "dispatcher/PipeFixture.h"
#include "support/JsonLiteral.h"
#include "support/SessionFacts.h"
#include "support/TestSupport.h"
#include "vela/session.h"
#include "vela/token.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"
#include "webentry/WebEntry.h"

namespace {

// The description check is the runner's own business; these tests call it
// to prepare a request the way the road would have.
struct Runner : VELA::APIRunner {
    using VELA::APIRunner::CheckRequestParam;
};
struct Entry : VELA::WebEntry {
    using VELA::WebEntry::CheckRequestParam;
};

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::PermissionCheck;
using VELA::Test::LogCapture;
using VELA::Test::ScopedEnv;

const char kApi[] = "VELA.Test.Perm";
const char kClient[] = "192.0.2.7";

// Methods: "get" plain, "poll" with allowTimeout, "anywhere" with
// skipCheckIP, "own" with its own "allowUser" list. `apiLevel` (JSON text)
// adds or replaces members of the API's description.
Json::Value Desc(const std::string& apiLevel = "")
{
    Json::Value desc = J(R"({"lib": "libperm.so", "minVersion": 1, "maxVersion": 1, "authLevel": 1,
        "methods": {"1": ["get", {"poll": {"allowTimeout": true}}, {"anywhere": {"skipCheckIP": true}},
                          {"own": {"allowUser": ["normal.local"]}}]}})");
    if (!apiLevel.empty()) {
        for (const auto& name : J(apiLevel).getMemberNames()) {
            desc[name] = J(apiLevel)[name];
        }
    }
    return desc;
}

// A runner whose request calls `method` of kApi (version 1) with the session
// cookie `sid` ("" for none), as the front end would have built it, and the
// check of that runner. kApi is read from the working directory.
struct PreparedCall {
    PreparedCall(const std::string& method, const std::string& sid)
    {
        Json::Value env = J(R"({"REQUEST_METHOD": "GET"})");
        if (!sid.empty()) {
            env["HTTP_COOKIE"] = "lang=x; id=" + sid;
        }
        Req()->InitEnv(env);
        Req()->InitParam(J(R"({"getParam": {"api": "VELA.Test.Perm", "version": "1", "method": ")" + method + "\"}}"),
                         true);
        EXPECT_TRUE(runner.CheckRequestParam(Req(), Resp())) << method;
        EXPECT_TRUE(runner.AddAPIInfo(Req()));
    }
    APIRequest* Req() { return runner.GetRequest(); }
    APIResponse* Resp() { return runner.GetResponseObject(); }
    bool Check() { return check.CheckPermission(Req(), Resp(), nullptr); }
    // The check refuses with error `code` and the x-request-error `word`
    // ("": none; null: not looked at).
    void ExpectRefused(int code, const char* word = nullptr)
    {
        EXPECT_FALSE(Check());
        EXPECT_EQ(code, Resp()->GetError());
        if (word != nullptr) {
            EXPECT_EQ(*word != '\0', Resp()->HasServerError());
            EXPECT_EQ(word, Resp()->GetServerError());
        }
    }
    const Json::Value& Slots() { return check.Verdicts()["permResult"]; }

    Runner runner;
    PermissionCheck check{runner};
};

// A fresh system root whose web-API directory is the working directory.
class PermissionCheckTest : public WebapiDirFixture {
protected:
    void SetUp() override
    {
        WebapiDirFixture::SetUp();
        Declare(Desc());
    }

    // kApi as `desc` for the runners made from now on.
    void Declare(const Json::Value& desc)
    {
        Json::Value file(Json::objectValue);
        file[kApi] = desc;
        WriteJson(std::string(kApi) + ".lib", file);
    }
    std::string Login(const char* user, VELA::Session::Options options = VELA::Session::Options())
    {
        std::string sid, token;
        EXPECT_EQ(0, VELA::Session::Create(user, kClient, &options, sid, token));
        return sid;
    }
    long long LastUse(const std::string& sid)
    {
        Json::Value session;
        EXPECT_TRUE(VELA::WebAPIUtil::ReadJsonFile(In("/run/vela/sessions/" + sid), session)) << sid;
        return session["lastUse"].asInt64();
    }

    ScopedEnv remote_{"REMOTE_ADDR", kClient};
    ScopedEnv token_{"velaAccessToken", nullptr};
    ScopedEnv user_{"VELA_WEBAPI_USERNAME", nullptr};
    ScopedEnv protect_{"HTTP_X_VELA_TOKEN", nullptr};
};

TEST(PermissionCheckAuthLevel, DecidesWhetherTheCheckRunsAndIsEnforced)
{
    EXPECT_TRUE(PermissionCheck::NeedPermission(nullptr));
    EXPECT_FALSE(PermissionCheck::SkipPermission(nullptr));
    const struct {
        const char* desc;
        bool need;
        bool skip;
    } cases[] = {{R"({"authLevel": 0})", false, false}, {R"({"authLevel": 1})", true, false},
                 {R"({"authLevel": 2})", true, true},   {R"({"authLevel": null})", true, false},
                 {R"({"authLevel": "0"})", true, false}, {R"({})", true, false}};
    for (const auto& c : cases) {
        APIRequest req;
        req.InitAPIInfo(J(c.desc));
        EXPECT_EQ(c.need, PermissionCheck::NeedPermission(&req)) << c.desc;
        EXPECT_EQ(c.skip, PermissionCheck::SkipPermission(&req)) << c.desc;
    }
}

TEST_F(PermissionCheckTest, NoSessionAndNoTokenIsUnauthenticatedOptionalLoginNoRefusal)
{
    LogCapture log;
    PreparedCall c("get", "");
    c.ExpectRefused(119, "unauth");
    EXPECT_EQ(AUTH_RESULT_UNAUTHENTICATED, c.Req()->GetAuthResult());
    EXPECT_FALSE(c.Req()->IsAuthorized());
    EXPECT_EQ(J("[null, -5]"), c.Slots());
    EXPECT_EQ(1, std::count_if(log.Lines().begin(), log.Lines().end(), [](const std::string& line) {
                  return line.find("session check refused") != std::string::npos;
              }));

    // Where the login is optional, the same verdict is no refusal and logs
    // nothing.
    Declare(Desc(R"({"authLevel": 2})"));
    LogCapture optionalLog;
    PreparedCall optional("get", "");
    optional.ExpectRefused(119, "unauth");
    EXPECT_TRUE(PermissionCheck::SkipPermission(optional.Req()));
    EXPECT_FALSE(optionalLog.Contains("session check refused"));
}

TEST_F(PermissionCheckTest, ValidSessionGivesItsFactsAndTheVerdictIsCachedPerSlot)
{
    VELA::Session::Options options;
    options.idleTimeout = 600;
    options.app = "VELA.App";
    options.webapi = "full";
    options.lang = "ger";
    const std::string sid = Login("root", options);
    PreparedCall c("get", sid);
    ASSERT_TRUE(c.Check());
    APIRequest* r = c.Req();
    EXPECT_EQ(0, c.Resp()->GetError());
    EXPECT_FALSE(c.Resp()->HasServerError());
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, r->GetAuthResult());
    EXPECT_EQ("0011 ger 600 root|VELA.App|full|" + In("/run/vela/sessions/" + sid), VELA::Test::SessionFacts(*r));
    EXPECT_TRUE(r->HasAppPriv(""));
    ASSERT_NE(nullptr, getenv("VELA_WEBAPI_USERNAME"));
    EXPECT_STREQ("root", getenv("VELA_WEBAPI_USERNAME"));
    EXPECT_EQ(J("[null, 1]"), c.Slots());

    // The session goes away: the slot already computed is reused, the other
    // one asks the platform and learns that there is no session.
    ASSERT_EQ(0, VELA::Session::Remove(sid.c_str()));
    EXPECT_EQ(0, c.check.CheckPermission(false, nullptr));
    EXPECT_EQ(105, c.check.CheckPermission(true, nullptr));
    EXPECT_EQ(J("[-2, 1]"), c.Slots());
}

TEST_F(PermissionCheckTest, TimeoutAddressTokenProtectionAndCutIdRefusals)
{
    VELA::Session::Options options;
    options.idleTimeout = 60;
    const std::string sid = Login("root", options);
    {
        // Past the idle timeout even a method a page polls is refused.
        Now() += 61;
        PreparedCall("poll", sid).ExpectRefused(106, "timeout");
        PreparedCall c("get", sid);
        c.ExpectRefused(106, "timeout");
        EXPECT_EQ(AUTH_RESULT_TIMEOUT, c.Req()->GetAuthResult());
    }
    const std::string other = Login("root");
    {
        ScopedEnv moved("REMOTE_ADDR", "198.51.100.1");
        PreparedCall("get", other).ExpectRefused(150, "errorip");
        PreparedCall anywhere("anywhere", other);
        EXPECT_TRUE(anywhere.Check());
        EXPECT_EQ("root", anywhere.Req()->GetLoginUserName());
    }
    options.tokenProtect = true;
    const std::string guarded = Login("root", options);
    {
        LogCapture log;
        PreparedCall("get", guarded).ExpectRefused(105, "noprivilege");
        EXPECT_TRUE(log.Contains("WebEntry:566 Token Authentication Fail."));
    }
    {
        // A session id cut by a NUL byte names no session.
        PreparedCall c("get", other + "%00x");
        ASSERT_EQ(other + std::string(1, '\0') + "x", c.Req()->GetSessionID());
        c.ExpectRefused(105);
        EXPECT_EQ(AUTH_RESULT_NO_SESSION, c.Req()->GetAuthResult());
        EXPECT_EQ("", c.Req()->GetLoginUserName());
    }
}

TEST_F(PermissionCheckTest, AllowTimeoutDoesNotMoveTheLastUse)
{
    const std::string sid = Login("root");
    Now() += 100;
    {
        PreparedCall c("poll", sid);
        EXPECT_TRUE(c.Check());
        EXPECT_EQ(J("[1, null]"), c.Slots());
    }
    EXPECT_EQ(kStart, LastUse(sid));
    EXPECT_TRUE(PreparedCall("get", sid).Check());
    EXPECT_EQ(kStart + 100, LastUse(sid));
}

TEST_F(PermissionCheckTest, UserClassesAndApplicationPrivilege)
{
    const std::string admin = Login("root");
    const std::string normal = Login("daemon");
    const struct {
        const char* apiLevel;
        const char* method;
        const std::string& sid;
        bool allowed;
    } cases[] = {
        {R"({"allowUser": ["admin.local"]})", "get", normal, false},
        {R"({"allowUser": ["admin.local"]})", "get", admin, true},
        {R"({"allowUser": ["admin.domain", "normal.local"]})", "get", normal, true},
        {R"({"allowUser": ["Normal.local", 8]})", "get", normal, false},
        {R"({"allowUser": []})", "get", normal, true},
        {R"({"allowUser": "admin.local"})", "get", normal, true},
        {R"({"allowUser": ["admin.local"]})", "own", normal, true},
    };
    for (const auto& c : cases) {
        Declare(Desc(c.apiLevel));
        SCOPED_TRACE(std::string(c.apiLevel) + " " + c.method);
        PreparedCall call(c.method, c.sid);
        if (c.allowed) {
            EXPECT_TRUE(call.Check());
        } else {
            call.ExpectRefused(105, "");
        }
    }

    // An application privilege is checked from the client address.
    Declare(Desc(R"({"appPriv": "VELA.Photo"})"));
    PreparedCall("get", normal).ExpectRefused(105);
    {
        PreparedCall c("get", admin);
        ASSERT_TRUE(c.Check());
        EXPECT_TRUE(c.Req()->HasAppPriv("VELA.Photo"));
    }
    Conf("app_privileges.json",
         R"({"applications": {"VELA.Photo": {"users": ["daemon"], "allow_from": ["192.0.2.0/24"]}}})");
    EXPECT_TRUE(PreparedCall("get", normal).Check());
}

// A relayed call: the session first, then the relay privilege from the
// client's address; the API's own rules are not judged here.
TEST_F(PermissionCheckTest, RelayNeedsASessionAndTheRelayPrivilege)
{
    const std::string admin = Login("root");
    const std::string normal = Login("daemon");
    struct Relay : PreparedCall {
        using PreparedCall::PreparedCall;
        bool Check() { return check.CheckRelay(Req(), Resp(), false, nullptr); }
    };
    Declare(Desc(R"({"allowUser": ["normal.local"], "appPriv": "VELA.Photo"})"));
    {
        Relay none("get", "");
        EXPECT_FALSE(none.Check());
        EXPECT_EQ(119, none.Resp()->GetError());
        EXPECT_EQ("unauth", none.Resp()->GetServerError());
    }
    EXPECT_TRUE(Relay("get", admin).Check()) << "the API's allowUser and appPriv are the peer's to judge";
    {
        Relay refused("get", normal);
        LogCapture log;
        EXPECT_FALSE(refused.Check());
        EXPECT_EQ(105, refused.Resp()->GetError());
        EXPECT_EQ("noprivilege", refused.Resp()->GetServerError());
        EXPECT_TRUE(log.Contains("relay refused: daemon lacks the privilege VELA.Relay"));
    }
    Conf("app_privileges.json", R"({"applications": {"VELA.Relay": {"users": ["daemon"],
        "allow_from": ["198.51.100.0/24"]}}})");
    EXPECT_FALSE(Relay("get", normal).Check()) << "granted only from other addresses";
    Conf("app_privileges.json", R"({"applications": {"VELA.Relay": {"users": ["daemon"],
        "allow_from": ["192.0.2.0/24"]}}})");
    EXPECT_TRUE(Relay("get", normal).Check());
    EXPECT_EQ(0, VELA::Session::Remove(normal.c_str()));
    EXPECT_FALSE(Relay("get", normal).Check()) << "a privilege without a session";
}

// The judgement of a caller that already acts as the user (velaapi): the
// description's rules without a session, with no refusal logged or set.
TEST_F(PermissionCheckTest, UserMayCallJudgesTheDescriptionWithoutASession)
{
    Conf("app_privileges.json", R"({"applications": {"VELA.Open": {"users": ["daemon"]},
        "VELA.Near": {"users": ["daemon"], "allow_from": ["192.0.2.0/24"]}}})");
    const struct {
        const char* apiLevel;
        const char* method;
        const char* user;
        const char* remote;
        bool allowed;
    } cases[] = {
        {R"({"allowUser": ["admin.local"]})", "get", "daemon", kClient, false},
        {R"({"allowUser": ["admin.local"]})", "get", "root", kClient, true},
        {R"({"allowUser": ["admin.local"]})", "own", "daemon", kClient, true},
        {R"({"allowUser": ["admin.local"], "authLevel": 0})", "get", "daemon", kClient, true},
        {R"({"allowUser": ["admin.local"], "authLevel": 2})", "get", "daemon", kClient, true},
        {R"({"appPriv": "VELA.Open"})", "get", "daemon", nullptr, true},
        {R"({"appPriv": "VELA.Open"})", "get", "nobody", nullptr, false},
        {R"({"appPriv": "VELA.Near"})", "get", "daemon", kClient, true},
        // No client address is known: a rule bound to addresses grants nothing.
        {R"({"appPriv": "VELA.Near"})", "get", "daemon", nullptr, false},
    };
    for (const auto& c : cases) {
        ScopedEnv remote("REMOTE_ADDR", c.remote);
        Declare(Desc(c.apiLevel));
        PreparedCall call(c.method, "");
        Json::Value session(Json::objectValue);
        session["username"] = c.user;
        session["isAdmin"] = std::string(c.user) == "root";
        call.Req()->InitSession(session);
        LogCapture log;
        EXPECT_EQ(c.allowed, call.check.UserMayCall(call.Req())) << c.apiLevel << " " << c.method << " " << c.user;
        EXPECT_FALSE(log.Contains("PermissionCheck:")) << c.apiLevel << ": a refusal was logged";
        EXPECT_EQ(0, call.Resp()->GetError()) << c.apiLevel;
    }
    Runner runner;
    EXPECT_FALSE(PermissionCheck(runner).UserMayCall(nullptr));
}

TEST_F(PermissionCheckTest, AccessTokenGrantsOnlyItsMethods)
{
    std::string token, id;
    ASSERT_EQ(0, VelaAccessTokenCreate("daemon", {"VELA.Test.*"}, {"get"}, 0, token, id));
    ScopedEnv tid("velaAccessToken", token.c_str());
    {
        PreparedCall c("get", "");
        ASSERT_TRUE(c.Check());
        EXPECT_EQ("daemon", c.Req()->GetLoginUserName());
        EXPECT_FALSE(c.Req()->IsAdmin());
        EXPECT_EQ("", c.Req()->GetSessionFilePath());
        EXPECT_STREQ("daemon", getenv("VELA_WEBAPI_USERNAME"));
        // Another call of the same client, to "poll": the cached verdict on
        // "get" does not open it (a compound's calls share one check).
        APIRequest sub(*c.Req());
        sub.InitParam(J(R"({"postParam": {"method": "poll"}})"), false);
        APIResponse subResp(&sub);
        EXPECT_FALSE(c.check.CheckPermission(&sub, &subResp, nullptr));
        EXPECT_EQ(119, subResp.GetError());
        EXPECT_TRUE(c.Check());  // and "get" is still granted
    }
    // A stale session cookie falls back to the token.
    EXPECT_TRUE(PreparedCall("get", std::string(VELA_SESSION_ID_LEN, 'A')).Check());
    {
        PreparedCall c("poll", "");
        c.ExpectRefused(119, "unauth");
        EXPECT_EQ("", c.Req()->GetLoginUserName());
    }
}

// The front end's hooks on a request built by Initialize from the CGI
// environment: "_sid" of the query reaches the check through the cookie,
// with the front end's own CGI handle, and both overloads share one cache.
TEST_F(PermissionCheckTest, WebEntryHooksCheckTheSessionOfItsRequest)
{
    const std::string sid = Login("root");
    ScopedEnv method("REQUEST_METHOD", "GET");
    ScopedEnv cookie("HTTP_COOKIE", "id=stale");
    ScopedEnv query("QUERY_STRING", ("api=VELA.Test.Perm&version=1&method=get&_sid=" + sid).c_str());
    Entry entry;
    APIRequest* req = entry.GetRequest();
    APIResponse* resp = entry.GetResponseObject();
    ASSERT_TRUE(entry.Initialize(Json::Value()));
    ASSERT_TRUE(entry.CheckRequestParam(req, resp));
    ASSERT_TRUE(entry.AddAPIInfo(req));

    EXPECT_TRUE(entry.NeedPermission(req));
    EXPECT_FALSE(entry.SkipPermission(req));
    ASSERT_TRUE(entry.CheckPermission(req, resp));
    EXPECT_EQ("root", req->GetLoginUserName());
    EXPECT_EQ(root_.Path() + "/run/vela/sessions/" + sid, req->GetSessionFilePath());
    ASSERT_EQ(0, VELA::Session::Remove(sid.c_str()));
    EXPECT_EQ(0, entry.CheckPermission(false));
    EXPECT_EQ(105, entry.CheckPermission(true));

    LogCapture log;
    EXPECT_FALSE(entry.CheckSharingPermission(req, resp));
    EXPECT_EQ(126, resp->GetError());
    EXPECT_TRUE(log.Contains("not a sharing request"));
}

}  // namespace

// The calls of a compound request are other request objects of the same
// client, checked by the runner's one PermissionCheck.
TEST_F(PermissionCheckTest, EveryCallOfOneClientIsCheckedOnItsOwn)
{
    PreparedCall c("get", Login("daemon"));
    APIRequest sub(*c.Req());  // copied before the check: no facts yet
    ASSERT_TRUE(c.Check());
    APIResponse subResp(&sub);
    ASSERT_TRUE(c.check.CheckPermission(&sub, &subResp, nullptr));
    EXPECT_EQ("daemon", sub.GetLoginUserName());  // the cached verdict brings its facts
    // (A call the cached verdict does not open: AccessTokenGrantsOnlyItsMethods.)
}
