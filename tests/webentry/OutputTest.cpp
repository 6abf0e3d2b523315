// The CGI reply: header block bytes and the compact JSON body, written by
// WebEntry and by the velascgi program as the web server runs it (a CGI
// environment, a body on standard input, the reply on standard output).
#include <gtest/gtest.h>

#include <iostream>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <vector>

#include "response/APIResponsePrivate.h"
#include "support/TestSupport.h"
#include "webapi/APIResponse.h"
#include "webentry/ChildRun.h"
#include "webentry/WebEntry.h"

namespace {

const char kFixed[] =
    "Accept-Ranges: none\r\n"
    "X-Content-Type-Options: nosniff\r\n"
    "X-XSS-Protection: 1; mode=block\r\n"
    "Cache-Control: max-age=0, no-cache, no-store, must-revalidate\r\n"
    "Pragma: no-cache\r\n"
    "Expires: 0\r\n"
    "\r\n";
const std::string kJson = "Content-type: application/json; charset=\"UTF-8\"\r\n";

// Everything written to std::cout while it lives.
class CoutCapture {
public:
    CoutCapture() : old_(std::cout.rdbuf(buf_.rdbuf())) {}
    ~CoutCapture() { std::cout.rdbuf(old_); }
    std::string Text() const { return buf_.str(); }

private:
    std::ostringstream buf_;
    std::streambuf* old_;
};

std::string Header(VELA::WebEntry& entry)
{
    CoutCapture out;
    entry.OutputHeader();
    return out.Text();
}

}  // namespace

TEST(WebEntryOutputHeader, FreshEmptyAndFullResponses)
{
    VELA::WebEntry entry;
    EXPECT_EQ(kJson + kFixed, Header(entry));

    entry.GetResponseObject()->GetPrivate()->ClearData("headers", "");
    EXPECT_EQ(kFixed, Header(entry));

    // Headers in name order, non-strings skipped, cookies before the fixed
    // lines.
    VELA::WebEntry full;
    VELA::APIResponse* resp = full.GetResponseObject();
    ASSERT_TRUE(resp->SetHeader("X-Trace", "t1"));
    ASSERT_TRUE(resp->SetHeader("Location", "https://h/x"));
    ASSERT_TRUE(resp->GetPrivate()->SetData("headers", "X-Count", Json::Value(5), false));
    ASSERT_TRUE(resp->AddCookie("a", "1", "/", 0, "", false, true));
    ASSERT_TRUE(resp->AddCookie("b", "2", "/", 0, "", true, false));
    const Json::Value cookies = resp->GetCookies();
    ASSERT_EQ(2u, cookies.size());

    const std::string expected = kJson +
                                 "Location: https://h/x\r\n"
                                 "X-Trace: t1\r\n"
                                 "Set-Cookie: " + cookies[0].asString() + "\r\n"
                                 "Set-Cookie: " + cookies[1].asString() + "\r\n" + kFixed;
    EXPECT_EQ(expected, Header(full));
}

TEST(WebEntryOutputBody, CompactJsonThenFlush)
{
    VELA::WebEntry entry;
    Json::Value data;
    data["name"] = "a b\"c";
    data["list"].append(1);
    entry.GetResponseObject()->SetSuccess(data);
    CoutCapture out;
    entry.OutputBody();
    EXPECT_EQ(R"({"data":{"list":[1],"name":"a b\"c"},"success":true})", out.Text());
}

// The refusals of the registry and the front end; 500 without the web-API
// directory.
TEST(Velascgi, RefusalsAnswerTheirCodeAndTheFixedHeaders)
{
    const std::string root = BuiltProgram("root");
    struct stat st;
    ASSERT_EQ(0, stat((root + "/usr/vela/velaman/webapi/lib.def").c_str(), &st))
        << "the build stages the web-API directory under " << root;
    VELA::Test::TempDir empty;
    const struct {
        std::string root;
        std::vector<std::string> env;
        std::string reply;
    } cases[] = {
        {root, {"REQUEST_METHOD=GET", "QUERY_STRING=api=VELA.NoSuchApi&version=1&method=get"},
         kJson + kFixed + R"({"error":{"code":102},"success":false})"},
        {root, {"REQUEST_METHOD=POST", "CONTENT_LENGTH=0", "CONTENT_TYPE=application/x-www-form-urlencoded"},
         kJson + kFixed + R"({"error":{"code":101},"success":false})"},
        {empty.Path(), {"REQUEST_METHOD=GET"},
         "Status: 500 Internal Server Error\r\n" + kJson + kFixed + R"({"error":{"code":117},"success":false})"},
    };
    for (const auto& c : cases) {
        std::vector<std::string> env = c.env;
        env.push_back("VELA_ROOT=" + c.root);
        EXPECT_EQ(c.reply, RunWithEnv(BuiltProgram("velascgi"), env, "")) << c.reply;
    }
}
