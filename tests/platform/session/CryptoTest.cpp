// Encrypted parameters: RSA-OAEP and AES-GCM decryption, strict base64, and
// libcrypto loaded only by the processes that decrypt (the key pair itself:
// ServerKeyTest.cpp).
//
// Ciphertexts are made independently of the code under test: RSA-OAEP with
// the openssl command-line tool, AES-GCM with libcrypto's encryption calls
// (opened here with dlopen, since this program must not link libcrypto) and
// one vector computed once with another implementation.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <openssl/evp.h>  // types only: this program does not link libcrypto

#include "platform/session/CryptoTestUtil.h"
#include "support/JsonLiteral.h"
#include "webapi/APIRequest.h"
#include "webapi/JsonUtil.h"

namespace {

using namespace VELA::Test;

bool LibcryptoMapped()
{
    return ReadText("/proc/self/maps").find("libcrypto") != std::string::npos;
}

// ---- The probe: this program started again as a fresh process ------------
// With VELA_CRYPTO_PROBE set, the program builds one request from the
// "getParam" JSON in that variable, prints the parameter "name", optionally
// asks for the public key, reports whether libcrypto is mapped, and exits
// before any test runs.
[[maybe_unused]] const bool g_probe = [] {
    const char* params = getenv("VELA_CRYPTO_PROBE");
    if (params == nullptr) {
        return false;
    }
    Json::Value request(Json::objectValue);
    VELA::JsonParse(params, request["getParam"]);
    VELA::APIRequest r(request);
    printf("name=%s\n", r.GetParam("name", "").asString().c_str());
    if (getenv("VELA_CRYPTO_PROBE_PUBKEY") != nullptr) {
        std::string pem;
        printf("pubkey=%d\n", VelaCgiPublicKeyPEM(pem));
    }
    printf("libcrypto=%d\n", LibcryptoMapped() ? 1 : 0);
    fflush(stdout);
    _exit(0);
}();

// How often `needle` occurs in `text`.
int Count(const std::string& text, const std::string& needle)
{
    int n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) {
        ++n;
    }
    return n;
}

// AES-256-GCM encryption with libcrypto's own encryption calls: IV |
// ciphertext | tag, the layout WebCrypto's output gives with the IV in front.
std::string GcmSeal(const std::string& key, const std::string& iv, const std::string& plain)
{
    static void* lib = dlopen("libcrypto.so.3", RTLD_NOW | RTLD_LOCAL);
#define SYM(name) auto name = lib ? reinterpret_cast<decltype(&::name)>(dlsym(lib, #name)) : nullptr
    SYM(EVP_CIPHER_CTX_new);
    SYM(EVP_CIPHER_CTX_free);
    SYM(EVP_CIPHER_CTX_ctrl);
    SYM(EVP_aes_256_gcm);
    SYM(EVP_EncryptInit_ex);
    SYM(EVP_EncryptUpdate);
    SYM(EVP_EncryptFinal_ex);
#undef SYM
    if (!EVP_CIPHER_CTX_new || !EVP_CIPHER_CTX_free || !EVP_CIPHER_CTX_ctrl || !EVP_aes_256_gcm ||
        !EVP_EncryptInit_ex || !EVP_EncryptUpdate || !EVP_EncryptFinal_ex || key.size() != 32 || iv.size() != 12) {
        ADD_FAILURE() << "cannot seal";
        return "";
    }
    auto u = [](const std::string& t) { return reinterpret_cast<const unsigned char*>(t.data()); };
    std::string body(plain.size() + 16, '\0');
    unsigned char tag[16];
    int n = 0, f = 0;
    EVP_CIPHER_CTX* ctx = EVP_CIPHER_CTX_new();
    EXPECT_TRUE(EVP_EncryptInit_ex(ctx, EVP_aes_256_gcm(), nullptr, u(key), u(iv)) == 1 &&
                EVP_EncryptUpdate(ctx, reinterpret_cast<unsigned char*>(&body[0]), &n, u(plain),
                                  static_cast<int>(plain.size())) == 1 &&
                EVP_EncryptFinal_ex(ctx, reinterpret_cast<unsigned char*>(&body[n]), &f) == 1 &&
                EVP_CIPHER_CTX_ctrl(ctx, EVP_CTRL_GCM_GET_TAG, 16, tag) == 1);
    EVP_CIPHER_CTX_free(ctx);
    body.resize(static_cast<size_t>(n + f));
    return iv + body + std::string(reinterpret_cast<char*>(tag), 16);
}

// The same bytes in base64 with a padding bit set: a lenient decoder takes
// it for `b64`.
std::string NonCanonical(std::string b64)
{
    static const std::string abc = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    const size_t at = b64.find('=') - 1;
    b64[at] = abc[abc.find(b64[at]) | 1];
    return b64;
}

std::string FlipBit(std::string s, size_t byte)
{
    s[byte] = static_cast<char>(s[byte] ^ 0x01);
    return s;
}

// A key pair made by the openssl tool, put in place as an administrator
// would; the tests that are not about creating keys share it.
class Crypto : public RootTest {
protected:
    static const std::string& SuiteKey()
    {
        static TempDir dir;
        static const std::string key = OpensslKey(dir, "suite.pem", 3072);
        return key;
    }

    void SetUp() override
    {
        ASSERT_EQ(0, system(("mkdir -p -m 0700 " + In("/var/lib/vela/keys")).c_str()));
        WriteFile(In("/var/lib/vela/keys/param_rsa.pem"), SuiteKey(), 0600);
        ASSERT_EQ(0, VelaCgiPublicKeyPEM(pem_));
        WriteFile(In("/pub.pem"), pem_);
    }

    // base64 of `plain` encrypted to the server key by the openssl tool.
    std::string Encrypt(const std::string& plain, const std::vector<std::string>& opts = kOaepSha256,
                        const std::string& pub = "")
    {
        return OpensslEncrypt(root_.Path(), pub.empty() ? In("/pub.pem") : pub, plain, opts);
    }

    // The probe run in a fresh process with `getParam`.
    Ran Probe(const std::string& getParam, std::vector<std::pair<std::string, std::string>> env = {})
    {
        env.push_back({"VELA_CRYPTO_PROBE", getParam});
        env.push_back({"VELA_LOG_STDERR", "1"});
        return RunTool({"/proc/self/exe", "--gtest_filter=-*"}, env);
    }

    std::string pem_;
};

const char kKey[] = "0123456789abcdefghijklmnopqrstuv";
const char kIv[] = "iv-12-bytes!";

TEST_F(Crypto, CipherTextRoundTrip)
{
    const std::string plain = "api=VELA.Test&method=login&account=alice&passwd=p%40ss+w0rd%26";
    const std::string ct = Encrypt(plain);
    std::string text = ct;
    ASSERT_EQ(512u, text.size());  // 384 bytes: the 3072-bit key
    ASSERT_EQ(0, VelaCgiDecryptParam(text));
    EXPECT_EQ(plain, text);

    const std::string longest(318, 'x');  // 384 - 2 * 32 - 2
    text = Encrypt(longest);
    ASSERT_EQ(0, VelaCgiDecryptParam(text));
    EXPECT_EQ(longest, text);

    // Through a request: the parameters take the place of the member.
    VELA::APIRequest r(J(R"({"getParam": {"__cIpHeRtExT": ")" + ct + R"(", "version": "1"}})"));
    EXPECT_EQ("alice", r.GetParam("account", "").asString());
    EXPECT_EQ("p@ss w0rd&", r.GetParam("passwd", "").asString());
    EXPECT_EQ("VELA.Test", r.GetAPIClass());
    EXPECT_EQ(1, r.GetAPIVersion());
    EXPECT_FALSE(r.HasParam("__cIpHeRtExT"));
}

TEST_F(Crypto, AesPairRoundTripAndKnownAnswer)
{
    const std::string token = Encrypt(kKey);
    char key[33];
    ASSERT_EQ(0, VELACloudServiceHubtokenGenerateToken(token.c_str(), key, sizeof(key)));
    EXPECT_STREQ(kKey, key);

    const std::string plain = "method=set&note=" + std::string(200 * 1024, 'n');
    std::string out;
    ASSERT_TRUE(VELA::CredRequestUtil::GetDecryptAESString(key, Base64(GcmSeal(key, kIv, plain)), out));
    EXPECT_EQ(plain, out);
    ASSERT_TRUE(VELA::CredRequestUtil::GetDecryptAESString(key, Base64(GcmSeal(key, kIv, "")), out));
    EXPECT_EQ("", out);

    const std::string cipher = Base64(GcmSeal(kKey, kIv, "account=bob&passwd=s%C3%A9same"));
    VELA::APIRequest r(J(R"({"postParam": {"__nEkOtReHpIc": ")" + token + R"(", "__tXeTrEhPiC": ")" + cipher +
                         R"(", "webapi": {"__cIpHeRtExT": ")" + Encrypt("name=nested") + R"("}}})"));
    EXPECT_EQ("bob", r.GetParam("account", "").asString());
    EXPECT_EQ("s\xC3\xA9same", r.GetParam("passwd", "").asString());
    const Json::Value nested = r.GetParam("webapi", Json::Value());
    ASSERT_TRUE(nested.isObject());
    EXPECT_EQ("nested", nested.get("name", "").asString());
    EXPECT_FALSE(r.HasParam("__nEkOtReHpIc") || r.HasParam("__tXeTrEhPiC"));

    // A known answer, computed with another AES-GCM implementation.
    const char known[] = "AAECAwQFBgcICQoLw3cszO/A4P0GcNSixIOSZSkm9vTuK2MCEiNvrTCEwAKptWZaltQj96E2xSN8+3etfbFQUowtz0M=";
    ASSERT_TRUE(VELA::CredRequestUtil::GetDecryptAESString("Vela-test-key-0123456789abcdefgh", known, out));
    EXPECT_EQ("api=VELA.Test&method=set&name=K%C3%A4the", out);
}

TEST_F(Crypto, DamagedAesInputFailsCleanly)
{
    const std::string sealed = GcmSeal(kKey, kIv, "account=bob&passwd=secret");
    const size_t tagAt = sealed.size() - 16;
    const std::string good = Base64(sealed);
    const std::string bad[] = {
        Base64(FlipBit(sealed, tagAt + 15)),          // tag
        Base64(FlipBit(sealed, 12)),                  // body
        Base64(FlipBit(sealed, 0)),                   // IV
        Base64(sealed.substr(0, sealed.size() - 1)),  // truncated
        Base64(sealed.substr(0, 27)),                 // shorter than IV and tag
        "",
        "@@@@" + good.substr(4),
        good.substr(0, 40) + "\n" + good.substr(40),
        good.substr(0, good.size() - 1),  // padding cut off
        NonCanonical(good), std::string(1024 * 1024 + 4, 'A'),
    };
    for (const std::string& cipher : bad) {
        std::string out = "stale";
        EXPECT_FALSE(VELA::CredRequestUtil::GetDecryptAESString(kKey, cipher, out)) << cipher.substr(0, 60);
        EXPECT_EQ("", out);
    }
    std::string out;
    for (const std::string& key : {std::string("0123456789abcdefghijklmnopqrstuw"), std::string(kKey, 31),
                                   std::string(kKey) + "x"}) {
        EXPECT_FALSE(VELA::CredRequestUtil::GetDecryptAESString(key, good, out)) << key;
    }
    EXPECT_FALSE(VELA::CredRequestUtil::GetDecryptAESString(kKey, Base64(GcmSeal(kKey, kIv, std::string("a=1\0b", 5))), out));
    EXPECT_TRUE(VELA::CredRequestUtil::GetDecryptAESString(kKey, good, out));

    // The size bound is exact: 1 MiB of base64 is accepted.
    const std::string biggest = GcmSeal(kKey, kIv, std::string(1024 * 1024 / 4 * 3 - 28, 'p'));
    EXPECT_TRUE(VELA::CredRequestUtil::GetDecryptAESString(kKey, Base64(biggest), out));
}

TEST_F(Crypto, DamagedCipherTextFailsCleanly)
{
    const std::string good = Encrypt("name=x");
    TempDir other;
    OpensslKey(other, "other.pem", 3072);
    ASSERT_TRUE(Exited0(RunTool({"openssl", "pkey", "-in", other.Path() + "/other.pem", "-pubout", "-out",
                             other.Path() + "/other.pub"})));
    const std::string bad[] = {
        good.substr(0, 100) + (good[100] == 'A' ? "B" : "A") + good.substr(101),  // flipped bits
        good.substr(0, good.size() - 4),                                          // truncated
        "", "not base64!", std::string(4100, 'A'),
        Encrypt("name=x", {"-pkeyopt", "rsa_padding_mode:oaep"}),  // OAEP with SHA-1
        Encrypt("name=x", {}),                                     // PKCS #1 v1.5
        Encrypt("name=x", kOaepSha256, other.Path() + "/other.pub"), Encrypt(std::string("name=x\0y", 8)),
    };
    for (const std::string& cipher : bad) {
        std::string text = cipher;
        EXPECT_EQ(-1, VelaCgiDecryptParam(text)) << cipher.substr(0, 60);
        EXPECT_EQ(cipher, text);
    }
}

TEST_F(Crypto, TokenKeyRules)
{
    char key[64];
    for (const std::string& k : {std::string(), std::string(33, 'k'), std::string("abc\x01", 4), std::string("K\xC3\xA4the")}) {
        memset(key, 'z', sizeof(key));
        EXPECT_EQ(-1, VELACloudServiceHubtokenGenerateToken(Encrypt(k).c_str(), key, sizeof(key))) << k;
        EXPECT_EQ('\0', key[0]);
    }
    ASSERT_EQ(0, VELACloudServiceHubtokenGenerateToken(Encrypt("k").c_str(), key, sizeof(key)));
    EXPECT_STREQ("k", key);
    const std::string spaced = "a b c d e f g h i j k l m n o p ";
    ASSERT_EQ(0, VELACloudServiceHubtokenGenerateToken(Encrypt(spaced).c_str(), key, 33));
    EXPECT_EQ(spaced, key);

    const std::string token = Encrypt(kKey);
    EXPECT_EQ(-1, VELACloudServiceHubtokenGenerateToken(token.c_str(), key, 32));
    EXPECT_EQ(-1, VELACloudServiceHubtokenGenerateToken(token.c_str(), nullptr, 33));
    EXPECT_EQ(-1, VELACloudServiceHubtokenGenerateToken(nullptr, key, sizeof(key)));
    EXPECT_EQ(-1, VELACloudServiceHubtokenGenerateToken(std::string(5000, 'A').c_str(), key, sizeof(key)));
}

// Only a request that decrypts loads libcrypto; junk in the encrypted members
// is refused before anything is loaded.
TEST_F(Crypto, OnlyDecryptingRequestsLoadLibcryptoAndFailClosedWithoutIt)
{
    const std::pair<std::string, std::string> cases[] = {
        {R"({"api": "VELA.Test", "name": "plain value"})", "name=plain value\nlibcrypto=0\n"},
        {R"({"__cIpHeRtExT": "AAAA", "__nEkOtReHpIc": "x", "__tXeTrEhPiC": "y", "name": "n"})",
         "name=n\nlibcrypto=0\n"},
        {R"({"__cIpHeRtExT": ")" + Encrypt("name=secret+value") + R"("})", "name=secret value\nlibcrypto=1\n"},
    };
    for (const auto& c : cases) {
        const Ran ran = Probe(c.first);
        EXPECT_TRUE(Exited0(ran)) << ran.err;
        EXPECT_EQ(c.second, ran.out) << ran.err;
    }

    // Without a usable libcrypto the decryption fails closed.
    const std::string getParam = R"({"__cIpHeRtExT": ")" + Encrypt("name=secret") + R"("})";
    TempDir libs;
    WriteFile(libs.Path() + "/libcrypto.so.3", "not a library");
    // Two calls need the library; the reason is logged once.
    Ran ran = Probe(getParam, {{"LD_LIBRARY_PATH", libs.Path()}, {"VELA_CRYPTO_PROBE_PUBKEY", "1"}});
    EXPECT_EQ("name=\npubkey=-1\nlibcrypto=0\n", ran.out) << ran.err;
    EXPECT_EQ(1, Count(ran.err, "encrypted parameters unavailable: cannot load libcrypto.so.3")) << ran.err;

    // A library without the functions: any other library will do.
    const std::string maps = ReadText("/proc/self/maps");
    const size_t name = maps.find("libjsoncpp");
    ASSERT_NE(std::string::npos, name);
    const size_t start = maps.rfind(' ', name) + 1;
    const std::string jsoncpp = maps.substr(start, maps.find('\n', name) - start);
    WriteFile(libs.Path() + "/libcrypto.so.3", ReadText(jsoncpp), 0755);
    ran = Probe(getParam, {{"LD_LIBRARY_PATH", libs.Path()}, {"VELA_CRYPTO_PROBE_PUBKEY", "1"}});
    EXPECT_EQ(0, ran.out.find("name=\npubkey=-1\n")) << ran.out << ran.err;
    EXPECT_EQ(1, Count(ran.err, "encrypted parameters unavailable: libcrypto.so.3 lacks OPENSSL_cleanse")) << ran.err;
}

// A parameter line encrypted as a whole is decrypted, then checked as a
// plain one is (ParamLineTest.cpp).
TEST_F(Crypto, WholeParamLineDecryptedAndChecked)
{
    const std::string plain = "api=VELA.Sample&name=a%20b";
    const std::string b64 = Encrypt(plain);
    for (const std::string& value : {b64, VELA::WebAPIUtil::URLEncode(b64)}) {
        std::string line = "__cIpHeRtExT=" + value;
        EXPECT_TRUE(VelaCgiDetectAndDecryptParamLine(line));
        EXPECT_EQ(plain, line);
    }

    std::string broken = "__cIpHeRtExT=" + Encrypt("name=%zz");
    const std::string before = broken;
    LogCapture log;
    EXPECT_FALSE(VelaCgiDetectAndDecryptParamLine(broken));
    EXPECT_EQ(before, broken);
    EXPECT_TRUE(log.Contains("decrypted parameter line refused"));
}

}  // namespace
