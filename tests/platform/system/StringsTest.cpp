// ASCII case, the checked decimal parser every number from outside goes
// through, CONTENT_LENGTH and the checked names.
#include <climits>

#include "platform/PlatformTest.h"

namespace {

TEST(Strings, CaseLowerTouchesOnlyAsciiLetters)
{
    char text[] = "AbC-Z@[\xC3\x89]09";
    EXPECT_EQ(text, VLIBCStrCaseLower(text));
    EXPECT_STREQ("abc-z@[\xC3\x89]09", text);
    EXPECT_EQ(nullptr, VLIBCStrCaseLower(nullptr));
}

TEST(Strings, ParseDecimal)
{
    long long out = 42;
    for (const std::string& bad : std::initializer_list<std::string>{"", "-", "+1", " 1", "1 ", "1e0", "1.0", "0x1", std::string("1\0", 2), "1a", "--1",
                                  "9223372036854775808", "99999999999999999999999"}) {
        EXPECT_FALSE(VELA::System::ParseDecimal(bad, LLONG_MIN, LLONG_MAX, out)) << bad;
        EXPECT_EQ(42, out);
    }
    EXPECT_TRUE(VELA::System::ParseDecimal("007", 0, 10, out));
    EXPECT_EQ(7, out);
    EXPECT_TRUE(VELA::System::ParseDecimal("9223372036854775807", 0, LLONG_MAX, out));
    EXPECT_EQ(LLONG_MAX, out);
    EXPECT_TRUE(VELA::System::ParseDecimal("-9223372036854775808", LLONG_MIN, 0, out));
    EXPECT_EQ(LLONG_MIN, out);
    // The range is part of the check; a sign only where negatives may be.
    EXPECT_FALSE(VELA::System::ParseDecimal("11", 0, 10, out));
    EXPECT_FALSE(VELA::System::ParseDecimal("-1", 0, 10, out));
    EXPECT_FALSE(VELA::System::ParseDecimal("-0", 0, 10, out));
    EXPECT_TRUE(VELA::System::ParseDecimal("-3", -5, 10, out));
    EXPECT_EQ(-3, out);
}

TEST(Strings, ContentLength)
{
    EXPECT_EQ(0, VELA::System::ContentLength(nullptr, 0, 100));
    EXPECT_EQ(0, VELA::System::ContentLength("", 0, 100));
    EXPECT_EQ(100, VELA::System::ContentLength("100", 3, 100));
    EXPECT_EQ(-1, VELA::System::ContentLength("101", 3, 100));
    EXPECT_EQ(-1, VELA::System::ContentLength(" 1", 2, 100));
    EXPECT_EQ(-1, VELA::System::ContentLength("-1", 2, 100));
}

TEST(Strings, CheckedName)
{
    EXPECT_TRUE(VELA::System::IsCheckedName("a-Z_9", VELA::System::kNameId, 5));
    EXPECT_FALSE(VELA::System::IsCheckedName("a-Z_9", VELA::System::kNameId, 4));
    EXPECT_FALSE(VELA::System::IsCheckedName("", VELA::System::kNameId, 5));
    EXPECT_FALSE(VELA::System::IsCheckedName("a.b", VELA::System::kNameId, 5));
    EXPECT_FALSE(VELA::System::IsCheckedName(std::string("a\0b", 3), VELA::System::kNameId, 5));
    EXPECT_FALSE(VELA::System::IsCheckedName("\xc3\xa9", VELA::System::kNameId, 5));
    EXPECT_TRUE(VELA::System::IsAPIName("VELA.Sample-1_x"));
    EXPECT_FALSE(VELA::System::IsAPIName(".VELA"));
    EXPECT_FALSE(VELA::System::IsAPIName("VELA..x"));
    EXPECT_FALSE(VELA::System::IsAPIName(std::string(129, 'a')));
}

}  // namespace
