// The road of one call through the dispatcher, in order. APIRunner::Process
// walks it from the top; ProcessLib from "permission" on. A new step of the
// road is one more line here (its function declared in Road.h).
#include "dispatcher/Road.h"

#include <exception>

#include "dispatcher/APIRunnerPrivate.h"
#include "dispatcher/Refusal.h"
#include "dispatcher/ResolvedCall.h"
#include "vela/log.h"

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

}  // namespace

Stage RoadStart() { return kRoad[0].run; }

bool WalkRoad(ResolvedCall& call, Stage from)
{
    const ResolvedCall* outer = call.d.Current();
    call.d.SetCurrent(&call);
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
    call.d.SetCurrent(outer);
    return served;
}

}  // namespace VELA
