// The private side of APIUpload: the platform CGI state the loaders fill,
// the buffers of the waiting file part, and the choice of the temporary
// directory.
#pragma once

#include <json/json.h>
#include <string>
#include <sys/types.h>

#include "vela/cgi.h"
#include "vela/export.h"
#include "webapi/APIUpload.h"

namespace VELA {

class APIRequest;

// Directory and space constants of the temporary directory choice.
constexpr char kUploadVolumeTmpDir[] = "@tmp";  // under the chosen volume
constexpr mode_t kUploadVolumeTmpMode = 01777;  // world-writable, sticky
constexpr char kUploadTmpDir[] = "/tmp";
constexpr char kUploadVarTmpDir[] = "/var/tmp";
constexpr unsigned long long kUploadSizeMargin = 5ULL * 1024 * 1024;       // added to the body size
constexpr unsigned long long kUploadRootReserve = 200ULL * 1024 * 1024;    // kept free on "/"
constexpr char kUploadDefaultsFile[] = "/etc.defaults/velainfo.conf";

// Exported for the tests (VELA_EXPORT: see vela/export.h).
class VELA_EXPORT APIUploadPrivate {
public:
    typedef void (*Progress)(unsigned long long, unsigned long long);

    APIUploadPrivate(APIUpload* owner, APIRequest* request);
    ~APIUploadPrivate();
    APIUploadPrivate(const APIUploadPrivate&) = delete;
    APIUploadPrivate& operator=(const APIUploadPrivate&) = delete;

    int GetUploadParam(Json::Value& params);
    int GetUploadFile(Json::Value& result);
    int GetUploadAll(Json::Value& params, Json::Value* files);

    // The directory for `size` bytes (the margin included already): a data
    // volume's "@tmp" (created 01777; not on "mintbox" systems), else
    // CanUploadtoTmp, else CanUploadtoRoot. Paths are resolved under the
    // system root. A directory that VELA::Transfer::UploadBaseUsable refuses (another
    // user's, or writable by others without the sticky bit and not ours to
    // repair) is passed over for the next one.
    bool FindUploadTmpDir(std::string& dir, unsigned long long size);
    // The process's private upload directory (vela/uploaddir.h) inside the
    // directory FindUploadTmpDir chooses for a body of `size` bytes, in
    // `dir`: 2 made now, 1 made by an earlier call, -1 none (logged).
    int PrivateDir(unsigned long long size, std::string& dir);
    // "/tmp" when its file system has `size` bytes free for the superuser;
    // else platform error 10496.
    bool CanUploadtoTmp(std::string& dir, unsigned long long size);
    // "/var/tmp" (created, mode 0700) when "/" keeps 200 MiB free beyond
    // `size`; else platform error 10496, or 3072 when it cannot be created.
    bool CanUploadtoRoot(std::string& dir, unsigned long long size);

    // CONTENT_LENGTH of the request's environment; 0 when absent or not a
    // decimal number.
    unsigned long long ContentLength() const;

    APIUpload* owner_;
    APIRequest* request_;
    Progress progress_ = nullptr;
    VELACGI_CTX* cgi_ = nullptr;
    char fileName_[256] = {};
    char fieldName_[64] = {};
    char fieldValue_[491] = {};
    unsigned long long expectedSize_ = 0;
    int lastError_ = 0;
};

}  // namespace VELA
