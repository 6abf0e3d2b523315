// The private side of APIRunner: the names under which the process shows
// itself (argument 0, the process name prefix, the name it started with).
#pragma once

#include <cstddef>
#include <string>

namespace VELA {

class APIRunner;

class APIRunnerPrivate {
public:
    // Both names start as the process's invocation name, then as the last
    // path component of the first word of /proc/self/cmdline.
    explicit APIRunnerPrivate(APIRunner* owner);
    APIRunnerPrivate(const APIRunnerPrivate&) = delete;
    APIRunnerPrivate& operator=(const APIRunnerPrivate&) = delete;

    // Takes over argv[0] as the area that shows the process name in ps:
    // clears it and writes "velascgi" at its start. A process whose initial
    // name holds "velascgi_" (renamed by an earlier runner) gets the prefix
    // "velascgi". Nothing when argc < 1 or argv is null.
    void SetArgs(int argc, char** argv);
    // Clears the argument area and writes `name` into it, cut to the
    // area's length. Nothing when no area is known.
    void SetArgv0(const char* name);

    // Prefix of "<prefix>_<api>_<version>_<method>".
    const std::string& GetProcName() const { return procName_; }
    // The name the process had when the runner was made.
    const std::string& GetOrigProcName() const { return origProcName_; }

private:
    APIRunner* owner_;
    char* argv0_ = nullptr;
    size_t argv0Len_ = 0;  // strlen(argv[0]) when taken over
    std::string procName_;
    std::string origProcName_;
};

}  // namespace VELA
