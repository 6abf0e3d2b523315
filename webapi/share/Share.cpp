// VELA.Sample.Share: what a visitor of a sharing link of the project
// "sample-share" may do with the shared folder (the link's path).
//
//   list      "path" (optional): the entries of the shared folder, or of a
//             folder inside it named relative to it
//   download  "path": one regular file inside the shared folder, sent with
//             byte ranges
//
// Both run as the link's owner (grantByUser: the visitor's session is the
// owner's). Nothing outside the shared folder is reachable: the visitor's
// path is a relative name of at most kMaxPath bytes whose parts are plain
// names (no "", "." or "..", no control byte), and it is resolved from a
// descriptor of the shared folder with openat2(RESOLVE_BENEATH |
// RESOLVE_NO_SYMLINKS), so no symbolic link is followed and nothing leads
// out of it. The descriptor that was resolved is the one listed or sent.
#include <algorithm>
#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <json/json.h>
#include <linux/openat2.h>
#include <string>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <vector>

#include "vela/vlibc.h"
#include "webapi/APIDownload.h"
#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIParameter.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

// The handler's own error codes, with the parameter or reason as data.
constexpr int kBadPath = 1001;     // the path is not a relative name inside the share
constexpr int kNotFound = 1002;    // no such entry, a link on the way, or not the expected kind
constexpr int kNoShare = 1003;     // the request has no shared folder
constexpr int kSendFailed = 1004;  // the file could not be sent

constexpr size_t kMaxPath = 1024;
constexpr size_t kMaxListed = 5000;

// Closes a descriptor on every way out.
struct Fd {
    explicit Fd(int v = -1) : fd(v) {}
    ~Fd()
    {
        if (fd >= 0) {
            close(fd);
        }
    }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int fd;
};

// A relative name made of plain parts, as described at the top.
bool IsRelativeName(const std::string& path)
{
    if (path.empty() || path.size() > kMaxPath || path[0] == '/') {
        return false;
    }
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) {
            end = path.size();
        }
        const std::string part = path.substr(start, end - start);
        if (part.empty() || part == "." || part == ".." || part.size() > 255) {
            return false;
        }
        for (char ch : part) {
            const unsigned char c = static_cast<unsigned char>(ch);
            if (c < 0x20 || c == 0x7f) {
                return false;
            }
        }
        start = end + 1;
    }
    return true;
}

// The shared folder of the request's link, opened as a directory without
// following a link in its last part. -1 when there is none. The store keeps
// the path as the system sees it, so it is taken under the system root.
int OpenShare(APIRequest* req)
{
    const std::string root = req->GetSharingEntry().get_path();
    if (root.empty() || root[0] != '/') {
        return -1;
    }
    return open(VELA::System::Path(root).c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
}

// `path` below the folder `dirfd`, never above it, through no link.
int OpenBeneath(int dirfd, const std::string& path, int flags)
{
    struct open_how how = {};
    how.flags = static_cast<unsigned long long>(flags | O_CLOEXEC | O_NOFOLLOW);
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
    const long fd = syscall(SYS_openat2, dirfd, path.c_str(), &how, sizeof(how));
    return fd < 0 ? -1 : static_cast<int>(fd);
}

// The optional (`required` false) or required parameter "path" into
// `path` ("" when absent); false with kBadPath set when it is not a
// relative name.
bool ReadPath(APIRequest* req, APIResponse* resp, bool required, std::string& path)
{
    const VELA::APIParameter<std::string> p =
        req->GetAndCheckString("path", required ? APIRequest::REQUIRED : APIRequest::OPTIONAL, nullptr);
    if (p.IsInvalid() || (required && !p.IsSet())) {
        resp->SetError(kBadPath, Json::Value("path"));
        return false;
    }
    path = p.IsSet() ? p.Get() : "";
    if (p.IsSet() && !IsRelativeName(path)) {
        resp->SetError(kBadPath, Json::Value("path"));
        return false;
    }
    return true;
}

void List(APIRequest* req, APIResponse* resp)
{
    std::string path;
    if (!ReadPath(req, resp, false, path)) {
        return;
    }
    Fd share(OpenShare(req));
    if (share.fd < 0) {
        resp->SetError(kNoShare);
        return;
    }
    const int fd = path.empty() ? dup(share.fd) : OpenBeneath(share.fd, path, O_RDONLY | O_DIRECTORY);
    if (fd < 0) {
        resp->SetError(kNotFound, Json::Value("path"));
        return;
    }
    DIR* dir = fdopendir(fd);
    if (dir == nullptr) {
        close(fd);
        resp->SetError(kNotFound, Json::Value("path"));
        return;
    }
    std::vector<Json::Value> entries;
    bool truncated = false;
    while (struct dirent* de = readdir(dir)) {
        const std::string name = de->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        if (entries.size() == kMaxListed) {
            truncated = true;
            break;
        }
        struct stat st;
        if (fstatat(dirfd(dir), de->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
            continue;
        }
        Json::Value e(Json::objectValue);
        e["name"] = name;
        e["type"] = S_ISDIR(st.st_mode) ? "dir" : S_ISREG(st.st_mode) ? "file" : "other";
        e["size"] = static_cast<Json::Int64>(S_ISREG(st.st_mode) ? st.st_size : 0);
        e["mtime"] = static_cast<Json::Int64>(st.st_mtime);
        entries.push_back(e);
    }
    closedir(dir);
    std::sort(entries.begin(), entries.end(),
              [](const Json::Value& a, const Json::Value& b) { return a["name"].asString() < b["name"].asString(); });
    Json::Value data(Json::objectValue);
    data["path"] = path;
    data["files"] = Json::Value(Json::arrayValue);
    for (const Json::Value& e : entries) {
        data["files"].append(e);
    }
    data["truncated"] = truncated;
    resp->SetSuccess(data);
}

void Download(APIRequest* req, APIResponse* resp)
{
    std::string path;
    if (!ReadPath(req, resp, true, path)) {
        return;
    }
    Fd share(OpenShare(req));
    if (share.fd < 0) {
        resp->SetError(kNoShare);
        return;
    }
    Fd file(OpenBeneath(share.fd, path, O_RDONLY | O_NONBLOCK));
    struct stat st;
    if (file.fd < 0 || fstat(file.fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        resp->SetError(kNotFound, Json::Value("path"));
        return;
    }
    const size_t slash = path.rfind('/');
    const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
    VELA::APIDownload download(resp);
    if (!download.Output(file.fd, name) && resp->IsEnableOutput()) {
        resp->SetError(kSendFailed);
    }
}

_tag_API_TABLE g_table[] = {
    {"VELA.Sample.Share", 1, "list", VELA::APIGuarded<List>},
    {"VELA.Sample.Share", 1, "download", VELA::APIGuarded<Download>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
