// The permission hooks of WebEntry against real login sessions and access
// tokens under a fresh VELA_ROOT: verdicts and their error codes, the
// session facts, the verdict cache, user classes and application privileges.
#include <gtest/gtest.h>

#include <stdlib.h>
#include <string>
#include <sys/stat.h>
#include <vector>

#include "platform/StateRootTest.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/session.h"
#include "vela/token.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/JsonUtil.h"
#include "webentry/WebEntry.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::Test::LogCapture;
using VELA::Test::ScopedEnv;

const char kApi[] = "VELA.Test.Perm";
const char kClient[] = "192.0.2.7";

// A WebEntry whose request is prepared by hand instead of by Initialize.
class PreparedEntry : public VELA::WebEntry {
public:
    // Declares kApi with `desc` and makes the request call `method` of it
    // (version 1) with the session cookie `sid` ("" for none).
    void Prepare(const Json::Value& desc, const std::string& method, const std::string& sid)
    {
        libDesc_[kApi] = desc;
        Json::Value env(Json::objectValue);
        env["REQUEST_METHOD"] = "GET";
        if (!sid.empty()) {
            env["HTTP_COOKIE"] = "lang=x; id=" + sid;
        }
        request_->InitEnv(env);
        Json::Value param;
        param["getParam"]["api"] = kApi;
        param["getParam"]["version"] = "1";
        param["getParam"]["method"] = method;
        request_->InitParam(param, true);
        request_->InitAPIInfo(desc);
    }
    bool Check() { return CheckPermission(request_, response_); }
    const Json::Value& Slots() { return permission_["permResult"]; }
};

// Methods: "get" plain, "poll" with allowTimeout, "anywhere" with
// skipCheckIP, "own" with its own "allowUser" list.
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

class PermissionTest : public StateRootTest {
protected:
    std::string Login(const char* user, VELA::Session::Options options = VELA::Session::Options())
    {
        std::string sid, token;
        EXPECT_EQ(0, VELA::Session::Create(user, kClient, &options, sid, token));
        return sid;
    }
    long long LastUse(const std::string& sid)
    {
        std::vector<VELA::Session::Record> all;
        EXPECT_EQ(0, VELA::Session::List(all));
        for (const VELA::Session::Record& r : all) {
            if (r.sid == sid) {
                return r.lastUse;
            }
        }
        ADD_FAILURE() << "no session " << sid;
        return -1;
    }

    ScopedEnv remote_{"REMOTE_ADDR", kClient};
    ScopedEnv token_{"velaAccessToken", nullptr};
    ScopedEnv user_{"VELA_WEBAPI_USERNAME", nullptr};
    ScopedEnv protect_{"HTTP_X_VELA_TOKEN", nullptr};
};

TEST_F(PermissionTest, AuthLevelDecidesWhetherTheCheckRunsAndIsEnforced)
{
    PreparedEntry e;
    EXPECT_TRUE(e.NeedPermission(nullptr));
    EXPECT_FALSE(e.SkipPermission(nullptr));
    const struct {
        const char* desc;
        bool need;
        bool skip;
    } cases[] = {{R"({"authLevel": 0})", false, false}, {R"({"authLevel": 1})", true, false},
                 {R"({"authLevel": 2})", true, true},   {R"({"authLevel": null})", true, false},
                 {R"({"authLevel": "0"})", true, false}};
    for (const auto& c : cases) {
        e.Prepare(Desc(c.desc), "get", "");
        EXPECT_EQ(c.need, e.NeedPermission(e.GetRequest())) << c.desc;
        EXPECT_EQ(c.skip, e.SkipPermission(e.GetRequest())) << c.desc;
    }
}

TEST_F(PermissionTest, NoSessionAndNoTokenIsUnauthenticated)
{
    PreparedEntry e;
    e.Prepare(Desc(), "get", "");
    EXPECT_FALSE(e.Check());
    EXPECT_EQ(119, e.GetResponseObject()->GetError());
    EXPECT_EQ("unauth", e.GetResponseObject()->GetServerError());
    EXPECT_EQ(AUTH_RESULT_UNAUTHENTICATED, e.GetRequest()->GetAuthResult());
    EXPECT_FALSE(e.GetRequest()->IsAuthorized());
}

TEST_F(PermissionTest, ASessionIdCutByANulByteNamesNoSession)
{
    const std::string sid = Login("root");
    PreparedEntry e;
    e.Prepare(Desc(), "get", sid + "%00x");
    ASSERT_EQ(sid + std::string(1, '\0') + "x", e.GetRequest()->GetSessionID());
    EXPECT_FALSE(e.Check());
    EXPECT_EQ(105, e.GetResponseObject()->GetError());
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, e.GetRequest()->GetAuthResult());
    EXPECT_EQ("", e.GetRequest()->GetLoginUserName());
}

TEST_F(PermissionTest, ValidSessionGivesItsFactsAndTheVerdictIsCachedPerSlot)
{
    VELA::Session::Options options;
    options.idleTimeout = 600;
    options.app = "VELA.App";
    options.webapi = "full";
    options.lang = "ger";
    const std::string sid = Login("root", options);
    PreparedEntry e;
    e.Prepare(Desc(), "get", sid);
    ASSERT_TRUE(e.Check());
    APIRequest* r = e.GetRequest();
    EXPECT_EQ(0, e.GetResponseObject()->GetError());
    EXPECT_FALSE(e.GetResponseObject()->HasServerError());
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, r->GetAuthResult());
    EXPECT_EQ("root", r->GetLoginUserName());
    EXPECT_TRUE(r->IsAdmin());
    EXPECT_TRUE(r->IsAuthorized());
    EXPECT_FALSE(r->IsTimeout());
    EXPECT_FALSE(r->IsSkipCheckIP());
    EXPECT_EQ(600, r->GetTimeoutDuration());
    EXPECT_EQ("ger", r->GetUILanguage());
    EXPECT_EQ("VELA.App", r->GetApplication());
    EXPECT_EQ("full", r->GetWebAPIPriv());
    EXPECT_EQ(root_.Path() + "/run/vela/sessions/" + sid, r->GetSessionFilePath());
    EXPECT_TRUE(r->HasAppPriv(""));
    ASSERT_NE(nullptr, getenv("VELA_WEBAPI_USERNAME"));
    EXPECT_STREQ("root", getenv("VELA_WEBAPI_USERNAME"));
    EXPECT_EQ(J("[null, 1]"), e.Slots());

    // The session goes away: the slot already computed is reused, the other
    // one asks the platform and learns that there is no session.
    ASSERT_EQ(0, VELA::Session::Remove(sid.c_str()));
    EXPECT_EQ(0, e.CheckPermission(false));
    EXPECT_EQ(105, e.CheckPermission(true));
    EXPECT_EQ(J("[-2, 1]"), e.Slots());
}

TEST_F(PermissionTest, TimeoutAddressAndTokenProtectionRefusals)
{
    VELA::Session::Options options;
    options.idleTimeout = 60;
    const std::string sid = Login("root", options);
    {
        Now() += 61;
        PreparedEntry e;
        e.Prepare(Desc(), "get", sid);
        EXPECT_FALSE(e.Check());
        EXPECT_EQ(106, e.GetResponseObject()->GetError());
        EXPECT_EQ("timeout", e.GetResponseObject()->GetServerError());
        EXPECT_EQ(AUTH_RESULT_TIMEOUT, e.GetRequest()->GetAuthResult());
    }
    const std::string other = Login("root");
    {
        ScopedEnv moved("REMOTE_ADDR", "198.51.100.1");
        PreparedEntry e;
        e.Prepare(Desc(), "get", other);
        EXPECT_FALSE(e.Check());
        EXPECT_EQ(150, e.GetResponseObject()->GetError());
        EXPECT_EQ("errorip", e.GetResponseObject()->GetServerError());

        PreparedEntry anywhere;
        anywhere.Prepare(Desc(), "anywhere", other);
        EXPECT_TRUE(anywhere.Check());
        EXPECT_EQ("root", anywhere.GetRequest()->GetLoginUserName());
    }
    options.tokenProtect = true;
    const std::string guarded = Login("root", options);
    {
        LogCapture log;
        PreparedEntry e;
        e.Prepare(Desc(), "get", guarded);
        EXPECT_FALSE(e.Check());
        EXPECT_EQ(105, e.GetResponseObject()->GetError());
        EXPECT_EQ("noprivilege", e.GetResponseObject()->GetServerError());
        EXPECT_TRUE(log.Contains("WebEntry:566 Token Authentication Fail."));
    }
}

TEST_F(PermissionTest, AllowTimeoutDoesNotMoveTheLastUse)
{
    const std::string sid = Login("root");
    Now() += 100;
    {
        PreparedEntry e;
        e.Prepare(Desc(), "poll", sid);
        EXPECT_TRUE(e.Check());
        EXPECT_EQ(J("[1, null]"), e.Slots());
    }
    EXPECT_EQ(kStart, LastUse(sid));
    {
        PreparedEntry e;
        e.Prepare(Desc(), "get", sid);
        EXPECT_TRUE(e.Check());
    }
    EXPECT_EQ(kStart + 100, LastUse(sid));
}

TEST_F(PermissionTest, UserClassesOfTheApiAndTheMethod)
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
        PreparedEntry e;
        e.Prepare(Desc(c.apiLevel), c.method, c.sid);
        EXPECT_EQ(c.allowed, e.Check()) << c.apiLevel << " " << c.method;
        if (!c.allowed) {
            EXPECT_EQ(105, e.GetResponseObject()->GetError());
            EXPECT_FALSE(e.GetResponseObject()->HasServerError());
        }
    }
}

TEST_F(PermissionTest, ApplicationPrivilegeIsCheckedFromTheClientAddress)
{
    const std::string normal = Login("daemon");
    const std::string admin = Login("root");
    const Json::Value desc = Desc(R"({"appPriv": "VELA.Photo"})");
    {
        PreparedEntry e;
        e.Prepare(desc, "get", normal);
        EXPECT_FALSE(e.Check());
        EXPECT_EQ(105, e.GetResponseObject()->GetError());
    }
    {
        PreparedEntry e;
        e.Prepare(desc, "get", admin);
        ASSERT_TRUE(e.Check());
        EXPECT_TRUE(e.GetRequest()->HasAppPriv("VELA.Photo"));
    }
    ASSERT_EQ(0, mkdir((root_.Path() + "/etc").c_str(), 0755));
    ASSERT_EQ(0, mkdir((root_.Path() + "/etc/vela").c_str(), 0755));
    ASSERT_TRUE(VELA::JsonWriteFile(root_.Path() + "/etc/vela/app_privileges.json",
                                    J(R"({"applications": {"VELA.Photo": {"users": ["daemon"],
                                        "allow_from": ["192.0.2.0/24"]}}})")));
    {
        PreparedEntry e;
        e.Prepare(desc, "get", normal);
        EXPECT_TRUE(e.Check());
    }
}

TEST_F(PermissionTest, AccessTokenGrantsOnlyItsMethods)
{
    std::string token, id;
    ASSERT_EQ(0, VelaAccessTokenCreate("daemon", {"VELA.Test.*"}, {"get"}, 0, token, id));
    ScopedEnv tid("velaAccessToken", token.c_str());
    {
        PreparedEntry e;
        e.Prepare(Desc(), "get", "");
        ASSERT_TRUE(e.Check());
        EXPECT_EQ("daemon", e.GetRequest()->GetLoginUserName());
        EXPECT_FALSE(e.GetRequest()->IsAdmin());
        EXPECT_EQ("", e.GetRequest()->GetSessionFilePath());
        EXPECT_STREQ("daemon", getenv("VELA_WEBAPI_USERNAME"));
    }
    {
        // A stale session cookie falls back to the token.
        PreparedEntry e;
        e.Prepare(Desc(), "get", std::string(VELA_SESSION_ID_LEN, 'A'));
        EXPECT_TRUE(e.Check());
    }
    {
        PreparedEntry e;
        e.Prepare(Desc(), "poll", "");
        EXPECT_FALSE(e.Check());
        EXPECT_EQ(119, e.GetResponseObject()->GetError());
        EXPECT_EQ("unauth", e.GetResponseObject()->GetServerError());
        EXPECT_EQ("", e.GetRequest()->GetLoginUserName());
    }
}

TEST_F(PermissionTest, SharingLinksAreRefused)
{
    LogCapture log;
    PreparedEntry e;
    e.Prepare(Desc(), "get", "");
    EXPECT_FALSE(e.CheckSharingPermission(e.GetRequest(), e.GetResponseObject()));
    EXPECT_EQ(105, e.GetResponseObject()->GetError());
    EXPECT_TRUE(log.Contains("sharing links are not available"));
}

}  // namespace
