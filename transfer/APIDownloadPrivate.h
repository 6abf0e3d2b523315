// State of an APIDownload.
#pragma once

#include <string>

#include "vela/httpoutput.h"

namespace VELA {

class APIDownload;
class APIResponse;

class APIDownloadPrivate {
public:
    APIDownloadPrivate(APIDownload* owner, APIResponse* response, bool ownsResponse)
        : owner(owner), response(response), ownsResponse(ownsResponse)
    {
    }

    APIDownload* owner;
    APIResponse* response;   // whose header section is printed; may be null
    std::string mimeType;    // empty: derived at output time
    HTTPFileOutputer outputer;
    bool ownsResponse;       // response was made by APIDownload() and is deleted with it
};

}  // namespace VELA
