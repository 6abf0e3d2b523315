// The audit trail: who logged in, out or failed to, whose sessions and
// access tokens were made or revoked, and the calls of methods whose
// description says "audit": true.
//
// Each event is one JSON object (keys sorted), written twice:
//  - to syslog, facility LOG_AUTHPRIV, as "audit: <json>";
//  - as one line appended to <root>/var/log/vela/audit.log (directory 0750,
//    file 0640, created if missing), with one write(2), so lines of
//    processes writing at the same time never mix. A process that switched
//    identity writes it with root rights regained for the write.
//
//   {"actor":"admin","address":"192.0.2.7","api":"VELA.Admin","epoch":1700000000,
//    "event":"session-revoke","method":"revoke","result":0,
//    "time":"2023-11-14T22:13:20Z","user":"alice"}
//
// "user" is the account concerned, "actor" who acted on it when that is
// someone else ("" otherwise), "result" 0 for success or the error code.
// Token events add "tokenId" (the token's id, never its secret). Nothing
// secret is ever written: no password, session id or token. Every text is
// cut to a bounded length (at a character boundary) so that a line stays
// below kMaxLine bytes; a line with a cut text says "truncated": true.
// Failing to write is logged and never fails the caller.
#pragma once

#include <cstddef>
#include <string>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {
namespace Audit {

// Event names.
extern const char kLogin[];          // "login": a password accepted, session opened
extern const char kLoginFailed[];    // "login-failed": wrong account or password
extern const char kLoginBlocked[];   // "login-blocked": refused by the login guard
extern const char kLogout[];         // "logout"
extern const char kSessionCreate[];  // "session-create"
extern const char kSessionRevoke[];  // "session-revoke"
extern const char kTokenCreate[];    // "token-create"
extern const char kTokenRevoke[];    // "token-revoke"
extern const char kCall[];           // "call": a method marked "audit": true

// The longest line of audit.log, newline excluded.
constexpr size_t kMaxLine = 1900;

// One event. Empty `address`, `api`, `method` and `actor` are taken from
// the call being served (see SetCallSource); outside a call the actor is
// the account of the process's real user id (the administrator running a
// tool). `actor` equal to `user` is written as "".
struct VELA_EXPORT Event {
    const char* name = "";
    std::string user;
    std::string actor;
    std::string address;
    std::string api;
    std::string method;
    int result = 0;
    std::string tokenId;  // token events only
};

// What the call being served says of itself, asked only when an event is
// recorded.
struct VELA_EXPORT CallFacts {
    std::string actor;  // the logged-in user, "" without a session
    std::string address;
    std::string api;
    std::string method;
};
typedef void (*CallSourceFn)(const void* arg, CallFacts& out);

// Records `event` (see above). Never throws.
void Record(const Event& event);

// The JSON line of `event` at time `epoch` (without the newline), as Record
// writes it, with the call's facts already filled in; at most kMaxLine bytes.
std::string FormatLine(const Event& event, long long epoch);

// Installs the source of the call being served (null: none) and returns
// the one it replaces, so that a nested call can put it back. Costs two
// stores: nothing is asked until an event is recorded.
struct CallSource {
    CallSourceFn fn = nullptr;
    const void* arg = nullptr;
};
CallSource SetCallSource(CallSource source);

}  // namespace Audit
}  // namespace VELA

#pragma GCC visibility pop
