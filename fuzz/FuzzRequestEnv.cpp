// Fuzz target: the raw header texts a client controls. The input is split
// at NUL bytes into Cookie header, Host header, request URI, user agent and
// query-like parameter text; each goes into the environment unchanged.
#include <cstddef>
#include <cstdint>
#include <string>

#include "fuzz/RequestProbe.h"
#include "vela/webapiutil.h"
#include "webapi/APIRequest.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const char* names[] = {"HTTP_COOKIE", "HTTP_HOST", "REQUEST_URI", "HTTP_USER_AGENT", "QUERY"};
    std::string pieces[5];
    size_t piece = 0;
    for (size_t i = 0; i < size && piece < 5; ++i) {
        if (data[i] == 0) {
            ++piece;
        } else {
            pieces[piece] += static_cast<char>(data[i]);
        }
    }
    Json::Value request(Json::objectValue);
    for (int i = 0; i < 4; ++i) {
        request["environ"][names[i]] = pieces[i];
    }
    request["environ"]["HTTPS"] = (size % 2) ? "on" : "off";
    Json::Value params(Json::objectValue);
    VELA::WebAPIUtil::strPairToJsonObj(pieces[4], params, true, true);
    request["getParam"] = params;
    VELA::APIRequest r(request);
    VELA::Fuzz::Probe(r);
    VELA::WebAPIUtil::URLEncode(VELA::WebAPIUtil::URLDecode(pieces[2], true));
    return 0;
}
