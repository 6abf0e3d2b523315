// APIUpload: result codes, the temporary directory choice under a fresh
// system root, and the step-by-step reads of a deferred upload. The body
// comes on standard input, as in the CGI program.
#include <gtest/gtest.h>

#include <fstream>
#include <memory>
#include <string>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>
#include <vector>

#include "platform/StateRootTest.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "transfer/APIUploadPrivate.h"
#include "vela/sysfile.h"
#include "vela/upload.h"
#include "webapi/APIRequest.h"
#include "webapi/APIUpload.h"

namespace {

using VELA::Test::DirEntries;
using VELA::Test::ReadText;
using VELA::Test::ScopedEnv;

const char kType[] = "multipart/form-data; boundary=XyZ";

std::string FieldPart(const std::string& name, const std::string& value)
{
    return "--XyZ\r\nContent-Disposition: form-data; name=\"" + name + "\"\r\n\r\n" + value + "\r\n";
}

std::string FilePart(const std::string& name, const std::string& file, const std::string& content)
{
    return "--XyZ\r\nContent-Disposition: form-data; name=\"" + name + "\"; filename=\"" + file +
           "\"\r\nContent-Type: text/plain\r\n\r\n" + content + "\r\n";
}

const std::string kClose = "--XyZ--\r\n";

unsigned long long g_progressDone;
void OnProgress(unsigned long long done, unsigned long long) { g_progressDone = done; }

class Upload : public StateRootTest {
protected:
    void SetUp() override
    {
        StateRootTest::SetUp();
        VelaCgiUploadReset();
        for (const char* dir : {"/tmp", "/etc", "/etc/vela", "/etc.defaults"}) {
            Mkdir(dir);
        }
        savedStdin_ = dup(STDIN_FILENO);
    }
    void TearDown() override
    {
        dup2(savedStdin_, STDIN_FILENO);
        close(savedStdin_);
        VelaCgiUploadReset();
        for (auto it = mounts_.rbegin(); it != mounts_.rend(); ++it) {
            umount2(it->c_str(), MNT_DETACH);
        }
        StateRootTest::TearDown();
    }

    void Mkdir(const std::string& path) { mkdir(In(path).c_str(), 0755); }
    void Write(const std::string& path, const std::string& text)
    {
        ASSERT_TRUE(std::ofstream(In(path)) << text) << path;
    }
    bool MountTmpfs(const std::string& path, const char* size)
    {
        if (geteuid() != 0 || mount("tmpfs", path.c_str(), "tmpfs", 0, size) != 0) {
            return false;
        }
        mounts_.push_back(path);
        return true;
    }

    // The body on standard input, CONTENT_LENGTH (the body's size unless
    // given) in the process and the request environment.
    void Send(const std::string& body, std::string length = "")
    {
        if (length.empty()) {
            length = std::to_string(body.size());
        }
        const int fd = memfd_create("body", MFD_CLOEXEC);
        ASSERT_EQ(static_cast<ssize_t>(body.size()), write(fd, body.data(), body.size()));
        lseek(fd, 0, SEEK_SET);
        dup2(fd, STDIN_FILENO);
        close(fd);
        lengthEnv_.reset();  // restores the old value first
        lengthEnv_.reset(new ScopedEnv("CONTENT_LENGTH", length.c_str()));
        request_.reset(new VELA::APIRequest(J(R"({"environ": {"REQUEST_METHOD": "POST", "CONTENT_TYPE": ")" +
                                                std::string(kType) + R"(", "CONTENT_LENGTH": ")" + length + "\"}}")));
    }

    ScopedEnv typeEnv_{"CONTENT_TYPE", kType};
    std::unique_ptr<ScopedEnv> lengthEnv_;
    std::unique_ptr<VELA::APIRequest> request_{new VELA::APIRequest()};
    std::vector<std::string> mounts_;
    int savedStdin_ = -1;
};

TEST_F(Upload, AllFieldsAndFilesIntoTmp)
{
    Send(FieldPart("api", "VELA.Demo.Upload") + FilePart("file", "a.txt", "alpha\r\n") +
         FilePart("file", "b.txt", "beta") + FieldPart("note", "n") + kClose);
    VELA::APIUpload upload(request_.get());
    g_progressDone = 0;
    upload.SetUploadCallback(&OnProgress);
    Json::Value params;
    Json::Value files(Json::arrayValue);
    ASSERT_EQ(1, upload.GetUploadAll(params, &files));
    EXPECT_EQ("VELA.Demo.Upload", params["api"].asString());
    EXPECT_EQ("n", params["note"].asString());
    EXPECT_EQ("a.txt", params["file_name"].asString());
    EXPECT_EQ("b.txt", params["file_2_name"].asString());
    ASSERT_EQ(2u, files.size());
    EXPECT_EQ(files[0], params["file"]);
    EXPECT_EQ(files[1], params["file_2"]);
    EXPECT_EQ(In("/tmp/"), files[0].asString().substr(0, In("/tmp/").size()));
    EXPECT_EQ("alpha\r\n", ReadText(files[0].asString()));
    EXPECT_EQ("beta", ReadText(files[1].asString()));
    EXPECT_EQ(std::stoull(request_->GetEnv("CONTENT_LENGTH").asString()), g_progressDone);
}

TEST_F(Upload, NothingToUpload)
{
    Json::Value params;
    for (const char* length : {"0", "abc", ""}) {
        Send("", length);
        if (*length == '\0') {
            request_.reset(new VELA::APIRequest());  // no CONTENT_LENGTH at all
        }
        EXPECT_EQ(-6, VELA::APIUpload(request_.get()).GetUploadAll(params, nullptr)) << length;
    }
    EXPECT_TRUE(DirEntries(In("/tmp")).empty());
    EXPECT_NE(0, access(In("/var").c_str(), F_OK));
}

// Where the body goes: a data volume's "@tmp" unless the system is a
// "mintbox"; "/tmp"; "/var/tmp" when "/tmp" is of no use.
TEST_F(Upload, TemporaryDirectoryChoice)
{
    Mkdir("/volume1");
    Conf("volumes.conf", "/volume1\n");
    VELA::APIUploadPrivate upload(nullptr, request_.get());
    std::string dir;
    ASSERT_TRUE(upload.FindUploadTmpDir(dir, 1024));
    EXPECT_EQ(In("/volume1/@tmp"), dir);
    struct stat st;
    ASSERT_EQ(0, stat(dir.c_str(), &st));
    EXPECT_EQ(01777u, st.st_mode & 07777);

    Write("/etc.defaults/velainfo.conf", "mintbox=\"yes\"\n");
    ASSERT_TRUE(upload.FindUploadTmpDir(dir, 1024));
    EXPECT_EQ(In("/tmp"), dir);

    rmdir(In("/tmp").c_str());  // statvfs of "/tmp" fails: the root file system
    ASSERT_TRUE(upload.FindUploadTmpDir(dir, 1024));
    EXPECT_EQ(In("/var/tmp"), dir);
    ASSERT_EQ(0, stat(dir.c_str(), &st));
    EXPECT_EQ(0700u, st.st_mode & 07777);

    // Nothing has room for that much.
    EXPECT_FALSE(upload.FindUploadTmpDir(dir, 1ULL << 62));
    EXPECT_EQ(VLIBC_ERR_NO_SPACE, VLIBCErrGet());
    Send(FieldPart("a", "b") + kClose, std::to_string(1ULL << 62));
    Json::Value params;
    EXPECT_EQ(-2, VELA::APIUpload(request_.get()).GetUploadAll(params, nullptr));

    // "/var/tmp" cannot be created.
    ASSERT_EQ(0, rmdir(In("/var/tmp").c_str()));
    ASSERT_EQ(0, rmdir(In("/var").c_str()));
    Write("/var", "a file in the way");
    EXPECT_FALSE(upload.FindUploadTmpDir(dir, 1024));
    EXPECT_EQ(VLIBC_ERR_MKDIR, VLIBCErrGet());
}

// Real space tests need file systems of known size: the root a 300 MiB
// tmpfs, "/tmp" a 1 MiB one (root only).
TEST_F(Upload, SpaceOnTmpAndRoot)
{
    if (!MountTmpfs(root_.Path(), "size=300m")) {
        GTEST_SKIP() << "mounting a tmpfs needs root";
    }
    Mkdir("/tmp");
    Mkdir("/etc.defaults");
    ASSERT_TRUE(MountTmpfs(In("/tmp"), "size=1m"));
    VELA::APIUploadPrivate upload(nullptr, request_.get());
    std::string dir;
    ASSERT_TRUE(upload.FindUploadTmpDir(dir, 512 * 1024));
    EXPECT_EQ(In("/tmp"), dir);
    // Too big for "/tmp", and "/" keeps 200 MiB beyond it.
    ASSERT_TRUE(upload.FindUploadTmpDir(dir, 50ULL << 20));
    EXPECT_EQ(In("/var/tmp"), dir);
    // "/" would keep less than 200 MiB.
    EXPECT_FALSE(upload.FindUploadTmpDir(dir, 150ULL << 20));
    EXPECT_EQ(VLIBC_ERR_NO_SPACE, VLIBCErrGet());
}

TEST_F(Upload, MalformedBodyPassesThePlatformCode)
{
    Send(FilePart("file", "a.txt", "alpha") + "--XyZ\r\nX-No-Disposition: 1\r\n\r\nz\r\n" + kClose);
    Json::Value params;
    Json::Value files(Json::arrayValue);
    EXPECT_EQ(VELA_UPLOAD_ERR_HEADER, VELA::APIUpload(request_.get()).GetUploadAll(params, &files));
    EXPECT_EQ(0u, files.size());
    EXPECT_TRUE(DirEntries(In("/tmp")).empty());

    // The files are stored and listed even when the answer cannot be built.
    VelaCgiUploadReset();
    Send(FilePart("file", "a.txt", "alpha") + kClose);
    Json::Value notAnObject(Json::arrayValue);
    EXPECT_EQ(-9, VELA::APIUpload(request_.get()).GetUploadAll(notAnObject, &files));
    ASSERT_EQ(1u, files.size());
    EXPECT_EQ("alpha", ReadText(files[0].asString()));
}

// A deferred upload read by the handler: fields, then each file in turn.
TEST_F(Upload, StepByStep)
{
    VELA::APIUpload upload(request_.get());
    Json::Value result;
    EXPECT_EQ(-8, upload.GetUploadFile(result));  // before any parameter

    Send(FieldPart("api", "A") + FilePart("doc", "d.txt", "one") + FieldPart("mid", "M") +
         FilePart("doc", "e.txt", "two") + kClose);
    VELA::APIUpload deferred(request_.get());
    Json::Value params;
    EXPECT_EQ(0, deferred.GetUploadParam(params));
    EXPECT_EQ("A", params["api"].asString());
    EXPECT_EQ("d.txt", params["doc"].asString());
    EXPECT_FALSE(params.isMember("mid"));

    ASSERT_EQ(0, deferred.GetUploadFile(result));
    EXPECT_EQ("d.txt", result["doc_name"].asString());
    EXPECT_EQ("one", ReadText(result["doc"].asString()));

    Json::Value more;
    EXPECT_EQ(0, deferred.GetUploadParam(more));
    EXPECT_EQ("M", more["mid"].asString());
    EXPECT_EQ("e.txt", more["doc"].asString());
    Json::Value second;
    ASSERT_EQ(0, deferred.GetUploadFile(second));
    EXPECT_EQ("two", ReadText(second["doc_2"].asString()));

    EXPECT_EQ(-8, deferred.GetUploadFile(second));  // no file part left
    // Both files in the request's one private directory.
    const std::string dir = result["doc"].asString().substr(0, result["doc"].asString().rfind('/'));
    EXPECT_EQ(std::vector<std::string>{dir.substr(In("/tmp/").size())}, DirEntries(In("/tmp")));
    EXPECT_EQ(2u, DirEntries(dir).size());
}

// A volume's "@tmp" of another user's is not used at all: that user could
// remove or rename what is stored there. (Another user against the files of
// an upload in flight in a world-writable "@tmp": tests/e2e/upload.sh.)
TEST_F(Upload, AnotherUsersVolumeTmpIsNotUsed)
{
    if (geteuid() != 0) {
        GTEST_SKIP() << "another user's directory needs root";
    }
    Mkdir("/volume1");
    Conf("volumes.conf", "/volume1\n");
    ASSERT_EQ(0, mkdir(In("/volume1/@tmp").c_str(), 01777));
    ASSERT_EQ(0, chown(In("/volume1/@tmp").c_str(), 65534, 65534));
    std::string dir;
    ASSERT_TRUE(VELA::APIUploadPrivate(nullptr, request_.get()).FindUploadTmpDir(dir, 1024));
    EXPECT_EQ(In("/tmp"), dir);
}

}  // namespace
