// velarun: runs one request JSON through the dispatcher, as a parent process
// would, and prints the answer on one line.
//
//   velarun [-C DIR] [FILE | -]
//   velarun --help
//
// The request JSON (members "getParam", "postParam", "environ", "session",
// "attr") is read from FILE, or from standard input when FILE is "-" or
// absent. The working directory becomes the web-API directory,
// <root>/usr/vela/velaman/webapi (VELA_ROOT), or DIR. lib.def is always read
// from the root.
//
// Exit status: 0 the answer says success, 1 it does not, 2 a usage error or
// unreadable input.
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <unistd.h>

#include "vela/vlibc.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace {

constexpr size_t kMaxRequest = 16 * 1024 * 1024;
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

const char kUsage[] =
    "usage: velarun [-C DIR] [FILE | -]\n"
    "       velarun --help\n"
    "  Runs the request JSON in FILE (standard input for \"-\" or no FILE)\n"
    "  in the web-API directory and prints the answer as one line of JSON.\n"
    "\n"
    "  -C DIR, --dir DIR  the web-API directory (default\n"
    "                     <VELA_ROOT>/usr/vela/velaman/webapi)\n"
    "  -h, --help         prints this text\n"
    "\n"
    "  Exit status: 0 the answer is a success, 1 it is an error, 2 a usage\n"
    "  error or unreadable input.\n";

// A usage error: one line saying what is wrong, and where help is.
int Usage(const char* problem)
{
    fprintf(stderr, "velarun: %s\nTry 'velarun --help' for more information.\n", problem);
    return kExitUsage;
}

// The whole stream, at most kMaxRequest bytes. False on a read error or a
// longer input.
bool ReadAll(FILE* in, std::string& out)
{
    char buf[65536];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), in)) > 0) {
        if (out.size() + n > kMaxRequest) {
            errno = EFBIG;
            return false;
        }
        out.append(buf, n);
    }
    return !ferror(in);
}

// The request JSON of `file` (standard input for null or "-"). False, with
// the reason printed, when it cannot be read or is not JSON.
bool ReadRequest(const char* file, Json::Value& request)
{
    std::string text;
    FILE* in = (!file || strcmp(file, "-") == 0) ? stdin : fopen(file, "rb");
    if (!in) {
        fprintf(stderr, "velarun: cannot open %s: %s\n", file, strerror(errno));
        return false;
    }
    const bool read = ReadAll(in, text);
    const int readErr = errno;
    if (in != stdin) {
        fclose(in);
    }
    if (!read) {
        fprintf(stderr, "velarun: cannot read the request: %s\n", strerror(readErr));
        return false;
    }
    if (!VELA::JsonParse(text, request)) {
        fprintf(stderr, "velarun: the request is not valid JSON\n");
        return false;
    }
    return true;
}

}  // namespace

int main(int argc, char** argv)
{
    std::string dir;
    const char* file = nullptr;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "-C" || arg == "--dir") {
            if (++i >= argc) {
                return Usage((arg + " needs a directory").c_str());
            }
            dir = argv[i];
        } else if (arg == "-h" || arg == "--help") {
            fputs(kUsage, stdout);
            return 0;
        } else if (arg.size() > 1 && arg[0] == '-') {
            return Usage(("unknown option " + arg).c_str());
        } else if (file) {
            return Usage("one request file at most");
        } else {
            file = argv[i];
        }
    }
    Json::Value request;
    if (!ReadRequest(file, request)) {
        return kExitUsage;
    }
    if (dir.empty()) {
        dir = VELA::System::Path("/usr/vela/velaman/webapi");
    }
    if (chdir(dir.c_str()) != 0) {
        fprintf(stderr, "velarun: cannot enter %s: %s\n", dir.c_str(), strerror(errno));
        return kExitUsage;
    }

    VELA::APIRunner runner;
    runner.Run(request);
    const Json::Value answer = runner.GetResponse();
    const std::string line = VELA::JsonToString(answer) + "\n";
    fwrite(line.data(), 1, line.size(), stdout);
    fflush(stdout);
    runner.HandleCallback(runner.GetResponseObject());
    return answer.isObject() && answer["success"] == Json::Value(true) ? 0 : kExitFailure;
}
