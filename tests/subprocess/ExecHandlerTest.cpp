// The exec handler through APIRunner::Exec, over the web-API directory of
// PipeFixture and the handlers of VELA.Pipe.Sub
// (tests/dispatcher/libs/pipe_handlers.cpp): the refusals of missing
// arguments, the request it builds, where a method runs (this process or a
// child) and as whom, what the caller keeps, children that die, and the
// forwarding of a child's output. (As whom, with real accounts:
// ExecContextTest.cpp.)
#include <gtest/gtest.h>

#include <csignal>
#include <fcntl.h>
#include <regex>
#include <string>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "dispatcher/PipeFixture.h"
#include "support/TestSupport.h"
#include "webapi/APIRunner.h"

namespace {

using VELA::Test::LogCapture;
using VELA::Test::ScopedEnv;

const char kApi[] = "VELA.Pipe.Sub";

Json::Value Failure(int code)
{
    return J(R"({"success": false, "error": {"code": )" + std::to_string(code) + "}}");
}

bool LoggedLine(const LogCapture& log, const std::string& pattern)
{
    for (const std::string& line : log.Lines()) {
        if (std::regex_search(line, std::regex(pattern))) {
            return true;
        }
    }
    return false;
}

// The body the "output" handler writes: byte `at` of it.
char BodyByte(long long at)
{
    return at % 1000 < 4 ? "\r\n\r\n"[at % 1000] : static_cast<char>((at * 7 + at / 251) & 0xff);
}

// The caller stands outside the web-API directory.
class ExecHandlerTest : public PipeFixture {
protected:
    void SetUp() override
    {
        PipeFixture::SetUp();
        // A handler running as another account reads nothing here after its
        // switch, but its working directory is inside.
        ASSERT_EQ(0, chmod(root_.Path().c_str(), 0755));
        realDir_ = Cwd();  // the web-API directory, links resolved
        ASSERT_EQ(0, chdir(oldCwd_.c_str()));
        self_ = RunAs();
    }

    static Json::Value Exec(const char* api, const char* method, const Json::Value& params, const char* user,
                            int outFd = -1, const Json::Value& attr = Json::Value(Json::objectValue))
    {
        Json::Value result;
        VELA::APIRunner().Exec(result, outFd, api, 1, method, params, attr, user);
        return result;
    }

    // <root>/out, emptied and opened for writing.
    int OpenOut() const
    {
        const int fd = open((root_.Path() + "/out").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        EXPECT_GE(fd, 0);
        return fd;
    }
    std::string Out() const { return VELA::Test::ReadText(root_.Path() + "/out"); }

    std::string realDir_;
    std::string self_;
};

TEST_F(ExecHandlerTest, MissingOrUnusableArgumentsAre101WithoutDispatch)
{
    const std::string marker = root_.Path() + "/dispatched";
    Json::Value params(Json::objectValue);
    params["marker"] = marker;
    const char* self = self_.c_str();
    struct Case {
        const char* api;
        const char* method;
        const char* user;
        bool missing;  // logged as a missing parameter
    } cases[] = {
        {nullptr, "reportGrantable", self, true}, {"", "reportGrantable", self, true},
        {kApi, nullptr, self, true},              {kApi, "", self, true},
        {kApi, "reportGrantable", nullptr, true}, {kApi, "report", "", true},
        {kApi, "report", "../etc", false},        {kApi, "report", "a\nb", false},
    };
    for (const Case& c : cases) {
        LogCapture log;
        EXPECT_EQ(Failure(101), Exec(c.api, c.method, params, c.user)) << (c.user ? c.user : "(null user)");
        EXPECT_EQ(c.missing, LoggedLine(log, "^ExecHandler:\\d+ missing parameter\\.$"));
        // Refused before anything ran; the working directory is left in the
        // web-API directory.
        EXPECT_EQ(realDir_, Cwd());
        ASSERT_EQ(0, chdir(oldCwd_.c_str()));
    }
    EXPECT_EQ(Failure(101), Exec(kApi, "report", J(R"([1, 2])"), self));
    EXPECT_NE(0, access(marker.c_str(), F_OK)) << "a refused call was dispatched";
}

// The request as the handler sees it, in this process and in a child, and
// through the shorter forms of APIRunner::Exec.
TEST_F(ExecHandlerTest, HandlerSeesTheCallItWasGivenNotTheOneParamsName)
{
    const Json::Value params = J(R"({"api": "VELA.Other", "method": "crash", "version": 9, "text": "hi"})");
    const Json::Value before = params;
    for (const char* method : {"reportGrantable", "report"}) {
        const Json::Value result = Exec(kApi, method, params, self_.c_str(), -1, J(R"({"mark": "m1"})"));
        ASSERT_EQ(Json::Value(true), result["success"]) << method << " " << result;
        // A POST (2) for the user, in the web-API directory.
        const std::string call = R"("api": ")" + std::string(kApi) + R"(", "method": ")" + method + R"(", "version": 1)";
        const Json::Value expected = J("{" + call + R"(, "params": {)" + call + R"(, "text": "hi"}, "attr": "m1",
            "user": ")" + self_ + R"(", "requestMethod": 2, "cwd": ")" + realDir_ + R"("})");
        for (const std::string& key : expected.getMemberNames()) {
            EXPECT_EQ(expected[key], result["data"][key]) << method << " " << key;
        }
        EXPECT_EQ(oldCwd_, Cwd()) << method << ": working directory not put back";
        EXPECT_EQ(Json::Value(false), result["httpd_restart"]);
    }
    EXPECT_EQ(before, params);

    VELA::APIRunner runner;
    Json::Value out;
    runner.Exec(out, kApi, 1, "reportGrantable", J(R"({"text": "a"})"), J(R"({"mark": "m2"})"), self_.c_str());
    EXPECT_EQ("m2", out["data"]["attr"].asString()) << out;
    EXPECT_EQ("a", out["data"]["params"]["text"].asString());
    runner.Exec(out, kApi, 1, "report", J(R"({"text": "b"})"), self_.c_str());
    EXPECT_EQ(Json::Value(true), out["success"]) << out;
    EXPECT_EQ("b", out["data"]["params"]["text"].asString());
    EXPECT_TRUE(out["data"]["attr"].isNull());
}

TEST_F(ExecHandlerTest, GrantableRunsHereOthersInAChildAndTheEnvironmentComesBack)
{
    for (bool callerHasNames : {true, false}) {
        ScopedEnv username("USERNAME", callerHasNames ? "caller-u" : nullptr);
        ScopedEnv webUser("VELA_WEBAPI_USERNAME", callerHasNames ? "caller-w" : nullptr);
        std::vector<std::pair<const char*, bool>> methods = {{"reportGrantable", true}, {"report", false}};
        if (geteuid() == 0) {
            methods.push_back({"reportDefault", true});  // full rights: root only
        }
        for (const auto& m : methods) {
            const Json::Value result = Exec(kApi, m.first, Json::Value(), self_.c_str());
            ASSERT_EQ(Json::Value(true), result["success"]) << m.first << " " << result;
            EXPECT_EQ(m.second, result["data"]["pid"].asInt() == getpid()) << m.first;
            EXPECT_EQ(self_, result["data"]["USERNAME"].asString()) << m.first;
            EXPECT_EQ(self_, result["data"]["VELA_WEBAPI_USERNAME"].asString()) << m.first;
            EXPECT_STREQ(callerHasNames ? "caller-u" : nullptr, getenv("USERNAME")) << m.first;
            EXPECT_STREQ(callerHasNames ? "caller-w" : nullptr, getenv("VELA_WEBAPI_USERNAME")) << m.first;
        }
    }
}

// What the caller gets back, what reaches outFd and what is logged,
// whatever the child does: it dies before answering (117); it writes a
// reply with or without a body; its output has no reader any more (the
// output is still drained, so the child finishes); it leaves a process
// behind that holds its pipes open after it has ended (the answer still
// comes, without waiting for that process).
TEST_F(ExecHandlerTest, AnswerWhateverTheChildDoes)
{
    // A crash leaves no core file behind; a reader gone is EPIPE, not death.
    struct rlimit old;
    ASSERT_EQ(0, getrlimit(RLIMIT_CORE, &old));
    struct rlimit none = {0, old.rlim_max};
    ASSERT_EQ(0, setrlimit(RLIMIT_CORE, &none));
    struct sigaction ignore = {}, oldPipe = {};
    ignore.sa_handler = SIG_IGN;
    ASSERT_EQ(0, sigaction(SIGPIPE, &ignore, &oldPipe));
    const int probe = static_cast<int>(syscall(SYS_pidfd_open, getpid(), 0));
    if (probe >= 0) {
        close(probe);
    }
    const std::string fifo = root_.Path() + "/fifo";
    ASSERT_EQ(0, mkfifo(fifo.c_str(), 0600));
    const std::string orphan = R"({"fifo": ")" + fifo + R"(", "how": )";
    const std::string died = "^ExecHandler:\\d+ read json failed$";
    enum OutFd { kNone, kFile, kGone };
    const struct {
        const char* method;
        std::string params;
        OutFd out;
        int code;            // 0: success, with "pad" bytes of padding
        const char* body;    // what reached the file (null: not looked at)
        std::string logged;  // a line logged (empty: not looked at)
    } cases[] = {
        {"crash", R"({"how": "kill"})", kNone, 117, nullptr, died},
        {"crash", R"({"how": "segv"})", kNone, 117, nullptr, died},
        {"crash", R"({"how": "exit"})", kNone, 117, nullptr, died},
        {"crash", R"({"how": "kill"})", kFile, 117, "", died},
        {"crash", R"({"how": "segv"})", kFile, 117, "", died},
        {"crash", R"({"how": "exit"})", kFile, 117, "", died},
        // Without an empty line nothing is body; after one, the rest is.
        {"output", R"({"raw": "Content-Type: text/plain\nno empty line\n"})", kFile, 0, "", ""},
        {"output", R"({"raw": "X: 1\r\n\r\nthe body\r\n\r\nstays"})", kFile, 0, "the body\r\n\r\nstays", ""},
        {"output", R"({"size": 1048576})", kGone, 0, nullptr,
         "^ExecHandler:\\d+ cannot forward the output of VELA.Pipe.Sub output"},
        {"orphan", orphan + R"("kill"})", kNone, 117, nullptr, died},
        {"orphan", orphan + R"("kill"})", kFile, 117, "", died},
        // An answer larger than a pipe holds, while the output stays open.
        {"orphan", orphan + R"("return", "pad": 1048576})", kFile, 0, "before", ""},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.method) + " " + c.params + " output " + std::to_string(c.out));
        const bool leaves = std::string(c.method) == "orphan";
        if (leaves && probe < 0) {
            continue;  // no pidfd on this kernel: a detached child's end is seen at end of file only
        }
        int fd = c.out == kFile ? OpenOut() : -1;
        int fds[2];
        if (c.out == kGone) {
            ASSERT_EQ(0, pipe2(fds, O_CLOEXEC));
            close(fds[0]);
            fd = fds[1];
        }
        LogCapture log;
        const Json::Value params = J(c.params);
        const Json::Value result = Exec(kApi, c.method, params, self_.c_str(), fd);
        if (leaves) {
            // Lets the process left behind end.
            const int writer = open(fifo.c_str(), O_WRONLY | O_CLOEXEC);
            EXPECT_GE(writer, 0);
            close(writer);
        }
        if (fd >= 0) {
            close(fd);
        }
        if (c.code != 0) {
            EXPECT_EQ(Failure(c.code), result);
        } else {
            EXPECT_EQ(Json::Value(true), result["success"]) << result;
            EXPECT_EQ(params.get("pad", 0).asUInt(), result["data"]["pad"].asString().size());
        }
        if (c.body != nullptr) {
            EXPECT_EQ(c.body, Out());
        }
        EXPECT_TRUE(c.logged.empty() || LoggedLine(log, c.logged)) << c.logged;
        EXPECT_EQ(oldCwd_, Cwd());
    }
    sigaction(SIGPIPE, &oldPipe, nullptr);
    setrlimit(RLIMIT_CORE, &old);
}

// Megabytes of body holding NUL bytes and empty lines reach outFd byte for
// byte, beside an answer far larger than a pipe holds, from a grantable
// method: still a child.
TEST_F(ExecHandlerTest, OutFdGetsTheWholeBodyFromAChild)
{
    const int fd = OpenOut();
    const Json::Value result = Exec(kApi, "output", J(R"({"size": 3145728, "pad": 1048576})"), self_.c_str(), fd);
    close(fd);
    ASSERT_EQ(Json::Value(true), result["success"]) << result["error"];
    EXPECT_NE(getpid(), result["data"]["pid"].asInt());
    EXPECT_EQ(1u << 20, result["data"]["pad"].asString().size());
    const long long size = 3 << 20;
    const std::string body = Out();
    ASSERT_EQ(static_cast<size_t>(size), body.size());
    for (long long at = 0; at < size; ++at) {
        if (body[static_cast<size_t>(at)] != BodyByte(at)) {
            ADD_FAILURE() << "body differs at byte " << at;
            break;
        }
    }
}

// A child never writes into the caller's standard output (a CGI reply) nor
// reads its standard input.
TEST_F(ExecHandlerTest, ChildKeepsOffTheCallersStandardStreams)
{
    const int outFile = OpenOut();
    int in[2];
    ASSERT_EQ(0, pipe2(in, O_CLOEXEC));
    ASSERT_EQ(14, write(in[1], "caller input\n\n", 14));
    fflush(stdout);
    const int savedIn = dup(STDIN_FILENO);
    const int savedOut = dup(STDOUT_FILENO);
    dup2(in[0], STDIN_FILENO);
    dup2(outFile, STDOUT_FILENO);
    const Json::Value result = Exec(kApi, "noisy", Json::Value(), self_.c_str());
    dup2(savedIn, STDIN_FILENO);
    dup2(savedOut, STDOUT_FILENO);
    for (int fd : {savedIn, savedOut, outFile, in[1]}) {
        close(fd);
    }

    EXPECT_EQ(Json::Value(true), result["success"]) << result;
    EXPECT_EQ("", result["data"]["stdin"].asString());
    EXPECT_EQ("", Out());
    char buf[64] = {0};
    EXPECT_EQ(14, read(in[0], buf, sizeof(buf)));
    EXPECT_STREQ("caller input\n\n", buf);
    close(in[0]);
}

}  // namespace
