// WebEntry::Initialize against a controlled process environment; the cases
// with a body run in a forked child whose standard input is a pipe.
#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/JsonUtil.h"
#include "webentry/ChildRun.h"
#include "webentry/WebEntry.h"

using VELA::Test::LogCapture;
using VELA::Test::ScopedEnv;

namespace {

std::string EnvOr(const char* name, const char* def)
{
    const char* v = getenv(name);
    return v != nullptr ? v : def;
}

class WebEntryInit : public ::testing::Test {
protected:
    void SetUp() override
    {
        for (const char* name : {"REQUEST_METHOD", "QUERY_STRING", "CONTENT_LENGTH", "CONTENT_TYPE", "HTTP_COOKIE",
                                 "HTTP_X_VELA_SHARING", "velaAccessToken", "HTTP_X_VELA_ACCESS_TOKEN",
                                 "HTTP_X_TYPE_NAME",
                                 "HTTP_ACCEPT_LANGUAGE"}) {
            Set(name, nullptr);
        }
    }
    void TearDown() override
    {
        while (!env_.empty()) {
            env_.pop_back();  // newest first, so every variable gets its first state back
        }
    }
    void Set(const char* name, const char* value) { env_.emplace_back(new ScopedEnv(name, value)); }

    // Initialize in a child whose standard input holds `body`; reports
    // {"ok", "error", "params", "api", "contentType", "stdinLeft"}. With
    // `upload`, HandleUpload runs after it.
    Json::Value InitializeWithBody(const std::string& body, bool upload = false)
    {
        return J(RunChild(body, [upload] {
            VELA::System::RootReset();
            Json::Value r;
            {
                VELA::WebEntry entry;
                VELA::APIRequest* req = entry.GetRequest();
                r["ok"] = entry.Initialize(Json::Value());
                if (upload && r["ok"].asBool()) {
                    r["ok"] = entry.HandleUpload(req, entry.GetResponseObject());
                }
                r["error"] = entry.GetResponseObject()->GetError();
                r["params"] = req->GetParam("");
                r["api"] = req->GetAPIClass();
                r["contentType"] = entry.GetResponseObject()->GetHeader("Content-type");
                char c[64];
                r["stdinLeft"] = static_cast<int>(read(STDIN_FILENO, c, sizeof(c)));
            }
            const std::string text = VELA::JsonToString(r);
            (void)!write(STDOUT_FILENO, text.data(), text.size());
        }));
    }

    std::vector<std::unique_ptr<ScopedEnv>> env_;
};

}  // namespace

TEST_F(WebEntryInit, GetQueryParametersAndBrokenPercentEncoding)
{
    Set("REQUEST_METHOD", "GET");
    Set("HTTP_ACCEPT_LANGUAGE", "de-DE,de;q=0.9");
    VELA::WebEntry entry;
    VELA::APIRequest* req = entry.GetRequest();
    ASSERT_TRUE(entry.Initialize(Json::Value()));
    EXPECT_EQ(0, entry.GetResponseObject()->GetError());
    EXPECT_EQ(Json::Value(Json::objectValue), req->GetParam(""));
    EXPECT_EQ(VELA::REQUEST_METHOD_GET, req->GetRequestMethod());
    EXPECT_EQ(Json::Value(true), req->GetAttr("_collector_count_webapi"));
    EXPECT_EQ("ger", req->GetUILanguage());
    EXPECT_EQ("GET", req->GetEnv("REQUEST_METHOD").asString());

    Set("QUERY_STRING", "api=VELA.Sample&version=1&method=echo&n=a%20b+c");
    {
        VELA::WebEntry entry;
        ASSERT_TRUE(entry.Initialize(Json::Value()));
        EXPECT_EQ(J(R"({"api": "VELA.Sample", "version": "1", "method": "echo", "n": "a b c"})"),
                  entry.GetRequest()->GetParam(""));
        EXPECT_EQ(1, entry.GetRequest()->GetAPIVersion());
    }
    for (const char* bad : {"api=VELA.Sample&n=%zz", "n=%4", "n=100%"}) {
        Set("QUERY_STRING", bad);
        LogCapture log;
        VELA::WebEntry entry;
        EXPECT_FALSE(entry.Initialize(Json::Value())) << bad;
        EXPECT_EQ(101, entry.GetResponseObject()->GetError()) << bad;
        EXPECT_TRUE(log.Contains("broken percent-encoding")) << bad;
    }
}

// The identity parameters of the query move into the process environment
// and the request's: "_sid" replaces the cookie's id (the first "id=" of the
// header, a plain substring search, becomes "abandoned="), "tid" becomes
// the access token only without "_sid", "_sharing_id" the sharing header,
// and "_sharing_sid" a cookie only with a sharing id. Once an identity
// parameter is given, both headers join the request's environment even when
// empty; "; " joins what is appended only to a cookie header the client sent.
// The header X-Vela-Access-Token stands for "tid" when the parameter is
// absent: the access token without a session id, nothing beside one; and it
// never becomes a parameter.
TEST_F(WebEntryInit, AccessTokenHeaderStandsForTid)
{
    Set("REQUEST_METHOD", "GET");
    const struct {
        const char* query;
        const char* header;  // null: none
        const char* token;   // velaAccessToken ("-": unset)
    } cases[] = {
        {"api=A", "tok2", "tok2"},
        {"tid=tok1", "tok2", "tok1"},
        {"_sid=abc", "tok2", "-"},
        {"api=A", "", "-"},
        {"api=A", nullptr, "-"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.query) + " / " + (c.header ? c.header : "(no header)"));
        Set("QUERY_STRING", c.query);
        Set("HTTP_X_VELA_ACCESS_TOKEN", c.header);
        Set("velaAccessToken", nullptr);
        VELA::WebEntry entry;
        ASSERT_TRUE(entry.Initialize(Json::Value()));
        EXPECT_EQ(c.token, EnvOr("velaAccessToken", "-"));
        EXPECT_FALSE(entry.GetRequest()->HasParam("tid") && std::string(c.query).find("tid=") == std::string::npos);
    }
}

TEST_F(WebEntryInit, IdentityParametersMoveIntoTheHeaders)
{
    Set("REQUEST_METHOD", "GET");
    const struct {
        const char* query;
        const char* cookieIn;   // null: no Cookie header
        const char* cookie;     // the request's
        const char* envCookie;  // the process's ("-": unset)
        const char* sharing;    // the request's (the process's: "-" when empty)
        const char* token;      // velaAccessToken ("-": unset)
        const char* sid;        // the request's session id (null: not looked at)
    } cases[] = {
        {"_sid=abc", "id=old; x=1", "abandoned=old; x=1; id=abc", "abandoned=old; x=1; id=abc", "", "-", "abc"},
        {"_sid=abc", "xsid=old", "xsabandoned=old; id=abc", "xsabandoned=old; id=abc", "", "-", "abc"},
        {"_sid=abc", nullptr, "id=abc", "id=abc", "", "-", "abc"},
        {"_sid=abc", "", "id=abc", "id=abc", "", "-", "abc"},
        {"tid=tok1", "id=old", "id=old", "id=old", "", "tok1", "old"},
        {"tid=tok1", nullptr, "", "-", "", "tok1", nullptr},
        {"tid=tok1&_sid=abc", "id=old", "abandoned=old; id=abc", "abandoned=old; id=abc", "", "-", "abc"},
        {"_sharing_sid=q", "a=1", "a=1", "a=1", "", "-", nullptr},
        {"_sharing_sid=q", nullptr, "", "-", "", "-", nullptr},
        {"_sharing_id=L1", "a=1", "a=1", "a=1", "L1", "-", nullptr},
        {"_sharing_id=L1&_sharing_sid=q", "a=1", "a=1; sharing_sid=q", "a=1; sharing_sid=q", "L1", "-", nullptr},
        {"_sharing_id=L1&_sharing_sid=q", nullptr, "sharing_sid=q", "sharing_sid=q", "L1", "-", nullptr},
        // No Cookie header came in: nothing joins the session id to the
        // sharing session cookie, and no "id=" is looked for.
        {"_sharing_id=L1&_sharing_sid=q&_sid=abc", nullptr, "sharing_sid=qid=abc", "sharing_sid=qid=abc", "L1", "-",
         nullptr},
        {"_sharing_id=L1&_sharing_sid=q&_sid=abc", "id=old", "abandoned=old; sharing_sid=q; id=abc",
         "abandoned=old; sharing_sid=q; id=abc", "L1", "-", "abc"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.query) + " / " + (c.cookieIn ? c.cookieIn : "(no cookie)"));
        Set("QUERY_STRING", c.query);
        Set("HTTP_COOKIE", c.cookieIn);
        Set("HTTP_X_VELA_SHARING", nullptr);
        Set("velaAccessToken", nullptr);
        VELA::WebEntry entry;
        ASSERT_TRUE(entry.Initialize(Json::Value()));
        const VELA::APIRequest* req = entry.GetRequest();
        EXPECT_EQ(Json::Value(c.cookie), req->GetEnv("HTTP_COOKIE"));
        EXPECT_EQ(c.envCookie, EnvOr("HTTP_COOKIE", "-"));
        EXPECT_EQ(Json::Value(c.sharing), req->GetEnv("HTTP_X_VELA_SHARING"));
        EXPECT_EQ(*c.sharing ? c.sharing : "-", EnvOr("HTTP_X_VELA_SHARING", "-"));
        EXPECT_EQ(*c.sharing != '\0', req->IsSharing());
        EXPECT_EQ(c.sharing, req->GetSharingID());
        EXPECT_EQ(c.token, EnvOr("velaAccessToken", "-"));
        EXPECT_EQ(c.token, std::string(req->GetVelaAccessTokenID() ? req->GetVelaAccessTokenID() : "-"));
        const std::string cookie = c.cookie;
        const size_t at = cookie.find("sharing_sid=");
        EXPECT_EQ(at != std::string::npos, req->HasCookie("sharing_sid"));
        EXPECT_EQ(at == std::string::npos ? "" : cookie.substr(at + 12, cookie.find(';', at) - at - 12),
                  req->GetSharingSID());
        if (c.sid != nullptr) {
            EXPECT_EQ(c.sid, req->GetSessionID());
        }
    }

    // A session id that would add a cookie is refused.
    Set("HTTP_COOKIE", "x=1");
    Set("HTTP_X_VELA_SHARING", nullptr);
    for (const char* query : {"_sid=abc%3B%20sharing_sid%3Devil", "_sharing_id=L1&_sharing_sid=q%3B%20id%3Devil",
                              "_sid=ok&_sharing_id=L1&_sharing_sid=q%2C"}) {
        Set("QUERY_STRING", query);
        VELA::WebEntry entry;
        EXPECT_FALSE(entry.Initialize(Json::Value())) << query;
        EXPECT_EQ(101, entry.GetResponseObject()->GetError()) << query;
        EXPECT_EQ("x=1", EnvOr("HTTP_COOKIE", "-")) << query;
        EXPECT_EQ("-", EnvOr("HTTP_X_VELA_SHARING", "-")) << query;
    }
}

TEST_F(WebEntryInit, PostBodyOverridesQueryStdinIsClosedAfterItBadBodiesRefused)
{
    Set("REQUEST_METHOD", "POST");
    Set("QUERY_STRING", "method=get&q=1");
    const std::string body = "method=set&b=x%2By";
    Set("CONTENT_LENGTH", std::to_string(body.size()).c_str());
    const Json::Value r = InitializeWithBody(body + "TRAILING");
    EXPECT_TRUE(r["ok"].asBool()) << r;
    EXPECT_EQ(J(R"({"method": "set", "q": "1", "b": "x+y"})"), r["params"]);
    EXPECT_EQ(0, r["stdinLeft"].asInt());  // /dev/null, not the rest of the pipe

    const struct {
        const char* length;
        std::string body;
    } cases[] = {
        {"0", ""},                                 // empty
        {nullptr, "a=1"},                          // no length
        {"10", "a=1"},                             // shorter than CONTENT_LENGTH
        {"16777217", "a=1"},                       // above the bound
        {"3x", "a=1"},                             // not a number
        {"7", std::string("a=1\0b=2", 7)},         // NUL byte
        {"6", "a=%zz1"},                           // broken percent-encoding
    };
    for (const auto& c : cases) {
        Set("CONTENT_LENGTH", c.length);
        const Json::Value r = InitializeWithBody(c.body);
        EXPECT_FALSE(r["ok"].asBool()) << (c.length ? c.length : "null");
        EXPECT_EQ(101, r["error"].asInt()) << (c.length ? c.length : "null");
    }
}

// An upload whose identity comes from the form fields before the first file
// part: nothing of the body is lost for the full load that follows.
TEST_F(WebEntryInit, UploadIdentityFromLeadingFields)
{
    VELA::Test::TempDir root;
    ASSERT_EQ(0, mkdir((root.Path() + "/tmp").c_str(), 0700));
    Set("VELA_ROOT", root.Path().c_str());
    const auto field = [](const std::string& name, const std::string& value) {
        return "--XyZ\r\nContent-Disposition: form-data; name=\"" + name + "\"\r\n\r\n" + value + "\r\n";
    };
    const std::string file = field("file\"; filename=\"a.txt", "hello");
    const std::string body =
        field("api", "VELA.Sample") + field("version", "1") + field("method", "put") + file + field("after", "yes") +
        "--XyZ--\r\n";
    Set("REQUEST_METHOD", "POST");
    Set("CONTENT_TYPE", "multipart/form-data; boundary=XyZ");
    Set("CONTENT_LENGTH", std::to_string(body.size()).c_str());
    const Json::Value r = InitializeWithBody(body, true);
    ASSERT_TRUE(r["ok"].asBool()) << r;
    EXPECT_EQ("VELA.Sample", r["api"].asString());
    EXPECT_EQ("text/plain; charset=\"UTF-8\"", r["contentType"].asString());
    const Json::Value& p = r["params"];
    EXPECT_EQ("put", p["method"].asString());
    EXPECT_EQ("yes", p["after"].asString());
    EXPECT_EQ("a.txt", p["file_name"].asString());
    EXPECT_EQ("hello", VELA::Test::ReadText(p["file"].asString()));

    // Without the identity before the first file part the upload is refused.
    const std::string late = file + field("api", "VELA.Sample") + "--XyZ--\r\n";
    Set("CONTENT_LENGTH", std::to_string(late.size()).c_str());
    const Json::Value refused = InitializeWithBody(late, true);
    EXPECT_FALSE(refused["ok"].asBool());
    EXPECT_EQ(101, refused["error"].asInt());
}
