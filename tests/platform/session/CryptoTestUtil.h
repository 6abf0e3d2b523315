// Helpers of the encrypted-parameter tests: tools (the openssl command, this
// program itself) run as child processes, keys and ciphertexts made by the
// openssl command.
#pragma once

#include <fcntl.h>

#include "platform/PlatformTest.h"

namespace VELA {
namespace Test {

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
        ran.out = ReadText(out);
        ran.err = ReadText(err);
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
    return ReadText(path);
}

inline std::string Base64(const std::string& in)
{
    static const char abc[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string out;
    for (size_t i = 0; i < in.size(); i += 3) {
        unsigned v = static_cast<unsigned char>(in[i]) << 16;
        if (i + 1 < in.size()) v |= static_cast<unsigned char>(in[i + 1]) << 8;
        if (i + 2 < in.size()) v |= static_cast<unsigned char>(in[i + 2]);
        out += abc[v >> 18];
        out += abc[(v >> 12) & 63];
        out += i + 1 < in.size() ? abc[(v >> 6) & 63] : '=';
        out += i + 2 < in.size() ? abc[v & 63] : '=';
    }
    return out;
}

inline const std::vector<std::string> kOaepSha256 = {"-pkeyopt", "rsa_padding_mode:oaep", "-pkeyopt",
                                                     "rsa_oaep_md:sha256", "-pkeyopt", "rsa_mgf1_md:sha256"};

// base64 of `plain` encrypted by the openssl tool to the public key in the
// PEM file `pub` with the options `opts`, made in `dir`.
inline std::string OpensslEncrypt(const std::string& dir, const std::string& pub, const std::string& plain,
                                  const std::vector<std::string>& opts = kOaepSha256)
{
    WriteFile(dir + "/plain", plain);
    std::vector<std::string> argv = {"openssl", "pkeyutl", "-encrypt", "-pubin", "-inkey", pub,
                                     "-in", dir + "/plain", "-out", dir + "/ct"};
    argv.insert(argv.end(), opts.begin(), opts.end());
    const Ran ran = RunTool(argv);
    EXPECT_TRUE(Exited0(ran)) << ran.err;
    return Base64(ReadText(dir + "/ct"));
}

}  // namespace Test
}  // namespace VELA
