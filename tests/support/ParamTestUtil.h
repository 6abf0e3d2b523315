// Helpers shared by the tests of typed parameters and their getters.
#pragma once

#include <gtest/gtest.h>

#include <json/json.h>
#include <string>

#include "webapi/APIParameter.h"

namespace VELA {
namespace Test {

inline Json::Value Parse(const std::string& text)
{
    Json::Value out;
    Json::Reader reader;
    EXPECT_TRUE(reader.parse(text, out)) << text;
    return out;
}

// The flags of `p` in one word: S set, R reset, I invalid, D default.
template <typename T> std::string Flags(APIParameter<T> const& p)
{
    return std::string(p.IsSet() ? "S" : "") + (p.IsReset() ? "R" : "") + (p.IsInvalid() ? "I" : "") +
           (p.IsDefault() ? "D" : "");
}

}  // namespace Test
}  // namespace VELA
