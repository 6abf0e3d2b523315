// The identity a handler runs with ("runAs", "grantable", "grantByUser",
// "grantByDefault") and its restoration, through the pipeline, for a user
// (APIRunner::Exec) and in compounds, the root guard and SetVelaInfo, on a
// real unprivileged account. Every case runs in a forked child so the
// test process keeps root. Needs root: skipped otherwise.
#include <gtest/gtest.h>

#include <functional>
#include <regex>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "dispatcher/PipeFixture.h"
#include "dispatcher/libs/ProcessIds.h"
#include "platform/IdentityTestUtil.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/user.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"
#include "webapi/APIUtils.h"
#include "webapi/JsonUtil.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::APIRunner;
using VELA::Test::InChild;

// Ids as parsed from a report: JSON integers.
Json::Value Triple(unsigned r, unsigned e, unsigned s)
{
    return J("[" + std::to_string(r) + ", " + std::to_string(e) + ", " + std::to_string(s) + "]");
}

bool HasGroup(const Json::Value& ids, unsigned gid)
{
    return VELA::JsonSearchArrayIndex(ids["groups"], Json::Value(static_cast<Json::Int>(gid))) >= 0;
}

// True when `log` ("<priority>|<line>" per line) holds a line of `priority`
// matching `pattern`.
bool Logged(const std::string& log, int priority, const std::string& pattern)
{
    return std::regex_search(log, std::regex(std::to_string(priority) + "\\|" + pattern));
}

void Collect(int priority, const char* line, void* arg)
{
    *static_cast<std::string*>(arg) += std::to_string(priority) + "|" + line + "\n";
}

const int kAuthInfo = LOG_AUTHPRIV | LOG_INFO;
const int kAuthErr = LOG_AUTHPRIV | LOG_ERR;

class Identity : public PipeFixture {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) {
            GTEST_SKIP() << "identity switches need root";
        }
        PipeFixture::SetUp();
        ASSERT_TRUE(account_.Create()) << "useradd/groupadd failed";
        created_ = true;
        // The account reads the descriptions in some cases.
        ASSERT_EQ(0, chmod(root_.Path().c_str(), 0755));
        Json::Value desc = Descriptions();
        desc["VELA.Pipe.Ids"] = J(R"({"lib": ")" + Lib("pipe_handlers") + R"(", "minVersion": 1,
            "maxVersion": 1, "runAs": "system", "authLevel": 0, "methods": {"1": [
                {"upload": {"runAs": ")" + account_.user + R"(", "allowUpload": true}},
                {"grantable": {"runAs": ")" + account_.user + R"(", "grantable": true}},
                {"dropped": {"runAs": ")" + account_.user + R"("}},
                {"byUser": {"grantByUser": true, "grantable": true}},
                {"byDefault": {"grantByDefault": true}},
                {"unknownUser": {"runAs": "vela-no-such-user-x", "grantable": true}}]}})");
        WriteJson("VELA.Pipe.lib", desc);
        rootIds_ = ProcessIds();
    }
    void TearDown() override
    {
        if (created_) {
            account_.Remove();
        }
        if (geteuid() == 0) {
            PipeFixture::TearDown();
        }
    }

    // Runs `call` (which answers into its argument) in a forked child after
    // `before`; reports the call's result, the answer, the child's pid and
    // USERNAME, its ids afterwards and the log lines.
    Json::Value ReportOfChild(const std::function<bool(Json::Value&)>& call,
                              const std::function<void()>& before = nullptr)
    {
        const std::string text = InChild([&] {
            std::string log;
            VELA::System::LogSetSink(Collect, &log);
            if (before) {
                before();
            }
            Json::Value report(Json::objectValue);
            const bool result = call(report["answer"]);
            report["result"] = result;
            report["after"] = ProcessIds();
            report["pid"] = static_cast<Json::Int>(getpid());
            report["USERNAME"] = getenv("USERNAME") != nullptr ? getenv("USERNAME") : "(unset)";
            VELA::System::LogSetSink(nullptr, nullptr);
            report["log"] = log;
            return VELA::JsonToString(report);
        });
        Json::Value report;
        EXPECT_TRUE(VELA::JsonParse(text, report)) << text;
        return report;
    }
    // The report of Run on `request`.
    Json::Value RunInChild(const Json::Value& request, const std::function<void()>& before = nullptr)
    {
        return ReportOfChild(
            [&](Json::Value& answer) {
                APIRunner runner;
                const bool result = runner.Run(request);
                answer = runner.GetResponse();
                return result;
            },
            before);
    }

    Json::Value IdsCall(const std::string& method, const Json::Value& session = Json::Value())
    {
        Json::Value request = Call("VELA.Pipe.Ids", 1, method);
        if (!session.isNull()) {
            request["session"] = session;
        }
        return request;
    }

    VELA::Test::TestAccount account_;
    bool created_ = false;
    Json::Value rootIds_;
};

TEST_F(Identity, NotGrantableStaysTheUser)
{
    const unsigned u = account_.uid, g = account_.gid;
    const Json::Value report = RunInChild(IdsCall("dropped"));
    EXPECT_EQ(Triple(u, u, u), report["answer"]["data"]["uid"]);
    EXPECT_EQ(Triple(u, u, u), report["after"]["uid"]);
    EXPECT_EQ(Triple(g, g, g), report["after"]["gid"]);

    // A process that already is the user and cannot regain root still runs
    // the handler.
    const Json::Value again = RunInChild(IdsCall("dropped"), [this] {
        ResetCredentialsByName(account_.user.c_str(), false);
    });
    EXPECT_EQ(Json::Value(true), again["result"]);
    EXPECT_EQ(Triple(u, u, u), again["answer"]["data"]["uid"]);
    EXPECT_TRUE(Logged(again["log"].asString(), kAuthErr, "ExecContext:\\d+ ERROR: setresuid\\(-1, 0, -1\\) \\[.+\\]\n"))
        << again["log"].asString();
}

// Refused switches end the call before the handler, with the preset 117.
TEST_F(Identity, RefusedSwitchSkipsTheHandlerSystemIsNoRoot)
{
    const struct {
        const char* method;
        const char* line;
    } cases[] = {
        {"byUser", "ExecContext:\\d+ grantByUser: failed to get login username\\.\n"},
        {"unknownUser", "ExecContext:\\d+ grantable failed\\. \\[.*\\]\n"},
    };
    for (const auto& c : cases) {
        const Json::Value report = RunInChild(IdsCall(c.method));
        EXPECT_EQ(Json::Value(false), report["result"]) << c.method;
        EXPECT_EQ(Json::Value(WEBAPI_ERR_NO_RESPONSE), report["answer"]["error"]["code"]) << c.method;
        EXPECT_FALSE(report["answer"].isMember("data")) << c.method;
        EXPECT_TRUE(Logged(report["log"].asString(), LOG_ERR, c.line)) << report["log"].asString();
        EXPECT_EQ(rootIds_, report["after"]) << c.method;
    }

    // A session's user "system" (an account of that name, or none) is an
    // account like any other for grantByUser: never the run-as superuser.
    const Json::Value report = RunInChild(IdsCall("byUser", J(R"({"username": "system"})")));
    const Json::Value& seen = report["answer"]["data"];
    EXPECT_NE(Triple(0, 0, 0), seen["uid"]) << report["answer"];
    if (!seen.isMember("uid")) {
        EXPECT_TRUE(Logged(report["log"].asString(), LOG_ERR, "ExecContext:\\d+ grantByUser failed\\. \\[.*\\]\n"))
            << report["log"].asString();
    }
    EXPECT_EQ(rootIds_, report["after"]);
}

// grantByDefault gives the handler full rights and puts the caller's ids
// back afterwards.
TEST_F(Identity, GrantByDefaultRunsAsRoot)
{
    const unsigned u = account_.uid, g = account_.gid;
    const Json::Value report = RunInChild(IdsCall("byDefault"), [&] {
        EXPECT_EQ(0, setresgid(0, g, 0));
        EXPECT_EQ(0, setresuid(0, u, 0));
    });
    EXPECT_EQ(Triple(0, 0, 0), report["answer"]["data"]["uid"]);
    EXPECT_EQ(Triple(0, 0, 0), report["answer"]["data"]["gid"]);
    EXPECT_EQ(Triple(0, u, 0), report["after"]["uid"]);
    EXPECT_EQ(Triple(0, g, 0), report["after"]["gid"]);
    const std::string log = report["log"].asString();
    EXPECT_TRUE(Logged(log, kAuthInfo, "ExecContext:\\d+ WARNING: setresgid\\(-1, 0, -1\\)\n")) << log;
    EXPECT_TRUE(Logged(log, kAuthInfo, "ExecContext:\\d+ WARNING: setresuid\\(-1, 0, -1\\)\n")) << log;
}

// An upload to "upload" (runs as the account) whose fields a front end
// merges into the request before the handler runs, one of them naming the
// method "byDefault" (runs as root): the call stays the one the checks saw,
// with its identity. (The same form through the CGI front end:
// tests/e2e/upload.sh.)
TEST_F(Identity, UploadFieldsCannotChangeTheCheckedMethod)
{
    const unsigned u = account_.uid;
    struct MergingRunner : APIRunner {
        bool HandleUpload(APIRequest* req, APIResponse*) override
        {
            req->InitParam(J(R"({"postParam": {"method": "byDefault"}})"), false);
            return true;
        }
    };
    const std::string seen = InChild([] {
        Json::Value request = Call("VELA.Pipe.Ids", 1, "upload");
        request["environ"]["CONTENT_TYPE"] = "multipart/form-data; boundary=x";
        MergingRunner runner;
        runner.Run(request);
        return VELA::JsonToString(runner.GetResponse()["data"]["uid"]);
    });
    EXPECT_EQ(VELA::JsonToString(Triple(u, u, u)), seen);
}

// APIRunner::Exec for the account: the handler runs with the identity of
// its method (by "runAs", or by the session's user) and for that user, in
// this process when the method is grantable or grantByDefault, in a child
// otherwise; a grantable switch comes back to root and says so; the caller
// keeps its ids and its USERNAME.
TEST_F(Identity, ExecForAUserLeavesTheCallerAsItWas)
{
    const unsigned u = account_.uid, g = account_.gid;
    const struct {
        const char* method;
        bool here;
        bool grantable;
        Json::Value uid, gid;
    } cases[] = {
        {"dropped", false, false, Triple(u, u, u), Triple(g, g, g)},
        {"grantable", true, true, Triple(u, u, 0), Triple(g, g, g)},
        {"byUser", true, true, Triple(u, u, 0), Triple(g, g, g)},
        {"byDefault", true, false, Triple(0, 0, 0), Triple(0, 0, 0)},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.method);
        const Json::Value report = ReportOfChild([&](Json::Value& answer) {
            setenv("USERNAME", "caller-u", 1);
            APIRunner().Exec(answer, "VELA.Pipe.Ids", 1, c.method, Json::Value(), account_.user.c_str());
            return true;
        });
        const Json::Value& seen = report["answer"]["data"];
        ASSERT_EQ(Json::Value(true), report["answer"]["success"]) << report["answer"];
        EXPECT_EQ(c.here, seen["pid"] == report["pid"]);
        EXPECT_EQ(c.uid, seen["uid"]);
        EXPECT_EQ(c.gid, seen["gid"]);
        EXPECT_EQ(c.uid[0].asUInt() == u, HasGroup(seen, account_.suppGid));
        EXPECT_EQ(Json::Value(account_.user), seen["USERNAME"]);
        EXPECT_EQ(Json::Value(account_.user), seen["user"]);
        EXPECT_EQ(rootIds_, report["after"]);
        EXPECT_EQ(Json::Value("caller-u"), report["USERNAME"]);
        EXPECT_EQ(c.grantable,
                  Logged(report["log"].asString(), kAuthInfo, "ExecContext:\\d+ WARNING: setresuid\\(-1, 0, -1\\)\n"))
            << report["log"].asString();
    }
}

// The calls of a compound: one in a child takes the identity of its
// method, one in this process (grantable) switches and comes back.
TEST_F(Identity, CompoundCallsTakeTheIdentityOfTheirMethod)
{
    const unsigned u = account_.uid;
    Json::Value request = Call("VELA.Entry.Request", 1, "request");
    request["getParam"]["compound"] = J(R"([{"api": "VELA.Pipe.Ids", "version": 1, "method": "dropped"},
                                           {"api": "VELA.Pipe.Ids", "version": 1, "method": "grantable"}])");
    const Json::Value report = RunInChild(request);
    const Json::Value& result = report["answer"]["data"]["result"];
    EXPECT_EQ(Triple(u, u, u), result[0]["data"]["uid"]) << report["answer"];
    EXPECT_NE(report["pid"], result[0]["data"]["pid"]);
    EXPECT_EQ(Triple(u, u, 0), result[1]["data"]["uid"]);
    EXPECT_EQ(rootIds_, report["after"]);
}

// The root guard as root changes nothing and logs nothing; from the user's
// effective ids with a saved uid 0 it gives root inside and the user again
// afterwards (SetVelaInfo writes); with no way back to root it skips the
// guarded statements and says so (SetVelaInfo refuses).
TEST_F(Identity, RootGuardAndSetVelaInfo)
{
    ASSERT_EQ(0, system(("mkdir -p '" + root_.Path() + "/etc'").c_str()));
    const unsigned u = account_.uid, g = account_.gid;
    const Json::Value report = ReportOfChild([&](Json::Value& seen) {
        // Whether the guard let the statements run, the ids inside and
        // afterwards, the lines logged and the guard's error line.
        const auto guarded = [&seen](const char* step) {
            Json::Value& s = seen[step];
            VELA::Test::LogCapture log;
            {
                VELA::RunAsRootGuard guard(__FILE__, __LINE__, "IF_RUN_AS");
                s["ok"] = guard.Ok();
                s["inside"] = ProcessIds();
            }
            s["after"] = ProcessIds();
            s["lines"] = static_cast<Json::UInt>(log.Lines().size());
            s["error"] = log.PriorityOf({"ExecContextTest:", " ERROR: IF_RUN_AS(0, 0)"});
        };
        guarded("root");
        setresgid(g, g, g);
        setresuid(u, u, 0);
        guarded("user");
        seen["user"]["written"] = VELA::APIUtils::SetVelaInfo("pipe_test_key", "written");
        seen["user"]["afterWrite"] = ProcessIds();
        setresuid(u, u, u);
        guarded("stuck");
        seen["stuck"]["written"] = VELA::APIUtils::SetVelaInfo("pipe_test_key", "refused");
        return true;
    });
    const Json::Value& root = report["answer"]["root"];
    const Json::Value& user = report["answer"]["user"];
    const Json::Value& stuck = report["answer"]["stuck"];
    EXPECT_EQ(Json::Value(true), root["ok"]) << report;
    EXPECT_EQ(rootIds_, root["inside"]);
    EXPECT_EQ(rootIds_, root["after"]);
    EXPECT_EQ(Json::Value(0), root["lines"]);
    EXPECT_EQ(Json::Value(true), user["ok"]);
    EXPECT_EQ(Json::Value(0), user["inside"]["uid"][1]);
    EXPECT_EQ(Json::Value(0), user["inside"]["gid"][1]);
    EXPECT_EQ(u, user["after"]["uid"][1].asUInt());
    EXPECT_EQ(g, user["after"]["gid"][1].asUInt());
    EXPECT_EQ(Json::Value(true), user["written"]);
    EXPECT_EQ(u, user["afterWrite"]["uid"][1].asUInt());
    EXPECT_EQ(Json::Value(false), stuck["ok"]);
    EXPECT_EQ(Json::Value(kAuthErr), stuck["error"]);
    EXPECT_EQ(Json::Value(false), stuck["written"]);
    EXPECT_EQ(1, VLIBCFileCheckKeyValue((root_.Path() + "/etc/velainfo.conf").c_str(), "pipe_test_key", "written", 0));
}

}  // namespace
