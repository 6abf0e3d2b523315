// Private upload directories: where one request stores the files of its
// upload, and what removes them however the request ends.
//
// A process stores every file of its upload in one directory of its own,
// VELA_UPLOAD_DIR_PREFIX followed by 12 random letters and digits, made
// inside a base directory the caller chose (a data volume's "@tmp", "/tmp",
// "/var/tmp") with mode 0700 and owned by the effective user of the moment:
// root for an upload the front end stores, the handler's identity for a
// handler that reads the body itself. No other local user can enter it, so
// nobody can read, rename or replace a stored file, even in a world-writable
// base. The process keeps the directory open and holds an exclusive flock on
// it for as long as it lives: that is how a sweep tells a live request from
// a dead one.
//
// The directory and everything in it go away:
//   - after the reply: VELA::Transfer::UploadDirRemove (the front end calls
//     it; a handler that keeps a file moves it out of the directory first);
//   - at exit() and on SIGTERM (the web server's answer to a client that
//     went away), SIGPIPE, SIGHUP, SIGINT, SIGALRM and SIGXCPU (time
//     limits), once VELA::Transfer::UploadCleanupOnExit has installed its
//     handlers; the process then dies of the signal as it would have
//     without them;
//   - when the process gives up root for good while the directory is
//     root's, a reaper (VELA::Transfer::UploadDirReaper) that keeps root
//     does both of the above in its place, whenever and however the
//     process ends;
//   - otherwise (SIGKILL, a crash): through the sweep of a later upload into
//     the same base by the same identity, once no process holds the
//     directory's lock and it has not changed for VELA_UPLOAD_SWEEP_AGE
//     seconds.
// Only the files directly inside the directory are removed, never through a
// symbolic link; a handler that makes subdirectories there removes them.
//
// Paths are used as given: callers resolve system paths (VELA::System::Path).
#pragma once

#include <stddef.h>

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

#define VELA_UPLOAD_DIR_PREFIX "vela-upload-"
#define VELA_UPLOAD_SWEEP_AGE 600

namespace VELA {
namespace Transfer {

// 1 when `base` may hold private upload directories, 0 otherwise (logged,
// last error VLIBC_ERR_MKDIR). Usable is a directory that is not a symbolic
// link, owned by root or by the effective user, and writable by group or
// others only when its sticky bit is set (else another user could rename
// the entries of root's). A base of the effective user's own that lacks the
// sticky bit while others may write to it gets the bit added (logged): a
// "@tmp" made world-writable by an earlier version is repaired so. A base
// of root's that the effective user cannot repair is not usable.
int UploadBaseUsable(const char* base);

// This process's private upload directory. The first call checks `base` as
// UploadBaseUsable does, sweeps it (UploadSweep with
// VELA_UPLOAD_SWEEP_AGE), then makes the directory inside it; later calls
// return the same directory, whatever base they name, until
// UploadDirRemove. 2 when made by this call, 1 when it existed, with its
// path in `path` (`pathSize` bytes); -1 on failure (logged, last error
// VLIBC_ERR_MKDIR or VLIBC_ERR_BAD_PARAMETER; nothing is left behind).
int UploadDirGet(const char* base, char* path, size_t pathSize);

// Removes the private directory with every file in it and forgets it. 0 when
// nothing is left (also when there was no directory) or a reaper removes
// what is; -1 when something could not be removed (logged): the rest is
// left to a later sweep.
int UploadDirRemove();

// For a process about to give up root for good (a handler's identity that
// is not grantable) while its private directory is root's: starts a child
// that keeps root and removes the directory once this process has let go of
// it (UploadDirRemove) or has ended, however it ended. 1 started, 0 not
// needed (no directory, not root's, or a reaper runs already), -1 failed
// (logged).
int UploadDirReaper();

// Removes the private directory, if the process still has one, when the
// process that made it (not a child that inherited this) ends: at exit()
// (registered once), and on SIGTERM, SIGPIPE, SIGHUP, SIGINT, SIGALRM and
// SIGXCPU, whose handlers then let the signal kill the process by its
// default action. A signal ignored when this is called stays ignored; a
// handler installed earlier is replaced, one installed later replaces this
// one. The handlers are async-signal-safe: they read a fixed record of the
// directory (its descriptors and name), never allocate, and remove the
// files through the directory's descriptor. 0 on success, -1 when a handler
// could not be installed (logged).
int UploadCleanupOnExit();

// The path of the process's private directory; "" when it has none.
const char* UploadDirPath();

// Removes from `base` the private directories of processes that are gone:
// entries named VELA_UPLOAD_DIR_PREFIX + 12 characters that are directories
// (never followed through a symbolic link), owned by the effective user,
// unchanged (modification time) for at least `minAgeSeconds`, and whose
// lock can be taken at once. The work is bounded: at most 1024 entries of
// `base` looked at, 8 directories and 4096 files removed per call; the rest
// waits for the next. The number of directories removed, or -1 when `base`
// cannot be opened.
int UploadSweep(const char* base, unsigned minAgeSeconds);

}  // namespace Transfer
}  // namespace VELA

#pragma GCC visibility pop
