// The CGI handle: cookies, the client address and the fail-closed session
// calls.

#include <tuple>

#include "platform/PlatformTest.h"

namespace {

using VELA::Test::ScopedEnv;
using Handle = VELA::Test::CgiHandle;

TEST(Cgi, CookiesWithOddPiecesAndTheirBounds)
{
    ScopedEnv cookie("HTTP_COOKIE", "id=abc; lang=en%20US;broken; ;k=a=b;  sp = v ;q=\"quoted\";id=second;bad\x01=x");
    Handle h;
    ASSERT_EQ(0, VelaCgiLoadInCookies(h.ctx));
    const std::pair<const char*, const char*> cookies[] = {
        {"id", "abc"},  // the first wins
        {"lang", "en%20US"}, {"k", "a=b"}, {"sp", "v"}, {"q", "quoted"}, {"broken", nullptr}, {"", nullptr},
        {"bad\x01", nullptr}, {nullptr, nullptr}};
    for (const auto& [name, value] : cookies) {
        EXPECT_STREQ(value, VelaCgiGetCookie(h.ctx, name)) << (name ? name : "null");
    }
    EXPECT_EQ(nullptr, VelaCgiGetCookie(nullptr, "id"));

    // No header, one too large, more cookies than are kept.
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
    // Each row: REMOTE_ADDR, X-Forwarded-For (null: unset) and the client
    // address expected, "FAIL" when the call fails.
    void Expect(std::initializer_list<std::tuple<const char*, const char*, const char*>> rows, const char* what = "")
    {
        for (const auto& [remote, forwarded, want] : rows) {
            ScopedEnv r("REMOTE_ADDR", remote);
            ScopedEnv f("HTTP_X_FORWARDED_FOR", forwarded);
            char buf[64];
            EXPECT_EQ(want, std::string(VelaCgiGetRemoteIP(buf, sizeof(buf)) == 0 ? buf : "FAIL"))
                << what << (remote ? remote : "null") << " / " << (forwarded ? forwarded : "null");
        }
    }
};

// Without trusted_proxies no peer is a proxy, loopback included: a local
// client's X-Forwarded-For would otherwise name any address it likes.
TEST_F(RemoteIP, DirectClientIgnoresForwardedFor)
{
    Expect({{"198.51.100.7", "127.0.0.1, 1.2.3.4", "198.51.100.7"},
            {"2001:DB8:0::1", nullptr, "2001:db8::1"},  // canonical text
            {nullptr, nullptr, "FAIL"}, {"not-an-ip", nullptr, "FAIL"}, {"1.2.3.4:5678", nullptr, "FAIL"}});
    for (const char* conf : {static_cast<const char*>(nullptr), "admin_group=\"x\"\n", "trusted_proxies=\"\"\n"}) {
        if (conf != nullptr) {
            Conf("webapi.conf", conf);
        }
        Expect({{"127.0.0.1", "203.0.113.9", "127.0.0.1"}, {"::1", "203.0.113.9, 127.0.0.1", "::1"}},
               conf ? conf : "no file: ");
        EXPECT_EQ(0, VelaCgiIsTrustedProxy("127.0.0.1")) << (conf ? conf : "no file");
    }
}

TEST_F(RemoteIP, ConfiguredProxyTakesRightmostUntrusted)
{
    Conf("webapi.conf", "trusted_proxies=\"127.0.0.1 ::1, 127.0.0.2,127.0.0.5\"\n");
    Expect({{"127.0.0.1", nullptr, "127.0.0.1"}, {"127.0.0.1", " ", "127.0.0.1"},
            {"127.0.0.1", "10.9.9.9, 203.0.113.9", "203.0.113.9"},  // left entry spoofable
            {"::1", "203.0.113.9, 127.0.0.2", "203.0.113.9"},
            {"::ffff:127.0.0.1", "203.0.113.9,::ffff:127.0.0.1", "203.0.113.9"},
            {"127.0.0.1", "127.0.0.5, ::1", "127.0.0.5"},  // all trusted: left-most
            {"127.0.0.1", "garbage", "FAIL"}, {"127.0.0.1", "1.2.3.4, ", "FAIL"},
            {"127.0.0.1", std::string(70000, '1').c_str(), "FAIL"},
            {"127.0.0.3", "203.0.113.9", "127.0.0.3"}});  // another loopback address is no proxy
}

TEST_F(RemoteIP, OnlyConfiguredAddressesAreProxies)
{
    Conf("webapi.conf", "# proxies\nother=\"x\"\ntrusted_proxies=\"192.0.2.10 2001:db8::10 bogus\"\n");
    Expect({{"192.0.2.10", "203.0.113.9", "203.0.113.9"},
            {"2001:db8:0:0::10", "203.0.113.9, 192.0.2.10", "203.0.113.9"},
            {"127.0.0.1", "203.0.113.9", "127.0.0.1"}});
    EXPECT_EQ(1, VelaCgiIsTrustedProxy("::ffff:192.0.2.10"));
    for (const char* peer : {"192.0.2.11", "bogus", "", "192.0.2.10 ", static_cast<const char*>(nullptr)}) {
        EXPECT_EQ(0, VelaCgiIsTrustedProxy(peer)) << (peer ? peer : "null");
    }

    // The address must fit the caller's buffer.
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
