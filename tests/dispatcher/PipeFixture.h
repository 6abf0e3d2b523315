// WebapiDirFixture: a fresh system root whose web-API directory is the
// working directory for the test's duration. PipeFixture, of the pipeline,
// counter, identity, exec handler and compound tests: that directory holds
// lib.def and the descriptions of the test handler libraries
// (tests/dispatcher/libs/pipe_*.cpp).
#pragma once

#include <climits>
#include <cstdlib>
#include <fstream>
#include <gtest/gtest.h>
#include <json/json.h>
#include <pwd.h>
#include <string>
#include <unistd.h>

#include "platform/StateRootTest.h"
#include "support/JsonLiteral.h"
#include "vela/webapiutil.h"

class WebapiDirFixture : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        oldCwd_ = Cwd();
        ASSERT_FALSE(oldCwd_.empty());
        webapiDir_ = root_.Path() + "/usr/vela/velaman/webapi";
        ASSERT_EQ(0, system(("mkdir -p '" + webapiDir_ + "'").c_str()));
        ASSERT_EQ(0, chdir(webapiDir_.c_str()));
    }
    void TearDown() override
    {
        if (!oldCwd_.empty()) {
            EXPECT_EQ(0, chdir(oldCwd_.c_str()));
        }
        StateRootTest::TearDown();
    }

    // Writes the file `name`, relative to the working directory: the web-API
    // directory, unless the test went elsewhere.
    void WriteJson(const std::string& name, const Json::Value& value)
    {
        ASSERT_TRUE(VELA::WebAPIUtil::WriteJsonFileAtomic(name, value, 0644)) << name;
    }

    // A request JSON for one call.
    static Json::Value Call(const std::string& api, int version, const std::string& method,
                            const Json::Value& params = Json::Value(Json::objectValue))
    {
        Json::Value request(Json::objectValue);
        request["getParam"] = params;
        request["getParam"]["api"] = api;
        request["getParam"]["version"] = version;
        request["getParam"]["method"] = method;
        return request;
    }

    static std::string Cwd()
    {
        char buf[PATH_MAX];
        return getcwd(buf, sizeof(buf)) ? buf : "";
    }

    // Path of a test handler library lib<name>.so.
    static std::string Lib(const std::string& name)
    {
        const char* dir = getenv("VELA_TEST_BINARY_DIR");
        return std::string(dir ? dir : ".") + "/tests/dispatcher/libs/lib" + name + ".so";
    }

    // The user the handlers run as: the test's own, so the switch needs no
    // rights the test lacks.
    static std::string RunAs()
    {
        const struct passwd* pw = getpwuid(geteuid());
        return pw ? pw->pw_name : "system";
    }

    std::string oldCwd_;
    std::string webapiDir_;
};

class PipeFixture : public WebapiDirFixture {
protected:
    void SetUp() override
    {
        WebapiDirFixture::SetUp();
        WriteJson("lib.def", J(R"({"authLevel": 1, "allowUser": ["admin.local"], "priority": 0,
                                   "methods": {"allowDemo": false}})"));
        WriteJson("VELA.Pipe.lib", Descriptions());
        WriteJson("VELA.Entry.lib", J(R"({"VELA.Entry.Request": {"lib": ")" + Lib("pipe_handlers") + R"(",
            "minVersion": 1, "maxVersion": 1, "runAs": ")" + RunAs() + R"(",
            "methods": {"1": ["request", "other"]}}})"));
    }

    // The descriptions of VELA.Pipe.lib; tests add to them and write again.
    // VELA.Pipe.Sub is the API of the exec handler and compound tests.
    Json::Value Descriptions() const
    {
        const std::string handlers = Lib("pipe_handlers");
        const std::string runAs = RunAs();
        return J(R"({
            "VELA.Pipe.Test": {"lib": ")" + handlers + R"(", "minVersion": 1, "maxVersion": 2,
                "runAs": ")" + runAs + R"(",
                "methods": {
                    "1": ["silent", "echo", "print", "chdir", "throws", "callback", "v1only",
                          {"printKept": {"allowDownload": true, "allowUpload": true}},
                          {"upload": {"allowUpload": true}},
                          {"timeout": {"allowTimeout": true}}],
                    "2": ["v1only"]}},
            "VELA.Pipe.Uncounted": {"lib": ")" + handlers + R"(", "minVersion": 1, "maxVersion": 1,
                "runAs": ")" + runAs + R"(", "count": false, "methods": {"1": ["get"]}},
            "VELA.Pipe.Nice": {"lib": ")" + handlers + R"(", "minVersion": 1, "maxVersion": 1,
                "runAs": ")" + runAs + R"(", "priority": 5, "methods": {"1": ["fail"]}},
            "VELA.Pipe.Checked": {"lib": ")" + Lib("pipe_checked") + R"(", "minVersion": 1, "maxVersion": 1,
                "runAs": ")" + runAs + R"(", "methods": {"1": ["open", "guarded", "unlisted"]}},
            "VELA.Pipe.NoLib": {"lib": ")" + Lib("pipe_missing") + R"(", "minVersion": 1, "maxVersion": 1,
                "methods": {"1": ["get"]}},
            "VELA.Pipe.NoTable": {"lib": ")" + Lib("reg_notable") + R"(", "minVersion": 1, "maxVersion": 1,
                "methods": {"1": ["get"]}},
            "VELA.Pipe.NullTable": {"lib": ")" + Lib("pipe_nulltable") + R"(", "minVersion": 1,
                "maxVersion": 1, "methods": {"1": ["get"]}},
            "VELA.Pipe.Sub": {"lib": ")" + handlers + R"(", "minVersion": 1, "maxVersion": 1,
                "runAs": ")" + runAs + R"(", "methods": {"1": ["report", "fail", "sleep", "crash", "orphan",
                    {"reportGrantable": {"grantable": true}}, {"reportDefault": {"grantByDefault": true}},
                    {"callback": {"grantByDefault": true}}, {"noisy": {"allowDownload": true}},
                    {"output": {"grantable": true, "allowDownload": true}}]}}
        })");
    }
};
