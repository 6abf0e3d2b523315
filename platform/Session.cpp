// Login sessions: not built yet; every call fails closed.
#include "CgiContext.h"
#include "vela/cgi.h"
#include "vela/log.h"

namespace {
const char kNotBuilt[] = "the identity/session module is not built yet";
}

int VelaCgiIsTokenEnable(VELACGI_CTX* ctx)
{
    VELA_LOG_ERR("VelaCgiIsTokenEnable: %s", kNotBuilt);
    return 0;
}

int VelaCgiUIDGet(const char* sid, const char* user)
{
    VELA_LOG_ERR("VelaCgiUIDGet: %s", kNotBuilt);
    return -1;
}
