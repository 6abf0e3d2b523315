// HTTP file output: whole files through a pipe and a file,
// byte ranges, X-Sendfile only for paths nobody else can change, nginx's
// X-Accel-Redirect, links on the path refused, refusals, the disposition
// header, a client that goes away.

#include <csignal>
#include <cstdio>
#include <fcntl.h>
#include <iostream>
#include <poll.h>
#include <regex>
#include <sys/socket.h>

#include "platform/PlatformTest.h"
#include "platform/system/FileUtil.h"
#include "vela/httpoutput.h"

namespace {

using VELA::HTTP::FileOutputerHelper;
using VELA::Test::ScopedEnv;

// What an output call wrote, split at the empty line after the headers.
struct Reply {
    Reply(bool ok, const std::string& out) : ok(ok), complete(out.find("\r\n\r\n") != std::string::npos)
    {
        head = complete ? out.substr(0, out.find("\r\n\r\n") + 2) : out;
        body = complete ? out.substr(head.size() + 2) : "";
    }
    // The value of header `name`, "" when absent.
    std::string Header(const std::string& name) const
    {
        std::smatch m;
        return std::regex_search(head, m, std::regex("(^|\r\n)" + name + ": ([^\r]*)")) ? m[2].str() : "";
    }

    bool ok;
    bool complete;     // the empty line was there
    std::string head;  // the header block without its empty line
    std::string body;
};

// Expects each header of `want` in `r`, "" for one that must be absent.
void ExpectHeaders(const Reply& r, std::initializer_list<std::pair<const char*, std::string>> want,
                   const std::string& what = "")
{
    for (const auto& header : want) {
        EXPECT_EQ(header.second, r.Header(header.first)) << what << ": " << header.first;
    }
}

// Runs `fn` in a child whose standard output is a pipe read by this
// process.
Reply ThroughPipe(const std::function<bool()>& fn)
{
    int fds[2];
    EXPECT_EQ(0, pipe(fds));
    VELA::Test::Children child(1, [&](int) {
        dup2(fds[1], 1);
        return fn() ? 0 : 1;
    });
    close(fds[1]);
    std::string out;
    char buf[65536];
    for (ssize_t n; (n = read(fds[0], buf, sizeof(buf))) > 0;) {
        out.append(buf, static_cast<size_t>(n));
    }
    close(fds[0]);
    return Reply(child.Wait() == std::vector<int>{0}, out);
}

std::string Pattern(size_t size)
{
    std::string data(size, '\0');
    for (size_t i = 0; i < size; ++i) {
        data[i] = static_cast<char>((i * 131 + i / 7) & 0xff);
    }
    return data;
}

class HttpOutput : public RootTest {
protected:
    HttpOutput()
    {
        FileOutputerHelper::SetFastOutputEnabled(true);
        mkdir(files_.c_str(), 0755);
    }
    std::string Write(const std::string& name, const std::string& data)
    {
        VELA::Test::WriteFile(files_ + "/" + name, data);
        return files_ + "/" + name;
    }
    // Runs `fn` with standard output on a new file opened with `flags` (extra
    // open flags), in this process.
    Reply ToFile(const std::function<bool()>& fn, int flags = 0)
    {
        const std::string path = In("/stdout");
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
        return Reply(ok, VELA::Test::ReadText(path));
    }
    // The file at `path` sent with the MIME type `type`.
    Reply Send(const std::string& path, const char* type = "")
    {
        return ToFile([&] { return out_.Output(path, type); });
    }

    // A directory below which only root may change anything, for fast
    // output: /run when it is root's alone (the checkout may sit below
    // /tmp, which anyone may write to), else the build directory.
    static const char* SafeBase()
    {
        const char* build = getenv("VELA_TEST_BINARY_DIR");
        EXPECT_NE(nullptr, build) << "run through CTest";
        struct stat st;
        const bool run = geteuid() == 0 && stat("/run", &st) == 0 && st.st_uid == 0 && (st.st_mode & 022) == 0;
        return run ? "/run" : build;
    }

    ScopedEnv range_{"HTTP_RANGE", nullptr};
    ScopedEnv ifRange_{"HTTP_IF_RANGE", nullptr};
    ScopedEnv method_{"REQUEST_METHOD", "GET"};
    std::string files_ = root_.Path() + "/files";
    HTTPFileOutputer out_;
};

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
    for (const Reply& r : {ThroughPipe(send), ToFile(send), ToFile(send, O_APPEND)}) {
        EXPECT_TRUE(r.ok);
        EXPECT_EQ(0u, r.head.find("X-From-Cout: 1\r\nX-From-Stdio: 2\r\n"));
        ExpectHeaders(r, {{"Content-Type", "application/x-test"}, {"Content-Length", std::to_string(data.size())},
                          {"Accept-Ranges", "bytes"}, {"X-Content-Type-Options", "nosniff"}, {"Status", ""}});
        EXPECT_TRUE(r.body == data) << "body of " << r.body.size() << " bytes differs";
    }

    ScopedEnv head("REQUEST_METHOD", "HEAD");
    const Reply r = Send(path);
    EXPECT_TRUE(r.ok && r.complete);
    ExpectHeaders(r, {{"Content-Length", std::to_string(data.size())}, {"Content-Type", "application/octet-stream"}});
    EXPECT_EQ("", r.body);
}

// A stream that is not a regular file (a pipe, a socket) goes out to its
// end without a length and without ranges, from where its reader stands:
// bytes already in the stream's buffer included.
TEST_F(HttpOutput, StreamsWithoutALength)
{
    // Larger than a pipe's buffer and than the copy buffer.
    const std::string data = Pattern(2 * 1024 * 1024 + 5);
    ScopedEnv range("HTTP_RANGE", "bytes=0-9");
    const struct { const char* what; int domain; bool nonBlocking; } kinds[] = {  // domain -1: a pipe
        {"pipe", -1, false}, {"non-blocking pipe", -1, true}, {"socket", AF_UNIX, false}};
    for (const auto& kind : kinds) {
        int fds[2];
        ASSERT_EQ(0, kind.domain < 0 ? pipe(fds) : socketpair(kind.domain, SOCK_STREAM, 0, fds)) << kind.what;
        VELA::Test::Children writer(1, [&](int) {
            close(fds[0]);
            return VELA::System::WriteAll(fds[1], data.data(), data.size()) ? 0 : 1;
        });
        close(fds[1]);
        if (kind.nonBlocking) {
            ASSERT_EQ(0, fcntl(fds[0], F_SETFL, fcntl(fds[0], F_GETFL) | O_NONBLOCK));
        }
        FILE* stream = fdopen(fds[0], "r");
        ASSERT_NE(nullptr, stream);
        struct pollfd in = {fds[0], POLLIN, 0};
        ASSERT_EQ(1, poll(&in, 1, -1));
        ASSERT_EQ(data[0], static_cast<char>(fgetc(stream)));  // the rest of a buffer is left in the stream
        const Reply r = ThroughPipe([&] { return out_.Output(stream, "made.tar", "application/x-tar"); });
        fclose(stream);
        writer.Wait();
        EXPECT_TRUE(r.ok) << kind.what;
        ExpectHeaders(r, {{"Content-Type", "application/x-tar"},
                          {"Content-Disposition", "attachment; filename=\"made.tar\"; filename*=UTF-8''made.tar"},
                          {"Accept-Ranges", "none"}, {"X-Content-Type-Options", "nosniff"}, {"Content-Length", ""},
                          {"Status", ""}, {"Content-Range", ""}, {"Last-Modified", ""}},
                      kind.what);
        EXPECT_TRUE(r.body == data.substr(1)) << kind.what << ": body of " << r.body.size() << " bytes differs";
    }

    // HEAD: the headers only.
    ScopedEnv head("REQUEST_METHOD", "HEAD");
    FILE* stream = popen("echo generated", "r");
    ASSERT_NE(nullptr, stream);
    const Reply r = ToFile([&] { return out_.Output(stream, "", ""); });
    pclose(stream);
    EXPECT_TRUE(r.ok && r.complete);
    ExpectHeaders(r, {{"Content-Type", "application/octet-stream"}, {"Content-Length", ""}});
    EXPECT_EQ("", r.body);
}

TEST_F(HttpOutput, SingleRanges)
{
    const std::string data = Pattern(1000);
    const std::string path = Write("r.bin", data);
    const struct { const char* range; int status; size_t first, last; } cases[] = {  // status 200, 206 or 416
        {"bytes=10-19", 206, 10, 19},   {"bytes=990-", 206, 990, 999},   {"bytes=-5", 206, 995, 999},
        {"bytes=-5000", 206, 0, 999},   {"bytes=900-5000", 206, 900, 999}, {" BYTES=0-0 ", 206, 0, 0},
        {"bytes=1000-", 416, 0, 0},     {"bytes=-0", 416, 0, 0}, {"bytes=99999999999999999999999-", 416, 0, 0},
        {"bytes=5-1", 200, 0, 999},     {"bytes=0-1,5-6", 200, 0, 999},  {"bytes=abc", 200, 0, 999},
        {"items=0-1", 200, 0, 999},     {"bytes=1-2x", 200, 0, 999},     {"bytes=", 200, 0, 999},
    };
    for (const auto& c : cases) {
        ScopedEnv range("HTTP_RANGE", c.range);
        const Reply r = Send(path, "text/plain");
        EXPECT_TRUE(r.ok && r.complete) << c.range;
        if (c.status == 416) {
            ExpectHeaders(r, {{"Status", "416 Range Not Satisfiable"}, {"Content-Range", "bytes */1000"}}, c.range);
            EXPECT_EQ("", r.body) << c.range;
            continue;
        }
        const std::string part = data.substr(c.first, c.last - c.first + 1);
        const std::string sent = "bytes " + std::to_string(c.first) + "-" + std::to_string(c.last) + "/1000";
        ExpectHeaders(r, {{"Status", c.status == 206 ? "206 Partial Content" : ""},
                          {"Content-Range", c.status == 206 ? sent : ""},
                          {"Content-Length", std::to_string(part.size())}},
                      c.range);
        EXPECT_TRUE(r.body == part) << c.range;
    }

    // If-Range: only the date the file was sent with keeps the range.
    ScopedEnv range("HTTP_RANGE", "bytes=0-9");
    const std::string modified = Send(path).Header("Last-Modified");
    ASSERT_NE("", modified);
    for (const auto& ifRange :
         {std::make_pair(modified, size_t{10}), std::make_pair(std::string("\"some-etag\""), data.size())}) {
        ScopedEnv env("HTTP_IF_RANGE", ifRange.first.c_str());
        EXPECT_EQ(ifRange.second, Send(path).body.size()) << ifRange.first;
    }
    EXPECT_EQ("bytes */0", Send(Write("empty", "")).Header("Content-Range"));
}

TEST_F(HttpOutput, FastOutputOnlyForPathsNobodyElseCanChange)
{
    // X-Sendfile may be used at all only below a directory only root may
    // change: /run when it is root's alone (the checkout may sit below /tmp,
    // which anyone may write to), else the build directory.
    ScopedEnv base("TMPDIR", SafeBase());
    const VELA::Test::TempDir safe;
    const std::string dir = safe.Path();
    chmod(dir.c_str(), 0755);
    mkdir((dir + "/sub").c_str(), 0755);
    const std::string path = dir + "/a b%c.txt";
    VELA::Test::WriteFile(path, "content");
    ASSERT_FALSE(FileOutputerHelper::IsFastOutputEnabled());  // nothing configured

    Conf("webapi.conf", "xsendfile=\"YES\"\n");
    VELA::Test::TempDir other;  // another root: the configuration is read again
    {
        ScopedEnv root("VELA_ROOT", other.Path().c_str());
        VELA::System::RootReset();
        EXPECT_FALSE(FileOutputerHelper::IsFastOutputEnabled());
    }
    VELA::System::RootReset();
    ASSERT_TRUE(FileOutputerHelper::IsFastOutputEnabled());
    char* real = realpath(dir.c_str(), nullptr);
    ASSERT_NE(nullptr, real);
    const std::string expected = std::string(real) + "/a%20b%25c.txt";
    free(real);
    const int fd = open(path.c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    const std::function<bool()> byServer[] = {
        [&] { return out_.Output(path, "text/plain"); },
        [&] { return out_.Output(dir + "/sub/../a b%c.txt", "text/plain"); },
        [&] { return out_.Output(fd, "a b%c.txt", "text/plain"); },
    };
    for (const auto& call : byServer) {
        const Reply r = ToFile(call);
        EXPECT_TRUE(r.ok && r.complete);
        ExpectHeaders(r, {{"X-Sendfile", expected}, {"Content-Type", "text/plain"},
                          {"X-Content-Type-Options", "nosniff"},
                          {"Content-Disposition", "attachment; filename=\"a b_c.txt\"; filename*=UTF-8''a%20b%25c.txt"},
                          {"Content-Length", ""}});
        EXPECT_EQ("", r.body);
    }
    close(fd);

    // The same file in places someone else could change before the web
    // server opens it: sent from the open descriptor instead.
    const auto place = [&](const std::string& folder, mode_t folderMode, mode_t fileMode, uid_t owner) {
        mkdir(folder.c_str(), 0755);
        chmod(folder.c_str(), folderMode);
        const std::string file = folder + "/f.txt";
        VELA::Test::WriteFile(file, "content", fileMode);
        EXPECT_EQ(0, owner == getuid() ? 0 : chown(folder.c_str(), owner, static_cast<gid_t>(-1)));
        return file;
    };
    mkdir((dir + "/open").c_str(), 0755);
    chmod((dir + "/open").c_str(), 0777);
    std::vector<std::string> streamed = {
        place(dir + "/others", 0777, 0644, getuid()), place(dir + "/sticky", 01777, 0644, getuid()),
        place(dir + "/group", 0775, 0644, getuid()),
        place(dir + "/open/deeper", 0755, 0644, getuid()),  // an ancestor others may write to
        place(dir + "/file-others", 0755, 0666, getuid()), place(dir + "/file-group", 0755, 0664, getuid()),
        dir + "/evil\r\nX-Injected: 1",
    };
    std::ofstream(streamed.back()) << "content";
    if (getuid() == 0) {
        streamed.push_back(place(dir + "/nobody", 0755, 0644, 65534));
    }
    for (const std::string& file : streamed) {
        VELA::Test::LogCapture log;
        const Reply r = Send(file, "text/plain");
        EXPECT_TRUE(r.ok) << file;
        ExpectHeaders(r, {{"X-Sendfile", ""}, {"X-Injected", ""}, {"Content-Length", "7"}}, file);
        EXPECT_EQ("content", r.body) << file;
        EXPECT_TRUE(log.Contains("X-Sendfile not used")) << file;
    }

    // Streamed as well: a descriptor whose path was swapped for a link
    // after the open (its own file goes out, never the link's target), a
    // stream, and any file once the helper is switched off.
    const std::string swapped = dir + "/swapped.txt";
    VELA::Test::WriteFile(swapped, "mine");
    const int mine = open(swapped.c_str(), O_RDONLY);
    ASSERT_GE(mine, 0);
    ASSERT_EQ(0, symlink(path.c_str(), (dir + "/link").c_str()));
    ASSERT_EQ(0, rename((dir + "/link").c_str(), swapped.c_str()));
    FILE* file = fopen(path.c_str(), "r");
    ASSERT_NE(nullptr, file);
    const std::pair<std::function<bool()>, std::string> direct[] = {
        {[&] { return out_.Output(mine, "swapped.txt", ""); }, "mine"},
        {[&] { return out_.Output(file, "f", ""); }, "content"},
        {[&] {
             FileOutputerHelper::SetFastOutputEnabled(false);
             return !FileOutputerHelper::IsFastOutputEnabled() && out_.Output(path, "");
         },
         "content"},
    };
    for (const auto& [call, body] : direct) {
        const Reply r = ToFile(call);
        EXPECT_TRUE(r.ok) << body;
        ExpectHeaders(r, {{"X-Sendfile", ""}}, body);
        EXPECT_EQ(body, r.body);
    }
    close(mine);
    fclose(file);
}

// nginx's form of fast output: X-Accel-Redirect to the configured internal
// prefix, the path encoded as for X-Sendfile ("?" and "#" included, which
// nginx would take for a query or a fragment). A prefix nginx could read
// otherwise turns fast output off: the file is streamed. For a server that
// decodes no path, only paths that need no encoding are handed over.
TEST_F(HttpOutput, AccelRedirectAndHowTheServerTakesThePath)
{
    ScopedEnv base("TMPDIR", SafeBase());
    const VELA::Test::TempDir safe;
    chmod(safe.Path().c_str(), 0755);
    const std::string path = safe.Path() + "/r?x #.bin";
    VELA::Test::WriteFile(path, "content");
    char* real = realpath(safe.Path().c_str(), nullptr);
    ASSERT_NE(nullptr, real);
    const std::string encoded = std::string(real) + "/r%3Fx%20%23.bin";
    free(real);

    // The configuration is read once per system root: another root and
    // back makes it read again.
    const VELA::Test::TempDir other;
    const auto configure = [&](const std::string& prefix, const std::string& more = "") {
        Conf("webapi.conf", "xsendfile=\"yes\"\nxaccel_prefix=\"" + prefix + "\"\n" + more);
        {
            ScopedEnv root("VELA_ROOT", other.Path().c_str());
            VELA::System::RootReset();
            EXPECT_FALSE(FileOutputerHelper::IsFastOutputEnabled());
        }
        VELA::System::RootReset();
    };
    const std::pair<std::string, const char*> taken[] = {  // the prefix and the header it makes
        {"", "X-Sendfile"}, {"/vela-internal", "X-Accel-Redirect"}, {"/a/b.c_d~", "X-Accel-Redirect"}};
    for (const auto& [prefix, header] : taken) {
        configure(prefix);
        const Reply r = Send(path, "text/plain");
        EXPECT_TRUE(r.ok && r.complete) << prefix;
        const char* absent = std::string(header) == "X-Sendfile" ? "X-Accel-Redirect" : "X-Sendfile";
        ExpectHeaders(r, {{header, prefix + encoded}, {absent, ""}, {"Content-Length", ""},
                          {"Content-Type", "text/plain"}, {"X-Content-Type-Options", "nosniff"}},
                      prefix);
        EXPECT_EQ("", r.body) << prefix;
    }
    for (const std::string& prefix : {std::string("vela"), std::string("/"), std::string("/vela/"),
                                      std::string("//vela"), std::string("/a/../b"), std::string("/a/./b"),
                                      std::string("/.hidden"), std::string("/a b"), std::string("/a?b"),
                                      std::string("/a%2fb"), std::string("/a\\b"), "/" + std::string(128, 'p')}) {
        configure(prefix);
        VELA::Test::LogCapture log;
        const Reply r = Send(path, "text/plain");
        EXPECT_TRUE(r.ok) << prefix;
        ExpectHeaders(r, {{"X-Accel-Redirect", ""}, {"X-Sendfile", ""}, {"Content-Length", "7"}}, prefix);
        EXPECT_EQ("content", r.body) << prefix;
        EXPECT_TRUE(log.Contains("xaccel_prefix")) << prefix;
    }

    configure("", "xsendfile_encoded=\"No\"\n");
    {
        VELA::Test::LogCapture log;
        const Reply r = Send(path, "text/plain");
        ExpectHeaders(r, {{"X-Sendfile", ""}, {"Content-Length", "7"}}, "encoded path, raw server");
        EXPECT_EQ("content", r.body);
        EXPECT_TRUE(log.Contains("takes no percent-encoded path"));
    }
    const std::string plain = safe.Path() + "/plain-1.txt";
    VELA::Test::WriteFile(plain, "content");
    real = realpath(plain.c_str(), nullptr);
    ASSERT_NE(nullptr, real);
    const std::string plainReal = real;
    free(real);
    const Reply r = Send(plain, "text/plain");
    ExpectHeaders(r, {{"X-Sendfile", plainReal}, {"Content-Length", ""}}, "plain path, raw server");
    EXPECT_EQ("", r.body);
}

// What is not a regular file is refused before anything is written, and so
// is a link anywhere on the path, the last component or a directory on the
// way (how the path is opened: FileUtilTest.cpp).
TEST_F(HttpOutput, RefusesLinksAndWhatIsNotARegularFile)
{
    VELA::Test::MakeLinkTree(files_);
    const std::string fifo = files_ + "/fifo";
    ASSERT_EQ(0, mkfifo(fifo.c_str(), 0600));
    FILE* writeOnly = fopen((files_ + "/w").c_str(), "w");
    ASSERT_NE(nullptr, writeOnly);
    const int dirFd = open(files_.c_str(), O_RDONLY | O_DIRECTORY);
    const int fifoFd = open(fifo.c_str(), O_RDONLY | O_NONBLOCK);
    const int pathFd = open((files_ + "/w").c_str(), O_PATH);  // names a file, cannot read it
    ASSERT_TRUE(dirFd >= 0 && fifoFd >= 0 && pathFd >= 0);
    FILE* dirStream = fdopen(dup(dirFd), "r");
    ASSERT_NE(nullptr, dirStream);
    for (const std::string& path : {files_, fifo}) {
        errno = 0;
        EXPECT_EQ(-1, HTTPFileOutputer::OpenForOutput(path)) << path;
        EXPECT_EQ(EINVAL, errno) << path;
    }
    // Each call with what it must log ("": nothing in particular). The FIFO
    // must not make it wait for a writer.
    std::vector<std::pair<std::string, std::function<bool()>>> calls;
    for (const std::string& path : {files_ + "/last", files_ + "/middle/in.txt", files_ + "/relative/in.txt", files_,
                                    fifo, files_ + "/missing", std::string("a\0b", 3)}) {
        calls.push_back({calls.size() < 3 ? "symbolic link" : "", [this, path] { return out_.Output(path, ""); }});
    }
    for (FILE* stream : {static_cast<FILE*>(nullptr), dirStream, writeOnly}) {
        calls.push_back({"", [this, stream] { return out_.Output(stream, "n", ""); }});
    }
    for (int fd : {dirFd, fifoFd, fileno(writeOnly), pathFd, -1}) {
        calls.push_back({"", [this, fd] { return out_.Output(fd, "n", ""); }});
    }
    for (size_t i = 0; i < calls.size(); ++i) {
        VELA::Test::LogCapture log;
        const Reply r = ToFile(calls[i].second);
        EXPECT_FALSE(r.ok) << "call " << i;
        EXPECT_EQ("", r.head) << "call " << i;
        EXPECT_TRUE(calls[i].first.empty() || log.Contains(calls[i].first)) << "call " << i;
    }
    fclose(dirStream);
    fclose(writeOnly);
    for (int fd : {dirFd, fifoFd, pathFd}) {
        close(fd);
    }

    // A caller that trusts its links may have them followed.
    out_.SetFollowSymlinks(true);
    EXPECT_EQ("secret", Send(files_ + "/last").body);
    EXPECT_EQ("in", Send(files_ + "/middle/in.txt").body);
}

TEST_F(HttpOutput, DispositionNamesAreSafe)
{
    const std::string path = Write("data", "x");
    const std::pair<std::string, std::string> cases[] = {  // the name and the header, "" for none
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
    for (const auto& [name, value] : cases) {
        const Reply r = ToFile([&] { return out_.Output(file, name, ""); });
        EXPECT_TRUE(r.ok);
        EXPECT_EQ(value, r.Header("Content-Disposition"));
        EXPECT_EQ("x", r.body);
    }
    fclose(file);

    EXPECT_EQ("attachment; filename=\"data\"; filename*=UTF-8''data", Send(path).Header("Content-Disposition"));
    out_.SetWriteDisposition(false);
    EXPECT_EQ("", Send(path).Header("Content-Disposition"));
}

TEST_F(HttpOutput, ClientGoneIsAFailureNotACrash)
{
    const std::string path = Write("big", Pattern(1024 * 1024));
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    close(fds[0]);  // nobody reads
    // 2: the call failed and left SIGPIPE neither blocked nor pending (128 +
    // the signal: it killed the process).
    EXPECT_EQ(std::vector<int>{2}, VELA::Test::InChildren(1, [&](int) {
                  dup2(fds[1], 1);
                  const bool ok = out_.Output(path, "");
                  sigset_t mask, pending;
                  sigprocmask(SIG_SETMASK, nullptr, &mask);
                  sigpending(&pending);
                  return !ok && !sigismember(&mask, SIGPIPE) && !sigismember(&pending, SIGPIPE) ? 2 : 1;
              }));
    close(fds[1]);
}

// The MIME type of a file name: the system's table, else the built-in one.
TEST_F(HttpOutput, MimeTypesFromTheSystemFileThenBuiltIn)
{
    mkdir(In("/etc").c_str(), 0755);
    VELA::Test::WriteFile(In("/etc/mime.types"), "# comment png\n\ntext/x-test\t\ttst TSX\napplication/pdf pdf\n"
                                                 "  image/png png\nno-slash abc\ntext/second tst\n");
    EXPECT_EQ("text/x-test", HTTPFileOutputer::GetMimeType("a.tst"));
    EXPECT_EQ("text/x-test", HTTPFileOutputer::GetMimeType("/x/A.TsX"));
    EXPECT_EQ("application/pdf", HTTPFileOutputer::GetMimeType("archive.tar.PDF"));
    EXPECT_EQ("image/png", HTTPFileOutputer::GetMimeType("p.png"));
    for (const char* unknown : {"x.abc", "noext", "dir.pdf/file", "trailing.", "x.zip"}) {
        EXPECT_EQ("application/octet-stream", HTTPFileOutputer::GetMimeType(unknown)) << unknown;
    }

    VELA::Test::TempDir bare;
    ScopedEnv root("VELA_ROOT", bare.Path().c_str());
    VELA::System::RootReset();
    EXPECT_EQ("application/zip", HTTPFileOutputer::GetMimeType("x.zip"));
    EXPECT_EQ("text/html", HTTPFileOutputer::GetMimeType("INDEX.HTML"));
    EXPECT_EQ("application/octet-stream", HTTPFileOutputer::GetMimeType("a.tst"));
}

}  // namespace
