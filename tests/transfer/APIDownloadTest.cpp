// Downloads: the response's headers, the MIME type, the stream and
// descriptor forms, a link on the path, and a download with a response of
// its own.
#include <gtest/gtest.h>

#include <cstdio>
#include <fcntl.h>
#include <string>
#include <unistd.h>

#include "platform/StateRootTest.h"
#include "vela/httpoutput.h"
#include "webapi/APIDownload.h"
#include "webapi/APIResponse.h"

namespace {

using VELA::APIDownload;
using VELA::APIResponse;
using VELA::Test::ScopedEnv;

class Download : public RootTest {
protected:
    void SetUp() override
    {
        VELA::HTTP::FileOutputerHelper::SetFastOutputEnabled(true);
        mkdir(In("/etc").c_str(), 0755);
        std::ofstream(In("/etc/mime.types")) << "text/plain txt\ntext/csv csv\n";
        std::ofstream(file_) << "hello";
    }

    // What d.Output(args...) writes to standard output; ok_ its result.
    template <typename... A> std::string Out(APIDownload& d, A... args)
    {
        const std::string path = In("/stdout");
        const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0600);
        fflush(stdout);
        const int saved = dup(1);
        dup2(fd, 1);
        close(fd);
        ok_ = d.Output(args...);
        fflush(stdout);
        dup2(saved, 1);
        close(saved);
        return VELA::Test::ReadText(path);
    }
    // d.Output(args...) fails before anything is written.
    template <typename... A> void Refused(APIDownload& d, A... args)
    {
        EXPECT_EQ("", Out(d, args...));
        EXPECT_FALSE(ok_);
    }

    ScopedEnv range_{"HTTP_RANGE", nullptr};
    ScopedEnv method_{"REQUEST_METHOD", "GET"};
    std::string file_ = In("/notes.txt");
    bool ok_ = false;
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
    const std::string out = Out(download, file_);
    EXPECT_TRUE(ok_);
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
    const std::string inl = Out(download, file_);
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
    std::string out = Out(download, file);
    EXPECT_TRUE(ok_);
    EXPECT_NE(std::string::npos, out.find("Content-Type: application/octet-stream\r\n"));
    EXPECT_EQ(std::string::npos, out.find("Content-Disposition"));
    download.SetMimeTypeFromFileName("table.CSV");
    out = Out(download, file);
    EXPECT_NE(std::string::npos, out.find("Content-Type: text/csv\r\n"));
    EXPECT_EQ("hello", out.substr(out.size() - 5));
    fclose(file);

    // Generated content: a pipe goes out to its end, without a length.
    ScopedEnv range("HTTP_RANGE", "bytes=0-1");
    response.SetHeader("X-A", "1");
    FILE* pipe = popen("printf 'made by a program'", "r");
    ASSERT_NE(nullptr, pipe);
    out = Out(download, pipe);
    pclose(pipe);
    EXPECT_TRUE(ok_);
    EXPECT_EQ(0u, out.find("X-A: 1\r\nContent-Type: text/csv\r\n")) << out;
    EXPECT_EQ(std::string::npos, out.find("Content-Length"));
    EXPECT_EQ(std::string::npos, out.find("Status"));
    const size_t end = out.find("\r\n\r\n");
    EXPECT_EQ("made by a program", end == std::string::npos ? "" : out.substr(end + 4));

    // A stream that cannot be read is refused before anything is written.
    FILE* writeOnly = fopen(In("/w").c_str(), "w");
    ASSERT_NE(nullptr, writeOnly);
    Refused(download, writeOnly);
    fclose(writeOnly);
}

TEST_F(Download, OwnResponseNoResponseAndMissingFiles)
{
    APIDownload own;
    EXPECT_TRUE(own.SetHeader("X-Own", "yes"));
    EXPECT_NE(std::string::npos, Out(own, file_).find("X-Own: yes\r\n"));
    EXPECT_TRUE(ok_);

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
    Refused(download, In("/missing"));
    Refused(download, In(""));
    EXPECT_TRUE(response.IsEnableOutput());
}

// A status of the handler's own is the only status line: a Range then gets
// the whole file under it instead of a second "Status: 206".
TEST_F(Download, HandlerStatusTurnsRangesOff)
{
    ScopedEnv range("HTTP_RANGE", "bytes=1-2");
    APIResponse response(nullptr);
    APIDownload download(&response);
    std::string out = Out(download, file_);
    EXPECT_NE(std::string::npos, out.find("Status: 206 Partial Content\r\n")) << out;
    EXPECT_EQ("el", out.substr(out.size() - 2));

    response.SetHeader("Status", "203 Non-Authoritative Information");
    out = Out(download, file_);
    EXPECT_TRUE(ok_);
    EXPECT_EQ(out.find("Status:"), out.rfind("Status:")) << out;
    EXPECT_NE(std::string::npos, out.find("Status: 203 Non-Authoritative Information\r\n"));
    EXPECT_EQ(std::string::npos, out.find("Accept-Ranges"));
    EXPECT_EQ("\r\n\r\nhello", out.substr(out.size() - 9));
}

// A link on the path is refused before anything is written; a descriptor
// the handler opened itself is sent under the name it gives.
TEST_F(Download, LinkRefusedDescriptorSent)
{
    const std::string link = In("/link.txt");
    ASSERT_EQ(0, symlink(file_.c_str(), link.c_str()));
    APIResponse response(nullptr);
    APIDownload download(&response);
    ok_ = true;
    Refused(download, link);
    const int dir = open(In("").c_str(), O_RDONLY | O_DIRECTORY);
    Refused(download, dir, std::string("x"));
    close(dir);
    EXPECT_TRUE(response.IsEnableOutput());

    const int fd = open(file_.c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    const std::string out = Out(download, fd, std::string("table.csv"));
    close(fd);
    EXPECT_TRUE(ok_);
    EXPECT_NE(std::string::npos, out.find("Content-Type: text/csv\r\n")) << out;
    EXPECT_NE(std::string::npos, out.find("filename=\"table.csv\"")) << out;
    EXPECT_EQ("\r\n\r\nhello", out.substr(out.size() - 9));
    EXPECT_FALSE(response.IsEnableOutput());
}

TEST_F(Download, XSendFileSwitch)
{
    Conf("webapi.conf", "xsendfile=\"yes\"\n");
    EXPECT_TRUE(APIDownload::GetXSendFileEnabled());
    APIDownload::SetXSendFileDisabled();
    EXPECT_FALSE(APIDownload::GetXSendFileEnabled());
}

}  // namespace
