// velascgi: the CGI program the web server runs for every web-API call.
// It works in the web-API directory, where the API descriptions and handler
// libraries are named relative to, and hands the call to one WebEntry.
//
//   velascgi            (run by the web server, with a CGI environment)
//   velascgi --help     (run by hand)
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "webentry/Serve.h"

namespace {

const char kUsage[] =
    "usage: velascgi             (run by the web server as a CGI program)\n"
    "       velascgi --help\n"
    "  Serves one web-API call from the CGI environment (REQUEST_METHOD,\n"
    "  QUERY_STRING, CONTENT_TYPE, CONTENT_LENGTH, HTTP_COOKIE, REMOTE_ADDR, ...)\n"
    "  and standard input, and writes the CGI answer to standard output. It\n"
    "  works in <VELA_ROOT>/usr/vela/velaman/webapi and takes its settings from\n"
    "  <VELA_ROOT>/etc/vela/webapi.conf. VELA_LOG_STDERR=1 copies the log lines\n"
    "  to standard error.\n"
    "\n"
    "  -h, --help  print this text (only outside a CGI environment: with\n"
    "              GATEWAY_INTERFACE set every run serves a call)\n";

// An option given by hand: --help answers, anything else is a usage error.
int HandOption(const char* option)
{
    if (strcmp(option, "--help") == 0 || strcmp(option, "-h") == 0) {
        fputs(kUsage, stdout);
        return 0;
    }
    fprintf(stderr, "velascgi: unknown option %s\nTry 'velascgi --help' for more information.\n", option);
    return 2;
}

}  // namespace

int main(int argc, char** argv)
{
    // A web server runs it without arguments, so a call costs one compare;
    // the environment is looked at only when an option was given.
    if (argc > 1 && argv[1][0] == '-' && getenv("GATEWAY_INTERFACE") == nullptr) {
        return HandOption(argv[1]);
    }
    VELA::ServeCgiRequest(argc, argv, nullptr);
    return 0;
}
