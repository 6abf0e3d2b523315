// The upload calls (vela/upload.h) and the multipart/form-data parser
// behind them: bodies fed through memfds and pipes, files stored in a fresh
// directory, delimiters across the edges of the parser's buffer, the
// Content-Type and its boundary.

#include <cstring>
#include <sys/resource.h>
#include <thread>

#include "platform/system/FileUtil.h"
#include "platform/transfer/MultipartBody.h"
#include "platform/transfer/MultipartReader.h"
#include "vela/upload.h"

namespace {

using namespace VELA::Test;
using namespace VELA::Transfer;

TEST(UploadRead, FieldsAndFilesFromOneForm)
{
    TempDir dir;
    const std::string binary = Tricky();
    const std::string body =
        "preamble to ignore\r\n" +
        Body({{"api", "VELA.Demo.Upload"},
              {"note", "two\r\nlines"}, {"file", binary, "C:\\Users\\me\\photo.jpg", true},
              {"file", "second file", "../x", true}, {"empty", "", "", true},  // a file input left empty: skipped
              {"tail", ""}}) + "epilogue\r\n";
    for (int viaPipe = 0; viaPipe < 2; ++viaPipe) {
        SCOPED_TRACE(viaPipe ? "pipe with small writes" : "memfd");
        Result r;
        if (viaPipe) {
            SlowPipe in(body);
            ReadAll(in.Fd(), body.size(), kType, dir.Path(), r);
        } else {
            ReadAllText(body, dir.Path(), r);
        }
        ASSERT_EQ(1, r.rc);
        EXPECT_EQ((std::map<std::string, std::string>{{"api", "VELA.Demo.Upload"}, {"note", "two\r\nlines"},
                                                      {"tail", ""}, {"file_name", "photo.jpg"}, {"file_2_name", "x"}}),
                  r.Fields());
        EXPECT_EQ(2, VLIBCSzHashCount(r.files));  // "empty" stored nothing
        EXPECT_EQ(binary, ReadText(r.File("file")));
        EXPECT_EQ("second file", ReadText(r.File("file_2")));
        for (const std::string& path : {r.File("file"), r.File("file_2")}) {
            EXPECT_EQ(dir.Path() + "/upload-", path.substr(0, dir.Path().size() + 8));
            EXPECT_EQ(0600u, Mode(path));
            unlink(path.c_str());
        }
        EXPECT_TRUE(DirEntries(dir.Path()).empty());
    }
}

// What the progress callback was told.
struct {
    unsigned long long calls = 0, done = 0, total = 0;
    bool monotonic = true;
} g_progress;

void OnProgress(unsigned long long done, unsigned long long total)
{
    g_progress.monotonic = g_progress.monotonic && done >= g_progress.done && done <= total;
    ++g_progress.calls;
    g_progress.done = done;
    g_progress.total = total;
}

long PeakRssKiB()
{
    struct rusage usage;
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_maxrss;
}

// A 64 MiB file streamed from a pipe: stored intact, progress reported per
// piece, and the process's peak memory grows by far less than the file.
TEST(UploadRead, LargeFileStreamsInBoundedMemory)
{
    TempDir dir;
    std::string content(64u << 20, '\0');
    for (size_t i = 0; i < content.size(); ++i) {
        content[i] = static_cast<char>((i * 2654435761u) >> 13);
    }
    const std::string head = std::string("--") + kBoundary + "\r\n" + PartHead({"big", "", "big.bin", true});
    const std::string tail = std::string("\r\n--") + kBoundary + "--\r\n";
    const unsigned long long length = head.size() + content.size() + tail.size();
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    std::thread writer([&] {
        for (const std::string* piece : std::initializer_list<const std::string*>{&head, &content, &tail}) {
            VELA::System::WriteAll(fds[1], piece->data(), piece->size());
        }
        close(fds[1]);
    });
    const long before = PeakRssKiB();
    Result r;
    ReadAll(fds[0], length, kType, dir.Path(), r, &OnProgress);
    const long grown = PeakRssKiB() - before;
    close(fds[0]);
    writer.join();
    ASSERT_EQ(1, r.rc);
    EXPECT_LT(grown, 8 * 1024) << "peak RSS grew by " << grown << " KiB";
    EXPECT_TRUE(g_progress.monotonic);
    EXPECT_EQ(length, g_progress.done);
    EXPECT_EQ(length, g_progress.total);
    EXPECT_LE(g_progress.calls, length / 4096);
    EXPECT_TRUE(ReadText(r.File("big")) == content) << "the stored file differs";
}

// Every malformed body fails with its code, removes the files the call
// created (a good file comes first in each) and leaves the tables empty.
TEST(UploadRead, BadBodiesLeaveNothingBehind)
{
    const std::string good = Body({{"ok", "stored first", "ok.txt", true}});
    const std::string open = good.substr(0, good.size() - 4);  // ends in "--boundary"
    const std::string dash = std::string("--") + kBoundary + "\r\n";
    const std::string field = "Content-Disposition: form-data; name=\"f\"\r\n\r\n";
    std::string manyFields;
    for (int i = 0; i <= 10000; ++i) {
        manyFields += dash + field + "v\r\n";
    }
    std::string manyLines;
    for (int i = 0; i < 17; ++i) {
        manyLines += "X-Pad: 1\r\n";
    }
    const struct { const char* what; std::string body; long long lengthDelta; int code; } cases[] = {
        {"input shorter than CONTENT_LENGTH", good, 10, VELA_UPLOAD_ERR_TRUNCATED},
        {"CONTENT_LENGTH cuts the close delimiter", good, -8, VELA_UPLOAD_ERR_SYNTAX},
        {"no close delimiter", open + "\r\n", 0, VELA_UPLOAD_ERR_SYNTAX},
        {"no boundary at all", "just some text\r\n", 0, VELA_UPLOAD_ERR_SYNTAX},
        {"junk after a delimiter", open + "junk\r\n", 0, VELA_UPLOAD_ERR_SYNTAX},
        {"no Content-Disposition", open + "\r\nContent-Type: text/plain\r\n\r\nx\r\n--" + kBoundary + "--\r\n", 0,
         VELA_UPLOAD_ERR_HEADER},
        {"two Content-Disposition", open + "\r\n" + field.substr(0, field.size() - 2) + field + "x\r\n", 0,
         VELA_UPLOAD_ERR_HEADER},
        {"Content-Disposition without a name", open + "\r\nContent-Disposition: form-data\r\n\r\n", 0,
         VELA_UPLOAD_ERR_HEADER},
        {"a repeated name", open + "\r\nContent-Disposition: form-data; name=a; name=b\r\n\r\n", 0,
         VELA_UPLOAD_ERR_HEADER},
        {"header line without end", open + "\r\nX-Long: " + std::string(9000, 'h'), 0, VELA_UPLOAD_ERR_HEADER},
        {"too many header lines", open + "\r\n" + manyLines + field + "x\r\n", 0, VELA_UPLOAD_ERR_HEADER},
        {"folded header line", open + "\r\n" + field.substr(0, field.size() - 2) + " more\r\n\r\n", 0,
         VELA_UPLOAD_ERR_HEADER},
        {"field above 64 KiB", open + "\r\n" + field + std::string(70000, 'v'), 0,
         VELA_UPLOAD_ERR_LIMIT},
        {"more than 10000 parts", good.substr(0, good.size() - strlen(kBoundary) - 6) + manyFields, 0,
         VELA_UPLOAD_ERR_LIMIT},
        {"NUL in a field", open + "\r\n" + field + std::string("a\0b", 3) + "\r\n--" + kBoundary + "--", 0,
         VELA_UPLOAD_ERR_FIELD},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        TempDir dir;
        VELA::Test::LogCapture log;
        Result r;
        ReadAllText(c.body, dir.Path(), r, c.lengthDelta);
        EXPECT_EQ(c.code, r.rc);
        EXPECT_TRUE(DirEntries(dir.Path()).empty());
        EXPECT_EQ(0, VLIBCSzHashCount(r.fields));
        EXPECT_EQ(0, VLIBCSzHashCount(r.files));
        EXPECT_FALSE(log.Lines().empty());  // each refusal says why
    }
}

TEST(UploadRead, ClientFileNamesAreReducedOrRefused)
{
    const struct { std::string sent; const char* stored; } cases[] = {  // the base name kept, null: refused
        {"../x", "x"}, {"a/b", "b"}, {"..\\..\\windows\\evil.dll", "evil.dll"}, {"..", nullptr}, {"a/..", nullptr},
        {"dir/", nullptr}, {std::string("a\0b", 3), nullptr}, {"tab\there", nullptr}, {std::string(256, 'n'), nullptr},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.sent);
        TempDir dir;
        Result r;
        ReadAllText(Body({{"f", "data", c.sent, true}}), dir.Path(), r);
        if (c.stored == nullptr) {
            EXPECT_EQ(VELA_UPLOAD_ERR_FILENAME, r.rc);
            EXPECT_TRUE(DirEntries(dir.Path()).empty());
            continue;
        }
        ASSERT_EQ(1, r.rc);
        EXPECT_EQ(c.stored, r.Field("f_name"));
        EXPECT_EQ(std::vector<std::string>{r.File("f").substr(dir.Path().size() + 1)}, DirEntries(dir.Path()));
    }
    // An empty name is a file input left empty: fine without content,
    // refused with content.
    TempDir dir;
    Result r;
    ReadAllText(Body({{"f", "data", "", true}}), dir.Path(), r);
    EXPECT_EQ(VELA_UPLOAD_ERR_FILENAME, r.rc);
}

// The step-by-step calls: fields up to a file, the file, the rest; a
// failure is final.
TEST(UploadRead, StepByStep)
{
    TempDir dir;
    const std::string body = Body({{"api", "A"}, {"doc", "content", "d.txt", true}, {"after", "B"}});
    const int fd = MemFd(body);
    UploadReader* reader = nullptr;
    ASSERT_EQ(1, UploadReaderOpen(fd, body.size(), kType.c_str(), &reader));
    char path[4096];
    EXPECT_EQ(VELA_UPLOAD_ERR_STATE, UploadReadFile(reader, dir.Path().c_str(), path, sizeof(path), nullptr, nullptr));
    Result r;
    ASSERT_EQ(1, UploadReadFields(reader, r.fields, nullptr));
    EXPECT_EQ("A", r.Field("api"));
    EXPECT_STREQ("doc", UploadPendingField(reader));
    EXPECT_STREQ("d.txt", UploadPendingFileName(reader));
    EXPECT_EQ(VELA_UPLOAD_ERR_ARGUMENT, UploadReadFile(reader, dir.Path().c_str(), path, 8, nullptr, nullptr));
    ASSERT_EQ(1, UploadReadFile(reader, dir.Path().c_str(), path, sizeof(path), r.files, nullptr));
    EXPECT_EQ("content", ReadText(path));
    EXPECT_EQ(path, r.File("doc"));
    EXPECT_EQ(nullptr, UploadPendingField(reader));
    // ReadAll picks up the rest and reports the whole body.
    Result all;
    ASSERT_EQ(1, UploadReadAll(reader, all.fields, all.files, dir.Path().c_str(), 0, nullptr));
    EXPECT_EQ((std::map<std::string, std::string>{{"api", "A"}, {"doc_name", "d.txt"}, {"after", "B"}}), all.Fields());
    EXPECT_EQ(path, all.File("doc"));
    EXPECT_EQ(body.size(), UploadConsumed(reader));
    UploadReaderFree(reader);
    close(fd);

    // After a failure every call repeats it.
    const std::string bad = std::string("--") + kBoundary + "\r\nX: y\r\n\r\n";
    const int badFd = MemFd(bad);
    ASSERT_EQ(1, UploadReaderOpen(badFd, bad.size(), kType.c_str(), &reader));
    EXPECT_EQ(VELA_UPLOAD_ERR_HEADER, UploadReadFields(reader, nullptr, nullptr));
    EXPECT_EQ(VELA_UPLOAD_ERR_HEADER, UploadReadAll(reader, all.fields, all.files, dir.Path().c_str(), 0, nullptr));
    EXPECT_EQ(VELA_UPLOAD_ERR_ARGUMENT, UploadReadAll(reader, all.fields, all.files, dir.Path().c_str(), 1, nullptr));
    UploadReaderFree(reader);
    close(badFd);
}

// The delimiter that ends a file lands on every position across the edge of
// the reader's buffer.
TEST(MultipartReader, DelimiterAcrossBufferEdges)
{
    TempDir dir;
    const std::string head = std::string("--") + kBoundary + "\r\n" + PartHead({"f", "", "a.bin", true});
    const size_t dlen = strlen(kBoundary) + 4;
    const size_t edge = kMultipartBufferSize - head.size();
    for (size_t size = edge - dlen - 2; size <= edge + 2; ++size) {
        std::string content(size, '\r');
        for (size_t i = 0; i < size; i += 7) {
            content[i] = static_cast<char>('a' + i % 26);
        }
        Result r;
        ReadAllText(Body({{"f", content, "a.bin", true}}), dir.Path(), r);
        ASSERT_EQ(1, r.rc) << size;
        ASSERT_EQ(content, ReadText(r.File("f"))) << size;
        unlink(r.File("f").c_str());
    }
}

TEST(MultipartReader, ContentTypeAndBoundary)
{
    const std::string b70(70, 'b');
    const struct { std::string type, boundary; } cases[] = {  // boundary empty: refused
        {"Multipart/Form-Data; charset=utf-8; BOUNDARY=" + b70, b70},
        {"multipart/form-data; boundary=\"a b:c/d=e?\"", "a b:c/d=e?"}, {"multipart/form-data;boundary=x", "x"},
        {"multipart/form-data; boundary=" + b70 + "b", ""}, {"multipart/form-data; boundary=\"ends in space \"", ""},
        {"multipart/form-data; boundary=\"bad@char\"", ""}, {"multipart/form-data; boundary=\"\"", ""},
        {"multipart/form-data; boundary=a; boundary=a", ""}, {"multipart/form-data", ""},
        {"multipart/mixed; boundary=x", ""}, {"application/x-www-form-urlencoded", ""},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.type);
        std::string boundary;
        EXPECT_EQ(!c.boundary.empty(), ParseMultipartContentType(c.type.c_str(), boundary));
        EXPECT_EQ(c.boundary, boundary);
    }
    UploadReader* reader = nullptr;
    EXPECT_EQ(VELA_UPLOAD_ERR_CONTENT_TYPE, UploadReaderOpen(0, 10, "text/plain", &reader));
    EXPECT_EQ(VELA_UPLOAD_ERR_NO_BODY, UploadReaderOpen(0, 0, kType.c_str(), &reader));
    EXPECT_EQ(nullptr, reader);

    // A quoted boundary with blanks works end to end, padding after it too.
    TempDir dir;
    const std::string body = "--a b\t \r\nContent-Disposition: form-data; name=\"k\"\r\n\r\nv\r\n--a b--";
    const int fd = MemFd(body);
    Result r;
    ReadAll(fd, body.size(), "multipart/form-data; boundary=\"a b\"", dir.Path(), r);
    close(fd);
    EXPECT_EQ(1, r.rc);
    EXPECT_EQ("v", r.Field("k"));
}

}  // namespace
