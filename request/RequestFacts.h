// Small conversions of stored JSON values used by the request accessors.
#pragma once

#include <json/json.h>
#include <string>

namespace VELA {
namespace RequestFacts {

// Truth of a stored value: true, non-zero numbers, non-empty strings and
// non-empty containers count as true; null and everything else as false.
bool Truthy(const Json::Value& v);
// Text of a stored value: the string itself, "" for anything else.
std::string Text(const Json::Value& v);
// Integer of a stored value: integral numbers in range as they are, reals
// truncated when in range, text that is exactly a decimal number
// (ParseDecimal); `def` for everything else and on overflow. Never throws.
long long Integer(const Json::Value& v, long long def);
// Integer of a value that came from the client: a JSON integer, or text
// that is exactly a decimal number (ParseDecimal), within [min, max];
// `def` for everything else (reals, "1e0", " 1", "1\0", junk, overflow).
long long CheckedInteger(const Json::Value& v, long long min, long long max, long long def);
// CONTENT_LENGTH of the request's environment (VELA::System::ContentLength): 0 when
// absent or empty, -1 for junk or more than `max`.
long long ContentLength(const Json::Value& v, long long max);

}  // namespace RequestFacts
}  // namespace VELA
