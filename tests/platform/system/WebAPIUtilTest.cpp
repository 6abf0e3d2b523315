// JSON text and files, query strings, URL coding.

#include "platform/PlatformTest.h"
#include "support/JsonLiteral.h"
#include "support/LinearTime.h"
#include "vela/webapiutil.h"

#include <thread>
#include <vector>

namespace {

using namespace VELA::WebAPIUtil;
using VELA::Test::DirEntries;
using VELA::Test::WriteFile;

std::string Nested(int depth, const std::string& inner)
{
    return std::string(depth, '[') + inner + std::string(depth, ']');
}

TEST(WebAPIUtil, ParseJsonStrictnessAndDepthLimit)
{
    Json::Value out("keep");
    for (const char* bad : {"", " ", "{} x", "{\"a\":1,}", "[1,]", "// c\n{}", "{'a':1}", "NaN", "{\"a\":1,\"a\":2}",
                            "\xEF\xBB\xBF{}", "[1", "{\"a\"}", "\"\\u12\""}) {
        EXPECT_FALSE(ParseJson(bad, out)) << bad;
        EXPECT_EQ("keep", out.asString()) << bad;
    }
    ASSERT_TRUE(ParseJson(" {\"a\":[1,\"x\"]}\n", out));
    EXPECT_EQ("x", out["a"][1].asString());
    ASSERT_TRUE(ParseJson("42", out));  // any value may be the root
    EXPECT_EQ(42, out.asInt());
    ASSERT_TRUE(ParseJson(std::string("\"a\\u0000b\""), out));
    EXPECT_EQ(3u, out.asString().size());

    // The nesting is limited, without an exception.
    const std::pair<std::string, bool> cases[] = {
        {Nested(256, "1"), true}, {Nested(255, "{}"), true}, {Nested(256, ""), true}, {Nested(257, "1"), false},
        {Nested(257, ""), false}, {std::string(100000, '['), false},
        {"[\"" + std::string(1000, '[') + "\\\"\"]", true},  // brackets inside strings do not nest
    };
    for (const auto& [text, ok] : cases) {
        EXPECT_EQ(ok, ParseJson(text, out)) << text.substr(0, 40);
    }
}

// Each thread keeps one reader for all its parses: an answer must not depend
// on what the thread parsed before (failures half-way through included).
TEST(WebAPIUtil, ParseJsonAnswerDoesNotDependOnEarlierParses)
{
    const std::vector<std::string> texts = {
        "{\"a\":[1,2,{\"b\":", "{\"a\":1}", "{\"a\":1,\"a\":2}", "[true,null]", "[1,]", "\"s\"", Nested(257, "1"),
        Nested(256, "1"), "{\"k\":\"v\"} x", "{}", "\"\\u12\"", "-0.5e3",
    };
    // The answer of each text in a thread that parsed nothing before.
    std::vector<std::pair<bool, Json::Value>> fresh(texts.size());
    for (size_t i = 0; i < texts.size(); ++i) {
        std::thread([&, i] { fresh[i].first = ParseJson(texts[i], fresh[i].second); }).join();
    }
    for (int round = 0; round < 2; ++round) {
        for (size_t i = 0; i < texts.size(); ++i) {
            Json::Value out;
            EXPECT_EQ(fresh[i].first, ParseJson(texts[i], out)) << texts[i].substr(0, 40);
            EXPECT_EQ(fresh[i].second, out) << texts[i].substr(0, 40);
        }
    }
    EXPECT_TRUE(fresh[1].first);
    EXPECT_FALSE(fresh[0].first);
}

TEST(WebAPIUtil, ReadJsonFileLimits)
{
    VELA::Test::TempDir dir;
    const std::string path = dir.Path() + "/doc.json";
    Json::Value out("keep");
    EXPECT_FALSE(ReadJsonFile(path, out));  // missing
    EXPECT_FALSE(ReadJsonFile(dir.Path(), out));  // a directory
    WriteFile(path, "{\"a\":1} trailing");
    EXPECT_FALSE(ReadJsonFile(path, out));
    EXPECT_EQ("keep", out.asString());

    // Exactly 16 MiB of valid JSON is read; one byte more is refused.
    std::string big = "\"" + std::string(16 * 1024 * 1024 - 2, 'x') + "\"";
    WriteFile(path, big);
    ASSERT_TRUE(ReadJsonFile(path, out));
    EXPECT_EQ(big.size() - 2, out.asString().size());
    WriteFile(path, big + " ");
    VELA::Test::LogCapture log;
    EXPECT_FALSE(ReadJsonFile(path, out));
    EXPECT_TRUE(log.Contains("larger than"));

    const std::string fifo = dir.Path() + "/fifo";
    ASSERT_EQ(0, mkfifo(fifo.c_str(), 0600));
    EXPECT_FALSE(ReadJsonFile(fifo, out));  // refused, not blocked on
}

// The file is replaced whole with its mode, or left as it was with no
// temporary file beside it.
TEST(WebAPIUtil, WriteJsonFileAtomic)
{
    VELA::Test::TempDir dir;
    const std::string path = dir.Path() + "/conf.json";
    WriteFile(path, "old");
    Json::Value value;
    value["k"] = "v\xC3\xA9";
    ASSERT_TRUE(WriteJsonFileAtomic(path, value, 0640));
    EXPECT_EQ("{\"k\":\"v\xC3\xA9\"}\n", VELA::Test::ReadText(path));
    EXPECT_EQ(0640u, VELA::Test::Mode(path));
    EXPECT_EQ(std::vector<std::string>{"conf.json"}, DirEntries(dir.Path()));

    // The temporary name must stay within NAME_MAX for a 255-byte name.
    const std::string longName(255, 'n');
    EXPECT_TRUE(WriteJsonFileAtomic(dir.Path() + "/" + longName, value, 0600));
    EXPECT_EQ(2u, DirEntries(dir.Path()).size());

    // The rename fails: the target is a non-empty directory.
    VELA::Test::TempDir other;
    const std::string target = other.Path() + "/busy";
    ASSERT_EQ(0, mkdir(target.c_str(), 0700));
    WriteFile(target + "/inside", "x");
    VELA::Test::LogCapture log;
    EXPECT_FALSE(WriteJsonFileAtomic(target, Json::Value(1), 0600));
    EXPECT_TRUE(log.Contains("rename"));
    EXPECT_EQ(std::vector<std::string>{"busy"}, DirEntries(other.Path()));
    EXPECT_EQ(std::vector<std::string>{"inside"}, DirEntries(target));
    for (const std::string& bad : {other.Path() + "/missing/x.json", std::string(), other.Path() + "/"}) {
        EXPECT_FALSE(WriteJsonFileAtomic(bad, Json::Value(1), 0600)) << bad;
    }
    if (geteuid() != 0) {  // root writes into a read-only directory
        const std::string sub = other.Path() + "/ro";
        ASSERT_EQ(0, mkdir(sub.c_str(), 0500));
        EXPECT_FALSE(WriteJsonFileAtomic(sub + "/x.json", Json::Value(1), 0600));
        EXPECT_TRUE(DirEntries(sub).empty());
        chmod(sub.c_str(), 0700);
    }
}

TEST(WebAPIUtil, QueryStringPairsAndCookiePieces)
{
    Json::Value out;
    ASSERT_TRUE(strPairToJsonObj("a=1&b=x%20y+z&flag&=skip&&c=%zz&d=k=v", out, true, true));
    EXPECT_EQ(J(R"({"a": "1", "b": "x y z", "flag": "", "c": "%zz", "d": "k=v"})"), out);
    // Without decoding and without replacing: "a" keeps its value.
    ASSERT_TRUE(strPairToJsonObj("a=2&e=%41&a=3", out, false, false));
    EXPECT_EQ(J(R"({"a": "1", "b": "x y z", "flag": "", "c": "%zz", "d": "k=v", "e": "%41"})"), out);
    ASSERT_TRUE(strPairToJsonObj("a=2&a=3", out, false, true));
    EXPECT_EQ("3", out["a"].asString());

    Json::Value array(Json::arrayValue);
    EXPECT_FALSE(strPairToJsonObj("a=1", array, true, true));
    Json::Value empty;
    ASSERT_TRUE(strPairToJsonObj("", empty, true, true));
    EXPECT_TRUE(empty.isObject());

    // Cookie headers split into their pieces.
    EXPECT_EQ(J(R"(["id=abc", "lang=en%20US", "broken", "", "k=a=b", ""])"),
              ParseToArray("id=abc; lang=en%20US;broken;\t;k=a=b;", ";"));
    EXPECT_EQ(J(R"([" a", "b"])"), ParseToArray(" a, b", ", "));  // multi-byte separator; leading blank kept
    EXPECT_EQ(0u, ParseToArray(nullptr, ";").size());
    EXPECT_EQ(J(R"(["x;y"])"), ParseToArray("x;y", ""));
    EXPECT_EQ(1u, ParseToArray("x;y", nullptr).size());
}

TEST(WebAPIUtil, URLDecodeMalformedSequencesAndEncodeRoundTrip)
{
    const std::pair<const char*, std::string> plain[] = {
        {"%", "%"}, {"%4", "%4"}, {"a%", "a%"}, {"%zz", "%zz"}, {"%4g", "%4g"}, {"%00", std::string("\0", 1)},
        {"%25A", "%A"},  // decoded once only
        {"%fF", "\xff"}, {"a+b", "a+b"},
    };
    for (const auto& c : plain) {
        EXPECT_EQ(c.second, URLDecode(c.first, false)) << c.first;
    }
    EXPECT_EQ("a b+", URLDecode("a+b%2B", true));

    EXPECT_EQ("aZ09-._~", URLEncode("aZ09-._~"));
    EXPECT_EQ("a%20b%2B%2F%3F%25%C3%A9%00", URLEncode(std::string("a b+/?%\xC3\xA9\0", 10)));
    std::string all;
    for (int c = 0; c < 256; ++c) {
        all.push_back(static_cast<char>(c));
    }
    EXPECT_EQ(all, URLDecode(URLEncode(all), true));
}

// Every parser here takes client text: its time is linear in the input
// (support/LinearTime.h).
TEST(WebAPIUtil, ParsersTakeLinearTime)
{
    using VELA::Test::ExpectLinear;
    using VELA::Test::LinearParser;
    const LinearParser form = [](const std::string& text) {
        Json::Value out;
        strPairToJsonObj(text, out, true, true);
    };
    const LinearParser decode = [](const std::string& text) { URLDecode(text, true); };
    // "&" alone was the quadratic case: each piece looked for "=" to the
    // end of the body.
    for (const char* piece : {"&", "&&=", "=", "a=b&", "%4"}) {
        ExpectLinear("strPairToJsonObj", form, piece);
        ExpectLinear("URLDecode", decode, piece);
    }
    const LinearParser list = [](const std::string& text) { ParseToArray(text.c_str(), ", "); };
    const LinearParser json = [](const std::string& text) {
        Json::Value out;
        ParseJson(text, out);
    };
    for (const char* piece : {", ", ",,  "}) {
        ExpectLinear("ParseToArray", list, piece, 4u << 20);
    }
    for (const char* piece : {"[1,", "\"\\\\", "{\"a\":"}) {
        ExpectLinear("ParseJson", json, piece);
    }
}

}  // namespace
