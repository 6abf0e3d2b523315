// Runs one web-API method on behalf of a named user, outside any web
// request: builds the request JSON by hand, dispatches it through a runner
// of its own (in this process or in a forked child) and hands back the
// response JSON. APIRunner::Exec is its front door.
#pragma once

#include <json/json.h>
#include <string>

#include "webapi/APIRunner.h"

namespace VELA {

class ExecHandler {
public:
    // Nothing is copied: the strings and JSON values must outlive Process.
    // `params` are the call's parameters ("api", "method" and "version" in
    // them are replaced by the arguments), `attr` the request's attributes.
    // `outFd` >= 0 forwards the body the handler writes to its standard
    // output (a CGI reply: headers, an empty line, the body) to that
    // descriptor; -1 forwards nothing.
    ExecHandler(const char* api, int version, const char* method, const Json::Value& params,
                const Json::Value& attr, const char* user, int outFd);
    ExecHandler(const ExecHandler&) = delete;
    ExecHandler& operator=(const ExecHandler&) = delete;

    // The whole call, from the web-API directory (the working directory is
    // put back afterwards). `result` is the response JSON ({"success": ...,
    // "httpd_restart": ...}), or {"success": false, "error": {"code": N}}
    // for the handler's own failures: 101 api, method or user missing (or a
    // user name no account can have, or params that are not an object),
    // 117 the web-API directory, a fork or the child's answer failed.
    //
    // With `outFd` < 0 a method that keeps the way back to the caller's
    // identity ("grantable") or runs with full rights ("grantByDefault") runs
    // in this process; any other runs in a detached child, so that its
    // identity switch never touches the caller. With `outFd` >= 0 the
    // method always runs in a child. A child's standard input is /dev/null,
    // and so is its standard output unless it is forwarded: it never
    // writes into the caller's reply. The caller waits for the child, not
    // for processes the handler left behind holding the child's pipes: once
    // the child has ended (seen through a pidfd), what it wrote is read and
    // the rest is not waited for.
    void Process(Json::Value& result);

    // True when api, method and user are given; else `result` is 101.
    bool CheckParams(Json::Value& result);
    // Builds the request JSON: "session" (the user, administrator or not),
    // "environ" (a POST), "postParam" (params with the call's api, method
    // and version) and "attr".
    void PrepareReq();
    // Dispatches in this process with USERNAME and VELA_WEBAPI_USERNAME set
    // to the user; unless `inChild`, both are put back as they were.
    void Run(Json::Value& result, bool inChild);
    // Dispatches in a child; its answer comes back through a Pipe.
    void RunFork(Json::Value& result);
    // Dispatches in a child whose standard output is read here: the header
    // block, up to the first "\r\n\r\n" found within one read of at most
    // 4095 bytes, is dropped, the rest goes to outFd.
    void RunForkForStdout(Json::Value& result);

    const Json::Value& Request() const { return request_; }

private:
    const char* api_;
    int version_;
    const char* method_;
    const Json::Value& params_;
    const Json::Value& attr_;
    const char* user_;
    APIRunner runner_;
    Json::Value request_;
    int outFd_;
};

}  // namespace VELA
