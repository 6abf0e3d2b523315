// Passwords of sharing links (not installed): salted PBKDF2-HMAC-SHA256
// through the lazily loaded libcrypto.
//
// A stored hash reads "pbkdf2-sha256$ITERATIONS$SALT$KEY": SALT 16 random
// bytes and KEY the 32-byte derived key, both in lower-case hex.
#pragma once

#include <string>

namespace VELA {
namespace sharing {

constexpr int kPasswordIterations = 600000;

// A new stored hash of `password` with a fresh salt. False (logged) when
// libcrypto or getrandom fails.
bool HashLinkPassword(const std::string& password, std::string& stored);

// 1 when `password` matches `stored` (compared in constant time), 0 when it
// does not, -1 (logged) when `stored` is malformed or libcrypto fails.
int VerifyLinkPassword(const std::string& password, const std::string& stored);

}  // namespace sharing
}  // namespace VELA
