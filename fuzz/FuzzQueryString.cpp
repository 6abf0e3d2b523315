// Fuzz target: the raw query string (or form-encoded body) as the client
// sends it, through the checks of the CGI library and the split into
// parameters that WebEntry applies to it.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "vela/cgi.h"
#include "vela/webapiutil.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string raw(reinterpret_cast<const char*>(data), size);
    std::string line = raw;
    const bool accepted = VelaCgiDetectAndDecryptParamLine(line);
    // A refused line is left as it was; a plain accepted one as well.
    if ((!accepted || raw.compare(0, 13, "__cIpHeRtExT=") != 0) && line != raw) {
        abort();
    }
    Json::Value params(Json::objectValue);
    if (accepted && !VELA::WebAPIUtil::strPairToJsonObj(line, params, true, true)) {
        abort();
    }
    // The split must also survive what the check refuses.
    Json::Value loose;
    VELA::WebAPIUtil::strPairToJsonObj(raw, loose, true, false);
    return 0;
}
