// The JSON pipe: framing, the ends each side keeps, and what the reader
// logs when the writer breaks the protocol.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

#include "support/TestSupport.h"
#include "webapi/APIUtils.h"

namespace {

using VELA::Pipe;
using VELA::Test::LogCapture;

void Reap(pid_t pid)
{
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_TRUE(WIFEXITED(status));
}

TEST(Pipe, DocumentsCrossInOrderWhateverTheirSize)
{
    // A document far above the pipe buffer crosses only because the parent
    // reads while the child writes; null and an empty object are framed too.
    Json::Value big(Json::objectValue);
    big["blob"] = std::string(1 << 20, 'x');
    const Json::Value docs[] = {Json::Value(), Json::Value(Json::objectValue), big, Json::Value("\xc3\xa9t\xc3\xa9")};
    Pipe pipe;
    ASSERT_TRUE(pipe.Init());
    // The child keeps only the write end, the parent only the read end.
    const pid_t pid = fork();
    if (pid == 0) {
        pipe.WriteOnly(-1);
        for (const Json::Value& doc : docs) {
            if (!pipe.WriteJson(doc)) {
                _exit(1);
            }
        }
        _exit(0);
    }
    pipe.ReadOnly(-1);
    for (const Json::Value& doc : docs) {
        Json::Value got(42);
        ASSERT_TRUE(pipe.ReadJson(got));
        EXPECT_EQ(doc, got);
    }
    Reap(pid);
}

// What the writer sent, raw, and what the reader must say about it.
struct BrokenFrame {
    const char* name;
    std::string bytes;
    const char* logged;  // nullptr: nothing logged, the parser refuses
};

std::string Frame(uint32_t len, const std::string& text)
{
    return std::string(reinterpret_cast<const char*>(&len), sizeof(len)) + text;
}

TEST(Pipe, ReaderRefusesBrokenFramesAndSaysWhy)
{
    const BrokenFrame frames[] = {
        {"nothing at all (the writer is gone)", "", "protocol failed"},
        {"half a length", std::string("\x05\x00", 2), "protocol failed"},
        {"text cut short", Frame(10, "{\"a\":"), "read json 10 failed, got 5"},
        {"not json", Frame(5, "{{{{{"), nullptr},
        {"length over the bound", Frame(Pipe::kMaxDocument + 1, ""), "new szBuf[67108866] failed"},
    };
    for (const BrokenFrame& frame : frames) {
        SCOPED_TRACE(frame.name);
        Pipe pipe;
        ASSERT_TRUE(pipe.Init());
        ASSERT_EQ(static_cast<ssize_t>(frame.bytes.size()),
                  write(pipe.WriteFd(), frame.bytes.data(), frame.bytes.size()));
        pipe.ReadOnly(-1);
        LogCapture log;
        Json::Value out("unchanged");
        EXPECT_FALSE(pipe.ReadJson(out));
        if (frame.logged != nullptr) {
            EXPECT_NE(-1, log.PriorityOf({"APIUtilsPrivate:", frame.logged}))
                << (log.Lines().empty() ? "(no line)" : log.Lines()[0]);
        }
    }
}

TEST(Pipe, EachSideKeepsOnlyItsEnd)
{
    Pipe pipe;
    EXPECT_EQ(-1, pipe.ReadFd());
    EXPECT_FALSE(pipe.WriteJson(Json::Value(1)));  // not open
    ASSERT_TRUE(pipe.Init());
    EXPECT_NE(0, fcntl(pipe.ReadFd(), F_GETFD) & FD_CLOEXEC);

    // WriteOnly(1) sends the child's standard output into the pipe; Read
    // zeroes the buffer before it reads, so what arrived is terminated.
    const pid_t pid = fork();
    if (pid == 0) {
        _exit(pipe.WriteOnly(1) == 1 && pipe.ReadFd() == -1 && write(1, "abc", 3) == 3 ? 0 : 1);
    }
    pipe.ReadOnly(-1);
    EXPECT_EQ(-1, pipe.WriteFd());
    char buf[8];
    memset(buf, 'z', sizeof(buf));
    EXPECT_EQ(3, pipe.Read(buf, sizeof(buf) - 1));
    EXPECT_STREQ("abc", buf);
    EXPECT_EQ(0, pipe.Read(buf, sizeof(buf) - 1));
    Reap(pid);

    // Closing is idempotent, and ReadOnly(-1) after the write end is gone
    // does not fail.
    EXPECT_EQ(0, pipe.ReadOnly(-1));
    pipe.Close();
    pipe.Close();
    EXPECT_EQ(-1, pipe.ReadFd());
}

}  // namespace
