// Login settings and the brute-force guard of the login API.
//
// Policy. Failed logins are counted per client address (IPv4 address, IPv6
// /64 prefix: one host holds a whole prefix) and per account, each attempt
// tagged with its (account, address) pair.
//  - An address with maxFailures failures within windowMinutes, for any
//    accounts, is blocked for blockMinutes: every attempt from it is refused
//    without the password being checked.
//  - An account is never blocked as a whole: its owner logs in from an
//    address of its own however many failures other addresses made for the
//    account (no lockout of the owner by strangers; each attacking address
//    is limited on its own). The account's count is logged when it reaches
//    maxFailures.
//  - A successful login clears only the failures of its own (account,
//    address) pair: an attacker's success with an account of their own
//    leaves the count of their address as it was.
//  - The records are bounded: at most maxRecords address records, expired
//    records purged whenever a new address record is wanted and after each
//    failure. When the store is full of records that have not expired, an
//    address without a record gets none, and its attempts count against the
//    account alone: an account with maxFailures failures within the window,
//    from anywhere, refuses them until the window moves on (fail safe: a
//    flood of addresses never lifts a limit; during such a flood the owner
//    of an attacked account may have to wait as well). Account records are
//    made only for accounts that exist (NSS), so their number is bounded by
//    the machine's accounts; an attempt that no record can count (unknown
//    account, full store) is refused.
//
// Records are files of <root>/run/vela/login-guard (directory 0700, files
// 0600, JSON written atomically), "addr-" or "acct-" followed by the
// SHA-256 of the address or account, so no text of the client ever becomes
// a path. Every update happens under the lock of the directory
// (VLIBCFileLockTimeByFile on ".lock"). Accounts are compared ignoring
// ASCII case.
//
// An attempt counts as a failure from the moment VELA::Session::LoginGuardBegin lets
// it through until VELA::Session::LoginGuardSucceeded clears it, so parallel attempts
// cannot get more password checks than the limit allows, and an attempt
// whose process dies half-way still counts.
//
// Every failure is logged to the authorisation facility at warning
// priority, every block, every attempt refused by a block and an account
// reaching the limit at notice priority, with the account (non-printable
// bytes escaped, cut to 64 bytes) and the client address. Times come from
// the session store's clock (VELA::Session::SetClockForTest in vela/session.h).
#pragma once

#include <string>
#include <vector>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// Defaults and bounds of the settings.
#define VELA_LOGIN_MAX_FAILURES_DEFAULT 5
#define VELA_LOGIN_MAX_FAILURES_MAX 1000
#define VELA_LOGIN_WINDOW_DEFAULT 10   // minutes
#define VELA_LOGIN_BLOCK_DEFAULT 15    // minutes
#define VELA_LOGIN_MINUTES_MAX 10080   // one week, for both
#define VELA_LOGIN_GUARD_RECORDS_DEFAULT 10000
#define VELA_LOGIN_GUARD_RECORDS_MAX 1000000

// Longest account and address text the guard takes.
#define VELA_LOGIN_ACCOUNT_MAX 255

namespace VELA {
namespace Session {

// The login settings of <root>/etc/vela/webapi.conf (key="value" lines):
//   login_max_failures     1 .. 1000
//   login_window_minutes   1 .. 10080
//   login_block_minutes    1 .. 10080
//   login_guard_max_records  1 .. 1000000, address records kept at most
//   session_idle_timeout   seconds, 1 .. VELA_SESSION_IDLE_MAX
//   session_lifetime       seconds, 1 .. VELA_SESSION_LIFETIME_MAX
// A missing file or key keeps the default; a value that is not a decimal
// number in range is logged and the default kept.
struct VELA_EXPORT LoginSettings {
    int maxFailures = VELA_LOGIN_MAX_FAILURES_DEFAULT;
    int windowMinutes = VELA_LOGIN_WINDOW_DEFAULT;
    int blockMinutes = VELA_LOGIN_BLOCK_DEFAULT;
    int maxRecords = VELA_LOGIN_GUARD_RECORDS_DEFAULT;
    int idleTimeout = 0;  // 0: the session store's default
    int lifetime = 0;     // 0: the session store's default
};

// Fills `settings` (null is ignored). Never fails.
void LoginSettingsLoad(LoginSettings* settings);

// Results of LoginGuardBegin.
#define VELA_LOGIN_GUARD_ERROR (-1)   // the records could not be read or written
#define VELA_LOGIN_GUARD_ALLOW 0      // check the password
#define VELA_LOGIN_GUARD_BLOCKED 1    // refuse without checking it

// Before a password check of `account` (1 to VELA_LOGIN_ACCOUNT_MAX bytes)
// from `clientIP` (an IP address; null or "" counts as one unknown client).
// Returns BLOCKED, with `*waitSeconds` set to the seconds until an attempt
// may come through (at least 1), when the address is blocked or its counted
// attempts have reached the limit, or, for an address the full store does
// not track, when the account's have, or when no record can count the
// attempt. Otherwise counts the attempt as a failure and returns ALLOW.
// ERROR on invalid arguments or a store that cannot be used (logged):
// refuse the login then. `settings` null means the defaults; `waitSeconds`
// may be null.
int LoginGuardBegin(const LoginSettings* settings, const char* account, const char* clientIP,
                    int* waitSeconds);

// After the password check of an attempt let through by Begin failed: logs
// the failure (with `reason`, which may be null), starts the block of the
// address when its counted attempts have reached the limit (logged; they
// are then forgotten, so the block is the whole penalty), logs an account
// whose count reaches the limit, and purges expired records.
void LoginGuardFailed(const LoginSettings* settings, const char* account, const char* clientIP,
                      const char* reason);

// After a successful password check: removes the attempts of this
// (account, address) pair, and no others, from both records. 0, or -1 when
// the records could not be updated (logged).
int LoginGuardSucceeded(const LoginSettings* settings, const char* account, const char* clientIP);

// One address or account that refuses login attempts now.
struct VELA_EXPORT LoginGuardEntry {
    // The address as it is counted ("192.0.2.7", "2001:db8:1:2::/64", "?"
    // for clients of no known address), or the account in lower case.
    std::string subject;
    long long until = 0;  // when an attempt is let through again (epoch seconds)
    int failures = 0;     // the failures that led to the block, or counted now
};

// The guard's records that refuse attempts now: addresses that are blocked
// or whose counted attempts have reached the limit, and accounts whose
// count from every address has reached it (which refuses the attempts of
// addresses the full store does not track). Each list is sorted by
// subject. The directory is walked without following links, at most
// VELA_LOGIN_GUARD_LIST_MAX files are read, and a record that is not one,
// or that was written before records named their subject, is skipped. 0,
// or -1 when the directory cannot be read (logged; the lists are then
// empty); a missing directory gives two empty lists.
#define VELA_LOGIN_GUARD_LIST_MAX (VELA_LOGIN_GUARD_RECORDS_MAX + 100000)
int LoginGuardList(const LoginSettings* settings, std::vector<LoginGuardEntry>& addresses,
                   std::vector<LoginGuardEntry>& accounts);

}  // namespace Session
}  // namespace VELA

#pragma GCC visibility pop
