// Data volumes: the directories listed in <root>/etc/vela/volumes.conf and
// their free space. Contract and file format are in vela/sysfile.h.
#include <cerrno>
#include <climits>
#include <cstring>
#include <string>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <vector>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/sysfile.h"

namespace {

using namespace VELA::System;

constexpr size_t kMaxConfFile = 64 * 1024;
constexpr size_t kMaxEntries = 64;
constexpr size_t kMaxEntryLength = 1024;
const char kConfPath[] = "/etc/vela/volumes.conf";

std::string Trim(const std::string& s)
{
    const char* blanks = " \t\r";
    const size_t begin = s.find_first_not_of(blanks);
    if (begin == std::string::npos) {
        return std::string();
    }
    const size_t end = s.find_last_not_of(blanks);
    return s.substr(begin, end - begin + 1);
}

bool ValidEntry(const std::string& entry)
{
    if (entry.empty() || entry[0] != '/' || entry.size() > kMaxEntryLength) {
        return false;
    }
    for (unsigned char c : entry) {
        if (c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    // ".." as a component ("/a/..", "/a/../b") would leave the listed place.
    const std::string padded = entry + "/";
    return padded.find("/../") == std::string::npos;
}

// The configured volumes, resolved under the root, in file order.
std::vector<std::string> ConfiguredVolumes()
{
    std::vector<std::string> volumes;
    const std::string conf = ResolvePath(kConfPath);
    std::string text;
    int err = 0;
    if (!ReadFileBounded(conf, kMaxConfFile, text, err)) {
        if (err != ENOENT) {
            errno = err;
            VELA_LOG_ERR("cannot read %s: %m", conf.c_str());
        }
        return volumes;
    }
    size_t start = 0;
    while (start < text.size() && volumes.size() < kMaxEntries) {
        size_t end = text.find('\n', start);
        if (end == std::string::npos) {
            end = text.size();
        }
        const std::string line = Trim(text.substr(start, end - start));
        start = end + 1;
        if (line.empty() || line[0] == '#') {
            continue;
        }
        if (!ValidEntry(line)) {
            VELA_LOG_ERR("%s: ignoring invalid volume \"%.64s\"", conf.c_str(), line.c_str());
            continue;
        }
        const std::string resolved = ResolvePath(line.c_str());
        if (!resolved.empty()) {
            volumes.push_back(resolved);
        }
    }
    return volumes;
}

int AvailGet(unsigned long long bytes, PVOLUME_INFO info, unsigned long long reserveBytes, int flags)
{
    memset(info, 0, sizeof(*info));
    if (bytes > ULLONG_MAX - reserveBytes) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "requested size overflows");
        return -1;
    }
    const unsigned long long need = bytes + reserveBytes;
    const std::vector<std::string> volumes = ConfiguredVolumes();
    if (volumes.empty()) {
        VELA_RECORD_ERROR(VLIBC_ERR_NOT_FOUND, "no data volume configured");
        return 0;
    }
    for (const std::string& volume : volumes) {
        struct stat st;
        struct statvfs vfs;
        if (volume.size() >= sizeof(info->szMountPath) || stat(volume.c_str(), &st) != 0 || !S_ISDIR(st.st_mode) ||
            statvfs(volume.c_str(), &vfs) != 0) {
            continue;
        }
        const bool readOnly = (vfs.f_flag & ST_RDONLY) != 0;
        if (readOnly && (flags & VOLUME_AVAIL_WRITABLE)) {
            continue;
        }
        const unsigned long long frag = vfs.f_frsize ? vfs.f_frsize : vfs.f_bsize;
        const unsigned long long avail = static_cast<unsigned long long>(vfs.f_bavail);
        const unsigned long long blocks = static_cast<unsigned long long>(vfs.f_blocks);
        // Saturate instead of wrapping on absurd block counts.
        const unsigned long long freeBytes = frag && avail > ULLONG_MAX / frag ? ULLONG_MAX : avail * frag;
        const unsigned long long totalBytes = frag && blocks > ULLONG_MAX / frag ? ULLONG_MAX : blocks * frag;
        if (freeBytes < need) {
            continue;
        }
        memcpy(info->szMountPath, volume.c_str(), volume.size() + 1);
        info->ullFreeBytes = freeBytes;
        info->ullTotalBytes = totalBytes;
        info->blReadOnly = readOnly ? 1 : 0;
        return 1;
    }
    VELA_RECORD_ERROR(VLIBC_ERR_NO_SPACE, "no volume with %llu bytes free", need);
    return 0;
}

}  // namespace

int VolumeAvailGet(unsigned long long bytes, PVOLUME_INFO info, unsigned long long reserveBytes, int flags)
{
    if (info == nullptr || (flags & ~VOLUME_AVAIL_WRITABLE) != 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "null info or unknown flags");
        return -1;
    }
    try {
        return AvailGet(bytes, info, reserveBytes, flags);
    } catch (const std::exception&) {
        memset(info, 0, sizeof(*info));
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}
