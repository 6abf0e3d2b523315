// velafcgi, the persistent front end for web servers that speak FastCGI.
//
// A master process holds the listening socket and keeps a few warm parents
// alive. Each parent has the framework, the platform and the handler
// libraries it has seen loaded and bound, and the API descriptions parsed;
// it reads the parameters of one request at a time and forks a child that
// serves it exactly as velascgi would. The parent never runs handler code
// and never changes identity, except for the methods whose description asks
// for "inProcess" (see APIRunner::ServesInProcess), which it serves itself.
#pragma once

#include <atomic>
#include <csignal>
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

// The parent's slots: one page each, so that a child keeps its own page
// mapped and no other.
struct SlotArea {
    char* base = nullptr;
    size_t page = 0;
    int count = 0;
    Slot& At(int i) const { return *reinterpret_cast<Slot*>(base + static_cast<size_t>(i) * page); }
};

// The child's side: serves the request `req`, already accepted and with its
// parameters read, through `entry`, then ends the process. It keeps slot
// `own` of `slots` and unmaps the others before anything else runs;
// `closeFds` are descriptors of the parent it must not keep.
[[noreturn]] void ServeChild(FCGX_Request& req, WebEntry& entry, const SlotArea& slots, int own,
                             const Options& options, const std::vector<int>& closeFds, int argc, char** argv);

// The environment of a request: only the server's own variables of
// `options`, then the request's parameters, except names that a request
// never sets (VELA_*, LD_*, PATH, TZ, IFS, HTTP_PROXY) and names that are not
// plain variable names. False, logged, when the parameters are more than
// 1000 or 1 MiB.
bool SetRequestEnvironment(char** params, const Options& options);

// Writes all of `length` bytes to `fd`, through interruptions. False when
// the descriptor refused them (a reader gone: EPIPE, never SIGPIPE, since
// the processes of velafcgi ignore or block it where they write).
bool WriteFully(int fd, const void* data, size_t length);

// Runs `onStop` for SIGTERM and SIGINT and `onChild` for SIGCHLD (no
// restart of interrupted calls) and blocks the three; the mask from before
// goes to `waiting` without them, for the waits that take them.
void CatchStopAndChildren(void (*onStop)(int), void (*onChild)(int), sigset_t& blocked, sigset_t& waiting);

// Writes `length` bytes of the reply to a FastCGI connection as stdout
// records of up to 65535 bytes each. False when the connection refused them.
bool WriteStdout(int fd, int requestId, const char* data, size_t length);
// Ends the request: the empty stdout record, then the end of the request
// (application status 0, request complete).
bool WriteEndRequest(int fd, int requestId);
// A whole reply (CGI header lines and body) and the end of the request, on a
// connection given a few seconds to take it.
bool WriteWholeReply(int fd, int requestId, const char* text, size_t length);

}  // namespace Fcgi
}  // namespace VELA
