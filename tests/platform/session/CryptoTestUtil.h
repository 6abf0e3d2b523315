// Helpers of the encrypted-parameter tests: keys and ciphertexts made by the
// openssl command.
#pragma once

#include "platform/PlatformTest.h"

namespace VELA {
namespace Test {

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
