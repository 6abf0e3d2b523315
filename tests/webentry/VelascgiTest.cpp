// The velascgi program as the web server runs it: a CGI environment, a
// body on standard input, the reply on standard output.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "support/TestSupport.h"

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
    int in[2];
    int out[2];
    if (pipe(in) != 0 || pipe(out) != 0) {
        ADD_FAILURE() << "pipe";
        return "";
    }
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(in[0], STDIN_FILENO);
        dup2(out[1], STDOUT_FILENO);
        close(in[0]);
        close(in[1]);
        close(out[0]);
        close(out[1]);
        std::vector<char*> envp;
        for (const std::string& e : env) {
            envp.push_back(const_cast<char*>(e.c_str()));
        }
        envp.push_back(nullptr);
        char* argv[] = {const_cast<char*>(program.c_str()), nullptr};
        execve(program.c_str(), argv, envp.data());
        _exit(127);
    }
    close(in[0]);
    close(out[1]);
    (void)!write(in[1], body.data(), body.size());
    close(in[1]);
    std::string text;
    char buf[4096];
    for (ssize_t n; (n = read(out[0], buf, sizeof(buf))) > 0;) {
        text.append(buf, static_cast<size_t>(n));
    }
    close(out[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    return text;
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
