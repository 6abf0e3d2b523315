// The velascgi program as the web server runs it: a CGI environment, a
// body on standard input, the reply on standard output.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <sys/stat.h>
#include <vector>

#include "support/TestSupport.h"
#include "webentry/ChildRun.h"

namespace {

const char kHeaders[] =
    "Content-type: application/json; charset=\"UTF-8\"\r\n"
    "X-Content-Type-Options: nosniff\r\n"
    "X-XSS-Protection: 1; mode=block\r\n"
    "Cache-Control: max-age=0, no-cache, no-store, must-revalidate\r\n"
    "Pragma: no-cache\r\n"
    "Expires: 0\r\n"
    "\r\n";

std::string BinaryDir()
{
    const char* dir = getenv("VELA_TEST_BINARY_DIR");
    return dir != nullptr ? dir : "";
}

// Runs velascgi with exactly `env` as its environment and `body` on its
// standard input; its standard output.
std::string RunCgi(const std::vector<std::string>& env, const std::string& body)
{
    const std::string program = BinaryDir() + "/velascgi";
    return RunChild(body, [&] {
        std::vector<char*> envp;
        for (const std::string& e : env) {
            envp.push_back(const_cast<char*>(e.c_str()));
        }
        envp.push_back(nullptr);
        char* argv[] = {const_cast<char*>(program.c_str()), nullptr};
        execve(program.c_str(), argv, envp.data());
        _exit(127);
    });
}

class Velascgi : public ::testing::Test {
protected:
    void SetUp() override
    {
        struct stat st;
        root_ = BinaryDir() + "/root";
        ASSERT_EQ(0, stat((root_ + "/usr/vela/velaman/webapi/lib.def").c_str(), &st))
            << "the build stages the web-API directory under " << root_;
    }
    std::string root_;
};

}  // namespace

TEST_F(Velascgi, UnknownApiAnswers102)
{
    const std::string reply = RunCgi({"VELA_ROOT=" + root_, "REQUEST_METHOD=GET",
                                      "QUERY_STRING=api=VELA.NoSuchApi&version=1&method=get"},
                                     "");
    EXPECT_EQ(std::string(kHeaders) + R"({"error":{"code":102},"success":false})", reply);
}

TEST_F(Velascgi, PostWithEmptyBodyAnswers101)
{
    const std::string reply = RunCgi({"VELA_ROOT=" + root_, "REQUEST_METHOD=POST", "CONTENT_LENGTH=0",
                                      "CONTENT_TYPE=application/x-www-form-urlencoded"},
                                     "");
    EXPECT_EQ(std::string(kHeaders) + R"({"error":{"code":101},"success":false})", reply);
}

TEST_F(Velascgi, MissingWebApiDirectoryAnswers500)
{
    VELA::Test::TempDir empty;
    const std::string reply = RunCgi({"VELA_ROOT=" + empty.Path(), "REQUEST_METHOD=GET"}, "");
    EXPECT_EQ(0u, reply.find("Status: 500 Internal Server Error\r\n")) << reply;
    EXPECT_NE(std::string::npos, reply.find("\r\n\r\n{\"error\":{\"code\":117},\"success\":false}")) << reply;
}
