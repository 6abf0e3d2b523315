// The string table.
#include "platform/PlatformTest.h"
#include "vela/webapiutil.h"

namespace {

TEST(SzHash, InsertionOrderAndReplaceInPlace)
{
    PVLIBCSZHASH hash = VLIBCSzHashAlloc(0);
    ASSERT_NE(nullptr, hash);
    EXPECT_EQ(0, VLIBCSzHashSetValue(hash, "b", "1"));
    EXPECT_EQ(0, VLIBCSzHashSetValue(hash, "a", "2"));
    EXPECT_EQ(0, VLIBCSzHashSetValue(hash, "c", ""));
    EXPECT_EQ(0, VLIBCSzHashSetValue(hash, "b", "3"));
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
}

TEST(SzHash, NullArgumentsAndHugeSizeHint)
{
    PVLIBCSZHASH hash = VLIBCSzHashAlloc(-5);
    ASSERT_NE(nullptr, hash);
    EXPECT_EQ(-1, VLIBCSzHashSetValue(hash, nullptr, "v"));
    EXPECT_EQ(-1, VLIBCSzHashSetValue(hash, "k", nullptr));
    EXPECT_EQ(-1, VLIBCSzHashSetValue(nullptr, "k", "v"));
    EXPECT_EQ(nullptr, VLIBCSzHashGetValue(hash, nullptr));
    EXPECT_EQ(0, VLIBCSzHashCount(hash));
    VLIBCSzHashFree(hash);

    hash = VLIBCSzHashAlloc(0x7fffffff);  // a hint, not an allocation size
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

}  // namespace
