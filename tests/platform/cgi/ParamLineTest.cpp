// VelaCgiDetectAndDecryptParamLine: plain lines pass unchanged, malformed
// ones are refused (a line encrypted as a whole: CryptoTest.cpp).
#include "platform/PlatformTest.h"
#include "support/LinearTime.h"

using VELA::Test::LogCapture;

TEST(ParamLine, PlainLinesUnchangedMalformedOnesRefused)
{
    for (std::string line : {"", "a=1&b=%41%4a+c", "&&==&x", "n=\xc3\xa9t\xc3\xa9", "k=%00",
                             "__cIpHeRtExT", "x=1&__cIpHeRtExT=QUJD"}) {
        const std::string before = line;
        EXPECT_TRUE(VelaCgiDetectAndDecryptParamLine(line)) << before;
        EXPECT_EQ(before, line);
    }
    std::string longest(VELACGI_MAX_PARAM_LINE, 'a');
    EXPECT_TRUE(VelaCgiDetectAndDecryptParamLine(longest));

    // Malformed lines are refused as they are, with the reason logged.
    const struct { std::string line; const char* logged; } cases[] = {
        {"a=%", "percent-encoding at offset 2"}, {"a=%4", "percent-encoding"}, {"a=%4g&b=1", "percent-encoding"},
        {"a=%g4", "percent-encoding"}, {"a=1\n", "control byte 0x0a at offset 3"},
        {std::string("a\0b", 3), "control byte 0x00"}, {"a=\x7f", "control byte 0x7f"},
        {std::string(VELACGI_MAX_PARAM_LINE + 1, 'a'), "more than"}, {"__cIpHeRtExT=not-base64", "does not decrypt"},
    };
    for (const auto& c : cases) {
        LogCapture log;
        std::string line = c.line;
        EXPECT_FALSE(VelaCgiDetectAndDecryptParamLine(line)) << c.logged;
        EXPECT_EQ(c.line, line);
        EXPECT_TRUE(log.Contains(c.logged)) << c.logged;
    }
}

// The line is checked before anything splits it, in time linear in its
// length (support/LinearTime.h).
TEST(ParamLine, CheckTakesLinearTime)
{
    const VELA::Test::LinearParser line = [](const std::string& text) {
        std::string copy = text;
        VelaCgiDetectAndDecryptParamLine(copy);
    };
    for (const char* piece : {"&", "%41&", "__cIpHeRtExT=&"}) {
        VELA::Test::ExpectLinear("VelaCgiDetectAndDecryptParamLine", line, piece);
    }
}
