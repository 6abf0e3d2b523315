// RFC 1123 host and domain names and address types.
#include "platform/PlatformTest.h"

namespace {

std::string Labels(int count, int each)
{
    std::string out;
    for (int i = 0; i < count; ++i) {
        out += (i ? "." : "") + std::string(each, 'a');
    }
    return out;
}

TEST(Names, HostnameLabelRules)
{
    EXPECT_TRUE(BlVLIBIsHostname("nas-01"));
    EXPECT_TRUE(BlVLIBIsHostname("9"));
    EXPECT_TRUE(BlVLIBIsHostname(std::string(63, 'x').c_str()));
    EXPECT_FALSE(BlVLIBIsHostname(std::string(64, 'x').c_str()));
    EXPECT_FALSE(BlVLIBIsHostname(""));
    EXPECT_FALSE(BlVLIBIsHostname(nullptr));
    EXPECT_FALSE(BlVLIBIsHostname("-nas"));
    EXPECT_FALSE(BlVLIBIsHostname("nas-"));
    EXPECT_FALSE(BlVLIBIsHostname("nas_1"));
    EXPECT_FALSE(BlVLIBIsHostname("nas.lan"));
    EXPECT_FALSE(BlVLIBIsHostname("n\xC3\xA4s"));
}

TEST(Names, DomainLengthsAndLabels)
{
    EXPECT_TRUE(BlVLIBIsDomain("example.com"));
    EXPECT_TRUE(BlVLIBIsDomain("example.com."));
    EXPECT_TRUE(BlVLIBIsDomain("localhost"));
    // 4 labels of 62 + 3 dots = 251; +".b" = 253 fits, +".bc" = 254 does not.
    const std::string base = Labels(4, 62);
    ASSERT_EQ(251u, base.size());
    EXPECT_TRUE(BlVLIBIsDomain((base + ".b").c_str()));
    EXPECT_TRUE(BlVLIBIsDomain((base + ".b.").c_str()));  // trailing dot not counted
    EXPECT_FALSE(BlVLIBIsDomain((base + ".bc").c_str()));
    EXPECT_TRUE(BlVLIBIsDomain((std::string(63, 'a') + ".com").c_str()));
    EXPECT_FALSE(BlVLIBIsDomain((std::string(64, 'a') + ".com").c_str()));
    for (const char* bad : {"", ".", "..", ".com", "a..com", "a.com..", "-a.com", "a-.com", "a b.com", "a_b.com"}) {
        EXPECT_FALSE(BlVLIBIsDomain(bad)) << bad;
    }
    EXPECT_FALSE(BlVLIBIsDomain(nullptr));
}

TEST(Names, AddressTypes)
{
    EXPECT_EQ(2, VELANetGetAddrType("192.0.2.1"));
    EXPECT_EQ(10, VELANetGetAddrType("2001:db8::1"));
    EXPECT_EQ(10, VELANetGetAddrType("::ffff:192.0.2.1"));
    EXPECT_EQ(10, VELANetGetAddrType("::"));
    for (const char* bad : {"", "192.0.2", "192.0.2.256", "192.0.2.1 ", "fe80::1%eth0", "[::1]", "1.2.3.4:80",
                            "host.example", "::ffff:999.0.0.1"}) {
        EXPECT_EQ(0, VELANetGetAddrType(bad)) << bad;
    }
    EXPECT_EQ(0, VELANetGetAddrType(nullptr));
}

}  // namespace
