// Users and groups from NSS, membership of the administrators group and
// application privileges. Contracts are in vela/user.h.
#include <arpa/inet.h>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <grp.h>
#include <json/json.h>
#include <netinet/in.h>
#include <pwd.h>
#include <string>
#include <unistd.h>
#include <vector>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace VELA {
namespace System {

namespace {

constexpr size_t kMaxAccountName = 255;
constexpr size_t kMaxNssBuffer = 1024 * 1024;
constexpr int kMaxGroups = 65536;

// Buffer size that NSS suggests for the *_r calls.
size_t NssBufferHint(int which)
{
    const long hint = sysconf(which);
    return hint > 0 && hint < static_cast<long>(kMaxNssBuffer) ? static_cast<size_t>(hint) : 16384;
}

// Interprets the result of a *_r lookup: 1 found, 0 no such entry, -1 error
// (ERANGE is handled by the callers).
int NssResult(int rc, bool found)
{
    if (found) {
        return 1;
    }
    // "No such name" is 0 with a null result, but some NSS modules report
    // it as ENOENT, ESRCH, EBADF or EPERM instead.
    if (rc == 0 || rc == ENOENT || rc == ESRCH || rc == EBADF || rc == EPERM) {
        return 0;
    }
    errno = rc;
    return -1;
}

// Looks a passwd entry up by name or uid and hands it to `use`.
template <typename Lookup, typename Use>
int WithPasswd(Lookup lookup, Use use)
{
    size_t len = NssBufferHint(_SC_GETPW_R_SIZE_MAX);
    for (;;) {
        std::vector<char> buffer(len);
        struct passwd pw;
        struct passwd* result = nullptr;
        const int rc = lookup(&pw, buffer.data(), buffer.size(), &result);
        if (rc == ERANGE && len < kMaxNssBuffer) {
            len *= 2;
            continue;
        }
        const int found = NssResult(rc, rc == 0 && result != nullptr);
        if (found == 1) {
            use(pw);
        }
        return found;
    }
}

// The administrators group: admin_group of <root>/etc/vela/webapi.conf or
// "administrators". False when the configuration cannot be trusted.
bool AdminGroupName(std::string& name)
{
    const std::string conf = ResolvePath("/etc/vela/webapi.conf");
    std::string value;
    const int rc = ReadKeyValue(conf, "admin_group", value);
    if (rc < 0) {
        return false;
    }
    if (rc == 0) {
        name = "administrators";
        return true;
    }
    if (!ValidAccountName(value.c_str())) {
        VELA_LOG_ERR("%s: admin_group is not a valid group name", conf.c_str());
        VELA_RECORD_ERROR(VLIBC_ERR_CORRUPT, "invalid admin_group");
        return false;
    }
    name = value;
    return true;
}

int IsAdmin(const char* user, int flags)
{
    if (flags != 0 || !ValidAccountName(user)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid user name or flags");
        return -1;
    }
    uid_t uid = 0;
    gid_t gid = 0;
    std::string canonical;
    const int found = LookupUserByName(user, uid, gid, &canonical);
    if (found <= 0) {
        return found;
    }
    if (uid == 0) {
        return 1;
    }
    std::string groupName;
    if (!AdminGroupName(groupName)) {
        return -1;
    }
    gid_t adminGid = 0;
    const int groupFound = LookupGroupByName(groupName.c_str(), adminGid);
    if (groupFound <= 0) {
        return groupFound;
    }
    if (gid == adminGid) {
        return 1;
    }
    std::vector<gid_t> groups;
    if (!GroupListOf(canonical, gid, groups)) {
        return -1;
    }
    for (gid_t g : groups) {
        if (g == adminGid) {
            return 1;
        }
    }
    return 0;
}

// ---- Application privileges ----

constexpr size_t kMaxPrivilegesFile = 1024 * 1024;
constexpr Json::ArrayIndex kMaxRuleEntries = 1024;

bool ValidPrivilege(const char* priv)
{
    if (priv == nullptr) {
        return false;
    }
    return IsCheckedName(priv, strnlen(priv, 129), "_-.:", 128);
}

struct Address {
    int family = 0;  // AF_INET or AF_INET6; IPv4-mapped IPv6 becomes AF_INET
    unsigned char bytes[16] = {};
};

bool ParseAddress(const std::string& text, Address& out)
{
    Address a;
    if (inet_pton(AF_INET, text.c_str(), a.bytes) == 1) {
        a.family = AF_INET;
    } else if (inet_pton(AF_INET6, text.c_str(), a.bytes) == 1) {
        a.family = AF_INET6;
        static const unsigned char mapped[12] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff};
        if (memcmp(a.bytes, mapped, sizeof(mapped)) == 0) {
            memmove(a.bytes, a.bytes + 12, 4);
            memset(a.bytes + 4, 0, 12);
            a.family = AF_INET;
        }
    } else {
        return false;
    }
    out = a;
    return true;
}

// True when `client` lies in `rule`: "address" or "address/prefix".
bool AddressMatches(const Address& client, const std::string& rule)
{
    if (rule.size() > 64) {
        return false;
    }
    const size_t slash = rule.find('/');
    Address net;
    if (!ParseAddress(rule.substr(0, slash), net)) {
        return false;
    }
    const int maxBits = net.family == AF_INET ? 32 : 128;
    int bits = maxBits;
    if (slash != std::string::npos) {
        long long prefix = 0;
        if (!ParseDecimal(rule.substr(slash + 1), 0, 128, prefix)) {
            return false;
        }
        bits = static_cast<int>(prefix);
        // An IPv4-mapped rule ("::ffff:10.0.0.0/104") counts its prefix in
        // IPv6 bits; after mapping it is an IPv4 prefix.
        if (net.family == AF_INET && rule.find(':') != std::string::npos) {
            bits -= 96;
            if (bits < 0) {
                return false;
            }
        }
        if (bits > maxBits) {
            return false;
        }
    }
    if (net.family != client.family) {
        return false;
    }
    const int whole = bits / 8;
    if (memcmp(net.bytes, client.bytes, static_cast<size_t>(whole)) != 0) {
        return false;
    }
    const int rest = bits % 8;
    if (rest == 0) {
        return true;
    }
    const unsigned char mask = static_cast<unsigned char>(0xff << (8 - rest));
    return (net.bytes[whole] & mask) == (client.bytes[whole] & mask);
}

bool ListHolds(const Json::Value& list, const std::string& name)
{
    if (!list.isArray()) {
        return false;
    }
    const Json::ArrayIndex n = list.size() < kMaxRuleEntries ? list.size() : kMaxRuleEntries;
    for (Json::ArrayIndex i = 0; i < n; ++i) {
        if (list[i].isString() && list[i].asString() == name) {
            return true;
        }
    }
    return false;
}

bool InSomeGroup(const Json::Value& list, const std::vector<gid_t>& groups)
{
    if (!list.isArray()) {
        return false;
    }
    const Json::ArrayIndex n = list.size() < kMaxRuleEntries ? list.size() : kMaxRuleEntries;
    for (Json::ArrayIndex i = 0; i < n; ++i) {
        if (!list[i].isString()) {
            continue;
        }
        const std::string name = list[i].asString();
        gid_t gid = 0;
        if (!ValidAccountName(name.c_str()) || LookupGroupByName(name.c_str(), gid) != 1) {
            continue;
        }
        for (gid_t g : groups) {
            if (g == gid) {
                return true;
            }
        }
    }
    return false;
}

bool AddressAllowed(const Json::Value& rule, const char* remoteIP)
{
    if (!rule.isMember("allow_from")) {
        return true;
    }
    const Json::Value& allow = rule["allow_from"];
    Address client;
    if (!allow.isArray() || remoteIP == nullptr || !ParseAddress(remoteIP, client)) {
        return false;
    }
    const Json::ArrayIndex n = allow.size() < kMaxRuleEntries ? allow.size() : kMaxRuleEntries;
    for (Json::ArrayIndex i = 0; i < n; ++i) {
        if (allow[i].isString() && AddressMatches(client, allow[i].asString())) {
            return true;
        }
    }
    return false;
}

int HasAppPriv(const char* user, const char* priv, const char* remoteIP)
{
    if (!ValidAccountName(user) || !ValidPrivilege(priv)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid user or privilege name");
        return 0;
    }
    if (remoteIP != nullptr && strnlen(remoteIP, 65) > 64) {
        remoteIP = nullptr;
    }
    if (IsAdmin(user, 0) == 1) {
        return 1;
    }
    uid_t uid = 0;
    gid_t gid = 0;
    std::string canonical;
    if (LookupUserByName(user, uid, gid, &canonical) != 1) {
        return 0;
    }
    const std::string path = ResolvePath("/etc/vela/app_privileges.json");
    std::string text;
    int err = 0;
    Json::Value doc;
    if (!ReadFileBounded(path, kMaxPrivilegesFile, text, err) || !WebAPIUtil::ParseJson(text, doc) ||
        !doc.isObject()) {
        if (err != ENOENT) {
            VELA_LOG_ERR("%s is unreadable or corrupt: administrators only", path.c_str());
        }
        return 0;
    }
    const Json::Value& apps = doc["applications"];
    if (!apps.isObject() || !apps.isMember(priv)) {
        return 0;
    }
    const Json::Value& rule = apps[priv];
    if (!rule.isObject() || !AddressAllowed(rule, remoteIP)) {
        return 0;
    }
    if (ListHolds(rule["users"], user)) {
        return 1;
    }
    if (!rule.isMember("groups")) {
        return 0;
    }
    std::vector<gid_t> groups;
    if (!GroupListOf(canonical, gid, groups)) {
        return 0;
    }
    return InSomeGroup(rule["groups"], groups) ? 1 : 0;
}

char* Dup(const char* s) { return strdup(s != nullptr ? s : ""); }

PVELAUSER NewUserRecord(const struct passwd& pw)
{
    PVELAUSER rec = static_cast<PVELAUSER>(calloc(1, sizeof(VELAUSER)));
    if (rec == nullptr) {
        return nullptr;
    }
    rec->uid = pw.pw_uid;
    rec->gid = pw.pw_gid;
    rec->szName = Dup(pw.pw_name);
    rec->szGecos = Dup(pw.pw_gecos);
    rec->szHome = Dup(pw.pw_dir);
    rec->szShell = Dup(pw.pw_shell);
    if (!rec->szName || !rec->szGecos || !rec->szHome || !rec->szShell) {
        VELAUserFree(rec);
        return nullptr;
    }
    return rec;
}

// Stores the record of the passwd entry found by `lookup` in `*user`.
template <typename Lookup>
int GetUser(Lookup lookup, PVELAUSER* user)
{
    PVELAUSER rec = nullptr;
    bool noMemory = false;
    const int found = WithPasswd(lookup, [&](const struct passwd& pw) {
        rec = NewUserRecord(pw);
        noMemory = rec == nullptr;
    });
    if (found < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "user lookup: %m");
        VELA_LOG_ERR("user lookup failed: %m");
        return -1;
    }
    if (found == 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_NOT_FOUND, "no such user");
        return -1;
    }
    if (noMemory) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
    *user = rec;
    return 0;
}

}  // namespace

bool ValidAccountName(const char* name)
{
    if (name == nullptr) {
        return false;
    }
    const size_t len = strnlen(name, kMaxAccountName + 1);
    if (len == 0 || len > kMaxAccountName) {
        return false;
    }
    if (strcmp(name, ".") == 0 || strcmp(name, "..") == 0) {
        return false;
    }
    for (size_t i = 0; i < len; ++i) {
        const unsigned char c = static_cast<unsigned char>(name[i]);
        if (c == '/' || c == ':' || c < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

int FindUserByName(const char* name, uid_t& uid, gid_t& gid, std::string* canonical)
{
    return WithPasswd(
        [name](struct passwd* pw, char* buf, size_t len, struct passwd** result) {
            return getpwnam_r(name, pw, buf, len, result);
        },
        [&](const struct passwd& pw) {
            uid = pw.pw_uid;
            gid = pw.pw_gid;
            if (canonical != nullptr) {
                *canonical = pw.pw_name;
            }
        });
}

int LookupUserByName(const char* name, uid_t& uid, gid_t& gid, std::string* canonical)
{
    const int found = FindUserByName(name, uid, gid, canonical);
    if (found < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "user lookup: %m");
        VELA_LOG_ERR("looking up user \"%.255s\": %m", name);
    }
    return found;
}

int LookupUserByUID(uid_t uid, std::string& name, gid_t& gid)
{
    const int found = WithPasswd(
        [uid](struct passwd* pw, char* buf, size_t len, struct passwd** result) {
            return getpwuid_r(uid, pw, buf, len, result);
        },
        [&](const struct passwd& pw) {
            name = pw.pw_name;
            gid = pw.pw_gid;
        });
    if (found < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "user lookup: %m");
        VELA_LOG_ERR("looking up uid %u: %m", static_cast<unsigned>(uid));
    }
    return found;
}

int FindGroupByName(const char* name, gid_t& gid)
{
    size_t len = NssBufferHint(_SC_GETGR_R_SIZE_MAX);
    for (;;) {
        std::vector<char> buffer(len);
        struct group gr;
        struct group* result = nullptr;
        const int rc = getgrnam_r(name, &gr, buffer.data(), buffer.size(), &result);
        if (rc == ERANGE && len < kMaxNssBuffer) {
            len *= 2;
            continue;
        }
        const int found = NssResult(rc, rc == 0 && result != nullptr);
        if (found == 1) {
            gid = gr.gr_gid;
        }
        return found;
    }
}

int LookupGroupByName(const char* name, gid_t& gid)
{
    const int found = FindGroupByName(name, gid);
    if (found < 0) {
        VELA_RECORD_ERROR(VLIBC_ERR_IO, "group lookup: %m");
        VELA_LOG_ERR("looking up group \"%.255s\": %m", name);
    }
    return found;
}

bool GroupListOf(const std::string& user, gid_t base, std::vector<gid_t>& groups)
{
    int count = 64;
    for (;;) {
        std::vector<gid_t> list(static_cast<size_t>(count));
        int n = count;
        if (getgrouplist(user.c_str(), base, list.data(), &n) >= 0) {
            list.resize(static_cast<size_t>(n));
            groups.swap(list);
            return true;
        }
        // n now holds the number needed (glibc); grow at least twofold.
        const int want = n > count ? n : count * 2;
        if (want > kMaxGroups) {
            VELA_RECORD_ERROR(VLIBC_ERR_IO, "too many groups");
            VELA_LOG_ERR("user \"%.255s\" has more than %d groups", user.c_str(), kMaxGroups);
            return false;
        }
        count = want;
    }
}

}  // namespace System
}  // namespace VELA

using namespace VELA::System;

int VELAUserNameIsValid(const char* name) { return ValidAccountName(name) ? 1 : 0; }

int VELAUserGetByUID(uid_t uid, PVELAUSER* user)
{
    if (user == nullptr) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "null output");
        return -1;
    }
    *user = nullptr;
    try {
        return GetUser(
            [uid](struct passwd* pw, char* buf, size_t len, struct passwd** result) {
                return getpwuid_r(uid, pw, buf, len, result);
            },
            user);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VELAUserGetByName(const char* name, PVELAUSER* user)
{
    if (user == nullptr) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "null output");
        return -1;
    }
    *user = nullptr;
    if (!ValidAccountName(name)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid user name");
        return -1;
    }
    try {
        return GetUser(
            [name](struct passwd* pw, char* buf, size_t len, struct passwd** result) {
                return getpwnam_r(name, pw, buf, len, result);
            },
            user);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

void VELAUserFree(PVELAUSER user)
{
    if (user == nullptr) {
        return;
    }
    free(user->szName);
    free(user->szGecos);
    free(user->szHome);
    free(user->szShell);
    free(user);
}

int VELAUserGetUGID(const char* name, uid_t* uid, gid_t* gid)
{
    if (uid == nullptr || gid == nullptr || !ValidAccountName(name)) {
        VELA_RECORD_ERROR(VLIBC_ERR_BAD_PARAMETER, "invalid user name or output");
        return -1;
    }
    try {
        uid_t u = 0;
        gid_t g = 0;
        const int found = LookupUserByName(name, u, g, nullptr);
        if (found != 1) {
            if (found == 0) {
                VELA_RECORD_ERROR(VLIBC_ERR_NOT_FOUND, "no such user");
            }
            return -1;
        }
        *uid = u;
        *gid = g;
        return 0;
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VELA::System::RunAsIsSuperuser(const char* runAs)
{
    return runAs != nullptr && strcmp(runAs, VELA_RUNAS_SUPERUSER) == 0 ? 1 : 0;
}

int VELA::System::RunAsGetUGID(const char* runAs, uid_t* uid, gid_t* gid)
{
    if (uid != nullptr && gid != nullptr && VELA::System::RunAsIsSuperuser(runAs)) {
        *uid = 0;
        *gid = 0;
        return 0;
    }
    return VELAUserGetUGID(runAs, uid, gid);
}

int VLIBGroupIsAdminGroupMem(const char* user, int flags)
{
    try {
        return IsAdmin(user, flags);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return -1;
    }
}

int VLIBAppPrivUserHas(const char* user, const char* priv, const char* remoteIP)
{
    try {
        return HasAppPriv(user, priv, remoteIP);
    } catch (const std::exception&) {
        VELA_RECORD_ERROR(VLIBC_ERR_MEMORY, "out of memory");
        return 0;
    }
}
