// The handler library of the upload benchmark, "VELA.Bench.Transfer": its
// method "receive" takes a multipart upload through the framework
// (APIUpload::GetUploadAll, the same call the sample's upload makes) and
// does nothing else with the stored files but measure and remove them, so
// that the benchmark times the framework's receiving path alone. run.sh
// installs it, with its description, only in its temporary state root.
#include <fcntl.h>
#include <json/json.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"
#include "webapi/APIUpload.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;

// Answers {"files": N, "bytes": total size}. The paths come from the upload
// reader, never from the parameters, where a client could name any file.
void Receive(APIRequest* req, APIResponse* resp)
{
    Json::Value params(Json::objectValue);
    Json::Value stored(Json::arrayValue);
    VELA::APIUpload upload(req);
    const int rc = upload.GetUploadAll(params, &stored);

    unsigned long long bytes = 0;
    for (const Json::Value& path : stored) {
        if (!path.isString()) {
            continue;
        }
        const int fd = open(path.asCString(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
        struct stat st;
        if (fd >= 0 && fstat(fd, &st) == 0) {
            bytes += static_cast<unsigned long long>(st.st_size);
        }
        if (fd >= 0) {
            close(fd);
        }
        unlink(path.asCString());
    }
    if (rc != VELA::UPLOAD_RESULT_SUCCESS) {
        Json::Value details(Json::objectValue);
        details["upload_err"] = rc;
        resp->SetError(WEBAPI_ERR_UPLOAD_FAILED, details);
        return;
    }
    Json::Value data(Json::objectValue);
    data["files"] = stored.size();
    data["bytes"] = static_cast<Json::UInt64>(bytes);
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Bench.Transfer", 1, "receive", VELA::APIGuarded<Receive>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

extern "C" __attribute__((visibility("default"))) _tag_API_TABLE* GetAPITable(void) { return g_table; }
