// The CGI handle: cookies, the client address and the fail-closed session
// calls.

#include "platform/PlatformTest.h"

namespace {

using VELA::Test::ScopedEnv;
using Handle = VELA::Test::CgiHandle;

TEST(Cgi, CookiesWithOddPieces)
{
    ScopedEnv cookie("HTTP_COOKIE", "id=abc; lang=en%20US;broken; ;k=a=b;  sp = v ;q=\"quoted\";id=second;bad\x01=x");
    Handle h;
    ASSERT_EQ(0, VelaCgiLoadInCookies(h.ctx));
    EXPECT_STREQ("abc", VelaCgiGetCookie(h.ctx, "id"));  // the first wins
    EXPECT_STREQ("en%20US", VelaCgiGetCookie(h.ctx, "lang"));
    EXPECT_STREQ("a=b", VelaCgiGetCookie(h.ctx, "k"));
    EXPECT_STREQ("v", VelaCgiGetCookie(h.ctx, "sp"));
    EXPECT_STREQ("quoted", VelaCgiGetCookie(h.ctx, "q"));
    EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, "broken"));
    EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, ""));
    EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, "bad\x01"));
    EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, nullptr));
    EXPECT_EQ(nullptr, VelaCgiGetCookie(nullptr, "id"));
}

TEST(Cgi, CookieBounds)
{
    Handle h;
    {
        ScopedEnv cookie("HTTP_COOKIE", nullptr);
        EXPECT_EQ(0, VelaCgiLoadInCookies(h.ctx));
        EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, "id"));
    }
    {
        ScopedEnv cookie("HTTP_COOKIE", ("id=x; big=" + std::string(64 * 1024, 'a')).c_str());
        VELA::Test::LogCapture log;
        EXPECT_EQ(-1, VelaCgiLoadInCookies(h.ctx));
        EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, "id"));
    }
    {
        std::string many;
        for (int i = 0; i < 300; ++i) {
            many += "c" + std::to_string(i) + "=v;";
        }
        ScopedEnv cookie("HTTP_COOKIE", many.c_str());
        VELA::Test::LogCapture log;
        ASSERT_EQ(0, VelaCgiLoadInCookies(h.ctx));
        EXPECT_STREQ("v", VelaCgiGetCookie(h.ctx, "c255"));
        EXPECT_EQ(nullptr, VelaCgiGetCookie(h.ctx, "c256"));
        EXPECT_TRUE(log.Contains("cookies"));
    }
    EXPECT_EQ(-1, VelaCgiLoadInCookies(nullptr));
    EXPECT_EQ(-1, VelaCgiInit("x", nullptr));
    VelaCgiFree(nullptr);
}

class RemoteIP : public RootTest {
protected:
    std::string Get(const char* remote, const char* forwarded)
    {
        ScopedEnv r("REMOTE_ADDR", remote);
        ScopedEnv f("HTTP_X_FORWARDED_FOR", forwarded);
        char buf[64];
        return VelaCgiGetRemoteIP(buf, sizeof(buf)) == 0 ? buf : "FAIL";
    }
};

TEST_F(RemoteIP, DirectClientIgnoresForwardedFor)
{
    EXPECT_EQ("198.51.100.7", Get("198.51.100.7", "127.0.0.1, 1.2.3.4"));
    EXPECT_EQ("2001:db8::1", Get("2001:DB8:0::1", nullptr));  // canonical text
    EXPECT_EQ("FAIL", Get(nullptr, nullptr));
    EXPECT_EQ("FAIL", Get("not-an-ip", nullptr));
    EXPECT_EQ("FAIL", Get("1.2.3.4:5678", nullptr));
}

// Without trusted_proxies no peer is a proxy, loopback included: a local
// client's X-Forwarded-For would otherwise name any address it likes.
TEST_F(RemoteIP, NoProxyIsTrustedUnlessConfigured)
{
    for (const char* conf : {static_cast<const char*>(nullptr), "admin_group=\"x\"\n", "trusted_proxies=\"\"\n"}) {
        if (conf != nullptr) {
            Conf("webapi.conf", conf);
        }
        EXPECT_EQ("127.0.0.1", Get("127.0.0.1", "203.0.113.9")) << (conf ? conf : "no file");
        EXPECT_EQ("::1", Get("::1", "203.0.113.9, 127.0.0.1")) << (conf ? conf : "no file");
        EXPECT_EQ(0, VelaCgiIsTrustedProxy("127.0.0.1")) << (conf ? conf : "no file");
    }
}

TEST_F(RemoteIP, ConfiguredProxyTakesRightmostUntrusted)
{
    Conf("webapi.conf", "trusted_proxies=\"127.0.0.1 ::1, 127.0.0.2,127.0.0.5\"\n");
    EXPECT_EQ("127.0.0.1", Get("127.0.0.1", nullptr));
    EXPECT_EQ("127.0.0.1", Get("127.0.0.1", " "));
    EXPECT_EQ("203.0.113.9", Get("127.0.0.1", "10.9.9.9, 203.0.113.9"));  // left entry spoofable
    EXPECT_EQ("203.0.113.9", Get("::1", "203.0.113.9, 127.0.0.2"));
    EXPECT_EQ("203.0.113.9", Get("::ffff:127.0.0.1", "203.0.113.9,::ffff:127.0.0.1"));
    EXPECT_EQ("127.0.0.5", Get("127.0.0.1", "127.0.0.5, ::1"));  // all trusted: left-most
    EXPECT_EQ("FAIL", Get("127.0.0.1", "garbage"));
    EXPECT_EQ("FAIL", Get("127.0.0.1", "1.2.3.4, "));
    EXPECT_EQ("FAIL", Get("127.0.0.1", std::string(70000, '1').c_str()));
    EXPECT_EQ("127.0.0.3", Get("127.0.0.3", "203.0.113.9"));  // another loopback address is no proxy
}

TEST_F(RemoteIP, OnlyConfiguredAddressesAreProxies)
{
    Conf("webapi.conf", "# proxies\nother=\"x\"\ntrusted_proxies=\"192.0.2.10 2001:db8::10 bogus\"\n");
    EXPECT_EQ("203.0.113.9", Get("192.0.2.10", "203.0.113.9"));
    EXPECT_EQ("203.0.113.9", Get("2001:db8:0:0::10", "203.0.113.9, 192.0.2.10"));
    EXPECT_EQ("127.0.0.1", Get("127.0.0.1", "203.0.113.9"));
    EXPECT_EQ(1, VelaCgiIsTrustedProxy("::ffff:192.0.2.10"));
    for (const char* peer : {"192.0.2.11", "bogus", "", "192.0.2.10 ", static_cast<const char*>(nullptr)}) {
        EXPECT_EQ(0, VelaCgiIsTrustedProxy(peer)) << (peer ? peer : "null");
    }
}

TEST_F(RemoteIP, BufferSize)
{
    ScopedEnv r("REMOTE_ADDR", "203.0.113.9");
    ScopedEnv f("HTTP_X_FORWARDED_FOR", nullptr);
    char buf[12];
    EXPECT_EQ(-1, VelaCgiGetRemoteIP(buf, 11));  // 11 characters need 12 bytes
    EXPECT_EQ('\0', buf[0]);
    EXPECT_EQ(0, VelaCgiGetRemoteIP(buf, 12));
    EXPECT_STREQ("203.0.113.9", buf);
    EXPECT_EQ(-1, VelaCgiGetRemoteIP(nullptr, 12));
}

}  // namespace
