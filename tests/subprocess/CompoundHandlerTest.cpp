// Compound requests run through a runner over a staged web-API directory
// whose handlers (tests/dispatcher/libs/compound_calls.cpp) report the
// process and the identity they ran with.
#include <gtest/gtest.h>

#include <climits>
#include <csignal>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <pwd.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/StateRootTest.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/webapiutil.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

// A runner whose permission check refuses the method "adminonly", as the
// session check refuses a method the caller's class may not call.
class GuardedRunner : public VELA::APIRunner {
public:
    bool NeedPermission(APIRequest*) override { return true; }
    bool CheckPermission(APIRequest* req, APIResponse* resp) override
    {
        if (req->GetAPIMethod() == "adminonly") {
            resp->SetError(105);
            return false;
        }
        return true;
    }
    bool SkipPermission(APIRequest*) override { return false; }
};

std::string Lib()
{
    const char* dir = getenv("VELA_TEST_BINARY_DIR");
    return std::string(dir ? dir : ".") + "/tests/dispatcher/libs/libcompound_calls.so";
}

std::string Self()
{
    const struct passwd* pw = getpwuid(geteuid());
    return pw ? pw->pw_name : "system";
}

Json::Value Call(const std::string& method, int n, Json::Value params = Json::Value(Json::objectValue))
{
    params["api"] = "VELA.Comp";
    params["version"] = 1;
    params["method"] = method;
    params["n"] = n;
    return params;
}

Json::Value Compound(const Json::Value& calls)
{
    Json::Value params(Json::objectValue);
    params["api"] = "VELA.Entry.Request";
    params["version"] = 1;
    params["method"] = "request";
    params["compound"] = calls;
    return params;
}

bool Exists(const std::string& path)
{
    struct stat st;
    return stat(path.c_str(), &st) == 0;
}

class CompoundTest : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        char buf[PATH_MAX];
        ASSERT_NE(nullptr, getcwd(buf, sizeof(buf)));
        oldCwd_ = buf;
        const std::string dir = root_.Path() + "/usr/vela/velaman/webapi";
        ASSERT_EQ(0, system(("mkdir -p '" + dir + "' '" + root_.Path() + "/etc/vela'").c_str()));
        ASSERT_EQ(0, chdir(dir.c_str()));
        Write("lib.def", J(R"({"authLevel": 1, "allowUser": ["admin.local"], "priority": 0, "methods": {}})"));
        Write("VELA.Entry.lib", J(R"({"VELA.Entry.Request": {"lib": "none.so", "minVersion": 1,
            "maxVersion": 1, "methods": {"1": ["request"]}}})"));
        Write("VELA.Comp.lib", J(R"({"VELA.Comp": {"lib": ")" + Lib() + R"(", "minVersion": 1, "maxVersion": 1,
            "runAs": ")" + Self() + R"(", "methods": {"1": ["echo", "fail", "crash", "sleep", "big", "adminonly",
              {"here": {"grantable": true}}, {"later": {"grantByDefault": true}},
              {"restart": {"grantable": true}}, {"asNobody": {"runAs": "nobody"}},
              {"download": {"allowDownload": true}}]}}})"));
    }
    void TearDown() override
    {
        EXPECT_EQ(0, chdir(oldCwd_.c_str()));
        StateRootTest::TearDown();
    }

    void Write(const std::string& name, const Json::Value& value)
    {
        ASSERT_TRUE(VELA::WebAPIUtil::WriteJsonFileAtomic(name, value, 0644)) << name;
    }
    void Configure(const std::string& lines)
    {
        std::ofstream(root_.Path() + "/etc/vela/webapi.conf") << lines;
    }

    // Runs the compound through a fresh runner; the answer's "data".
    Json::Value Run(const Json::Value& params)
    {
        Json::Value request(Json::objectValue);
        request["postParam"] = params;
        runner_.reset(new GuardedRunner());
        runner_->Run(request);
        answer_ = runner_->GetResponse();
        return answer_["data"];
    }

    std::string oldCwd_;
    std::unique_ptr<GuardedRunner> runner_;
    Json::Value answer_;
};

TEST_F(CompoundTest, SequentialCallsRunInProcessOnlyWhenGrantable)
{
    Json::Value calls(Json::arrayValue);
    calls.append(Call("echo", 0));
    calls.append(Call("here", 1));
    calls.append(Call("fail", 2));
    calls.append(Call("download", 3));
    calls.append(J("{}"));
    calls.append(Call("big", 5));
    calls.append(Call("adminonly", 6));
    const Json::Value data = Run(Compound(calls));
    ASSERT_TRUE(answer_["success"].asBool()) << answer_;
    EXPECT_TRUE(data["has_fail"].asBool());
    const Json::Value& r = data["result"];
    ASSERT_EQ(7u, r.size()) << data;
    const int self = static_cast<int>(getpid());
    EXPECT_NE(self, r[0]["data"]["pid"].asInt());  // not grantable: a child
    EXPECT_EQ(self, r[1]["data"]["pid"].asInt());  // grantable: this process
    for (int i : {0, 1, 5}) {
        SCOPED_TRACE(i);
        EXPECT_TRUE(r[i]["success"].asBool());
        EXPECT_EQ(i, r[i]["data"]["n"].asInt());
        EXPECT_EQ("VELA.Comp", r[i]["api"].asString());
        EXPECT_EQ(1, r[i]["version"].asInt());
    }
    EXPECT_EQ(256u * 1024u, r[5]["data"]["blob"].asString().size());
    EXPECT_EQ(1001, r[2]["error"]["code"].asInt());
    EXPECT_EQ(113, r[3]["error"]["code"].asInt());
    EXPECT_EQ(J(R"({"success": false, "error": {"code": 101}})"), r[4]);  // names no API: none added
    EXPECT_EQ(105, r[6]["error"]["code"].asInt());  // the permission hook is asked for each call
}

TEST_F(CompoundTest, StopWhenErrorSkipsTheRestOnlyInSequence)
{
    const std::string mark = root_.Path() + "/ran";
    Json::Value calls(Json::arrayValue);
    calls.append(Call("echo", 0));
    calls.append(Call("fail", 1));
    calls.append(Call("echo", 2, J(R"({"mark": ")" + mark + R"("})")));
    // From a form: the list and the flag arrive as text.
    Json::Value params = Compound(VELA::JsonToString(calls));
    params["stop_when_error"] = "true";
    Json::Value data = Run(params);
    EXPECT_TRUE(data["has_fail"].asBool());
    EXPECT_TRUE(data["result"][0]["success"].asBool());
    EXPECT_EQ(112, data["result"][2]["error"]["code"].asInt()) << data;
    EXPECT_FALSE(Exists(mark));

    params["mode"] = "parallel";
    data = Run(params);
    EXPECT_TRUE(data["result"][2]["success"].asBool()) << data;
    EXPECT_TRUE(Exists(mark));
}

TEST_F(CompoundTest, ParallelAnswersKeepTheirPlaceWhateverTheChildrenDo)
{
    Json::Value calls(Json::arrayValue);
    calls.append(Call("sleep", 0, J(R"({"ms": 100})")));
    calls.append(Call("echo", 1));
    calls.append(Call("crash", 2));
    calls.append(Call("big", 3));
    calls.append(Call("fail", 4));
    calls.append(Call("here", 5));
    for (const char* children : {"1", "2", "16"}) {
        SCOPED_TRACE(children);
        Configure(std::string("compound_max_children=") + children + "\n");
        VELA::Test::LogCapture log;
        Json::Value params = Compound(calls);
        params["mode"] = "parallel";
        const Json::Value data = Run(params);
        const Json::Value& r = data["result"];
        ASSERT_EQ(6u, r.size()) << data;
        EXPECT_TRUE(data["has_fail"].asBool());
        for (int i : {0, 1, 3, 5}) {
            EXPECT_TRUE(r[i]["success"].asBool()) << i;
            EXPECT_EQ(i, r[i]["data"]["n"].asInt());
            EXPECT_NE(static_cast<int>(getpid()), r[i]["data"]["pid"].asInt());  // every call forks
        }
        EXPECT_TRUE(r[2].isNull());  // died without answering
        EXPECT_TRUE(log.Contains("read compound json failed"));
        EXPECT_EQ(1001, r[4]["error"]["code"].asInt());
    }
}

TEST_F(CompoundTest, ChildPastItsTimeIsKilledAndTheOthersStillAnswer)
{
    Configure("compound_child_seconds=1\n");
    const std::string pidFile = root_.Path() + "/sleeper";
    Json::Value calls(Json::arrayValue);
    calls.append(Call("sleep", 0, J(R"({"ms": 10000, "mark": ")" + pidFile + R"("})")));
    calls.append(Call("echo", 1));
    VELA::Test::LogCapture log;
    const Json::Value data = Run(Compound(calls));
    EXPECT_TRUE(data["has_fail"].asBool());
    EXPECT_TRUE(data["result"][0].isNull()) << data;
    EXPECT_TRUE(data["result"][1]["success"].asBool());
    EXPECT_TRUE(log.Contains("call 0 gave no answer in 1 s: killed"));
    const pid_t sleeper = static_cast<pid_t>(atoi(VELA::Test::ReadText(pidFile).c_str()));
    ASSERT_GT(sleeper, 0);
    // Gone, or a zombie of whoever adopted it: killed either way. The kill
    // takes effect asynchronously; a sleeper that was not killed would
    // still be asleep ten seconds from now.
    std::string stat;
    for (int i = 0; i < 200; ++i) {
        stat = VELA::Test::ReadText("/proc/" + std::to_string(sleeper) + "/stat");
        if (stat.empty() || stat.find(") Z ") != std::string::npos) {
            break;
        }
        usleep(25000);
    }
    EXPECT_TRUE(stat.empty() || stat.find(") Z ") != std::string::npos) << stat;
}

TEST_F(CompoundTest, BoundsRefuseTheWholeCompoundBeforeAnythingRuns)
{
    Configure("compound_max_calls=3\ncompound_max_depth=2\n");
    const std::string mark = root_.Path() + "/ran";
    const Json::Value marked = Call("echo", 0, J(R"({"mark": ")" + mark + R"("})"));
    Json::Value four(Json::arrayValue);
    for (int i = 0; i < 4; ++i) {
        four.append(marked);
    }
    Json::Value one(Json::arrayValue);
    one.append(marked);
    Json::Value nested2(Json::arrayValue);
    nested2.append(Compound(one));  // two levels: allowed
    Json::Value nested3(Json::arrayValue);
    nested3.append(Compound(nested2));  // three: refused
    Json::Value nestedTooMany(Json::arrayValue);
    nestedTooMany.append(Compound(one));
    nestedTooMany.append(Compound(one));  // 2 + 2 calls

    for (const Json::Value* calls : {&four, &nested3, &nestedTooMany}) {
        Run(Compound(*calls));
        EXPECT_EQ(110, answer_["error"]["code"].asInt()) << answer_;
        EXPECT_TRUE(answer_["error"]["errors"].isString());
        EXPECT_FALSE(Exists(mark));
    }
    const Json::Value data = Run(Compound(nested2));
    EXPECT_TRUE(data["result"][0]["data"]["result"][0]["success"].asBool()) << data;
    EXPECT_TRUE(Exists(mark));
}

TEST_F(CompoundTest, CallsPassOnRestartServerErrorAndCallbacks)
{
    Json::Value calls(Json::arrayValue);
    calls.append(Call("restart", 0));
    calls.append(Call("later", 1));
    const Json::Value data = Run(Compound(calls));
    EXPECT_FALSE(data["has_fail"].asBool()) << data;
    EXPECT_TRUE(answer_["httpd_restart"].asBool());
    EXPECT_EQ("disk busy", runner_->GetResponseObject()->GetServerError());
    EXPECT_EQ(1u, runner_->GetResponseObject()->GetCallbackFuncs().size());

    EXPECT_EQ(J(R"({"has_fail": false, "result": []})"), Run(Compound(Json::Value(Json::arrayValue))));
}

TEST_F(CompoundTest, ChildTakesTheIdentityOfItsMethod)
{
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root to switch identity";
    }
    const struct passwd* nobody = getpwnam("nobody");
    ASSERT_NE(nullptr, nobody);
    Json::Value calls(Json::arrayValue);
    calls.append(Call("asNobody", 0));
    calls.append(Call("here", 1));
    const Json::Value data = Run(Compound(calls));
    EXPECT_EQ(nobody->pw_uid, data["result"][0]["data"]["euid"].asUInt()) << data;
    EXPECT_EQ(0u, data["result"][1]["data"]["euid"].asUInt());
    EXPECT_EQ(0u, geteuid());
}

}  // namespace
