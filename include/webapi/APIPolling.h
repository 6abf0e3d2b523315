// Background tasks: work that outlives the request which starts it.
//
// A handler creates an APIPolling on its request, sets the task's
// attributes and calls Start with the work function. The work runs in a
// detached worker process that leads its own session; the request answers
// {"task_id": "<owner>/<short id>"} once the worker has reported its first
// result (SetSuccess/SetError on its response, or SetProgress), or has
// ended, or after 60 seconds. Later requests read the task's record with
// Status, stop it with Stop or list tasks with List.
//
// The owner of a task is the login user, or "@administrators" (group
// "admin": every administrator) or "@users" (group "everyone": every user).
// Errors are kept by the object (GetError): 501 finishing failed, 502 no
// request or bad parameters, 503 malformed task id or owner refused, 505 the
// "admin" group asked by a non-administrator, 506 the worker could not be
// signalled, 508 no such task. Start answers 105, 110 or 114 on the response.
#pragma once

#include <json/json.h>
#include <string>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

class APIRequest;
class APIResponse;
// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
class APIPollingPrivate;
#pragma GCC visibility pop

class VELA_EXPORT APIPolling {
public:
    APIPolling();
    explicit APIPolling(APIRequest* request);
    ~APIPolling();
    APIPolling(const APIPolling&) = delete;
    APIPolling& operator=(const APIPolling&) = delete;

    void SetRequest(APIRequest* request);

    // Attributes of the next Start.
    // Prefix of the short id: letters, digits, "_", "-", ".", at most 32.
    bool SetPrefixAttr(const std::string& prefix);
    // "admin", "everyone", or "" for the login user.
    bool SetGroupAttr(const std::string& group);
    // Remove the record as soon as the work has finished.
    bool SetRemoveAttr(bool remove);
    // Keep the request's parameters out of the task record ("info" then has
    // no "param"). The session id, access token and sharing parameters are
    // never kept.
    bool SetRemoveParam(bool remove);

    // Starts `work(request, response, data)` in a worker. The worker's
    // SetSuccess/SetError write the task's "body". False (error on `resp`
    // or GetError) when the task could not be started.
    bool Start(APIResponse* resp, void (*work)(APIRequest*, APIResponse*, void*), void* data);

    // The task's last "body", with "finish", "auto_remove", "info" and
    // "progress". A task whose worker died without finishing is marked
    // finished, with error 117 in its body.
    bool Status(const std::string& fullTaskId, Json::Value& out);
    bool Status(const char* fullTaskId, Json::Value& out);
    // Several ids (an array of full ids, or one as a string): `out` is an
    // object keyed by id, each the status of that task or {"error": code}.
    // True when every id was answered with its status.
    bool Status(const Json::Value& ids, Json::Value& out);

    // Sends the worker SIGTERM and marks the task finished (or removes it
    // with `removeRecord`). A worker already gone is not an error.
    bool Stop(const std::string& fullTaskId, bool removeRecord);

    // The requester's tasks of `api`: {"tasks": [...], "total": n}, newest
    // first, each {"task_id", "finish", "created", "info", "progress"}.
    // `filter` (an object, may be null): "group" ("user", "admin",
    // "everyone", or an array of them) picks the owners; "method" a method;
    // "finish" true or false.
    bool List(const std::string& api, const Json::Value& filter, Json::Value& out);

    // In a worker: records its progress, `percent` held to 0..100 and a
    // short description (at most 256 bytes). False outside a worker.
    bool SetProgress(int percent, const std::string& description);

    int GetError() const;
    void SetError(int code);

private:
    APIPollingPrivate* d_;
};

}  // namespace VELA

#pragma GCC visibility pop
