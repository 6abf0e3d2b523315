// The sample handler library: the API "VELA.Sample" (and "VELA.Sample.Echo",
// its echo alone), built the way any handler library is, against include/
// and JsonCpp, linked to the framework. Its description is VELA.Sample.lib.
//
//   echo    answers its parameters as they arrived
//   fail    answers the handler's own error code 1001 with details
//   typed   reads typed parameters with validators; a bad one gets 101 and
//           the list of what was wrong
//   whoami  runs as the user its description names ("runAs"), answers the
//           real, effective and saved user and group ids and the login user
//   adminonly  open to local administrators only ("allowUser"); answers the
//           login user
//   status  what a page polls ("allowTimeout": the call does not keep an
//           idle session alive); answers the login user and the session's
//           idle timeout in seconds
//   upload, download  (Transfer.cpp) a multipart form in, a file out
//   checksum, taskstatus, taskstop, tasklist  (Tasks.cpp) a background task
//           with progress, and its status, stop and listing
#include <json/json.h>
#include <string>
#include <unistd.h>

#include "webapi/APIError.h"
#include "webapi/APIGuard.h"
#include "webapi/APIParameter.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"
#include "webapi/APIValidator.h"

#include "Tasks.h"
#include "Transfer.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

using VELA::APIParameter;
using VELA::APIRequest;
using VELA::APIResponse;
using VELA::APIValidator;

// The sample's own error code: codes the framework does not use are the
// handler's.
constexpr int kSampleFailure = 1001;
constexpr size_t kMaxName = 32;
constexpr Json::ArrayIndex kMaxTags = 16;

void Echo(APIRequest* req, APIResponse* resp)
{
    resp->SetSuccess(req->GetParam("", Json::Value(Json::objectValue)));
}

void Fail(APIRequest* req, APIResponse* resp)
{
    Json::Value details(Json::objectValue);
    details["reason"] = "the sample fails on purpose";
    details["method"] = req->GetAPIMethod();
    resp->SetError(kSampleFailure, details);
}

// 1 to kMaxName letters, digits, "-" and "_".
bool IsSampleName(std::string const& name)
{
    return name.size() <= kMaxName && APIValidator::CheckRegex(name, "^[A-Za-z0-9_-]+$");
}

// At most kMaxTags strings.
bool AreTags(Json::Value const& tags)
{
    if (tags.size() > kMaxTags) {
        return false;
    }
    for (const auto& tag : tags) {
        if (!tag.isString()) {
            return false;
        }
    }
    return true;
}

template <typename T>
void Note(Json::Value& errors, const char* name, APIParameter<T> const& p)
{
    if (p.IsInvalid()) {
        Json::Value e(Json::objectValue);
        e["name"] = name;
        e["reason"] = p.IsSet() ? "invalid" : "missing";
        errors.append(e);
    }
}

void Typed(APIRequest* req, APIResponse* resp)
{
    APIParameter<std::string> name = req->GetAndCheckString("name", APIRequest::REQUIRED, IsSampleName);
    APIParameter<int> port = req->GetAndCheckInt("port", APIRequest::OPTIONAL, APIValidator::IsPort);
    APIParameter<bool> enabled = req->GetAndCheckBool("enabled", APIRequest::OPTIONAL);
    APIParameter<Json::Value> tags = req->GetAndCheckArray("tags", APIRequest::OPTIONAL, AreTags);
    port.SetDefault(5000);
    enabled.SetDefault(false);
    tags.SetDefault(Json::Value(Json::arrayValue));

    Json::Value errors(Json::arrayValue);
    Note(errors, "name", name);
    Note(errors, "port", port);
    Note(errors, "enabled", enabled);
    Note(errors, "tags", tags);
    if (!errors.empty()) {
        resp->SetError(WEBAPI_ERR_BAD_REQUEST, errors);
        return;
    }
    Json::Value data(Json::objectValue);
    data["name"] = name.Get();
    data["port"] = port.Get();
    data["portIsDefault"] = port.IsDefault();
    data["enabled"] = enabled.Get();
    data["tags"] = tags.Get();
    resp->SetSuccess(data);
}

void WhoAmI(APIRequest* req, APIResponse* resp)
{
    uid_t ruid, euid, suid;
    gid_t rgid, egid, sgid;
    if (getresuid(&ruid, &euid, &suid) != 0 || getresgid(&rgid, &egid, &sgid) != 0) {
        resp->SetError(kSampleFailure, Json::Value("cannot read the ids"));
        return;
    }
    Json::Value data(Json::objectValue);
    data["user"] = req->GetLoginUserName();
    for (uid_t id : {ruid, euid, suid}) {
        data["uid"].append(static_cast<Json::UInt>(id));
    }
    for (gid_t id : {rgid, egid, sgid}) {
        data["gid"].append(static_cast<Json::UInt>(id));
    }
    resp->SetSuccess(data);
}

void AdminOnly(APIRequest* req, APIResponse* resp)
{
    Json::Value data(Json::objectValue);
    data["user"] = req->GetLoginUserName();
    data["isAdmin"] = req->IsAdmin();
    resp->SetSuccess(data);
}

void Status(APIRequest* req, APIResponse* resp)
{
    Json::Value data(Json::objectValue);
    data["user"] = req->GetLoginUserName();
    data["idleTimeout"] = req->GetTimeoutDuration();
    resp->SetSuccess(data);
}

_tag_API_TABLE g_table[] = {
    {"VELA.Sample", 1, "echo", VELA::APIGuarded<Echo>},
    {"VELA.Sample", 1, "fail", VELA::APIGuarded<Fail>},
    {"VELA.Sample", 1, "typed", VELA::APIGuarded<Typed>},
    {"VELA.Sample", 1, "whoami", VELA::APIGuarded<WhoAmI>},
    {"VELA.Sample", 1, "adminonly", VELA::APIGuarded<AdminOnly>},
    {"VELA.Sample", 1, "status", VELA::APIGuarded<Status>},
    {"VELA.Sample", 1, "upload", VELA::APIGuarded<Sample::Upload>},
    {"VELA.Sample", 1, "download", VELA::APIGuarded<Sample::Download>},
    {"VELA.Sample", 1, "checksum", VELA::APIGuarded<Sample::Checksum>},
    {"VELA.Sample", 1, "taskstatus", VELA::APIGuarded<Sample::TaskStatus>},
    {"VELA.Sample", 1, "taskstop", VELA::APIGuarded<Sample::TaskStop>},
    {"VELA.Sample", 1, "tasklist", VELA::APIGuarded<Sample::TaskList>},
    {"VELA.Sample.Echo", 1, "echo", VELA::APIGuarded<Echo>},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return g_table; }
