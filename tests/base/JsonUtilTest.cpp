// JsonFlag: how description and request settings read as yes or no.
#include <gtest/gtest.h>

#include "support/JsonLiteral.h"
#include "webapi/JsonUtil.h"

namespace {

TEST(JsonFlag, BooleansNumbersAndEverythingElse)
{
    const Json::Value values = J(R"([true, 1, -1, 0.5, 18446744073709551615,
                                     false, 0, 0.0, "true", "1", [true], {"a": true}])");
    for (Json::ArrayIndex i = 0; i < values.size(); ++i) {
        const bool expected = i < 5;
        EXPECT_EQ(expected, VELA::JsonFlag(values[i])) << values[i].toStyledString();
        EXPECT_EQ(expected, VELA::JsonFlag(values[i], true)) << values[i].toStyledString();
    }
    EXPECT_FALSE(VELA::JsonFlag(Json::Value()));
    EXPECT_TRUE(VELA::JsonFlag(Json::Value(), true));
}

}  // namespace
