// The multipart/form-data parser behind the upload calls: delimiters across
// the edges of its buffer, the Content-Type and its boundary.
#include <cstring>

#include "platform/transfer/MultipartBody.h"
#include "platform/transfer/MultipartReader.h"
#include "vela/upload.h"

namespace {

using namespace VELA::Test;
using namespace VELA::Transfer;

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
    const struct {
        std::string type;
        std::string boundary;  // empty: refused
    } cases[] = {
        {"Multipart/Form-Data; charset=utf-8; BOUNDARY=" + b70, b70},
        {"multipart/form-data; boundary=\"a b:c/d=e?\"", "a b:c/d=e?"},
        {"multipart/form-data;boundary=x", "x"},
        {"multipart/form-data; boundary=" + b70 + "b", ""},
        {"multipart/form-data; boundary=\"ends in space \"", ""},
        {"multipart/form-data; boundary=\"bad@char\"", ""},
        {"multipart/form-data; boundary=\"\"", ""},
        {"multipart/form-data; boundary=a; boundary=a", ""},
        {"multipart/form-data", ""},
        {"multipart/mixed; boundary=x", ""},
        {"application/x-www-form-urlencoded", ""},
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
