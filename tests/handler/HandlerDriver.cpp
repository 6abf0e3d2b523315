// Opens the test handler library with dlopen(), runs its functions on
// requests built from JSON and compares what they answered. Exit status 0
// when everything matched, 1 otherwise (each mismatch is printed).
#include <dlfcn.h>
#include <iostream>
#include <memory>
#include <json/json.h>
#include <string>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

namespace {

typedef void (*HandlerFn)(VELA::APIRequest*, VELA::APIResponse*);

int g_failures = 0;

void Check(bool ok, const std::string& what)
{
    if (!ok) {
        std::cerr << "mismatch: " << what << "\n";
        ++g_failures;
    }
}

void CheckJson(const Json::Value& expected, const Json::Value& actual, const std::string& what)
{
    if (expected != actual) {
        std::cerr << "mismatch: " << what << "\n  expected " << expected.toStyledString()
                  << "  actual   " << actual.toStyledString();
        ++g_failures;
    }
}

Json::Value Parse(const char* text)
{
    Json::Value out;
    Json::CharReaderBuilder builder;
    std::string errors;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    const std::string s(text);
    if (!reader->parse(s.data(), s.data() + s.size(), &out, &errors)) {
        std::cerr << "bad JSON in the driver: " << errors << "\n";
        ++g_failures;
    }
    return out;
}

HandlerFn Lookup(void* lib, const char* name)
{
    void* sym = dlsym(lib, name);
    Check(sym != nullptr, std::string("symbol ") + name);
    return reinterpret_cast<HandlerFn>(sym);
}

// Each parameter the handler read answers [value, flags]: S set, R reset,
// I invalid, D default.
void RunParams(HandlerFn fn)
{
    VELA::APIRequest req(Parse(R"({"getParam": {
        "count": 5, "negative": -1, "wrongtype": "x", "enabled": true, "ratio": 0.5,
        "name": "disk1", "cleared": null, "ids": [1, 2], "opts": {"a": 1}, "paths": "single",
        "big": -9000000000, "mask": 4294967295, "size": 18446744073709551615}})"));
    VELA::APIResponse resp(&req);
    fn(&req, &resp);
    Check(resp.GetError() == 0, "params: error code");
    CheckJson(Parse(R"({"success": true, "data": {
        "count": [5, "S"], "negative": [-1, "SI"], "wrongtype": [0, "SI"], "enabled": [true, "S"],
        "ratio": [0.5, "S"], "name": ["disk1", "S"], "cleared": ["", "SR"], "missing_req": ["", "I"],
        "ids": [[1, 2], "S"], "opts": [{"a": 1}, "S"], "paths": [["single"], "S"], "limit": [7, "SD"],
        "big": [-9000000000, "S"], "mask": [4294967295, "S"], "size": [18446744073709551615, "S"]}})"),
              resp.GetBody(), "params: body");
}

void RunRefuse(HandlerFn fn)
{
    VELA::APIRequest req(Parse(R"({"environ": {"HTTP_HOST": "nas"}})"));
    VELA::APIResponse resp(&req);
    fn(&req, &resp);
    CheckJson(Parse(R"({"success": false, "error": {"code": 105, "errors": {"reason": "not admin", "verdict": -4}}})"),
              resp.GetBody(), "refuse: body");
    Check(resp.GetError() == 105, "refuse: error code");
    Check(resp.GetStatus() == 403, "refuse: status");
    Check(resp.GetServerError() == "admin only", "refuse: server error");
    Check(resp.HasServerError(), "refuse: has server error");
}

void RunLogin(HandlerFn fn)
{
    VELA::APIRequest req(Parse(R"({"environ": {"HTTPS": "on", "HTTP_HOST": "nas:5001"},
                                   "getParam": {"client_time": 0}})"));
    VELA::APIResponse resp(&req);
    fn(&req, &resp);
    CheckJson(Parse(R"({"success": true, "data": {"injection_refused": true}})"), resp.GetBody(),
              "login: body");
    CheckJson(Parse(R"(["id=s%201; path=/; expires=Thu, 01-Jan-1970 00:10:00 GMT; secure; httponly"])"),
              resp.GetCookies(), "login: cookies");
    Check(resp.GetHeader("Location") == "https://nas:5001/index.html", "login: location");
    Check(resp.GetStatus() == 302, "login: status");
    Check(resp.GetHeader("X-Handler") == "login", "login: own header");
    Check(!resp.HasHeader("X-Evil"), "login: injected header");
    Check(resp.GetHeader("Content-type") == "application/json; charset=\"UTF-8\"",
          "login: content type");
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::cerr << "usage: " << argv[0] << " <handler library>\n";
        return 2;
    }
    void* lib = dlopen(argv[1], RTLD_NOW | RTLD_LOCAL);
    if (!lib) {
        const char* err = dlerror();
        std::cerr << "dlopen failed: " << (err ? err : "unknown error") << "\n";
        return 1;
    }
    HandlerFn params = Lookup(lib, "HandlerParams");
    HandlerFn refuse = Lookup(lib, "HandlerRefuse");
    HandlerFn login = Lookup(lib, "HandlerLogin");
    if (params && refuse && login) {
        RunParams(params);
        RunRefuse(refuse);
        RunLogin(login);
    }
    if (dlclose(lib) != 0) {
        const char* err = dlerror();
        Check(false, std::string("dlclose: ") + (err ? err : "unknown error"));
    }
    if (g_failures != 0) {
        std::cerr << g_failures << " mismatch(es)\n";
        return 1;
    }
    std::cout << "handler results as expected\n";
    return 0;
}
