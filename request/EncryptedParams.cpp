#include "request/EncryptedParams.h"

#include <cstring>

#include "request/RequestFacts.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/webapiutil.h"

namespace VELA {
namespace EncryptedParams {

const char kCipherText[] = "__cIpHeRtExT";
const char kCipherToken[] = "__cIpHeRtOkEn";
const char kAESToken[] = "__nEkOtReHpIc";
const char kAESCipher[] = "__tXeTrEhPiC";

namespace {

// Nesting of "webapi" objects that DecryptMembers follows.
const int kMaxDecryptDepth = 8;

bool DecryptMembersAt(Json::Value& params, int depth)
{
    if (!params.isObject()) {
        return true;
    }
    if (params.isMember(kCipherText)) {
        std::string text = RequestFacts::Text(params[kCipherText]);
        params.removeMember(kCipherText);
        if (VelaCgiDecryptParam(text) != 0) {
            return false;
        }
        if (!WebAPIUtil::strPairToJsonObj(text, params, true, true)) {
            return false;
        }
    }
    if (!params.empty() && !DecryptAES(params)) {
        return false;
    }
    if (params.isMember("webapi")) {
        if (depth >= kMaxDecryptDepth) {
            VELA_LOG_ERR("encrypted parameters nested deeper than %d levels", kMaxDecryptDepth);
            return false;
        }
        return DecryptMembersAt(params["webapi"], depth + 1);
    }
    return true;
}

}  // namespace

bool DecryptLine(const std::string& line, Json::Value& out)
{
    std::string plain = line;
    if (!VelaCgiDetectAndDecryptParamLine(plain)) {
        return false;
    }
    if (!WebAPIUtil::strPairToJsonObj(plain, out, true, true)) {
        return false;
    }
    if (!out.empty() && !DecryptAES(out)) {
        VELA_LOG_ERR("parameters refused: __tXeTrEhPiC does not decrypt");
        return false;
    }
    Json::Value* webapi = out.isObject() && out.isMember("webapi") ? &out["webapi"] : nullptr;
    if (webapi != nullptr && webapi->isObject() && webapi->isMember(kCipherText)) {
        const std::string cipher = RequestFacts::Text((*webapi)[kCipherText]);
        webapi->removeMember(kCipherText);
        DecryptCipher(cipher, *webapi);
        webapi->removeMember(kCipherToken);
    }
    return true;
}

bool DecryptCipher(const std::string& cipher, Json::Value& out)
{
    std::string plain = cipher;
    if (VelaCgiDecryptParam(plain) != 0) {
        return false;
    }
    if (!WebAPIUtil::strPairToJsonObj(plain, out, true, true)) {
        return false;
    }
    return out.empty() || DecryptAES(out);
}

bool DecryptAES(Json::Value& params)
{
    if (!params.isObject() || !params.isMember(kAESToken) || !params.isMember(kAESCipher)) {
        return true;
    }
    const std::string token = RequestFacts::Text(params[kAESToken]);
    const std::string cipher = RequestFacts::Text(params[kAESCipher]);
    params.removeMember(kAESToken);
    params.removeMember(kAESCipher);
    if (token.empty() || cipher.empty()) {
        return false;
    }
    char key[33] = {0};
    if (VELACloudServiceHubtokenGenerateToken(token.c_str(), key, sizeof(key)) < 0) {
        explicit_bzero(key, sizeof(key));
        return false;
    }
    key[sizeof(key) - 1] = '\0';
    std::string plain;
    const bool decrypted = CredRequestUtil::GetDecryptAESString(key, cipher, plain);
    explicit_bzero(key, sizeof(key));
    bool parsed = decrypted && WebAPIUtil::strPairToJsonObj(plain, params, true, true);
    if (!plain.empty()) {
        explicit_bzero(&plain[0], plain.size());
    }
    return parsed;
}

bool DecryptMembers(Json::Value& params) { return DecryptMembersAt(params, 0); }

}  // namespace EncryptedParams
}  // namespace VELA
