// Letting go of the reply in a process that outlives it.
#include "subprocess/Detach.h"

#include <climits>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "dispatcher/ProcessName.h"

namespace VELA {

namespace {

bool IsPipeOrSocket(int fd)
{
    struct stat st;
    return fstat(fd, &st) == 0 && (S_ISFIFO(st.st_mode) || S_ISSOCK(st.st_mode));
}

// The descriptors of this process above standard error.
std::vector<int> OpenDescriptors()
{
    std::vector<int> fds;
    DIR* dir = opendir("/proc/self/fd");
    if (dir == nullptr) {
        const long max = sysconf(_SC_OPEN_MAX);
        for (int fd = 3; fd < (max > 0 && max < 65536 ? max : 65536); ++fd) {
            if (fcntl(fd, F_GETFD) >= 0) {
                fds.push_back(fd);
            }
        }
        return fds;
    }
    for (struct dirent* entry; (entry = readdir(dir)) != nullptr;) {
        char* end = nullptr;
        const long fd = strtol(entry->d_name, &end, 10);
        if (end != entry->d_name && *end == '\0' && fd > 2 && fd != dirfd(dir) && fd <= INT_MAX) {
            fds.push_back(static_cast<int>(fd));
        }
    }
    closedir(dir);
    return fds;
}

}  // namespace

void LetGoOfTheReply()
{
    const int null = open("/dev/null", O_RDWR);
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
        if (fd == STDERR_FILENO && !IsPipeOrSocket(fd)) {
            continue;
        }
        if (null < 0) {
            close(fd);
        } else if (null != fd) {
            dup2(null, fd);
        }
    }
    if (null > STDERR_FILENO) {
        close(null);
    }
    closelog();
    for (int fd : OpenDescriptors()) {
        if (IsPipeOrSocket(fd)) {
            close(fd);
        }
    }
    if (ProcessLogIdent()[0] != '\0') {
        openlog(ProcessLogIdent(), LOG_CONS | LOG_PID, LOG_USER);
    }
}


}  // namespace VELA
