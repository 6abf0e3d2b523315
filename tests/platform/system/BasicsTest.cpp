// The small pieces of the platform: ASCII case, the checked decimal parser
// every number from outside goes through, CONTENT_LENGTH, the checked names,
// RFC 1123 host and domain names, address types, the string table, the
// last-error record and the system root.
#include <cerrno>
#include <climits>
#include <cstring>
#include <tuple>

#include "platform/PlatformTest.h"
#include "vela/sysfile.h"
#include "vela/webapiutil.h"

namespace {

using VELA::System::ParseDecimal;

TEST(Strings, ParseDecimal)
{
    long long out = 42;
    const std::string bads[] = {"",   "-",  "+1",  "0x1", " 1", "1 ", "1e0", "1.0", std::string("1\0", 2),
                                "1a", "--1", "9223372036854775808", "99999999999999999999999"};
    for (const std::string& bad : bads) {
        EXPECT_FALSE(ParseDecimal(bad, LLONG_MIN, LLONG_MAX, out)) << bad;
        EXPECT_EQ(42, out);
    }
    // The range is part of the check; a sign only where negatives may be.
    const struct { const char* text; long long min, max; bool ok; long long value; } cases[] = {
        {"007", 0, 10, true, 7}, {"9223372036854775807", 0, LLONG_MAX, true, LLONG_MAX},
        {"-9223372036854775808", LLONG_MIN, 0, true, LLONG_MIN}, {"-3", -5, 10, true, -3},
        {"11", 0, 10, false, 0}, {"-1", 0, 10, false, 0}, {"-0", 0, 10, false, 0},
    };
    for (const auto& c : cases) {
        out = 42;
        EXPECT_EQ(c.ok, ParseDecimal(c.text, c.min, c.max, out)) << c.text;
        EXPECT_EQ(c.ok ? c.value : 42, out) << c.text;
    }
}

TEST(Strings, CaseContentLengthAndCheckedNames)
{
    char text[] = "AbC-Z@[\xC3\x89]09";  // only ASCII letters change case
    EXPECT_EQ(text, VLIBCStrCaseLower(text));
    EXPECT_STREQ("abc-z@[\xC3\x89]09", text);
    EXPECT_EQ(nullptr, VLIBCStrCaseLower(nullptr));

    const std::pair<const char*, long long> lengths[] = {{nullptr, 0}, {"", 0},     {"100", 100},
                                                         {"101", -1},  {" 1", -1}, {"-1", -1}};
    for (const auto& c : lengths) {
        EXPECT_EQ(c.second, VELA::System::ContentLength(c.first, c.first ? strlen(c.first) : 0, 100)) << c.first;
    }
    const std::tuple<std::string, size_t, bool> names[] = {
        {"a-Z_9", 5, true}, {"a-Z_9", 4, false}, {"", 5, false}, {"a.b", 5, false},
        {std::string("a\0b", 3), 5, false}, {"\xc3\xa9", 5, false},
    };
    for (const auto& [name, max, ok] : names) {
        EXPECT_EQ(ok, VELA::System::IsCheckedName(name, VELA::System::kNameId, max)) << name;
    }
    const std::pair<std::string, bool> apis[] = {
        {"VELA.Sample-1_x", true}, {".VELA", false}, {"VELA..x", false}, {std::string(129, 'a'), false}};
    for (const auto& [name, ok] : apis) {
        EXPECT_EQ(ok, VELA::System::IsAPIName(name)) << name;
    }
}

TEST(Names, HostnamesDomainsAndAddressTypes)
{
    const std::pair<std::string, int> hosts[] = {
        {"nas-01", 1}, {"9", 1},      {std::string(63, 'x'), 1}, {std::string(64, 'x'), 0}, {"", 0},
        {"-nas", 0},   {"nas-", 0},   {"nas_1", 0},              {"nas.lan", 0},            {"n\xC3\xA4s", 0}};
    for (const auto& [name, ok] : hosts) {
        EXPECT_EQ(ok, BlVLIBIsHostname(name.c_str())) << name;
    }
    EXPECT_FALSE(BlVLIBIsHostname(nullptr));

    // 4 labels of 62 + 3 dots = 251; +".b" = 253 fits, +".bc" = 254 does
    // not; a trailing dot is not counted.
    std::string base = std::string(62, 'a');
    base = base + "." + base + "." + base + "." + base;
    const std::pair<std::string, int> domains[] = {
        {"example.com", 1}, {"example.com.", 1}, {"localhost", 1}, {base + ".b", 1}, {base + ".b.", 1},
        {base + ".bc", 0}, {std::string(63, 'a') + ".com", 1}, {std::string(64, 'a') + ".com", 0},
        {"", 0}, {".", 0}, {"..", 0}, {".com", 0}, {"a..com", 0}, {"a.com..", 0}, {"-a.com", 0}, {"a-.com", 0},
        {"a b.com", 0}, {"a_b.com", 0}};
    for (const auto& [name, ok] : domains) {
        EXPECT_EQ(ok, BlVLIBIsDomain(name.c_str())) << name;
    }
    EXPECT_FALSE(BlVLIBIsDomain(nullptr));

    const std::pair<const char*, int> addresses[] = {
        {"192.0.2.1", 2}, {"2001:db8::1", 10}, {"::ffff:192.0.2.1", 10}, {"::", 10}, {"", 0}, {"192.0.2", 0},
        {"192.0.2.256", 0}, {"192.0.2.1 ", 0}, {"fe80::1%eth0", 0}, {"[::1]", 0}, {"1.2.3.4:80", 0},
        {"host.example", 0}, {"::ffff:999.0.0.1", 0}, {nullptr, 0}};
    for (const auto& [text, type] : addresses) {
        EXPECT_EQ(type, VELANetGetAddrType(text)) << (text ? text : "null");
    }
}

TEST(SzHash, InsertionOrderReplaceInPlaceAndBadArguments)
{
    PVLIBCSZHASH hash = VLIBCSzHashAlloc(0);
    ASSERT_NE(nullptr, hash);
    const std::pair<const char*, const char*> sets[] = {{"b", "1"}, {"a", "2"}, {"c", ""}, {"b", "3"}};
    for (const auto& [key, value] : sets) {
        EXPECT_EQ(0, VLIBCSzHashSetValue(hash, key, value)) << key;
    }
    ASSERT_EQ(3, VLIBCSzHashCount(hash));
    EXPECT_STREQ("b", VLIBCSzHashKeyAt(hash, 0));
    EXPECT_STREQ("3", VLIBCSzHashValueAt(hash, 0));
    EXPECT_STREQ("a", VLIBCSzHashKeyAt(hash, 1));
    EXPECT_STREQ("", VLIBCSzHashGetValue(hash, "c"));
    EXPECT_EQ(nullptr, VLIBCSzHashGetValue(hash, "B"));
    EXPECT_EQ(nullptr, VLIBCSzHashKeyAt(hash, 3));
    EXPECT_EQ(nullptr, VLIBCSzHashValueAt(hash, -1));

    const Json::Value obj = VELA::WebAPIUtil::SzHashToJsonObj(hash);
    EXPECT_EQ(3u, obj.size());
    EXPECT_EQ("3", obj["b"].asString());
    VLIBCSzHashFree(hash);

    // Null arguments, and a size hint that is no allocation size.
    hash = VLIBCSzHashAlloc(-5);
    ASSERT_NE(nullptr, hash);
    EXPECT_EQ(-1, VLIBCSzHashSetValue(hash, nullptr, "v"));
    EXPECT_EQ(-1, VLIBCSzHashSetValue(hash, "k", nullptr));
    EXPECT_EQ(-1, VLIBCSzHashSetValue(nullptr, "k", "v"));
    EXPECT_EQ(nullptr, VLIBCSzHashGetValue(hash, nullptr));
    EXPECT_EQ(0, VLIBCSzHashCount(hash));
    VLIBCSzHashFree(hash);

    hash = VLIBCSzHashAlloc(0x7fffffff);
    ASSERT_NE(nullptr, hash);
    for (int i = 0; i < 1000; ++i) {
        ASSERT_EQ(0, VLIBCSzHashSetValue(hash, std::to_string(i).c_str(), "x"));
    }
    EXPECT_EQ(1000, VLIBCSzHashCount(hash));
    EXPECT_STREQ("999", VLIBCSzHashKeyAt(hash, 999));
    VLIBCSzHashFree(hash);

    EXPECT_EQ(0, VLIBCSzHashCount(nullptr));
    EXPECT_EQ(nullptr, VLIBCSzHashGetValue(nullptr, "k"));
    EXPECT_EQ(0u, VELA::WebAPIUtil::SzHashToJsonObj(nullptr).size());
    VLIBCSzHashFree(nullptr);
}

TEST(LastError, RecordKeepsStemLineAndErrno)
{
    errno = ENOSPC;
    VLIBCErrSetEx(10496, "/src/transfer/APIUpload.cpp", 77);
    EXPECT_EQ(ENOSPC, errno);
    VLIBC_ERR_INFO info;
    ASSERT_EQ(0, VLIBCErrGetEx(&info));
    EXPECT_EQ(VLIBC_ERR_NO_SPACE, info.code);
    EXPECT_STREQ("APIUpload", info.szFile);
    EXPECT_EQ(77, info.line);
    EXPECT_EQ(ENOSPC, info.sysErrno);
    VLIBCErrSetEx(3072, nullptr, 0, std::string(400, 'm').c_str());  // cut to fit
    ASSERT_EQ(0, VLIBCErrGetEx(&info));
    EXPECT_EQ(255u, strlen(info.szMessage));
    VLIBCErrClear();
    EXPECT_EQ(VLIBC_ERR_NONE, VLIBCErrGet());
}

// VELA_ROOT is read once, until reset; the paths resolve under it.
TEST(Root, DefaultAndTrailingSlashes)
{
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", nullptr);
        VELA::System::RootReset();
        EXPECT_EQ("/", VELA::System::Root());
        EXPECT_EQ("/etc/velainfo.conf", VELA::System::Path("/etc/velainfo.conf"));
        EXPECT_EQ(1, VLIBCFileExist("/proc/self/status"));  // a path of the system, used as it is
    }
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", "/tmp/r//");
        VELA::System::RootReset();
        EXPECT_EQ("/tmp/r", VELA::System::Root());
        EXPECT_EQ("/tmp/r/etc/velainfo.conf", VELA::System::Path("/etc/velainfo.conf"));
    }
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", "relative/dir");  // cached until reset
        EXPECT_EQ("/tmp/r", VELA::System::Root());
        VELA::System::RootReset();
        EXPECT_EQ("/", VELA::System::Root());
    }
    VELA::System::RootReset();
}

}  // namespace
