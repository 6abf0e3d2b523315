// Limits of the process that serves one request, so that no single request
// can hold a core, a process slot or the machine's memory for long: CPU time
// (RLIMIT_CPU), wall-clock time (alarm), the time a body may sit idle, and
// the number of requests one client address may have under way at once.
#pragma once

#include "vela/export.h"
namespace VELA {

// The functions below are exported for velascgi and the tests
// (VELA_EXPORT: see vela/export.h).

struct RequestLimits {
    // CPU seconds of the process; at the limit the kernel sends SIGXCPU,
    // and SIGKILL a few seconds later.
    int cpuSeconds = 120;
    // Wall-clock seconds of a request apart from the time its body takes to
    // arrive; at the limit the process gets SIGALRM.
    int timeSeconds = 300;
    // A body that sends nothing for this long is refused.
    int bodyIdleSeconds = 20;
    // The body is given its length divided by this rate (bytes per second)
    // on top of timeSeconds.
    long long bodyMinRate = 16384;
    // Requests one client address may have under way at once; 0 for no
    // limit.
    int maxPerClient = 16;

    // velafcgi: warm parents (0: one per online core), children at once in
    // all, and the seconds a request's parameters may take to arrive.
    int fcgiParents = 0;
    int fcgiMaxChildren = 64;
    int fcgiParamSeconds = 10;
};

// The limits of <root>/etc/vela/webapi.conf (request_cpu_seconds,
// request_time_seconds, request_body_idle_seconds, request_body_min_rate,
// request_max_per_client, fcgi_parents, fcgi_max_children,
// fcgi_param_seconds); a key that is absent or not a number in range
// keeps its default (and a bad one is logged).
VELA_EXPORT RequestLimits LoadRequestLimits();

// Wall-clock seconds a request with a body of `contentLength` bytes may
// take: timeSeconds plus the body's allowance, at most a day.
VELA_EXPORT unsigned RequestWallSeconds(const RequestLimits& limits, long long contentLength);

// Arms the CPU limit and the alarm for this process. False (logged) when
// the kernel refuses either.
VELA_EXPORT bool ArmRequestLimits(const RequestLimits& limits, long long contentLength);

// Takes one of the maxPerClient slots of the client `address` (text as
// VelaCgiGetRemoteIP gives it; IPv6 addresses share the slots of their /64).
// The slot is a lock held until the process ends. 1 when taken (or there is
// no limit), 0 when every slot of the address is busy, -1 when the slots
// cannot be used (logged; the caller lets the request through).
VELA_EXPORT int TakeClientSlot(const RequestLimits& limits, const char* address);

}  // namespace VELA
