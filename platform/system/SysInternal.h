// Helpers shared by the system-library sources (users, credentials, files,
// volumes); not installed.
#pragma once

#include <cstddef>
#include <string>
#include <sys/types.h>
#include <vector>

#include "system/FileUtil.h"

namespace VELA {
namespace System {

// `path` resolved as the public headers describe: an absolute path under
// the system root unless it already lies inside it; a relative path as it
// is. Empty for null, empty or over-long (PATH_MAX) paths and paths holding
// control bytes.
std::string ResolvePath(const char* path);

// Records a failure in the last-error record with the source file stem and
// line (errno kept). `fmt` is printf-like.
void RecordError(int code, const char* file, int line, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));
#define VELA_RECORD_ERROR(code, fmt, ...) \
    ::VELA::System::RecordError((code), __FILE__, __LINE__, fmt, ##__VA_ARGS__)

// ---- Key=value text (format in vela/sysfile.h) ----

// Valid key: 1 to 128 bytes of letters, digits, "_", "-", ".".
bool ValidKey(const char* key);
// Valid value: at most 4096 bytes, no control byte other than tab.
bool ValidValue(const char* value);

// One entry line of a key=value file.
struct KeyValueLine {
    std::string text;  // the line as read, without its line end
    std::string key;   // empty for blank lines and comments
    std::string value; // unquoted
};

// Splits `text` into lines. False when the text is corrupt (see the format).
bool ParseKeyValueText(const std::string& text, std::vector<KeyValueLine>& lines);

// Reads `key` from the resolved file `path`. 1 found (`value` set), 0 key or
// file missing, -1 unreadable or corrupt (last error recorded).
int ReadKeyValue(const std::string& path, const std::string& key, std::string& value);

// ---- Users and groups ----

// User and group names: 1 to 255 bytes, no "/", ":", control byte, not "."
// or "..".
bool ValidAccountName(const char* name);

// NSS look-ups without logging or recording anything: 1 found, 0 no such
// name (also the ENOENT, ESRCH, EBADF and EPERM some NSS modules give for
// it), -1 lookup error with errno set. Can throw std::bad_alloc.
int FindUserByName(const char* name, uid_t& uid, gid_t& gid, std::string* canonical);
int FindGroupByName(const char* name, gid_t& gid);

// The same look-ups, plus the uid one, with an error logged and recorded in
// the last-error record. 1 found, 0 no such name, -1 lookup error.
int LookupUserByName(const char* name, uid_t& uid, gid_t& gid, std::string* canonical);
int LookupUserByUID(uid_t uid, std::string& name, gid_t& gid);
int LookupGroupByName(const char* name, gid_t& gid);
// Every group of `user` (getgrouplist with `base` included). False on error.
bool GroupListOf(const std::string& user, gid_t base, std::vector<gid_t>& groups);

}  // namespace System
}  // namespace VELA
