// Identity switches of the process: to an account (ResetCredentialsByName),
// to a run-as identity (ResetCredentialsForRunAs, the only place where the
// run-as name "system" means the superuser) or to the owner of a file
// (InitCredentialsByExecutable). Contracts are in vela/user.h.
#include <cerrno>
#include <cstring>
#include <grp.h>
#include <string>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/user.h"

namespace {

using namespace VELA::System;

constexpr int kMaxGroups = 65536;

const char* ErrorText(int err, char* buf, size_t size)
{
    // GNU strerror_r returns the text, which need not be `buf`.
    return strerror_r(err, buf, size);
}

// "WARNING: setresuid(r, e, s)" after a successful set, "ERROR: ...
// [reason]" after a failed one, to the authorisation facility.
void LogSet(int line, bool ok, const char* what, int r, int e, int s, int err)
{
    if (ok) {
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_INFO, __FILE__, line, "WARNING: set%s(%d, %d, %d)", what, r, e, s);
        return;
    }
    char buf[256];
    VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, __FILE__, line, "ERROR: set%s(%d, %d, %d) [%s]", what, r, e, s,
                        ErrorText(err, buf, sizeof(buf)));
}

bool SetResUid(int line, uid_t r, uid_t e, uid_t s)
{
    const bool ok = setresuid(r, e, s) == 0;
    const int err = errno;
    LogSet(line, ok, "resuid", static_cast<int>(r), static_cast<int>(e), static_cast<int>(s), err);
    errno = err;
    return ok;
}

bool SetResGid(int line, gid_t r, gid_t e, gid_t s)
{
    const bool ok = setresgid(r, e, s) == 0;
    const int err = errno;
    LogSet(line, ok, "resgid", static_cast<int>(r), static_cast<int>(e), static_cast<int>(s), err);
    errno = err;
    return ok;
}

#define SET_RESUID(r, e, s) SetResUid(__LINE__, (r), (e), (s))
#define SET_RESGID(r, e, s) SetResGid(__LINE__, (r), (e), (s))

const uid_t kKeepUid = static_cast<uid_t>(-1);

// The identity of the process before a switch, to go back to on failure.
struct Identity {
    uid_t ruid = 0, euid = 0, suid = 0;
    gid_t rgid = 0, egid = 0, sgid = 0;
    std::vector<gid_t> groups;
    bool valid = false;
};

Identity Current()
{
    Identity id;
    if (getresuid(&id.ruid, &id.euid, &id.suid) != 0 || getresgid(&id.rgid, &id.egid, &id.sgid) != 0) {
        return id;
    }
    const int n = getgroups(0, nullptr);
    if (n < 0 || n > kMaxGroups) {
        return id;
    }
    id.groups.resize(static_cast<size_t>(n));
    const int got = n > 0 ? getgroups(n, id.groups.data()) : 0;
    if (got < 0) {
        return id;
    }
    id.groups.resize(static_cast<size_t>(got));
    id.valid = true;
    return id;
}

// Puts `old` back after a failed switch, as far as the process still may.
void Restore(const Identity& old)
{
    if (!old.valid) {
        return;
    }
    if (geteuid() != 0 && !SET_RESUID(kKeepUid, 0, kKeepUid)) {
        return;  // no way back: the ids stay as the failed switch left them
    }
    if (setgroups(old.groups.size(), old.groups.data()) != 0) {
        char buf[256];
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, __FILE__, __LINE__, "ERROR: setgroups(%zu) [%s]", old.groups.size(),
                            ErrorText(errno, buf, sizeof(buf)));
    }
    SET_RESGID(old.rgid, old.egid, old.sgid);
    SET_RESUID(old.ruid, old.euid, old.suid);
}

// How the supplementary groups are set: initgroups of a user name, or an
// explicit list.
struct GroupPlan {
    std::string initName;       // initgroups(initName, gid) when not empty
    std::vector<gid_t> explicitList;
};

bool ApplyGroups(const GroupPlan& plan, gid_t gid)
{
    char buf[256];
    if (!plan.initName.empty()) {
        if (initgroups(plan.initName.c_str(), gid) == 0) {
            return true;
        }
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, __FILE__, __LINE__, "ERROR: initgroups(%.255s, %d) [%s]",
                            plan.initName.c_str(), static_cast<int>(gid), ErrorText(errno, buf, sizeof(buf)));
        return false;
    }
    if (setgroups(plan.explicitList.size(), plan.explicitList.data()) == 0) {
        return true;
    }
    VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, __FILE__, __LINE__, "ERROR: setgroups(%zu) [%s]",
                        plan.explicitList.size(), ErrorText(errno, buf, sizeof(buf)));
    return false;
}

// Switches the whole identity of the process to uid/gid with the groups of
// `plan`; `grantable` keeps the saved user id 0.
bool SwitchTo(uid_t uid, gid_t gid, const GroupPlan& plan, bool grantable)
{
    const Identity old = Current();
    if (!old.valid) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "cannot read the current ids: %m");
        VELA_LOG_ERR("cannot read the current ids: %m");
        return false;
    }
    if (old.euid != 0 && !SET_RESUID(kKeepUid, 0, kKeepUid)) {
        VELA_RECORD_ERROR(VLIBC_ERR_PERMISSION, "cannot regain root: %m");
        return false;
    }
    if (!ApplyGroups(plan, gid)) {
        VELA_RECORD_ERROR(VLIBC_ERR_PERMISSION, "supplementary groups: %m");
        Restore(old);
        return false;
    }
    if (!SET_RESGID(gid, gid, gid)) {
        VELA_RECORD_ERROR(VLIBC_ERR_PERMISSION, "setresgid: %m");
        Restore(old);
        return false;
    }
    if (!grantable && uid != 0) {
        // Capabilities must not survive the change away from uid 0.
        prctl(PR_SET_KEEPCAPS, 0, 0, 0, 0);
    }
    const uid_t saved = grantable ? 0 : uid;
    if (!SET_RESUID(uid, uid, saved)) {
        VELA_RECORD_ERROR(VLIBC_ERR_PERMISSION, "setresuid: %m");
        Restore(old);
        return false;
    }
    uid_t r, e, s;
    gid_t rg, eg, sg;
    if (getresuid(&r, &e, &s) != 0 || getresgid(&rg, &eg, &sg) != 0 || r != uid || e != uid || s != saved ||
        rg != gid || eg != gid || sg != gid) {
        VELA_RECORD_ERROR(VLIBC_ERR_PERMISSION, "ids differ after the switch");
        VELA::System::LogAt(LOG_AUTHPRIV | LOG_ERR, __FILE__, __LINE__, "ERROR: ids differ after switching to %d/%d",
                            static_cast<int>(uid), static_cast<int>(gid));
        Restore(old);
        return false;
    }
    return true;
}

// Every user and group id 0 and no supplementary group but 0: the run-as
// identity "system" already holds. Most calls run as "system" in a process
// that the web server started as root; going through NSS (initgroups) each
// time would cost more than the rest of the call.
bool AlreadyPlainRoot()
{
    const Identity now = Current();
    if (!now.valid || now.ruid != 0 || now.euid != 0 || now.suid != 0 || now.rgid != 0 || now.egid != 0 ||
        now.sgid != 0) {
        return false;
    }
    for (gid_t g : now.groups) {
        if (g != 0) {
            return false;
        }
    }
    return true;
}

bool ValidSwitchName(const char* name)
{
    if (!ValidAccountName(name)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid user name");
        VELA_LOG_ERR("refusing to switch to an invalid user name");
        return false;
    }
    return true;
}

// The account `name`, whatever its name: "system" included.
bool ResetByName(const char* name, bool grantable)
{
    if (!ValidSwitchName(name)) {
        return false;
    }
    uid_t uid = 0;
    gid_t gid = 0;
    GroupPlan plan;
    std::string canonical;
    const int found = LookupUserByName(name, uid, gid, &canonical);
    if (found != 1) {
        if (found == 0) {
            VELA_RECORD_ERROR(VLIBC_ERR_NOT_FOUND, "no such user");
            VELA_LOG_ERR("cannot switch to unknown user \"%.255s\"", name);
        }
        return false;
    }
    plan.initName = canonical;
    return SwitchTo(uid, gid, plan, grantable);
}

bool ResetForRunAs(const char* runAs, bool grantable)
{
    if (!ValidSwitchName(runAs)) {
        return false;
    }
    if (VELA::System::RunAsIsSuperuser(runAs) != 1) {
        return ResetByName(runAs, grantable);
    }
    if (AlreadyPlainRoot()) {
        return true;  // nothing to switch: no account look-up is paid
    }
    GroupPlan plan;
    std::string rootName;
    gid_t rootGid = 0;
    if (LookupUserByUID(0, rootName, rootGid) == 1) {
        plan.initName = rootName;
    } else {
        plan.explicitList.push_back(0);
    }
    return SwitchTo(0, 0, plan, grantable);
}

bool ByExecutable(const char* path, bool grantable)
{
    const std::string resolved = ResolvePath(path);
    struct stat st;
    if (resolved.empty() || stat(resolved.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "not a regular file");
        VELA_LOG_ERR("cannot take the credentials of %.256s: not a regular file", resolved.c_str());
        return false;
    }
    GroupPlan plan;
    std::string owner;
    gid_t ownerGid = 0;
    const int found = LookupUserByUID(st.st_uid, owner, ownerGid);
    if (found < 0) {
        return false;
    }
    if (found == 1) {
        // The owner's groups (its primary group included) and the file's.
        if (!GroupListOf(owner, ownerGid, plan.explicitList)) {
            return false;
        }
        bool listed = false;
        for (gid_t g : plan.explicitList) {
            listed = listed || g == st.st_gid;
        }
        if (!listed) {
            plan.explicitList.push_back(st.st_gid);
        }
    } else {
        plan.explicitList.push_back(st.st_gid);
    }
    return SwitchTo(st.st_uid, st.st_gid, plan, grantable);
}

}  // namespace

bool ResetCredentialsByName(const char* name, bool grantable)
{
    try {
        return ResetByName(name, grantable);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return false;
    }
}

bool ResetCredentialsForRunAs(const char* runAs, bool grantable)
{
    try {
        return ResetForRunAs(runAs, grantable);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return false;
    }
}

bool InitCredentialsByExecutable(const char* path, int grantable)
{
    try {
        return ByExecutable(path, grantable != 0);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return false;
    }
}
