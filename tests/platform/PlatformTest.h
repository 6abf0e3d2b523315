// Helpers shared by the platform tests (their fixtures: StateRootTest.h):
// files with their modes, directory listings, children forked to run a piece
// of the test, and the CGI handle.
#pragma once

#include <gtest/gtest.h>

#include <fstream>
#include <functional>
#include <json/json.h>
#include <map>
#include <set>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "platform/StateRootTest.h"
#include "support/TestSupport.h"
#include "vela/cgi.h"

namespace VELA {
namespace Test {

// Writes `data` to `path` (created or emptied) and gives it `mode`.
inline void WriteFile(const std::string& path, const std::string& data, mode_t mode = 0644)
{
    std::ofstream(path, std::ios::binary | std::ios::trunc) << data;
    ASSERT_EQ(0, chmod(path.c_str(), mode)) << path;
}

// The permission bits of `path` itself (links not followed); 0 when it is missing.
inline mode_t Mode(const std::string& path)
{
    struct stat st;
    return lstat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
}

// The names in `dir`, sorted.
inline std::set<std::string> Names(const std::string& dir)
{
    const std::vector<std::string> names = DirEntries(dir);
    return std::set<std::string>(names.begin(), names.end());
}

// Every path under `dir` with its mode, size and modification time, so a test
// can tell that a call touched nothing.
inline std::map<std::string, std::string> Tree(const std::string& dir)
{
    std::map<std::string, std::string> out;
    for (const std::string& name : DirEntries(dir)) {
        const std::string path = dir + "/" + name;
        struct stat st;
        if (lstat(path.c_str(), &st) == 0) {
            out[path] = std::to_string(st.st_mode) + " " + std::to_string(st.st_size) + " " +
                        std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec);
            if (S_ISDIR(st.st_mode)) {
                const std::map<std::string, std::string> sub = Tree(path);
                out.insert(sub.begin(), sub.end());
            }
        }
    }
    return out;
}

// `doc` as JSON text once for each change of `changes`: the key set to the
// value, or removed when the value is null.
inline std::vector<std::string> JsonVariants(const Json::Value& doc,
                                             const std::vector<std::pair<std::string, Json::Value>>& changes)
{
    std::vector<std::string> out;
    for (const auto& change : changes) {
        Json::Value changed = doc;
        if (change.second.isNull()) {
            changed.removeMember(change.first);
        } else {
            changed[change.first] = change.second;
        }
        out.push_back(Json::writeString(Json::StreamWriterBuilder(), changed));
    }
    return out;
}

// In the existing directory `files`: target.txt ("secret"), dir/in.txt
// ("in"), and the links last (to target.txt), middle (to dir) and relative
// (to "dir").
inline void MakeLinkTree(const std::string& files)
{
    WriteFile(files + "/target.txt", "secret");
    ASSERT_EQ(0, mkdir((files + "/dir").c_str(), 0755));
    WriteFile(files + "/dir/in.txt", "in");
    ASSERT_EQ(0, symlink((files + "/target.txt").c_str(), (files + "/last").c_str()));
    ASSERT_EQ(0, symlink((files + "/dir").c_str(), (files + "/middle").c_str()));
    ASSERT_EQ(0, symlink("dir", (files + "/relative").c_str()));
}

// Children forked at once, each running `body(i)` and exiting with what it
// returns.
class Children {
public:
    Children(int n, const std::function<int(int)>& body)
    {
        fflush(nullptr);
        for (int i = 0; i < n; ++i) {
            const pid_t pid = fork();
            if (pid == 0) {
                _exit(body(i));
            }
            pids_.push_back(pid);
        }
    }
    pid_t Pid(size_t i) const { return pids_[i]; }
    // Waits for them all: their exit codes, 128 + the signal for a child a
    // signal ended, -1 for one that could not be forked.
    std::vector<int> Wait()
    {
        std::vector<int> codes;
        for (pid_t pid : pids_) {
            int status = 0;
            if (pid <= 0 || waitpid(pid, &status, 0) != pid) {
                codes.push_back(-1);
            } else {
                codes.push_back(WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status));
            }
        }
        pids_.clear();
        return codes;
    }

private:
    std::vector<pid_t> pids_;
};

inline std::vector<int> InChildren(int n, const std::function<int(int)>& body) { return Children(n, body).Wait(); }

struct CgiHandle {
    CgiHandle() { EXPECT_EQ(0, VelaCgiInit("test", &ctx)); }
    ~CgiHandle() { VelaCgiFree(ctx); }
    VELACGI_CTX* ctx = nullptr;
};

}  // namespace Test
}  // namespace VELA
