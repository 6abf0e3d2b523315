#include "webapi/APIUtils.h"

#include "vela/sysfile.h"

namespace VELA {

bool APIUtils::SetVelaInfo(const std::string& key, const std::string& value)
{
    RunAsRootGuard guard(__FILE__, __LINE__, "IF_RUN_AS");
    if (!guard.Ok()) {
        return false;
    }
    return VLIBCINFOSetKeyValue(key.c_str(), value.c_str()) >= 0;
}

}  // namespace VELA
