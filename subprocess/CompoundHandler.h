// Compound requests: the entry API "VELA.Entry.Request", method "request",
// carries a list of calls in "compound" and answers them in one response,
// {"has_fail": <bool>, "result": [<answer of call 0>, ...]}.
//
// Each call goes through APIRunner::Process like a request of its own (the
// same permission check and identity switch), either in this process (a
// "grantable" or "grantByDefault" method in sequential mode) or in a forked
// child that sends its answer back through a Pipe. "mode": "parallel" forks
// every call; "stop_when_error" (sequential only) skips the calls after the
// first failure. A failed call never fails the compound: it shows in its
// answer and in "has_fail".
#pragma once

#include <json/json.h>
#include <string>
#include <sys/types.h>
#include <utility>
#include <vector>

#include "webapi/APIError.h"
#include "webapi/APIUtils.h"

namespace VELA {

class APIRequest;
class APIResponse;
class APIRunner;

// The bounds of compound requests: keys of <root>/etc/vela/webapi.conf,
// each a decimal number; a missing or bad one keeps its default (a bad one
// is logged).
struct CompoundLimits {
    long long maxCalls = 128;      // compound_max_calls: calls in one request, nested ones counted
    long long maxDepth = 4;        // compound_max_depth: compounds inside compounds, the outer one counted
    long long maxChildren = 16;    // compound_max_children: children at once in parallel mode
    long long childSeconds = 300;  // compound_child_seconds: a child that has not answered by then is killed
};
CompoundLimits LoadCompoundLimits();

class CompoundHandler {
public:
    CompoundHandler(APIRequest* req, APIResponse* resp, APIRunner* runner);
    ~CompoundHandler();
    CompoundHandler(const CompoundHandler&) = delete;
    CompoundHandler& operator=(const CompoundHandler&) = delete;

    // Replaces the limits read from the configuration; `depth` is how many
    // compounds enclose this one (0 for a compound sent by a client).
    void SetLimits(const CompoundLimits& limits, int depth);

    // Runs every call and writes the combined answer into the response.
    // False when the compound itself is refused (110, 117).
    bool Process();

private:
    typedef std::pair<Pipe*, unsigned int> ChildPipe;
    struct LiveChild {
        ChildPipe pipe;
        pid_t pid;
        int pidfd;           // pins the child for the kill of a late one; -1 without
        long long deadline;  // CLOCK_MONOTONIC milliseconds
    };

    _tag_WEBAPI_ERR ParseParams();
    _tag_WEBAPI_ERR CheckBounds();
    _tag_WEBAPI_ERR PrepareNewCompReqResp();
    void PreloadLibs();
    void PreloadEntry(const Json::Value& entry, int depth);
    _tag_WEBAPI_ERR CompoundProcess();
    _tag_WEBAPI_ERR CompoundProcessEntry(const Json::Value& entry, unsigned int index);
    bool InitNewPipe(ChildPipe& child, unsigned int index);
    bool ProcessFork(ChildPipe& child);
    [[noreturn]] void RunChild(ChildPipe& child, pid_t parent);
    void PrepareCompundResponse(unsigned int index);
    void PrepareCompundResponse(Json::Value& result, Json::Value& info);
    void PrepareCompundResponseFromChild(LiveChild& child);
    bool WaitForAnswer(LiveChild& child);
    void HandleCompoundInfo();
    void Output(_tag_WEBAPI_ERR code);
    void NewSubResponse();

    APIRequest* req_;
    APIResponse* resp_;
    APIRunner* runner_;
    CompoundLimits limits_;
    int depth_ = 0;
    bool parallel_ = false;
    bool stopWhenError_ = false;
    bool hasFail_ = false;
    Json::Value compound_;
    APIRequest* subReq_ = nullptr;
    APIResponse* subResp_ = nullptr;
    Json::Value output_;
    Json::Value info_;
    std::string errorText_;
    std::vector<LiveChild> children_;
};

}  // namespace VELA
