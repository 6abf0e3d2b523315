// CGI library of the platform: cookies, client address, login sessions and
// encrypted parameters.
//
// Sessions, tokens and decryption belong to the identity and session module;
// until it is built those calls fail closed (they log why and return their
// failure value), they never report success.
#pragma once

#include <stddef.h>
#include <string>

// Verdict of the login-session check (VelaCgiIsAuthorizedEx).
enum _tag_authorized_result_ : int {
    AUTH_RESULT_AUTHORIZED = 1,       // valid session
    AUTH_RESULT_TIMEOUT = -1,         // idle timeout passed
    AUTH_RESULT_NO_SESSION = -2,      // no such session
    AUTH_RESULT_REJECTED = -3,        // refused by the platform
    AUTH_RESULT_NONE = -4,            // no verdict was ever stored
    AUTH_RESULT_UNAUTHENTICATED = -5, // not authenticated
    AUTH_RESULT_TOKEN_MISSING = -7,   // anti-forgery token missing or wrong
    AUTH_RESULT_IP_MISMATCH = -8,     // client address differs from the session's
};
typedef enum _tag_authorized_result_ AUTHORIZED_RESULT;

// Handle of the CGI library: the parsed cookies of the process environment
// and what later calls fill in.
typedef struct _tag_VELACGI_CTX_ VELACGI_CTX;

// Creates a handle for application `app` (may be ""). 0 on success, -1 on
// failure (`*ctx` is then null).
int VelaCgiInit(const char* app, VELACGI_CTX** ctx);
// Parses HTTP_COOKIE of the process environment into the handle. 0 / -1.
int VelaCgiLoadInCookies(VELACGI_CTX* ctx);
// The value of cookie `name` loaded into the handle, or null.
const char* VelaCgiGetCookie(VELACGI_CTX* ctx, const char* name);
// Frees the handle; null is ignored.
void VelaCgiFree(VELACGI_CTX* ctx);

// Writes the client address (REMOTE_ADDR; the last address of
// X-Forwarded-For instead when REMOTE_ADDR is a trusted proxy) into `buf`
// of `size` bytes. 0 on success; -1 when there is no valid address or it does
// not fit. Trusted proxies are the loopback addresses unless
// <root>/etc/vela/webapi.conf names others (trusted_proxies="a b c").
int VelaCgiGetRemoteIP(char* buf, size_t size);

// Non-zero when token protection is on for the session of the handle.
int VelaCgiIsTokenEnable(VELACGI_CTX* ctx);
// The uid of the user logged in with session `sid`, or -1.
int VelaCgiUIDGet(const char* sid, const char* user);
// Decrypts a "__cIpHeRtExT" payload in place into a query string. 0 / -1.
int VelaCgiDecryptParam(std::string& text);
// Recovers the AES key from a "__nEkOtReHpIc" token into `key` (`size`
// bytes, at most 32 characters and the terminator). 0 / -1.
int VELACloudServiceHubtokenGenerateToken(const char* token, char* key, size_t size);

// The server's public key for encrypted parameters, as PEM text (created
// with the key pair on first use). 0 / -1.
int VelaCgiPublicKeyPEM(std::string& pem);

namespace VELA {
namespace CredRequestUtil {
// Decrypts a "__tXeTrEhPiC" payload with `key`. False on any failure.
bool GetDecryptAESString(const std::string& key, const std::string& cipher, std::string& plain);
}  // namespace CredRequestUtil
}  // namespace VELA
