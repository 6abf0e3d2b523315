// APIBase: the sections of a request or response store, set, read and
// cleared.
#include <gtest/gtest.h>

#include "base/APIBase.h"
#include "support/JsonLiteral.h"

namespace {

// A derived store with the sections a private object would create.
class Store : public VELA::APIBase {
public:
    Store()
    {
        data_["obj"] = Json::Value(Json::objectValue);
        data_["arr"] = Json::Value(Json::arrayValue);
    }
    const Json::Value& Raw() const { return data_; }
};

}  // namespace

TEST(APIBaseSet, NeverCreatesASectionStringsOnlyRefusesNonObjects)
{
    Store s;
    EXPECT_FALSE(s.SetData("nope", "k", 1, false));
    EXPECT_FALSE(s.SetData("nope", J(R"({"a": 1})"), false));
    EXPECT_FALSE(s.Raw().isMember("nope"));

    // A strings-only merge skips the others but succeeds.
    EXPECT_TRUE(s.SetData("obj", J(R"({"a": "x", "b": 1})"), true));
    EXPECT_TRUE(s.HasData("obj", "a"));
    EXPECT_FALSE(s.HasData("obj", "b"));
    EXPECT_TRUE(s.SetData("obj", J(R"({"c": 2})"), true));  // all skipped, still true
    EXPECT_FALSE(s.HasData("obj", "c"));
    EXPECT_FALSE(s.SetData("obj", "k", 1, true));
    EXPECT_TRUE(s.SetData("obj", "k", "v", true));

    // Empty objects and non-objects are refused.
    EXPECT_FALSE(s.SetData("obj", J("{}"), false));
    EXPECT_FALSE(s.SetData("obj", J("[1,2]"), false));
    EXPECT_FALSE(s.SetData("obj", Json::Value("s"), false));
    EXPECT_FALSE(s.SetData("obj", "", 1, false));
    // An array section cannot take keyed entries; no exception escapes.
    EXPECT_FALSE(s.SetData("arr", "k", 1, false));
    EXPECT_FALSE(s.SetData("arr", J(R"({"a": 1})"), false));
    EXPECT_TRUE(s.Raw()["arr"].isArray());
}

TEST(APIBaseGet, DefaultsAndWholeSections)
{
    Store s;
    s.SetData("obj", "k", 7, false);
    const Json::Value def("d");
    EXPECT_EQ(&def, &s.GetData("nope", "k", def));
    EXPECT_EQ(&def, &s.GetData("obj", "missing", def));
    EXPECT_EQ(&def, &s.GetData("arr", "k", def));
    EXPECT_EQ(J(R"({"k": 7})"), s.GetData("obj", "", def));
    EXPECT_EQ(7, s.GetData("obj", "k", def).asInt());
    EXPECT_FALSE(s.HasData("obj", ""));
    EXPECT_FALSE(s.HasData("arr", "0"));
}

TEST(APIBaseClear, EntriesAndSections)
{
    Store s;
    s.SetData("obj", J(R"({"a": 1, "b": 2})"), false);
    EXPECT_TRUE(s.ClearData("obj", "a"));
    EXPECT_FALSE(s.ClearData("obj", "a"));
    EXPECT_FALSE(s.ClearData("", ""));
    EXPECT_FALSE(s.ClearData("nope", ""));
    EXPECT_TRUE(s.ClearData("obj", ""));
    EXPECT_TRUE(s.Raw().isMember("obj"));
    EXPECT_TRUE(s.Raw()["obj"].isObject());
    EXPECT_TRUE(s.Raw()["obj"].empty());
    EXPECT_TRUE(s.SetData("obj", "again", 1, false));
    EXPECT_FALSE(s.ClearData("arr", "k"));
}
