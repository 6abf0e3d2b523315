// velaadm: administration of login sessions, access tokens, background
// tasks, sharing links and relay peers, and the server's public key. Works
// on the state under VELA_ROOT ("/" by default).
//
// Exit status: 0 success, 1 the operation failed, 2 a usage error.
#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <json/json.h>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "vela/vlibc.h"
#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/relay.h"
#include "vela/session.h"
#include "vela/sharing.h"
#include "vela/task.h"
#include "vela/token.h"
#include "vela/user.h"

namespace {

const char kUsage[] =
    "usage: velaadm <command> [arguments]\n"
    "       velaadm --help\n"
    "\n"
    "  session create <user> [--ip ADDRESS] [--timeout SECONDS] [--lifetime SECONDS]\n"
    "                 [--token] [--skip-ip] [--lang CODE]\n"
    "        Creates a login session and prints its id and anti-forgery token.\n"
    "        --ip binds it to a client address (without it no address is checked);\n"
    "        --timeout is the idle timeout (default 900), --lifetime the absolute\n"
    "        lifetime (default 86400); --token requires the anti-forgery token on\n"
    "        every request; --lang is a three-letter UI language (\"enu\").\n"
    "  session list\n"
    "  session revoke <sid>\n"
    "  token create <user> --api PATTERN [--api PATTERN...] --method PATTERN\n"
    "               [--method PATTERN...] [--expires SECONDS]\n"
    "        Creates an access token and prints it once, with its id. A pattern\n"
    "        is a name or a prefix ending in \"*\". --expires: lifetime in seconds\n"
    "        (default 2592000, 30 days).\n"
    "  token list\n"
    "  token revoke <id>\n"
    "  task list [--owner OWNER]\n"
    "        One line per background task: its id OWNER/ID, state (running,\n"
    "        finished, or lost when its worker ended without finishing it),\n"
    "        creation time, API and method, progress.\n"
    "  task show <OWNER/ID>\n"
    "        Prints the task's whole record (JSON).\n"
    "  task stop <OWNER/ID> [--remove]\n"
    "        Sends SIGTERM to the task's worker when it still runs and marks the\n"
    "        task finished; --remove deletes its record instead.\n"
    "  link create --owner USER --project NAME --path PATH [--expires SECONDS]\n"
    "              [--password-file FILE | --password-stdin] [--uses N] [--match-ip]\n"
    "        Creates a sharing link to the file or folder PATH (absolute, under\n"
    "        VELA_ROOT) for visitors without an account, and prints its id and the\n"
    "        path of its sharing URL. --expires: lifetime in seconds (default:\n"
    "        none); the password is read from FILE or standard input (its first\n"
    "        line), never from the command line; --uses limits the visitor\n"
    "        sessions it may open; --match-ip keeps a visitor to the address that\n"
    "        opened the session.\n"
    "  link list [--owner USER]\n"
    "  link show <id>\n"
    "        Prints the link's record (JSON), without the password's hash.\n"
    "  link revoke <id>\n"
    "        Ends the link and every visitor session of it.\n"
    "  peer add <name> --url URL (--token-file FILE | --token-stdin)\n"
    "           [--ca-file PATH] [--pin sha256//BASE64] [--replace]\n"
    "        Names a peer appliance that calls may be relayed to (parameter\n"
    "        relay_ds). URL is https://host[:port], or http:// to a loopback\n"
    "        address; the token is an access token the peer issued, read from\n"
    "        FILE or standard input (its first line), never from the command\n"
    "        line. --ca-file: the authority that signed the peer's certificate\n"
    "        (default: the system's); --pin: the peer's public key hash.\n"
    "  peer list\n"
    "        One line per peer: name, URL, TLS check (never the token).\n"
    "  peer test <name> [--api API --method METHOD] [--version N] [--timeout SECONDS]\n"
    "        Calls API/METHOD (default VELA.Entry.Request request) on the peer\n"
    "        with its token and prints the peer's answer; exit status 0 when the\n"
    "        peer answered with JSON of the web API, whatever its code.\n"
    "  peer remove <name>\n"
    "  pubkey\n"
    "        Prints the server's public key for encrypted parameters (PEM).\n"
    "\n"
    "  -h, --help\n"
    "        Prints this text (--help also after a command).\n"
    "\n"
    "The state lives under VELA_ROOT when it is set. Exit status: 0 success,\n"
    "1 the operation failed, 2 a usage error.\n";

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

// Platform log lines go to syslog as usual and, so that the administrator
// sees why a command failed, warnings and errors to standard error as well.
void LogSink(int priority, const char* line, void*)
{
    syslog(priority, "%s", line);
    if (LOG_PRI(priority) > LOG_WARNING) {
        return;
    }
    // The terminal gets the message without the "Source:line " prefix.
    const char* text = line;
    const char* colon = strchr(line, ':');
    const char* space = strchr(line, ' ');
    if (colon != nullptr && space != nullptr && colon < space && colon[1] >= '0' && colon[1] <= '9') {
        text = space + 1;
    }
    fprintf(stderr, "velaadm: %s\n", text);
}

// A usage error: one line saying what is wrong, and where help is.
int Usage(const char* problem)
{
    fprintf(stderr, "velaadm: %s\nTry 'velaadm --help' for more information.\n", problem);
    return kExitUsage;
}

int Fail(const std::string& message)
{
    fprintf(stderr, "velaadm: %s\n", message.c_str());
    return kExitFailure;
}

// A decimal number of seconds from 1 to `max`. False for anything else
// (signs, blanks, trailing text, overflow).
bool ParseSeconds(const char* text, long long max, long long& out)
{
    return text != nullptr && VELA::System::ParseDecimal(text, strlen(text), 1, max, out);
}

std::string FormatTime(long long t)
{
    const time_t tt = static_cast<time_t>(t);
    struct tm tm;
    char buf[32];
    if (gmtime_r(&tt, &tm) == nullptr || strftime(buf, sizeof(buf), "%Y-%m-%dT%H:%M:%SZ", &tm) == 0) {
        return std::to_string(t);
    }
    return buf;
}

std::string Join(const std::vector<std::string>& items)
{
    std::string out;
    for (const std::string& item : items) {
        if (!out.empty()) {
            out += ",";
        }
        out += item;
    }
    return out;
}

// Arguments after the subcommand: positionals and "--name [value]" options.
struct Args {
    std::vector<std::string> positional;
    std::vector<std::pair<std::string, std::string>> options;
};

// `withValue` lists the options that take a value, `flags` those that do not.
// False (with `problem` set) for an unknown option or a missing value.
bool SplitArgs(int argc, char** argv, int first, const std::vector<std::string>& withValue,
               const std::vector<std::string>& flags, Args& out, std::string& problem)
{
    for (int i = first; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg.size() < 3 || arg.compare(0, 2, "--") != 0) {
            out.positional.push_back(arg);
            continue;
        }
        bool known = false;
        for (const std::string& name : withValue) {
            if (arg == name) {
                if (i + 1 >= argc) {
                    problem = arg + " needs a value";
                    return false;
                }
                out.options.emplace_back(arg, argv[++i]);
                known = true;
                break;
            }
        }
        for (const std::string& name : flags) {
            if (!known && arg == name) {
                out.options.emplace_back(arg, "");
                known = true;
            }
        }
        if (!known) {
            problem = "unknown option " + arg;
            return false;
        }
    }
    return true;
}

int SessionCreate(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--ip", "--timeout", "--lifetime", "--lang"}, {"--token", "--skip-ip"}, args,
                   problem)) {
        return Usage(problem.c_str());
    }
    if (args.positional.size() != 1) {
        return Usage("session create needs exactly one user name");
    }
    const std::string& user = args.positional[0];
    std::string ip;
    VELA::Session::Options options;
    for (const auto& opt : args.options) {
        long long seconds = 0;
        if (opt.first == "--ip") {
            ip = opt.second;
        } else if (opt.first == "--timeout") {
            if (!ParseSeconds(opt.second.c_str(), VELA_SESSION_IDLE_MAX, seconds)) {
                return Usage(("--timeout must be 1 to " + std::to_string(VELA_SESSION_IDLE_MAX) + " seconds").c_str());
            }
            options.idleTimeout = static_cast<int>(seconds);
        } else if (opt.first == "--lifetime") {
            if (!ParseSeconds(opt.second.c_str(), VELA_SESSION_LIFETIME_MAX, seconds)) {
                return Usage(
                    ("--lifetime must be 1 to " + std::to_string(VELA_SESSION_LIFETIME_MAX) + " seconds").c_str());
            }
            options.lifetime = static_cast<int>(seconds);
        } else if (opt.first == "--lang") {
            options.lang = opt.second;
        } else if (opt.first == "--token") {
            options.tokenProtect = true;
        } else if (opt.first == "--skip-ip") {
            options.skipIP = true;
        }
    }
    std::string sid;
    std::string token;
    if (VELA::Session::Create(user.c_str(), ip.c_str(), &options, sid, token) != 0) {
        return Fail("cannot create a session for \"" + user + "\"");
    }
    printf("sid=%s\ntoken=%s\n", sid.c_str(), token.c_str());
    return 0;
}

int SessionList(int argc, char** argv)
{
    if (argc != 3) {
        return Usage("session list takes no arguments");
    }
    std::vector<VELA::Session::Record> sessions;
    if (VELA::Session::List(sessions) != 0) {
        return Fail("cannot list the sessions");
    }
    printf("%-32s  %-16s  %-15s  %-20s  %-20s  %7s  %8s  %s\n", "SID", "USER", "ADDRESS", "CREATED", "LAST USE",
           "IDLE", "LIFETIME", "FLAGS");
    for (const VELA::Session::Record& s : sessions) {
        std::string flags;
        flags += s.skipIP ? "skip-ip " : "";
        flags += s.tokenProtect ? "token " : "";
        flags += s.expired ? "expired" : "active";
        printf("%-32s  %-16s  %-15s  %-20s  %-20s  %7d  %8d  %s\n", s.sid.c_str(), s.user.c_str(),
               s.clientIP.empty() ? "-" : s.clientIP.c_str(), FormatTime(s.created).c_str(),
               FormatTime(s.lastUse).c_str(), s.idleTimeout, s.lifetime, flags.c_str());
    }
    return 0;
}

int SessionRevoke(int argc, char** argv)
{
    if (argc != 4) {
        return Usage("session revoke needs exactly one session id");
    }
    const int rc = VELA::Session::Remove(argv[3]);
    if (rc == -2) {
        return Fail("no session with that id");
    }
    if (rc != 0) {
        return Fail("cannot remove the session");
    }
    printf("session revoked\n");
    return 0;
}

int TokenCreate(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--api", "--method", "--expires"}, {}, args, problem)) {
        return Usage(problem.c_str());
    }
    if (args.positional.size() != 1) {
        return Usage("token create needs exactly one user name");
    }
    const std::string& user = args.positional[0];
    std::vector<std::string> apis;
    std::vector<std::string> methods;
    long long lifetime = 0;
    for (const auto& opt : args.options) {
        std::vector<std::string>& list = opt.first == "--api" ? apis : methods;
        if (opt.first == "--expires") {
            if (!ParseSeconds(opt.second.c_str(), VELA_TOKEN_LIFETIME_MAX, lifetime)) {
                return Usage(
                    ("--expires must be 1 to " + std::to_string(VELA_TOKEN_LIFETIME_MAX) + " seconds").c_str());
            }
            continue;
        }
        if (!VelaAccessTokenIsPattern(opt.second)) {
            return Usage(("invalid pattern \"" + opt.second + "\" for " + opt.first +
                          ": a name of letters, digits, '.', '_', '-', optionally ending in '*'")
                             .c_str());
        }
        list.push_back(opt.second);
    }
    if (apis.empty() || methods.empty()) {
        return Usage("token create needs at least one --api and one --method");
    }
    if (apis.size() > VELA_TOKEN_MAX_PATTERNS || methods.size() > VELA_TOKEN_MAX_PATTERNS) {
        return Usage(("at most " + std::to_string(VELA_TOKEN_MAX_PATTERNS) + " patterns of each kind").c_str());
    }
    std::string token;
    std::string id;
    if (VelaAccessTokenCreate(user.c_str(), apis, methods, lifetime, token, id) != 0) {
        return Fail("cannot create an access token for \"" + user + "\"");
    }
    printf("id=%s\ntoken=%s\n", id.c_str(), token.c_str());
    return 0;
}

int TokenList(int argc, char** argv)
{
    if (argc != 3) {
        return Usage("token list takes no arguments");
    }
    std::vector<VelaAccessTokenRecord> tokens;
    if (VelaAccessTokenList(tokens) != 0) {
        return Fail("cannot list the access tokens");
    }
    printf("%-22s  %-16s  %-20s  %-20s  %-7s  %s\n", "ID", "USER", "CREATED", "EXPIRES", "STATE", "APIS / METHODS");
    for (const VelaAccessTokenRecord& t : tokens) {
        printf("%-22s  %-16s  %-20s  %-20s  %-7s  %s / %s\n", t.id.c_str(), t.user.c_str(),
               FormatTime(t.created).c_str(), FormatTime(t.expires).c_str(), t.expired ? "expired" : "active",
               Join(t.apis).c_str(), Join(t.methods).c_str());
    }
    return 0;
}

int TokenRevoke(int argc, char** argv)
{
    if (argc != 4) {
        return Usage("token revoke needs exactly one token id");
    }
    const int rc = VelaAccessTokenRevoke(argv[3]);
    if (rc == -2) {
        return Fail("no access token with that id");
    }
    if (rc != 0) {
        return Fail("cannot revoke the access token");
    }
    printf("access token revoked\n");
    return 0;
}

// Text from a task record for one column: printable ASCII only (anything
// else shows as "?", so a record cannot drive the terminal), at most `max`
// bytes; "-" when it is not a string or empty.
std::string Column(const Json::Value& value, size_t max)
{
    if (!value.isString() || value.asString().empty()) {
        return "-";
    }
    std::string out = value.asString();
    if (out.size() > max) {
        out.resize(max - 3);
        out += "...";
    }
    for (char& c : out) {
        if (c < 0x20 || c > 0x7e) {
            c = '?';
        }
    }
    return out;
}

const char kBadTaskId[] =
    "invalid task id: OWNER/ID expected (OWNER a user name, @administrators or @users; ID letters, digits, "
    "'.', '_' and '-')";

// The task named by the one positional argument, read. Its exit status on
// failure (usage or missing task), 0 when `task` is loaded.
int OpenTask(const Args& args, const char* action, std::unique_ptr<TARN::Task>& task)
{
    if (args.positional.size() != 1) {
        return Usage((std::string("task ") + action + " needs exactly one task id").c_str());
    }
    std::string owner;
    std::string id;
    if (!TARN::TaskUtil::splitFullId(args.positional[0], owner, id)) {
        return Usage(kBadTaskId);
    }
    task.reset(new TARN::Task(owner, id));
    if (!task->reload()) {
        return TARN::TaskUtil::checkTaskExists(owner, id) ? Fail("cannot read the record of task " + owner + "/" + id)
                                                           : Fail("no task " + owner + "/" + id);
    }
    return 0;
}

int TaskList(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--owner"}, {}, args, problem)) {
        return Usage(problem.c_str());
    }
    if (!args.positional.empty()) {
        return Usage("task list takes no positional arguments");
    }
    std::vector<std::string> owners;
    for (const auto& opt : args.options) {
        if (!TARN::TaskUtil::isValidOwner(opt.second)) {
            return Usage("invalid owner for --owner: a user name, @administrators or @users");
        }
        owners.push_back(opt.second);
    }
    if (owners.empty()) {
        owners = TARN::TaskMgr::getAllOwners();
    }
    printf("%-48s  %-8s  %-20s  %-40s  %s\n", "ID", "STATE", "CREATED", "API / METHOD", "PROGRESS");
    for (const std::string& owner : owners) {
        for (const std::string& id : TARN::TaskMgr::getAllTaskId(owner)) {
            TARN::Task task(owner, id);
            if (!task.reload()) {
                continue;  // removed meanwhile, or not a record (logged)
            }
            const char* state = task.stateName();
            const Json::Value info = task.getProperty("info");
            const Json::Value progress = task.getProperty("progress");
            std::string percent = "-";
            if (progress.isObject() && progress["percent"].isInt()) {
                percent = std::to_string(progress["percent"].asInt()) + "%";
            }
            const std::string apiMethod = info.isObject() ? Column(info["api"], 64) + " / " + Column(info["method"], 64)
                                                          : std::string("-");
            printf("%-48s  %-8s  %-20s  %-40s  %s\n", (owner + "/" + id).c_str(), state,
                   FormatTime(task.getCreated()).c_str(), apiMethod.c_str(), percent.c_str());
        }
    }
    return 0;
}

int TaskShow(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {}, {}, args, problem)) {
        return Usage(problem.c_str());
    }
    std::unique_ptr<TARN::Task> task;
    const int rc = OpenTask(args, "show", task);
    if (rc != 0) {
        return rc;
    }
    // Control characters and anything outside ASCII come out escaped.
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    builder["emitUTF8"] = false;
    printf("%s\n", Json::writeString(builder, task->getRecord()).c_str());
    return 0;
}

// SIGTERM to the task's worker when it still runs as recorded. The pidfd
// pins the process before the check, so a pid that ends and is reused
// meanwhile is never signalled. False (with `problem`) when the signal
// could not be sent to a worker that runs.
bool SignalWorker(const TARN::Task& task, bool& signalled, std::string& problem)
{
    signalled = false;
    const pid_t pid = task.getCreatePid();
    if (pid <= 0 || !task.isWorkerAlive()) {
        return true;  // none recorded, or gone already
    }
    const int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    if (pidfd < 0 && errno == ESRCH) {
        return true;
    }
    if (pidfd < 0 && errno != ENOSYS) {
        problem = "cannot reach the worker " + std::to_string(pid) + ": " + strerror(errno);
        return false;
    }
    long rc = 0;
    if (task.isWorkerAlive()) {  // again, now that the process is pinned
        rc = pidfd >= 0 ? syscall(SYS_pidfd_send_signal, pidfd, SIGTERM, nullptr, 0)
                        : static_cast<long>(kill(pid, SIGTERM));
        signalled = rc == 0;
        if (rc != 0 && errno != ESRCH) {
            problem = "cannot signal the worker " + std::to_string(pid) + ": " + strerror(errno);
        }
    }
    if (pidfd >= 0) {
        close(pidfd);
    }
    return problem.empty();
}

int TaskStop(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {}, {"--remove"}, args, problem)) {
        return Usage(problem.c_str());
    }
    std::unique_ptr<TARN::Task> task;
    const int rc = OpenTask(args, "stop", task);
    if (rc != 0) {
        return rc;
    }
    const bool remove = !args.options.empty();
    bool signalled = false;
    if (!SignalWorker(*task, signalled, problem)) {
        return Fail(problem);
    }
    if (signalled) {
        printf("worker %d sent SIGTERM\n", static_cast<int>(task->getCreatePid()));
    }
    if (!task->finish(remove)) {
        return Fail(remove ? "cannot remove the task's record" : "cannot mark the task finished");
    }
    fputs(remove ? "task removed\n" : "task finished\n", stdout);
    return 0;
}

// ---- Sharing links -------------------------------------------------------------

namespace sdb = VELA::sharing::db;
namespace srec = VELA::sharing::record;

// Ten years: --expires counts from now.
constexpr long long kLinkExpiresMax = 10LL * 366 * 86400;

std::string Printable(const std::string& text)
{
    std::string out = text;
    for (char& c : out) {
        if (c < 0x20 || c > 0x7e) {
            c = '?';
        }
    }
    return out;
}

bool IsLinkId(const std::string& id)
{
    return id.size() == 22 && VELA::System::IsCheckedName(id, VELA::System::kNameId, 22);
}

// A system path as links keep it: absolute, printable, no "." or ".." part.
bool IsLinkPath(const std::string& path)
{
    if (path.empty() || path.size() > VELA::sharing::kMaxPath || path[0] != '/' || Printable(path) != path) {
        return false;
    }
    const std::string padded = path + "/";
    return padded.find("/./") == std::string::npos && padded.find("/../") == std::string::npos;
}

// `path` resolved under the root with every link on the way followed, as a
// system path again. False (with `problem`) unless it is an existing file
// or directory inside the root.
bool ResolveLinkPath(const std::string& path, std::string& stored, std::string& problem)
{
    char* real = realpath(VELA::System::Path(path).c_str(), nullptr);
    const int err = errno;
    char* root = realpath(VELA::System::Root().c_str(), nullptr);
    struct stat st;
    std::string r = real != nullptr ? real : "";
    const std::string top = root != nullptr ? root : "";
    free(real);
    free(root);
    if (r.empty() || top.empty()) {
        problem = path + ": " + strerror(err);
        return false;
    }
    if (stat(r.c_str(), &st) != 0 || (!S_ISDIR(st.st_mode) && !S_ISREG(st.st_mode))) {
        problem = path + ": not a file or directory";
        return false;
    }
    if (top != "/") {
        if (r.compare(0, top.size() + 1, top + "/") != 0) {
            problem = path + ": leads out of the system root";
            return false;
        }
        r.erase(0, top.size());
    }
    stored = r;
    return true;
}

// The password: the first line of `fd`, without its line end, 1 to
// kMaxPassword bytes. False (with `problem`) otherwise.
bool ReadPassword(int fd, std::string& out, std::string& problem)
{
    char buf[VELA::sharing::kMaxPassword + 2];
    size_t len = 0;
    while (len < sizeof(buf)) {
        const ssize_t n = read(fd, buf + len, sizeof(buf) - len);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            problem = std::string("cannot read the password: ") + strerror(errno);
            return false;
        }
        if (n == 0) {
            break;
        }
        len += static_cast<size_t>(n);
        if (memchr(buf, '\n', len) != nullptr) {
            break;
        }
    }
    const char* nl = static_cast<const char*>(memchr(buf, '\n', len));
    size_t end = nl != nullptr ? static_cast<size_t>(nl - buf) : len;
    if (end > 0 && buf[end - 1] == '\r') {
        --end;
    }
    out.assign(buf, end);
    bool control = false;
    for (unsigned char c : out) {
        control = control || c < 0x20 || c == 0x7f;
    }
    if (out.empty() || out.size() > VELA::sharing::kMaxPassword || control) {
        problem = "the password must be 1 to " + std::to_string(VELA::sharing::kMaxPassword) +
                  " bytes without control characters on its first line";
        return false;
    }
    return true;
}

bool ReadPasswordFile(const std::string& file, std::string& out, std::string& problem)
{
    const int fd = open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    struct stat st;
    if (fd < 0 || fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        problem = file + ": " + (fd < 0 ? strerror(errno) : "not a regular file");
        if (fd >= 0) {
            close(fd);
        }
        return false;
    }
    const bool ok = ReadPassword(fd, out, problem);
    close(fd);
    return ok;
}

std::string LinkUrlPath(const srec::Entry& e) { return "/sharing/" + e.get_project_name() + "/" + e.get_hash(); }

int LinkCreate(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--owner", "--project", "--path", "--expires", "--password-file", "--uses"},
                   {"--password-stdin", "--match-ip"}, args, problem)) {
        return Usage(problem.c_str());
    }
    if (!args.positional.empty()) {
        return Usage("link create takes no positional arguments");
    }
    sdb::LinkSpec link;
    std::string path;
    std::string passwordFile;
    bool passwordStdin = false;
    long long expires = 0;
    for (const auto& opt : args.options) {
        if (opt.first == "--owner") {
            link.userName = opt.second;
        } else if (opt.first == "--project") {
            link.projectName = opt.second;
        } else if (opt.first == "--path") {
            path = opt.second;
        } else if (opt.first == "--expires") {
            if (!ParseSeconds(opt.second.c_str(), kLinkExpiresMax, expires)) {
                return Usage(("--expires must be 1 to " + std::to_string(kLinkExpiresMax) + " seconds").c_str());
            }
        } else if (opt.first == "--uses") {
            if (!ParseSeconds(opt.second.c_str(), VELA::sharing::kMaxUseLimit, link.useLimit)) {
                return Usage(("--uses must be 1 to " + std::to_string(VELA::sharing::kMaxUseLimit)).c_str());
            }
        } else if (opt.first == "--password-file") {
            passwordFile = opt.second;
        } else if (opt.first == "--password-stdin") {
            passwordStdin = true;
        } else if (opt.first == "--match-ip") {
            link.enableMatchIP = true;
        }
    }
    if (link.userName.empty() || link.projectName.empty() || path.empty()) {
        return Usage("link create needs --owner, --project and --path");
    }
    if (passwordStdin && !passwordFile.empty()) {
        return Usage("--password-file and --password-stdin exclude each other");
    }
    if (!IsLinkPath(path)) {
        return Usage("--path must be an absolute path of printable bytes without \".\" or \"..\" parts");
    }
    gid_t gid = 0;
    if (VELAUserGetUGID(link.userName.c_str(), &link.uid, &gid) != 0) {
        return Fail("no user \"" + Printable(link.userName) + "\"");
    }
    if (!ResolveLinkPath(path, link.path, problem)) {
        return Fail(Printable(problem));
    }
    if ((passwordStdin && !ReadPassword(STDIN_FILENO, link.password, problem)) ||
        (!passwordFile.empty() && !ReadPasswordFile(passwordFile, link.password, problem))) {
        return Fail(problem);
    }
    link.expireTime = expires == 0 ? 0 : static_cast<long long>(time(nullptr)) + expires;
    srec::Entry entry;
    if (!sdb::EntryDB(sdb::SharingDB::Instance()).Create(link, entry)) {
        return Fail("cannot create the link");
    }
    printf("id=%s\nurl=%s\n", entry.get_hash().c_str(), LinkUrlPath(entry).c_str());
    return 0;
}

int LinkList(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--owner"}, {}, args, problem)) {
        return Usage(problem.c_str());
    }
    if (!args.positional.empty() || args.options.size() > 1) {
        return Usage("link list takes at most one --owner");
    }
    sdb::EntryDB entries(sdb::SharingDB::Instance());
    std::vector<srec::Entry> links;
    bool ok = false;
    if (args.options.empty()) {
        ok = entries.ListAll(links);
    } else {
        uid_t uid = 0;
        gid_t gid = 0;
        if (VELAUserGetUGID(args.options[0].second.c_str(), &uid, &gid) != 0) {
            return Fail("no user \"" + Printable(args.options[0].second) + "\"");
        }
        ok = entries.ListByOwner(uid, links);
    }
    if (!ok) {
        return Fail("cannot list the sharing links");
    }
    const long long now = static_cast<long long>(time(nullptr));
    printf("%-22s  %-16s  %-16s  %-20s  %-20s  %-11s  %-8s  %s\n", "ID", "OWNER", "PROJECT", "CREATED", "EXPIRES",
           "USES", "STATE", "PATH");
    for (const srec::Entry& e : links) {
        const char* state = "active";
        if (e.is_revoked()) {
            state = "revoked";
        } else if (e.get_expire_time() != 0 && e.get_expire_time() <= now) {
            state = "expired";
        }
        std::string uses = std::to_string(e.get_use_count());
        if (e.get_use_limit() != 0) {
            uses += "/" + std::to_string(e.get_use_limit());
        }
        printf("%-22s  %-16s  %-16s  %-20s  %-20s  %-11s  %-8s  %s%s%s\n", e.get_hash().c_str(),
               Printable(e.get_user_name()).c_str(), e.get_project_name().c_str(),
               FormatTime(e.get_create_time()).c_str(),
               e.get_expire_time() == 0 ? "never" : FormatTime(e.get_expire_time()).c_str(), uses.c_str(), state,
               Printable(e.get_path()).c_str(), e.has_password() ? " [password]" : "",
               e.get_enable_match_ip() ? " [match-ip]" : "");
    }
    return 0;
}

// The link named by the one positional argument. Its exit status on
// failure, 0 when `entry` is loaded.
int OpenLink(int argc, char** argv, const char* action, srec::Entry& entry)
{
    if (argc != 4) {
        return Usage((std::string("link ") + action + " needs exactly one link id").c_str());
    }
    if (!IsLinkId(argv[3])) {
        return Usage("invalid link id: 22 characters of letters, digits, '-' and '_'");
    }
    if (!sdb::EntryDB(sdb::SharingDB::Instance()).GetByHash(argv[3], entry)) {
        return Fail("no link with that id");
    }
    return 0;
}

int LinkShow(int argc, char** argv)
{
    srec::Entry e;
    const int rc = OpenLink(argc, argv, "show", e);
    if (rc != 0) {
        return rc;
    }
    Json::Value out(Json::objectValue);
    out["id"] = e.get_hash();
    out["url"] = LinkUrlPath(e);
    out["project"] = e.get_project_name();
    out["path"] = e.get_path();
    out["owner"] = e.get_user_name();
    out["uid"] = static_cast<Json::UInt>(e.get_uid());
    out["created"] = static_cast<Json::Int64>(e.get_create_time());
    out["expires"] = static_cast<Json::Int64>(e.get_expire_time());
    out["hasPassword"] = e.has_password();
    out["useLimit"] = static_cast<Json::Int64>(e.get_use_limit());
    out["useCount"] = static_cast<Json::Int64>(e.get_use_count());
    out["matchIP"] = e.get_enable_match_ip();
    out["revoked"] = e.is_revoked();
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    builder["emitUTF8"] = false;
    printf("%s\n", Json::writeString(builder, out).c_str());
    return 0;
}

int LinkRevoke(int argc, char** argv)
{
    srec::Entry e;
    const int rc = OpenLink(argc, argv, "revoke", e);
    if (rc != 0) {
        return rc;
    }
    if (!e.is_revoked() && !sdb::EntryDB(sdb::SharingDB::Instance()).Revoke(e.get_hash())) {
        return Fail("cannot revoke the link");
    }
    printf("link revoked\n");
    return 0;
}

int PublicKey(int argc, char** argv)
{
    if (argc != 2) {
        return Usage("pubkey takes no arguments");
    }
    std::string pem;
    if (VelaCgiPublicKeyPEM(pem) != 0 || pem.empty()) {
        return Fail("the server's public key is not available");
    }
    fputs(pem.c_str(), stdout);
    if (pem.back() != '\n') {
        fputc('\n', stdout);
    }
    return 0;
}

// The token of a peer: the first line of `fd`, without its line end.
bool ReadTokenLine(int fd, std::string& out, std::string& problem)
{
    char buf[VELA::Relay::kMaxPeerToken + 2];
    size_t len = 0;
    while (len < sizeof(buf)) {
        const ssize_t n = read(fd, buf + len, sizeof(buf) - len);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            problem = std::string("cannot read the token: ") + strerror(errno);
            return false;
        }
        if (n == 0 || memchr(buf + len, '\n', static_cast<size_t>(n)) != nullptr) {
            len += static_cast<size_t>(n);
            break;
        }
        len += static_cast<size_t>(n);
    }
    const char* nl = static_cast<const char*>(memchr(buf, '\n', len));
    size_t end = nl != nullptr ? static_cast<size_t>(nl - buf) : len;
    if (end > 0 && buf[end - 1] == '\r') {
        --end;
    }
    out.assign(buf, end);
    if (out.empty() || out.size() > VELA::Relay::kMaxPeerToken) {
        problem = "the token must be on the first line, 1 to " + std::to_string(VELA::Relay::kMaxPeerToken) +
                  " bytes";
        return false;
    }
    return true;
}

int PeerAdd(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--url", "--token-file", "--ca-file", "--pin"}, {"--token-stdin", "--replace"},
                   args, problem)) {
        return Usage(problem.c_str());
    }
    if (args.positional.size() != 1) {
        return Usage("peer add needs exactly one peer name");
    }
    VELA::RelayPeer peer;
    peer.name = args.positional[0];
    std::string tokenFile;
    bool tokenStdin = false;
    bool replace = false;
    for (const auto& opt : args.options) {
        if (opt.first == "--url") {
            peer.url = opt.second;
        } else if (opt.first == "--token-file") {
            tokenFile = opt.second;
        } else if (opt.first == "--ca-file") {
            peer.caFile = opt.second;
        } else if (opt.first == "--pin") {
            peer.pinnedPubKey = opt.second;
        } else if (opt.first == "--token-stdin") {
            tokenStdin = true;
        } else if (opt.first == "--replace") {
            replace = true;
        }
    }
    if (peer.url.empty() || tokenFile.empty() == !tokenStdin) {
        return Usage("peer add needs --url and one of --token-file, --token-stdin");
    }
    if (tokenStdin) {
        if (!ReadTokenLine(STDIN_FILENO, peer.token, problem)) {
            return Fail(problem);
        }
    } else {
        const int fd = open(tokenFile.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
        struct stat st;
        const bool ok = fd >= 0 && fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && ReadTokenLine(fd, peer.token, problem);
        if (!ok && problem.empty()) {
            problem = tokenFile + ": " + (fd < 0 ? strerror(errno) : "not a regular file");
        }
        if (fd >= 0) {
            close(fd);
        }
        if (!ok) {
            return Fail(problem);
        }
    }
    if (!VELA::Relay::CheckPeer(peer, problem)) {
        return Fail(problem);
    }
    std::vector<VELA::RelayPeer> peers;
    if (!VELA::Relay::LoadPeers(peers, problem)) {
        return Fail(problem);
    }
    bool found = false;
    for (VELA::RelayPeer& p : peers) {
        if (p.name == peer.name) {
            if (!replace) {
                return Fail("a peer named \"" + peer.name + "\" exists (--replace replaces it)");
            }
            p = peer;
            found = true;
        }
    }
    if (!found) {
        peers.push_back(peer);
    }
    if (!VELA::Relay::SavePeers(peers, problem)) {
        return Fail(problem);
    }
    printf("peer %s %s\n", peer.name.c_str(), found ? "replaced" : "added");
    return 0;
}

int PeerList(int argc, char**)
{
    if (argc != 3) {
        return Usage("peer list takes no arguments");
    }
    std::vector<VELA::RelayPeer> peers;
    std::string problem;
    if (!VELA::Relay::LoadPeers(peers, problem)) {
        return Fail(problem);
    }
    printf("%-24s  %-40s  %s\n", "NAME", "URL", "TLS");
    for (const VELA::RelayPeer& p : peers) {
        std::string tls = p.url.compare(0, 5, "http:") == 0 ? "none (loopback)" : "system authorities";
        if (!p.caFile.empty()) {
            tls = "ca " + p.caFile;
        }
        if (!p.pinnedPubKey.empty()) {
            tls += ", key pinned";
        }
        printf("%-24s  %-40s  %s\n", p.name.c_str(), p.url.c_str(), tls.c_str());
    }
    return 0;
}

int PeerRemove(int argc, char** argv)
{
    if (argc != 4) {
        return Usage("peer remove needs exactly one peer name");
    }
    std::vector<VELA::RelayPeer> peers;
    std::string problem;
    if (!VELA::Relay::LoadPeers(peers, problem)) {
        return Fail(problem);
    }
    const size_t before = peers.size();
    peers.erase(std::remove_if(peers.begin(), peers.end(),
                               [&](const VELA::RelayPeer& p) { return p.name == argv[3]; }),
                peers.end());
    if (peers.size() == before) {
        return Fail("no peer with that name");
    }
    if (!VELA::Relay::SavePeers(peers, problem)) {
        return Fail(problem);
    }
    printf("peer removed\n");
    return 0;
}

int PeerTest(int argc, char** argv)
{
    Args args;
    std::string problem;
    if (!SplitArgs(argc, argv, 3, {"--api", "--method", "--version", "--timeout"}, {}, args, problem)) {
        return Usage(problem.c_str());
    }
    if (args.positional.size() != 1) {
        return Usage("peer test needs exactly one peer name");
    }
    std::string api = "VELA.Entry.Request";
    std::string method = "request";
    long long version = 1;
    long long timeout = 10;
    for (const auto& opt : args.options) {
        if (opt.first == "--api") {
            api = opt.second;
        } else if (opt.first == "--method") {
            method = opt.second;
        } else if (opt.first == "--version" &&
                   !VELA::System::ParseDecimal(opt.second.c_str(), opt.second.size(), 1, INT_MAX, version)) {
            return Usage("--version must be a positive number");
        } else if (opt.first == "--timeout" && !ParseSeconds(opt.second.c_str(), VELA::CredRequestMgr::kMaxTimeout, timeout)) {
            return Usage("--timeout must be 1 to 3600 seconds");
        }
    }
    VELA::CredRequestMgr mgr;
    mgr.SetTimeout(static_cast<int>(timeout));
    if (!mgr.AddWebAPIRequest(args.positional[0], api, static_cast<int>(version), method, Json::Value()) ||
        !mgr.Run()) {
        return Fail("peer test failed[" + std::to_string(mgr.GetError()) + "]: " + mgr.GetErrorText());
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    printf("%s\n", Json::writeString(builder, mgr.GetResponse()).c_str());
    return 0;
}

int Run(int argc, char** argv)
{
    if (argc < 2) {
        return Usage("no command given");
    }
    const std::string command = argv[1];
    // --help anywhere asks for the text, even where an option's value is
    // due: none of the values velaadm takes is sensibly "--help".
    bool help = command == "-h" || command == "help";
    for (int i = 1; i < argc && !help; ++i) {
        help = strcmp(argv[i], "--help") == 0;
    }
    if (help) {
        fputs(kUsage, stdout);
        return 0;
    }
    if (command == "pubkey") {
        return PublicKey(argc, argv);
    }
    // Every command with actions: its actions in the order the usage
    // message names them.
    struct Action {
        const char* name;
        int (*run)(int, char**);
    };
    static const struct {
        const char* command;
        std::vector<Action> actions;
    } kCommands[] = {
        {"session", {{"create", SessionCreate}, {"list", SessionList}, {"revoke", SessionRevoke}}},
        {"token", {{"create", TokenCreate}, {"list", TokenList}, {"revoke", TokenRevoke}}},
        {"task", {{"list", TaskList}, {"show", TaskShow}, {"stop", TaskStop}}},
        {"peer", {{"add", PeerAdd}, {"list", PeerList}, {"test", PeerTest}, {"remove", PeerRemove}}},
        {"link", {{"create", LinkCreate}, {"list", LinkList}, {"show", LinkShow}, {"revoke", LinkRevoke}}},
    };
    for (const auto& entry : kCommands) {
        if (command != entry.command) {
            continue;
        }
        if (argc < 3) {
            std::string names;
            for (size_t k = 0; k < entry.actions.size(); ++k) {
                names += (k == 0 ? "" : (k + 1 == entry.actions.size() ? " or " : ", "));
                names += entry.actions[k].name;
            }
            return Usage((command + " needs an action: " + names).c_str());
        }
        const std::string action = argv[2];
        for (const Action& a : entry.actions) {
            if (action == a.name) {
                return a.run(argc, argv);
            }
        }
        return Usage(("unknown action \"" + action + "\" for " + command).c_str());
    }
    if (command.size() > 1 && command[0] == '-') {
        return Usage(("unknown option " + command).c_str());
    }
    return Usage(("unknown command \"" + command + "\"").c_str());
}

}  // namespace

int main(int argc, char** argv)
{
    openlog("velaadm", LOG_PID, LOG_AUTHPRIV);
    VELA::System::LogSetSink(LogSink, nullptr);
    umask(077);
    int rc = kExitFailure;
    try {
        rc = Run(argc, argv);
    } catch (const std::exception& e) {
        rc = Fail(std::string("internal error: ") + e.what());
    }
    if (fflush(stdout) != 0) {
        fprintf(stderr, "velaadm: cannot write the output: %s\n", strerror(errno));
        rc = kExitFailure;
    }
    return rc;
}
