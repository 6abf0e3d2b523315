#include "webapi/JsonUtil.h"

#include "vela/webapiutil.h"

namespace VELA {

namespace {

// The length (1 to 4) of the well-formed UTF-8 sequence that starts at
// text[i], or 0 when none does: a continuation byte, C0, C1, F5 to FF, an
// overlong form, a surrogate (ED A0 to ED BF), a code point above U+10FFFF,
// or a sequence cut short by a wrong byte or by the end of the text.
size_t SequenceAt(const std::string& text, size_t i)
{
    const unsigned char c = static_cast<unsigned char>(text[i]);
    if (c < 0x80) {
        return 1;
    }
    size_t len = 0;
    unsigned char low = 0x80;   // the range of the second byte, which
    unsigned char high = 0xbf;  // rules out overlong forms and surrogates
    if (c >= 0xc2 && c <= 0xdf) {
        len = 2;
    } else if (c == 0xe0) {
        len = 3;
        low = 0xa0;
    } else if (c == 0xed) {
        len = 3;
        high = 0x9f;
    } else if (c >= 0xe1 && c <= 0xef) {
        len = 3;
    } else if (c == 0xf0) {
        len = 4;
        low = 0x90;
    } else if (c == 0xf4) {
        len = 4;
        high = 0x8f;
    } else if (c >= 0xf1 && c <= 0xf3) {
        len = 4;
    } else {
        return 0;
    }
    if (text.size() - i < len) {
        return 0;
    }
    const unsigned char second = static_cast<unsigned char>(text[i + 1]);
    if (second < low || second > high) {
        return 0;
    }
    for (size_t k = 2; k < len; ++k) {
        const unsigned char next = static_cast<unsigned char>(text[i + k]);
        if (next < 0x80 || next > 0xbf) {
            return 0;
        }
    }
    return len;
}

// `text` with every byte that is not part of a well-formed UTF-8 sequence
// replaced by U+FFFD (EF BF BD). One pass; the text is copied only when it
// holds such a byte.
std::string ValidUTF8(std::string text)
{
    size_t i = 0;
    size_t len = 0;
    while (i < text.size() && (len = SequenceAt(text, i)) != 0) {
        i += len;
    }
    if (i == text.size()) {
        return text;
    }
    std::string out(text, 0, i);
    out.reserve(text.size() + 16);
    while (i < text.size()) {
        len = SequenceAt(text, i);
        if (len == 0) {
            out += "\xef\xbf\xbd";
            ++i;
        } else {
            out.append(text, i, len);
            i += len;
        }
    }
    return out;
}

}  // namespace

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
    // The writer escapes control characters and copies every byte from 0x80
    // up as it is; the JSON structure around strings is ASCII, so repairing
    // the finished text repairs exactly the strings and member names.
    return ValidUTF8(Json::writeString(builder, value));
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
