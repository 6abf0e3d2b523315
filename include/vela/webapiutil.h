// Web-API utilities of the platform: JSON files, query strings, URL coding.
#pragma once

#include <json/json.h>
#include <string>

#include "vela/vlibc.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {
namespace WebAPIUtil {

// Parses `text` into `out`: strict JSON, at most 256 levels of nesting, no
// trailing garbage. False (and `out` unchanged) otherwise. Never throws.
bool ParseJson(const std::string& text, Json::Value& out);

// Writes `value` (compact, with a final newline) to `path` atomically: a
// temporary file in the same directory created with `mode`, written, fsync'd,
// then renamed over `path`. On any failure the temporary file is removed and
// `path` is untouched.
bool WriteJsonFileAtomic(const std::string& path, const Json::Value& value, unsigned mode);

// Reads and parses the JSON document in `path` into `out`. False (and `out`
// unchanged) when the file cannot be read, is larger than 16 MiB, or is not
// valid JSON (as ParseJson). Never throws.
bool ReadJsonFile(const std::string& path, Json::Value& out);

// Parses a query string ("a=1&b=x%20y", RFC 3986 / HTML form encoding) into
// members of `out`. Pairs are separated by "&"; a pair without "=" gives the
// member with the empty string; pairs with an empty name are skipped. With
// `urlDecode` true names and values are URL-decoded ("+" as space). With
// `overwrite` false an existing member of `out` is kept. `out` must be an
// object or null (null becomes an object); anything else gives false.
bool strPairToJsonObj(const std::string& text, Json::Value& out, bool urlDecode, bool overwrite);

// Splits `text` at every occurrence of `separator` into a JSON array of
// strings, removing the blanks (spaces and tabs) that follow a separator.
// Empty pieces are kept. A null text gives an empty array; a null or empty
// separator gives the whole text as one element.
Json::Value ParseToArray(const char* text, const char* separator);

// Percent-decoding. "%hh" with two hex digits becomes that byte; a "%" not
// followed by two hex digits is kept as it is. With `plusAsSpace` true "+"
// becomes a space.
std::string URLDecode(const std::string& text, bool plusAsSpace);

// Percent-encoding: the unreserved characters of RFC 3986 (letters, digits,
// "-", ".", "_", "~") stay as they are, every other byte becomes "%HH".
std::string URLEncode(const std::string& text);

// The table's entries as a JSON object of strings (a later duplicate key,
// which the table does not produce, would win). Null gives an empty object.
Json::Value SzHashToJsonObj(PVLIBCSZHASH hash);

}  // namespace WebAPIUtil
}  // namespace VELA

#pragma GCC visibility pop
