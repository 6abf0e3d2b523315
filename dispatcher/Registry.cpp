// The API description registry of APIRunner: description files ("*.lib")
// merged with the defaults of lib.def, the attribute object of one method,
// and the first check of a request against the descriptions.
//
// Every relative name (the "*.lib" pattern, the candidates of one API) is
// resolved against the working directory, the web-API directory. API names
// come from the client: they are checked for length and characters before
// any file name is built from them.
#include <exception>
#include <glob.h>
#include <set>
#include <string>

#include "dispatcher/Refusal.h"
#include "vela/log.h"
#include "vela/sysfile.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace VELA {

namespace {

// Candidate description files tried for one API name.
constexpr int kMaxCandidates = 4;

const Json::Value& NullValue()
{
    static const Json::Value kNull;
    return kNull;
}

// The member `key` of `v`, or null when `v` is not an object or lacks it.
// Never throws (the const operator[] of JsonCpp does on arrays and scalars).
const Json::Value& Member(const Json::Value& v, const std::string& key)
{
    if (!v.isObject()) {
        return NullValue();
    }
    const Json::Value* found = v.find(key.data(), key.data() + key.size());
    return found ? *found : NullValue();
}


// An API name from which file names may be built (IsAPIName of vlibc.h).
bool IsSafeAPIName(const std::string& api) { return System::IsAPIName(api); }

}  // namespace

// ---- Descriptions -------------------------------------------------------------

Json::Value& APIRunner::ApplyLibDef(Json::Value& desc)
{
    if (!desc.isObject()) {
        return desc;
    }
    try {
        if (!desc.isMember("authLevel")) {
            desc["authLevel"] = Member(libDef_, "authLevel");
        }
        if (!desc.isMember("allowUser")) {
            desc["allowUser"] = Member(libDef_, "allowUser");
        }
        if (!desc.isMember("requestFormat")) {
            desc["requestFormat"] = "JSON";
        }
        if (!desc.isMember("priority")) {
            desc["priority"] = Member(libDef_, "priority");
        }
    } catch (const std::exception&) {
        // Out of memory: the description keeps what it had.
    }
    return desc;
}

bool APIRunner::CheckLibDescription(Json::Value& desc)
{
    if (!desc.isObject()) {
        return false;
    }
    const Json::Value& lib = Member(desc, "lib");
    if (!lib.isString() || lib.asString().empty()) {
        return false;
    }
    if (!Member(desc, "minVersion").isInt() || !Member(desc, "maxVersion").isInt()) {
        return false;
    }
    if (!Member(desc, "methods").isObject()) {
        return false;
    }
    if (desc.isMember("priority")) {
        const Json::Value& priority = desc["priority"];
        if (!priority.isInt() || priority.asInt() > 10 || priority.asInt() < -10) {
            return false;
        }
    }
    return true;
}

// Adds the valid descriptions of one file's object to `table`. A name added
// earlier in the same load (`added`) is replaced by the later file; an entry
// that was in the table before the load is kept, since entries live, and
// references to them stay valid, for the runner's whole life.
static void AddDescriptions(APIRunner& runner, Json::Value& table, const Json::Value& file,
                            std::set<std::string>& added)
{
    for (Json::Value::const_iterator it = file.begin(); it != file.end(); ++it) {
        const std::string name = it.name();
        if (table.isMember(name) && added.count(name) == 0) {
            continue;
        }
        Json::Value desc = *it;
        if (!runner.CheckLibDescription(desc)) {
            VELA_LOG_ERR("WebAPI description %s is not valid.", LogSafe(name).c_str());
            continue;
        }
        table[name] = runner.ApplyLibDef(desc);
        added.insert(name);
    }
}

bool APIRunner::InitLibDesc(Json::Value& table)
{
    if (!table.isNull() && !table.isObject()) {
        return false;
    }
    glob_t files{};
    if (glob("*.lib", 0, nullptr, &files) != 0) {
        globfree(&files);
        return false;
    }
    try {
        std::set<std::string> added;
        for (size_t i = 0; i < files.gl_pathc; ++i) {
            Json::Value file;
            if (!WebAPIUtil::ReadJsonFile(files.gl_pathv[i], file) || !file.isObject()) {
                VELA_LOG_ERR("WebAPI description file %s is not valid", files.gl_pathv[i]);
                continue;
            }
            AddDescriptions(*this, table, file, added);
        }
    } catch (const std::exception&) {
        globfree(&files);
        return false;
    }
    globfree(&files);
    return true;
}

bool APIRunner::InitLibDesc(Json::Value& table, const std::string& api)
{
    if (api.empty()) {
        return false;
    }
    if (!IsSafeAPIName(api)) {
        VELA_LOG_ERR("WebAPI name refused: \"%s\"", LogSafe(api).c_str());
        return false;
    }
    if (!table.isNull() && !table.isObject()) {
        return false;
    }
    if (table.isMember(api)) {
        return true;
    }
    try {
        // The prefixes ending before the second, third, ... dot, then the
        // whole name: for A.B.C.D the files A.B.lib, A.B.C.lib, A.B.C.D.lib.
        // The first component alone is never tried; the longest existing
        // file wins; at most kMaxCandidates names are tried.
        std::string chosen;
        size_t dot = api.find('.');
        for (int i = 0; i < kMaxCandidates; ++i) {
            const size_t next = dot == std::string::npos ? std::string::npos : api.find('.', dot + 1);
            const std::string candidate = (next == std::string::npos ? api : api.substr(0, next)) + ".lib";
            if (VLIBCFileExist(candidate.c_str())) {
                chosen = candidate;
            }
            if (next == std::string::npos) {
                break;
            }
            dot = next;
        }
        if (chosen.empty()) {
            VELA_LOG_ERR("WebAPI %s is not valid", api.c_str());
            return false;
        }
        Json::Value file;
        if (!WebAPIUtil::ReadJsonFile(chosen, file) || !file.isObject()) {
            VELA_LOG_ERR("WebAPI description file %s is not valid", chosen.c_str());
            return false;
        }
        std::set<std::string> added;
        AddDescriptions(*this, table, file, added);
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

bool APIRunner::InitLibDesc(Json::Value& table, APIRequest* req)
{
    if (!req) {
        return false;
    }
    return InitLibDesc(table, req->GetAPIClass());
}

// ---- Methods ------------------------------------------------------------------

const Json::Value& APIRunner::GetMethod(const std::string& api, int version, const std::string& method)
{
    const Json::Value& defaults = Member(libDef_, "methods");
    if (!InitLibDesc(libDesc_, api)) {
        return defaults;
    }
    std::string key;
    try {
        key = std::to_string(version);
    } catch (const std::exception&) {
        return defaults;
    }
    const Json::Value& list = Member(Member(Member(libDesc_, api), "methods"), key);
    if (!list.isArray()) {
        return defaults;
    }
    // Members of an object are kept sorted, so begin() is the smallest name:
    // only that one receives the entry's attributes.
    for (const Json::Value& entry : list) {
        if (!entry.isObject() || entry.empty()) {
            continue;
        }
        Json::Value::const_iterator first = entry.begin();
        if (first.name() == method) {
            return *first;
        }
    }
    return defaults;
}

bool APIRunner::GetMethodAttr(const std::string& api, int version, const std::string& method,
                              const std::string& attr)
{
    try {
        const Json::Value& found = GetMethod(api, version, method);
        if (found.isObject()) {
            return JsonFlag(Member(found, attr));
        }
        return JsonFlag(Member(Member(libDef_, "methods"), attr));
    } catch (const std::exception&) {
        return false;
    }
}

bool APIRunner::GetMethodAttr(APIRequest* req, const std::string& attr)
{
    if (!req || attr.empty()) {
        return false;
    }
    return GetMethodAttr(req->GetAPIClass(), req->GetAPIVersion(), req->GetAPIMethod(), attr);
}

bool APIRunner::AddAPIInfo(APIRequest* req)
{
    if (!req) {
        return false;
    }
    const std::string api = req->GetAPIClass();
    if (!libDesc_.isObject() || !libDesc_.isMember(api)) {
        return false;
    }
    req->InitAPIInfo(Member(libDesc_, api));
    return true;
}

// ---- The first check of a request -----------------------------------------------

bool APIRunner::CheckRequestParam(APIRequest* req, APIResponse* resp)
{
    if (!req || !resp) {
        return false;
    }
    try {
        const std::string api = req->GetAPIClass();
        const int version = req->GetAPIVersion();
        const std::string method = req->GetAPIMethod();
        if (api.empty() || version < 1 || method.empty()) {
            // A call without API, version or method is refused before
            // anything is read or logged.
            resp->SetError(WEBAPI_ERR_BAD_REQUEST);
            return false;
        }
        if (!InitLibDesc(libDesc_, req)) {
            // InitLibDesc has logged why (name refused, no file, file invalid).
            resp->SetError(WEBAPI_ERR_NO_SUCH_API);
            return false;
        }
        if (!libDesc_.isMember(api)) {
            VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_API, "WebAPI %s is not described", LogSafe(api).c_str());
            return false;
        }
        const Json::Value& desc = Member(libDesc_, api);
        const Json::Value& minVersion = Member(desc, "minVersion");
        const Json::Value& maxVersion = Member(desc, "maxVersion");
        if (!minVersion.isInt() || !maxVersion.isInt() || version < minVersion.asInt() ||
            version > maxVersion.asInt()) {
            VELA_REFUSE(resp, WEBAPI_ERR_NOT_SUPPORTED_VERSION, "WebAPI %s has no version %d",
                        LogSafe(api).c_str(), version);
            return false;
        }
        // Any member of an object entry makes its method callable, though
        // only the first member gets the entry's attributes (GetMethod).
        bool listed = false;
        const Json::Value& list = Member(Member(desc, "methods"), std::to_string(version));
        if (list.isArray()) {
            for (const Json::Value& entry : list) {
                if ((entry.isString() && entry.asString() == method) ||
                    (entry.isObject() && entry.isMember(method))) {
                    listed = true;
                    break;
                }
            }
        }
        if (!listed) {
            VELA_REFUSE(resp, WEBAPI_ERR_NO_SUCH_METHOD, "WebAPI %s version %d has no method \"%s\"",
                        LogSafe(api).c_str(), version, LogSafe(method).c_str());
            return false;
        }
        if (!GetMethodAttr(api, version, method, "allowUpload") && req->IsUploadRequest()) {
            VELA_REFUSE(resp, WEBAPI_ERR_UPLOAD_NOT_ALLOWED, "WebAPI %s %d %s takes no upload",
                        LogSafe(api).c_str(), version, LogSafe(method).c_str());
            return false;
        }
        if (!GetMethodAttr(api, version, method, "allowDemo") && req->IsDemoMode()) {
            VELA_REFUSE(resp, WEBAPI_ERR_DEMO_MODE, "WebAPI %s %d %s is not served in demo mode",
                        LogSafe(api).c_str(), version, LogSafe(method).c_str());
            return false;
        }
        return true;
    } catch (const std::exception& e) {
        VELA_REFUSE(resp, WEBAPI_ERR_BAD_REQUEST, "request check failed: %s", e.what());
        return false;
    }
}

}  // namespace VELA
