// The last-error record of the process.
#include <cerrno>
#include <cstring>

#include "platform/PlatformTest.h"
#include "vela/sysfile.h"

namespace {

TEST(LastError, RecordKeepsStemLineAndErrno)
{
    errno = ENOSPC;
    VLIBCErrSetEx(10496, "/src/transfer/APIUpload.cpp", 77);
    EXPECT_EQ(ENOSPC, errno);
    VLIBC_ERR_INFO info;
    ASSERT_EQ(0, VLIBCErrGetEx(&info));
    EXPECT_EQ(VLIBC_ERR_NO_SPACE, info.code);
    EXPECT_STREQ("APIUpload", info.szFile);
    EXPECT_EQ(77, info.line);
    EXPECT_EQ(ENOSPC, info.sysErrno);
    VLIBCErrSetEx(3072, nullptr, 0, std::string(400, 'm').c_str());  // cut to fit
    ASSERT_EQ(0, VLIBCErrGetEx(&info));
    EXPECT_EQ(255u, strlen(info.szMessage));
    VLIBCErrClear();
    EXPECT_EQ(VLIBC_ERR_NONE, VLIBCErrGet());
}

}  // namespace
