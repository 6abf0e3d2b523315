// Upload and download methods of the sample library.
//
// "upload" is described with "allowUpload" and "deferUpload": the handler
// reads the body itself, so it learns the stored files from the upload
// reader and never from the merged parameters, where a client could name
// any path in a field of its own. Every stored file is removed before the
// answer.
//
// "download" is described with "allowDownload": it answers with the file
// instead of JSON. Files come only from <first data volume>/sample, under a
// plain name, so that X-Sendfile (whose web server only serves the data
// volumes) and direct output give the same answers. The file is opened
// once, without following links, and its descriptor is handed over.
#include "Transfer.h"
#include "Cksum.h"

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <fcntl.h>
#include <json/json.h>
#include <string>
#include <unistd.h>

#include "vela/httpoutput.h"
#include "vela/sysfile.h"
#include "webapi/APIDownload.h"
#include "webapi/APIError.h"
#include "webapi/APIParameter.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIUpload.h"
#include "webapi/APIValidator.h"

namespace Sample {

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

constexpr int kSampleFailure = 1001;
const char kDownloadFolder[] = "/sample";

// Size and cksum of the stored file `path`; false when it cannot be read.
bool Checksum(const std::string& path, unsigned long long& size, uint32_t& crc)
{
    const int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) {
        return false;
    }
    PosixCksum sum;
    unsigned char buf[65536];
    bool ok = true;
    for (;;) {
        const ssize_t n = read(fd, buf, sizeof(buf));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            ok = false;
            break;
        }
        if (n == 0) {
            break;
        }
        sum.Add(buf, static_cast<size_t>(n));
    }
    close(fd);
    size = sum.Length();
    crc = sum.Finish();
    return ok;
}

// A name of the download folder: letters, digits, ".", "_" and "-", not
// starting with "." (so neither "." nor ".." nor a hidden file), at most 128
// bytes.
bool IsDownloadName(std::string const& name)
{
    return name.size() <= 128 && VELA::APIValidator::CheckRegex(name, "^[A-Za-z0-9_-][A-Za-z0-9._-]*$");
}

// Describes each parameter of `params` that is a stored file (its value is
// a path in `stored`) with its checksum, and copies the other parameters
// into `fields`. False when a stored file could not be read.
bool DescribeUpload(const Json::Value& params, const Json::Value& stored, Json::Value& files, Json::Value& fields)
{
    bool readable = true;
    for (const std::string& key : params.getMemberNames()) {
        const Json::Value& value = params[key];
        bool isFile = false;
        for (const Json::Value& path : stored) {
            isFile = isFile || value == path;
        }
        if (!isFile) {
            continue;
        }
        unsigned long long size = 0;
        uint32_t crc = 0;
        readable = readable && Checksum(value.asString(), size, crc);
        Json::Value file(Json::objectValue);
        file["field"] = key;
        file["name"] = params.get(key + "_name", "").asString();
        file["size"] = static_cast<Json::UInt64>(size);
        file["cksum"] = static_cast<Json::UInt>(crc);
        files.append(file);
    }
    for (const std::string& key : params.getMemberNames()) {
        bool fileEntry = false;
        for (const Json::Value& file : files) {
            const std::string field = file["field"].asString();
            fileEntry = fileEntry || key == field || key == field + "_name";
        }
        if (!fileEntry) {
            fields[key] = params[key];
        }
    }
    return readable;
}

}  // namespace

void Upload(APIRequest* req, APIResponse* resp)
{
    Json::Value params(Json::objectValue);
    Json::Value stored(Json::arrayValue);
    VELA::APIUpload upload(req);
    const int rc = upload.GetUploadAll(params, &stored);

    Json::Value files(Json::arrayValue);
    Json::Value fields(Json::objectValue);
    const bool readable = rc != VELA::UPLOAD_RESULT_SUCCESS || DescribeUpload(params, stored, files, fields);
    for (const Json::Value& path : stored) {
        if (path.isString()) {
            unlink(path.asString().c_str());
        }
    }

    if (rc != VELA::UPLOAD_RESULT_SUCCESS) {
        Json::Value details(Json::objectValue);
        details["upload_err"] = rc;
        resp->SetError(WEBAPI_ERR_UPLOAD_FAILED, details);
        return;
    }
    if (!readable) {
        resp->SetError(kSampleFailure, Json::Value("a stored file could not be read"));
        return;
    }
    Json::Value data(Json::objectValue);
    data["fields"] = fields;
    data["files"] = files;
    resp->SetSuccess(data);
}

void Download(APIRequest* req, APIResponse* resp)
{
    VELA::APIParameter<std::string> name = req->GetAndCheckString("name", APIRequest::REQUIRED, IsDownloadName);
    if (name.IsInvalid()) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST, Json::Value("name"));
        return;
    }
    VOLUME_INFO volume;
    if (VolumeAvailGet(0, &volume, 0, 0) != 1) {
        resp->SetError(kSampleFailure, Json::Value("no data volume"));
        return;
    }
    // The volume's own path is the administrator's and may lead through a
    // link (a volume mounted elsewhere): it is resolved first. Below it,
    // only a regular file of the folder itself, not a link that leads out:
    // opened once without following any link on the way, checked on the
    // descriptor, and the descriptor is what is sent. A path checked first
    // and opened later could be swapped for a link in between by anyone who
    // may write to the folder.
    char* mount = realpath(volume.szMountPath, nullptr);
    if (mount == nullptr) {
        resp->SetError(kSampleFailure, Json::Value("no data volume"));
        return;
    }
    const std::string path = std::string(mount) + kDownloadFolder + "/" + name.Get();
    free(mount);
    const int fd = HTTPFileOutputer::OpenForOutput(path);
    if (fd < 0) {
        resp->SetError(kSampleFailure, Json::Value("no such file"));
        return;
    }
    VELA::APIDownload download(resp);
    if (!download.Output(fd, name.Get()) && resp->IsEnableOutput()) {
        // Nothing was written: the JSON error still goes out.
        resp->SetError(kSampleFailure, Json::Value("the file could not be sent"));
    }
    close(fd);
}

}  // namespace Sample
