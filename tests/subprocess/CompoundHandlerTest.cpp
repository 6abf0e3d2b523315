// Compound requests run through a runner over the web-API directory of
// PipeFixture, whose VELA.Pipe.Sub handlers
// (tests/dispatcher/libs/pipe_handlers.cpp) report the process and the
// identity they ran with. (The identity of the calls, with real accounts:
// ExecContextTest.cpp.)
#include <gtest/gtest.h>

#include <initializer_list>
#include <memory>
#include <string>
#include <unistd.h>

#include "dispatcher/PipeFixture.h"
#include "support/TestSupport.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

// A runner whose permission check refuses the calls that ask for it with
// "refuse", as the session check refuses a method the caller's class may
// not call.
class GuardedRunner : public VELA::APIRunner {
public:
    bool NeedPermission(APIRequest*) override { return true; }
    bool CheckPermission(APIRequest* req, APIResponse* resp) override
    {
        if (req->GetParam("refuse", false) == Json::Value(true)) {
            resp->SetError(105);
            return false;
        }
        return true;
    }
    bool SkipPermission(APIRequest*) override { return false; }
};

// One call of VELA.Pipe.Sub; the handlers answer "n" back among their
// parameters.
Json::Value SubCall(const std::string& method, int n, Json::Value params = Json::Value(Json::objectValue))
{
    params["api"] = "VELA.Pipe.Sub";
    params["version"] = 1;
    params["method"] = method;
    params["n"] = n;
    return params;
}

Json::Value List(std::initializer_list<Json::Value> items)
{
    Json::Value list(Json::arrayValue);
    for (const Json::Value& item : items) {
        list.append(item);
    }
    return list;
}

// The call of the entry API that runs `calls` (a list, or its JSON text).
Json::Value Compound(const Json::Value& calls)
{
    Json::Value params(Json::objectValue);
    params["api"] = "VELA.Entry.Request";
    params["version"] = 1;
    params["method"] = "request";
    params["compound"] = calls;
    return params;
}

class CompoundTest : public PipeFixture {
protected:
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

    std::unique_ptr<GuardedRunner> runner_;
    Json::Value answer_;
};

TEST_F(CompoundTest, SequentialCallsRunInProcessOnlyWhenGrantable)
{
    // The fourth call is a download; the fifth names no call.
    const Json::Value data = Run(Compound(List({SubCall("report", 0), SubCall("reportGrantable", 1),
        SubCall("fail", 2), SubCall("noisy", 3), J("{}"), SubCall("report", 5, J(R"({"pad": 262144})")),
        SubCall("report", 6, J(R"({"refuse": true})"))})));
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
        EXPECT_EQ(i, r[i]["data"]["params"]["n"].asInt());
        EXPECT_EQ("VELA.Pipe.Sub", r[i]["api"].asString());
        EXPECT_EQ(1, r[i]["version"].asInt());
    }
    EXPECT_EQ(256u * 1024u, r[5]["data"]["pad"].asString().size());
    EXPECT_EQ(1001, r[2]["error"]["code"].asInt());
    EXPECT_EQ(113, r[3]["error"]["code"].asInt());
    EXPECT_EQ(J(R"({"success": false, "error": {"code": 101}})"), r[4]);  // names no API: none added
    EXPECT_EQ(105, r[6]["error"]["code"].asInt());  // the permission hook is asked for each call
}

TEST_F(CompoundTest, StopWhenErrorSkipsTheRestOnlyInSequence)
{
    const std::string mark = root_.Path() + "/ran";
    const Json::Value calls =
        List({SubCall("report", 0), SubCall("fail", 1), SubCall("report", 2, J(R"({"marker": ")" + mark + R"("})"))});
    // From a form: the list and the flag arrive as text.
    Json::Value params = Compound(VELA::JsonToString(calls));
    params["stop_when_error"] = "true";
    Json::Value data = Run(params);
    EXPECT_TRUE(data["has_fail"].asBool());
    EXPECT_TRUE(data["result"][0]["success"].asBool());
    EXPECT_EQ(112, data["result"][2]["error"]["code"].asInt()) << data;
    EXPECT_NE(0, access(mark.c_str(), F_OK));

    params["mode"] = "parallel";
    data = Run(params);
    EXPECT_TRUE(data["result"][2]["success"].asBool()) << data;
    EXPECT_EQ(0, access(mark.c_str(), F_OK));
}

TEST_F(CompoundTest, ParallelAnswersKeepTheirPlaceWhateverTheChildrenDo)
{
    const Json::Value calls = List({SubCall("sleep", 0, J(R"({"ms": 100})")), SubCall("report", 1),
        SubCall("crash", 2), SubCall("report", 3, J(R"({"pad": 262144})")), SubCall("fail", 4),
        SubCall("reportGrantable", 5)});
    for (const char* children : {"1", "2", "16"}) {
        SCOPED_TRACE(children);
        Conf("webapi.conf", std::string("compound_max_children=") + children + "\n");
        VELA::Test::LogCapture log;
        Json::Value params = Compound(calls);
        params["mode"] = "parallel";
        const Json::Value data = Run(params);
        const Json::Value& r = data["result"];
        ASSERT_EQ(6u, r.size()) << data;
        EXPECT_TRUE(data["has_fail"].asBool());
        for (int i : {0, 1, 3, 5}) {
            EXPECT_TRUE(r[i]["success"].asBool()) << i;
            EXPECT_EQ(i, r[i]["data"]["params"]["n"].asInt());
            EXPECT_NE(static_cast<int>(getpid()), r[i]["data"]["pid"].asInt());  // every call forks
        }
        EXPECT_TRUE(r[2].isNull());  // died without answering
        EXPECT_TRUE(log.Contains("read compound json failed"));
        EXPECT_EQ(1001, r[4]["error"]["code"].asInt());
    }
}

TEST_F(CompoundTest, ChildPastItsTimeIsKilledAndTheOthersStillAnswer)
{
    Conf("webapi.conf", "compound_child_seconds=1\n");
    const std::string pidFile = root_.Path() + "/sleeper";
    VELA::Test::LogCapture log;
    const Json::Value sleeper = SubCall("sleep", 0, J(R"({"ms": 10000, "pidfile": ")" + pidFile + R"("})"));
    const Json::Value data = Run(Compound(List({sleeper, SubCall("report", 1)})));
    EXPECT_TRUE(data["has_fail"].asBool());
    EXPECT_TRUE(data["result"][0].isNull()) << data;
    EXPECT_TRUE(data["result"][1]["success"].asBool());
    EXPECT_TRUE(log.Contains("call 0 gave no answer in 1 s: killed"));
    const pid_t pid = static_cast<pid_t>(atoi(VELA::Test::ReadText(pidFile).c_str()));
    ASSERT_GT(pid, 0);
    // Gone, or a zombie of whoever adopted it: killed either way. The kill
    // takes effect asynchronously; a sleeper that was not killed would
    // still be asleep ten seconds from now.
    std::string stat;
    for (int i = 0; i < 200; ++i) {
        stat = VELA::Test::ReadText("/proc/" + std::to_string(pid) + "/stat");
        if (stat.empty() || stat.find(") Z ") != std::string::npos) {
            break;
        }
        usleep(25000);
    }
    EXPECT_TRUE(stat.empty() || stat.find(") Z ") != std::string::npos) << stat;
}

TEST_F(CompoundTest, BoundsRefuseTheWholeCompoundBeforeAnythingRuns)
{
    Conf("webapi.conf", "compound_max_calls=3\ncompound_max_depth=2\n");
    const std::string mark = root_.Path() + "/ran";
    const Json::Value marked = SubCall("report", 0, J(R"({"marker": ")" + mark + R"("})"));
    const Json::Value four = List({marked, marked, marked, marked});
    const Json::Value nested2 = List({Compound(List({marked}))});  // two levels: allowed
    const Json::Value nested3 = List({Compound(nested2)});         // three: refused
    const Json::Value nestedTooMany = List({Compound(List({marked})), Compound(List({marked}))});  // 2 + 2 calls

    for (const Json::Value* calls : {&four, &nested3, &nestedTooMany}) {
        Run(Compound(*calls));
        EXPECT_EQ(110, answer_["error"]["code"].asInt()) << answer_;
        EXPECT_TRUE(answer_["error"]["errors"].isString());
        EXPECT_NE(0, access(mark.c_str(), F_OK));
    }
    const Json::Value data = Run(Compound(nested2));
    EXPECT_TRUE(data["result"][0]["data"]["result"][0]["success"].asBool()) << data;
    EXPECT_EQ(0, access(mark.c_str(), F_OK));
}

// A call run in this process (grantByDefault) hands its restart, server
// error and callbacks to the compound's reply.
TEST_F(CompoundTest, CallsPassOnRestartServerErrorAndCallbacks)
{
    const Json::Value call = SubCall("callback", 0, J(R"({"restart": "1", "error": "disk busy"})"));
    const Json::Value data = Run(Compound(List({call})));
    EXPECT_FALSE(data["has_fail"].asBool()) << data;
    EXPECT_TRUE(answer_["httpd_restart"].asBool());
    EXPECT_EQ("disk busy", runner_->GetResponseObject()->GetServerError());
    EXPECT_EQ(1u, runner_->GetResponseObject()->GetCallbackFuncs().size());

    EXPECT_EQ(J(R"({"has_fail": false, "result": []})"), Run(Compound(List({}))));
}

}  // namespace
