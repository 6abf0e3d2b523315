// HTTP file output: MIME types, whole files through a pipe and a file,
// byte ranges, X-Sendfile, refusals, the disposition header, a client that
// goes away.
#include <gtest/gtest.h>

#include <csignal>
#include <cstdio>
#include <fcntl.h>
#include <fstream>
#include <functional>
#include <iostream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/StateRootTest.h"
#include "support/TestSupport.h"
#include "vela/httpoutput.h"

namespace {

using VELA::HTTP::FileOutputerHelper;
using VELA::Test::ScopedEnv;

struct Reply {
    bool ok = false;
    std::string head;  // the header block without its empty line
    std::string body;
    bool complete = false;  // the empty line was there

    // The value of header `name`, "" when absent.
    std::string Header(const std::string& name) const
    {
        const std::string key = name + ": ";
        size_t pos = 0;
        while (pos < head.size()) {
            size_t end = head.find("\r\n", pos);
            end = end == std::string::npos ? head.size() : end;
            if (head.compare(pos, key.size(), key) == 0) {
                return head.substr(pos + key.size(), end - pos - key.size());
            }
            pos = end + 2;
        }
        return "";
    }
};

Reply Split(bool ok, const std::string& out)
{
    Reply r;
    r.ok = ok;
    const size_t end = out.find("\r\n\r\n");
    r.complete = end != std::string::npos;
    r.head = r.complete ? out.substr(0, end + 2) : out;
    r.body = r.complete ? out.substr(end + 4) : "";
    return r;
}

// Runs `fn` with standard output on a new file opened with `flags` (extra
// open flags), in this process.
Reply ToFile(const std::string& dir, const std::function<bool()>& fn, int flags = 0)
{
    const std::string path = dir + "/stdout";
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | flags, 0600);
    EXPECT_GE(fd, 0);
    fflush(stdout);
    const int saved = dup(1);
    dup2(fd, 1);
    close(fd);
    const bool ok = fn();
    fflush(stdout);
    dup2(saved, 1);
    close(saved);
    return Split(ok, VELA::Test::ReadText(path));
}

// Runs `fn` in a child whose standard output is a pipe read by this
// process.
Reply ThroughPipe(const std::function<bool()>& fn)
{
    int fds[2];
    EXPECT_EQ(0, pipe(fds));
    fflush(stdout);
    const pid_t pid = fork();
    if (pid == 0) {
        close(fds[0]);
        dup2(fds[1], 1);
        close(fds[1]);
        _exit(fn() ? 0 : 1);
    }
    close(fds[1]);
    std::string out;
    char buf[65536];
    ssize_t n;
    while ((n = read(fds[0], buf, sizeof(buf))) > 0) {
        out.append(buf, static_cast<size_t>(n));
    }
    close(fds[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    return Split(WIFEXITED(status) && WEXITSTATUS(status) == 0, out);
}

std::string Pattern(size_t size)
{
    std::string data(size, '\0');
    for (size_t i = 0; i < size; ++i) {
        data[i] = static_cast<char>((i * 131 + i / 7) & 0xff);
    }
    return data;
}

class HttpOutput : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        FileOutputerHelper::SetFastOutputEnabled(true);
        mkdir((root_.Path() + "/etc").c_str(), 0755);
        mkdir((root_.Path() + "/etc/vela").c_str(), 0755);
        mkdir(files_.c_str(), 0755);
    }
    std::string Write(const std::string& name, const std::string& data)
    {
        const std::string path = files_ + "/" + name;
        std::ofstream(path, std::ios::binary) << data;
        return path;
    }

    ScopedEnv range_{"HTTP_RANGE", nullptr};
    ScopedEnv ifRange_{"HTTP_IF_RANGE", nullptr};
    ScopedEnv method_{"REQUEST_METHOD", "GET"};
    std::string files_ = root_.Path() + "/files";
    HTTPFileOutputer out_;
};

TEST_F(HttpOutput, MimeTypesFromTheSystemFileThenBuiltIn)
{
    std::ofstream(root_.Path() + "/etc/mime.types")
        << "# comment png\n\ntext/x-test\t\ttst TSX\napplication/pdf pdf\n  image/png png\n"
           "no-slash abc\ntext/second tst\n";
    EXPECT_EQ("text/x-test", HTTPFileOutputer::GetMimeType("a.tst"));
    EXPECT_EQ("text/x-test", HTTPFileOutputer::GetMimeType("/x/A.TsX"));
    EXPECT_EQ("application/pdf", HTTPFileOutputer::GetMimeType("archive.tar.PDF"));
    EXPECT_EQ("image/png", HTTPFileOutputer::GetMimeType("p.png"));
    for (const char* unknown : {"x.abc", "noext", "dir.pdf/file", "trailing.", "x.zip"}) {
        EXPECT_EQ("application/octet-stream", HTTPFileOutputer::GetMimeType(unknown)) << unknown;
    }

    VELA::Test::TempDir bare;
    ScopedEnv root("VELA_ROOT", bare.Path().c_str());
    VELA::VelaRootReset();
    EXPECT_EQ("application/zip", HTTPFileOutputer::GetMimeType("x.zip"));
    EXPECT_EQ("text/html", HTTPFileOutputer::GetMimeType("INDEX.HTML"));
    EXPECT_EQ("application/octet-stream", HTTPFileOutputer::GetMimeType("a.tst"));
}

TEST_F(HttpOutput, WholeFileThroughPipeFileAndAppendOnlyFile)
{
    // Larger than a pipe's buffer and than the copy buffer of the fallback.
    const std::string data = Pattern(3 * 1024 * 1024 + 17);
    const std::string path = Write("big.bin", data);
    const auto send = [&] {
        std::cout << "X-From-Cout: 1\r\n";
        printf("X-From-Stdio: 2\r\n");
        return out_.Output(path, "application/x-test");
    };
    // O_APPEND makes sendfile refuse the output: the read/write path runs.
    for (const Reply& r : {ThroughPipe(send), ToFile(root_.Path(), send), ToFile(root_.Path(), send, O_APPEND)}) {
        EXPECT_TRUE(r.ok);
        EXPECT_EQ(0u, r.head.find("X-From-Cout: 1\r\nX-From-Stdio: 2\r\n"));
        EXPECT_EQ("application/x-test", r.Header("Content-Type"));
        EXPECT_EQ(std::to_string(data.size()), r.Header("Content-Length"));
        EXPECT_EQ("bytes", r.Header("Accept-Ranges"));
        EXPECT_EQ("nosniff", r.Header("X-Content-Type-Options"));
        EXPECT_EQ("", r.Header("Status"));
        EXPECT_TRUE(r.body == data) << "body of " << r.body.size() << " bytes differs";
    }

    ScopedEnv head("REQUEST_METHOD", "HEAD");
    const Reply r = ToFile(root_.Path(), [&] { return out_.Output(path, ""); });
    EXPECT_TRUE(r.ok && r.complete);
    EXPECT_EQ(std::to_string(data.size()), r.Header("Content-Length"));
    EXPECT_EQ("application/octet-stream", r.Header("Content-Type"));
    EXPECT_EQ("", r.body);
}

TEST_F(HttpOutput, SingleRanges)
{
    const std::string data = Pattern(1000);
    const std::string path = Write("r.bin", data);
    struct Case {
        const char* range;
        int status;  // 200, 206 or 416
        size_t first, last;
    };
    const Case cases[] = {
        {"bytes=10-19", 206, 10, 19},   {"bytes=990-", 206, 990, 999},   {"bytes=-5", 206, 995, 999},
        {"bytes=-5000", 206, 0, 999},   {"bytes=900-5000", 206, 900, 999}, {" BYTES=0-0 ", 206, 0, 0},
        {"bytes=1000-", 416, 0, 0},     {"bytes=-0", 416, 0, 0},
        {"bytes=99999999999999999999999-", 416, 0, 0},
        {"bytes=5-1", 200, 0, 999},     {"bytes=0-1,5-6", 200, 0, 999},  {"bytes=abc", 200, 0, 999},
        {"items=0-1", 200, 0, 999},     {"bytes=1-2x", 200, 0, 999},     {"bytes=", 200, 0, 999},
    };
    for (const Case& c : cases) {
        ScopedEnv range("HTTP_RANGE", c.range);
        const Reply r = ToFile(root_.Path(), [&] { return out_.Output(path, "text/plain"); });
        EXPECT_TRUE(r.ok && r.complete) << c.range;
        if (c.status == 416) {
            EXPECT_EQ("416 Range Not Satisfiable", r.Header("Status")) << c.range;
            EXPECT_EQ("bytes */1000", r.Header("Content-Range")) << c.range;
            EXPECT_EQ("", r.body) << c.range;
            continue;
        }
        const std::string part = data.substr(c.first, c.last - c.first + 1);
        EXPECT_EQ(c.status == 206 ? "206 Partial Content" : "", r.Header("Status")) << c.range;
        EXPECT_EQ(c.status == 206 ? "bytes " + std::to_string(c.first) + "-" + std::to_string(c.last) + "/1000" : "",
                  r.Header("Content-Range"))
            << c.range;
        EXPECT_EQ(std::to_string(part.size()), r.Header("Content-Length")) << c.range;
        EXPECT_TRUE(r.body == part) << c.range;
    }

    // If-Range: only the date the file was sent with keeps the range.
    ScopedEnv range("HTTP_RANGE", "bytes=0-9");
    const std::string modified = ToFile(root_.Path(), [&] { return out_.Output(path, ""); }).Header("Last-Modified");
    ASSERT_NE("", modified);
    {
        ScopedEnv ifRange("HTTP_IF_RANGE", modified.c_str());
        EXPECT_EQ(10u, ToFile(root_.Path(), [&] { return out_.Output(path, ""); }).body.size());
    }
    {
        ScopedEnv ifRange("HTTP_IF_RANGE", "\"some-etag\"");
        EXPECT_EQ(data.size(), ToFile(root_.Path(), [&] { return out_.Output(path, ""); }).body.size());
    }

    const std::string empty = Write("empty", "");
    EXPECT_EQ("bytes */0", ToFile(root_.Path(), [&] { return out_.Output(empty, ""); }).Header("Content-Range"));
}

TEST_F(HttpOutput, FastOutputWritesXSendfileOnlyForPaths)
{
    mkdir((files_ + "/sub").c_str(), 0755);
    const std::string path = Write("a b%c.txt", "content");
    ASSERT_EQ(0, symlink(path.c_str(), (files_ + "/link").c_str()));
    ASSERT_FALSE(FileOutputerHelper::IsFastOutputEnabled());  // nothing configured

    std::ofstream(root_.Path() + "/etc/vela/webapi.conf") << "xsendfile=\"YES\"\n";
    VELA::Test::TempDir other;  // another root: the configuration is read again
    {
        ScopedEnv root("VELA_ROOT", other.Path().c_str());
        VELA::VelaRootReset();
        EXPECT_FALSE(FileOutputerHelper::IsFastOutputEnabled());
    }
    VELA::VelaRootReset();
    ASSERT_TRUE(FileOutputerHelper::IsFastOutputEnabled());
    char* real = realpath(path.c_str(), nullptr);
    ASSERT_NE(nullptr, real);
    std::string expected(real);
    free(real);
    expected.replace(expected.rfind('/') + 1, std::string::npos, "a%20b%25c.txt");
    for (const std::string& via : {files_ + "/link", files_ + "/sub/../a b%c.txt"}) {
        const Reply r = ToFile(root_.Path(), [&] { return out_.Output(via, "text/plain"); });
        EXPECT_TRUE(r.ok && r.complete) << via;
        EXPECT_EQ(expected, r.Header("X-Sendfile")) << via;
        EXPECT_EQ("text/plain", r.Header("Content-Type"));
        EXPECT_EQ("nosniff", r.Header("X-Content-Type-Options"));
        EXPECT_EQ("", r.Header("Content-Length"));
        EXPECT_EQ("", r.body);
    }

    const std::string crlf = Write("evil\r\nX-Injected: 1", "x");
    const Reply refused = ToFile(root_.Path(), [&] { return out_.Output(crlf, ""); });
    EXPECT_FALSE(refused.ok);
    EXPECT_EQ("", refused.head);

    FILE* file = fopen(path.c_str(), "r");
    ASSERT_NE(nullptr, file);
    const Reply stream = ToFile(root_.Path(), [&] { return out_.Output(file, "f", ""); });
    fclose(file);
    EXPECT_EQ("", stream.Header("X-Sendfile"));
    EXPECT_EQ("content", stream.body);

    FileOutputerHelper::SetFastOutputEnabled(false);
    EXPECT_FALSE(FileOutputerHelper::IsFastOutputEnabled());
    const Reply direct = ToFile(root_.Path(), [&] { return out_.Output(path, ""); });
    EXPECT_EQ("", direct.Header("X-Sendfile"));
    EXPECT_EQ("content", direct.body);
}

TEST_F(HttpOutput, RefusesWhatIsNotARegularFile)
{
    const std::string fifo = files_ + "/fifo";
    ASSERT_EQ(0, mkfifo(fifo.c_str(), 0600));
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    FILE* pipeStream = fdopen(fds[0], "r");
    ASSERT_NE(nullptr, pipeStream);
    FILE* writeOnly = fopen((files_ + "/w").c_str(), "w");
    ASSERT_NE(nullptr, writeOnly);
    const std::function<bool()> calls[] = {
        [&] { return out_.Output(files_, ""); },
        [&] { return out_.Output(fifo, ""); },  // must not wait for a writer
        [&] { return out_.Output(files_ + "/missing", ""); },
        [&] { return out_.Output(std::string("a\0b", 3), ""); },
        [&] { return out_.Output(static_cast<FILE*>(nullptr), "n", ""); },
        [&] { return out_.Output(pipeStream, "n", ""); },
        [&] { return out_.Output(writeOnly, "n", ""); },
    };
    for (const auto& call : calls) {
        const Reply r = ToFile(root_.Path(), call);
        EXPECT_FALSE(r.ok);
        EXPECT_EQ("", r.head);
    }
    fclose(pipeStream);
    fclose(writeOnly);
    close(fds[1]);
}

TEST_F(HttpOutput, DispositionNamesAreSafe)
{
    const std::string path = Write("data", "x");
    struct Case {
        std::string name;
        std::string value;  // "" when no header is expected
    };
    const Case cases[] = {
        {"report.pdf", "attachment; filename=\"report.pdf\"; filename*=UTF-8''report.pdf"},
        {"a\"b\r\nc;d.txt", "attachment; filename=\"a_b__c;d.txt\"; filename*=UTF-8''a%22b__c%3Bd.txt"},
        {"r\xc3\xa9sum\xc3\xa9 100%.txt",
         "attachment; filename=\"r_sum_ 100_.txt\"; filename*=UTF-8''r%C3%A9sum%C3%A9%20100%25.txt"},
        {"../x\\y", "attachment; filename=\".._x_y\"; filename*=UTF-8''.._x_y"},
        {"\xff\xc0\x80.bin", "attachment; filename=\"___.bin\""},  // not UTF-8: no extended form
        {"", ""},
        // Cut to 255 bytes, never inside a character.
        {std::string(254, 'n') + "\xc3\xa9.txt",
         "attachment; filename=\"" + std::string(254, 'n') + "\"; filename*=UTF-8''" + std::string(254, 'n')},
    };
    FILE* file = fopen(path.c_str(), "r");
    ASSERT_NE(nullptr, file);
    for (const Case& c : cases) {
        const Reply r = ToFile(root_.Path(), [&] { return out_.Output(file, c.name, ""); });
        EXPECT_TRUE(r.ok);
        EXPECT_EQ(c.value, r.Header("Content-Disposition"));
        EXPECT_EQ("x", r.body);
    }
    fclose(file);

    EXPECT_EQ("attachment; filename=\"data\"; filename*=UTF-8''data",
              ToFile(root_.Path(), [&] { return out_.Output(path, ""); }).Header("Content-Disposition"));
    out_.SetWriteDisposition(false);
    EXPECT_EQ("", ToFile(root_.Path(), [&] { return out_.Output(path, ""); }).Header("Content-Disposition"));
}

TEST_F(HttpOutput, ClientGoneIsAFailureNotACrash)
{
    const std::string path = Write("big", Pattern(1024 * 1024));
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    close(fds[0]);  // nobody reads
    fflush(stdout);
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(fds[1], 1);
        close(fds[1]);
        const bool ok = out_.Output(path, "");
        sigset_t mask;
        sigprocmask(SIG_SETMASK, nullptr, &mask);
        sigset_t pending;
        sigpending(&pending);
        // 2: the call failed and left SIGPIPE neither blocked nor pending.
        _exit(!ok && !sigismember(&mask, SIGPIPE) && !sigismember(&pending, SIGPIPE) ? 2 : 1);
    }
    close(fds[1]);
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    ASSERT_TRUE(WIFEXITED(status)) << "killed by signal " << WTERMSIG(status);
    EXPECT_EQ(2, WEXITSTATUS(status));
}

}  // namespace
