// HTTP file output of the platform: writes a file as the CGI answer on
// standard output (descriptor 1), after whatever header lines the caller has
// already printed there.
//
// What Output writes, each line ended by "\r\n":
//   Content-Type: <mime type>
//   Content-Disposition: attachment; filename="<ASCII>"; filename*=UTF-8''<name>
//       (when there is a name and the caller did not turn it off)
//   Last-Modified: <HTTP date of the file>
//   Accept-Ranges: bytes     (unless ranges are switched off)
//   Content-Length: <bytes of the body>
//   X-Content-Type-Options: nosniff
// then, for one satisfiable byte range in the CGI variable HTTP_RANGE
// (RFC 9110: "bytes=a-b", "bytes=a-", "bytes=-n"), "Status: 206 Partial
// Content" and "Content-Range: bytes a-b/size"; for an unsatisfiable one
// "Status: 416 Range Not Satisfiable", "Content-Range: bytes */size" and no
// body. Several ranges, a malformed Range, or an If-Range that does not
// match the file's Last-Modified date send the whole file (200). Then the
// empty line and the content, streamed (sendfile, or large reads and
// writes), never held in memory as a whole. A HEAD request gets the headers
// only.
//
// Fast output: when the deployment says its web server takes the X-Sendfile
// header (xsendfile="yes" in /etc/vela/webapi.conf under the system root)
// and nobody switched it off (VELA::HTTP::FileOutputerHelper), Output(path)
// writes "X-Sendfile: <canonical absolute path, percent-encoded>" with the
// content type, nosniff and the disposition, and the web server sends the file,
// ranges included. Output(FILE*) never uses it.
//
// Only regular files are sent. Output returns false, having written nothing,
// when the file cannot be opened or is not a regular file; it returns false
// as well when the client went away or the file shrank while it was being
// sent (the answer is then cut short). No call throws; SIGPIPE never kills
// the process during a call.
#pragma once

#include <cstdio>
#include <string>

class HTTPFileOutputer {
public:
    HTTPFileOutputer();

    // The MIME type of a file name, from its extension (the text after the
    // last "." of its last component, compared ignoring ASCII case) in
    // /etc/mime.types under the system root, read once per process; a small
    // built-in table serves when that file is missing or unreadable.
    // "application/octet-stream" for anything unknown.
    static std::string GetMimeType(const std::string& name);

    // Sends the file at `path` (the content, or X-Sendfile when fast output
    // is on); the disposition names the last component of `path`.
    bool Output(const std::string& path, const std::string& mimeType);
    // Sends the whole of the open regular file `file`, from its first byte
    // whatever its position (pending output of the stream is flushed
    // first). `name` is the file name the client is offered; empty sends no
    // Content-Disposition. The stream is not closed.
    bool Output(FILE* file, const std::string& name, const std::string& mimeType);

    // Whether Output writes the Content-Disposition header (on by default);
    // off for callers that printed one of their own.
    void SetWriteDisposition(bool write);

    // Whether Output answers a Range request with 206 or 416 (on by
    // default). Off for callers that printed a Status line of their own:
    // the client then gets the whole file under that status, never a
    // second Status line. Fast output leaves ranges to the web server.
    void SetRangesEnabled(bool enabled);

private:
    bool writeDisposition_;
    bool honourRanges_;
};

namespace VELA {
namespace HTTP {

// Fast output (X-Sendfile), process-wide.
class FileOutputerHelper {
public:
    // false switches fast output off for the rest of the process; true
    // lets it follow the deployment's configuration again (it cannot turn
    // it on for a server that does not support it).
    static void SetFastOutputEnabled(bool enabled);
    // True when the configuration enables it and it was not switched off.
    static bool IsFastOutputEnabled();
};

}  // namespace HTTP
}  // namespace VELA
