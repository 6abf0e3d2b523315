// Login settings and the brute-force guard of the login API.
//
// Failed logins are counted per client address and per account. After
// maxFailures failures from one address, or for one account, within
// windowMinutes, further attempts are refused for blockMinutes without the
// password being checked at all. A successful login clears the records of
// its account and of its address.
//
// Records are files of <root>/run/vela/login-guard (directory 0700, files
// 0600, JSON written atomically), one per address and one per account,
// named after the SHA-256 of the address or account, so no text of the
// client ever becomes a path. Every update happens under the lock of the
// directory (VLIBCFileLockTimeByFile on ".lock"). Accounts are compared
// ignoring ASCII case; IPv6 clients count per /64 prefix (one host holds a
// whole prefix), IPv4 clients per address.
//
// An attempt counts as a failure from the moment VelaLoginGuardBegin lets
// it through until VelaLoginGuardSucceeded clears it, so parallel attempts
// cannot get more password checks than the limit allows, and an attempt
// whose process dies half-way still counts.
//
// Every failure is logged to the authorisation facility at warning
// priority, every block and every attempt refused by a block at notice
// priority, with the account (non-printable bytes escaped, cut to 64 bytes)
// and the client address. Times come from the session store's clock
// (VelaSetClockForTest in vela/session.h).
#pragma once

// Defaults and bounds of the settings.
#define VELA_LOGIN_MAX_FAILURES_DEFAULT 5
#define VELA_LOGIN_MAX_FAILURES_MAX 1000
#define VELA_LOGIN_WINDOW_DEFAULT 10   // minutes
#define VELA_LOGIN_BLOCK_DEFAULT 15    // minutes
#define VELA_LOGIN_MINUTES_MAX 10080   // one week, for both

// Longest account and address text the guard takes.
#define VELA_LOGIN_ACCOUNT_MAX 255

// The login settings of <root>/etc/vela/webapi.conf (key="value" lines):
//   login_max_failures     1 .. 1000
//   login_window_minutes   1 .. 10080
//   login_block_minutes    1 .. 10080
//   session_idle_timeout   seconds, 1 .. VELA_SESSION_IDLE_MAX
//   session_lifetime       seconds, 1 .. VELA_SESSION_LIFETIME_MAX
// A missing file or key keeps the default; a value that is not a decimal
// number in range is logged and the default kept.
struct VelaLoginSettings {
    int maxFailures = VELA_LOGIN_MAX_FAILURES_DEFAULT;
    int windowMinutes = VELA_LOGIN_WINDOW_DEFAULT;
    int blockMinutes = VELA_LOGIN_BLOCK_DEFAULT;
    int idleTimeout = 0;  // 0: the session store's default
    int lifetime = 0;     // 0: the session store's default
};

// Fills `settings` (null is ignored). Never fails.
void VelaLoginSettingsLoad(VelaLoginSettings* settings);

// Results of VelaLoginGuardBegin.
#define VELA_LOGIN_GUARD_ERROR (-1)   // the records could not be read or written
#define VELA_LOGIN_GUARD_ALLOW 0      // check the password
#define VELA_LOGIN_GUARD_BLOCKED 1    // refuse without checking it

// Before a password check of `account` (1 to VELA_LOGIN_ACCOUNT_MAX bytes)
// from `clientIP` (an IP address; null or "" counts as one unknown client).
// When the address or the account is blocked, or the attempts still
// counted for either have reached the limit, returns BLOCKED with
// `*waitSeconds` set to the seconds until the block ends (at least 1).
// Otherwise counts the attempt as a failure of both and returns ALLOW.
// ERROR on
// invalid arguments or a store that cannot be used (logged): refuse the
// login then. `settings` null means the defaults; `waitSeconds` may be null.
int VelaLoginGuardBegin(const VelaLoginSettings* settings, const char* account, const char* clientIP,
                        int* waitSeconds);

// After the password check of an attempt let through by Begin failed: logs
// the failure (with `reason`, which may be null), and starts the block of
// the address or the account whose counted attempts have reached the limit
// (logged; its counted attempts are then forgotten, so the block is the
// whole penalty).
void VelaLoginGuardFailed(const VelaLoginSettings* settings, const char* account, const char* clientIP,
                          const char* reason);

// After a successful password check: removes the records of `account` and
// `clientIP`. 0, or -1 when they could not be removed (logged).
int VelaLoginGuardSucceeded(const char* account, const char* clientIP);
