#include <gtest/gtest.h>

#include <fstream>
#include <sys/stat.h>

#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"

using VELA::APIRequest;

namespace {

APIRequest WithEnv(const Json::Value& env)
{
    Json::Value request(Json::objectValue);
    request["environ"] = env;
    return APIRequest(request);
}

}  // namespace

TEST(RequestMethod, ExactNamesOnly)
{
    EXPECT_EQ(VELA::REQUEST_METHOD_GET, WithEnv(J(R"({"REQUEST_METHOD": "GET"})")).GetRequestMethod());
    EXPECT_EQ(VELA::REQUEST_METHOD_POST, WithEnv(J(R"({"REQUEST_METHOD": "POST"})")).GetRequestMethod());
    EXPECT_EQ(VELA::REQUEST_METHOD_HEAD, WithEnv(J(R"({"REQUEST_METHOD": "HEAD"})")).GetRequestMethod());
    EXPECT_EQ(0, WithEnv(J(R"({"REQUEST_METHOD": "get"})")).GetRequestMethod());
    EXPECT_EQ(0, WithEnv(J(R"({"REQUEST_METHOD": "PUT"})")).GetRequestMethod());
}

TEST(RequestMethod, RederivedOnEveryMergeButUnknownKeepsTheOld)
{
    APIRequest r = WithEnv(J(R"({"REQUEST_METHOD": "GET"})"));
    r.InitEnv(J(R"({"REQUEST_METHOD": "POST"})"));
    EXPECT_EQ(VELA::REQUEST_METHOD_POST, r.GetRequestMethod());
    r.InitEnv(J(R"({"REQUEST_METHOD": "DELETE"})"));
    EXPECT_EQ(VELA::REQUEST_METHOD_POST, r.GetRequestMethod());
}

TEST(RequestURL, Scheme)
{
    EXPECT_EQ("https", WithEnv(J(R"({"HTTPS": "on"})")).GetURLProto("x"));
    EXPECT_EQ("https", WithEnv(J(R"({"HTTPS": "ON"})")).GetURLProto("x"));
    EXPECT_EQ("http", WithEnv(J(R"({"HTTPS": "1"})")).GetURLProto("x"));
    EXPECT_EQ("http", APIRequest().GetURLProto("x"));
}

// X-Forwarded-Proto counts only when the peer is a configured trusted proxy:
// a client's own header would make the login cookie Secure, or anything
// else that follows the scheme.
TEST(RequestURL, ForwardedSchemeOnlyFromATrustedProxy)
{
    VELA::Test::TempDir root;
    VELA::Test::ScopedEnv rootEnv("VELA_ROOT", root.Path().c_str());
    VELA::System::RootReset();
    const auto proto = [](const char* remote) {
        Json::Value env = J(R"({"HTTPS": "off", "HTTP_X_FORWARDED_PROTO": "HTTPS"})");
        env["REMOTE_ADDR"] = remote;
        return WithEnv(env).GetURLProto("x");
    };
    EXPECT_EQ("http", proto("127.0.0.1"));  // no proxy configured, loopback included
    ASSERT_EQ(0, mkdir((root.Path() + "/etc").c_str(), 0755));
    ASSERT_EQ(0, mkdir((root.Path() + "/etc/vela").c_str(), 0755));
    std::ofstream(root.Path() + "/etc/vela/webapi.conf") << "trusted_proxies=\"192.0.2.10\"\n";
    EXPECT_EQ("https", proto("192.0.2.10"));
    EXPECT_EQ("http", proto("192.0.2.11"));
    EXPECT_EQ("http", proto("127.0.0.1"));
    EXPECT_EQ("http", WithEnv(J(R"({"HTTP_X_FORWARDED_PROTO": "https"})")).GetURLProto("x"));  // no peer
    VELA::System::RootReset();
}

TEST(RequestURL, HostAndPort)
{
    struct Case {
        const char* env;
        const char* host;
        int port;
    } cases[] = {
        {R"({"HTTP_HOST": "myhost", "HTTPS": "on"})", "myhost", 443},
        {R"({"HTTP_HOST": "myhost"})", "myhost", 80},
        {R"({"HTTP_HOST": "10.0.0.5:5001"})", "10.0.0.5", 5001},
        {R"({"HTTP_HOST": "[fe80::1]:5001"})", "[fe80::1]", 5001},
        {R"({"HTTP_HOST": "[fe80::1]", "HTTPS": "on"})", "[fe80::1]", 443},
        {R"({"HTTP_HOST": "[fe80::1]junk"})", "[fe80::1]", 80},
        {R"({"HTTP_HOST": "fe80::1"})", "fe80:", 1},
        {R"({"HTTP_HOST": "host:"})", "host", 80},
        {R"({"HTTP_HOST": "host:abc"})", "host", 0},
        {R"({"HTTP_HOST": "host:99999999999999999999"})", "host", 0},
        {R"({"HTTP_HOST": ":"})", "", 80},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.env);
        APIRequest r = WithEnv(J(c.env));
        EXPECT_EQ(c.host, r.GetURLHost("dflt"));
        EXPECT_EQ(c.port, r.GetURLPort(-1));
    }
}

TEST(RequestURL, UnusableHostLeavesHostAndPortToTheDefaults)
{
    for (const char* env : {R"({"HTTP_HOST": "[::1"})", R"({"HTTP_HOST": ""})", "{}"}) {
        SCOPED_TRACE(env);
        Json::Value e = J(env);
        e["REQUEST_URI"] = "/a/b";
        APIRequest r = WithEnv(e);
        EXPECT_EQ("dflt", r.GetURLHost("dflt"));
        EXPECT_EQ(-1, r.GetURLPort(-1));
        EXPECT_EQ("http", r.GetURLProto("x"));
        EXPECT_EQ("/a/", r.GetURLPath("x"));
    }
}

TEST(RequestURL, PathAndName)
{
    APIRequest a = WithEnv(J(R"({"REQUEST_URI": "/webapi/entry.cgi?api=x/y"})"));
    EXPECT_EQ("/webapi/", a.GetURLPath("d"));
    EXPECT_EQ("entry.cgi", a.GetURLName("d"));
    APIRequest b = WithEnv(J(R"({"REQUEST_URI": "/webapi/"})"));
    EXPECT_EQ("/webapi/", b.GetURLPath("d"));
    EXPECT_EQ("", b.GetURLName("d"));
    APIRequest c = WithEnv(J(R"({"REQUEST_URI": "entry.cgi"})"));
    EXPECT_EQ("d", c.GetURLPath("d"));
    EXPECT_EQ("d", c.GetURLName("d"));
    APIRequest d = WithEnv(J(R"({"REQUEST_URI": "/a/../b//c%2f"})"));
    EXPECT_EQ("/a/../b//", d.GetURLPath("d"));  // no decoding, no normalisation
    EXPECT_EQ("c%2f", d.GetURLName("d"));
}

TEST(RequestURL, FactsAreFrozenAtFirstUse)
{
    APIRequest r = WithEnv(J(R"({"HTTP_HOST": "first:1", "REQUEST_URI": "/a/x"})"));
    EXPECT_EQ("first", r.GetURLHost(""));
    r.InitEnv(J(R"({"HTTP_HOST": "second:2", "REQUEST_URI": "/b/y", "HTTPS": "on"})"));
    EXPECT_EQ("first", r.GetURLHost(""));
    EXPECT_EQ(1, r.GetURLPort(0));
    EXPECT_EQ("/a/", r.GetURLPath(""));
    EXPECT_EQ("http", r.GetURLProto(""));
}

TEST(RequestRemoteIP, StoredAddressWinsOverThePlatform)
{
    VELA::Test::ScopedEnv remote("REMOTE_ADDR", "192.0.2.7");
    APIRequest r = WithEnv(J(R"({"vela_remoteIP": "198.51.100.1"})"));
    EXPECT_EQ("198.51.100.1", r.GetRemoteIP());
}

TEST(RequestRemoteIP, AskedOnceAndCached)
{
    VELA::Test::TempDir root;
    VELA::Test::ScopedEnv rootEnv("VELA_ROOT", root.Path().c_str());
    VELA::Test::ScopedEnv forwarded("HTTP_X_FORWARDED_FOR", nullptr);
    APIRequest r;
    {
        VELA::Test::ScopedEnv remote("REMOTE_ADDR", "192.0.2.7");
        EXPECT_EQ("192.0.2.7", r.GetRemoteIP());
    }
    VELA::Test::ScopedEnv remote("REMOTE_ADDR", "192.0.2.8");
    EXPECT_EQ("192.0.2.7", r.GetRemoteIP());
    EXPECT_EQ("192.0.2.7", r.GetEnv("vela_remoteIP").asString());
}

TEST(RequestRemoteIP, UnknownAddressIsEmptyAndRetried)
{
    APIRequest r;
    {
        VELA::Test::ScopedEnv remote("REMOTE_ADDR", nullptr);
        EXPECT_EQ("", r.GetRemoteIP());
        EXPECT_FALSE(r.HasEnv("vela_remoteIP"));
    }
    VELA::Test::ScopedEnv remote("REMOTE_ADDR", "2001:db8::1");
    EXPECT_EQ("2001:db8::1", r.GetRemoteIP());
}
