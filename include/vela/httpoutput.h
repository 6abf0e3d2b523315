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
// Opening: Output(path) opens the path once, without following a symbolic
// link in any of its components (unless the caller opted out with
// SetFollowSymlinks), and checks what it opened with fstat: only a regular
// file is sent, and everything after (size, date, ranges, the content)
// comes from that descriptor, never from the path again. A handler that
// opens the file itself hands over the descriptor (Output(int) or
// Output(FILE*)) the same way.
//
// Fast output: when the deployment says its web server takes the X-Sendfile
// header (xsendfile="yes" in /etc/vela/webapi.conf under the system root)
// and nobody switched it off (VELA::HTTP::FileOutputerHelper), Output(path)
// and Output(int) may write "X-Sendfile: <absolute path, percent-encoded>"
// with the content type, nosniff and the disposition instead of the
// content; the web server then opens the path itself, later, as its own
// user, and sends the file, ranges included. With xaccel_prefix="/PREFIX"
// in the same file (nginx: an internal location mapping /PREFIX to "/"),
// the header is "X-Accel-Redirect: /PREFIX<absolute path, percent-encoded>"
// instead; a prefix that is not "/" and plain segments (letters, digits,
// "-", "_", "~", dots inside a segment; at most 128 bytes) turns fast output
// off (logged). With xsendfile_encoded="no" (a server that takes the path
// as it is, such as mod_xsendfile before 1.0), only a path that needs no
// percent-encoding goes to the server; any other file is streamed. So the path must be one that
// nobody less privileged than the web server can change in between. The
// path is the one the kernel keeps for the open descriptor
// (/proc/self/fd/N), and it is handed over only when
//   - it still leads to the very file that was opened (same device and
//     inode, no symbolic link on the way), and
//   - "/", every directory below it on the way, and the file itself are
//     owned by root or by the web server's account (the real user id of the
//     process), and none of them is writable by its group or by others
//     (a sticky /tmp included).
// Otherwise the file is streamed from the open descriptor as if fast output
// were off (logged at LOG_INFO). Files in a folder a user may write to are
// therefore always streamed. Output(FILE*) never uses X-Sendfile: its
// caller may remove or change the file as soon as the call returns.
//
// Streams: Output(FILE*) also takes a readable stream that is not a regular
// file (a pipe, a socket, a FIFO, a device). Its length is unknown, so it
// goes out with
//   Content-Type, Content-Disposition (as above), Accept-Ranges: none,
//   X-Content-Type-Options: nosniff
// and no Content-Length, Last-Modified or range answer; the body is what
// the stream gives from where its reader stands (bytes already in its
// buffer first) to its end, written as it arrives (the descriptor is
// non-blocking meanwhile, its flags restored afterwards). The answer ends
// when the CGI output does.
//
// Otherwise only regular files are sent. Output returns false, having
// written nothing, when the file cannot be opened, is not a regular file
// (but for the streams above) or is a directory; it returns false
// as well when the client went away or the file shrank while it was being
// sent (the answer is then cut short). No call throws; SIGPIPE never kills
// the process during a call.
#pragma once

#include <cstdio>
#include <string>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

class VELA_EXPORT HTTPFileOutputer {
public:
    HTTPFileOutputer();

    // The MIME type of a file name, from its extension (the text after the
    // last "." of its last component, compared ignoring ASCII case) in
    // /etc/mime.types under the system root, read once per process; a small
    // built-in table serves when that file is missing or unreadable.
    // "application/octet-stream" for anything unknown.
    static std::string GetMimeType(const std::string& name);

    // Opens `path` for reading as Output(path) does: read-only,
    // close-on-exec, without following a symbolic link in any component
    // unless `followSymlinks`, never waiting on a FIFO, and only a regular
    // file (checked on the descriptor). The descriptor, which the caller
    // closes, or -1 with errno set: ELOOP when a component is a symbolic
    // link, EINVAL when `path` is empty, holds a NUL or is not a regular
    // file, ENAMETOOLONG, or the errno of the open.
    static int OpenForOutput(const std::string& path, bool followSymlinks = false);

    // Sends the file at `path` (the content, or X-Sendfile when fast output
    // is on and allowed for it); the disposition names the last component
    // of `path`.
    bool Output(const std::string& path, const std::string& mimeType);
    // Sends the whole of the open regular file `fd` (not closed, read with
    // pread from its first byte: its position does not matter), or
    // X-Sendfile when fast output is on and allowed for it; the file must
    // then stay where it is until the answer is sent. `name` is the file
    // name the client is offered; empty sends no Content-Disposition.
    bool Output(int fd, const std::string& name, const std::string& mimeType);
    // Sends the whole of the open regular file `file`, from its first byte
    // whatever its position (pending output of the stream is flushed
    // first), never through X-Sendfile; any other readable stream to its
    // end without a length (see Streams above). `name` as above. The stream
    // is not closed.
    bool Output(FILE* file, const std::string& name, const std::string& mimeType);

    // Whether Output(path) follows symbolic links (off by default). Only for
    // a caller whose path no one less privileged can change, such as a file
    // of its own installation reached through a link it made; a path that
    // holds anything a client or a user chose must never be followed.
    void SetFollowSymlinks(bool follow);

    // Whether Output writes the Content-Disposition header (on by default);
    // off for callers that printed one of their own.
    void SetWriteDisposition(bool write);

    // Whether Output answers a Range request with 206 or 416 (on by
    // default). Off for callers that printed a Status line of their own:
    // the client then gets the whole file under that status, never a
    // second Status line. Fast output leaves ranges to the web server.
    void SetRangesEnabled(bool enabled);

private:
    bool SendDescriptor(int fd, const std::string& name, const std::string& mimeType, bool serverMayOpen);

    bool writeDisposition_;
    bool honourRanges_;
    bool followSymlinks_;
};

namespace VELA {
namespace HTTP {

// Fast output (X-Sendfile or X-Accel-Redirect), process-wide.
class VELA_EXPORT FileOutputerHelper {
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

#pragma GCC visibility pop
