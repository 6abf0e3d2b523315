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

long long Integer(const Json::Value& v, long long def)
{
    if (v.isInt64()) {
        return v.asInt64();
    }
    if (v.isUInt64()) {
        return def;  // above LLONG_MAX
    }
    if (v.isDouble()) {
        double d = v.asDouble();
        if (std::isfinite(d) && d > static_cast<double>(LLONG_MIN) && d < static_cast<double>(LLONG_MAX)) {
            return static_cast<long long>(d);
        }
        return def;
    }
    if (!v.isString()) {
        return def;
    }
    // Decimal text: the whole text a ParseDecimal number, `def` otherwise.
    const char* begin = nullptr;
    const char* end = nullptr;
    long long value = def;
    if (v.getString(&begin, &end) && System::ParseDecimal(begin, static_cast<size_t>(end - begin), LLONG_MIN, LLONG_MAX, value)) {
        return value;
    }
    return def;
}

long long CheckedInteger(const Json::Value& v, long long min, long long max, long long def)
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
