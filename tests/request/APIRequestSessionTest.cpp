#include <gtest/gtest.h>

#include <sys/stat.h>

#include "support/JsonLiteral.h"
#include "support/LinearTime.h"
#include "support/TestSupport.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"

using VELA::APIRequest;

namespace {

APIRequest WithCookie(const std::string& header)
{
    Json::Value request(Json::objectValue);
    request["environ"]["HTTP_COOKIE"] = header;
    return APIRequest(request);
}

}  // namespace

TEST(RequestCookieHeader, PiecesNamesAndValues)
{
    APIRequest r = WithCookie("id=abc; lang=en%20US;broken;k=a=b;  sp=1;=novalue;e=");
    EXPECT_EQ("abc", r.GetSessionID());
    EXPECT_EQ("en US", r.GetCookie("lang"));
    EXPECT_EQ("a=b", r.GetCookie("k"));
    EXPECT_EQ("1", r.GetCookie("sp"));  // blanks after ";" are not part of the name
    EXPECT_EQ("", r.GetCookie("e", "d"));
    EXPECT_FALSE(r.HasCookie("broken"));
    EXPECT_FALSE(r.HasCookie(""));
}

TEST(RequestCookieHeader, LaterCookieWinsAndSetCookiesSurviveAMerge)
{
    APIRequest r = WithCookie("id=one; id=two");
    EXPECT_EQ("two", r.GetSessionID());
    r.SetCookie("local", "x");
    r.InitEnv(J(R"({"HTTP_COOKIE": "id=three"})"));
    EXPECT_EQ("three", r.GetSessionID());
    EXPECT_EQ("x", r.GetCookie("local"));
}

TEST(RequestCookieHeader, OddEncodingsAndSizes)
{
    APIRequest r = WithCookie("a=%; b=%4; c=%zz; d=%41%42; e=x+y; f=%00z; ;;; ");
    EXPECT_EQ("%", r.GetCookie("a"));
    EXPECT_EQ("%4", r.GetCookie("b"));
    EXPECT_EQ("%zz", r.GetCookie("c"));
    EXPECT_EQ("AB", r.GetCookie("d"));
    EXPECT_EQ(std::string("\0z", 2), r.GetCookie("f"));
    APIRequest big = WithCookie("id=" + std::string(1 << 20, 'v') + ";" + std::string(100000, ';'));
    EXPECT_EQ(size_t(1) << 20, big.GetSessionID().size());
}

// Cookies reach the process in one environment variable, which the kernel
// caps at 128 KiB; the request JSON of velarun has no cap, so the cookie
// parser is held to the same rule as the body parsers.
TEST(RequestCookieHeader, ParsedInLinearTime)
{
    const VELA::Test::LinearParser cookies = [](const std::string& text) {
        Json::Value request;
        request["environ"]["HTTP_COOKIE"] = text;
        APIRequest req(request);
        req.GetCookie("id", "");
    };
    for (const char* piece : {";", "a=;", "id=%41"}) {
        VELA::Test::ExpectLinear("cookie header", cookies, piece, 2u << 20);
    }
}

TEST(RequestSessionFacts, DefaultsOfAnEmptySession)
{
    APIRequest r;
    EXPECT_TRUE(r.IsTimeout());
    EXPECT_TRUE(r.IsSkipCheckIP());
    EXPECT_FALSE(r.IsAuthorized());
    EXPECT_FALSE(r.IsAdmin());
    EXPECT_EQ("enu", r.GetUILanguage());
    EXPECT_EQ(0, r.GetTimeoutDuration());
    EXPECT_EQ("", r.GetLoginUserName());
    EXPECT_EQ("", r.GetApplication());
    EXPECT_EQ("", r.GetWebAPIPriv());
    EXPECT_EQ("", r.GetSessionFilePath());
    EXPECT_TRUE(r.HasAppPriv(""));
    EXPECT_FALSE(r.HasAppPriv("x"));
    EXPECT_EQ(static_cast<uid_t>(-1), r.GetLoginUID());
}

TEST(RequestSessionFacts, StoredFactsAndTheirConversions)
{
    APIRequest r(J(R"({"session": {"username": "alice", "isAdmin": "yes", "isTimeout": 0,
        "isSkipCheckIP": [], "isAuthorized": 2, "timeout": "900", "uiLang": "ger", "app": "a",
        "webapi": "w", "sessFile": "/f", "appPriv": "VELA.App"}})"));
    EXPECT_EQ("alice", r.GetLoginUserName());
    EXPECT_TRUE(r.IsAdmin());        // non-empty text counts as true
    EXPECT_FALSE(r.IsTimeout());     // 0
    EXPECT_FALSE(r.IsSkipCheckIP()); // empty container
    EXPECT_TRUE(r.IsAuthorized());
    EXPECT_EQ(900, r.GetTimeoutDuration());
    EXPECT_EQ("ger", r.GetUILanguage());
    EXPECT_EQ("a", r.GetApplication());
    EXPECT_EQ("w", r.GetWebAPIPriv());
    EXPECT_EQ("/f", r.GetSessionFilePath());
    EXPECT_TRUE(r.HasAppPriv("VELA.App"));
    EXPECT_FALSE(r.HasAppPriv(""));
}

TEST(RequestLoginUID, StoredUidIsUsedAsIs)
{
    APIRequest r(J(R"({"session": {"uid": 1000, "username": "alice"}})"));
    EXPECT_EQ(1000u, r.GetLoginUID());
    APIRequest neg(J(R"({"session": {"uid": -1}})"));
    EXPECT_EQ(static_cast<uid_t>(-1), neg.GetLoginUID());
    APIRequest bad(J(R"({"session": {"uid": "1000"}})"));
    EXPECT_EQ(static_cast<uid_t>(-1), bad.GetLoginUID());
}

TEST(RequestLoginUID, PlatformAnswerIsStoredEvenWhenItFails)
{
    APIRequest r(J(R"({"session": {"username": "nobody-such-user"}, "environ": {"HTTP_COOKIE": "id=abc"}})"));
    VELA::Test::LogCapture log;
    const uid_t first = r.GetLoginUID();
    EXPECT_EQ(static_cast<uid_t>(-1), first);
    // The verdict is cached in the session: the platform is not asked again.
    const size_t linesAfterFirst = log.Lines().size();
    EXPECT_EQ(first, r.GetLoginUID());
    EXPECT_EQ(linesAfterFirst, log.Lines().size());
    r.InitSession(J(R"({"username": "nobody-such-user", "uid": 42})"));
    EXPECT_EQ(42u, r.GetLoginUID());
}

TEST(RequestAllowUser, BitsFromTheDescription)
{
    APIRequest r(J(R"({"reqLib": {"allowUser": ["admin.local", "normal.ldap", 5, "Admin.local"]}})"));
    EXPECT_EQ(0x21, r.GetAllowUser());
    // Cached in the session: a new description does not change it.
    r.InitAPIInfo(J(R"({"allowUser": ["admin.domain"]})"));
    EXPECT_EQ(0x21, r.GetAllowUser());
    // A zero mask is never a cached answer.
    APIRequest z(J(R"({"reqLib": {"allowUser": ["nobody"]}})"));
    EXPECT_EQ(0, z.GetAllowUser());
    z.InitAPIInfo(J(R"({"allowUser": ["normal.local", "normal.domain", "admin.ldap"]})"));
    EXPECT_EQ(0x1C, z.GetAllowUser());
}

TEST(RequestAllowUser, NoListYieldsZeroAndStoresNothing)
{
    for (const char* desc : {"{}", R"({"allowUser": "admin.local"})", R"({"allowUser": []})"}) {
        SCOPED_TRACE(desc);
        Json::Value request(Json::objectValue);
        request["reqLib"] = J(desc);
        APIRequest r(request);
        EXPECT_EQ(0, r.GetAllowUser());
        EXPECT_EQ(0, r.GetAllowUser());
    }
}

TEST(RequestUpload, ContentTypeAndSliceHeader)
{
    auto upload = [](const char* env) { return APIRequest(J(std::string(R"({"environ": )") + env + "}")).IsUploadRequest(); };
    EXPECT_TRUE(upload(R"({"CONTENT_TYPE": "multipart/form-data; boundary=x"})"));
    EXPECT_FALSE(upload(R"({"CONTENT_TYPE": "Multipart/Form-Data; boundary=x"})"));
    EXPECT_TRUE(upload(R"({"CONTENT_TYPE": "Multipart/Form-Data", "HTTP_X_TYPE_NAME": "sliceUpload"})"));
    EXPECT_FALSE(upload(R"({"CONTENT_TYPE": "application/json"})"));
    EXPECT_FALSE(upload("{}"));
    EXPECT_FALSE(upload(R"({"HTTP_X_TYPE_NAME": "SLICEUPLOADX"})"));
}

TEST(RequestPollingTask, NeedsBothIdAndUser)
{
    EXPECT_FALSE(APIRequest(J(R"({"environ": {"task_id": "t"}})")).IsPollingTask());
    APIRequest r(J(R"({"environ": {"task_id": "t", "task_user": "u", "full_task_id": "@u/t"}})"));
    EXPECT_TRUE(r.IsPollingTask());
    EXPECT_EQ("@u/t", r.GetPollingTaskId());
    EXPECT_EQ("", APIRequest().GetPollingTaskId());
}

TEST(RequestEncryptedParams, HalfAPairIsLeftAlone)
{
    APIRequest r(J(R"({"getParam": {"__nEkOtReHpIc": "tok", "a": 1}})"));
    EXPECT_TRUE(r.HasParam("__nEkOtReHpIc"));
    EXPECT_EQ(1, r.GetParam("a").asInt());
}

TEST(RequestEncryptedParams, EmptyMemberDropsThePairAndNothingElse)
{
    APIRequest r(J(R"({"postParam": {"__nEkOtReHpIc": "tok", "__tXeTrEhPiC": "", "a": 1}})"));
    EXPECT_FALSE(r.HasParam("__nEkOtReHpIc"));
    EXPECT_FALSE(r.HasParam("__tXeTrEhPiC"));
    EXPECT_EQ(1, r.GetParam("a").asInt());
}

TEST(RequestEncryptedParams, FailedDecryptionKeepsTheRestAndNeverSucceedsFalsely)
{
    VELA::Test::LogCapture log;
    APIRequest r(J(R"({"getParam": {"__cIpHeRtExT": "AAAA", "api": "VELA.A",
                                    "webapi": {"__nEkOtReHpIc": "t", "__tXeTrEhPiC": "c", "b": 2}}})"));
    EXPECT_FALSE(r.HasParam("__cIpHeRtExT"));
    EXPECT_EQ("VELA.A", r.GetAPIClass());
    // Decryption failed before the nested object was reached: it is kept.
    EXPECT_TRUE(r.GetParam("webapi").isMember("__tXeTrEhPiC"));
}

TEST(RequestPreferenceDir, UnderTheRootOrTmp)
{
    VELA::Test::TempDir root;
    VELA::Test::ScopedEnv env("VELA_ROOT", root.Path().c_str());
    VELA::System::RootReset();
    APIRequest r(J(R"({"session": {"username": "alice"}})"));
    const std::string dir = r.GetPreferenceDir();
    EXPECT_EQ(0u, dir.find(root.Path() + "/"));
    struct stat st;
    EXPECT_EQ(0, stat(dir.c_str(), &st));
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(0u, r.GetGroupPreferenceDir("staff").find(root.Path() + "/"));
    EXPECT_EQ("/tmp", r.GetGroupPreferenceDir("../etc"));
    EXPECT_EQ("/tmp", r.GetGroupPreferenceDir(""));
    EXPECT_EQ("/tmp", APIRequest(J(R"({"session": {"username": "a/b"}})")).GetPreferenceDir());
    EXPECT_EQ("/tmp", APIRequest().GetPreferenceDir());
    VELA::System::RootReset();
}

TEST(RequestToken, AccessTokenComesFromTheProcessEnvironment)
{
    APIRequest r(J(R"({"environ": {"velaAccessToken": "fromRequest"}})"));
    {
        VELA::Test::ScopedEnv env("velaAccessToken", nullptr);
        EXPECT_EQ(nullptr, r.GetVelaAccessTokenID());
    }
    VELA::Test::ScopedEnv env("velaAccessToken", "tok");
    ASSERT_NE(nullptr, r.GetVelaAccessTokenID());
    EXPECT_STREQ("tok", r.GetVelaAccessTokenID());
}
