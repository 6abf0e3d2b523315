// The CGI handle shared by the platform's CGI, session and token code.
#pragma once

#include <string>

#include "vela/vlibc.h"

namespace VELA {
namespace Cgi {

// The handle's upload tables (vela/upload.h), freed with the handle.
struct UploadTables {
    PVLIBCSZHASH params = nullptr;  // every form field read so far
    PVLIBCSZHASH files = nullptr;   // the file stored by the last load
    UploadTables() = default;
    UploadTables(const UploadTables&) = delete;
    UploadTables& operator=(const UploadTables&) = delete;
    ~UploadTables()
    {
        VLIBCSzHashFree(params);
        VLIBCSzHashFree(files);
    }
};

}  // namespace Cgi
}  // namespace VELA

struct _tag_VELACGI_CTX_ {
    std::string app;
    PVLIBCSZHASH cookies = nullptr;

    // Set by the caller before a session check (VelaCgiSetSkipCheckIP); after
    // a valid check also on when the session skips the address check.
    int skipCheckIP = 0;

    // Filled by VelaCgiIsAuthorizedEx for a valid session, cleared by every
    // other verdict.
    bool authorized = false;
    std::string sessionFile;
    int timeout = 0;               // idle timeout, seconds
    std::string timeoutText;       // the same as decimal text (option 10)
    bool sessionSkipIP = false;    // the session's own flag (option 1)
    std::string sessionApp;        // option 7
    std::string sessionWebAPI;     // option 6
    std::string sessionLang;       // three letters or ""

    VELA::Cgi::UploadTables upload;
};
