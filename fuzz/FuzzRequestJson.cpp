// Fuzz target: any bytes as a request JSON. Whatever the document, building
// the request and asking every accessor must neither crash nor throw.
#include <cstddef>
#include <cstdint>
#include <string>

#include "fuzz/RequestProbe.h"
#include "webapi/APIRequest.h"
#include "webapi/JsonUtil.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    Json::Value doc;
    if (!VELA::JsonParse(std::string(reinterpret_cast<const char*>(data), size), doc)) {
        return 0;
    }
    VELA::APIRequest request(doc);
    VELA::Fuzz::Probe(request);
    VELA::APIRequest copy(request);
    copy.InitParam(doc, true);
    copy.InitEnv(doc.isObject() ? doc.get("environ", Json::Value()) : Json::Value());
    VELA::Fuzz::Probe(copy);
    return 0;
}
