// System library of the platform: key=value files, locks, files and
// directories, process creation, data volumes and the last-error record.
//
// Paths. A path that starts with "/" is a path of the system and is resolved
// under the system root (VELA::System::Path, VELA_ROOT), except when it
// already lies inside the root (it starts with VELA::System::Root() + "/"):
// such a path came from VELA::System::Path or from another platform call
// (VolumeAvailGet) and is used as it is, so a path is never resolved twice. A relative path is relative
// to the working directory. With the default root "/" every path is used as
// it is.
//
// No call throws. Calls that fail also fill the last-error record (below)
// and leave errno describing the failing system call where there is one.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include <stddef.h>
#include <sys/types.h>

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// ---- Last error ----------------------------------------------------------------
// One record per process: the last failure a platform call (or a caller
// through VLIBCErrSetEx) reported. Setting it replaces the previous record;
// success does not clear it.

enum {
    VLIBC_ERR_NONE = 0,
    VLIBC_ERR_BAD_PARAMETER = 0x0100,  // null, too long or invalid argument
    VLIBC_ERR_NOT_FOUND = 0x0200,      // no such file, key, user or volume
    VLIBC_ERR_CORRUPT = 0x0300,        // a file that does not follow its format
    VLIBC_ERR_IO = 0x0400,             // a system call failed (see sysErrno)
    VLIBC_ERR_TIMEOUT = 0x0500,        // a lock was not obtained in time
    VLIBC_ERR_MEMORY = 0x0600,         // out of memory
    VLIBC_ERR_PERMISSION = 0x0700,     // an identity switch was refused
    VLIBC_ERR_MKDIR = 0x0C00,          // a directory could not be created (3072)
    VLIBC_ERR_NO_SPACE = 0x2900,       // not enough free space (10496)
};

typedef struct _tag_VLIBC_ERR_INFO_ {
    int code;            // one of VLIBC_ERR_* or a caller's own code
    int sysErrno;        // errno when the record was set (0 if none)
    char szFile[64];     // source file stem ("APIUpload"), may be empty
    int line;            // source line, 0 if unknown
    char szMessage[256]; // free text, may be empty; cut to fit
} VLIBC_ERR_INFO;

// Records `code` with the source `file` (its directory and extension are
// dropped) and `line`, the current errno and an optional `message` (null
// for none). errno is left unchanged.
void VLIBCErrSetEx(int code, const char* file, int line);
void VLIBCErrSetEx(int code, const char* file, int line, const char* message);
#define VLIBCErrSet(code) VLIBCErrSetEx((code), __FILE__, __LINE__)
// The code of the last record; VLIBC_ERR_NONE when nothing was recorded.
int VLIBCErrGet(void);
// Copies the last record into `info`. 0 on success, -1 for null.
int VLIBCErrGetEx(VLIBC_ERR_INFO* info);
// Forgets the record (VLIBCErrGet then returns VLIBC_ERR_NONE).
void VLIBCErrClear(void);

// ---- Key=value files ----------------------------------------------------------
// Format: one entry per line, key="value" (key=value without quotes is read
// as well); blanks around key and value are ignored; blank lines and lines
// starting with "#" are comments. When a key appears on several lines the
// last one wins. A file is corrupt when it is larger than 1 MiB, holds a NUL
// byte, a line longer than 8 KiB, or a line that is neither a comment nor a
// key=value entry (a value opened with a quote must be closed at the end of
// its line, so a file cut in the middle of a value is corrupt).
// Keys: 1 to 128 bytes of letters, digits, "_", "-" and "."; values: at most
// 4096 bytes without control bytes other than tab (no CR or LF).

#define VLIBC_KV_NOCASE 0x1  // VLIBCFileCheckKeyValue: compare ignoring ASCII case

// 1 when the file at `path` holds `key` with exactly `value`, 0 otherwise:
// other value, key or file missing, invalid arguments, unknown flags or a
// corrupt or unreadable file (so a switch read this way is off unless the
// file clearly turns it on).
int VLIBCFileCheckKeyValue(const char* path, const char* key, const char* value, int flags);

// Copies the value of `key` into `buf` (`size` bytes, terminator included).
// 1 when found; 0 when the key or the file is missing (`buf` then holds "");
// -1 on invalid arguments, a corrupt or unreadable file, or a value that
// does not fit.
int VLIBCFileGetKeyValue(const char* path, const char* key, char* buf, size_t size);

namespace VELA {
namespace System {
// Every key="value" line of the file at `path` in one read, in file order
// (a later line of a key follows its earlier ones). 1 when read, 0 when the
// file is missing (`out` empty), -1 when it is corrupt or unreadable.
int ReadKeyValueFile(const char* path, std::vector<std::pair<std::string, std::string>>& out);
// `value` from the last line of `key` in `settings` (as ReadKeyValueFile
// gives them), when that is a decimal number in [min, max]. An absent key
// keeps `value`; a bad one is logged, naming `path`, and keeps it too.
void NumberSetting(const std::vector<std::pair<std::string, std::string>>& settings, const char* path,
                   const char* key, long long min, long long max, long long& value);
}  // namespace System
}  // namespace VELA

// Sets `key` to `value` in the file at `path`, creating it (mode 0644) when
// missing: the first line of the key is replaced, its later lines dropped,
// or the entry is appended. The new content goes to a temporary file in the
// same directory, is fsync'd and renamed over `path`, keeping the mode (and,
// when run as root, the owner) of the old file; on any failure the old file
// is untouched and no temporary file is left. 0 on success, -1 on failure
// (invalid key or value, corrupt old file, path that is not a regular file,
// I/O error). Concurrent writers must hold a lock (VLIBCFileLockTimeByFile)
// around their read-modify-write; readers always see a whole file.
int VLIBCFileSetKeyValue(const char* path, const char* key, const char* value);

// The system information file /etc/velainfo.conf (under the root).
// VLIBCINFOSetKeyValue: as VLIBCFileSetKeyValue; 0 on success, negative on
// failure. VLIBCINFOGetKeyValue: as VLIBCFileGetKeyValue.
int VLIBCINFOSetKeyValue(const char* key, const char* value);
int VLIBCINFOGetKeyValue(const char* key, char* buf, size_t size);

// ---- Files and directories -----------------------------------------------------

// 1 when `path` names an existing regular file (symbolic links followed),
// 0 otherwise (missing, a directory or other kind, invalid argument).
int VLIBCFileExist(const char* path);

// Creates the regular file `path` (mode 0644) when missing and sets its
// access and modification times to now. The last component is never
// followed as a symbolic link. 0 on success, -1 on failure (also when
// `path` exists and is not a regular file).
int VLIBCFileTouch(const char* path);

// mkdir -p: creates `path` and its missing parents. Directories it creates
// get `mode` exactly (the umask does not apply): the last one always, the
// parents too when `allWithMode` is non-zero, else 0755. `uid`/`gid` own the
// directories it creates ((uid_t)-1 / (gid_t)-1 keep the creator's). With
// `resetExisting` non-zero an already existing last directory gets `mode`,
// `uid` and `gid` as well (never through a symbolic link: a link there
// fails). Existing components may otherwise be symbolic links to
// directories. A ".." component is refused. 0 when `path` is a directory
// afterwards, -1 otherwise (last error VLIBC_ERR_MKDIR or
// VLIBC_ERR_BAD_PARAMETER).
int VELAFSMkdirP(const char* path, int allWithMode, int resetExisting, uid_t uid, gid_t gid, mode_t mode);

// ---- Locks ----------------------------------------------------------------------
// Advisory locks (flock) on a lock file, created (mode 0600) when missing;
// the lock file is never followed as a symbolic link. A lock belongs to the
// open file: it is released by VLIBCFileUnlockByFile or when every process
// holding the handle has exited. A child created by fork shares the lock of
// a handle it inherits; the handle is closed on exec.

// Takes the lock of `path`: exclusive when `exclusive` is non-zero, else
// shared. Waits at most `timeoutSec` seconds (0: one attempt; a value below
// 0 or above 3600 is refused), polling every few milliseconds. 0 on success with `*handle` set to the
// handle (>= 0); -1 on failure with `*handle` set to -1 (last error
// VLIBC_ERR_TIMEOUT when the lock stayed held by someone else).
int VLIBCFileLockTimeByFile(const char* path, int exclusive, int timeoutSec, int* handle);

// Releases and closes a handle of VLIBCFileLockTimeByFile. 0 on success;
// -1 for any value that is not a handle this process got from
// VLIBCFileLockTimeByFile and has not released yet (nothing is closed then).
int VLIBCFileUnlockByFile(int handle);

// ---- Processes ------------------------------------------------------------------

#define VLIBC_FORK_DETACH 0x01           // the child is detached (see VLIBCProcForkEx)
#define VLIBC_FORK_NEW_SESSION 0x02      // the child calls setsid()
#define VLIBC_FORK_DEFAULT_SIGNALS 0x40  // the child gets default signal handling

// fork() after flushing every stdio stream (so buffered output is not
// written twice). The child's pid in the parent, 0 in the child, -1 on
// failure. The caller reaps the child (or leaves it to exit with the process).
pid_t VLIBCProcFork(void);

// VLIBCProcFork with options:
//  - VLIBC_FORK_DETACH: double fork. An intermediate child forks the worker
//    and exits at once; the caller reaps only that intermediate child (which
//    never blocks for long) and gets the worker's pid. The worker is the
//    child of init (or of a subreaper), so it never becomes a zombie of the
//    caller and the caller never waits for it.
//  - VLIBC_FORK_NEW_SESSION: the child (the worker when detached) leads a
//    new session (setsid).
//  - VLIBC_FORK_DEFAULT_SIGNALS: the child resets every signal to its
//    default action and unblocks all signals.
// Returns the child's (worker's) pid in the caller, 0 in the child
// (worker), -1 on failure (also for unknown flags) with errno set. Flags 65
// (detached, default signals) are what sub-requests use.
pid_t VLIBCProcForkEx(int flags);

// ---- Data volumes -----------------------------------------------------------------
// The data volumes are the directories listed in /etc/vela/volumes.conf
// (under the root): one absolute path per line, each resolved under the
// root; blank lines and lines starting with "#" are ignored; at most 64
// entries. Lines that are relative, hold "..", a control byte or more than
// 1024 bytes are skipped (and logged), as are entries that are not
// directories. No file, or no entry, means no volume.

#define VOLUME_AVAIL_WRITABLE 0x1  // skip volumes mounted read-only

typedef struct _tag_VOLUME_INFO_ {
    char szMountPath[4096];            // the volume's directory (resolved under the root)
    unsigned long long ullFreeBytes;   // free for ordinary users (f_bavail × f_frsize)
    unsigned long long ullTotalBytes;  // size of the file system
    int blReadOnly;                    // mounted read-only
} VOLUME_INFO, *PVOLUME_INFO;

// The first volume, in file order, with at least `bytes` + `reserveBytes`
// bytes free. 1 when found (`*info` filled); 0 when no volume is configured
// or none has the room (`*info` zeroed, last error VLIBC_ERR_NO_SPACE or
// VLIBC_ERR_NOT_FOUND); -1 on invalid arguments (null info, unknown flags,
// a sum that overflows).
int VolumeAvailGet(unsigned long long bytes, PVOLUME_INFO info, unsigned long long reserveBytes, int flags);

#pragma GCC visibility pop
