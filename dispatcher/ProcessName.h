// The names under which the process shows the call it serves.
#pragma once

#include <string>

namespace VELA {

class APIName;
class APIResponse;
class APIRunnerPrivate;

// Shows the call `api` `version` `method` as the log identity, argument 0
// and the thread name; nothing to do when they already show it. False, with
// error 118 on `resp` (when not null) and one line, when the thread name
// cannot be set.
bool NameProcess(APIRunnerPrivate& d, const APIName& api, int version, const std::string& method,
                 APIResponse* resp);
// Puts the name the process started with back everywhere.
void RestoreProcessName(APIRunnerPrivate& d);
// The log identity the process names itself with ("" before it is named):
// for a child that closes the log and opens it again.
const char* ProcessLogIdent();

}  // namespace VELA
