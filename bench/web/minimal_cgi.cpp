// The smallest honest CGI answer the echo API can be compared with: one
// C++ process linked with JsonCpp and nothing else, which decodes
// QUERY_STRING, puts every parameter into {"success": true, "data": {...}}
// and writes the same header block velascgi writes. The difference between
// the two is the cost of the framework: description files, the handler
// library, the session check and the platform library.
//
// Query string: pairs joined by "&", "name=value", percent-encoded with "+"
// as space (HTML form encoding, RFC 3986 section 2.1). The text is bounded;
// a longer one is answered with an error.
#include <json/json.h>

#include <cstdlib>
#include <cstring>
#include <iostream>
#include <string>

namespace {

constexpr size_t kMaxQuery = 64 * 1024;
constexpr size_t kMaxParams = 256;

int HexDigit(char c)
{
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

// "%hh" becomes the byte, "+" a space; a "%" without two hex digits stays.
std::string Decode(const char* begin, const char* end)
{
    std::string out;
    out.reserve(end - begin);
    for (const char* p = begin; p < end; ++p) {
        if (*p == '+') {
            out += ' ';
        } else if (*p == '%' && end - p > 2 && HexDigit(p[1]) >= 0 && HexDigit(p[2]) >= 0) {
            out += static_cast<char>(HexDigit(p[1]) * 16 + HexDigit(p[2]));
            p += 2;
        } else {
            out += *p;
        }
    }
    return out;
}

// Fills `out` with the decoded pairs of `query`; false when there are too many.
bool ParseQuery(const char* query, Json::Value& out)
{
    size_t count = 0;
    const char* p = query;
    while (*p) {
        const char* end = std::strchr(p, '&');
        if (!end) end = p + std::strlen(p);
        const char* eq = static_cast<const char*>(std::memchr(p, '=', end - p));
        const char* nameEnd = eq ? eq : end;
        if (nameEnd > p) {
            if (++count > kMaxParams) return false;
            out[Decode(p, nameEnd)] = eq ? Decode(eq + 1, end) : std::string();
        }
        p = *end ? end + 1 : end;
    }
    return true;
}

}  // namespace

int main()
{
    const char* query = std::getenv("QUERY_STRING");
    if (!query) query = "";

    Json::Value data(Json::objectValue);
    Json::Value body(Json::objectValue);
    if (std::strlen(query) <= kMaxQuery && ParseQuery(query, data)) {
        body["success"] = true;
        body["data"] = data;
    } else {
        body["success"] = false;
        body["error"]["code"] = 101;
    }

    std::cout << "Content-type: application/json; charset=\"UTF-8\"\r\n"
                 "X-Content-Type-Options: nosniff\r\n"
                 "X-XSS-Protection: 1; mode=block\r\n"
                 "Cache-Control: max-age=0, no-cache, no-store, must-revalidate\r\n"
                 "Pragma: no-cache\r\n"
                 "Expires: 0\r\n"
                 "\r\n";
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "";
    writer["emitUTF8"] = true;
    std::cout << Json::writeString(writer, body);
    std::cout.flush();
    return 0;
}
