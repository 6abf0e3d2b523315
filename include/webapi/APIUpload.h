// Receiving a multipart upload from the request body.
//
// APIUpload picks a temporary directory with room for the body (a data
// volume's "@tmp", else "/tmp", else "/var/tmp" when the root file system
// keeps 200 MiB spare), makes the process's private directory inside it
// (vela/uploaddir.h: mode 0700, removed after the reply and when a signal
// ends the request), lets the platform stream the parts into that, and
// returns the form fields and the stored files as JSON. Stored files are the
// caller's during the request; one that should outlive it is moved out of
// the private directory. Results:
//   1   success
//   -2  no temporary directory has room for the body (platform error 10496,
//       or 3072 when "/var/tmp" or the private directory could not be
//       created)
//   -6  nothing to upload (CONTENT_LENGTH absent or 0)
//   -8  GetUploadFile before a file part was named by GetUploadParam
//   -9  out of memory, or the tables could not be turned into JSON
//   other values: the platform loader's own codes (VELA_UPLOAD_ERR_* of
//   vela/upload.h), passed through.
// A stored file "<key>" appears as "<key>" -> its path and "<key>_name" ->
// the client's base name of the file (vela/upload.h).
#pragma once

#include <json/json.h>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

class APIRequest;
// Defined inside the library; exported for the library's own tests.
class APIUploadPrivate;

enum {
    UPLOAD_RESULT_SUCCESS = 1,
    UPLOAD_RESULT_NO_SPACE = -2,
    UPLOAD_RESULT_EMPTY = -6,
    UPLOAD_RESULT_NO_FILE = -8,
    UPLOAD_RESULT_MEMORY = -9,
};

class VELA_EXPORT APIUpload {
public:
    // `request` supplies the environment (CONTENT_LENGTH); it must outlive
    // this object.
    explicit APIUpload(APIRequest* request);
    ~APIUpload();
    APIUpload(const APIUpload&) = delete;
    APIUpload& operator=(const APIUpload&) = delete;

    // Progress of the following reads: bytes consumed and CONTENT_LENGTH.
    void SetUploadCallback(void (*progress)(unsigned long long, unsigned long long));

    // Reads the form fields up to the first (next) file part into `params`;
    // the file part's field then maps to the client's file name. The last
    // error code: 0 unless this or an earlier call failed.
    int GetUploadParam(Json::Value& params);
    // Stores the file part GetUploadParam stopped at and puts its entries
    // into `result`; afterwards the next file part (if any) waits. The last
    // error code (0 on success, -8 when no file part waits).
    int GetUploadFile(Json::Value& result);
    // Reads the whole body: fields and stored files into `params`; the
    // stored paths, in body order, appended to `files` when given.
    int GetUploadAll(Json::Value& params, Json::Value* files);

private:
    APIUploadPrivate* d_;
};

}  // namespace VELA

#pragma GCC visibility pop
