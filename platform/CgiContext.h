// The CGI handle shared by the platform's CGI, session and token code.
#pragma once

#include <string>

#include "vela/vlibc.h"

struct _tag_VELACGI_CTX_ {
    std::string app;
    PVLIBCSZHASH cookies = nullptr;
};
