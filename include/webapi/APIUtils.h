// Running a few statements with full rights, and writing the system
// information file.
#pragma once

#include <string>
#include <sys/types.h>

namespace VELA {

// Gains effective uid and gid 0 for its scope and puts the recorded
// effective ids back when it ends. Check Ok() before the guarded statements:
// they must be skipped when the rights could not be gained.
//
//   RunAsRootGuard guard(__FILE__, __LINE__, "IF_RUN_AS");
//   if (guard.Ok()) { ... }
class RunAsRootGuard {
public:
    RunAsRootGuard(const char* file, int line, const char* label);
    ~RunAsRootGuard();
    RunAsRootGuard(const RunAsRootGuard&) = delete;
    RunAsRootGuard& operator=(const RunAsRootGuard&) = delete;
    bool Ok() const { return ok_; }

private:
    uid_t uid_;  // (uid_t)-1: leave as it is
    gid_t gid_;
    const char* file_;
    int line_;
    const char* label_;
    bool ok_;
};

#define IF_RUN_AS_ROOT()                                                   \
    if (::VELA::RunAsRootGuard _vela_root_guard{__FILE__, __LINE__, "IF_RUN_AS"}; \
        _vela_root_guard.Ok())

class APIUtils {
public:
    // Writes key="value" into the system information file
    // (<root>/etc/velainfo.conf) with full rights.
    static bool SetVelaInfo(const std::string& key, const std::string& value);
};

}  // namespace VELA
