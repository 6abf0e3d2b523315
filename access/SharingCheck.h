// The check of a call that comes through a sharing link: the link and the
// visitor session are validated against the sharing database, the visitor
// gets the session facts of the link's owner, and the check library of the
// application that made the link decides whether the method may be called.
//
// Check libraries live in <root>/usr/lib/sharing/permission_lib/, one per
// project, named <project>.so (webapi/APITable.h shows the table they
// export). A library is opened once per process and stays loaded until
// the process ends. Its check runs under the owner and group of the library
// file, never as root.
//
// The front end (WebEntry) hands its hooks to these functions; every log
// line carries the source name WebEntry.
#pragma once

#include <cstddef>
#include <string>

#include "vela/cgi.h"
#include "vela/export.h"
#include "webapi/APITable.h"

namespace VELA {

class APIRequest;
class APIResponse;
class APIRunner;

namespace SharingCheck {

// VELA_EXPORT: exported for the tests (see vela/export.h).

// The permission directory, resolved under the system root.
std::string PermissionLibDir();

// The check library of the project of `req`'s link; "" when the request has
// no link record or the project name is not a plain name (1 to 64 letters,
// digits, ".", "_" or "-", not starting with "."), so that a link can never
// name a file outside the permission directory.
std::string GetSharingCheckLibPath(APIRequest* req);

// The table of `req`'s check library into `*table`, opening the library on
// first use. False (logged) when there is no path, the file is not a
// regular file or can be written by others than its owner, it cannot be
// opened, or it gives no table.
bool OpenSharingCheckLib(APIRequest* req, _tag_API_SHARING_CHECK_TABLE** table);

// Calls the library's GetAPISharingCheckTable. False (logged) when it is
// missing or answers 0.
bool GetSharingCheckTableFunc(void* handle, _tag_API_SHARING_CHECK_TABLE** table);

// The check of the first entry of `table` that matches `req`'s version,
// api and method. False when none matches; entries with an empty pattern
// are skipped with a warning.
VELA_EXPORT bool GetSharingCheckFunc(APIRequest* req, _tag_API_SHARING_CHECK_TABLE* table, APICheckFn* check);

// 0 when `text` matches `pattern`: "*" matches everything, anything else is
// a POSIX extended regular expression (unanchored). Non-zero for no match,
// a pattern that does not compile, or a null argument.
VELA_EXPORT int RegexMatch(const char* pattern, const char* text);

// Finds the check of `req`'s call in its library and runs it as the owner
// of the library file; the process's ids and groups are put back after it.
// False when no check is found, the switch fails, or the check refuses.
bool CheckSharingAppPermission(APIRequest* req, APIResponse* resp);

// The session facts of the visitor: those of the link's owner (the user of
// the visitor session), "isAuthorized" false since the visitor holds no
// login session. `cgi` (may be null) gives the session file and language.
// Nothing is set when the owner has no account.
void InitSharingSession(APIRequest* req, VELACGI_CTX* cgi);

// The pipeline hook for a sharing request: refuses (126) a request that is
// not one or a method without "allowSharing"; validates the link and the
// visitor session (StatusToError gives the refusal); builds the visitor's
// session; runs the application's check unless the method has
// "skipSharingAppCheck". True when the call may go on.
bool CheckSharingPermission(APIRunner& runner, APIRequest* req, APIResponse* resp, VELACGI_CTX* cgi);

// The error code that refuses a call for a sharing status other than valid.
int StatusToError(int status);

// How many check libraries this process has opened.
VELA_EXPORT size_t OpenedLibraries();

}  // namespace SharingCheck
}  // namespace VELA
