// velaapi: calls one web-API method on behalf of a user, through
// APIRunner::Exec, or lists the methods a user may call. The manual is
// kManual below (velaapi --help).
//
// The user is the account running velaapi; root may name any other. Exec
// itself checks no permission, so the tool judges the user first, with the
// rules the session check applies once a session is valid (APICatalog,
// access/): "authLevel", the user classes of "allowUser" and the API's
// application privilege. The list is the answer of VELA.Admin's "apis",
// called the same way. Every argument is treated as hostile: the user is
// checked and looked up before anything runs, the parameters are bounded.
#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <memory>
#include <sstream>
#include <string>
#include <unistd.h>
#include <utility>
#include <vector>

extern char** environ;

#include "access/APICatalog.h"
#include "vela/relay.h"
#include "vela/user.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace {

constexpr int kExitSuccess = 0;
constexpr int kExitFailure = 1;  // the call answered an error, or was refused (105)
constexpr int kExitUsage = 2;    // bad arguments or parameters
constexpr int kExitUser = 3;     // the user may not be acted for, or does not exist
constexpr size_t kMaxParams = 16 * 1024 * 1024;

const char kWebAPIDir[] = "/usr/vela/velaman/webapi";
// The method that lists what a user may call.
const char kListAPI[] = "VELA.Admin";
constexpr int kListVersion = 1;
const char kListMethod[] = "apis";

const char kManual[] =
    "NAME\n"
    "    velaapi - call a web-API method as a user, or list what a user may call\n"
    "\n"
    "SYNOPSIS\n"
    "    velaapi call API METHOD [key=value ... | JSON | -] [--version N] [--user NAME]\n"
    "                 [--peer NAME]\n"
    "    velaapi list [--user NAME]\n"
    "    velaapi --help\n"
    "\n"
    "DESCRIPTION\n"
    "    velaapi runs web-API methods without a web server, through the same\n"
    "    dispatcher as the CGI program, on behalf of a user: the handler sees\n"
    "    that user as the logged-in user, and a method that runs as its caller\n"
    "    (\"grantByUser\") runs as that user's account.\n"
    "\n"
    "    call   runs METHOD of API and prints the answer as JSON: indented when\n"
    "           standard output is a terminal, one line otherwise. Parameters\n"
    "           are key=value pairs, where a value that is valid JSON is taken as\n"
    "           that JSON (n=5, on=true, tags='[\"a\"]') and any other value as a\n"
    "           string (name=disk1); or one JSON object; or \"-\" to read that\n"
    "           object from standard input (at most 16 MiB). \"api\", \"method\" and\n"
    "           \"version\" are not parameters. A method the user's class may\n"
    "           not call (\"allowUser\", the API's application privilege) is\n"
    "           refused with error 105 without running.\n"
    "\n"
    "    list   prints, one per line, \"API VERSION METHOD\" for every method the\n"
    "           user may call, judged as call judges it: the answer of the\n"
    "           method \"apis\" of VELA.Admin, called as call calls it.\n"
    "\n"
    "    The call runs with a plain environment: only PATH, HOME, LANG,\n"
    "    LANGUAGE, LC_*, TZ, TERM, TMPDIR and VELA_* are kept, so no CGI\n"
    "    variable of the caller (REMOTE_ADDR, HTTP_COOKIE, CONTENT_TYPE, ...)\n"
    "    reaches the request. No client address is known: an application\n"
    "    privilege granted only from some addresses is not held.\n"
    "\n"
    "    The description files are read from the web-API directory,\n"
    "    <VELA_ROOT>/usr/vela/velaman/webapi. Methods that run as another\n"
    "    account (\"runAs\", by default the superuser) need velaapi to run as\n"
    "    root; otherwise they answer error 117.\n"
    "\n"
    "OPTIONS\n"
    "    --user NAME\n"
    "           Act for the account NAME. Only root may name an account other\n"
    "           than its own. Default: the account running velaapi.\n"
    "    --peer NAME\n"
    "           Relay the call to the peer appliance NAME of the peers file\n"
    "           (velaadm peer add; root only): the peer runs it as the user of\n"
    "           the access token it issued, and its answer is printed. The user\n"
    "           acted for here must hold the relay privilege VELA.Relay\n"
    "           (administrators do); else 105. A peer that cannot be reached or\n"
    "           answers no JSON gives error 109 with the reason. --version\n"
    "           defaults to 1.\n"
    "    --version N\n"
    "           The API version to call (call only). Default: the highest\n"
    "           version of the API that lists METHOD.\n"
    "    --     Ends the options: what follows are arguments.\n"
    "    -h, --help\n"
    "           Prints this text.\n"
    "\n"
    "EXIT STATUS\n"
    "    0  the answer is a success (list: the list was printed)\n"
    "    1  the answer is an error, or the user may not call the method (105)\n"
    "    2  usage error: unknown option, missing or malformed argument or\n"
    "       parameters, no web-API directory\n"
    "    3  the user cannot be acted for: not a valid or existing account, or\n"
    "       another account named by someone other than root\n"
    "\n"
    "EXAMPLES\n"
    "    velaapi call VELA.Sample echo text=hello n=5 tags='[\"a\",\"b\"]'\n"
    "    velaapi call VELA.Sample echo '{\"text\": \"hello\"}' --version 1\n"
    "    echo '{\"text\": \"hello\"}' | velaapi call VELA.Sample echo -\n"
    "    velaapi call VELA.Sample adminonly --user alice\n"
    "    velaapi list --user alice\n"
    "    VELA_ROOT=$PWD/build/root build/velaapi list\n";

// Text from the command line made fit for a message: printable ASCII kept,
// every other byte written as \xHH, cut to `max` bytes.
std::string Shown(const std::string& text, size_t max = 64)
{
    std::string out;
    for (size_t i = 0; i < text.size() && i < max; ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        if (c >= 0x20 && c < 0x7f && c != '\\') {
            out += static_cast<char>(c);
        } else {
            char hex[8];
            snprintf(hex, sizeof(hex), "\\x%02X", c);
            out += hex;
        }
    }
    if (text.size() > max) {
        out += "...";
    }
    return out;
}

// Keeps only the environment a local call needs: no CGI variable of the
// caller's shell (REMOTE_ADDR, HTTP_COOKIE, CONTENT_TYPE, QUERY_STRING...)
// may reach the request, whose environment is built from this process's.
void KeepPlainEnvironment()
{
    static const char* const kKept[] = {"PATH", "HOME", "LANG", "LANGUAGE", "TZ", "TERM", "TMPDIR"};
    std::vector<std::string> dropped;
    for (char** entry = environ; entry != nullptr && *entry != nullptr; ++entry) {
        const char* eq = strchr(*entry, '=');
        const std::string name(*entry, eq != nullptr ? static_cast<size_t>(eq - *entry) : strlen(*entry));
        bool keep = name.rfind("LC_", 0) == 0 || name.rfind("VELA_", 0) == 0;
        for (const char* kept : kKept) {
            keep = keep || name == kept;
        }
        if (!keep) {
            dropped.push_back(name);
        }
    }
    for (const std::string& name : dropped) {
        unsetenv(name.c_str());
    }
}

// A usage error: one line saying what is wrong, and where help is.
int Usage(const std::string& problem)
{
    fprintf(stderr, "velaapi: %s\nTry 'velaapi --help' for more information.\n", problem.c_str());
    return kExitUsage;
}

struct Options {
    std::string command;
    std::vector<std::string> args;
    bool help = false;
    bool versionGiven = false;
    int version = 0;
    bool userGiven = false;
    std::string user;
    bool peerGiven = false;
    std::string peer;
};

// False, with the message printed, for a usage error.
bool ParseOptions(int argc, char** argv, Options& o, int& status)
{
    bool optionsEnd = false;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        std::string value;
        const bool isOption = !optionsEnd && arg.size() > 1 && arg[0] == '-';
        if (isOption && arg == "--") {
            optionsEnd = true;
            continue;
        }
        if (isOption && (arg == "-h" || arg == "--help")) {
            o.help = true;
            continue;
        }
        if (isOption && (arg == "--user" || arg == "--version" || arg == "--peer" || arg.rfind("--user=", 0) == 0 ||
                         arg.rfind("--version=", 0) == 0 || arg.rfind("--peer=", 0) == 0)) {
            const size_t eq = arg.find('=');
            const std::string name = arg.substr(0, eq);
            if (eq != std::string::npos) {
                value = arg.substr(eq + 1);
            } else if (++i < argc) {
                value = argv[i];
            } else {
                status = Usage(name + " needs a value");
                return false;
            }
            if (name == "--peer") {
                if (o.peerGiven) {
                    status = Usage("--peer given twice");
                    return false;
                }
                o.peerGiven = true;
                o.peer = value;
            } else if (name == "--user") {
                if (o.userGiven) {
                    status = Usage("--user given twice");
                    return false;
                }
                o.userGiven = true;
                o.user = value;
            } else {
                long long n = 0;
                if (o.versionGiven || !VELA::System::ParseDecimal(value, 1, INT_MAX, n)) {
                    status = Usage("--version needs one whole number from 1, not \"" + Shown(value) + "\"");
                    return false;
                }
                o.versionGiven = true;
                o.version = static_cast<int>(n);
            }
            continue;
        }
        if (isOption && arg != "-") {
            status = Usage("unknown option " + Shown(arg));
            return false;
        }
        if (o.command.empty()) {
            o.command = arg;
        } else {
            o.args.push_back(arg);
        }
    }
    return true;
}

// The account to act for, by its own name: the one running velaapi, or the
// one named with --user (root only). 0, or an exit status with the message
// printed.
int ResolveUser(const Options& o, std::string& user)
{
    // Installed set-user-id, the account running it would not be the one
    // whose rights it has.
    if (getuid() != geteuid() || getgid() != getegid()) {
        fprintf(stderr, "velaapi: refusing to run set-user-id or set-group-id\n");
        return kExitUser;
    }
    PVELAUSER self = nullptr;
    if (VELAUserGetByUID(getuid(), &self) != 0) {
        fprintf(stderr, "velaapi: the account of uid %u is unknown\n", static_cast<unsigned>(getuid()));
        return kExitUser;
    }
    const std::string own = self->szName;
    VELAUserFree(self);
    if (!o.userGiven) {
        user = own;
        return 0;
    }
    if (getuid() != 0 && o.user != own) {
        fprintf(stderr, "velaapi: only root may act for another user (you are %s)\n", Shown(own).c_str());
        return kExitUser;
    }
    if (!VELAUserNameIsValid(o.user.c_str())) {
        fprintf(stderr, "velaapi: \"%s\" is not a valid user name\n", Shown(o.user).c_str());
        return kExitUser;
    }
    PVELAUSER named = nullptr;
    if (VELAUserGetByName(o.user.c_str(), &named) != 0) {
        fprintf(stderr, "velaapi: no such user \"%s\"\n", Shown(o.user).c_str());
        return kExitUser;
    }
    user = named->szName;
    VELAUserFree(named);
    if (!VELAUserNameIsValid(user.c_str())) {
        fprintf(stderr, "velaapi: the account \"%s\" has a name that cannot be used\n", Shown(user).c_str());
        return kExitUser;
    }
    return 0;
}

// Standard input, at most kMaxParams bytes. False on a read error or a
// longer input.
bool ReadStdin(std::string& out)
{
    char buf[65536];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), stdin)) > 0) {
        if (out.size() + n > kMaxParams) {
            errno = EFBIG;
            return false;
        }
        out.append(buf, n);
    }
    return !ferror(stdin);
}

// The parameters of a call from its arguments. False, with the message
// printed, when they are malformed.
bool ParseParams(const std::vector<std::string>& args, size_t from, Json::Value& params)
{
    params = Json::Value(Json::objectValue);
    if (args.size() == from) {
        return true;
    }
    const std::string& first = args[from];
    const size_t start = first.find_first_not_of(" \t\n");
    if (first == "-" || (start != std::string::npos && first[start] == '{')) {
        if (args.size() > from + 1) {
            Usage("a JSON object is the only parameter argument");
            return false;
        }
        std::string text = first;
        if (first == "-") {
            text.clear();
            if (!ReadStdin(text)) {
                fprintf(stderr, "velaapi: cannot read the parameters: %s\n", strerror(errno));
                return false;
            }
        }
        if (!VELA::JsonParse(text, params) || !params.isObject()) {
            fprintf(stderr, "velaapi: the parameters are not a JSON object\n");
            return false;
        }
    } else {
        size_t total = 0;
        for (size_t i = from; i < args.size(); ++i) {
            const std::string& arg = args[i];
            total += arg.size();
            const size_t eq = arg.find('=');
            if (eq == std::string::npos || eq == 0) {
                Usage("parameters are key=value, not \"" + Shown(arg) + "\"");
                return false;
            }
            const std::string key = arg.substr(0, eq);
            const std::string text = arg.substr(eq + 1);
            Json::Value value;
            if (!VELA::JsonParse(text, value)) {
                value = text;
            }
            params[key] = value;
        }
        if (total > kMaxParams) {
            fprintf(stderr, "velaapi: the parameters are larger than 16 MiB\n");
            return false;
        }
    }
    for (const char* reserved : {"api", "method", "version"}) {
        if (params.isMember(reserved)) {
            Usage(std::string("\"") + reserved + "\" is given as an argument, not as a parameter");
            return false;
        }
    }
    return true;
}

void PrintAnswer(const Json::Value& answer)
{
    // JsonToString's text is valid UTF-8 whatever the handler answered; the
    // indented form is made from it.
    std::string text = VELA::JsonToString(answer);
    Json::Value clean;
    if (isatty(STDOUT_FILENO) && VELA::JsonParse(text, clean)) {
        Json::StreamWriterBuilder builder;
        builder["indentation"] = "  ";
        builder["emitUTF8"] = true;
        builder["enableYAMLCompatibility"] = true;  // "key": value
        text = Json::writeString(builder, clean);
    }
    text += "\n";
    fwrite(text.data(), 1, text.size(), stdout);
    fflush(stdout);
}

// The call relayed to a peer (--peer): the local user needs the relay
// privilege; the peer judges the rest.
int CallPeer(const Options& o, const std::string& user, const Json::Value& params)
{
    const std::string& api = o.args[0];
    const std::string& method = o.args[1];
    const int version = o.versionGiven ? o.version : 1;
    Json::Value answer(Json::objectValue);
    if (VLIBAppPrivUserHas(user.c_str(), VELA::kRelayPrivilege, nullptr) != 1) {
        fprintf(stderr, "velaapi: %s may not relay calls (privilege %s)\n", Shown(user).c_str(),
                VELA::kRelayPrivilege);
        answer["success"] = false;
        answer["error"]["code"] = 105;
        PrintAnswer(answer);
        return kExitFailure;
    }
    VELA::CredRequestMgr mgr;
    if (!mgr.AddWebAPIRequest(o.peer, api, version, method, params) || !mgr.Run()) {
        fprintf(stderr, "velaapi: relay to %s failed[%d]: %s\n", Shown(o.peer).c_str(), mgr.GetError(),
                mgr.GetErrorText().c_str());
        answer["success"] = false;
        answer["error"]["code"] = 109;
        answer["error"]["errors"]["reason"] = mgr.GetErrorText();
        PrintAnswer(answer);
        return kExitFailure;
    }
    PrintAnswer(mgr.GetResponse());
    return mgr.GetResponse()["success"] == Json::Value(true) ? kExitSuccess : kExitFailure;
}

int Call(const Options& o, const std::string& user)
{
    if (o.args.size() < 2) {
        return Usage("call needs an API and a method");
    }
    const std::string& api = o.args[0];
    const std::string& method = o.args[1];
    Json::Value params;
    if (!ParseParams(o.args, 2, params)) {
        return kExitUsage;
    }
    if (o.peerGiven) {
        return CallPeer(o, user, params);
    }
    VELA::APICatalog catalog;
    int version = o.version;
    Json::Value desc;
    const bool described = catalog.Describe(api, desc);
    if (!o.versionGiven) {
        version = desc["maxVersion"].isInt() ? desc["maxVersion"].asInt() : 1;
        for (const auto& entry : VELA::APICatalog::Versions(desc)) {
            if (std::find(entry.second.begin(), entry.second.end(), method) != entry.second.end()) {
                version = entry.first;
            }
        }
    }
    // An API that is not described is refused by the call itself (102).
    if (described && !catalog.MayCall(api, version, method, user)) {
        fprintf(stderr, "velaapi: %s may not call %s %d %s\n", Shown(user).c_str(), Shown(api).c_str(), version,
                Shown(method).c_str());
        Json::Value refused(Json::objectValue);
        refused["success"] = false;
        refused["error"]["code"] = 105;
        PrintAnswer(refused);
        return kExitFailure;
    }
    Json::Value answer;
    catalog.Exec(answer, api.c_str(), version, method.c_str(), params, user.c_str());
    PrintAnswer(answer);
    return answer.isObject() && answer["success"] == Json::Value(true) ? kExitSuccess : kExitFailure;
}

int List(const Options& o, const std::string& user)
{
    if (!o.args.empty()) {
        return Usage("list takes no arguments");
    }
    if (o.versionGiven || o.peerGiven) {
        return Usage("--version and --peer are options of call");
    }
    // The administrators' API answers the list, judged and run as a call.
    VELA::APICatalog catalog;
    if (!catalog.MayCall(kListAPI, kListVersion, kListMethod, user)) {
        fprintf(stderr, "velaapi: %s may not call %s %d %s\n", Shown(user).c_str(), kListAPI, kListVersion,
                kListMethod);
        return kExitFailure;
    }
    Json::Value answer;
    catalog.Exec(answer, kListAPI, kListVersion, kListMethod, Json::Value(Json::objectValue), user.c_str());
    const Json::Value& apis = answer["data"]["apis"];
    if (!answer.isObject() || answer["success"] != Json::Value(true) || !apis.isArray()) {
        fprintf(stderr, "velaapi: %s %d %s gave no list\n", kListAPI, kListVersion, kListMethod);
        PrintAnswer(answer);
        return kExitFailure;
    }
    std::string out;
    for (const Json::Value& api : apis) {
        const Json::Value& methods = api["methods"];
        if (!api["api"].isString() || !methods.isObject()) {
            continue;
        }
        std::vector<std::pair<long long, std::string>> versions;
        for (const std::string& key : methods.getMemberNames()) {
            long long version = 0;
            if (VELA::System::ParseDecimal(key, 1, INT_MAX, version)) {
                versions.emplace_back(version, key);
            }
        }
        std::sort(versions.begin(), versions.end());
        for (const auto& version : versions) {
            for (const Json::Value& method : methods[version.second]) {
                if (method.isString()) {
                    out += Shown(api["api"].asString()) + " " + version.second + " " + Shown(method.asString()) + "\n";
                }
            }
        }
    }
    fwrite(out.data(), 1, out.size(), stdout);
    return fflush(stdout) == 0 ? kExitSuccess : kExitFailure;
}

}  // namespace

int main(int argc, char** argv)
{
    Options o;
    int status = kExitUsage;
    if (!ParseOptions(argc, argv, o, status)) {
        return status;
    }
    if (o.help) {
        fputs(kManual, stdout);
        return kExitSuccess;
    }
    if (o.command != "call" && o.command != "list") {
        return Usage(o.command.empty() ? "no command" : "unknown command " + Shown(o.command));
    }
    KeepPlainEnvironment();
    std::string user;
    status = ResolveUser(o, user);
    if (status != 0) {
        return status;
    }
    const std::string dir = VELA::System::Path(kWebAPIDir);
    if (chdir(dir.c_str()) != 0) {
        fprintf(stderr, "velaapi: cannot enter %s: %s\n", Shown(dir, PATH_MAX).c_str(), strerror(errno));
        return kExitUsage;
    }
    return o.command == "call" ? Call(o, user) : List(o, user);
}
