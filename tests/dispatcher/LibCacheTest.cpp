// Handler libraries: the cache by path, the two tables of a loaded library
// and the messages of each failure.
#include <gtest/gtest.h>

#include <dlfcn.h>
#include <memory>
#include <string>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/PipeFixture.h"
#include "support/TestSupport.h"
#include "vela/log.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::APIRequest;
using VELA::APIRunner;

// Shows the library members and the size of the runner's cache to the tests.
class CacheRunner : public APIRunner {
public:
    using APIRunner::CloseLib;
    using APIRunner::GetCheckTableFunc;
    using APIRunner::GetTableFunc;
    using APIRunner::OpenLib;
    size_t Cached() const { return d_->libs.Size(); }
};

class LibCache : public PipeFixture {
protected:
    // A request whose description names `lib`.
    static APIRequest* WithLib(const Json::Value& lib)
    {
        auto* req = new APIRequest();
        Json::Value info(Json::objectValue);
        info["lib"] = lib;
        req->InitAPIInfo(info);
        return req;
    }

    void* Cache(APIRunner& runner, const Json::Value& lib)
    {
        std::unique_ptr<APIRequest> req(WithLib(lib));
        void* handle = &handle;  // must be overwritten
        EXPECT_TRUE(runner.CacheLib(req.get(), &handle)) << lib;
        return handle;
    }

    static bool Loaded(const std::string& path)
    {
        void* h = dlopen(path.c_str(), RTLD_LAZY | RTLD_NOLOAD);
        if (h) {
            dlclose(h);
        }
        return h != nullptr;
    }
};

// One path, one open; every spelling of a path is an entry of its own, and
// CloseLib gives back every open it made.
TEST_F(LibCache, OneOpenPerPath)
{
    const std::string path = Lib("pipe_handlers");
    const std::string dir = path.substr(0, path.rfind('/'));
    const std::string alias = dir + "/./libpipe_handlers.so";
    ASSERT_FALSE(Loaded(path));
    {
        CacheRunner runner;
        void* first = Cache(runner, path);
        ASSERT_NE(nullptr, first);
        EXPECT_EQ(first, Cache(runner, path));
        EXPECT_EQ(1u, runner.Cached());
        // The loader knows the file under its other name and hands back the
        // same object, counted twice.
        EXPECT_EQ(first, Cache(runner, alias));
        EXPECT_EQ(2u, runner.Cached());
        runner.CloseLib();
        EXPECT_TRUE(runner.Cached() == 0);
        EXPECT_FALSE(Loaded(path));

        Cache(runner, path);
        Cache(runner, path);
    }
    EXPECT_FALSE(Loaded(path));  // the destructor closed it, once

    APIRunner runner;
    VELA::Test::LogCapture log;
    const Json::Value bad[] = {Json::Value(""), Json::Value(7), Json::Value()};
    for (const auto& lib : bad) {
        std::unique_ptr<APIRequest> req(WithLib(lib));
        void* handle = nullptr;
        EXPECT_FALSE(runner.CacheLib(req.get(), &handle)) << lib;
    }
    EXPECT_EQ(3u, log.Lines().size());
    EXPECT_TRUE(log.Contains("library path empty"));

    const std::string missing = dir + "/libreg_missing.so";
    std::unique_ptr<APIRequest> req(WithLib(missing));
    void* handle = &handle;
    EXPECT_FALSE(runner.CacheLib(req.get(), &handle));
    EXPECT_EQ(nullptr, handle);
    EXPECT_TRUE(log.Contains("cannot open library: " + missing + ". error = " + missing));
}

TEST_F(LibCache, TablesOfALoadedLibrary)
{
    CacheRunner runner;
    VELA::Test::LogCapture log;
    _tag_API_TABLE* table = nullptr;
    _tag_API_CHECK_TABLE* check = nullptr;
    _tag_API_CHECK_TABLE untouched{};

    // No check table: a normal library; the output is left alone.
    void* tables = Cache(runner, Lib("pipe_handlers"));
    ASSERT_TRUE(runner.GetTableFunc(tables, &table));
    EXPECT_STREQ("VELA.Pipe.Test", table[0].api);
    EXPECT_STREQ("silent", table[0].method);
    EXPECT_STREQ("echo", table[1].method);
    check = &untouched;
    EXPECT_TRUE(runner.GetCheckTableFunc(tables, &check));
    EXPECT_EQ(&untouched, check);

    // A null check table fails its fetch, but OpenLib goes on without it.
    void* nullCheck = Cache(runner, Lib("reg_nullcheck"));
    EXPECT_FALSE(runner.GetCheckTableFunc(nullCheck, &check));
    EXPECT_EQ(LOG_ERR, log.PriorityOf({"cannot get api check table"}));
    std::unique_ptr<APIRequest> req(WithLib(Lib("reg_nullcheck")));
    table = nullptr;
    check = nullptr;
    EXPECT_TRUE(runner.OpenLib(req.get(), &table, &check));
    EXPECT_STREQ("Reg.Cache.NullCheck", table[0].api);
    EXPECT_EQ(nullptr, check);

    // No GetAPITable: a debug line, then OpenLib's own; the check table was
    // fetched first.
    req.reset(WithLib(Lib("reg_notable")));
    table = nullptr;
    EXPECT_FALSE(runner.OpenLib(req.get(), &table, &check));
    EXPECT_EQ(nullptr, table);
    EXPECT_NE(nullptr, check);
    EXPECT_EQ(LOG_DEBUG, log.PriorityOf({"cannot load table: "}));
    EXPECT_EQ(LOG_ERR, log.PriorityOf({"Get API Table Fail"}));

    // GetAPITable answering null.
    void* nullTable = Cache(runner, Lib("pipe_nulltable"));
    EXPECT_FALSE(runner.GetTableFunc(nullTable, &table));
    EXPECT_EQ(LOG_ERR, log.PriorityOf({"cannot get api table"}));

    EXPECT_FALSE(runner.GetTableFunc(nullptr, &table));
    EXPECT_FALSE(runner.GetTableFunc(tables, nullptr));
    EXPECT_FALSE(runner.GetCheckTableFunc(nullptr, &check));
    EXPECT_FALSE(runner.OpenLib(nullptr, &table, &check));
    EXPECT_FALSE(runner.OpenLib(req.get(), nullptr, &check));
    EXPECT_EQ(LOG_ERR, log.PriorityOf({"Bad parameters"}));
}

// Through the whole pipeline: two APIs share the library of one path, and a
// library whose check table is null still serves its calls.
TEST_F(LibCache, CallsThroughTheRunner)
{
    WriteJson("Reg.Cache.lib", J(R"({"Reg.Cache.NullCheck": {"lib": ")" + Lib("reg_nullcheck") + R"(",
        "minVersion": 1, "maxVersion": 1, "runAs": ")" + RunAs() + R"(", "methods": {"1": ["get"]}}})"));
    const std::string echoed = R"(", "cwd": ")" + webapiDir_ + R"(", "user": ""})";
    const struct {
        const char* api;
        const char* method;
        std::string data;
    } calls[] = {
        {"VELA.Pipe.Test", "echo", R"({"api": "VELA.Pipe.Test", "method": "echo)" + echoed},
        {"VELA.Pipe.Uncounted", "get", R"({"api": "VELA.Pipe.Uncounted", "method": "get)" + echoed},
        {"Reg.Cache.NullCheck", "get", R"("unchecked")"},
    };
    CacheRunner runner;
    for (const auto& c : calls) {
        APIRequest req(Call(c.api, 1, c.method));
        VELA::APIResponse resp(&req);
        EXPECT_TRUE(runner.Process(&req, &resp)) << c.api;
        EXPECT_EQ(J(c.data), resp.GetBody()["data"]) << c.api;
    }
    EXPECT_EQ(2u, runner.Cached());
}

}  // namespace
