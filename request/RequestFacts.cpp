#include "request/RequestFacts.h"

#include <climits>
#include <cmath>

#include "vela/vlibc.h"

namespace VELA {
namespace RequestFacts {

bool Truthy(const Json::Value& v)
{
    switch (v.type()) {
    case Json::booleanValue:
        return v.asBool();
    case Json::intValue:
        return v.asLargestInt() != 0;
    case Json::uintValue:
        return v.asLargestUInt() != 0;
    case Json::realValue:
        return v.asDouble() != 0.0;
    case Json::stringValue: {
        const char* begin = nullptr;
        const char* end = nullptr;
        return v.getString(&begin, &end) && end != begin;
    }
    case Json::arrayValue:
    case Json::objectValue:
        return !v.empty();
    default:
        return false;
    }
}

std::string Text(const Json::Value& v)
{
    return v.isString() ? v.asString() : std::string();
}

long long CheckedInteger(const Json::Value& v, long long min, long long max, long long def)
{
    long long value = def;
    if (v.isInt64()) {
        value = v.asInt64();
    } else if (v.isDouble() && !v.isUInt64()) {
        // A real: truncated when it fits long long (2^63 is the first
        // double that does not; NaN fails both comparisons).
        const double t = std::trunc(v.asDouble());
        if (!(t >= -9223372036854775808.0 && t < 9223372036854775808.0)) {
            return def;
        }
        value = static_cast<long long>(t);
    } else if (v.isString()) {
        const char* begin = nullptr;
        const char* end = nullptr;
        if (v.getString(&begin, &end) &&
            System::ParseNumberText(begin, static_cast<size_t>(end - begin), min, max, value)) {
            return value;
        }
        return def;
    } else {
        return def;  // also an unsigned integer above LLONG_MAX
    }
    return value >= min && value <= max ? value : def;
}

long long ExactInteger(const Json::Value& v, long long min, long long max, long long def)
{
    long long value = def;
    if (v.isInt64()) {
        value = v.asInt64();
        return value >= min && value <= max ? value : def;
    }
    const char* begin = nullptr;
    const char* end = nullptr;
    if (v.isString() && v.getString(&begin, &end) &&
        System::ParseDecimal(begin, static_cast<size_t>(end - begin), min, max, value)) {
        return value;
    }
    return def;
}

long long Integer(const Json::Value& v, long long def)
{
    return CheckedInteger(v, LLONG_MIN, LLONG_MAX, def);
}

long long ContentLength(const Json::Value& v, long long max)
{
    if (v.isNull()) {
        return 0;
    }
    const char* begin = nullptr;
    const char* end = nullptr;
    if (!v.isString() || !v.getString(&begin, &end)) {
        return -1;
    }
    return VELA::System::ContentLength(begin, static_cast<size_t>(end - begin), max);
}

}  // namespace RequestFacts
}  // namespace VELA
