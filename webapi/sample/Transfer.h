// Upload and download handlers of the sample library (Transfer.cpp); the
// table that exports them is in Sample.cpp.
#pragma once

namespace VELA {
class APIRequest;
class APIResponse;
}  // namespace VELA

namespace Sample {

// "upload": reads a multipart form itself and answers its fields and, for
// each file, the field, the client's file name, the size and the POSIX
// cksum CRC; the stored files are removed afterwards.
void Upload(VELA::APIRequest* req, VELA::APIResponse* resp);
// "download": sends the file "name" of the first data volume's folder
// "sample", byte ranges included.
void Download(VELA::APIRequest* req, VELA::APIResponse* resp);

}  // namespace Sample
