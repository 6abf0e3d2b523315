// The runner pipeline end to end: request JSON in, response out, through the
// real description files and handler libraries of PipeFixture.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <iostream>
#include <sstream>
#include <string>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include "dispatcher/PipeFixture.h"
#include "support/TestSupport.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::APIRunner;

class Pipeline : public PipeFixture {
protected:
    struct Outcome {
        bool ok;  // what Run returned
        int code;
        Json::Value answer;
    };
    // Runs `request` in a fresh runner.
    static Outcome RunOnce(const Json::Value& request)
    {
        APIRunner runner;
        const bool ok = runner.Run(request);
        return {ok, runner.GetResponseObject()->GetError(), runner.GetResponse()};
    }
};

// A runner whose permission and upload hooks the test sets.
class HookRunner : public APIRunner {
public:
    bool skip = false;
    bool uploadOk = true;
    int permissionChecks = 0;
    int uploads = 0;

    bool NeedPermission(APIRequest*) override { return true; }
    bool CheckPermission(APIRequest*, APIResponse* resp) override
    {
        ++permissionChecks;
        resp->SetError(WEBAPI_ERR_NO_PERMISSION);
        return false;
    }
    bool SkipPermission(APIRequest*) override { return skip; }
    bool HandleUpload(APIRequest*, APIResponse* resp) override
    {
        ++uploads;
        if (!uploadOk) {
            resp->SetError(WEBAPI_ERR_UPLOAD_FAILED);
        }
        return uploadOk;
    }
};

// A handler that answers nothing, or throws, leaves the preset 117; one that
// answers is heard.
TEST_F(Pipeline, HandlerAnswerOrPreset)
{
    Outcome out = RunOnce(Call("VELA.Pipe.Test", 1, "silent"));
    EXPECT_TRUE(out.ok);
    EXPECT_EQ(WEBAPI_ERR_NO_RESPONSE, out.code);

    VELA::Test::LogCapture log;
    EXPECT_EQ(WEBAPI_ERR_NO_RESPONSE, RunOnce(Call("VELA.Pipe.Test", 1, "throws")).code);
    EXPECT_TRUE(log.Contains("handler gave up"));

    out = RunOnce(Call("VELA.Pipe.Test", 1, "echo"));
    EXPECT_TRUE(out.ok);
    EXPECT_EQ(0, out.code);
    EXPECT_EQ(J(R"({"success": true, "httpd_restart": false,
                    "data": {"api": "VELA.Pipe.Test", "method": "echo", "cwd": ")" + webapiDir_ + R"(",
                             "user": ""}})"),
              out.answer);

    // The entry API called with another method: refused without an error
    // code (its refusals with codes: RoadTest.cpp).
    out = RunOnce(Call("VELA.Entry.Request", 1, "other"));
    EXPECT_FALSE(out.answer.isMember("success"));
    EXPECT_FALSE(out.ok);
    EXPECT_EQ(0, out.code);
}

// The named check refuses; the terminating entry's check vets the calls
// that no entry names, and may let them through.
TEST_F(Pipeline, CheckTableSelection)
{
    const Outcome out = RunOnce(Call("VELA.Pipe.Checked", 1, "guarded"));
    EXPECT_EQ(WEBAPI_ERR_NO_PERMISSION, out.code);
    EXPECT_EQ(Json::Value("guarded"), out.answer["error"]["errors"]);
    EXPECT_EQ(499, RunOnce(Call("VELA.Pipe.Checked", 1, "open", J(R"({"deny": true})"))).code);

    APIRunner runner;
    EXPECT_TRUE(runner.Run(Call("VELA.Pipe.Checked", 1, "open")));
    EXPECT_EQ(Json::Value("handled"), runner.GetResponse()["data"]);
    EXPECT_EQ("catch-all", runner.GetResponseObject()->GetHeader("X-Checked"));

    // Listed in the description, missing from the library's table.
    EXPECT_EQ(WEBAPI_ERR_METHOD_NOT_IN_TABLE, RunOnce(Call("VELA.Pipe.Checked", 1, "unlisted")).code);
}

TEST_F(Pipeline, PermissionAndUploadHooks)
{
    {
        HookRunner runner;
        EXPECT_FALSE(runner.Run(Call("VELA.Pipe.Test", 1, "echo")));
        EXPECT_EQ(1, runner.permissionChecks);
        EXPECT_EQ(WEBAPI_ERR_NO_PERMISSION, runner.GetResponseObject()->GetError());
    }
    {
        // Asked before the library is opened.
        HookRunner runner;
        EXPECT_FALSE(runner.Run(Call("VELA.Pipe.NoLib", 1, "get")));
        EXPECT_EQ(WEBAPI_ERR_NO_PERMISSION, runner.GetResponseObject()->GetError());
    }
    {
        HookRunner runner;
        runner.skip = true;
        EXPECT_TRUE(runner.Run(Call("VELA.Pipe.Test", 1, "echo")));
        EXPECT_EQ(1, runner.permissionChecks);
        EXPECT_EQ(Json::Value(true), runner.GetResponse()["success"]);
    }
    Json::Value upload = Call("VELA.Pipe.Test", 1, "upload");
    upload["environ"]["CONTENT_TYPE"] = "multipart/form-data; boundary=x";
    for (bool uploadOk : {false, true}) {
        HookRunner runner;
        runner.skip = true;
        runner.uploadOk = uploadOk;
        EXPECT_EQ(uploadOk, runner.Run(upload));
        EXPECT_EQ(1, runner.uploads);
        EXPECT_EQ(uploadOk ? 0 : WEBAPI_ERR_UPLOAD_FAILED, runner.GetResponseObject()->GetError());
    }
}

// Priority, standard streams and working directory come back after the
// call, whatever the handler did.
TEST_F(Pipeline, CallLeavesNoTrace)
{
    errno = 0;
    const int nice = getpriority(PRIO_PROCESS, 0);
    ASSERT_EQ(0, errno);
    if (nice == 5) {
        GTEST_SKIP() << "the test already runs at the description's priority";
    }
    const Outcome failed = RunOnce(Call("VELA.Pipe.Nice", 1, "fail"));
    EXPECT_EQ(555, failed.code);
    EXPECT_EQ(Json::Value(5), failed.answer["error"]["errors"]["nice"]);
    EXPECT_EQ(nice, getpriority(PRIO_PROCESS, 0));

    std::stringstream out;
    std::stringstream in;
    std::streambuf* oldOut = std::cout.rdbuf(out.rdbuf());
    std::streambuf* oldIn = std::cin.rdbuf(in.rdbuf());
    in.str("typed\ntyped again\n");
    const Json::Value discarded = RunOnce(Call("VELA.Pipe.Test", 1, "print")).answer;
    const std::string afterDiscarded = out.str();
    const Json::Value kept = RunOnce(Call("VELA.Pipe.Test", 1, "printKept")).answer;
    const bool cinRestored = std::cin.rdbuf() == in.rdbuf() && std::cout.rdbuf() == out.rdbuf();
    std::cout.rdbuf(oldOut);
    std::cin.rdbuf(oldIn);
    EXPECT_TRUE(cinRestored);
    EXPECT_EQ("", afterDiscarded);
    EXPECT_EQ(Json::Value(""), discarded["data"]["stdin"]);
    EXPECT_EQ("handler output\n", out.str());
    EXPECT_EQ(Json::Value("typed"), kept["data"]["stdin"]);

    EXPECT_EQ(Json::Value("/"), RunOnce(Call("VELA.Pipe.Test", 1, "chdir")).answer["data"]["cwd"]);
    EXPECT_EQ(webapiDir_, Cwd());
}

// Callbacks run in a child after the reply, which keeps none of the
// descriptors a web server may be waiting on: its standard output and
// error, and a pipe it inherited, all reach end of file while the callback
// (3 s) is still running.
TEST_F(Pipeline, CallbacksRunInAChildThatDoesNotHoldTheReply)
{
    const std::string marker = root_.Path() + "/callback.done";
    APIRunner runner;
    ASSERT_TRUE(runner.Run(
        Call("VELA.Pipe.Test", 1, "callback", J(R"({"file": ")" + marker + R"(", "sleep": "3"})"))));
    ASSERT_EQ(1u, runner.GetResponseObject()->GetCallbackFuncs().size());
    int out[2], err[2], extra[2];
    ASSERT_EQ(0, pipe(out));
    ASSERT_EQ(0, pipe(err));
    ASSERT_EQ(0, pipe(extra));
    fflush(stdout);
    fflush(stderr);
    const int savedOut = dup(STDOUT_FILENO);
    const int savedErr = dup(STDERR_FILENO);
    ASSERT_GE(savedOut, 0);
    ASSERT_GE(savedErr, 0);
    dup2(out[1], STDOUT_FILENO);
    dup2(err[1], STDERR_FILENO);
    std::cout << "reply";  // still buffered when the child is made
    runner.HandleCallback(runner.GetResponseObject());
    std::cout.flush();
    dup2(savedOut, STDOUT_FILENO);
    dup2(savedErr, STDERR_FILENO);
    for (int fd : {savedOut, savedErr, out[1], err[1], extra[1]}) {
        close(fd);
    }
    std::string replies[3];
    int i = 0;
    for (int fd : {out[0], err[0], extra[0]}) {
        char buf[256];
        for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;) {
            replies[i].append(buf, static_cast<size_t>(n));
        }
        close(fd);
        ++i;
    }
    EXPECT_NE(0, access(marker.c_str(), F_OK)) << "the child held a descriptor until its callback ended";
    EXPECT_EQ("reply", replies[0]);  // once: the child wrote nothing of the parent's
    EXPECT_EQ("", replies[1]);
    EXPECT_EQ("", replies[2]);

    std::string pid;
    for (int n = 0; n < 600 && pid.empty(); ++n) {  // up to a minute on a slow machine
        usleep(100 * 1000);
        pid = VELA::Test::ReadText(marker);
    }
    ASSERT_FALSE(pid.empty()) << "callback did not run";
    const pid_t child = static_cast<pid_t>(std::stol(pid));
    EXPECT_NE(getpid(), child);
    int status = 0;
    EXPECT_EQ(child, waitpid(child, &status, 0));
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

    // No callbacks: no child.
    APIResponse empty(nullptr);
    runner.HandleCallback(&empty);
    EXPECT_EQ(-1, waitpid(-1, &status, WNOHANG));
    EXPECT_EQ(ECHILD, errno);
}

TEST_F(Pipeline, ProcessNameFollowsTheCall)
{
    const std::string comm = VELA::Test::ReadText("/proc/self/comm");
    char area[96];
    memset(area, 'x', sizeof(area) - 1);
    area[sizeof(area) - 1] = '\0';
    char* argv[] = {area, nullptr};
    const std::string prefix = program_invocation_short_name;
    {
        APIRunner runner;
        runner.SetArgs(1, argv);
        EXPECT_STREQ("velascgi", area);
        EXPECT_EQ(std::string(sizeof(area) - 1 - 8, '\0'), std::string(area + 8, sizeof(area) - 1 - 8));

        ASSERT_TRUE(runner.Run(Call("VELA.Pipe.Test", 1, "echo")));
        EXPECT_EQ(prefix + "_VELA.Pipe.Test_1_echo", std::string(area));
        EXPECT_EQ("VELA.Pipe.Test_\n", VELA::Test::ReadText("/proc/self/comm"));

        // An API name that fails the name check is never shown: the call is
        // refused and the process keeps the name of its last call.
        for (const char* api : {"VELA.Pipe\nX", "../VELA.Pipe.Test", "VELA.Pipe.Test/x"}) {
            EXPECT_FALSE(runner.Run(Call(api, 1, "echo")));
            EXPECT_EQ(WEBAPI_ERR_NO_SUCH_API, runner.GetResponseObject()->GetError()) << api;
            EXPECT_EQ(prefix + "_VELA.Pipe.Test_1_echo", std::string(area)) << api;
            EXPECT_EQ("VELA.Pipe.Test_\n", VELA::Test::ReadText("/proc/self/comm")) << api;
        }
        // Control bytes of a method never reach ps or syslog.
        runner.Run(Call("VELA.Pipe.Test", 1, "ec\nho"));
        EXPECT_EQ(prefix + "_VELA.Pipe.Test_1_ec?ho", std::string(area));
    }
    EXPECT_EQ(prefix.substr(0, sizeof(area) - 1), std::string(area));
    EXPECT_EQ(comm, VELA::Test::ReadText("/proc/self/comm"));
}

}  // namespace
