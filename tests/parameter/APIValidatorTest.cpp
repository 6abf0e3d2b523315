#include <cfloat>
#include <thread>
#include <vector>

#include "support/ParamTestUtil.h"
#include "support/TestSupport.h"
#include "webapi/APIValidator.h"

namespace VELA {
namespace {

typedef APIValidator V;

// A valid parameter holding `v`, or an invalid one.
template <typename T> APIParameter<T> Param(T const& v, bool invalid = false)
{
    APIParameter<T> p;
    EXPECT_TRUE(p.SetDefault(v));
    if (invalid) {
        p.MarkInvalid();
    }
    return p;
}

TEST(TextFormat, PatternsHostAndAddress)
{
    const struct {
        bool (*check)(std::string const&);
        std::vector<std::string> valid, invalid;
    } cases[] = {
        // In the e-mail pattern "+-\" is a range: ":" and "[" lie inside it.
        {V::IsEMail, {"john.doe@example.com", "a\"b,(c)<d>@host", "a:b[@host"},
         {"a b@host", "@host", "user@", "user@ho st", ""}},
        {V::IsNetbios, {"a_b-C9", std::string(255, 'a')}, {std::string(256, 'a'), "9abc", "ab.c", ""}},
        // Unanchored: one character outside the forbidden set is enough.
        {V::IsWorkGroup, {"WORKGROUP", "a;"}, {";", "]", "[", "\\", "/", "|?,*+<>:\"", ""}},
        {V::IsDigit, {"007"}, {"", "12a", "-1", std::string("12\0x", 4)}},
        {V::IsFarlinkId, {"Ab-12"}, {"a_b", ""}},
        {V::IsHostname, {"nas-01"}, {"-nas", std::string("nas\0-", 5), ""}},
        {V::IsDomain, {"corp.example.com"}, {"corp..com", ""}},
        {V::IsIP, {"192.168.0.1", "fe80::1"}, {"192.168.0.256", std::string("10.0.0.1\0junk", 13), ""}},
        {V::IsIPv4, {"192.168.0.1"}, {"fe80::1", ""}},
        {V::IsIPv6, {"fe80::1"}, {"192.168.0.1", ""}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(&c - cases);
        for (const std::string& text : c.valid) {
            EXPECT_TRUE(c.check(text)) << '"' << text << '"';
        }
        for (const std::string& text : c.invalid) {
            EXPECT_FALSE(c.check(text)) << '"' << text << '"';
        }
    }
}

TEST(CheckRegex, BadPatternLogsSharedAcrossThreads)
{
    static const char bad[] = "a(b";
    VELA::Test::LogCapture capture;
    EXPECT_FALSE(V::CheckRegex("a(b", bad));
    EXPECT_TRUE(capture.Contains("APIValidator:57 Invalid pattern"));
    EXPECT_FALSE(V::CheckRegex("x", nullptr));

    // One validator, shared across threads.
    static const char pattern[] = "^x+$";
    std::vector<APIValidator*> seen(8, nullptr);
    std::vector<int> matched(8, 0);
    std::vector<std::thread> threads;
    for (size_t i = 0; i < seen.size(); ++i) {
        threads.emplace_back([&, i] {
            seen[i] = V::GetInstance();
            matched[i] = V::CheckRegex(std::string(i + 1, 'x'), pattern) && !V::CheckRegex("xy", pattern);
        });
    }
    for (auto& t : threads) {
        t.join();
    }
    for (size_t i = 0; i < seen.size(); ++i) {
        EXPECT_NE(seen[i], nullptr);
        EXPECT_EQ(seen[i], V::GetInstance());
        EXPECT_TRUE(matched[i]) << i;
    }
}

TEST(Numeric, PortEqualAndRanges)
{
    EXPECT_FALSE(V::IsPort(-1));
    EXPECT_TRUE(V::IsPort(0));
    EXPECT_TRUE(V::IsPort(65535));
    EXPECT_FALSE(V::IsPort(65536));

    EXPECT_TRUE(V::IsEqual(Param(3), 3));
    EXPECT_FALSE(V::IsEqual(Param(3, true), 3));
    EXPECT_TRUE(V::IsEqual(Param(true), true));
    EXPECT_FALSE(V::IsEqual(Param(std::string("a")), std::string("b")));
    EXPECT_TRUE(V::IsEqual(Param(std::string("a")), "a"));
    EXPECT_FALSE(V::IsEqual(Param(std::string("a")), static_cast<const char*>(nullptr)));
    EXPECT_TRUE(V::IsEqual(Param(J("[1,{\"k\":2}]")), J("[1,{\"k\":2}]")));
    EXPECT_TRUE(V::IsEqual(Param(0.3), 0.1 + 0.2));
    EXPECT_FALSE(V::IsEqual(Param(0.3), 0.3001));
    EXPECT_FALSE(V::IsEqual(Param(0.3, true), 0.3));

    EXPECT_TRUE(V::IsBetween(Param(5), 5, 10));
    EXPECT_TRUE(V::IsBetween(Param(10), 5, 10));
    EXPECT_FALSE(V::IsBetween(Param(11), 5, 10));
    EXPECT_FALSE(V::IsBetween(Param(7, true), 5, 10));
    EXPECT_TRUE(V::IsBetween(Param(4000000000u), 1u, 4000000000u));
    EXPECT_FALSE(V::IsBetween(Param(0ULL), 1ULL, 2ULL));
    // Doubles: both ends excluded.
    EXPECT_FALSE(V::IsBetween(Param(5.0), 5.0, 10.0));
    EXPECT_TRUE(V::IsBetween(Param(5.0000001), 5.0, 10.0));
    EXPECT_FALSE(V::IsBetween(Param(10.0), 5.0, 10.0));
    EXPECT_FALSE(V::IsBetween(Param(7.0, true), 5.0, 10.0));

    EXPECT_TRUE(V::IsGreater(Param(2), 1));
    EXPECT_FALSE(V::IsGreater(Param(1), 1));
    EXPECT_FALSE(V::IsGreater(Param(2, true), 1));
    EXPECT_TRUE(V::IsGreater(Param(5000000000ULL), 4999999999ULL));
    EXPECT_TRUE(V::IsLess(Param(0u), 1u));
    EXPECT_FALSE(V::IsLess(Param(0, true), 1));
    EXPECT_FALSE(V::IsGreater(Param(DBL_EPSILON / 2), 0.0));
    EXPECT_TRUE(V::IsGreater(Param(1.5), 1.0));
    EXPECT_FALSE(V::IsLess(Param(1.0), 1.0));
    EXPECT_TRUE(V::IsLess(Param(0.5), 1.0));
    EXPECT_FALSE(V::IsLess(Param(0.5, true), 1.0));
}

TEST(Membership, StringAndJson)
{
    Json::Value strings = J("[\"a\",\"b\",1]");
    EXPECT_TRUE(V::IsBelong(Param(std::string("b")), strings));
    EXPECT_FALSE(V::IsBelong(Param(std::string("1")), strings));
    EXPECT_FALSE(V::IsBelong(Param(std::string("a"), true), strings));
    EXPECT_FALSE(V::IsBelong(Param(std::string("a")), J("{\"a\":\"a\"}")));

    // Every element of the value must be in the list: a scalar has none, so
    // any scalar passes, in the list or not.
    Json::Value list = J("[1,2,3,\"x\"]");
    for (const char* in : {"[1,2]", "{\"p\":3,\"q\":\"x\"}", "[]", "null", "2", "4", "\"y\"", "true", "0.5"}) {
        EXPECT_TRUE(V::IsBelong(Param(J(in)), list)) << in;
    }
    for (const char* out : {"[1,4]", "{\"p\":4}", "[[1]]"}) {
        EXPECT_FALSE(V::IsBelong(Param(J(out)), list)) << out;
    }
    EXPECT_FALSE(V::IsBelong(Param(J("[1]")), J("{\"a\":1}")));
    EXPECT_FALSE(V::IsBelong(Param(J("[]")), Json::Value(1)));
    EXPECT_FALSE(V::IsBelong(Param(J("[1]"), true), list));
}

}  // namespace
}  // namespace VELA
