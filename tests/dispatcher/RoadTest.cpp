// The road of a call as a whole: every refusal the dispatcher makes is one
// log line stamped with the file that decided it; when several faults apply
// the earlier stage's refusal wins (the permission hook before the library:
// APIRunnerTest.cpp); a method marked "audit" leaves one line in the audit
// trail at the end of the road, others none; a call that skips the description check
// (ProcessLib by itself) runs as its request's description says; the hooks
// read the attributes of the call on the road.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "dispatcher/PipeFixture.h"
#include "support/TestSupport.h"
#include "vela/audit.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::APIRunner;

class Road : public PipeFixture {
protected:
    struct Outcome {
        int code = -1;
        std::vector<std::string> lines;
    };

    // Runs `request` through Run of a fresh runner (`process`: through
    // Process, as a sub-request would), capturing the log. Run's refusal
    // answers success false and no restart.
    static Outcome RunCall(const Json::Value& request, bool process = false)
    {
        Outcome out;
        APIRunner runner;
        VELA::Test::LogCapture log;
        if (process) {
            APIRequest req(request);
            APIResponse resp(&req);
            EXPECT_FALSE(runner.Process(&req, &resp)) << request;
            out.code = resp.GetError();
        } else {
            EXPECT_FALSE(runner.Run(request)) << request;
            out.code = runner.GetResponseObject()->GetError();
            EXPECT_EQ(Json::Value(false), runner.GetResponse()["success"]) << request;
            EXPECT_EQ(Json::Value(false), runner.GetResponse()["httpd_restart"]) << request;
        }
        out.lines = log.Lines();
        return out;
    }

    static Json::Value WithParam(Json::Value request, const char* name, const Json::Value& value)
    {
        request["getParam"][name] = value;
        return request;
    }
};

TEST_F(Road, EveryRefusalLogsOnceWhereItIsDecided)
{
    WriteJson("VELA.Broken.lib", Json::Value(Json::arrayValue));
    Json::Value upload = Call("VELA.Pipe.Test", 1, "echo");
    upload["environ"]["CONTENT_TYPE"] = "multipart/form-data; boundary=x";
    Json::Value noName(Json::objectValue);
    noName["getParam"]["version"] = 1;
    noName["getParam"]["method"] = "echo";
    const Json::Value relay = WithParam(Call("VELA.Pipe.Test", 1, "echo"), "relay_ds", "other");
    const Json::Value relayUnknown = WithParam(Call("VELA.Nope", 1, "get"), "relay_ds", "other");

    const struct {
        const char* what;
        Json::Value request;
        bool process;
        int code;
        const char* source;  // the file that refuses (null: not looked at)
        const char* says;
    } cases[] = {
        {"null request", Json::Value(), false, WEBAPI_ERR_BAD_REQUEST, "APIRunner", "no request JSON"},
        {"empty request", Json::Value(Json::objectValue), false, WEBAPI_ERR_BAD_REQUEST, "APIRunner", "empty"},
        {"no API name", noName, false, WEBAPI_ERR_BAD_REQUEST, "ProcessName", "no API name"},
        {"no API name (sub-request)", noName, true, WEBAPI_ERR_BAD_REQUEST, "Registry", "no API name"},
        {"version 0", Call("VELA.Pipe.Test", 0, "echo"), false, WEBAPI_ERR_BAD_REQUEST, "Registry", "VELA.Pipe.Test"},
        {"no method", Call("VELA.Pipe.Test", 1, ""), false, WEBAPI_ERR_BAD_REQUEST, "Registry", "VELA.Pipe.Test"},
        {"relay_ds given to Run", relay, false, WEBAPI_ERR_BAD_REQUEST, "APIRunner", "relayed"},
        {"name refused", Call("../VELA.Pipe.Test", 1, "echo"), false, WEBAPI_ERR_NO_SUCH_API, "Registry",
         "name refused"},
        {"no description file", Call("VELA.Nothing.Here", 1, "get"), false, WEBAPI_ERR_NO_SUCH_API, "Registry",
         "VELA.Nothing.Here is not valid"},
        {"file not an object", Call("VELA.Broken", 1, "get"), false, WEBAPI_ERR_NO_SUCH_API, "Registry",
         "file VELA.Broken.lib is not valid"},
        {"file without the API", Call("VELA.Pipe.Other", 1, "get"), false, WEBAPI_ERR_NO_SUCH_API, "Registry",
         "VELA.Pipe.Other is not described"},
        {"version out of range", Call("VELA.Pipe.Test", 3, "echo"), false, WEBAPI_ERR_NOT_SUPPORTED_VERSION,
         "Registry", "no version 3"},
        {"method not listed", Call("VELA.Pipe.Test", 1, "nope"), false, WEBAPI_ERR_NO_SUCH_METHOD, "Registry",
         "no method \"nope\""},
        {"method with a line break", Call("VELA.Pipe.Test", 1, "no\nsuch"), false, WEBAPI_ERR_NO_SUCH_METHOD,
         "Registry", "VELA.Pipe.Test version 1 has no method \"no\\x0asuch\""},
        {"upload not allowed", upload, false, WEBAPI_ERR_UPLOAD_NOT_ALLOWED, "Registry", "takes no upload"},
        {"relay_ds reaching Process", relay, true, WEBAPI_ERR_RELAY_FAILED, "APIRunner", "relaying"},
        {"entry API without compound", Call("VELA.Entry.Request", 1, "request"), false,
         WEBAPI_ERR_COMPOUND_OR_FORK, "APIRunner", "without \"compound\""},
        {"compound not a list", WithParam(Call("VELA.Entry.Request", 1, "request"), "compound", "{}"), false,
         WEBAPI_ERR_COMPOUND_OR_FORK, "CompoundHandler", "ParseParams failed"},
        {"library missing", Call("VELA.Pipe.NoLib", 1, "get"), false, WEBAPI_ERR_LOAD_LIBRARY, "LibCache",
         "cannot open library"},
        {"no GetAPITable", Call("VELA.Pipe.NoTable", 1, "get"), false, WEBAPI_ERR_LOAD_LIBRARY, "LibCache",
         "Get API Table Fail: cannot load table"},
        {"GetAPITable gives null", Call("VELA.Pipe.NullTable", 1, "get"), false, WEBAPI_ERR_LOAD_LIBRARY,
         "LibCache", "Get API Table Fail: cannot get api table"},
        {"not in the API table", Call("VELA.Pipe.Test", 2, "v1only"), false, WEBAPI_ERR_METHOD_NOT_IN_TABLE,
         "LibCache", "not in its library's API table"},
        // Several faults at once: the stage that comes first on the road
        // answers.
        {"bad name and version 0", Call("../x", 0, "get"), false, WEBAPI_ERR_BAD_REQUEST, nullptr,
         "without a version"},
        {"bad name and no method", Call("a/b", 1, ""), true, WEBAPI_ERR_BAD_REQUEST, nullptr, "without a version"},
        {"version and method", Call("VELA.Pipe.Test", 9, "nope"), false, WEBAPI_ERR_NOT_SUPPORTED_VERSION, nullptr,
         "no version 9"},
        {"relay of an unknown API, sub-request", relayUnknown, true, WEBAPI_ERR_NO_SUCH_API, nullptr,
         "is not valid"},
        {"relay of an unknown API, Run", relayUnknown, false, WEBAPI_ERR_BAD_REQUEST, nullptr, "relayed"},
        {"relay of the entry API", WithParam(Call("VELA.Entry.Request", 1, "request"), "relay_ds", "x"), true,
         WEBAPI_ERR_RELAY_FAILED, nullptr, "relaying"},
    };
    for (const auto& c : cases) {
        const Outcome out = RunCall(c.request, c.process);
        EXPECT_EQ(c.code, out.code) << c.what;
        ASSERT_EQ(1u, out.lines.size()) << c.what << ": " << testing::PrintToString(out.lines);
        if (c.source != nullptr) {
            EXPECT_EQ(0u, out.lines[0].rfind(std::string(c.source) + ":", 0)) << c.what << ": " << out.lines[0];
        }
        EXPECT_NE(std::string::npos, out.lines[0].find(c.says)) << c.what << ": " << out.lines[0];
    }
}

// ProcessLib by itself takes the library, identity and priority from the
// description handed to the request, and the attributes from the registry.
TEST_F(Road, ProcessLibRunsAsTheRequestsDescriptionSays)
{
    APIRunner runner;
    Json::Value request = Call("VELA.Pipe.Test", 1, "echo");
    request["reqLib"] = J(R"({"lib": ")" + Lib("pipe_handlers") + R"(", "runAs": ")" + RunAs() + R"("})");
    APIRequest req(request);
    APIResponse resp(&req);
    EXPECT_TRUE(runner.ProcessLib(&req, &resp));
    EXPECT_EQ(0, resp.GetError());
    EXPECT_EQ(Json::Value("VELA.Pipe.Test"), resp.GetBody()["data"]["api"]);

    // No description handed over: no library to open.
    APIRequest bare(Call("VELA.Pipe.Test", 1, "echo"));
    APIResponse bareResp(&bare);
    VELA::Test::LogCapture log;
    EXPECT_FALSE(runner.ProcessLib(&bare, &bareResp));
    EXPECT_EQ(WEBAPI_ERR_LOAD_LIBRARY, bareResp.GetError());
    ASSERT_EQ(1u, log.Lines().size());
    EXPECT_NE(std::string::npos, log.Lines()[0].find("library path empty"));
}

// The hooks read the method's attributes of the call on the road; for
// another request they ask the registry.
TEST_F(Road, HooksReadTheCallsAttributes)
{
    struct Asking : APIRunner {
        Json::Value seen;
        bool NeedPermission(APIRequest* req) override
        {
            seen["upload"] = GetMethodAttr(req, "allowUpload");
            seen["download"] = GetMethodAttr(req->GetAPIClass(), req->GetAPIVersion(), req->GetAPIMethod(),
                                             "allowDownload");
            seen["own"] = GetMethod(req->GetAPIClass(), req->GetAPIVersion(), req->GetAPIMethod());
            APIRequest other(Call("VELA.Pipe.Test", 1, "upload"));
            seen["other"] = GetMethodAttr(&other, "allowUpload");
            return false;
        }
    };
    Asking plain;
    EXPECT_TRUE(plain.Run(Call("VELA.Pipe.Test", 1, "echo")));
    EXPECT_EQ(J(R"({"upload": false, "download": false, "own": {"allowDemo": false}, "other": true})"),
              plain.seen);
    Asking own;
    EXPECT_TRUE(own.Run(Call("VELA.Pipe.Test", 1, "upload")));
    EXPECT_EQ(J(R"({"upload": true, "download": false, "own": {"allowUpload": true}, "other": true})"), own.seen);
}

// A method described with "audit": true leaves one line in the audit trail
// once the road is over, with the answer's code and the call's facts; a
// method without it leaves no file behind.
TEST_F(Road, AuditedMethodsLeaveOneLineEach)
{
    Json::Value d = Descriptions();
    d["VELA.Pipe.Test"]["methods"]["1"][1] = J(R"({"echo": {"audit": true}})");
    d["VELA.Pipe.Nice"]["methods"]["1"][0] = J(R"({"fail": {"audit": true}})");
    WriteJson("VELA.Pipe.lib", d);
    struct Open : APIRunner {
        bool NeedPermission(APIRequest*) override { return false; }
    };
    const std::string log = root_.Path() + "/var/log/vela/audit.log";

    const Json::Value print = Call("VELA.Pipe.Test", 1, "print");
    EXPECT_TRUE(Open().Run(print));
    struct stat st;
    EXPECT_NE(0, stat(log.c_str(), &st)) << "an unaudited call touched the audit trail";

    {
        VELA::Test::ScopedEnv client("REMOTE_ADDR", "192.0.2.5");
        EXPECT_TRUE(Open().Run(Call("VELA.Pipe.Test", 1, "echo")));
    }
    {
        VELA::Test::ScopedEnv client("REMOTE_ADDR", "192.0.2.6");
        EXPECT_TRUE(Open().Run(Call("VELA.Pipe.Nice", 1, "fail")));
    }

    const std::string text = VELA::Test::ReadText(log);
    const size_t nl = text.find('\n');
    ASSERT_NE(std::string::npos, nl) << text;
    ASSERT_EQ(text.size() - 1, text.find('\n', nl + 1)) << "two lines expected: " << text;
    const Json::Value first = J(text.substr(0, nl));
    const Json::Value second = J(text.substr(nl + 1));
    EXPECT_EQ("call", first["event"].asString());
    EXPECT_EQ("VELA.Pipe.Test", first["api"].asString());
    EXPECT_EQ("echo", first["method"].asString());
    EXPECT_EQ("192.0.2.5", first["address"].asString());
    EXPECT_EQ(0, first["result"].asInt());
    EXPECT_EQ("VELA.Pipe.Nice", second["api"].asString());
    EXPECT_EQ("fail", second["method"].asString());
    EXPECT_EQ("192.0.2.6", second["address"].asString());
    EXPECT_EQ(555, second["result"].asInt());
}

}  // namespace
