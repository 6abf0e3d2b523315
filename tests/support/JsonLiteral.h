// Builds a Json::Value from JSON text in tests; aborts the test on bad text.
#pragma once

#include <gtest/gtest.h>
#include <json/json.h>
#include <string>

#include "webapi/JsonUtil.h"

inline Json::Value J(const std::string& text)
{
    Json::Value v;
    if (!VELA::JsonParse(text, v)) {
        ADD_FAILURE() << "bad JSON in test: " << text;
    }
    return v;
}
