// The handler libraries behind APIRunner: loaded on first use with the
// dynamic loader, cached by the "lib" path of the description exactly as
// written, kept until the runner is destroyed.
#pragma once

#include <dlfcn.h>
#include <map>
#include <string>

#include "webapi/APITable.h"

namespace VELA {

class APIResponse;

class LibCache {
public:
    LibCache() = default;
    LibCache(const LibCache&) = delete;
    LibCache& operator=(const LibCache&) = delete;
    ~LibCache() { CloseAll(); }

    // The handle of the library at `path`, opened on first use; null on
    // failure, which is one line and, with `resp`, error 111 on `resp`.
    // `mode` is dlopen's (RTLD_NOW binds every symbol at once).
    void* Open(const std::string& path, APIResponse* resp, int mode = RTLD_LAZY);
    // Closes every cached library and empties the cache.
    void CloseAll();
    size_t Size() const { return handles_.size(); }

private:
    std::map<std::string, void*> handles_;  // "lib" path -> dlopen handle
};

// The API table of a loaded library. Null when it has none; `why` then says
// why and `priority` at which priority that is worth a line.
_tag_API_TABLE* FetchAPITable(void* handle, std::string& why, int& priority);

}  // namespace VELA
