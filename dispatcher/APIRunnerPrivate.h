// The private side of APIRunner: the names under which the process shows
// itself (argument 0, the process name prefix, the name it started with),
// the description registry, the handler-library cache, the compound depth
// and the call on the road.
#pragma once

#include <cstddef>
#include <string>

#include "dispatcher/LibCache.h"
#include "dispatcher/Registry.h"

namespace VELA {

class APIRunner;
struct ResolvedCall;

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
    // Whether argument 0 shows `name` (or there is no argument area).
    bool ShowsName(const char* name) const;

    // The name check of API names (IsAPIName), asked once for a name the
    // runner has just found good: a call named once by its front end and
    // once by the road is checked once.
    bool CheckName(const std::string& api, APIName& out);

    // The call the road is walking (the innermost one), null between calls.
    // The method-attribute look-ups of the hooks read it instead of the
    // registry.
    const ResolvedCall* Current() const { return current_; }
    void SetCurrent(const ResolvedCall* call) { current_ = call; }

    Registry registry;
    LibCache libs;
    int compoundDepth = 0;

private:
    APIRunner* owner_;
    char* argv0_ = nullptr;
    size_t argv0Len_ = 0;  // strlen(argv[0]) when taken over
    std::string shown_;    // what SetArgv0 last wrote
    std::string procName_;
    std::string origProcName_;
    APIName lastChecked_;
    const ResolvedCall* current_ = nullptr;
};

}  // namespace VELA
