// The description registry: validation and defaults, loading all files or
// the one file of an API, method attributes, the first check of a request,
// and names from the client that must never reach a file name.
#include <gtest/gtest.h>

#include <fstream>
#include <string>
#include <unistd.h>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/PipeFixture.h"
#include "support/TestSupport.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::APIRunner;

// Shows the registry's members and the runner's description table to the
// tests.
class TableRunner : public APIRunner {
public:
    using APIRunner::ApplyLibDef;
    using APIRunner::CheckLibDescription;
    using APIRunner::CheckRequestParam;
    using APIRunner::InitLibDesc;
    const Json::Value& Descriptions() const { return d_->registry.Table(); }
};

// A web-API directory holding only this test's files.
class Registry : public WebapiDirFixture {
protected:
    void SetUp() override
    {
        WebapiDirFixture::SetUp();
        WriteJson("lib.def", J(R"({"authLevel": 2, "allowUser": ["admin.local"], "priority": 3,
                                   "requestFormat": "XML",
                                   "methods": {"allowUpload": false, "allowDownload": true}})"));
    }

    static void WriteText(const std::string& path, const std::string& text)
    {
        std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
    }

    // A valid description whose "lib" tells where it was read from.
    static Json::Value Desc(const std::string& lib, const std::string& methods = R"({"1": ["get"]})")
    {
        return J(R"({"lib": ")" + lib + R"(", "minVersion": 1, "maxVersion": 1, "methods": )" + methods + "}");
    }

    static Json::Value One(const std::string& api, const Json::Value& desc)
    {
        Json::Value file(Json::objectValue);
        file[api] = desc;
        return file;
    }

    // The code CheckRequestParam answers for one request JSON (0: passed).
    static int Check(TableRunner& runner, const Json::Value& request)
    {
        APIRequest req(request);
        APIResponse resp(&req);
        const bool ok = runner.CheckRequestParam(&req, &resp);
        EXPECT_EQ(ok, resp.GetError() == 0) << request;
        return resp.GetError();
    }
};

TEST_F(Registry, ValidationAndDefaults)
{
    TableRunner runner;
    const struct {
        const char* what;
        const char* desc;
        bool valid;
    } cases[] = {
        {"minimal", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}})", true},
        {"priority 10", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}, "priority": 10})", true},
        {"priority -10", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}, "priority": -10})", true},
        {"min above max", R"({"lib": "x.so", "minVersion": 3, "maxVersion": 1, "methods": {}})", true},
        {"priority 11", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}, "priority": 11})", false},
        {"priority -11", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}, "priority": -11})", false},
        {"priority 2.5", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}, "priority": 2.5})", false},
        {"priority text", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": {}, "priority": "1"})", false},
        {"lib empty", R"({"lib": "", "minVersion": 1, "maxVersion": 1, "methods": {}})", false},
        {"lib not text", R"({"lib": 7, "minVersion": 1, "maxVersion": 1, "methods": {}})", false},
        {"no minVersion", R"({"lib": "x.so", "maxVersion": 1, "methods": {}})", false},
        {"maxVersion text", R"({"lib": "x.so", "minVersion": 1, "maxVersion": "2", "methods": {}})", false},
        {"methods array", R"({"lib": "x.so", "minVersion": 1, "maxVersion": 1, "methods": []})", false},
        {"not an object", R"(["lib"])", false},
    };
    for (const auto& c : cases) {
        Json::Value desc = J(c.desc);
        EXPECT_EQ(c.valid, runner.CheckLibDescription(desc)) << c.what;
    }

    // Absent keys come from lib.def, except "requestFormat", which is always
    // "JSON"; present keys stay, whatever their value.
    Json::Value bare = J(R"({"lib": "x.so"})");
    EXPECT_EQ(J(R"({"lib": "x.so", "authLevel": 2, "allowUser": ["admin.local"], "priority": 3,
                    "requestFormat": "JSON"})"),
              runner.ApplyLibDef(bare));
    Json::Value set = J(R"({"authLevel": null, "allowUser": [], "priority": 0, "requestFormat": "form"})");
    const Json::Value before = set;
    EXPECT_EQ(before, runner.ApplyLibDef(set));

    // lib.def that is not an object reads as no defaults at all.
    WriteText("lib.def", "[1, 2]");
    TableRunner bareRunner;
    EXPECT_EQ(Json::Value(), bareRunner.GetMethod("No.Such", 1, "get"));
    Json::Value desc = J(R"({"lib": "x.so"})");
    EXPECT_EQ(J(R"({"lib": "x.so", "authLevel": null, "allowUser": null, "priority": null,
                    "requestFormat": "JSON"})"),
              bareRunner.ApplyLibDef(desc));
    EXPECT_FALSE(bareRunner.GetMethodAttr("No.Such", 1, "get", "allowDownload"));
}

// All files, in glob order: a later file replaces an entry of an earlier
// one; invalid descriptions and files are logged and skipped; an entry that
// was in the table before the load stays.
TEST_F(Registry, LoadAllFiles)
{
    TableRunner runner;
    Json::Value table(Json::objectValue);
    EXPECT_FALSE(runner.InitLibDesc(table));  // no *.lib at all

    Json::Value first = One("X", Desc("first.so"));
    first["Bad.Prio"] = Desc("bad.so");
    first["Bad.Prio"]["priority"] = 11;
    first["Kept"] = Desc("file.so");
    WriteJson("a.lib", first);
    WriteJson("b.lib", One("X", Desc("second.so")));
    WriteText("c.lib", "{\"Y\": ");
    WriteText("d.lib", R"([{"Z": {"lib": "z.so"}}])");
    WriteText("e.lib.bak", R"({"W": {"lib": "w.so", "minVersion": 1, "maxVersion": 1, "methods": {}}})");

    table["Kept"] = "from before";
    VELA::Test::LogCapture log;
    EXPECT_TRUE(runner.InitLibDesc(table));
    EXPECT_EQ((std::vector<std::string>{"Kept", "X"}), table.getMemberNames());
    EXPECT_EQ(Json::Value("second.so"), table["X"]["lib"]);
    EXPECT_EQ(Json::Value("JSON"), table["X"]["requestFormat"]);
    EXPECT_EQ(Json::Value("from before"), table["Kept"]);
    EXPECT_TRUE(log.Contains("WebAPI description Bad.Prio is not valid."));
    EXPECT_TRUE(log.Contains("WebAPI description file c.lib is not valid"));
    EXPECT_TRUE(log.Contains("WebAPI description file d.lib is not valid"));
}

// The one file of an API: prefixes from the second component on, the
// longest existing one wins, four candidates at most, the first component
// alone never.
TEST_F(Registry, CandidateSearch)
{
    TableRunner runner;
    Json::Value ab = One("A.B.C", Desc("from-AB"));
    ab["A.B.Z"] = Desc("from-AB");
    WriteJson("A.B.lib", ab);
    Json::Value abc = One("A.B.C", Desc("from-ABC"));
    abc["A.B.C.Also"] = Desc("from-ABC");
    WriteJson("A.B.C.lib", abc);
    WriteJson("A.lib", One("A.Q", Desc("from-A")));
    WriteJson("Solo.lib", One("Solo", Desc("solo")));
    WriteJson("P.Q.R.S.T.U.lib", One("P.Q.R.S.T.U", Desc("too-deep")));

    const struct {
        const char* api;
        bool found;
        const char* members;  // the table afterwards, lib of each entry
    } cases[] = {
        {"A.B.C", true, R"({"A.B.C": "from-ABC", "A.B.C.Also": "from-ABC"})"},
        {"A.B.C.D", true, R"({"A.B.C": "from-ABC", "A.B.C.Also": "from-ABC"})"},
        {"A.B.Z", true, R"({"A.B.C": "from-AB", "A.B.Z": "from-AB"})"},
        {"A.B", true, R"({"A.B.C": "from-AB", "A.B.Z": "from-AB"})"},
        {"A.Q", false, "{}"},
        {"Solo", true, R"({"Solo": "solo"})"},
        {"P.Q.R.S.T.U", false, "{}"},
    };
    for (const auto& c : cases) {
        Json::Value table(Json::objectValue);
        VELA::Test::LogCapture log;
        EXPECT_EQ(c.found, runner.InitLibDesc(table, c.api)) << c.api;
        Json::Value libs(Json::objectValue);
        for (const auto& name : table.getMemberNames()) {
            libs[name] = table[name]["lib"];
        }
        EXPECT_EQ(J(c.members), libs) << c.api;
        EXPECT_EQ(!c.found, log.Contains(std::string("WebAPI ") + c.api + " is not valid")) << c.api;
    }

    // The fourth candidate is the last one tried.
    WriteJson("P.Q.R.S.T.lib", One("P.Q.R.S.T.U", Desc("fourth")));
    Json::Value table(Json::objectValue);
    EXPECT_TRUE(runner.InitLibDesc(table, "P.Q.R.S.T.U"));
    EXPECT_EQ(Json::Value("fourth"), table["P.Q.R.S.T.U"]["lib"]);

    // A candidate that is not JSON ends the search with its own message.
    WriteText("Solo.lib", "not json");
    VELA::Test::LogCapture log;
    Json::Value fresh(Json::objectValue);
    EXPECT_FALSE(runner.InitLibDesc(fresh, "Solo"));
    EXPECT_TRUE(log.Contains("WebAPI description file Solo.lib is not valid"));
    EXPECT_EQ(Json::Value(Json::objectValue), fresh);
}

// A string entry and all but the first member of an object entry get the
// defaults; the first member of an object entry gets its own attributes
// (an absent flag is false there, not the default).
TEST_F(Registry, MethodAttributes)
{
    WriteJson("R.M.lib", One("R.M", Desc("r.so", R"({
        "1": ["list", {"get": {"allowUpload": true}, "put": {"allowUpload": true}},
              {"set": {"allowUpload": "yes", "allowDemo": 1}}, 7, {}],
        "2": [{"get": {"allowTimeout": true}}]})")));
    TableRunner runner;
    // lib.def's "methods", one object whatever the method that falls back
    // to it.
    const Json::Value& defaults = runner.GetMethod("No.Such", 1, "get");
    EXPECT_EQ(J(R"({"allowUpload": false, "allowDownload": true})"), defaults);

    EXPECT_EQ(&defaults, &runner.GetMethod("R.M", 1, "list"));
    EXPECT_EQ(&defaults, &runner.GetMethod("R.M", 1, "put"));
    EXPECT_EQ(&defaults, &runner.GetMethod("R.M", 3, "get"));
    EXPECT_EQ(J(R"({"allowUpload": true})"), runner.GetMethod("R.M", 1, "get"));

    const struct {
        int version;
        const char* method;
        const char* attr;
        bool value;
    } flags[] = {
        {1, "list", "allowDownload", true},  {1, "put", "allowUpload", false},  {1, "get", "allowUpload", true},
        {1, "get", "allowDownload", false},  {1, "set", "allowUpload", false},  {1, "set", "allowDemo", true},
        {2, "get", "allowTimeout", true},    {2, "get", "allowUpload", false},  {2, "list", "allowDownload", true},
    };
    for (const auto& f : flags) {
        EXPECT_EQ(f.value, runner.GetMethodAttr("R.M", f.version, f.method, f.attr))
            << f.version << " " << f.method << " " << f.attr;
    }
    APIRequest req(Call("R.M", 1, "get"));
    EXPECT_TRUE(runner.GetMethodAttr(&req, "allowUpload"));
    EXPECT_FALSE(runner.GetMethodAttr(&req, ""));
    EXPECT_FALSE(runner.GetMethodAttr(nullptr, "allowUpload"));
}

TEST_F(Registry, CheckRequestParamCodes)
{
    Json::Value desc = Desc("r.so", R"({"1": ["list", {"get": {"allowUpload": true}, "put": {}}], "2": ["get"]})");
    desc["maxVersion"] = 2;
    WriteJson("R.M.lib", One("R.M", desc));
    WriteText("Broken.lib", "{");

    Json::Value uploadAllowed = Call("R.M", 1, "get");
    uploadAllowed["environ"]["CONTENT_TYPE"] = "multipart/form-data; boundary=x";

    // Beside the refusals the whole road makes (RoadTest.cpp).
    const struct {
        const char* what;
        Json::Value request;
        int code;
    } cases[] = {
        {"negative version", Call("R.M", -1, "list"), WEBAPI_ERR_BAD_REQUEST},
        {"file not JSON", Call("Broken", 1, "list"), WEBAPI_ERR_NO_SUCH_API},
        {"listed for another version", Call("R.M", 2, "list"), WEBAPI_ERR_NO_SUCH_METHOD},
        {"upload allowed", uploadAllowed, 0},
        {"string entry", Call("R.M", 1, "list"), 0},
        {"second member", Call("R.M", 1, "put"), 0},
        {"version 2", Call("R.M", 2, "get"), 0},
    };
    TableRunner runner;
    for (const auto& c : cases) {
        EXPECT_EQ(c.code, Check(runner, c.request)) << c.what;
    }

    // The description goes to the request once loaded.
    APIRequest req(Call("R.M", 1, "list"));
    EXPECT_TRUE(runner.AddAPIInfo(&req));
    EXPECT_EQ(Json::Value("r.so"), req.GetAPIInfo("lib"));
    EXPECT_EQ(Json::Value(3), req.GetAPIInfo("priority"));
    APIRequest unknown(Call("No.Such", 1, "list"));
    EXPECT_FALSE(runner.AddAPIInfo(&unknown));
    EXPECT_FALSE(runner.AddAPIInfo(nullptr));
}

// A bad version is refused before any file is read; an API in the table is
// served without its file.
TEST_F(Registry, DiskTouchedOnlyWhenNeeded)
{
    WriteText("Z.Y.lib", "not json");
    TableRunner runner;
    {
        VELA::Test::LogCapture log;
        EXPECT_EQ(WEBAPI_ERR_BAD_REQUEST, Check(runner, Call("Z.Y", 0, "get")));
        // The refusal's one line, and nothing about the file.
        ASSERT_EQ(1u, log.Lines().size());
        EXPECT_EQ(0u, log.Lines()[0].rfind("Registry:", 0)) << log.Lines()[0];
        EXPECT_EQ(std::string::npos, log.Lines()[0].find("file")) << log.Lines()[0];
        EXPECT_EQ(WEBAPI_ERR_NO_SUCH_API, Check(runner, Call("Z.Y", 1, "get")));
        EXPECT_TRUE(log.Contains("WebAPI description file Z.Y.lib is not valid"));
    }

    WriteJson("R.M.lib", One("R.M", Desc("r.so")));
    EXPECT_EQ(0, Check(runner, Call("R.M", 1, "get")));
    ASSERT_EQ(0, unlink("R.M.lib"));
    EXPECT_EQ(0, Check(runner, Call("R.M", 1, "get")));
    TableRunner fresh;
    EXPECT_EQ(WEBAPI_ERR_NO_SUCH_API, Check(fresh, Call("R.M", 1, "get")));
}

// Names that would lead the search out of the directory, or to a hidden or
// overlong file, are refused although a file answering them exists.
TEST_F(Registry, HostileNamesReachNoFile)
{
    const std::string longName = "L." + std::string(200, 'x');
    const std::string withNul = std::string("R.M\0/../x", 9);
    ASSERT_EQ(0, system("mkdir -p a ../q"));
    WriteJson("../x.lib", One("../x", Desc("up.so")));
    WriteJson("../q/r.lib", One("../q/r", Desc("up.so")));
    WriteJson("a/b.lib", One("a/b", Desc("down.so")));
    WriteJson(".hidden.lib", One(".hidden", Desc("hidden.so")));
    WriteJson("a..b.lib", One("a..b", Desc("dots.so")));
    WriteJson(longName + ".lib", One(longName, Desc("long.so")));
    WriteJson("R.M.lib", One("R.M", Desc("r.so")));
    WriteJson("caf\xc3\xa9.lib", One("caf\xc3\xa9", Desc("utf8.so")));

    const std::string names[] = {"../x", "../q/r", "a/b", ".hidden", "a..b", longName, withNul,
                                 "caf\xc3\xa9", "R.M ", "R.M\n"};
    TableRunner runner;
    for (const auto& name : names) {
        VELA::Test::LogCapture log;
        EXPECT_EQ(WEBAPI_ERR_NO_SUCH_API, Check(runner, Call(name, 1, "get"))) << name;
        Json::Value table(Json::objectValue);
        EXPECT_FALSE(runner.InitLibDesc(table, name)) << name;
        EXPECT_EQ(Json::Value(Json::objectValue), table) << name;
        ASSERT_FALSE(log.Lines().empty()) << name;
        for (const auto& line : log.Lines()) {
            EXPECT_NE(std::string::npos, line.find("WebAPI name refused")) << line;
            EXPECT_EQ(std::string::npos, line.find('\n')) << line;
            EXPECT_LT(line.size(), 120u) << line;
        }
    }
    EXPECT_EQ(Json::Value(Json::objectValue), runner.Descriptions());
    // The same directory serves a well-formed name.
    EXPECT_EQ(0, Check(runner, Call("R.M", 1, "get")));
}

}  // namespace
