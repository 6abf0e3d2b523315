// APICatalog: what a user may call, from the description files of a fresh
// web-API directory, judged as the session check judges a valid session.
#include <gtest/gtest.h>

#include <string>

#include "access/APICatalog.h"
#include "dispatcher/PipeFixture.h"
#include "support/JsonLiteral.h"

namespace {

class APICatalogTest : public WebapiDirFixture {
protected:
    void SetUp() override
    {
        WebapiDirFixture::SetUp();
        WriteJson("lib.def", J(R"({"authLevel": 1, "allowUser": ["admin.local", "normal.local"]})"));
        Conf("app_privileges.json", R"({"applications": {"VELA.Open": {"users": ["daemon"]},
            "VELA.Near": {"users": ["daemon"], "allow_from": ["192.0.2.0/24"]}}})");
        // Open: no login needed, two versions. Admin: administrators, but
        // one method of its own for ordinary users. Priv and Near: behind
        // an application privilege. Range: a version listed outside the
        // range, repeats and object entries. None: nothing for anyone but
        // administrators.
        WriteJson("VELA.T.lib", J(R"({
            "VELA.T.Open": {"lib": "x.so", "minVersion": 1, "maxVersion": 2, "authLevel": 0,
                            "methods": {"1": ["a"], "2": ["b", "a"]}},
            "VELA.T.Admin": {"lib": "x.so", "minVersion": 1, "maxVersion": 1, "allowUser": ["admin.local"],
                             "methods": {"1": ["zap", {"mine": {"allowUser": ["normal.local"]}}]}},
            "VELA.T.Priv": {"lib": "x.so", "minVersion": 1, "maxVersion": 1, "appPriv": "VELA.Open",
                            "methods": {"1": ["get"]}},
            "VELA.T.Near": {"lib": "x.so", "minVersion": 1, "maxVersion": 1, "appPriv": "VELA.Near",
                            "methods": {"1": ["get"]}},
            "VELA.T.Range": {"lib": "x.so", "minVersion": 2, "maxVersion": 3,
                             "methods": {"1": ["old"], "2": ["y", "x", "y", {"w": {}}], "x": ["bad"]}},
            "VELA.T.None": {"lib": "x.so", "minVersion": 1, "maxVersion": 1, "allowUser": ["admin.local"],
                            "methods": {"1": ["get"]}}})"));
    }
};

TEST_F(APICatalogTest, CallableListsOnlyWhatTheUserMayCallSortedByName)
{
    VELA::APICatalog catalog;
    EXPECT_EQ(J(R"([
        {"api": "VELA.T.Admin", "minVersion": 1, "maxVersion": 1, "methods": {"1": ["mine"]}},
        {"api": "VELA.T.Open", "minVersion": 1, "maxVersion": 2, "methods": {"1": ["a"], "2": ["a", "b"]}},
        {"api": "VELA.T.Priv", "minVersion": 1, "maxVersion": 1, "methods": {"1": ["get"]}},
        {"api": "VELA.T.Range", "minVersion": 2, "maxVersion": 2, "methods": {"2": ["w", "x", "y"]}}])"),
              catalog.Callable("daemon"))
        << "no address known: a privilege bound to addresses grants nothing";

    const Json::Value near = catalog.Callable("daemon", "192.0.2.7");
    ASSERT_EQ(5u, near.size());
    EXPECT_EQ("VELA.T.Near", near[1]["api"].asString());

    // An administrator gets the administrators' methods; a user without the
    // privilege does not get the privileged API.
    const Json::Value admin = catalog.Callable("root");
    bool sawNone = false;
    for (const Json::Value& api : admin) {
        if (api["api"] == "VELA.T.Admin") {
            // A method's own "allowUser" replaces the API's, for everyone.
            EXPECT_EQ(J(R"({"1": ["zap"]})"), api["methods"]);
        }
        sawNone = sawNone || api["api"] == "VELA.T.None";
    }
    EXPECT_TRUE(sawNone);
    for (const Json::Value& api : catalog.Callable("nobody")) {
        EXPECT_NE("VELA.T.Priv", api["api"].asString());
        EXPECT_NE("VELA.T.None", api["api"].asString());
    }
}

TEST_F(APICatalogTest, MayCallAgreesWithTheListAndRefusesWhatIsNotDescribed)
{
    VELA::APICatalog catalog;
    EXPECT_TRUE(catalog.MayCall("VELA.T.Admin", 1, "zap", "root"));
    EXPECT_FALSE(catalog.MayCall("VELA.T.Admin", 1, "zap", "daemon"));
    EXPECT_TRUE(catalog.MayCall("VELA.T.Admin", 1, "mine", "daemon"));
    EXPECT_TRUE(catalog.MayCall("VELA.T.Near", 1, "get", "daemon", "192.0.2.7"));
    EXPECT_FALSE(catalog.MayCall("VELA.T.Near", 1, "get", "daemon", "198.51.100.1"));
    EXPECT_FALSE(catalog.MayCall("VELA.T.Missing", 1, "get", "root"));
    EXPECT_FALSE(catalog.MayCall("../VELA.T.Open", 1, "a", "root"));
    Json::Value desc;
    EXPECT_FALSE(catalog.Describe("VELA.T.Missing", desc));
    ASSERT_TRUE(catalog.Describe("VELA.T.Open", desc));
    EXPECT_EQ(2, desc["maxVersion"].asInt());
}

}  // namespace
