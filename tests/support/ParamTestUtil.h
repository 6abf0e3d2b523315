// Helpers shared by the tests of typed parameters and their getters (and
// J, JSON text as a value).
#pragma once

#include <gtest/gtest.h>

#include <string>

#include "support/JsonLiteral.h"
#include "webapi/APIParameter.h"

namespace VELA {
namespace Test {

// The flags of `p` in one word: S set, R reset, I invalid, D default.
template <typename T> std::string Flags(APIParameter<T> const& p)
{
    return std::string(p.IsSet() ? "S" : "") + (p.IsReset() ? "R" : "") + (p.IsInvalid() ? "I" : "") +
           (p.IsDefault() ? "D" : "");
}

}  // namespace Test
}  // namespace VELA
