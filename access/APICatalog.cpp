// The judgement of what a user may call (access/APICatalog.h).
#include "access/APICatalog.h"

#include <algorithm>

#include "access/PermissionCheck.h"
#include "dispatcher/Registry.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"

namespace VELA {

namespace {

Json::Value Request(const std::string& api, int version, const std::string& method)
{
    Json::Value request(Json::objectValue);
    request["postParam"]["api"] = api;
    request["postParam"]["version"] = version;
    request["postParam"]["method"] = method;
    return request;
}

}  // namespace

APICatalog::APICatalog() : check_(new PermissionCheck(*this)) {}

APICatalog::~APICatalog() { delete check_; }

std::vector<std::string> APICatalog::Names()
{
    Json::Value table(Json::objectValue);
    InitLibDesc(table);
    std::vector<std::string> names = table.getMemberNames();
    std::sort(names.begin(), names.end());
    return names;
}

bool APICatalog::Describe(const std::string& api, Json::Value& desc)
{
    if (!System::IsAPIName(api)) {
        return false;
    }
    GetMethod(api, 0, "");  // loads the description when there is one
    APIRequest req;
    req.InitParam(Request(api, 0, ""), true);
    if (!AddAPIInfo(&req)) {
        return false;
    }
    desc = Json::Value(Json::objectValue);
    for (const char* key : {"minVersion", "maxVersion", "methods"}) {
        desc[key] = req.GetAPIInfo(key);
    }
    return true;
}

std::vector<std::pair<int, std::vector<std::string>>> APICatalog::Versions(const Json::Value& desc)
{
    std::vector<std::pair<int, std::vector<std::string>>> out;
    const Json::Value& methods = JsonMember(desc, "methods");
    const Json::Value& min = JsonMember(desc, "minVersion");
    const Json::Value& max = JsonMember(desc, "maxVersion");
    if (!methods.isObject() || !min.isInt() || !max.isInt()) {
        return out;
    }
    for (const std::string& key : methods.getMemberNames()) {
        long long version = 0;
        if (!System::ParseDecimal(key, min.asInt(), max.asInt(), version)) {
            continue;
        }
        const Json::Value& list = methods[key];
        if (!list.isArray()) {
            continue;
        }
        std::vector<std::string> names;
        for (const Json::Value& entry : list) {
            if (entry.isString()) {
                names.push_back(entry.asString());
            } else if (entry.isObject()) {
                for (const std::string& name : entry.getMemberNames()) {
                    names.push_back(name);
                }
            }
        }
        std::vector<std::string> listed;
        for (const std::string& name : names) {
            if (Registry::Lists(desc, static_cast<int>(version), name) &&
                std::find(listed.begin(), listed.end(), name) == listed.end()) {
                listed.push_back(name);
            }
        }
        std::sort(listed.begin(), listed.end());
        out.emplace_back(static_cast<int>(version), listed);
    }
    std::sort(out.begin(), out.end());
    return out;
}

bool APICatalog::MayCall(const std::string& api, int version, const std::string& method, const std::string& user,
                         const std::string& clientIP)
{
    if (!System::IsAPIName(api)) {
        return false;
    }
    GetMethod(api, 0, "");  // loads the description when there is one
    Json::Value request = Request(api, version, method);
    request["session"]["username"] = user;
    request["session"]["isAdmin"] = VLIBGroupIsAdminGroupMem(user.c_str(), 0) == 1;
    if (!clientIP.empty()) {
        request["environ"]["vela_remoteIP"] = clientIP;
    }
    APIRequest req(request);
    return AddAPIInfo(&req) && check_->UserMayCall(&req);
}

Json::Value APICatalog::Callable(const std::string& user, const std::string& clientIP)
{
    Json::Value apis(Json::arrayValue);
    for (const std::string& api : Names()) {
        Json::Value desc;
        if (!Describe(api, desc)) {
            continue;
        }
        Json::Value entry(Json::objectValue);
        entry["api"] = api;
        entry["methods"] = Json::Value(Json::objectValue);
        int lowest = 0;
        int highest = 0;
        for (const auto& version : Versions(desc)) {
            Json::Value methods(Json::arrayValue);
            for (const std::string& method : version.second) {
                if (MayCall(api, version.first, method, user, clientIP)) {
                    methods.append(method);
                }
            }
            if (methods.empty()) {
                continue;
            }
            entry["methods"][std::to_string(version.first)] = methods;
            lowest = lowest == 0 ? version.first : lowest;
            highest = version.first;
        }
        if (lowest == 0) {
            continue;
        }
        entry["minVersion"] = lowest;
        entry["maxVersion"] = highest;
        apis.append(entry);
    }
    return apis;
}

}  // namespace VELA
