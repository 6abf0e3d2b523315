// A handler's answer with a file instead of JSON.
//
//   VELA::APIDownload download(response);
//   download.SetHeader("X-Job", "42");
//   if (!download.Output("/volume1/share/report.pdf")) {
//       response->SetError(WEBAPI_ERR_...);   // nothing was written
//   }
//
// Output prints the response's own string headers, then hands the file to
// the platform's HTTP file outputer (vela/httpoutput.h), which writes the
// content type, length, disposition and byte ranges, the empty line and the
// content (or the web server's X-Sendfile header when fast output is on).
// Once it has written anything it switches the response's own output off
// (APIResponse::SetEnableOutput(false)), so no JSON follows the file.
// The response's "Content-type" and "Content-Length" headers are not
// printed: the outputer writes the file's; a "Content-Disposition" of the
// response replaces the outputer's attachment header.
//
// A path is opened once, without following a symbolic link in any of its
// components, and checked on the open descriptor, so a user who can write
// to a folder on the way cannot swap the file for a link to one they may
// not read. A handler that needs a link followed (one it trusts) opens the
// file itself and hands over the descriptor. X-Sendfile is used only for a
// path no one less privileged than the web server can change (see
// vela/httpoutput.h); any other file is streamed from the open descriptor.
#pragma once

#include <cstdio>
#include <json/json.h>
#include <string>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

class APIResponse;
// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
class APIDownloadPrivate;
#pragma GCC visibility pop

class VELA_EXPORT APIDownload {
public:
    // With a response of its own, made without a request and deleted with
    // the download.
    APIDownload();
    // With the handler's `response` (not owned; null makes SetHeader fail).
    explicit APIDownload(APIResponse* response);
    ~APIDownload();
    APIDownload(const APIDownload&) = delete;
    APIDownload& operator=(const APIDownload&) = delete;

    // APIResponse::SetHeader on the response; false without one or when
    // the response refuses the header (empty name, CR or LF).
    bool SetHeader(std::string const& name, std::string const& value);
    // Sets every member of `headers` whose value is a string, in member
    // order; others are skipped. Stops at the first refusal (false);
    // earlier members stay set.
    bool SetHeader(Json::Value const& headers);

    // The Content-Type sent; empty (the start) derives it at output time.
    void SetMimeType(std::string const& mimeType);
    void SetMimeTypeFromFileName(std::string const& name);

    // Sends the file at `path`; without a MIME type it is derived from the
    // path. False, with nothing written, when `path` is not a regular file
    // or a symbolic link is on it; false as well when sending fails after
    // the headers went out.
    bool Output(std::string const& path);
    // Sends the whole of the open regular file `fd` (not closed), offered as
    // `name` (empty: no Content-Disposition); without a MIME type it is
    // derived from `name`. The file must stay where it is until the answer
    // is sent (X-Sendfile). False, with nothing written, when `fd` is not a
    // readable regular file.
    bool Output(int fd, std::string const& name);
    // Sends the open stream `file` (not closed), as
    // application/octet-stream unless a MIME type was set, without a file
    // name: a regular file whole, with its length; any other readable
    // stream (a pipe from popen, a socket, a FIFO) from where its reader
    // stands to its end, without a length and without ranges. False, with
    // nothing written, when `file` cannot be read or is a directory.
    bool Output(FILE* file);

    // Fast output (X-Sendfile) off for the rest of the process.
    static void SetXSendFileDisabled();
    static bool GetXSendFileEnabled();

    // Writes the response's string headers ("name: value\r\n") to standard
    // output, except those the outputer writes itself (see above).
    void PrintHeader();

private:
    bool SendOpen(int fd, std::string const& name, std::string const& mimeType);

    APIDownloadPrivate* d_;
};

}  // namespace VELA

#pragma GCC visibility pop
