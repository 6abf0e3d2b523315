// The API description registry behind APIRunner: the defaults of lib.def,
// the table of merged descriptions (API name -> description) and the
// look-ups on them. Entries are only ever added, never replaced once a load
// has finished, so a reference to a description or to a method's attribute
// object stays valid for the runner's whole life.
#pragma once

#include <json/json.h>
#include <string>

#include "vela/export.h"

namespace VELA {

class APIResponse;

// An API name that passed the name check (IsAPIName): the only kind of name
// the registry builds a file name from.
class APIName {
public:
    APIName() = default;
    // False, `out` untouched, for a name that may not name a file.
    static bool Check(const std::string& text, APIName& out);
    const std::string& Text() const { return text_; }

private:
    std::string text_;
};

class Registry {
public:
    Registry();
    Registry(const Registry&) = delete;
    Registry& operator=(const Registry&) = delete;

    // Reads lib.def from `path`; an empty object when missing or not an object.
    void LoadDefaults(const std::string& path);
    const Json::Value& Defaults() const { return defaults_; }
    // The runner's own description table.
    Json::Value& Table() { return table_; }

    // Copies the defaults' "authLevel", "allowUser" and "priority" into
    // `desc` where absent; "requestFormat" defaults to "JSON".
    Json::Value& ApplyLibDef(Json::Value& desc) const;
    static bool CheckLibDescription(const Json::Value& desc);
    // Every *.lib file of the working directory into `table`.
    bool LoadAll(Json::Value& table) const;
    // Makes sure `api` is in `table`, loading the one file that declares it.
    // A failure is one line; with `resp` it is also error 102 on `resp`.
    bool Load(Json::Value& table, const APIName& api, APIResponse* resp) const;

    // The description of `api` in the table; null when not loaded.
    const Json::Value* Find(const std::string& api) const;
    // The attribute object of one method of the loaded description `desc`:
    // the first member of the object entry named `method`, or the
    // defaults' "methods" when the method has none of its own.
    const Json::Value& MethodOf(const Json::Value& desc, int version, const std::string& method) const;
    // Whether `desc` lists `method` for `version` (a string entry or any
    // member of an object entry). Exported for the tests (vela/export.h).
    VELA_EXPORT static bool Lists(const Json::Value& desc, int version, const std::string& method);
    // The object whose members are the flags of a method whose attribute
    // object (MethodOf) is `method`: itself, or the defaults' "methods"
    // when it is not an object.
    const Json::Value& FlagsOf(const Json::Value& method) const;

    void Swap(Registry& other)
    {
        defaults_.swap(other.defaults_);
        table_.swap(other.table_);
    }

private:
    Json::Value defaults_;  // lib.def
    Json::Value table_;     // API name -> merged description
};

// The member `key` of `v`, or null when `v` is not an object or lacks it.
// Never throws.
const Json::Value& JsonMember(const Json::Value& v, const std::string& key);

}  // namespace VELA
