// The private upload directory for the multipart loaders (not installed);
// the contract of the directory is in vela/uploaddir.h.
#pragma once

#include <string>

namespace VELA {
namespace Transfer {

// A new close-on-exec descriptor of the process's private upload directory
// when `path` is its path exactly as UploadDirGet gave it; -1 otherwise.
// The loaders store files through it, so the path is not looked up again.
int DupUploadDir(const std::string& path);

}  // namespace Transfer
}  // namespace VELA
