// Preference directories of users and groups:
// <root>/var/lib/vela/preference/{user,group}/<name>, mode 0700, owned by
// the user (or group) when the process runs as root.
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/vlibc.h"

namespace {

constexpr size_t kMaxName = 255;  // NAME_MAX: one path component
const char kPreferenceBase[] = "/var/lib/vela/preference/";

enum class Kind { User, Group };

// The name becomes one path component: it must not be empty, "." or "..",
// hold "/" or a control byte, or exceed NAME_MAX bytes.
bool ValidName(const char* name)
{
    if (name == nullptr) {
        return false;
    }
    const size_t len = strnlen(name, kMaxName + 1);
    if (len == 0 || len > kMaxName) {
        return false;
    }
    if (strcmp(name, ".") == 0 || strcmp(name, "..") == 0) {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        const unsigned char c = static_cast<unsigned char>(name[i]);
        if (c == '/' || c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

// Owner for the directory from NSS. 1 when found, 0 when the name is not
// known, -1 on a lookup error.
int LookupOwner(Kind kind, const char* name, uid_t& uid, gid_t& gid)
{
    int found = -1;
    try {
        if (kind == Kind::User) {
            found = VELA::System::FindUserByName(name, uid, gid, nullptr);
        } else {
            found = VELA::System::FindGroupByName(name, gid);
            if (found == 1) {
                uid = static_cast<uid_t>(-1);  // the owner stays root
            }
        }
    } catch (const std::exception&) {
        return -1;
    }
    if (found < 0) {
        VELA_LOG_ERR("looking up %s \"%s\": %m", kind == Kind::User ? "user" : "group", name);
    }
    return found;
}

int PreferenceDirGet(Kind kind, const char* name, char* buf, size_t size)
{
    const char* what = kind == Kind::User ? "user" : "group";
    if (!ValidName(name)) {
        VELA_LOG_ERR("invalid %s name for a preference directory", what);
        return -1;
    }
    if (buf == nullptr || size == 0) {
        return -1;
    }
    const std::string parent = VELA::System::Path(std::string(kPreferenceBase) + what);
    const std::string path = parent + "/" + name;
    // Check the room first so a failure leaves nothing behind.
    if (path.size() + 1 > size) {
        VELA_LOG_ERR("buffer of %zu bytes too small for %s", size, path.c_str());
        return -1;
    }
    if (!VELA::System::MakeDirs(parent, 0755)) {
        return -1;
    }
    int parentFd = open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (parentFd < 0) {
        VELA_LOG_ERR("open(%s): %m", parent.c_str());
        return -1;
    }
    bool created = mkdirat(parentFd, name, 0700) == 0;
    if (!created && errno != EEXIST) {
        VELA_LOG_ERR("mkdir(%s): %m", path.c_str());
        close(parentFd);
        return -1;
    }
    // O_NOFOLLOW: the leaf is never a symbolic link, so the chown below
    // cannot be redirected to another file.
    int fd = openat(parentFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    close(parentFd);
    if (fd < 0) {
        VELA_LOG_ERR("open(%s): %m", path.c_str());
        return -1;
    }
    int rc = 0;
    if (created && fchmod(fd, 0700) != 0) {  // whatever the umask was
        VELA_LOG_ERR("chmod(%s): %m", path.c_str());
        rc = -1;
    }
    if (rc == 0 && geteuid() == 0) {
        uid_t uid = static_cast<uid_t>(-1);
        gid_t gid = static_cast<gid_t>(-1);
        // An NSS error leaves the directory owned by root: still private.
        if (LookupOwner(kind, name, uid, gid) == 1 && fchown(fd, uid, gid) != 0) {
            VELA_LOG_ERR("chown(%s): %m", path.c_str());
            rc = -1;
        }
    }
    close(fd);
    if (rc != 0) {
        return -1;
    }
    memcpy(buf, path.c_str(), path.size() + 1);
    return 0;
}

}  // namespace

int VELAUserPreferenceDirGet(const char* user, char* buf, size_t size)
{
    try {
        return PreferenceDirGet(Kind::User, user, buf, size);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory building a preference directory");
        return -1;
    }
}

int VELAGroupPreferenceDirGet(const char* group, char* buf, size_t size)
{
    try {
        return PreferenceDirGet(Kind::Group, group, buf, size);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory building a preference directory");
        return -1;
    }
}
