// The two-level JSON store (section, entry, value) behind the framework's
// private objects. A derived class creates its sections in its constructor;
// the operations here never create one, so a section it did not create can
// not be written.
#pragma once

#include <json/json.h>
#include <string>

#include "vela/export.h"

namespace VELA {

// Exported for the tests (VELA_EXPORT: see vela/export.h).
class VELA_EXPORT APIBase {
public:
    APIBase();
    virtual ~APIBase();

    // True when `section` exists and holds `key` (an empty key is never held).
    virtual bool HasData(const std::string& section, const std::string& key);
    // Merges the members of the object `object` into `section`. With
    // `stringsOnly` members whose value is not a string are skipped. False for
    // a missing section or an empty or non-object `object`.
    virtual bool SetData(const std::string& section, const Json::Value& object, bool stringsOnly);
    // Sets one entry. False for a missing section, an empty key, or a
    // non-string value under `stringsOnly`.
    virtual bool SetData(const std::string& section, const std::string& key, const Json::Value& value,
                         bool stringsOnly);
    // The entry, the whole section for an empty key, or `defaultValue` itself
    // when the section or key is missing.
    virtual const Json::Value& GetData(const std::string& section, const std::string& key,
                                       const Json::Value& defaultValue);
    // Removes one entry, or empties the section for an empty key.
    virtual bool ClearData(const std::string& section, const std::string& key);

protected:
    Json::Value data_;
};

}  // namespace VELA
