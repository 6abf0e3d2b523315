// Helpers shared by the platform tests (their fixtures: StateRootTest.h):
// files with their modes, directory listings, JSON files edited in place,
// children forked to run a piece of the test, programs run with their output
// kept, and the CGI handle.
#pragma once

#include <gtest/gtest.h>

#include <fcntl.h>
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
#include "vela/webapiutil.h"

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

// `doc` as JSON text once for each change of `changes` (the key set to the
// value, or removed when the value is null) and once without each of `removed`.
inline std::vector<std::string> JsonVariants(const Json::Value& doc,
                                             std::vector<std::pair<std::string, Json::Value>> changes,
                                             const std::vector<std::string>& removed = {})
{
    for (const std::string& key : removed) {
        changes.push_back({key, Json::Value()});
    }
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

// Expects each member of `want` in `doc`, of the same type and value.
inline void ExpectMembers(const Json::Value& doc, std::initializer_list<std::pair<const char*, Json::Value>> want)
{
    for (const auto& member : want) {
        EXPECT_EQ(member.second, doc[member.first]) << member.first;
    }
}

// Sets `key` of the JSON file at `path` to `value`, the way the code writes it.
inline void EditJson(const std::string& path, const std::string& key, const Json::Value& value)
{
    Json::Value doc;
    ASSERT_TRUE(WebAPIUtil::ReadJsonFile(path, doc)) << path;
    doc[key] = value;
    ASSERT_TRUE(WebAPIUtil::WriteJsonFileAtomic(path, doc, 0600)) << path;
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

// A pipe that makes one process wait for another: Wait() gives the byte the
// other side posted, 0 once no writer is left.
class Gate {
public:
    Gate() { EXPECT_EQ(0, pipe(fds_)); }
    ~Gate()
    {
        close(fds_[0]);
        close(fds_[1]);
    }
    void Post(char c = 'y') const { (void)!write(fds_[1], &c, 1); }
    char Wait() const
    {
        char c = 0;
        return read(fds_[0], &c, 1) == 1 ? c : 0;
    }

private:
    int fds_[2];
};

// Polls `done` every `micros`, at most `tries` times (a bound on the wait,
// not a timing assertion). True once it holds.
inline bool WaitUntil(const std::function<bool()>& done, int tries = 500, useconds_t micros = 10000)
{
    for (int i = 0; i < tries; ++i) {
        if (done()) {
            return true;
        }
        usleep(micros);
    }
    return done();
}

struct Ran { int status = -1; std::string out, err; };

// Runs argv[0] from PATH (or /proc/self/exe) with `env` added; its output
// goes through files, so nothing can block on a full pipe.
inline Ran RunTool(const std::vector<std::string>& argv,
                   const std::vector<std::pair<std::string, std::string>>& env = {})
{
    TempDir io;
    const std::string out = io.Path() + "/out", err = io.Path() + "/err";
    pid_t pid = fork();
    if (pid == 0) {
        int o = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int e = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int in = open("/dev/null", O_RDONLY);
        if (o < 0 || e < 0 || in < 0 || dup2(o, 1) < 0 || dup2(e, 2) < 0 || dup2(in, 0) < 0) {
            _exit(126);
        }
        for (const auto& kv : env) {
            setenv(kv.first.c_str(), kv.second.c_str(), 1);
        }
        std::vector<char*> args;
        for (const auto& a : argv) {
            args.push_back(const_cast<char*>(a.c_str()));
        }
        args.push_back(nullptr);
        execvp(args[0], args.data());
        _exit(127);
    }
    Ran ran;
    if (pid > 0 && waitpid(pid, &ran.status, 0) == pid) {
        ran.out = ReadText(out);
        ran.err = ReadText(err);
    }
    return ran;
}

inline bool Exited0(const Ran& ran) { return WIFEXITED(ran.status) && WEXITSTATUS(ran.status) == 0; }

struct CgiHandle {
    CgiHandle() { EXPECT_EQ(0, VelaCgiInit("test", &ctx)); }
    ~CgiHandle() { VelaCgiFree(ctx); }
    VELACGI_CTX* ctx = nullptr;
};

}  // namespace Test
}  // namespace VELA
