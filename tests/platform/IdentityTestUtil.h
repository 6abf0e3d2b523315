// Helpers of the identity tests: real accounts made with useradd/groupadd
// (root only) and checks run in a forked child, so the test process keeps
// its own identity whatever the code under test does.
#pragma once

#include <fcntl.h>
#include <functional>
#include <grp.h>
#include <pwd.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace VELA {
namespace Test {

// Runs a program (no shell), its output discarded. True when it exits 0.
inline bool RunProgram(const std::vector<std::string>& args)
{
    std::vector<char*> argv;
    for (const std::string& a : args) {
        argv.push_back(const_cast<char*>(a.c_str()));
    }
    argv.push_back(nullptr);
    const pid_t pid = fork();
    if (pid < 0) {
        return false;
    }
    if (pid == 0) {
        const int devnull = open("/dev/null", O_WRONLY);
        if (devnull >= 0) {
            dup2(devnull, 1);
            dup2(devnull, 2);
        }
        execv(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) {
            return false;
        }
    }
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// Runs `body` in a forked child and returns what it returned ("" means every
// check passed), or a description of how the child died.
inline std::string InChild(const std::function<std::string()>& body)
{
    int fds[2];
    if (pipe(fds) != 0) {
        return "pipe failed";
    }
    const pid_t pid = fork();
    if (pid < 0) {
        return "fork failed";
    }
    if (pid == 0) {
        close(fds[0]);
        const std::string out = body();
        (void)!write(fds[1], out.data(), out.size());  // short reports: one write
        _exit(0);
    }
    close(fds[1]);
    std::string out;
    char buf[4096];
    ssize_t n;
    while ((n = read(fds[0], buf, sizeof(buf))) > 0 || (n < 0 && errno == EINTR)) {
        out.append(buf, n > 0 ? static_cast<size_t>(n) : 0);
    }
    close(fds[0]);
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        out += " [child died, status " + std::to_string(status) + "]";
    }
    return out;
}

// An unprivileged system user vela-t-<pid> with its own primary group and
// the supplementary group vela-tg-<pid>. Remove() deletes both (and is safe
// to call after a partial Create()).
struct TestAccount {
    std::string user = "vela-t-" + std::to_string(getpid());
    std::string supp = "vela-tg-" + std::to_string(getpid());
    uid_t uid = 0;
    gid_t gid = 0;
    gid_t suppGid = 0;

    bool Create()
    {
        if (!RunProgram({"/usr/sbin/groupadd", "--system", supp}) ||
            !RunProgram({"/usr/sbin/useradd", "--system", "--no-create-home", "--shell", "/usr/sbin/nologin",
                         "--user-group", "--groups", supp, user})) {
            return false;
        }
        const struct passwd* pw = getpwnam(user.c_str());
        const struct group* gr = getgrnam(supp.c_str());
        if (pw == nullptr || gr == nullptr) {
            return false;
        }
        uid = pw->pw_uid;
        gid = pw->pw_gid;
        suppGid = gr->gr_gid;
        return uid != 0 && gid != 0;
    }

    void Remove()
    {
        RunProgram({"/usr/sbin/userdel", user});
        RunProgram({"/usr/sbin/groupdel", user});  // the user's own group, if userdel left it
        RunProgram({"/usr/sbin/groupdel", supp});
    }
};

}  // namespace Test
}  // namespace VELA
