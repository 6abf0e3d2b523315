// Web-API utilities: JSON text and files, query strings (RFC 3986 section
// 3.4 with HTML form encoding), percent-coding (RFC 3986 section 2.1).
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <string_view>
#include <sys/stat.h>
#include <unistd.h>

#include "system/FileUtil.h"
#include "vela/log.h"
#include "vela/webapiutil.h"

namespace VELA {
namespace WebAPIUtil {

namespace {

constexpr int kMaxJsonDepth = 256;
constexpr size_t kMaxJsonFile = 16u * 1024 * 1024;

// The deepest nesting of arrays and objects in `text`, counted outside
// string literals. JsonCpp's stackLimit counts recursive readValue() calls,
// which is one more than the nesting when the innermost value is a scalar
// and equal to it when it is an empty container, so the exact limit is
// checked here and stackLimit stays as the backstop.
bool DepthWithin(const std::string& text, int limit)
{
    int depth = 0;
    bool inString = false;
    bool escaped = false;
    for (char c : text) {
        if (inString) {
            if (escaped) {
                escaped = false;
            } else if (c == '\\') {
                escaped = true;
            } else if (c == '"') {
                inString = false;
            }
            continue;
        }
        if (c == '"') {
            inString = true;
        } else if (c == '[' || c == '{') {
            if (++depth > limit) {
                return false;
            }
        } else if (c == ']' || c == '}') {
            --depth;  // unbalanced text is the parser's to reject
        }
    }
    return true;
}

int HexValue(unsigned char c)
{
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    if (c >= 'A' && c <= 'F') {
        return c - 'A' + 10;
    }
    return -1;
}

bool IsUnreserved(unsigned char c)
{
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
           c == '.' || c == '_' || c == '~';
}

// The JSON reader of the calling thread, made on its first parse and kept:
// building the settings and a new reader for every parse cost more than
// parsing the small texts of a call. A reader keeps no state from one parse
// to the next (each parse starts afresh, also after one that threw).
Json::CharReader& ThreadJsonReader()
{
    thread_local const std::unique_ptr<Json::CharReader> reader = [] {
        Json::CharReaderBuilder builder;
        builder["allowComments"] = false;
        builder["allowTrailingCommas"] = false;
        builder["allowDroppedNullPlaceholders"] = false;
        builder["allowNumericKeys"] = false;
        builder["allowSingleQuotes"] = false;
        builder["allowSpecialFloats"] = false;
        builder["collectComments"] = false;
        builder["failIfExtra"] = true;
        builder["rejectDupKeys"] = true;
        builder["skipBom"] = false;
        builder["strictRoot"] = false;
        builder["stackLimit"] = kMaxJsonDepth + 1;
        return std::unique_ptr<Json::CharReader>(builder.newCharReader());
    }();
    return *reader;
}

}  // namespace

bool ParseJson(const std::string& text, Json::Value& out)
{
    try {
        if (!DepthWithin(text, kMaxJsonDepth)) {
            return false;
        }
        Json::Value parsed;
        std::string errors;
        const char* begin = text.data();
        if (!ThreadJsonReader().parse(begin, begin + text.size(), &parsed, &errors)) {
            return false;
        }
        out.swap(parsed);
        return true;
    } catch (...) {
        // JsonCpp reports the stack limit (and some malformed input) by
        // throwing; none of it may leave this function.
        return false;
    }
}

bool ReadJsonFile(const std::string& path, Json::Value& out)
{
    std::string text;
    int err = 0;
    if (!System::ReadFileBounded(path, kMaxJsonFile, text, err)) {
        if (err == EFBIG) {
            VELA_LOG_ERR("%s is larger than %zu bytes", path.c_str(), kMaxJsonFile);
        } else if (err != ENOENT) {
            VELA_LOG_ERR("cannot read %s: %s", path.c_str(), strerror(err));
        }
        return false;
    }
    if (!ParseJson(text, out)) {
        VELA_LOG_ERR("%s is not valid JSON", path.c_str());
        return false;
    }
    return true;
}

bool WriteJsonFileAtomic(const std::string& path, const Json::Value& value, unsigned mode)
{
    return System::WriteJsonAtomic(path, value, static_cast<mode_t>(mode & 07777), true);
}

bool strPairToJsonObj(const std::string& text, Json::Value& out, bool urlDecode, bool overwrite)
{
    if (out.isNull()) {
        out = Json::Value(Json::objectValue);
    } else if (!out.isObject()) {
        return false;
    }
    try {
        // Each byte is looked at a bounded number of times: the "=" of a
        // pair is searched for only inside that pair, never in the rest of
        // the text, so the whole parse is linear in the length of `text`.
        const char* const base = text.data();
        size_t start = 0;
        while (start <= text.size()) {
            size_t end = text.find('&', start);
            if (end == std::string::npos) {
                end = text.size();
            }
            const void* hit = memchr(base + start, '=', end - start);
            std::string name;
            std::string value;
            if (hit == nullptr) {
                name = text.substr(start, end - start);
            } else {
                const size_t eq = static_cast<size_t>(static_cast<const char*>(hit) - base);
                name = text.substr(start, eq - start);
                value = text.substr(eq + 1, end - eq - 1);
            }
            if (urlDecode) {
                name = URLDecode(name, true);
                value = URLDecode(value, true);
            }
            if (!name.empty() && (overwrite || !out.isMember(name))) {
                out[name] = value;
            }
            start = end + 1;
        }
    } catch (...) {
        return false;  // out of memory; members set so far stay
    }
    return true;
}

Json::Value ParseToArray(const char* text, const char* separator)
{
    Json::Value result(Json::arrayValue);
    if (text == nullptr) {
        return result;
    }
    try {
        if (separator == nullptr || *separator == '\0') {
            result.append(text);
            return result;
        }
        // The text is measured once and searched with its length known, so
        // the split is linear whatever the text (strstr on each rest would
        // measure the rest again, and sanitizer builds do exactly that).
        const std::string_view all(text);
        const std::string_view sep(separator);
        size_t start = 0;
        for (;;) {
            const size_t hit = all.find(sep, start);
            if (hit == std::string_view::npos) {
                result.append(std::string(all.substr(start)));
                break;
            }
            result.append(std::string(all.substr(start, hit - start)));
            start = hit + sep.size();
            while (start < all.size() && (all[start] == ' ' || all[start] == '\t')) {
                ++start;
            }
        }
    } catch (...) {
        return Json::Value(Json::arrayValue);
    }
    return result;
}

std::string URLDecode(const std::string& text, bool plusAsSpace)
{
    std::string out;
    out.reserve(text.size());
    const size_t n = text.size();
    for (size_t i = 0; i < n; ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        if (c == '%' && n - i >= 3) {  // both digits inside the text
            const int hi = HexValue(static_cast<unsigned char>(text[i + 1]));
            const int lo = HexValue(static_cast<unsigned char>(text[i + 2]));
            if (hi >= 0 && lo >= 0) {
                out.push_back(static_cast<char>(hi * 16 + lo));
                i += 2;
                continue;
            }
        }
        if (c == '+' && plusAsSpace) {
            out.push_back(' ');
        } else {
            out.push_back(static_cast<char>(c));
        }
    }
    return out;
}

std::string URLEncode(const std::string& text)
{
    static const char kHex[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(text.size() * 3);
    for (char ch : text) {
        const unsigned char c = static_cast<unsigned char>(ch);
        if (IsUnreserved(c)) {
            out.push_back(ch);
        } else {
            out.push_back('%');
            out.push_back(kHex[c >> 4]);
            out.push_back(kHex[c & 0x0f]);
        }
    }
    return out;
}

Json::Value SzHashToJsonObj(PVLIBCSZHASH hash)
{
    Json::Value result(Json::objectValue);
    const int count = VLIBCSzHashCount(hash);
    try {
        for (int i = 0; i < count; ++i) {
            const char* key = VLIBCSzHashKeyAt(hash, i);
            const char* value = VLIBCSzHashValueAt(hash, i);
            if (key != nullptr && value != nullptr) {
                result[key] = value;
            }
        }
    } catch (...) {
        return Json::Value(Json::objectValue);
    }
    return result;
}

}  // namespace WebAPIUtil

bool System::WriteJsonAtomic(const std::string& path, const Json::Value& value, mode_t mode, bool durable)
{
    if (path.empty() || path.back() == '/') {
        VELA_LOG_ERR("invalid JSON file path \"%s\"", path.c_str());
        return false;
    }
    std::string text;
    try {
        Json::StreamWriterBuilder builder;
        builder["indentation"] = "";
        builder["emitUTF8"] = true;
        text = Json::writeString(builder, value);
        text.push_back('\n');
    } catch (...) {
        VELA_LOG_ERR("cannot serialize JSON for %s", path.c_str());
        return false;
    }
    const char* step = nullptr;
    if (!WriteFileAtomic(path, text.data(), text.size(), mode, static_cast<uid_t>(-1), static_cast<gid_t>(-1), step,
                         durable)) {
        VELA_LOG_ERR("cannot write %s (%s): %m", path.c_str(), step);
        return false;
    }
    return true;
}

}  // namespace VELA
