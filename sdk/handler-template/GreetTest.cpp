// Loads the staged web-API directory the way the dispatcher does: reads
// VELA.Greet.lib, opens the library its "lib" path names with dlopen(),
// checks that every method the description lists has an entry in the
// library's table, then calls "greet" on requests built from JSON.
//
//   greet_test <web-API directory>
//
// Exit status 0 when every check passed; each failure is printed.
#include <dlfcn.h>
#include <json/json.h>

#include <cstdio>
#include <cstring>
#include <string>

#include <webapi/APIError.h>
#include <webapi/APIRequest.h>
#include <webapi/APIResponse.h>
#include <webapi/APITable.h>
#include <webapi/JsonUtil.h>

namespace {

int failures = 0;

void Check(bool ok, const std::string& what)
{
    if (!ok) {
        fprintf(stderr, "FAILED: %s\n", what.c_str());
        ++failures;
    }
}

Json::Value Parse(const char* text)
{
    Json::Value out;
    Check(VELA::JsonParse(text, out), std::string("parse ") + text);
    return out;
}

// The table entry of api/version/method, or null.
APIHandlerFn Find(const _tag_API_TABLE* table, const std::string& api, int version, const std::string& method)
{
    for (; table->api != nullptr; ++table) {
        if (api == table->api && version == table->version && method == table->method) {
            return table->handler;
        }
    }
    return nullptr;
}

// A method of a description is its name, or an object of one member whose
// name is the method's.
std::string MethodName(const Json::Value& entry)
{
    if (entry.isString()) {
        return entry.asString();
    }
    return entry.isObject() && entry.size() == 1 ? entry.getMemberNames()[0] : std::string();
}

// Runs `handler` on `request` and compares the whole answer with `expected`.
void Expect(APIHandlerFn handler, const char* request, const char* expected)
{
    VELA::APIRequest req(Parse(request));
    VELA::APIResponse resp(&req);
    handler(&req, &resp);
    const Json::Value body = resp.GetBody();
    Check(body == Parse(expected),
          std::string(request) + " answered " + VELA::JsonToString(body) + ", expected " + expected);
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc != 2) {
        fprintf(stderr, "usage: greet_test <web-API directory>\n");
        return 2;
    }
    const std::string dir = argv[1];
    Json::Value description;
    if (!VELA::JsonReadFile(dir + "/VELA.Greet.lib", description) || !description.isMember("VELA.Greet")) {
        fprintf(stderr, "FAILED: no VELA.Greet in %s/VELA.Greet.lib\n", dir.c_str());
        return 1;
    }
    const Json::Value& api = description["VELA.Greet"];
    const std::string lib = dir + "/" + api["lib"].asString();
    void* handle = dlopen(lib.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) {
        fprintf(stderr, "FAILED: dlopen %s: %s\n", lib.c_str(), dlerror());
        return 1;
    }
    typedef _tag_API_TABLE* (*TableFn)(void);
    const TableFn getTable = reinterpret_cast<TableFn>(dlsym(handle, "GetAPITable"));
    if (getTable == nullptr) {
        fprintf(stderr, "FAILED: %s exports no GetAPITable\n", lib.c_str());
        return 1;
    }
    const _tag_API_TABLE* table = getTable();

    // Every listed method of every version in range is in the table.
    const int minVersion = api["minVersion"].asInt();
    const int maxVersion = api["maxVersion"].asInt();
    Check(minVersion >= 1 && minVersion <= maxVersion, "version range");
    for (const std::string& version : api["methods"].getMemberNames()) {
        for (const Json::Value& entry : api["methods"][version]) {
            const std::string method = MethodName(entry);
            Check(Find(table, "VELA.Greet", std::stoi(version), method) != nullptr,
                  "VELA.Greet " + version + " " + method + " has no table entry");
        }
    }

    const APIHandlerFn greet = Find(table, "VELA.Greet", 1, "greet");
    if (greet == nullptr) {
        fprintf(stderr, "FAILED: no greet method\n");
        return 1;
    }
    Expect(greet, R"({"getParam": {"name": "ann", "port": 8080}, "session": {"username": "alice"}})",
           R"({"success": true, "data": {"hello": "ann", "port": 8080, "user": "alice"}})");
    // The port is optional.
    Expect(greet, R"({"getParam": {"name": "ann"}})",
           R"({"success": true, "data": {"hello": "ann", "port": 5000, "user": ""}})");
    // Refusals name the parameter: a missing name, a port out of range, a
    // number sent as text.
    const std::string refused = std::to_string(WEBAPI_ERR_BAD_REQUEST);
    Expect(greet, R"({"getParam": {"port": 8080}})",
           (R"({"success": false, "error": {"code": )" + refused + R"(, "errors": "name"}})").c_str());
    Expect(greet, R"({"getParam": {"name": "ann", "port": 70000}})",
           (R"({"success": false, "error": {"code": )" + refused + R"(, "errors": "port"}})").c_str());
    Expect(greet, R"({"getParam": {"name": "ann", "port": "80"}})",
           (R"({"success": false, "error": {"code": )" + refused + R"(, "errors": "port"}})").c_str());

    dlclose(handle);
    if (failures == 0) {
        printf("greet: all checks passed\n");
    }
    return failures == 0 ? 0 : 1;
}
