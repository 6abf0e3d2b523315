// The CGI handle shared by the platform's CGI, session and token code.
#pragma once

#include <string>

#include "vela/vlibc.h"

// The handle's upload tables (vela/upload.h), freed with the handle.
struct VelaCgiUploadTables {
    PVLIBCSZHASH params = nullptr;  // every form field read so far
    PVLIBCSZHASH files = nullptr;   // the file stored by the last load
    VelaCgiUploadTables() = default;
    VelaCgiUploadTables(const VelaCgiUploadTables&) = delete;
    VelaCgiUploadTables& operator=(const VelaCgiUploadTables&) = delete;
    ~VelaCgiUploadTables()
    {
        VLIBCSzHashFree(params);
        VLIBCSzHashFree(files);
    }
};

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

    VelaCgiUploadTables upload;
};
