#include <gtest/gtest.h>

#include <fstream>
#include <sys/stat.h>
#include <unistd.h>

#include "base/APIBase.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "webapi/JsonUtil.h"

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

TEST(APIBaseSet, NeverCreatesASection)
{
    Store s;
    EXPECT_FALSE(s.SetData("nope", "k", 1, false));
    EXPECT_FALSE(s.SetData("nope", J(R"({"a": 1})"), false));
    EXPECT_FALSE(s.Raw().isMember("nope"));
}

TEST(APIBaseSet, StringsOnlyMergeSkipsOthersButSucceeds)
{
    Store s;
    EXPECT_TRUE(s.SetData("obj", J(R"({"a": "x", "b": 1})"), true));
    EXPECT_TRUE(s.HasData("obj", "a"));
    EXPECT_FALSE(s.HasData("obj", "b"));
    EXPECT_TRUE(s.SetData("obj", J(R"({"c": 2})"), true));  // all skipped, still true
    EXPECT_FALSE(s.HasData("obj", "c"));
    EXPECT_FALSE(s.SetData("obj", "k", 1, true));
    EXPECT_TRUE(s.SetData("obj", "k", "v", true));
}

TEST(APIBaseSet, RefusesEmptyAndNonObjects)
{
    Store s;
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

TEST(JsonUtil, ParseRefusesGarbageAndExtremeNesting)
{
    Json::Value v(5);
    EXPECT_FALSE(VELA::JsonParse("{\"a\": 1} trailing", v));
    EXPECT_FALSE(VELA::JsonParse("", v));
    EXPECT_FALSE(VELA::JsonParse(std::string(100000, '['), v));
    EXPECT_EQ(Json::Value(5), v);
    EXPECT_TRUE(VELA::JsonParse(std::string(100, '[') + std::string(100, ']'), v));
}

TEST(JsonUtil, WriteIsAtomicAndReadable)
{
    VELA::Test::TempDir dir;
    const std::string path = dir.Path() + "/doc.json";
    ASSERT_TRUE(VELA::JsonWriteFile(path, J(R"({"a": [1, "x"]})"), 0600));
    Json::Value back;
    ASSERT_TRUE(VELA::JsonReadFile(path, back));
    EXPECT_EQ(J(R"({"a": [1, "x"]})"), back);
    struct stat st;
    ASSERT_EQ(0, stat(path.c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777);
    EXPECT_FALSE(VELA::JsonWriteFile(dir.Path() + "/no/such/dir/doc.json", 1));
    EXPECT_FALSE(VELA::JsonReadFile(dir.Path() + "/missing.json", back));
    std::ofstream(dir.Path() + "/bad.json") << "{\"a\":";
    EXPECT_FALSE(VELA::JsonReadFile(dir.Path() + "/bad.json", back));
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
