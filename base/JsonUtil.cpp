#include "webapi/JsonUtil.h"

#include "vela/webapiutil.h"

namespace VELA {

bool JsonParse(const std::string& text, Json::Value& out)
{
    return WebAPIUtil::ParseJson(text, out);
}

bool JsonReadFile(const std::string& path, Json::Value& out)
{
    return WebAPIUtil::ReadJsonFile(path, out);
}

bool JsonWriteFile(const std::string& path, const Json::Value& value, unsigned mode)
{
    return WebAPIUtil::WriteJsonFileAtomic(path, value, mode);
}

std::string JsonToString(const Json::Value& value)
{
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    return Json::writeString(builder, value);
}

int JsonSearchArrayIndex(const Json::Value& array, const Json::Value& value)
{
    if (!array.isArray()) {
        return -1;
    }
    for (Json::ArrayIndex i = 0; i < array.size(); ++i) {
        if (array[i] == value) {
            return static_cast<int>(i);
        }
    }
    return -1;
}

bool JsonFlag(const Json::Value& value, bool def)
{
    if (value.isNull()) {
        return def;
    }
    if (value.isBool()) {
        return value.asBool();
    }
    if (value.isInt64()) {
        return value.asInt64() != 0;
    }
    if (value.isUInt64()) {
        return value.asUInt64() != 0;
    }
    if (value.isDouble()) {
        return value.asDouble() != 0.0;
    }
    return false;
}

}  // namespace VELA
