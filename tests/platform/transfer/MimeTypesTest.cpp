// MIME types of file names: the system's table, else the built-in one.
#include "platform/PlatformTest.h"
#include "vela/httpoutput.h"

namespace {

class MimeTypes : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        mkdir((root_.Path() + "/etc").c_str(), 0755);
    }
};

TEST_F(MimeTypes, FromTheSystemFileThenBuiltIn)
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
    VELA::Test::ScopedEnv root("VELA_ROOT", bare.Path().c_str());
    VELA::System::RootReset();
    EXPECT_EQ("application/zip", HTTPFileOutputer::GetMimeType("x.zip"));
    EXPECT_EQ("text/html", HTTPFileOutputer::GetMimeType("INDEX.HTML"));
    EXPECT_EQ("application/octet-stream", HTTPFileOutputer::GetMimeType("a.tst"));
}

}  // namespace
