// Letting go of the reply in a process that outlives it (after-reply
// callbacks, background tasks).
#pragma once

namespace VELA {

// Lets go of every descriptor the web server may be waiting on, since a CGI
// answer ends only when every process holding its write end has closed it.
// Standard input and output go to /dev/null, standard error too when it is
// a pipe or a socket (a log file stays), and every other inherited pipe or
// socket is closed; the system log's socket goes with them and is opened
// again by the next line logged.
void LetGoOfTheReply();

}  // namespace VELA
