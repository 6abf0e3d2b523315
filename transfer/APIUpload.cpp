// Uploads: the temporary directory choice and the hand-over of the body to
// the platform's multipart loaders (vela/upload.h).
#include <climits>
#include <string>
#include <sys/statvfs.h>

#include "request/RequestFacts.h"
#include "transfer/APIUploadPrivate.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/upload.h"
#include "vela/uploaddir.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webapi/APIRequest.h"
#include "webapi/APIUpload.h"

namespace VELA {

namespace {

// Bytes free for the superuser (blocks free, not only those available to
// ordinary users, times the fragment size).
unsigned long long FreeBytes(const struct statvfs& st)
{
    unsigned long long bytes = 0;
    if (__builtin_mul_overflow(static_cast<unsigned long long>(st.f_bfree),
                               static_cast<unsigned long long>(st.f_frsize), &bytes)) {
        return ULLONG_MAX;
    }
    return bytes;
}

// Adds the string members of `hash` to the object `out`. False when the
// table could not be converted whole or `out` is not an object.
bool MergeTable(PVLIBCSZHASH hash, Json::Value& out)
{
    try {
        const Json::Value obj = WebAPIUtil::SzHashToJsonObj(hash);
        if (!obj.isObject() || obj.size() != static_cast<Json::ArrayIndex>(VLIBCSzHashCount(hash))) {
            return false;
        }
        if (!out.isObject() && !out.isNull()) {
            return false;
        }
        if (out.isNull()) {
            out = Json::Value(Json::objectValue);
        }
        for (const std::string& name : obj.getMemberNames()) {
            out[name] = obj[name];
        }
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

// Owns the two tables of GetUploadAll.
struct UploadTables {
    PVLIBCSZHASH fields = VLIBCSzHashAlloc(256);
    PVLIBCSZHASH files = VLIBCSzHashAlloc(256);
    UploadTables() = default;
    UploadTables(const UploadTables&) = delete;
    UploadTables& operator=(const UploadTables&) = delete;
    ~UploadTables()
    {
        VLIBCSzHashFree(fields);
        VLIBCSzHashFree(files);
    }
};

}  // namespace

APIUploadPrivate::APIUploadPrivate(APIUpload* owner, APIRequest* request) : owner_(owner), request_(request)
{
    if (VelaCgiInit("", &cgi_) != 0) {
        VELA_LOG_ERR("cannot initialise the CGI library for the upload");
        cgi_ = nullptr;
    }
}

APIUploadPrivate::~APIUploadPrivate() { VelaCgiFree(cgi_); }

unsigned long long APIUploadPrivate::ContentLength() const
{
    if (request_ == nullptr) {
        return 0;
    }
    // Junk answers 0, no body, as an absent or empty CONTENT_LENGTH does.
    const long long size = RequestFacts::ContentLength(request_->GetEnv("CONTENT_LENGTH"), LLONG_MAX);
    return size > 0 ? static_cast<unsigned long long>(size) : 0;
}

bool APIUploadPrivate::CanUploadtoTmp(std::string& dir, unsigned long long size)
{
    const std::string tmp = VELA::System::Path(kUploadTmpDir);
    struct statvfs st;
    if (statvfs(tmp.c_str(), &st) != 0) {
        return false;
    }
    if (size <= FreeBytes(st)) {
        dir = tmp;
        return true;
    }
    VLIBCErrSetEx(VLIBC_ERR_NO_SPACE, __FILE__, __LINE__);
    return false;
}

bool APIUploadPrivate::CanUploadtoRoot(std::string& dir, unsigned long long size)
{
    struct statvfs st;
    if (statvfs(VELA::System::Root().c_str(), &st) != 0) {
        return false;
    }
    unsigned long long need = 0;
    if (!__builtin_add_overflow(size, kUploadRootReserve, &need) && need <= FreeBytes(st)) {
        const std::string varTmp = VELA::System::Path(kUploadVarTmpDir);
        if (VELAFSMkdirP(varTmp.c_str(), 0, 0, static_cast<uid_t>(-1), static_cast<gid_t>(-1), 0700) != 0) {
            VLIBCErrSetEx(VLIBC_ERR_MKDIR, __FILE__, __LINE__);
            return false;
        }
        dir = varTmp;
        return true;
    }
    VLIBCErrSetEx(VLIBC_ERR_NO_SPACE, __FILE__, __LINE__);
    return false;
}

bool APIUploadPrivate::FindUploadTmpDir(std::string& dir, unsigned long long size)
{
    // Systems marked "mintbox" keep temporary files off their data volumes.
    if (VLIBCFileCheckKeyValue(kUploadDefaultsFile, "mintbox", "yes", 0) != 1) {
        VOLUME_INFO volume;
        if (VolumeAvailGet(size, &volume, 0, VOLUME_AVAIL_WRITABLE) == 1) {
            dir = std::string(volume.szMountPath) + "/" + kUploadVolumeTmpDir;
            // Every identity that uploads may make its private directory
            // here; the sticky bit keeps each one's entries its own.
            (void)VELAFSMkdirP(dir.c_str(), 0, 0, static_cast<uid_t>(-1), static_cast<gid_t>(-1),
                               kUploadVolumeTmpMode);
            if (VELA::Transfer::UploadBaseUsable(dir.c_str()) == 1) {
                return true;
            }
        }
    }
    if (CanUploadtoTmp(dir, size) && VELA::Transfer::UploadBaseUsable(dir.c_str()) == 1) {
        return true;
    }
    return CanUploadtoRoot(dir, size) && VELA::Transfer::UploadBaseUsable(dir.c_str()) == 1;
}

int APIUploadPrivate::PrivateDir(unsigned long long size, std::string& dir)
{
    dir = VELA::Transfer::UploadDirPath();
    if (!dir.empty()) {
        return 1;  // chosen and made by an earlier call of this request
    }
    if (size > ULLONG_MAX - kUploadSizeMargin || !FindUploadTmpDir(dir, size + kUploadSizeMargin)) {
        VELA_LOG_ERR("no temporary directory has room for an upload of %llu bytes", size);
        return -1;
    }
    char path[PATH_MAX];
    const int rc = VELA::Transfer::UploadDirGet(dir.c_str(), path, sizeof(path));
    if (rc < 0) {
        return -1;
    }
    dir = path;
    return rc;
}

int APIUploadPrivate::GetUploadAll(Json::Value& params, Json::Value* files)
{
    const unsigned long long size = ContentLength();
    if (size == 0) {
        return UPLOAD_RESULT_EMPTY;
    }
    UploadTables tables;
    if (tables.fields == nullptr || tables.files == nullptr) {
        VELA_LOG_ERR("cannot alloc memory for hash!");
        return UPLOAD_RESULT_MEMORY;
    }
    std::string dir;
    const int made = PrivateDir(size, dir);
    if (made < 0) {
        return UPLOAD_RESULT_NO_SPACE;
    }
    const int rc = VelaCgiLoadUploadAll(tables.fields, tables.files, dir.c_str(), 0, progress_);
    if (rc != 1 && made == 2) {
        VELA::Transfer::UploadDirRemove();  // a failed load removed its files; nothing else is in there
    }
    if (files != nullptr) {
        const int count = VLIBCSzHashCount(tables.files);
        try {
            for (int i = 0; i < count; ++i) {
                const char* key = VLIBCSzHashKeyAt(tables.files, i);
                const char* value = VLIBCSzHashValueAt(tables.files, i);
                if (key != nullptr && value != nullptr) {
                    files->append(Json::Value(value));
                }
            }
        } catch (const std::exception&) {
            return UPLOAD_RESULT_MEMORY;
        }
    }
    if (rc != 1) {
        return rc;
    }
    if (!MergeTable(tables.fields, params)) {
        return UPLOAD_RESULT_MEMORY;
    }
    if (!MergeTable(tables.files, params)) {
        VELA_LOG_ERR("cannot convert hash to Json object!");
        return UPLOAD_RESULT_MEMORY;
    }
    return rc;
}

int APIUploadPrivate::GetUploadParam(Json::Value& params)
{
    if (cgi_ == nullptr) {
        lastError_ = UPLOAD_RESULT_MEMORY;
        return lastError_;
    }
    const int rc = VelaCgiLoadUploadParams(cgi_, progress_, &expectedSize_, fileName_, sizeof(fileName_),
                                           fieldName_, sizeof(fieldName_), fieldValue_, sizeof(fieldValue_));
    if (rc > 0) {
        if (!MergeTable(VelaCgiGetUploadParams(cgi_), params)) {
            lastError_ = UPLOAD_RESULT_MEMORY;
        }
    } else {
        lastError_ = rc;  // the loader's own code, passed through
    }
    if (fieldName_[0] != '\0' && fieldValue_[0] != '\0') {
        try {
            params[fieldName_] = fieldValue_;
        } catch (const std::exception&) {
            lastError_ = UPLOAD_RESULT_MEMORY;
        }
    }
    return lastError_;
}

int APIUploadPrivate::GetUploadFile(Json::Value& result)
{
    if (fileName_[0] == '\0' || fieldName_[0] == '\0' || fieldValue_[0] == '\0') {
        lastError_ = UPLOAD_RESULT_NO_FILE;
        return lastError_;
    }
    if (expectedSize_ == 0) {
        lastError_ = UPLOAD_RESULT_EMPTY;
        return lastError_;
    }
    std::string dir;
    const int made = PrivateDir(expectedSize_, dir);
    if (made < 0) {
        lastError_ = UPLOAD_RESULT_NO_SPACE;
        return lastError_;
    }
    const int rc = VelaCgiLoadUploadFileToDir(cgi_, dir.c_str(), progress_, fileName_, sizeof(fileName_),
                                              fieldName_, sizeof(fieldName_), fieldValue_, sizeof(fieldValue_));
    if (rc < 1 && made == 2) {
        VELA::Transfer::UploadDirRemove();
    }
    if (rc < 1) {
        lastError_ = rc;  // the loader's own code, passed through
        return lastError_;
    }
    if (!MergeTable(VelaCgiGetUploadFiles(cgi_), result)) {
        lastError_ = UPLOAD_RESULT_MEMORY;
    }
    return lastError_;
}

APIUpload::APIUpload(APIRequest* request) : d_(new APIUploadPrivate(this, request)) {}

APIUpload::~APIUpload() { delete d_; }

void APIUpload::SetUploadCallback(void (*progress)(unsigned long long, unsigned long long))
{
    d_->progress_ = progress;
}

int APIUpload::GetUploadParam(Json::Value& params) { return d_->GetUploadParam(params); }

int APIUpload::GetUploadFile(Json::Value& result) { return d_->GetUploadFile(result); }

int APIUpload::GetUploadAll(Json::Value& params, Json::Value* files)
{
    try {
        return d_->GetUploadAll(params, files);
    } catch (const std::exception&) {
        return UPLOAD_RESULT_MEMORY;
    }
}

}  // namespace VELA
