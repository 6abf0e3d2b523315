// Background-task methods of the sample library (Tasks.cpp); the table that
// exports them is in Sample.cpp.
#pragma once

namespace VELA {
class APIRequest;
class APIResponse;
}  // namespace VELA

namespace Sample {

// "checksum": starts a task that checksums the folder "path" of the first
// data volume ("share": "admin" or "everyone"; "auto_remove"; "pace_ms", a
// pause after every 64 KiB block, for demonstrations).
void Checksum(VELA::APIRequest* req, VELA::APIResponse* resp);
// "taskstatus": the status of "task_id" (one id, or an array of ids).
void TaskStatus(VELA::APIRequest* req, VELA::APIResponse* resp);
// "taskstop": stops "task_id" ("remove": also remove its record).
void TaskStop(VELA::APIRequest* req, VELA::APIResponse* resp);
// "tasklist": the requester's tasks of this API ("group", "finish").
void TaskList(VELA::APIRequest* req, VELA::APIResponse* resp);

}  // namespace Sample
