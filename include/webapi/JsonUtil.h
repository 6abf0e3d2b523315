// Small JSON helpers shared by the framework and handler libraries. None of
// them throws.
//
// JsonToString is the writer of every answer (the CGI body, velarun's
// output), and its text is always valid UTF-8, whatever bytes the value's
// strings hold (a file name on a volume may hold any). Well-formed UTF-8
// passes unchanged, byte for byte; every byte that is not part of a
// well-formed sequence (a stray continuation byte, C0, C1, F5 to FF, an
// overlong form, a surrogate such as ED A0 80, a sequence cut short) becomes
// one U+FFFD, in strings and member names alike. A client therefore always
// gets JSON it can parse, and sees where bytes were replaced; the replaced
// bytes cannot be recovered from the answer. A handler that must give back
// a name the client can send again (to name that file in a later call)
// sends it in an encoding of its own beside the display text, for example
// percent-encoded or base64.
#pragma once

#include <json/json.h>
#include <string>

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

// Parses `text` into `out`. Nesting deeper than 256 levels, trailing garbage
// and invalid JSON give false with `out` unchanged.
bool JsonParse(const std::string& text, Json::Value& out);
// Reads and parses the file at `path` (at most 16 MiB).
bool JsonReadFile(const std::string& path, Json::Value& out);
// Writes `value` to `path` atomically: a temporary file in the same directory
// (mode `mode`), flushed, then renamed over `path`. No partial file is left.
bool JsonWriteFile(const std::string& path, const Json::Value& value, unsigned mode = 0644);
// Compact one-line text of `value`, valid UTF-8 (see above). Linear in the
// size of the text.
std::string JsonToString(const Json::Value& value);
// The index of the first element of the array `array` equal to `value`
// (JSON equality), or -1 when there is none or `array` is not an array.
int JsonSearchArrayIndex(const Json::Value& array, const Json::Value& value);
// A yes/no setting of a description or a request: booleans as they are,
// numbers when not zero, `def` for null, false for anything else (text,
// arrays, objects), where Json::Value::asBool() would throw.
bool JsonFlag(const Json::Value& value, bool def = false);

}  // namespace VELA

#pragma GCC visibility pop
