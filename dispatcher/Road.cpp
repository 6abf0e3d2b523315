// The road of one call through the dispatcher, in order. APIRunner::Process
// walks it from the top; ProcessLib from "permission" on. A new step of the
// road is one more line here (its function declared in Road.h).
#include "dispatcher/Road.h"

#include <exception>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "vela/audit.h"
#include "vela/log.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

namespace VELA {

namespace {

struct RoadStage {
    const char* name;
    Stage run;
};

// clang-format off
const RoadStage kRoad[] = {
    // name                   stage                    refuses with / calls
    {"call named",            CheckCallNames},         // 101, 102
    {"process named",         NameProcessAfterCall},   // 118
    {"call described",        DescribeCall},           // 102 104 103 115 116
    {"relay refused",         RefuseRelay},            // 109
    {"entry API",             RunEntryAPI},            // ProcessEntry: 110, compound
    {"permission",            AskPermission},          // CheckSharingPermission, NeedPermission,
                                                       // CheckPermission, SkipPermission
    {"usage counted",         CountUsage},
    {"upload received",       ReceiveUpload},          // HandleUpload
    {"library opened",        OpenLibrary},            // 111
    {"streams and priority",  EnterCallScope},
    {"entry found",           FindEntry},              // check table, 121, 117 preset
    {"identity",              SwitchIdentity},
    {"handler",               CallHandler},
};
// clang-format on

// What an audit event recorded during the call learns of it (asked only
// when one is recorded).
void CallFactsOf(const void* arg, Audit::CallFacts& out)
{
    const ResolvedCall& call = *static_cast<const ResolvedCall*>(arg);
    out.actor = call.req->GetLoginUserName();
    out.address = call.req->GetRemoteIP();
    out.api = call.api;
    out.method = call.method;
}

// A method described with "audit": true leaves one line in the audit trail
// once the road is over, served or refused, with the answer's error code.
void AuditCall(const ResolvedCall& call)
{
    if (call.flags == nullptr || !call.Flag("audit")) {
        return;
    }
    Audit::Event event;
    event.name = Audit::kCall;
    event.user = call.req->GetLoginUserName();
    event.result = call.resp->GetError();
    Audit::Record(event);
}

}  // namespace

Stage RoadStart() { return kRoad[0].run; }

bool WalkRoad(ResolvedCall& call, Stage from)
{
    const ResolvedCall* outer = call.d.Current();
    call.d.SetCurrent(&call);
    const Audit::CallSource outerSource = Audit::SetCallSource({&CallFactsOf, &call});
    bool served = false;
    const char* at = "road";
    try {
        bool walking = false;
        for (const RoadStage& stage : kRoad) {
            walking = walking || stage.run == from;
            if (!walking) {
                continue;
            }
            at = stage.name;
            const Step step = stage.run(call);
            if (step != Step::kGoOn) {
                served = step == Step::kServed;
                break;
            }
        }
    } catch (const std::exception& e) {
        VELA_LOG_ERR("%s failed at \"%s\": %s", LogSafe(call.api).c_str(), at, e.what());
    } catch (...) {
        VELA_LOG_ERR("%s failed at \"%s\"", LogSafe(call.api).c_str(), at);
    }
    call.identity.Restore();
    call.scope.Restore();
    try {
        AuditCall(call);
    } catch (const std::exception& e) {
        VELA_LOG_ERR("%s: audit failed: %s", LogSafe(call.api).c_str(), e.what());
    }
    Audit::SetCallSource(outerSource);
    call.d.SetCurrent(outer);
    return served;
}

}  // namespace VELA
