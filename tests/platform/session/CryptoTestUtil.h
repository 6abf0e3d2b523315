// Helpers of the encrypted-parameter tests: files with their modes, and
// tools (the openssl command, this program itself) run as child processes.
#pragma once

#include <gtest/gtest.h>

#include <fcntl.h>
#include <fstream>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "support/TestSupport.h"

namespace VELA {
namespace Test {

inline std::string ReadFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

inline void WriteFile(const std::string& path, const std::string& data, mode_t mode = 0600)
{
    std::ofstream(path, std::ios::binary | std::ios::trunc) << data;
    ASSERT_EQ(0, chmod(path.c_str(), mode));
}

inline mode_t Mode(const std::string& path)
{
    struct stat st;
    return lstat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
}

struct Ran {
    int status = -1;
    std::string out, err;
};

// Runs argv[0] from PATH (or /proc/self/exe) with `env` added; its output
// goes through files, so nothing can block on a full pipe.
inline Ran RunTool(const std::vector<std::string>& argv, const std::vector<std::pair<std::string, std::string>>& env = {})
{
    TempDir io;
    const std::string out = io.Path() + "/out", err = io.Path() + "/err";
    pid_t pid = fork();
    if (pid == 0) {
        int o = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int e = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int in = open("/dev/null", O_RDONLY);
        if (o < 0 || e < 0 || in < 0 || dup2(o, 1) < 0 || dup2(e, 2) < 0 || dup2(in, 0) < 0) {
            _exit(126);
        }
        for (const auto& kv : env) {
            setenv(kv.first.c_str(), kv.second.c_str(), 1);
        }
        std::vector<char*> args;
        for (const auto& a : argv) {
            args.push_back(const_cast<char*>(a.c_str()));
        }
        args.push_back(nullptr);
        execvp(args[0], args.data());
        _exit(127);
    }
    Ran ran;
    if (pid > 0 && waitpid(pid, &ran.status, 0) == pid) {
        ran.out = ReadFile(out);
        ran.err = ReadFile(err);
    }
    return ran;
}

inline bool Exited0(const Ran& ran)
{
    return WIFEXITED(ran.status) && WEXITSTATUS(ran.status) == 0;
}

inline std::string OpensslKey(const TempDir& dir, const std::string& name, int bits, const std::vector<std::string>& extra = {})
{
    const std::string path = dir.Path() + "/" + name;
    std::vector<std::string> argv = {"openssl", "genpkey", "-quiet", "-algorithm", "RSA", "-pkeyopt",
                                     "rsa_keygen_bits:" + std::to_string(bits), "-out", path};
    argv.insert(argv.end(), extra.begin(), extra.end());
    EXPECT_TRUE(Exited0(RunTool(argv))) << name;
    return ReadFile(path);
}

}  // namespace Test
}  // namespace VELA
