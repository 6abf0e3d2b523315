// JsonFlag: how description and request settings read as yes or no.
// JsonToString: the text every answer is written as. Parsing, files and
// the search in arrays.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "webapi/JsonUtil.h"

namespace {

TEST(JsonFlag, BooleansNumbersAndEverythingElse)
{
    const Json::Value values = J(R"([true, 1, -1, 0.5, 18446744073709551615,
                                     false, 0, 0.0, "true", "1", [true], {"a": true}])");
    for (Json::ArrayIndex i = 0; i < values.size(); ++i) {
        const bool expected = i < 5;
        EXPECT_EQ(expected, VELA::JsonFlag(values[i])) << values[i].toStyledString();
        EXPECT_EQ(expected, VELA::JsonFlag(values[i], true)) << values[i].toStyledString();
    }
    EXPECT_FALSE(VELA::JsonFlag(Json::Value()));
    EXPECT_TRUE(VELA::JsonFlag(Json::Value(), true));
}

// Bytes that are not UTF-8 (a file name can hold any) reach the text as one
// U+FFFD each; well-formed text, however long its sequences, is untouched.
TEST(JsonToString, EveryByteOutsideUTF8BecomesOneReplacementCharacter)
{
    const std::string R = "\xef\xbf\xbd";
    const struct {
        std::string in, out;
    } cases[] = {
        // U+00E9, U+20AC, U+1F600, U+FFFD itself, U+D7FF, U+E000, U+10FFFF, DEL.
        {"\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80\xef\xbf\xbd\xed\x9f\xbf\xee\x80\x80\xf4\x8f\xbf\xbf\x7f",
         "\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80\xef\xbf\xbd\xed\x9f\xbf\xee\x80\x80\xf4\x8f\xbf\xbf\x7f"},
        // Overlong forms of "/" and of U+07FF.
        {"\xc0\xaf", R + R},
        {"\xc1\xbf", R + R},
        {"\xe0\x80\xaf", R + R + R},
        {"\xe0\x9f\xbf", R + R + R},
        {"\xf0\x80\x80\xaf", R + R + R + R},
        // Surrogates, high and low.
        {"\xed\xa0\x80", R + R + R},
        {"\xed\xbf\xbf", R + R + R},
        // Above U+10FFFF, and bytes that never start a sequence.
        {"\xf4\x90\x80\x80", R + R + R + R},
        {"\xf5\x80\x80\x80", R + R + R + R},
        {"a\xf8\xfe\xff" "b", "a" + R + R + R + "b"},
        // Stray continuation bytes; a sequence cut short, inside and at the end.
        {"\x80\xbf", R + R},
        {"\xe2\x82" "a", R + R + "a"},
        {"\xff\xc3\xa9", R + "\xc3\xa9"},
        {"a\xc3", "a" + R},
        {"a\xe2\x82", "a" + R + R},
        {"a\xf0\x9f\x98", "a" + R + R + R},
    };
    for (const auto& c : cases) {
        EXPECT_EQ("\"" + c.out + "\"", VELA::JsonToString(Json::Value(c.in))) << c.in;
    }
    // Member names are text of the answer as well; escapes stay escapes.
    Json::Value object(Json::objectValue);
    object["k\xff"] = std::string("\x01\"\xed\xa0\x80", 5);
    EXPECT_EQ("{\"k" + R + "\":\"\\u0001\\\"" + R + R + R + "\"}", VELA::JsonToString(object));
}

// Thin over the platform's parser and files (platform/system/WebAPIUtilTest):
// the mode reaches the file, and a failure leaves the value alone.
TEST(JsonUtil, ParseAndFilesKeepThePlatformsContract)
{
    VELA::Test::TempDir dir;
    const std::string path = dir.Path() + "/doc.json";
    ASSERT_TRUE(VELA::JsonWriteFile(path, J(R"({"a": [1, "x"]})"), 0600));
    Json::Value back;
    ASSERT_TRUE(VELA::JsonReadFile(path, back));
    struct stat st;
    ASSERT_EQ(0, stat(path.c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777);
    EXPECT_FALSE(VELA::JsonReadFile(dir.Path() + "/missing.json", back));
    EXPECT_FALSE(VELA::JsonParse("{\"a\": 1} trailing", back));
    EXPECT_EQ(J(R"({"a": [1, "x"]})"), back);
}

TEST(JsonUtil, SearchArrayIndexByJsonEquality)
{
    const Json::Value arr = J(R"([1, "1", {"a": [2]}, null])");
    EXPECT_EQ(0, VELA::JsonSearchArrayIndex(arr, 1));
    EXPECT_EQ(1, VELA::JsonSearchArrayIndex(arr, "1"));
    EXPECT_EQ(2, VELA::JsonSearchArrayIndex(arr, J(R"({"a": [2]})")));
    EXPECT_EQ(3, VELA::JsonSearchArrayIndex(arr, Json::Value()));
    EXPECT_EQ(-1, VELA::JsonSearchArrayIndex(arr, 2));
    EXPECT_EQ(-1, VELA::JsonSearchArrayIndex(J(R"({"a": 1})"), 1));
}

}  // namespace
