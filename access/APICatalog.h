// What a user may call: the descriptions of the web-API directory judged
// with the rules the session check applies once a session is valid
// ("authLevel", the user classes of "allowUser", the API's "appPriv").
// One judgement for every lister: velaapi and the administrators' API.
//
// The catalog is a runner of its own that reads the *.lib files of the
// working directory (the web-API directory) and lib.def.
#pragma once

#include <json/json.h>
#include <string>
#include <utility>
#include <vector>

#include "vela/export.h"
#include "webapi/APIRunner.h"

namespace VELA {

class PermissionCheck;

class VELA_EXPORT APICatalog : public APIRunner {
public:
    APICatalog();
    ~APICatalog() override;

    // The names of the APIs the *.lib files describe, sorted.
    std::vector<std::string> Names();

    // The description of `api` as a call finds it (its own file, the
    // defaults of lib.def applied): "minVersion", "maxVersion", "methods".
    // False when there is none.
    bool Describe(const std::string& api, Json::Value& desc);

    // The versions of `desc` within its range, ascending, each with the
    // methods it lists, sorted and without repeats.
    static std::vector<std::pair<int, std::vector<std::string>>> Versions(const Json::Value& desc);

    // Whether `user` may call the method, as the session check judges it
    // once the session is valid: the user's class ("admin." for a member
    // of the administrators' group) and the API's application privilege
    // from `clientIP` (empty: no address known, only rules without
    // addresses apply).
    bool MayCall(const std::string& api, int version, const std::string& method, const std::string& user,
                 const std::string& clientIP = "");

    // Every API `user` may call something of, sorted by name:
    //   [{"api": "VELA.Sample", "minVersion": 1, "maxVersion": 1,
    //     "methods": {"1": ["echo", ...]}}, ...]
    // with only the versions and methods MayCall admits; the versions are
    // the lowest and highest of those.
    Json::Value Callable(const std::string& user, const std::string& clientIP = "");

private:
    PermissionCheck* check_;
};

}  // namespace VELA
