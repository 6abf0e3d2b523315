// The baseline of velarun's echo: the least a C++ program linked with
// JsonCpp must do to give the same answer. It reads the request JSON (a
// file, or standard input), merges "getParam" and "postParam" (the body
// wins) and prints {"data": <parameters>, "httpd_restart": false,
// "success": true} on one line, byte for byte what velarun prints for the
// sample's echo. The difference between the two is the framework's cost.
#include <json/json.h>

#include <cstdio>
#include <cstring>
#include <memory>
#include <string>

namespace {

constexpr size_t kMaxRequest = 16 * 1024 * 1024;

bool ReadAll(FILE* in, std::string& out)
{
    char buf[65536];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), in)) > 0) {
        if (out.size() + n > kMaxRequest) {
            return false;
        }
        out.append(buf, n);
    }
    return !ferror(in);
}

}  // namespace

int main(int argc, char** argv)
{
    const char* file = argc > 1 ? argv[1] : "-";
    FILE* in = strcmp(file, "-") == 0 ? stdin : fopen(file, "rb");
    std::string text;
    if (!in || !ReadAll(in, text)) {
        fprintf(stderr, "minimal_echo: cannot read %s\n", file);
        return 2;
    }
    if (in != stdin) {
        fclose(in);
    }

    Json::CharReaderBuilder reader;
    reader["collectComments"] = false;
    std::unique_ptr<Json::CharReader> parser(reader.newCharReader());
    Json::Value request;
    if (!parser->parse(text.data(), text.data() + text.size(), &request, nullptr) || !request.isObject()) {
        fprintf(stderr, "minimal_echo: the request is not a JSON object\n");
        return 2;
    }
    Json::Value params(Json::objectValue);
    for (const char* part : {"getParam", "postParam"}) {
        const Json::Value& given = request[part];
        if (given.isObject()) {
            for (const auto& name : given.getMemberNames()) {
                params[name] = given[name];
            }
        }
    }
    Json::Value body(Json::objectValue);
    body["success"] = true;
    body["data"] = params;
    body["httpd_restart"] = false;

    Json::StreamWriterBuilder writer;
    writer["indentation"] = "";
    writer["emitUTF8"] = true;
    const std::string line = Json::writeString(writer, body) + "\n";
    fwrite(line.data(), 1, line.size(), stdout);
    return 0;
}
