// Strict base64 for the encrypted parameters (not installed).
#pragma once

#include <cstddef>
#include <string>

namespace VELA {
namespace Session {

class SecretBytes;

// Number of bytes that `text` decodes to when it is canonical base64 of the
// standard alphabet (RFC 4648 section 4): length a multiple of 4, "=" only
// as the last one or two characters, zero padding bits, no blanks or line
// breaks. -1 when it is not, or when it is longer than `maxText` characters.
// The empty text decodes to 0 bytes.
long DecodedBase64Size(const std::string& text, size_t maxText);

// Decodes `text` (checked first with DecodedBase64Size) into `out`, whose
// size must be exactly the decoded size. False when it is not.
bool DecodeBase64Strict(const std::string& text, SecretBytes& out);

}  // namespace Session
}  // namespace VELA
