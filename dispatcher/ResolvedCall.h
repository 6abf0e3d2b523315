// One call on the road: the request and response it runs for, and every
// answer about it that the road needs, each asked once — the names read from
// the request, what the registry says of the API and the method, the
// library and its tables once loaded — plus what is put back on the way out.
#pragma once

#include <json/json.h>
#include <string>

#include "dispatcher/ExecContext.h"
#include "dispatcher/Registry.h"
#include "webapi/APITable.h"

namespace VELA {

class APIRequest;
class APIResponse;
class APIRunner;
class APIRunnerPrivate;

struct ResolvedCall {
    ResolvedCall(APIRunner& runner_, APIRunnerPrivate& d_, APIRequest* req_, APIResponse* resp_)
        : runner(runner_), d(d_), req(req_), resp(resp_)
    {
    }
    ResolvedCall(const ResolvedCall&) = delete;
    ResolvedCall& operator=(const ResolvedCall&) = delete;

    // A flag of the method ("allowUpload", "grantable", ...), as
    // APIRunner::GetMethodAttr answers it.
    bool Flag(const std::string& attr) const;

    APIRunner& runner;
    APIRunnerPrivate& d;
    APIRequest* const req;
    APIResponse* const resp;

    // Who is called, as the request names it.
    std::string api;
    int version = 0;
    std::string method;
    APIName name;  // `api` once it passed the name check

    // What the registry answered (its own values, alive as long as the
    // runner): the API's merged description (null when the call did not go
    // through the description check) and the method's attribute object.
    const Json::Value* description = nullptr;
    const Json::Value* methodAttrs = nullptr;
    const Json::Value* flags = nullptr;  // methodAttrs, or lib.def's "methods"
    // Taken from the description.
    std::string lib;
    int priority = 0;
    std::string runAs;  // the API's, replaced by the method's own
    bool counted = true;

    // The library, once opened, and the entry of the call in its tables.
    _tag_API_TABLE* table = nullptr;
    _tag_API_CHECK_TABLE* check = nullptr;
    const _tag_API_TABLE* entry = nullptr;

    bool named = false;  // the process shows this call's name
    // Put back on every way out (identity first, then the scope).
    CallScope scope;
    ExecContext identity;
};

// Resolves a call that did not go through the description check (ProcessLib
// called by itself): the names from the request, the method's attributes
// from the registry, the rest from the description handed to the request.
void ResolveFromRequest(ResolvedCall& call);

}  // namespace VELA
