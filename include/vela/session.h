// Login sessions of the platform: creation, removal and listing, for the
// login API and the administration tool. The request-time checks
// (VelaCgiIsAuthorizedEx and the calls that read the same session) are in
// vela/cgi.h.
//
// A session is one file <root>/run/vela/sessions/<sid> (mode 0600, directory
// 0700), a JSON object written atomically (temporary file, fsync, rename):
//
//   {"version":1, "id":"<sid>", "user":"admin", "created":1700000000,
//    "lastUse":1700000000, "idleTimeout":900, "lifetime":86400,
//    "clientIP":"192.0.2.7", "skipIP":false, "app":"", "webapi":"",
//    "lang":"enu", "tokenProtect":true, "token":"<anti-forgery token>"}
//
// A session id is 24 bytes from getrandom(2) written as 32 characters of
// base64url without padding ([A-Za-z0-9_-]); the anti-forgery token has the
// same form. Any other text is refused before a path is built from it.
// Times are seconds since the epoch. A file that lacks a member, holds one of
// the wrong type or out of range, or names another id, is no session.
#pragma once

#include <stddef.h>
#include <string>
#include <vector>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// Characters of a session id and of an anti-forgery token.
#define VELA_SESSION_ID_LEN 32
#define VELA_SESSION_TOKEN_LEN 32

// Defaults and bounds of the two time limits, in seconds.
#define VELA_SESSION_IDLE_DEFAULT 900          // 15 minutes without a request
#define VELA_SESSION_IDLE_MAX (31 * 86400)     // 31 days
#define VELA_SESSION_LIFETIME_DEFAULT 86400    // 24 hours after the login
#define VELA_SESSION_LIFETIME_MAX (366 * 86400)

// A request moves a session's "lastUse" only when it is at least this many
// seconds old, so that a busy session's file is rewritten at most once per
// step, not on every request. The idle timeout is counted from the last use
// written: a session may be taken for idle up to this many seconds early.
#define VELA_SESSION_LAST_USE_STEP 30

namespace VELA {
namespace Session {

// What a new session holds besides its user and client address. Zero-filled
// (Options{}) it gives the defaults.
struct VELA_EXPORT Options {
    int idleTimeout = 0;        // 0: VELA_SESSION_IDLE_DEFAULT; else 1 .. VELA_SESSION_IDLE_MAX
    int lifetime = 0;           // 0: VELA_SESSION_LIFETIME_DEFAULT; else 1 .. VELA_SESSION_LIFETIME_MAX
    bool skipIP = false;        // do not compare the client address on later requests
    bool tokenProtect = false;  // every request must carry the anti-forgery token
    std::string app;            // application the session was opened for (at most 255 bytes)
    std::string webapi;         // web-API privilege (at most 255 bytes)
    std::string lang;           // three lower-case letters ("enu"), or "" for none
    const char* auditEvent = nullptr;  // name of its audit event; null: "session-create"
};

// A session as List reports it (the anti-forgery token is left out).
struct VELA_EXPORT Record {
    std::string sid;
    std::string user;
    std::string clientIP;  // "" when the session is bound to no address
    long long created = 0;
    long long lastUse = 0;
    int idleTimeout = 0;
    int lifetime = 0;
    bool skipIP = false;
    bool tokenProtect = false;
    std::string app;
    std::string webapi;
    std::string lang;
    bool expired = false;  // the idle timeout or the lifetime has passed
};

// Creates a session for `user`, which must exist (getpwnam_r), bound to the
// client address `clientIP` (any IPv4 or IPv6 text; stored in canonical form).
// A null or empty `clientIP` binds no address and forces skipIP on. `options`
// may be null for the defaults. Returns 0 and fills `sid` and `token` (the
// anti-forgery token); -1 on any failure (logged), the outputs then empty.
// Expired sessions of the store are removed on the way. A new session is
// recorded in the audit trail (vela/audit.h) as "session-create", or as
// `options->auditEvent` (the login API's "login").
int Create(const char* user, const char* clientIP, const Options* options,
           std::string& sid, std::string& token);

// Removes session `sid`. 0 removed, -2 no such session (or a malformed id),
// -1 on failure. A removal is recorded in the audit trail with the
// session's user as `auditEvent`, null meaning "session-revoke" (the login
// API's logout passes "logout").
int Remove(const char* sid, const char* auditEvent = nullptr);

// Every session of the store, oldest first, expired ones included; files that
// are not valid sessions are skipped. 0 / -1 (`out` then empty).
int List(std::vector<Record>& out);

// Removes the sessions that expired more than `graceSeconds` ago (so that for
// a while a late request still learns "timed out" rather than "no session").
// Returns how many were removed, or -1.
int Purge(long long graceSeconds);

// Characters of a session's handle: the first 16 hex digits of the SHA-256
// of its id. A handle names a session to administrators without giving
// away the id, which is a credential.
#define VELA_SESSION_HANDLE_LEN 16

// The handle of session `sid` (lower-case hex). 0, or -1 when `sid` is not
// an id or SHA-256 is not available (logged); `handle` is then empty.
int HandleOf(const char* sid, std::string& handle);

// Whether `text` has the shape of a handle: exactly VELA_SESSION_HANDLE_LEN
// lower-case hex digits.
bool IsHandle(const char* text);

// Tests only: replaces time(2) for sessions and access tokens with `now`;
// null restores time(2).
void SetClockForTest(long long (*now)(void));

}  // namespace Session
}  // namespace VELA

#pragma GCC visibility pop
