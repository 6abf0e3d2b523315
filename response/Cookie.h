// Set-Cookie lines of a response: name checks, the expiry date and the
// assembled line "name=value; path=...; expires=...; domain=...; secure;
// httponly". Nothing here throws.
#pragma once

#include <ctime>
#include <json/json.h>
#include <string>

namespace VELA {
namespace Cookie {

// The date written for a cookie the client should delete.
extern const char* const kExpiredDate;

// Non-empty and only ASCII letters, digits, "_" and "-".
bool IsValidName(const std::string& name);

// True when `text` holds CR or LF.
bool HasLineBreak(const std::string& text);

// The seconds of a "client_time" parameter, read as an integer like every
// number a client sends (RequestFacts::CheckedInteger: a real or a text with
// a fraction is truncated, blanks around a text are skipped). Anything else,
// or a number that does not fit time_t, gives 0.
time_t ParseClientTime(const Json::Value& value);

// Writes the expiry date `reference` + `minutes` * 60 as
// "Thu, 01-Jan-1970 00:10:00 GMT" (C locale, UTC) into `out`. False, with
// `out` unchanged, when the sum overflows time_t or the date has no broken-
// down form.
bool FormatExpiry(time_t reference, long minutes, std::string& out);

// Assembles the line. `reference` is read only when `expireMinutes` > 0.
// The value is URL-encoded; the other parts go in as they are, so the
// caller checks them first. False when the expiry can not be formatted.
bool BuildLine(const std::string& name, const std::string& value, const std::string& path,
               long expireMinutes, time_t reference, const std::string& domain, bool secure,
               bool httpOnly, std::string& line);

}  // namespace Cookie
}  // namespace VELA
