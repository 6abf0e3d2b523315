// The session facts of a request in one line, so that a case compares them
// all at once: IsTimeout, IsSkipCheckIP, IsAuthorized, IsAdmin as 1 or 0,
// then the language, the idle timeout, and user|application|web-API
// privilege|session file.
#pragma once

#include <sstream>
#include <string>

#include "webapi/APIRequest.h"

namespace VELA {
namespace Test {

inline std::string SessionFacts(const APIRequest& r)
{
    std::ostringstream out;
    out << r.IsTimeout() << r.IsSkipCheckIP() << r.IsAuthorized() << r.IsAdmin() << " " << r.GetUILanguage() << " "
        << r.GetTimeoutDuration() << " " << r.GetLoginUserName() << "|" << r.GetApplication() << "|"
        << r.GetWebAPIPriv() << "|" << r.GetSessionFilePath();
    return out.str();
}

}  // namespace Test
}  // namespace VELA
