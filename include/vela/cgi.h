// CGI library of the platform: cookies, client address, login sessions and
// encrypted parameters.
//
// A call that is not built yet fails closed (it logs why and returns its
// failure value); it never reports success. Creating and removing login
// sessions is in vela/session.h.
#pragma once

#include <stddef.h>
#include <string>

#include "vela/authresult.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

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

// 1 when `peer` (the text of REMOTE_ADDR, the address the connection came
// from) is a trusted proxy, else 0 (also for null or anything that is not an
// IP address). Trusted proxies are the addresses that
// <root>/etc/vela/webapi.conf names (trusted_proxies="a b c"); none without
// the key, loopback included, since any local user can connect there. Only
// a trusted proxy's forwarding headers are believed: X-Forwarded-For
// (VelaCgiGetRemoteIP) and X-Forwarded-Proto (the request's protocol).
int VelaCgiIsTrustedProxy(const char* peer);

// Writes the client address (REMOTE_ADDR; the last address of
// X-Forwarded-For that is no trusted proxy instead when REMOTE_ADDR is a
// trusted proxy, see VelaCgiIsTrustedProxy) into `buf` of `size` bytes. 0 on
// success; -1 when there is no valid address or it does not fit.
int VelaCgiGetRemoteIP(char* buf, size_t size);

// ---- Login sessions ------------------------------------------------------------

// Flags of VelaCgiIsAuthorizedEx.
// Check only: the session's last use is not moved forward, so a method that
// a page polls by itself (marked "allowTimeout") does not keep an idle
// session alive. A last use found in the future is still pulled back to now.
#define VELACGI_AUTH_NO_REFRESH 0x1

// What VelaCgiIsAuthorizedEx reports about the session it read, whatever the
// verdict (all zero when no valid session file was found).
typedef struct _tag_VELACGI_SESSION_INFO_ {
    long long created;  // seconds since the epoch
    long long lastUse;  // as stored before this check
    int idleTimeout;    // seconds
    int lifetime;       // seconds after `created`
    int skipCheckIP;    // 1 when the client address was not compared
    int tokenProtect;   // 1 when requests must carry the anti-forgery token
    char clientIP[46];  // the address the session is bound to, "" for none
    char lang[4];       // three letters, "" for none
} VELACGI_SESSION_INFO;

// Checks login session `sid` for the current request (process environment).
// Verdicts, in the order they are tested:
//   -2 AUTH_RESULT_NO_SESSION  malformed id, no such session, a corrupt or
//                              foreign session file, or its user no longer
//                              exists;
//   -1 AUTH_RESULT_TIMEOUT     the idle timeout or the lifetime has passed;
//   -8 AUTH_RESULT_IP_MISMATCH the client address (VelaCgiGetRemoteIP)
//                              differs from the session's and neither the
//                              session nor the handle skips that check;
//   -7 AUTH_RESULT_TOKEN_MISSING token protection is on and the request has
//                              neither header X-Vela-Token (HTTP_X_VELA_TOKEN)
//                              nor query parameter VelaToken equal to the
//                              session's anti-forgery token;
//   -3 AUTH_RESULT_REJECTED    `user` too small, a failed user look-up, out
//                              of memory;
//    1 AUTH_RESULT_AUTHORIZED  valid: `user` (of `userSize` bytes, 493 is
//                              enough for any user name) receives the user
//                              name, the handle the session-file path, the
//                              idle timeout, the skip-IP flag and the options
//                              read by VelaCgiGetOption and VelaCgiGetLang;
//                              the last use becomes now unless `flags` holds
//                              VELACGI_AUTH_NO_REFRESH, once it is at least
//                              VELA_SESSION_LAST_USE_STEP seconds old
//                              (vela/session.h).
// A last use or creation time in the future (the clock went back) counts as
// now and is written back as now. `ctx`, `user` and `info` may be null.
// `user` is "" unless the verdict is 1.
int VelaCgiIsAuthorizedEx(VELACGI_CTX* ctx, const char* sid, char* user, size_t userSize,
                          VELACGI_SESSION_INFO* info, int flags);

// Options of VelaCgiGetOption.
#define VELACGI_OPT_SKIP_IP 1   // the session's skip-IP flag, "1" or "0"
#define VELACGI_OPT_WEBAPI 6    // the session's web-API privilege
#define VELACGI_OPT_APP 7       // the session's application
#define VELACGI_OPT_TIMEOUT 10  // the session's idle timeout in seconds, decimal

// An option of the session that the handle was last authorised for
// (VelaCgiIsAuthorizedEx returned 1), as text owned by the handle and valid
// until the next check or VelaCgiFree. `defaultValue` (which may be null) when
// the handle holds no authorised session or the option is unknown.
const char* VelaCgiGetOption(VELACGI_CTX* ctx, int option, const char* defaultValue);

// The three-letter UI language: the language of the handle's authorised
// session when it has one; otherwise the best entry of Accept-Language
// (HTTP_ACCEPT_LANGUAGE, quality values honoured, tags matched by dropping
// subtags from the end):
//   en enu, de ger, fr fra, ja jpn, zh-tw/zh-hk/zh-mo/zh-hant cht,
//   zh/zh-cn/zh-sg/zh-hans chs, it ita, es spn, nl nld, sv sve, da dan,
//   nb/nn/no nor, fi fin, pl plk, pt-br ptb, pt ptg, ru rus, ko krn, cs csy,
//   hu hun, tr trk, th tha;
// otherwise "enu". Writes it into `buf` (`size` >= 4). 0, or -1 for a null or
// too small buffer.
int VelaCgiGetLang(VELACGI_CTX* ctx, char* buf, size_t size);

// The skip-IP flag of the handle: set it before VelaCgiIsAuthorizedEx for a
// method that must not compare the client address; after a valid check it
// is also on when the session skips the check. Set: 0 / -1 for a null handle.
// Get: 1 or 0.
int VelaCgiSetSkipCheckIP(VELACGI_CTX* ctx, int skip);
int VelaCgiGetSkipCheckIP(VELACGI_CTX* ctx);
// The session-file path and the idle timeout (seconds) of the handle's
// authorised session; "" and 0 when it has none.
const char* VelaCgiGetSessionFile(VELACGI_CTX* ctx);
int VelaCgiGetTimeout(VELACGI_CTX* ctx);

// 1 when token protection is on for the session named by the handle's "id"
// cookie, 0 otherwise (no cookie, malformed id, no such session).
int VelaCgiIsTokenEnable(VELACGI_CTX* ctx);
// The uid of `user` when session `sid` exists and belongs to `user`, else -1.
int VelaCgiUIDGet(const char* sid, const char* user);

// ---- Encrypted parameters ---------------------------------------------------------
//
// One server RSA key pair (3072 bits) under /var/lib/vela/keys, created by
// the first VelaCgiPublicKeyPEM call; decryption never creates it. libcrypto
// is loaded on the first decryption, never before. Formats (all base64 is the
// standard alphabet, padded, without whitespace):
//   "__cIpHeRtExT"   base64(RSA-OAEP with SHA-256 (digest and MGF1) of the
//                    query string), at most 318 bytes of plain text;
//   "__nEkOtReHpIc"  base64(RSA-OAEP of a 32-character AES key text);
//   "__tXeTrEhPiC"   base64(IV[12] | ciphertext | tag[16]), AES-256-GCM under
//                    the 32 bytes of the key text, no additional data.
// These are what a browser's WebCrypto produces for RSA-OAEP/SHA-256 with the
// SPKI public key and AES-GCM with a 12-byte IV.

// Decrypts a "__cIpHeRtExT" payload in place into a query string. 0 / -1.
int VelaCgiDecryptParam(std::string& text);

// Longest parameter line (query string or form-encoded body) accepted.
#define VELACGI_MAX_PARAM_LINE (16u * 1024u * 1024u)
// Checks a raw parameter line (a query string or an
// application/x-www-form-urlencoded body, RFC 3986 percent-encoding) and
// decrypts it in place when it is encrypted as a whole:
//  - a plain "name=value&..." line is accepted unchanged;
//  - a line of exactly one pair "__cIpHeRtExT=<base64>" is replaced by its
//    decrypted query string (VelaCgiDecryptParam; the value may be
//    percent-encoded), which must pass the same checks;
//  - refused (false, one log line) are: a line longer than
//    VELACGI_MAX_PARAM_LINE, a control byte (0x00-0x1f, 0x7f) anywhere, a
//    "%" not followed by two hex digits, and a cipher that does not decrypt.
// Encrypted members among other pairs are left for the request to decrypt.
// On false `line` is unchanged.
bool VelaCgiDetectAndDecryptParamLine(std::string& line);
// Recovers the AES key from a "__nEkOtReHpIc" token into `key` (`size`
// bytes, at most 32 characters and the terminator). 0 / -1.
int VELACloudServiceHubtokenGenerateToken(const char* token, char* key, size_t size);

// The server's public key for encrypted parameters, as SPKI PEM text; the
// key pair is created on the first call. 0 / -1.
int VelaCgiPublicKeyPEM(std::string& pem);

namespace VELA {
namespace CredRequestUtil {
// Decrypts a "__tXeTrEhPiC" payload with `key`. False on any failure.
bool GetDecryptAESString(const std::string& key, const std::string& cipher, std::string& plain);
}  // namespace CredRequestUtil
}  // namespace VELA

#pragma GCC visibility pop
