// Downloads: the response's headers, the MIME type, the stream and
// descriptor forms, a link on the path, and a download with a response of
// its own.
#include <gtest/gtest.h>

#include <cstdio>
#include <fcntl.h>
#include <fstream>
#include <functional>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "support/TestSupport.h"
#include "vela/httpoutput.h"
#include "vela/vlibc.h"
#include "webapi/APIDownload.h"
#include "webapi/APIResponse.h"

namespace {

using VELA::APIDownload;
using VELA::APIResponse;
using VELA::Test::ScopedEnv;

class Download : public ::testing::Test {
protected:
    void SetUp() override
    {
        VELA::System::RootReset();
        VELA::HTTP::FileOutputerHelper::SetFastOutputEnabled(true);
        mkdir((root_.Path() + "/etc").c_str(), 0755);
        std::ofstream(root_.Path() + "/etc/mime.types") << "text/plain txt\ntext/csv csv\n";
        file_ = root_.Path() + "/notes.txt";
        std::ofstream(file_) << "hello";
    }
    void TearDown() override { VELA::System::RootReset(); }

    // What `fn` writes to standard output; `ok` receives its result.
    std::string Capture(const std::function<bool()>& fn, bool& ok)
    {
        const std::string path = root_.Path() + "/stdout";
        const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0600);
        fflush(stdout);
        const int saved = dup(1);
        dup2(fd, 1);
        close(fd);
        ok = fn();
        fflush(stdout);
        dup2(saved, 1);
        close(saved);
        return VELA::Test::ReadText(path);
    }

    VELA::Test::TempDir root_;
    ScopedEnv rootEnv_{"VELA_ROOT", root_.Path().c_str()};
    ScopedEnv range_{"HTTP_RANGE", nullptr};
    ScopedEnv method_{"REQUEST_METHOD", "GET"};
    std::string file_;
};

TEST_F(Download, PrintsTheResponseHeadersThenTheFile)
{
    APIResponse response(nullptr);
    APIDownload download(&response);
    Json::Value headers;
    headers["X-A"] = "1";
    headers["X-Number"] = 5;  // not a string: skipped, still true
    headers["Content-Type"] = "text/html";
    EXPECT_TRUE(download.SetHeader(headers));
    EXPECT_FALSE(download.SetHeader("X-Bad", "a\r\nInjected: 1"));
    bool ok = false;
    const std::string out = Capture([&] { return download.Output(file_); }, ok);
    EXPECT_TRUE(ok);
    EXPECT_EQ(0u, out.find("X-A: 1\r\nContent-Type: text/plain\r\n")) << out;
    EXPECT_EQ(std::string::npos, out.find("X-Number"));
    EXPECT_EQ(std::string::npos, out.find("Injected"));
    // Only the file's type: neither the response's default JSON type nor its text/html.
    EXPECT_EQ(std::string::npos, out.find("json"));
    EXPECT_EQ(std::string::npos, out.find("html"));
    EXPECT_NE(std::string::npos, out.find("Content-Length: 5\r\n"));
    EXPECT_EQ("\r\n\r\nhello", out.substr(out.size() - 9));
    EXPECT_FALSE(response.IsEnableOutput());  // no JSON after the file

    // A disposition of the handler's own replaces the outputer's.
    response.SetHeader("Content-Disposition", "inline");
    download.SetMimeType("text/x-own");
    const std::string inl = Capture([&] { return download.Output(file_); }, ok);
    EXPECT_NE(std::string::npos, inl.find("Content-Disposition: inline\r\n"));
    EXPECT_EQ(std::string::npos, inl.find("attachment"));
    EXPECT_NE(std::string::npos, inl.find("Content-Type: text/x-own\r\n"));
}

TEST_F(Download, StreamIsOctetStreamUnlessTyped)
{
    APIResponse response(nullptr);
    APIDownload download(&response);
    FILE* file = fopen(file_.c_str(), "r");
    ASSERT_NE(nullptr, file);
    bool ok = false;
    std::string out = Capture([&] { return download.Output(file); }, ok);
    EXPECT_TRUE(ok);
    EXPECT_NE(std::string::npos, out.find("Content-Type: application/octet-stream\r\n"));
    EXPECT_EQ(std::string::npos, out.find("Content-Disposition"));
    download.SetMimeTypeFromFileName("table.CSV");
    out = Capture([&] { return download.Output(file); }, ok);
    EXPECT_NE(std::string::npos, out.find("Content-Type: text/csv\r\n"));
    EXPECT_EQ("hello", out.substr(out.size() - 5));
    fclose(file);

    // Generated content: a pipe goes out to its end, without a length.
    ScopedEnv range("HTTP_RANGE", "bytes=0-1");
    response.SetHeader("X-A", "1");
    FILE* pipe = popen("printf 'made by a program'", "r");
    ASSERT_NE(nullptr, pipe);
    out = Capture([&] { return download.Output(pipe); }, ok);
    pclose(pipe);
    EXPECT_TRUE(ok);
    EXPECT_EQ(0u, out.find("X-A: 1\r\nContent-Type: text/csv\r\n")) << out;
    EXPECT_EQ(std::string::npos, out.find("Content-Length"));
    EXPECT_EQ(std::string::npos, out.find("Status"));
    const size_t end = out.find("\r\n\r\n");
    EXPECT_EQ("made by a program", end == std::string::npos ? "" : out.substr(end + 4));

    // A stream that cannot be read is refused before anything is written.
    FILE* writeOnly = fopen((root_.Path() + "/w").c_str(), "w");
    ASSERT_NE(nullptr, writeOnly);
    EXPECT_EQ("", Capture([&] { return download.Output(writeOnly); }, ok));
    EXPECT_FALSE(ok);
    fclose(writeOnly);
}

TEST_F(Download, OwnResponseNoResponseAndMissingFiles)
{
    APIDownload own;
    EXPECT_TRUE(own.SetHeader("X-Own", "yes"));
    bool ok = false;
    EXPECT_NE(std::string::npos, Capture([&] { return own.Output(file_); }, ok).find("X-Own: yes\r\n"));
    EXPECT_TRUE(ok);

    APIDownload none(nullptr);
    EXPECT_FALSE(none.SetHeader("X-A", "1"));
    Json::Value headers;
    headers["X-A"] = "1";
    EXPECT_FALSE(none.SetHeader(headers));

    // Nothing is written for a file that cannot be sent, so the handler can
    // still answer with an error.
    APIResponse response(nullptr);
    APIDownload download(&response);
    download.SetHeader("X-A", "1");
    EXPECT_EQ("", Capture([&] { return download.Output(root_.Path() + "/missing"); }, ok));
    EXPECT_FALSE(ok);
    EXPECT_EQ("", Capture([&] { return download.Output(root_.Path()); }, ok));
    EXPECT_FALSE(ok);
    EXPECT_TRUE(response.IsEnableOutput());
}

// A status of the handler's own is the only status line: a Range then gets
// the whole file under it instead of a second "Status: 206".
TEST_F(Download, HandlerStatusTurnsRangesOff)
{
    ScopedEnv range("HTTP_RANGE", "bytes=1-2");
    APIResponse response(nullptr);
    APIDownload download(&response);
    bool ok = false;
    std::string out = Capture([&] { return download.Output(file_); }, ok);
    EXPECT_NE(std::string::npos, out.find("Status: 206 Partial Content\r\n")) << out;
    EXPECT_EQ("el", out.substr(out.size() - 2));

    response.SetHeader("Status", "203 Non-Authoritative Information");
    out = Capture([&] { return download.Output(file_); }, ok);
    EXPECT_TRUE(ok);
    EXPECT_EQ(out.find("Status:"), out.rfind("Status:")) << out;
    EXPECT_NE(std::string::npos, out.find("Status: 203 Non-Authoritative Information\r\n"));
    EXPECT_EQ(std::string::npos, out.find("Accept-Ranges"));
    EXPECT_EQ("\r\n\r\nhello", out.substr(out.size() - 9));
}

// A link on the path is refused before anything is written; a descriptor
// the handler opened itself is sent under the name it gives.
TEST_F(Download, LinkRefusedDescriptorSent)
{
    const std::string link = root_.Path() + "/link.txt";
    ASSERT_EQ(0, symlink(file_.c_str(), link.c_str()));
    APIResponse response(nullptr);
    APIDownload download(&response);
    bool ok = true;
    EXPECT_EQ("", Capture([&] { return download.Output(link); }, ok));
    EXPECT_FALSE(ok);
    const int dir = open(root_.Path().c_str(), O_RDONLY | O_DIRECTORY);
    EXPECT_EQ("", Capture([&] { return download.Output(dir, "x"); }, ok));
    EXPECT_FALSE(ok);
    close(dir);
    EXPECT_TRUE(response.IsEnableOutput());

    const int fd = open(file_.c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    const std::string out = Capture([&] { return download.Output(fd, "table.csv"); }, ok);
    close(fd);
    EXPECT_TRUE(ok);
    EXPECT_NE(std::string::npos, out.find("Content-Type: text/csv\r\n")) << out;
    EXPECT_NE(std::string::npos, out.find("filename=\"table.csv\"")) << out;
    EXPECT_EQ("\r\n\r\nhello", out.substr(out.size() - 9));
    EXPECT_FALSE(response.IsEnableOutput());
}

TEST_F(Download, XSendFileSwitch)
{
    mkdir((root_.Path() + "/etc/vela").c_str(), 0755);
    std::ofstream(root_.Path() + "/etc/vela/webapi.conf") << "xsendfile=\"yes\"\n";
    EXPECT_TRUE(APIDownload::GetXSendFileEnabled());
    APIDownload::SetXSendFileDisabled();
    EXPECT_FALSE(APIDownload::GetXSendFileEnabled());
}

}  // namespace
