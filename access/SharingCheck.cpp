// The check of a call through a sharing link (see SharingCheck.h).
//
// Log lines that administrators' filters look for keep fixed positions
// ("WebEntry:<line>"), whatever the layout of this file.
#include "access/SharingCheck.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <grp.h>
#include <map>
#include <regex.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "dispatcher/Refusal.h"
#include "platform/session/SessionStore.h"
#include "vela/log.h"
#include "vela/sharing.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"

namespace VELA {
namespace SharingCheck {

namespace {

const char kSource[] = "WebEntry";
const char kPermissionLibDir[] = "/usr/lib/sharing/permission_lib/";
// No library table is this long; a table without its end stops here.
constexpr size_t kMaxTableEntries = 4096;
constexpr int kMaxGroups = 65536;

// Library path -> dlopen handle, for the life of the process.
std::map<std::string, void*>& Libraries()
{
    static std::map<std::string, void*> libraries;
    return libraries;
}

bool IsPlainName(const std::string& name)
{
    if (name.empty() || name.size() > sharing::kMaxProjectName || name[0] == '.') {
        return false;
    }
    for (char c : name) {
        const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
                        c == '_' || c == '-';
        if (!ok) {
            return false;
        }
    }
    return true;
}

// "ERROR: set<what>(r, e, s) [reason]" after a failed set, "WARNING:
// set<what>(r, e, s)" when the ids read back are not the ones asked for.
void LogSetFailure(int line, const char* what, long r, long e, long s, int err)
{
    char buf[256];
    System::LogAt(LOG_AUTH | LOG_ERR, kSource, line, "ERROR: set%s(%d, %d, %d) [%s]", what, static_cast<int>(r),
                  static_cast<int>(e), static_cast<int>(s), strerror_r(err, buf, sizeof(buf)));
}

void LogSetMismatch(int line, const char* what, long r, long e, long s)
{
    System::LogAt(LOG_AUTH | LOG_INFO, kSource, line, "WARNING: set%s(%d, %d, %d)", what, static_cast<int>(r),
                  static_cast<int>(e), static_cast<int>(s));
}

// The ids and groups of the process before the check, put back after it.
struct SavedIds {
    uid_t ruid = 0, euid = 0, suid = 0;
    gid_t rgid = 0, egid = 0, sgid = 0;
    std::vector<gid_t> groups;

    bool Save()
    {
        if (getresuid(&ruid, &euid, &suid) != 0 || getresgid(&rgid, &egid, &sgid) != 0) {
            return false;
        }
        const int n = getgroups(0, nullptr);
        if (n < 0 || n > kMaxGroups) {
            return false;
        }
        groups.resize(static_cast<size_t>(n));
        const int got = n > 0 ? getgroups(n, groups.data()) : 0;
        if (got < 0) {
            return false;
        }
        groups.resize(static_cast<size_t>(got));
        return true;
    }

    // Group ids and groups can only be set with root's rights: the switch
    // kept the saved user id 0, so root is taken back first.
    void Restore() const
    {
        if (geteuid() != 0 && setresuid(static_cast<uid_t>(-1), 0, static_cast<uid_t>(-1)) != 0) {
            LogSetFailure(1079, "resuid", -1, 0, -1, errno);
        }
        if (setgroups(groups.size(), groups.data()) != 0) {
            char buf[256];
            System::LogAt(LOG_AUTH | LOG_ERR, kSource, 1079, "ERROR: setgroups(%zu) [%s]", groups.size(),
                          strerror_r(errno, buf, sizeof(buf)));
        }
        if (setresgid(rgid, egid, sgid) != 0) {
            LogSetFailure(1080, "resgid", rgid, egid, sgid, errno);
        } else {
            gid_t r = 0, e = 0, s = 0;
            if (getresgid(&r, &e, &s) != 0 || r != rgid || e != egid || s != sgid) {
                LogSetMismatch(1080, "resgid", rgid, egid, sgid);
            }
        }
        if (setresuid(ruid, euid, suid) != 0) {
            LogSetFailure(1081, "resuid", ruid, euid, suid, errno);
        } else {
            uid_t r = 0, e = 0, s = 0;
            if (getresuid(&r, &e, &s) != 0 || r != ruid || e != euid || s != suid) {
                LogSetMismatch(1081, "resuid", ruid, euid, suid);
            }
        }
    }
};

// Runs `step` with the owner and group of the file `path` (the saved user
// id stays 0), then puts every id and group back. False, with nothing run,
// when the switch fails (logged by it).
template <typename Step>
bool AsOwnerOf(const std::string& path, Step step)
{
    SavedIds saved;
    if (!saved.Save()) {
        System::LogAt(LOG_ERR, kSource, 1060, "cannot read the process ids [%m]");
        return false;
    }
    if (!InitCredentialsByExecutable(path.c_str(), 1)) {
        saved.Restore();
        return false;
    }
    step();
    saved.Restore();
    return true;
}

}  // namespace

std::string PermissionLibDir() { return System::Path(kPermissionLibDir); }

std::string GetSharingCheckLibPath(APIRequest* req)
{
    if (req == nullptr) {
        return "";
    }
    const std::string project = req->GetSharingEntry().get_project_name();
    if (!IsPlainName(project)) {
        return "";
    }
    return PermissionLibDir() + project + ".so";
}

bool OpenSharingCheckLib(APIRequest* req, _tag_API_SHARING_CHECK_TABLE** table)
{
    if (req == nullptr || table == nullptr) {
        System::LogAt(LOG_ERR, kSource, 923, "Bad parameters");
        return false;
    }
    const std::string path = GetSharingCheckLibPath(req);
    if (path.empty()) {
        System::LogAt(LOG_ERR, kSource, 931, "cannot open library: %s. error = %s",
                      LogSafe(req->GetSharingEntry().get_project_name()).c_str(), "not a project name");
        return false;
    }
    std::map<std::string, void*>& libraries = Libraries();
    auto found = libraries.find(path);
    void* handle = found != libraries.end() ? found->second : nullptr;
    if (handle == nullptr) {
        // Only a file its owner alone can change is loaded, and it is loaded
        // with its owner's rights: its constructors never run as root.
        struct stat st;
        if (stat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode) || (st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
            System::LogAt(LOG_ERR, kSource, 931, "cannot open library: %s. error = %s", path.c_str(),
                          "not a regular file writable by its owner only");
            return false;
        }
        if (!AsOwnerOf(path, [&] { handle = dlopen(path.c_str(), RTLD_LAZY); })) {
            return false;
        }
        if (handle == nullptr) {
            const char* err = dlerror();
            System::LogAt(LOG_ERR, kSource, 931, "cannot open library: %s. error = %s", path.c_str(),
                          err != nullptr ? err : "");
            return false;
        }
        libraries[path] = handle;
    }
    if (!GetSharingCheckTableFunc(handle, table)) {
        System::LogAt(LOG_ERR, kSource, 941, "Get Sharing Check Table Fail");
        return false;
    }
    return true;
}

bool GetSharingCheckTableFunc(void* handle, _tag_API_SHARING_CHECK_TABLE** table)
{
    if (handle == nullptr || table == nullptr) {
        return false;
    }
    dlerror();
    void* sym = dlsym(handle, "GetAPISharingCheckTable");
    const char* err = dlerror();
    if (err != nullptr || sym == nullptr) {
        System::LogAt(LOG_DEBUG, kSource, 967, "cannot load sharing check table: %s",
                      err != nullptr ? err : "null symbol");
        return false;
    }
    GetAPISharingCheckTableFn get = reinterpret_cast<GetAPISharingCheckTableFn>(sym);
    *table = nullptr;
    if (get(table) == 0 || *table == nullptr) {
        System::LogAt(LOG_ERR, kSource, 973, "cannot get sharing check table");
        return false;
    }
    return true;
}

int RegexMatch(const char* pattern, const char* text)
{
    if (pattern == nullptr || text == nullptr) {
        return REG_NOMATCH;
    }
    if (strcmp(pattern, "*") == 0) {
        return 0;
    }
    regex_t re;
    const int compiled = regcomp(&re, pattern, REG_EXTENDED);
    if (compiled != 0) {
        return compiled;
    }
    const int rc = regexec(&re, text, 0, nullptr, 0);
    regfree(&re);
    return rc;
}

bool GetSharingCheckFunc(APIRequest* req, _tag_API_SHARING_CHECK_TABLE* table, APICheckFn* check)
{
    if (req == nullptr || table == nullptr || check == nullptr) {
        System::LogAt(LOG_ERR, kSource, 991, "bad parameters");
        return false;
    }
    const std::string api = req->GetAPIClass();
    const std::string method = req->GetAPIMethod();
    const int version = req->GetAPIVersion();
    const std::string project = LogSafe(req->GetSharingEntry().get_project_name());
    for (size_t i = 0; i < kMaxTableEntries && table[i].api != nullptr; ++i) {
        const _tag_API_SHARING_CHECK_TABLE& entry = table[i];
        if (entry.version != 0 && entry.version != version) {
            continue;
        }
        if (entry.api[0] == '\0') {
            System::LogAt(LOG_ERR, kSource, 1004, "warning: empty api regex in %s", project.c_str());
            continue;
        }
        if (RegexMatch(entry.api, api.c_str()) != 0) {
            continue;
        }
        if (entry.method == nullptr || entry.method[0] == '\0') {
            System::LogAt(LOG_ERR, kSource, 1011, "warning: empty method regex in %s", project.c_str());
            continue;
        }
        if (RegexMatch(entry.method, method.c_str()) == 0 && entry.check != nullptr) {
            *check = entry.check;
            return true;
        }
    }
    return false;
}

bool CheckSharingAppPermission(APIRequest* req, APIResponse* resp)
{
    const std::string path = GetSharingCheckLibPath(req);
    _tag_API_SHARING_CHECK_TABLE* table = nullptr;
    APICheckFn check = nullptr;
    if (path.empty() || !OpenSharingCheckLib(req, &table) || !GetSharingCheckFunc(req, table, &check)) {
        VELA::System::LogAt(LOG_ERR, kSource, 1050, "no sharing check of %s for %s %s",
                            LogSafe(req != nullptr ? req->GetSharingEntry().get_project_name() : "").c_str(),
                            LogSafe(req != nullptr ? req->GetAPIClass() : "").c_str(),
                            LogSafe(req != nullptr ? req->GetAPIMethod() : "").c_str());
        return false;
    }
    bool allowed = false;
    AsOwnerOf(path, [&] {
        try {
            allowed = check(req, resp);
        } catch (...) {
            System::LogAt(LOG_ERR, kSource, 1070, "sharing check of %s failed", path.c_str());
            allowed = false;
        }
    });
    return allowed;
}

void InitSharingSession(APIRequest* req, VELACGI_CTX* cgi)
{
    if (req == nullptr) {
        return;
    }
    const sharing::record::Session visit = req->GetSharingSession();
    PVELAUSER user = nullptr;
    if (visit.empty() || VELAUserGetByUID(visit.get_uid(), &user) != 0 || user == nullptr) {
        VELAUserFree(user);
        return;
    }
    long long minutes = (visit.get_timeout() - Session::Now()) / 60;
    if (minutes < 0) {
        minutes = 15;
    }
    setenv("VELA_WEBAPI_USERNAME", user->szName, 1);
    char lang[8] = "";
    const char* sessFile = nullptr;
    if (cgi != nullptr) {
        VelaCgiGetLang(cgi, lang, sizeof(lang));
        sessFile = VelaCgiGetSessionFile(cgi);
    }
    Json::Value session(Json::objectValue);
    session["appPriv"] = "";
    session["username"] = user->szName;
    session["isAdmin"] = VLIBGroupIsAdminGroupMem(user->szName, 0) == 1;
    session["sessFile"] = sessFile != nullptr ? sessFile : "";
    session["isTimeout"] = false;
    session["timeout"] = static_cast<Json::Int64>(minutes);
    // The link's own switch, as the link states it.
    session["isSkipCheckIP"] = req->GetSharingEntry().get_enable_match_ip();
    session["uiLang"] = lang;
    session["app"] = "";
    session["webapi"] = "";
    session["isAuthorized"] = false;
    req->InitSession(session);
    VELAUserFree(user);
}

int StatusToError(int status)
{
    switch (status) {
    case sharing::SHARING_STATUS_NO_LINK:
        return WEBAPI_ERR_SHARING_NO_LINK;
    case sharing::SHARING_STATUS_REVOKED:
    case sharing::SHARING_STATUS_EXPIRED:
    case sharing::SHARING_STATUS_USE_LIMIT:
        return WEBAPI_ERR_SHARING_LINK_ENDED;
    case sharing::SHARING_STATUS_NO_SESSION:
        return WEBAPI_ERR_SHARING_NO_SESSION;
    case sharing::SHARING_STATUS_SESSION_EXPIRED:
        return WEBAPI_ERR_SHARING_SESSION_TIMEOUT;
    case sharing::SHARING_STATUS_IP_MISMATCH:
        return WEBAPI_ERR_SHARING_REMOTE_IP;
    default:
        // The database could not be used, or a status this check does not
        // know: the visitor is refused all the same.
        return WEBAPI_ERR_SHARING_REFUSED;
    }
}

bool CheckSharingPermission(APIRunner& runner, APIRequest* req, APIResponse* resp, VELACGI_CTX* cgi)
{
    if (req == nullptr || resp == nullptr) {
        return false;
    }
    if (!req->IsSharing()) {
        VELA_REFUSE(resp, WEBAPI_ERR_SHARING_REFUSED, "%s %s refused: not a sharing request",
                    LogSafe(req->GetAPIClass()).c_str(), LogSafe(req->GetAPIMethod()).c_str());
        return false;
    }
    if (!runner.GetMethodAttr(req, "allowSharing")) {
        req->SetAuthResult(AUTH_RESULT_REJECTED);
        VELA_REFUSE(resp, WEBAPI_ERR_SHARING_REFUSED, "%s %s refused: not open to sharing links",
                    LogSafe(req->GetAPIClass()).c_str(), LogSafe(req->GetAPIMethod()).c_str());
        return false;
    }
    const std::string id = req->GetSharingID();
    const int status = sharing::CheckSharing(id, req->GetSharingSID(), req->GetRemoteIP());
    if (status != sharing::SHARING_STATUS_VALID) {
        req->SetAuthResult(AUTH_RESULT_REJECTED);
        VELA_REFUSE(resp, StatusToError(status), "sharing link %s refused for %s %s (status %d)",
                    LogSafe(id).c_str(), LogSafe(req->GetAPIClass()).c_str(), LogSafe(req->GetAPIMethod()).c_str(),
                    status);
        return false;
    }
    // The records were read with the environment; the link must still be
    // the one the request names, with its visitor session and token.
    const sharing::record::Entry entry = req->GetSharingEntry();
    const sharing::record::Session visit = req->GetSharingSession();
    if (entry.get_hash() != id || visit.get_hash() != id || req->GetSharingToken().empty()) {
        VELA_REFUSE(resp, WEBAPI_ERR_SHARING_REFUSED, "sharing link %s refused: its records changed",
                    LogSafe(id).c_str());
        return false;
    }
    req->InitSession(Json::Value(Json::objectValue));
    InitSharingSession(req, cgi);
    if (req->GetLoginUserName().empty()) {
        VELA_REFUSE(resp, WEBAPI_ERR_SHARING_REFUSED, "sharing link %s refused: its owner %d has no account",
                    LogSafe(id).c_str(), static_cast<int>(visit.get_uid()));
        return false;
    }
    if (!runner.GetMethodAttr(req, "skipSharingAppCheck")) {
        const int before = resp->GetError();
        if (!CheckSharingAppPermission(req, resp)) {
            if (resp->GetError() == before || resp->GetError() == WEBAPI_ERR_NONE) {
                resp->SetError(WEBAPI_ERR_SHARING_REFUSED);
            }
            System::LogAt(LOG_ERR, kSource, 1100, "sharing link %s: %s %s refused by its application",
                          LogSafe(id).c_str(), LogSafe(req->GetAPIClass()).c_str(),
                          LogSafe(req->GetAPIMethod()).c_str());
            return false;
        }
    }
    return true;
}

size_t OpenedLibraries() { return Libraries().size(); }

}  // namespace SharingCheck
}  // namespace VELA
