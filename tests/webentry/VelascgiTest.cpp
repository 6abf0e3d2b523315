// The velascgi program as the web server runs it: a CGI environment, a
// body on standard input, the reply on standard output.
#include <gtest/gtest.h>

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

}  // namespace

TEST(Velascgi, RefusalsOfTheRegistryAndTheFrontEnd)
{
    const std::string root = BuiltProgram("root");
    struct stat st;
    ASSERT_EQ(0, stat((root + "/usr/vela/velaman/webapi/lib.def").c_str(), &st))
        << "the build stages the web-API directory under " << root;
    const struct {
        std::vector<std::string> env;
        const char* body;
    } cases[] = {
        {{"REQUEST_METHOD=GET", "QUERY_STRING=api=VELA.NoSuchApi&version=1&method=get"},
         R"({"error":{"code":102},"success":false})"},
        {{"REQUEST_METHOD=POST", "CONTENT_LENGTH=0", "CONTENT_TYPE=application/x-www-form-urlencoded"},
         R"({"error":{"code":101},"success":false})"},
    };
    for (const auto& c : cases) {
        std::vector<std::string> env = c.env;
        env.push_back("VELA_ROOT=" + root);
        EXPECT_EQ(std::string(kHeaders) + c.body, RunWithEnv(BuiltProgram("velascgi"), env, "")) << c.body;
    }
}

TEST(Velascgi, MissingWebApiDirectoryAnswers500)
{
    VELA::Test::TempDir empty;
    const std::string reply =
        RunWithEnv(BuiltProgram("velascgi"), {"VELA_ROOT=" + empty.Path(), "REQUEST_METHOD=GET"}, "");
    EXPECT_EQ(0u, reply.find("Status: 500 Internal Server Error\r\n")) << reply;
    EXPECT_NE(std::string::npos, reply.find("\r\n\r\n{\"error\":{\"code\":117},\"success\":false}")) << reply;
}
