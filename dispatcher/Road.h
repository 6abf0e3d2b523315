// The road of one call: an ordered list of stages (Road.cpp) that a walker
// runs one after the other until one of them stops the call. A stage that
// refuses the call sets its error code and logs it once (Refusal.h) before it
// answers kStop; hooks and handler checks that refuse set their own code.
#pragma once

#include <cstddef>

namespace VELA {

struct ResolvedCall;

enum class Step {
    kGoOn,    // next stage
    kStop,    // the call ends unserved; the response says why
    kServed,  // the call has been answered; no further stage
};

using Stage = Step (*)(ResolvedCall& call);

// Walks the road from the stage `from` to the end. True when a stage
// answered kServed. Whatever the call changed around its handler is put
// back before this returns.
bool WalkRoad(ResolvedCall& call, Stage from);
// The first stage of the road.
Stage RoadStart();

// ---- The stages, by the file that holds them ----
// Registry.cpp
Step CheckCallNames(ResolvedCall& call);   // 101, 102
Step DescribeCall(ResolvedCall& call);     // 102, 103, 104, 115, 116
// ProcessName.cpp
Step NameProcessAfterCall(ResolvedCall& call);  // 118
// APIRunner.cpp
Step RefuseRelay(ResolvedCall& call);      // 109
Step RunEntryAPI(ResolvedCall& call);      // 110, compound requests
Step AskPermission(ResolvedCall& call);    // the runner's permission hooks
Step ReceiveUpload(ResolvedCall& call);    // the runner's upload hook
// UsageCounter.cpp
Step CountUsage(ResolvedCall& call);
// LibCache.cpp
Step OpenLibrary(ResolvedCall& call);      // 111
Step FindEntry(ResolvedCall& call);        // the check table, 121, 117 preset
// ExecContext.cpp
Step EnterCallScope(ResolvedCall& call);   // standard streams, priority
Step SwitchIdentity(ResolvedCall& call);   // working directory, ids, identity
Step CallHandler(ResolvedCall& call);

}  // namespace VELA
