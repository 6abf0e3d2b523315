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
// Integer of a value, the one reading of every number a client sends,
// as a JSON number or as text: integers as they are, reals truncated
// toward zero, text read by ParseNumberText (blanks around it and a
// fraction allowed: " 5", "5.9" and 5.9 are all 5). Within [min, max];
// `def` for everything else (booleans, null, containers, "1e0", "0x1",
// "1\0", junk, NaN, overflow). Never throws.
long long CheckedInteger(const Json::Value& v, long long min, long long max, long long def);
// Integer of a value that selects what runs ("version"): a JSON integer, or
// text that is exactly a decimal number (ParseDecimal), within [min, max];
// `def` for everything else (" 1", "+1", "1.0", reals, "1e0", "1\0").
// Stricter than CheckedInteger on purpose: whoever else reads the request
// on its way (a proxy, a filter, a log reader) must see the same version.
long long ExactInteger(const Json::Value& v, long long min, long long max, long long def);
// CheckedInteger over the whole range of long long, for stored values.
long long Integer(const Json::Value& v, long long def);
// CONTENT_LENGTH of the request's environment (VELA::System::ContentLength): 0 when
// absent or empty, -1 for junk or more than `max`.
long long ContentLength(const Json::Value& v, long long max);

}  // namespace RequestFacts
}  // namespace VELA
