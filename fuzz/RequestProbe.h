// Calls every accessor of a request, so fuzz targets reach all derivations.
#pragma once

#include "webapi/APIRequest.h"

namespace VELA {
namespace Fuzz {

inline void Probe(const APIRequest& r)
{
    r.GetAPIClass();
    r.GetAPIVersion();
    r.GetAPIMethod();
    r.GetRequestMethod();
    r.GetAuthResult();
    r.GetURLProto("d");
    r.GetURLHost("d");
    r.GetURLPort(-1);
    r.GetURLPath("d");
    r.GetURLName("d");
    r.IsMobile();
    r.IsMobileDevice();
    r.IsIPhone();
    r.IsAndroid();
    r.IsIEMobile();
    r.IsIPad();
    r.IsPlayBook();
    r.IsBlackBerry6();
    r.IsWebKit();
    r.IsSupportWebApp();
    r.GetSessionID();
    r.GetLoginUserName();
    r.IsAdmin();
    r.IsSkipCheckIP();
    r.IsTimeout();
    r.GetTimeoutDuration();
    r.IsAuthorized();
    r.GetUILanguage();
    r.HasAppPriv("x");
    r.GetAllowUser();
    r.IsPollingTask();
    r.GetPollingTaskId();
    r.IsUploadRequest();
    r.IsSharing();
    r.GetAndCheckInt("api", APIRequest::REQUIRED);
    r.GetAndCheckString("method", APIRequest::OPTIONAL);
    r.GetAndCheckIntegral<unsigned long long>("version", APIRequest::OPTIONAL);
    r.GetAndCheckUnitArray("list", APIRequest::OPTIONAL);
    r.GetAndCheckReal("n", APIRequest::OPTIONAL);
    r.GetAndCheckObject("webapi", APIRequest::OPTIONAL);
}

}  // namespace Fuzz
}  // namespace VELA
