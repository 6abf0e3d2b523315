// vela-demo: builds a request from a request JSON and prints what a handler
// would see. Reads the JSON from the file named as the first argument, from
// standard input with "-", or uses a built-in sample without arguments.
#include <cstdio>
#include <iostream>
#include <iterator>
#include <string>

#include <json/json.h>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIValidator.h"
#include "webapi/JsonUtil.h"

namespace {

const char kSample[] = R"({
  "environ": {
    "REQUEST_METHOD": "POST",
    "HTTP_HOST": "nas.example.net:5001",
    "HTTPS": "on",
    "REQUEST_URI": "/webapi/entry.cgi?api=VELA.Demo.Echo",
    "HTTP_COOKIE": "id=Zm9vYmFy; lang=en%20US; broken",
    "HTTP_USER_AGENT": "Mozilla/5.0 (iPhone; CPU iPhone OS 17_0 like Mac OS X) AppleWebKit/605.1.15",
    "REMOTE_ADDR": "192.0.2.10",
    "CONTENT_TYPE": "application/x-www-form-urlencoded"
  },
  "getParam": {"api": "VELA.Demo.Echo", "version": "1", "method": "get"},
  "postParam": {"method": "echo", "count": 3, "tags": ["a", "b"], "enabled": true},
  "session": {"username": "alice", "isAdmin": false, "isTimeout": false, "timeout": 900},
  "reqLib": {"allowUser": ["admin.local", "normal.local"]}
})";

bool ReadInput(int argc, char** argv, std::string& text)
{
    if (argc < 2) {
        text = kSample;
        return true;
    }
    std::string arg = argv[1];
    if (arg == "-") {
        text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
        return true;
    }
    Json::Value parsed;
    if (!VELA::JsonReadFile(arg, parsed)) {
        return false;
    }
    text = VELA::JsonToString(parsed);
    return true;
}

}  // namespace

// What a handler reads of the request: names, URL, cookies, client kind
// and session facts.
Json::Value Seen(const VELA::APIRequest& request)
{
    Json::Value seen(Json::objectValue);
    seen["api"] = request.GetAPIClass();
    seen["version"] = request.GetAPIVersion();
    seen["method"] = request.GetAPIMethod();
    seen["requestMethod"] = request.GetRequestMethod();
    seen["url"]["proto"] = request.GetURLProto("");
    seen["url"]["host"] = request.GetURLHost("");
    seen["url"]["port"] = request.GetURLPort(0);
    seen["url"]["path"] = request.GetURLPath("");
    seen["url"]["name"] = request.GetURLName("");
    seen["cookies"]["id"] = request.GetCookie("id", "");
    seen["cookies"]["lang"] = request.GetCookie("lang", "");
    seen["client"]["mobile"] = request.IsMobile();
    seen["client"]["iPhone"] = request.IsIPhone();
    seen["client"]["webKit"] = request.IsWebKit();
    seen["session"]["sessionId"] = request.GetSessionID();
    seen["session"]["user"] = request.GetLoginUserName();
    seen["session"]["isAdmin"] = request.IsAdmin();
    seen["session"]["isTimeout"] = request.IsTimeout();
    seen["session"]["timeout"] = request.GetTimeoutDuration();
    seen["session"]["uiLanguage"] = request.GetUILanguage();
    seen["session"]["allowUser"] = request.GetAllowUser();
    seen["session"]["authResult"] = static_cast<int>(request.GetAuthResult());
    seen["upload"] = request.IsUploadRequest();
    return seen;
}

int main(int argc, char** argv)
{
    std::string text;
    Json::Value input;
    if (!ReadInput(argc, argv, text) || !VELA::JsonParse(text, input)) {
        fprintf(stderr, "vela-demo: the input is not a JSON document\n");
        return 2;
    }
    VELA::APIRequest request(input);
    Json::Value seen = Seen(request);
    // Typed parameters, with the flags a handler would test.
    auto count = request.GetAndCheckInt("count", VELA::APIRequest::OPTIONAL);
    auto tags = request.GetAndCheckUnitArray("tags", VELA::APIRequest::OPTIONAL);
    auto enabled = request.GetAndCheckBool("enabled", VELA::APIRequest::REQUIRED);
    auto port = request.GetAndCheckInt("port", VELA::APIRequest::OPTIONAL, VELA::APIValidator::IsPort);
    port.SetDefault(5000);
    seen["param"]["count"] = count.IsInvalid() ? Json::Value("invalid") : Json::Value(count.Get(0));
    seen["param"]["tags"] = tags.Get(Json::Value(Json::arrayValue));
    seen["param"]["enabled"] = enabled.IsInvalid() ? Json::Value("invalid") : Json::Value(enabled.Get());
    seen["param"]["port"] = port.Get();
    seen["param"]["portIsDefault"] = port.IsDefault();

    // What an echo handler would answer.
    VELA::APIResponse response(&request);
    Json::Value echo(Json::objectValue);
    echo["method"] = request.GetAPIMethod();
    echo["count"] = count.Get(0);
    response.SetSuccess(echo);
    response.AddCookie("lang", request.GetCookie("lang", "en"), "/", 0, "", request.GetURLProto("") == "https", true);
    seen["response"]["body"] = response.GetBody();
    seen["response"]["cookies"] = response.GetCookies();

    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    std::cout << Json::writeString(builder, seen) << std::endl;
    return 0;
}
