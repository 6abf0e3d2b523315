#include <gtest/gtest.h>

#include <string>

#include "support/JsonLiteral.h"
#include "webapi/APIRequest.h"

using VELA::APIRequest;

namespace {

// The ten flags in one string, so a case reads as one line:
// M=mobile D=device I=iPhone A=android E=ieMobile P=iPad B=playBook
// K=blackBerry6 W=webKit S=supportWebApp; "-" for false.
std::string Flags(const APIRequest& r)
{
    std::string s;
    s += r.IsMobile() ? 'M' : '-';
    s += r.IsMobileDevice() ? 'D' : '-';
    s += r.IsIPhone() ? 'I' : '-';
    s += r.IsAndroid() ? 'A' : '-';
    s += r.IsIEMobile() ? 'E' : '-';
    s += r.IsIPad() ? 'P' : '-';
    s += r.IsPlayBook() ? 'B' : '-';
    s += r.IsBlackBerry6() ? 'K' : '-';
    s += r.IsWebKit() ? 'W' : '-';
    s += r.IsSupportWebApp() ? 'S' : '-';
    return s;
}

std::string FlagsFor(const std::string& ua, Json::Value extraEnv = Json::Value(Json::objectValue))
{
    Json::Value request(Json::objectValue);
    request["environ"] = extraEnv;
    request["environ"]["HTTP_USER_AGENT"] = ua;
    return Flags(APIRequest(request));
}

}  // namespace

TEST(RequestClient, NoUserAgentIsADesktopWhateverTheGatewaySays)
{
    APIRequest r(J(R"({"environ": {"HTTP_X_WAP_PROFILE": "x", "HTTP_UA_OS": "y"}})"));
    EXPECT_EQ("----------", Flags(r));
}

TEST(RequestClient, DeviceFamilies)
{
    struct Case {
        const char* ua;
        const char* flags;
    } cases[] = {
        {"Mozilla/5.0 (iPad; CPU OS 17_0) AppleWebKit/605.1.15", "MDI--P--WS"},
        {"Mozilla/5.0 (iPhone; CPU iPhone OS 17_0) AppleWebKit/605.1.15", "MDI-----WS"},
        {"Mozilla/5.0 (iPod touch) AppleWebKit/605", "MDI-----WS"},
        {"Mozilla/5.0 (Linux; Android 14) AppleWebKit/537.36 Chrome/120", "MD-A----WS"},
        {"Opera/9.80 (iPad; Opera Mini/7)", "MDI--P----"},
        {"Opera/9.80 (Android; Opera Mini/7)", "MD-A------"},
        {"Mozilla/5.0 (PlayBook; U; RIM Tablet OS 2.1.0) AppleWebKit/536.2+", "MD----B-WS"},
        {"Mozilla/5.0 (PlayBook)", "MD----B---"},
        {"Mozilla/5.0 (BlackBerry; U; BlackBerry 9800) AppleWebKit/534.1+", "MD-----KWS"},
        {"BlackBerry9000/4.6.0.167", "MD--------"},
        {"Mozilla/4.0 (compatible; MSIE 6.0; Windows CE; IEMobile 7.11)", "MD--E-----"},
        {"Mozilla/5.0 (X11; Linux x86_64) AppleWebKit/537.36 Chrome/120", "--------W-"},
        {"Mozilla/4.0 (compatible; MSIE 8.0; Windows NT 6.1)", "----------"},
        {"Mozilla/5.0 (X11; Linux x86_64; rv:120.0) Gecko/20100101 Firefox/120.0", "----------"},
        {"NOKIA SYMBIANOS", "MD--------"},
        {"mIxEd iPhOnE aNdRoId", "MDI-------"},
        {"", "----------"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.ua);
        EXPECT_EQ(c.flags, FlagsFor(c.ua));
    }
}

TEST(RequestClient, GatewayHeadersMakeADesktopAgentMobile)
{
    EXPECT_EQ("MD--------", FlagsFor("Mozilla/5.0 (X11)", J(R"({"HTTP_UA_OS": "x"})")));
    EXPECT_EQ("MD--------", FlagsFor("Mozilla/5.0 (X11)", J(R"({"HTTP_X_WAP_PROFILE": "x"})")));
    EXPECT_EQ("MD--E---W-", FlagsFor("AppleWebKit MSIE", J(R"({"HTTP_UA_OS": "x"})")));
}

TEST(RequestClient, ForceDesktopCookieKeepsTheDevice)
{
    const char* iphone = "Mozilla/5.0 (iPhone) AppleWebKit/605";
    EXPECT_EQ("-DI-----WS", FlagsFor(iphone, J(R"({"HTTP_COOKIE": "forceDesktop=1"})")));
    EXPECT_EQ("-DI-----WS", FlagsFor(iphone, J(R"({"HTTP_COOKIE": "forceDesktop=-2x"})")));
    EXPECT_EQ("-DI-----WS", FlagsFor(iphone, J(R"({"HTTP_COOKIE": "forceDesktop=99999999999999999999999"})")));
    EXPECT_EQ("MDI-----WS", FlagsFor(iphone, J(R"({"HTTP_COOKIE": "forceDesktop=0"})")));
    EXPECT_EQ("MDI-----WS", FlagsFor(iphone, J(R"({"HTTP_COOKIE": "forceDesktop=yes"})")));
}

TEST(RequestClient, ClassifiedOnceAndFrozen)
{
    APIRequest r(J(R"j({"environ": {"HTTP_USER_AGENT": "Mozilla/5.0 (X11)"}})j"));
    EXPECT_FALSE(r.IsMobile());
    r.InitEnv(J(R"j({"HTTP_USER_AGENT": "Mozilla/5.0 (iPhone) AppleWebKit"})j"));
    EXPECT_FALSE(r.IsMobile());
    EXPECT_FALSE(r.IsIPhone());
    APIRequest copy(r);
    EXPECT_FALSE(copy.IsIPhone());
}

TEST(RequestClient, HostileUserAgentsAreClassifiedWithoutHarm)
{
    std::string binary;
    for (int i = 0; i < 256; ++i) {
        binary += static_cast<char>(i);
    }
    EXPECT_EQ(10u, FlagsFor(binary + "iphone").size());
    EXPECT_EQ("MDI-------", FlagsFor(std::string(1 << 20, 'x') + "iPhone"));
}
