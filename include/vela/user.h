// Users, groups, administrators, application privileges and the identity of
// the process.
//
// Users and groups are the machine's own, from NSS (getpwnam_r, getgrnam_r,
// getgrouplist): local users, and domain ("DOMAIN\user") or directory
// ("user@realm") users when an NSS module provides them.
//
// User names accepted by every call here: 1 to 255 bytes, no "/", no ":",
// no control byte, not "." or "..". Anything else is refused before any
// lookup.
//
// "system" is the dispatcher's run-as name of the superuser (an API's
// "runAs" attribute, its default), never an account's: only the run-as
// calls (VELA::System::RunAsGetUGID, ResetCredentialsForRunAs) map it to
// uid 0. Every other call here takes a name as an account, so a login name,
// a session's or an access token's user "system" is whatever the account of
// that name is, and no account is ever taken for root by its name.
//
// No call throws; every configuration file is read with a size bound.
#pragma once

#include <sys/types.h>

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// ---- Users ------------------------------------------------------------------------

typedef struct _tag_VELAUSER_ {
    char* szName;   // login name
    uid_t uid;
    gid_t gid;      // primary group
    char* szGecos;  // full name field, "" when empty
    char* szHome;   // home directory, "" when empty
    char* szShell;  // login shell, "" when empty
} VELAUSER, *PVELAUSER;

// 1 when `name` is acceptable as a user or group name (see above), else 0.
int VELAUserNameIsValid(const char* name);

// Looks the user up and stores a new record in `*user` (free it with
// VELAUserFree). 0 on success; -1 when there is no such user, the name is
// invalid, `user` is null or the lookup fails (`*user` is then null when
// `user` is not null).
int VELAUserGetByUID(uid_t uid, PVELAUSER* user);
int VELAUserGetByName(const char* name, PVELAUSER* user);
// Frees a record of VELAUserGetByUID / VELAUserGetByName; null is ignored.
void VELAUserFree(PVELAUSER user);

// The uid and primary gid of user `name`. 0 on success, -1 when the user is
// unknown, the name invalid, an output null or the lookup fails.
int VELAUserGetUGID(const char* name, uid_t* uid, gid_t* gid);

// ---- Run-as identities --------------------------------------------------------------
// The identity an API runs as: VELA_RUNAS_SUPERUSER, or an account's name.

#define VELA_RUNAS_SUPERUSER "system"

namespace VELA {
namespace System {
// 1 when `runAs` is exactly VELA_RUNAS_SUPERUSER, else 0 (null included).
int RunAsIsSuperuser(const char* runAs);
// As VELAUserGetUGID, but VELA_RUNAS_SUPERUSER gives 0 and 0 without a
// lookup.
int RunAsGetUGID(const char* runAs, uid_t* uid, gid_t* gid);
}  // namespace System
}  // namespace VELA

// ---- Administrators ----------------------------------------------------------------
// The administrators group is "administrators" unless /etc/vela/webapi.conf
// (under the root) sets admin_group="name" (key="value" lines, read as
// VLIBCFileGetKeyValue does).

// 1 when `user` is an account of uid 0 or a member of the administrators group
// (as primary or supplementary group); 0 when not (also when the group does
// not exist or the user is unknown); -1 on error: invalid name, `flags` not
// 0, a corrupt configuration or an admin_group that is not a valid name, or
// a failed lookup.
int VLIBGroupIsAdminGroupMem(const char* user, int flags);

// ---- Application privileges -------------------------------------------------------
// /etc/vela/app_privileges.json (under the root), a JSON object of at most
// 1 MiB:
//
//   {
//     "applications": {
//       "VELA.Photo": {
//         "users":      ["alice", "CORP\\bob"],
//         "groups":     ["photo"],
//         "allow_from": ["192.168.1.0/24", "10.0.0.7", "fd00::/8"]
//       }
//     }
//   }
//
// A user holds privilege P when "applications"/P lists the user in "users"
// or one of the user's groups (primary or supplementary) in "groups", and,
// when "allow_from" is present, the remote address matches one of its
// entries: an IPv4 or IPv6 address or a CIDR prefix (an IPv4-mapped IPv6
// client address matches IPv4 entries). Without "allow_from" every address
// is allowed; an empty "allow_from" allows none. Members of the wrong type
// and invalid entries grant nothing. Administrators hold every privilege
// from every address. A missing or corrupt file grants privileges to
// administrators only.

// 1 when `user` holds application privilege `priv` (1 to 128 bytes of
// letters, digits, "_", "-", ".", ":") from `remoteIP` (may be null or ""
// when unknown: then only rules without "allow_from" apply); 0 otherwise,
// including every error.
int VLIBAppPrivUserHas(const char* user, const char* priv, const char* remoteIP);

// ---- Identity of the process --------------------------------------------------------
// Both calls need an effective or saved user id of 0. They take back the
// effective user id 0 first (setresuid(-1, 0, -1)) when needed, then set the
// supplementary groups, setresgid(gid, gid, gid) and
// setresuid(uid, uid, uid) — or setresuid(uid, uid, 0) when `grantable`, so
// the caller can return to root later with setresuid. Each set is logged to
// the authorisation facility: "<file>:<line> WARNING: setres{g,u}id(r, e, s)"
// at informational priority, "<file>:<line> ERROR: setres{g,u}id(r, e, s)
// [reason]" at error priority. On failure the previous ids and groups are
// put back when possible and false is returned.

// Switches to the account `name` with its groups (initgroups). True when
// the ids read back as requested.
bool ResetCredentialsByName(const char* name, bool grantable);

// Switches to the run-as identity `runAs`: VELA_RUNAS_SUPERUSER is uid 0,
// gid 0 with the groups of root's account; any other name is an account, as
// ResetCredentialsByName. A process whose user and group ids are all 0 and
// whose only supplementary group is 0 (or none) already is the superuser:
// nothing is changed or logged and no account is looked up.
bool ResetCredentialsForRunAs(const char* runAs, bool grantable);

// Switches to the owner and group of the regular file `path` (symbolic
// links followed): the group of the file becomes the primary group; the
// supplementary groups are the owner's NSS groups plus that group, or only
// that group when the owner has no NSS entry. `grantable` non-zero keeps the
// saved user id 0. True on success.
bool InitCredentialsByExecutable(const char* path, int grantable);

#pragma GCC visibility pop
