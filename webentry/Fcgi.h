// velafcgi, the persistent front end for web servers that speak FastCGI.
//
// A master process holds the listening socket and keeps a few warm parents
// alive. Each parent has the framework, the platform and the handler
// libraries it has seen loaded and bound, and the API descriptions parsed;
// it reads the parameters of one request at a time and forks a child that
// serves it exactly as velascgi would. The parent never runs handler code
// and never changes identity.
#pragma once

#include <atomic>
#include <cstddef>
#include <string>
#include <vector>

#include <fcgiapp.h>

namespace VELA {

class WebEntry;

namespace Fcgi {

struct Options {
    int parents = 0;            // warm parents; 0: one per online core
    int maxChildren = 64;       // children at once, shared out between the parents
    int paramSeconds = 10;      // to read the parameters of a request
    std::vector<std::string> environment;  // "NAME=value" every child starts from
};

// What a child has sent of its reply, as its parent sees it.
enum ReplyState : int {
    kNothingSent = 0,  // not a byte: the parent may still answer
    kReplyStarted = 1,
    kReplyEnded = 2,   // the request's end record went out
};

// A child's page of memory shared with its parent.
struct Slot {
    std::atomic<int> state;
    // The API whose library the child opened first (the parent then warms
    // it up); empty when it opened none.
    char api[128];
};

// The parent of warm `entry`: forks one child per request accepted on
// `listenFd` until SIGTERM or SIGINT, then waits for its children. Returns
// the process's exit status.
int RunParent(int listenFd, const Options& options, int argc, char** argv);

// The child's side: serves the request `req`, already accepted and with its
// parameters read, through `entry`, then ends the process. `closeFds` are
// descriptors of the parent the child must not keep.
[[noreturn]] void ServeChild(FCGX_Request& req, WebEntry& entry, Slot& slot, const Options& options,
                             const std::vector<int>& closeFds, int argc, char** argv);

// Writes a whole reply (CGI header lines and body) to a FastCGI connection as
// one stdout stream followed by the end of the request. False when the
// connection refused it.
bool WriteWholeReply(int fd, int requestId, const char* text, size_t length);

}  // namespace Fcgi
}  // namespace VELA
