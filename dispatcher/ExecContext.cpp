// What a handler call runs in: its standard streams, priority and working
// directory, its identity, and the scoped guard that runs a few statements
// with full rights; the road's stages that set them up and call the handler.
// The call's switches log under this file's name; the guard logs under the
// file its user names.
#include "dispatcher/ExecContext.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <exception>
#include <grp.h>
#include <iostream>
#include <sys/resource.h>
#include <unistd.h>

#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "dispatcher/Road.h"
#include "vela/log.h"
#include "vela/uploaddir.h"
#include "vela/user.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIUtils.h"

namespace VELA {

namespace {

const uid_t kKeepUid = static_cast<uid_t>(-1);
const gid_t kKeepGid = static_cast<gid_t>(-1);
constexpr int kMaxGroups = 65536;

// "WARNING: set<what>(r, e, s)" to the authorisation facility after a
// successful set, "ERROR: set<what>(r, e, s) [reason]" after a failed one.
// errno is kept.
void LogSet(int line, bool ok, const char* what, int r, int e, int s, int err)
{
    const int saved = errno;
    if (ok) {
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_INFO, __FILE__, line, "WARNING: set%s(%d, %d, %d)", what, r, e, s);
    } else {
        char buf[256];
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, __FILE__, line, "ERROR: set%s(%d, %d, %d) [%s]", what, r, e, s,
                  strerror_r(err, buf, sizeof(buf)));
    }
    errno = saved;
}

// setresuid/setresgid with the log line above. `logSuccess` false leaves a
// success unlogged (failures are always logged).
bool SetResUid(int line, uid_t r, uid_t e, uid_t s, bool logSuccess = true)
{
    const bool ok = setresuid(r, e, s) == 0;
    const int err = errno;
    if (!ok || logSuccess) {
        LogSet(line, ok, "resuid", static_cast<int>(r), static_cast<int>(e), static_cast<int>(s), err);
    }
    errno = err;
    return ok;
}

bool SetResGid(int line, gid_t r, gid_t e, gid_t s, bool logSuccess = true)
{
    const bool ok = setresgid(r, e, s) == 0;
    const int err = errno;
    if (!ok || logSuccess) {
        LogSet(line, ok, "resgid", static_cast<int>(r), static_cast<int>(e), static_cast<int>(s), err);
    }
    errno = err;
    return ok;
}

bool ReadGroups(std::vector<gid_t>& out)
{
    const int n = getgroups(0, nullptr);
    if (n < 0 || n > kMaxGroups) {
        return false;
    }
    std::vector<gid_t> groups(static_cast<size_t>(n));
    const int got = n > 0 ? getgroups(n, groups.data()) : 0;
    if (got < 0) {
        return false;
    }
    groups.resize(static_cast<size_t>(got));
    std::sort(groups.begin(), groups.end());
    out.swap(groups);
    return true;
}

// Who a switch is for: the description's run-as identity, where "system"
// is the superuser, or the session's account, which is only ever an
// account, whatever its name.
enum class Whom { RunAs, Account };

// Runs the process as `name`. Takes back root first; when that is refused,
// a process that already is that identity goes on as it is.
bool SwitchTo(Whom whom, const std::string& name, bool grantable)
{
    const auto reset = [&] {
        return whom == Whom::RunAs ? ResetCredentialsForRunAs(name.c_str(), grantable)
                                   : ResetCredentialsByName(name.c_str(), grantable);
    };
    if (SetResUid(__LINE__, kKeepUid, 0, kKeepUid)) {
        if (!grantable && VELA::Transfer::UploadDirPath()[0] != '\0') {
            uid_t uid = 0;
            gid_t gid = 0;
            const int found = whom == Whom::RunAs ? VELA::System::RunAsGetUGID(name.c_str(), &uid, &gid)
                                                  : VELAUserGetUGID(name.c_str(), &uid, &gid);
            if (found == 0 && uid != 0) {
                // Root for good no more: what root's upload stored is
                // removed by a reaper that keeps root.
                VELA::Transfer::UploadDirReaper();
            }
        }
        return reset();
    }
    uid_t uid = 0;
    gid_t gid = 0;
    const int known = whom == Whom::RunAs ? VELA::System::RunAsGetUGID(name.c_str(), &uid, &gid)
                                          : VELAUserGetUGID(name.c_str(), &uid, &gid);
    if (known == 0 && geteuid() == uid && getegid() == gid) {
        return true;
    }
    return reset();
}

}  // namespace

// ---- CallScope ------------------------------------------------------------------

void CallScope::RedirectStreams(bool keepIn, bool keepOut)
{
    if (!keepIn) {
        if (nullIn_.open("/dev/null", std::ios::in)) {
            oldIn_ = std::cin.rdbuf(&nullIn_);
        } else {
            VELA_LOG_ERR("cannot open /dev/null for reading");
        }
    }
    if (!keepOut) {
        std::cout.flush();
        if (nullOut_.open("/dev/null", std::ios::out | std::ios::trunc)) {
            oldOut_ = std::cout.rdbuf(&nullOut_);
        } else {
            VELA_LOG_ERR("cannot open /dev/null for writing");
        }
    }
}

void CallScope::SetPriority(int priority)
{
    errno = 0;
    const int current = getpriority(PRIO_PROCESS, 0);
    if (current == -1 && errno != 0) {
        VELA_LOG_ERR("getpriority failed [%m]");
        return;
    }
    if (current == priority) {
        return;
    }
    if (setpriority(PRIO_PROCESS, 0, priority) != 0) {
        VELA_LOG_ERR("setpriority(%d) failed [%m]", priority);
        return;
    }
    oldPriority_ = current;
    priorityChanged_ = true;
}

bool CallScope::SaveCwd()
{
    char buf[PATH_MAX];
    if (getcwd(buf, sizeof(buf)) == nullptr) {
        VELA_LOG_ERR("getcwd failed [%m]");
        return false;
    }
    cwd_ = buf;
    return true;
}

void CallScope::Restore()
{
    if (priorityChanged_) {
        priorityChanged_ = false;
        if (setpriority(PRIO_PROCESS, 0, oldPriority_) != 0) {
            VELA_LOG_ERR("setpriority(%d) failed [%m]", oldPriority_);
        }
    }
    if (oldIn_) {
        std::cin.rdbuf(oldIn_);
        oldIn_ = nullptr;
    }
    if (oldOut_) {
        std::cout.rdbuf(oldOut_);
        oldOut_ = nullptr;
    }
    nullIn_.close();
    nullOut_.close();
    if (!cwd_.empty()) {
        if (chdir(cwd_.c_str()) != 0) {
            VELA_LOG_ERR("cannot change back to %s [%m]", cwd_.c_str());
        }
        cwd_.clear();
    }
}

// ---- ExecContext ------------------------------------------------------------------

ExecContext::~ExecContext() { Restore(); }

bool ExecContext::SaveIds()
{
    saved_ = getresuid(&ruid_, &euid_, &suid_) == 0 && getresgid(&rgid_, &egid_, &sgid_) == 0 &&
             ReadGroups(groups_);
    return saved_;
}

bool ExecContext::Prepare(const ExecIdentity& want)
{
    if (!saved_) {
        return false;
    }
    // Whatever a failed switch changed is put back: a refused call leaves
    // the identity as it found it.
    restore_ = true;
    if (!want.grantByDefault && !want.grantByUser) {
        if (!SwitchTo(Whom::RunAs, want.runAs, want.grantable)) {
            VELA_LOG(LOG_ERR, "grantable failed. [%m]");
            return false;
        }
        restore_ = want.grantable;
        return true;
    }
    if (!want.grantByDefault) {
        if (want.loginName.empty()) {
            VELA_LOG(LOG_ERR, "grantByUser: failed to get login username.");
            return false;
        }
        if (!SwitchTo(Whom::Account, want.loginName, want.grantable)) {
            VELA_LOG(LOG_ERR, "grantByUser failed. [%m]");
            return false;
        }
        restore_ = want.grantable;
        return true;
    }
    // grantByDefault: the handler runs with full rights.
    if (egid_ != 0 && !SetResGid(__LINE__, kKeepGid, 0, kKeepGid)) {
        VELA_LOG(LOG_ERR, "grantByDefault failed. [%m]");
        return false;
    }
    if (euid_ != 0 && !SetResUid(__LINE__, kKeepUid, 0, kKeepUid)) {
        VELA_LOG(LOG_ERR, "grantByDefault failed. [%m]");
        return false;
    }
    return true;
}

void ExecContext::Restore()
{
    if (!restore_ || !saved_) {
        return;
    }
    restore_ = false;
    uid_t r = 0, e = 0, s = 0;
    gid_t rg = 0, eg = 0, sg = 0;
    std::vector<gid_t> groups;
    const bool known = getresuid(&r, &e, &s) == 0 && getresgid(&rg, &eg, &sg) == 0 && ReadGroups(groups);
    const bool groupsDiffer = !known || groups != groups_;
    const bool idsDiffer = !known || r != ruid_ || e != euid_ || s != suid_ || rg != rgid_ || eg != egid_ ||
                           sg != sgid_;
    // Group ids and groups can only be put back with root's rights: a user
    // switch that kept the saved uid 0 takes root back first.
    if ((groupsDiffer || idsDiffer) && geteuid() != 0) {
        SetResUid(__LINE__, kKeepUid, 0, kKeepUid);
    }
    if (groupsDiffer && setgroups(groups_.size(), groups_.data()) != 0) {
        char buf[256];
        VELA_LOG(LOG_AUTHPRIV | LOG_ERR, "ERROR: setgroups(%zu) [%s]", groups_.size(),
                   strerror_r(errno, buf, sizeof(buf)));
    }
    SetResGid(__LINE__, rgid_, egid_, sgid_, egid_ == 0);
    SetResUid(__LINE__, ruid_, euid_, suid_, euid_ == 0);
}

// ---- Stages -----------------------------------------------------------------------

Step EnterCallScope(ResolvedCall& call)
{
    call.scope.RedirectStreams(call.Flag("allowUpload"), call.Flag("allowDownload"));
    call.scope.SetPriority(call.priority);
    return Step::kGoOn;
}

Step SwitchIdentity(ResolvedCall& call)
{
    if (!call.scope.SaveCwd()) {
        return Step::kStop;  // logged by SaveCwd; the preset 117 answers
    }
    if (!call.identity.SaveIds()) {
        VELA_REFUSE(call.resp, WEBAPI_ERR_NO_RESPONSE, "cannot read the ids to come back to");
        return Step::kStop;
    }
    ExecIdentity want;
    want.runAs = call.runAs;
    want.loginName = call.req->GetLoginUserName();
    want.grantable = call.Flag("grantable");
    want.grantByDefault = call.Flag("grantByDefault");
    want.grantByUser = call.Flag("grantByUser");
    // A failed switch is logged by Prepare; the preset 117 answers.
    return call.identity.Prepare(want) ? Step::kGoOn : Step::kStop;
}

Step CallHandler(ResolvedCall& call)
{
    const APIHandlerFn handler = call.entry->handler;
    if (handler == nullptr) {
        VELA_REFUSE(call.resp, WEBAPI_ERR_NO_RESPONSE, "%s %d %s has no handler in its library's API table",
                    LogSafe(call.api).c_str(), call.version, LogSafe(call.method).c_str());
        return Step::kStop;
    }
    try {
        handler(call.req, call.resp);
    } catch (const std::exception& e) {
        VELA_LOG_ERR("handler of %s %s failed: %s", call.api.c_str(), call.method.c_str(), e.what());
    } catch (...) {
        VELA_LOG_ERR("handler of %s %s failed", call.api.c_str(), call.method.c_str());
    }
    call.identity.Restore();
    return Step::kServed;
}

// ---- RunAsRootGuard -----------------------------------------------------------------

RunAsRootGuard::RunAsRootGuard(const char* file, int line, const char* label)
    : uid_(geteuid()), gid_(getegid()), file_(file), line_(line), label_(label ? label : ""), ok_(true)
{
    if (geteuid() != 0 && setresuid(kKeepUid, 0, kKeepUid) != 0) {
        ok_ = false;
    } else if (getegid() != 0) {
        ok_ = setresgid(kKeepGid, 0, kKeepGid) == 0 && setresuid(kKeepUid, 0, kKeepUid) == 0;
    }
    if (!ok_) {
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, file_, line_, "ERROR: %s(%d, %d)", label_, 0, 0);
    }
}

RunAsRootGuard::~RunAsRootGuard()
{
    const bool uidSame = uid_ == kKeepUid || geteuid() == uid_;
    const bool gidSame = gid_ == kKeepGid || getegid() == gid_;
    if (uidSame && gidSame) {
        return;
    }
    bool ok = true;
    if (geteuid() != 0) {
        ok = setresuid(kKeepUid, 0, kKeepUid) == 0;
    }
    if (ok && !gidSame) {
        ok = setresgid(kKeepGid, gid_, kKeepGid) == 0;
    }
    if (ok && uid_ != kKeepUid) {
        ok = setresuid(kKeepUid, uid_, kKeepUid) == 0;
    }
    if (!ok) {
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_CRIT, file_, line_, "ERROR: ~%s(%d, %d)", label_, static_cast<int>(uid_),
                  static_cast<int>(gid_));
    }
}

}  // namespace VELA
