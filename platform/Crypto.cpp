// Encrypted parameters: not built yet; every call fails closed.
#include <string>

#include "vela/cgi.h"
#include "vela/log.h"

namespace {
const char kNotBuilt[] = "the parameter-encryption module is not built yet";
}

int VelaCgiDecryptParam(std::string& text)
{
    VELA_LOG_ERR("VelaCgiDecryptParam: %s", kNotBuilt);
    return -1;
}

int VELACloudServiceHubtokenGenerateToken(const char* token, char* key, size_t size)
{
    if (key != nullptr && size > 0) {
        key[0] = '\0';
    }
    VELA_LOG_ERR("VELACloudServiceHubtokenGenerateToken: %s", kNotBuilt);
    return -1;
}

int VelaCgiPublicKeyPEM(std::string& pem)
{
    pem.clear();
    VELA_LOG_ERR("VelaCgiPublicKeyPEM: %s", kNotBuilt);
    return -1;
}

namespace VELA {
namespace CredRequestUtil {

bool GetDecryptAESString(const std::string& key, const std::string& cipher, std::string& plain)
{
    plain.clear();
    VELA_LOG_ERR("GetDecryptAESString: %s", kNotBuilt);
    return false;
}

}  // namespace CredRequestUtil
}  // namespace VELA
