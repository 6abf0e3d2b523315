// What a handler call runs in, and what is put back after it: the standard
// stream objects, the scheduling priority and the working directory
// (CallScope), and the identity chosen from the API's and the method's
// "runAs", "grantable", "grantByDefault" and "grantByUser" (ExecContext).
#pragma once

#include <fstream>
#include <string>
#include <sys/types.h>
#include <vector>

#include "vela/user.h"

namespace VELA {

// What a call changes around its handler and puts back on every way out
// (Restore, or the destructor).
class CallScope {
public:
    CallScope() = default;
    CallScope(const CallScope&) = delete;
    CallScope& operator=(const CallScope&) = delete;
    ~CallScope() { Restore(); }

    // std::cin reads /dev/null unless `keepIn`; std::cout writes to
    // /dev/null unless `keepOut`. Only the stream objects change; the file
    // descriptors stay as they are.
    void RedirectStreams(bool keepIn, bool keepOut);
    // Sets the nice value `priority` when the process runs with another.
    void SetPriority(int priority);
    // Remembers the working directory to come back to. False (logged) when
    // it cannot be read.
    bool SaveCwd();
    void Restore();

private:
    std::filebuf nullIn_;
    std::filebuf nullOut_;
    std::streambuf* oldIn_ = nullptr;
    std::streambuf* oldOut_ = nullptr;
    int oldPriority_ = 0;
    bool priorityChanged_ = false;
    std::string cwd_;
};

// What a call asks for, as read from its description and its request.
struct ExecIdentity {
    std::string runAs = VELA_RUNAS_SUPERUSER;  // the API's "runAs", replaced by the method's
    std::string loginName;                     // the session's account, may be empty; never a run-as name
    bool grantable = false;
    bool grantByDefault = false;
    bool grantByUser = false;
};

// One handler call's identity switch. SaveIds() before Prepare(); Restore()
// after the handler (the destructor restores too if nobody did).
class ExecContext {
public:
    ExecContext() = default;
    ~ExecContext();
    ExecContext(const ExecContext&) = delete;
    ExecContext& operator=(const ExecContext&) = delete;

    // Records the real, effective and saved user and group ids and the
    // supplementary groups. False when they cannot be read.
    bool SaveIds();
    // Switches to the identity `want` asks for. False (logged) ends the call
    // before the handler runs; the response keeps its preset error.
    bool Prepare(const ExecIdentity& want);
    // Puts the recorded identity back when the switch asked for it
    // (grantable, or grantByDefault). Failures are only logged.
    void Restore();

private:
    uid_t ruid_ = 0, euid_ = 0, suid_ = 0;
    gid_t rgid_ = 0, egid_ = 0, sgid_ = 0;
    std::vector<gid_t> groups_;
    bool saved_ = false;
    bool restore_ = false;
};

}  // namespace VELA
