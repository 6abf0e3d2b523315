// The CGI handle shared by the platform's CGI, session and token code.
#pragma once

#include <string>

#include "vela/vlibc.h"

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
};
