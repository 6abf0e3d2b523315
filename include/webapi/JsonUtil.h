// Small JSON helpers shared by the framework and handler libraries. None of
// them throws.
#pragma once

#include <json/json.h>
#include <string>

namespace VELA {

// Parses `text` into `out`. Nesting deeper than 256 levels, trailing garbage
// and invalid JSON give false with `out` unchanged.
bool JsonParse(const std::string& text, Json::Value& out);
// Reads and parses the file at `path` (at most 16 MiB).
bool JsonReadFile(const std::string& path, Json::Value& out);
// Writes `value` to `path` atomically: a temporary file in the same directory
// (mode `mode`), flushed, then renamed over `path`. No partial file is left.
bool JsonWriteFile(const std::string& path, const Json::Value& value, unsigned mode = 0644);
// Compact one-line text of `value`.
std::string JsonToString(const Json::Value& value);
// The index of the first element of the array `array` equal to `value`
// (JSON equality), or -1 when there is none or `array` is not an array.
int JsonSearchArrayIndex(const Json::Value& array, const Json::Value& value);
// A yes/no setting of a description or a request: booleans as they are,
// numbers when not zero, `def` for null, false for anything else (text,
// arrays, objects), where Json::Value::asBool() would throw.
bool JsonFlag(const Json::Value& value, bool def = false);

}  // namespace VELA
