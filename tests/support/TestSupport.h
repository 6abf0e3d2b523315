// Helpers shared by the test programs.
#pragma once

#include <initializer_list>
#include <string>
#include <vector>

namespace VELA {
namespace Test {

// Captures every log line while it lives (installs the log sink).
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    const std::vector<std::string>& Lines() const { return lines_; }
    // True when some captured line contains `text`.
    bool Contains(const std::string& text) const;
    // The priority (facility included) of the first line holding every one
    // of `texts`; -1 when no line does.
    int PriorityOf(std::initializer_list<std::string> texts) const;

private:
    static void Sink(int priority, const char* line, void* arg);
    std::vector<std::string> lines_;
    std::vector<int> priorities_;
};

// A fresh directory under $TMPDIR, removed with everything in it at the end
// of the scope.
class TempDir {
public:
    TempDir();
    ~TempDir();
    const std::string& Path() const { return path_; }

private:
    std::string path_;
};

// Sets (or, with a null value, unsets) an environment variable for the
// scope, restoring the old state afterwards.
class ScopedEnv {
public:
    ScopedEnv(const char* name, const char* value);
    ~ScopedEnv();

private:
    std::string name_;
    std::string old_;
    bool had_;
};

// The whole content of the file `path`; empty when it cannot be read.
std::string ReadText(const std::string& path);

// The names in the directory `dir` other than "." and "..", in readdir
// order; empty when it cannot be opened.
std::vector<std::string> DirEntries(const std::string& dir);

}  // namespace Test
}  // namespace VELA
