// Access tokens: a bearer token that lets a program call chosen APIs and
// methods as one user without a login session.
//
// A token is "<id>.<secret>": the id is 16 bytes from getrandom(2) as 22
// base64url characters, the secret 32 bytes as 43 characters. The id names
// the token (listing, revocation) and its file <root>/var/lib/vela/tokens/<id>
// (mode 0600, directory 0700, written atomically); the secret is only compared
// (in constant time), so a listing of ids hands out nothing usable. The file
// is a JSON object:
//
//   {"version":1, "id":"<id>", "secret":"<secret>", "user":"backup",
//    "apis":["VELA.Demo.*"], "methods":["get*","list"],
//    "created":1700000000, "expires":1702592000}
//
// A pattern is an exact name, or a prefix followed by one "*" at the end
// ("VELA.Demo.*", "get*", "*" for every name); names and prefixes are made of
// letters, digits, ".", "_" and "-", at most 128 bytes, and compare
// case-sensitively.
//
// A token never grants more than its user holds: VelaAccessTokenGrant only
// ever yields the token's own user, and the caller then applies every check
// that user would meet with a login session (user classes, administrator
// membership, application privileges). The api and method patterns narrow
// what the token may call; they never widen what the user may do.
#pragma once

#include <stddef.h>
#include <string>
#include <vector>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

#define VELA_TOKEN_ID_LEN 22
#define VELA_TOKEN_SECRET_LEN 43
#define VELA_TOKEN_LEN (VELA_TOKEN_ID_LEN + 1 + VELA_TOKEN_SECRET_LEN)
#define VELA_TOKEN_LIFETIME_DEFAULT (30LL * 86400)   // 30 days
#define VELA_TOKEN_LIFETIME_MAX (3660LL * 86400)     // about ten years
#define VELA_TOKEN_MAX_PATTERNS 32

// A token as VelaAccessTokenList reports it (without its secret).
struct VELA_EXPORT VelaAccessTokenRecord {
    std::string id;
    std::string user;
    std::vector<std::string> apis;
    std::vector<std::string> methods;
    long long created = 0;
    long long expires = 0;
    bool expired = false;
};

// Grants `token` for one call of `method` of `api`. Returns 0 and writes the
// token's user into `user` (`userSize` bytes; 493 is enough for any user
// name) when the token exists, has not expired, has an api pattern matching
// `api` and a method pattern matching `method`, and its user still exists
// (getpwnam_r). Otherwise `user` is "" and the result is negative:
// -1 malformed or unknown token, -2 expired, -3 api or method not granted,
// -4 the user no longer exists, -5 any other failure (buffer too small,
// unreadable store).
int VelaAccessTokenGrant(const char* token, const char* api, const char* method, char* user, size_t userSize);

// Creates a token for `user` (who must exist) granting `apis` x `methods`
// (1 to VELA_TOKEN_MAX_PATTERNS patterns each), valid for `lifetime` seconds
// (0: VELA_TOKEN_LIFETIME_DEFAULT; at most VELA_TOKEN_LIFETIME_MAX). Returns 0
// and fills `token` (to hand to the caller once) and `id`; -1 on failure
// (logged), the outputs then empty. Expired tokens are removed on the way.
int VelaAccessTokenCreate(const char* user, const std::vector<std::string>& apis,
                          const std::vector<std::string>& methods, long long lifetime, std::string& token,
                          std::string& id);

// Every token of the store, oldest first, expired ones included; files that
// are not valid tokens are skipped. 0 / -1 (`out` then empty).
int VelaAccessTokenList(std::vector<VelaAccessTokenRecord>& out);

// Revokes the token with id `id` (the id alone, or a whole token). 0 revoked,
// -2 no such token (or a malformed id), -1 on failure.
int VelaAccessTokenRevoke(const char* id);

// True when `pattern` is a valid api or method pattern as described above.
bool VelaAccessTokenIsPattern(const std::string& pattern);

#pragma GCC visibility pop
