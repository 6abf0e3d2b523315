// The CGI reply: header block bytes and the compact JSON body.
#include <gtest/gtest.h>

#include <iostream>
#include <sstream>
#include <string>

#include "response/APIResponsePrivate.h"
#include "webapi/APIResponse.h"
#include "webentry/WebEntry.h"

namespace {

const char kFixed[] =
    "X-Content-Type-Options: nosniff\r\n"
    "X-XSS-Protection: 1; mode=block\r\n"
    "Cache-Control: max-age=0, no-cache, no-store, must-revalidate\r\n"
    "Pragma: no-cache\r\n"
    "Expires: 0\r\n"
    "\r\n";

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
    EXPECT_EQ(std::string("Content-type: application/json; charset=\"UTF-8\"\r\n") + kFixed, Header(entry));

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

    const std::string expected = "Content-type: application/json; charset=\"UTF-8\"\r\n"
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
