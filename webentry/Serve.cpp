// One request served from this process's CGI environment and standard
// streams.
#include "webentry/Serve.h"

#include <climits>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <string>
#include <unistd.h>

#include "vela/cgi.h"
#include "vela/log.h"
#include "vela/vlibc.h"
#include "webentry/RequestLimits.h"
#include "webentry/WebEntry.h"

namespace VELA {

const char kSetupFailedReply[] =
    "Status: 500 Internal Server Error\r\n"
    "Content-type: application/json; charset=\"UTF-8\"\r\n"
    "Accept-Ranges: none\r\n"
    "X-Content-Type-Options: nosniff\r\n"
    "X-XSS-Protection: 1; mode=block\r\n"
    "Cache-Control: max-age=0, no-cache, no-store, must-revalidate\r\n"
    "Pragma: no-cache\r\n"
    "Expires: 0\r\n"
    "\r\n"
    "{\"error\":{\"code\":117},\"success\":false}";
const size_t kSetupFailedReplyLength = sizeof(kSetupFailedReply) - 1;

const char kBusyReply[] =
    "Status: 503 Service Unavailable\r\n"
    "Retry-After: 5\r\n"
    "Content-type: application/json; charset=\"UTF-8\"\r\n"
    "X-Content-Type-Options: nosniff\r\n"
    "Cache-Control: max-age=0, no-cache, no-store, must-revalidate\r\n"
    "\r\n"
    "{\"error\":{\"code\":117},\"success\":false}";
const size_t kBusyReplyLength = sizeof(kBusyReply) - 1;

void WriteReply(const char* p, size_t left)
{
    while (left > 0) {
        const ssize_t n = write(STDOUT_FILENO, p, left);
        if (n <= 0) {
            return;
        }
        p += n;
        left -= static_cast<size_t>(n);
    }
}

namespace {

// Arms this request's CPU and wall-clock limits and takes its client's
// slot. False when the client has too many requests under way (answered).
bool LimitRequest()
{
    const RequestLimits limits = LoadRequestLimits();
    const char* text = getenv("CONTENT_LENGTH");
    long long length = System::ContentLength(text, text != nullptr ? strlen(text) : 0, LLONG_MAX);
    if (length < 0) {
        length = 0;  // the front end refuses it later, with the request's own answer
    }
    ArmRequestLimits(limits, length);
    char address[64] = "";
    if (VelaCgiGetRemoteIP(address, sizeof(address)) != 0) {
        address[0] = '\0';
    }
    if (TakeClientSlot(limits, address) == 0) {
        VELA_LOG_ERR("refused: %s already has %d requests under way", address[0] ? address : "(unknown client)",
                     limits.maxPerClient);
        WriteReply(kBusyReply, kBusyReplyLength);
        return false;
    }
    return true;
}

}  // namespace

void ServeCgiRequest(int argc, char** argv, WebEntry* entry)
{
    try {
        const std::string dir = System::Path("/usr/vela/velaman/webapi");
        if (chdir(dir.c_str()) != 0) {
            VELA_LOG_ERR("cannot enter the web-API directory %s[%m]", dir.c_str());
            WriteReply(kSetupFailedReply, kSetupFailedReplyLength);
            return;
        }
        if (!LimitRequest()) {
            return;
        }
        if (entry != nullptr) {
            entry->SetArgs(argc, argv);
            entry->Run(Json::Value());
        } else {
            // The process ends with the call: its runner is not taken apart
            // piece by piece, the system takes the memory back at once.
            static WebEntry* own = nullptr;
            own = new WebEntry();
            own->SetArgs(argc, argv);
            own->Run(Json::Value());
        }
    } catch (const std::exception& e) {
        VELA_LOG_ERR("request aborted: %s", e.what());
    } catch (...) {
        VELA_LOG_ERR("request aborted");
    }
}

}  // namespace VELA
