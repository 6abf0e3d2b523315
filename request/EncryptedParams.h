// Encrypted parameters, shared by the CGI front end (a query string or body
// line) and the request (encrypted members of a request JSON).
#pragma once

#include <json/json.h>
#include <string>

namespace VELA {
namespace EncryptedParams {

// Member names of the protocol.
extern const char kCipherText[];   // "__cIpHeRtExT": RSA-encrypted query string
extern const char kCipherToken[];  // "__cIpHeRtOkEn": dropped beside it
extern const char kAESToken[];     // "__nEkOtReHpIc": the AES key, RSA-encrypted
extern const char kAESCipher[];    // "__tXeTrEhPiC": AES-encrypted query string

// A query string or body: decrypted when it is one "__cIpHeRtExT" pair,
// parsed into `out`, its AES members decrypted, and an encrypted "webapi"
// member decrypted in place (its failure ignored). False when the line or
// its AES members do not decrypt or parse.
bool DecryptLine(const std::string& line, Json::Value& out);
// An RSA-encrypted query string parsed into `out`, then its AES members.
bool DecryptCipher(const std::string& cipher, Json::Value& out);
// Replaces the "__nEkOtReHpIc"/"__tXeTrEhPiC" pair of `params` by the pairs
// it decrypts to. True when there is no such pair; a pair found is removed
// whatever follows.
bool DecryptAES(Json::Value& params);
// The encrypted members of a request JSON's parameters, following nested
// "webapi" objects 8 levels deep. False on the first that fails.
bool DecryptMembers(Json::Value& params);

}  // namespace EncryptedParams
}  // namespace VELA
