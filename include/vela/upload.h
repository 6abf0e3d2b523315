// Uploads of the CGI library: a streaming reader of multipart/form-data
// bodies (RFC 7578, RFC 2046 section 5.1).
//
// The body is read straight from a file descriptor in fixed-size pieces;
// memory stays constant whatever its size. Form fields are kept in memory
// (bounded, see the limits below); file parts go straight to a directory the
// caller chooses, each under a new unique name ("upload-" and 16 random
// letters or digits, created O_EXCL with mode 0600); the name the client
// sent is never used as a path. The client's file name is reduced to its
// base name (after the last "/" or "\") and refused when that is empty,
// ".", "..", longer than 255 bytes or holds a control byte.
//
// A call either succeeds (1) or fails with one of the VELA_UPLOAD_ERR_*
// codes below; a failed call removes every file it created. A reader that
// failed stays failed: every later call gives the same code. Each refusal
// logs one line that says what the client sent.
//
// Results in tables (vela/vlibc.h string tables):
//   fields: field name -> value, for every part without a file name; a later
//           field of the same name replaces the earlier one. For every stored
//           file also "<key>_name" -> the client's base name of the file.
//   files:  <key> -> path of the stored file. <key> is the file part's field
//           name; a second file under the same field name (a file input with
//           "multiple") gets "<name>_2", the third "<name>_3", and so on, so
//           no stored file is ever left out of the table. Every value of the
//           files table is a stored path, and nothing else.
// A part with an empty file name and no content (a file input left empty)
// is skipped; with content it is refused.
//
// Body syntax is read strictly: lines end with CR LF, delimiters are
// "--boundary" (the first may start the body without a preceding CR LF),
// transport padding of blanks is allowed after a delimiter, the close
// delimiter "--boundary--" must come within CONTENT_LENGTH bytes and the
// input must hold exactly CONTENT_LENGTH bytes (the epilogue is read and
// ignored). Part headers: at most 16 lines of at most 8192 bytes, no folded
// lines, exactly one Content-Disposition of type "form-data" with a "name"
// parameter (1 to 255 bytes, no control byte); "filename" makes the part a
// file; other headers and parameters are ignored. Parameter values are
// tokens or quoted strings; a quoted string ends at the next double quote (a
// backslash is an ordinary byte, as browsers send Windows paths unescaped).
#pragma once

#include <stddef.h>

#include "vela/cgi.h"
#include "vela/vlibc.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {
namespace Transfer {
// Progress of a read: `done` bytes of the body consumed out of `total`
// (CONTENT_LENGTH). Called after each piece read from the input (at most
// once per buffer fill, never per byte), the last time with done == total.
typedef void (*UploadProgressFn)(unsigned long long done, unsigned long long total);
}  // namespace Transfer
}  // namespace VELA

// ---- Results ------------------------------------------------------------------
#define VELA_UPLOAD_OK 1
#define VELA_UPLOAD_ERR_ARGUMENT (-101)     // null or invalid argument, unknown flags,
                                            // a directory that cannot be opened
#define VELA_UPLOAD_ERR_NO_BODY (-102)      // CONTENT_LENGTH missing, not a decimal number, or 0
#define VELA_UPLOAD_ERR_CONTENT_TYPE (-103) // not multipart/form-data, or a missing or invalid
                                            // boundary (1 to 70 characters of RFC 2046 bchars,
                                            // not ending in a space)
#define VELA_UPLOAD_ERR_TRUNCATED (-104)    // the input ended before CONTENT_LENGTH bytes
#define VELA_UPLOAD_ERR_READ (-105)         // reading the input failed
#define VELA_UPLOAD_ERR_SYNTAX (-106)       // no delimiter where one must be: no boundary in the
                                            // body, bad delimiter line, no close delimiter
                                            // within CONTENT_LENGTH bytes
#define VELA_UPLOAD_ERR_HEADER (-107)       // a part header line too long, without end, folded or
                                            // malformed; too many lines; Content-Disposition
                                            // missing, repeated, not "form-data", without or with
                                            // a repeated or invalid "name"
#define VELA_UPLOAD_ERR_LIMIT (-108)        // more than 10000 parts, a field value above 64 KiB,
                                            // fields above 4 MiB in all, or a name that does not
                                            // fit the caller's buffer
#define VELA_UPLOAD_ERR_FILENAME (-109)     // a file name refused (see above)
#define VELA_UPLOAD_ERR_FIELD (-110)        // a field value holding a NUL byte
#define VELA_UPLOAD_ERR_WRITE (-111)        // a stored file could not be created or written
#define VELA_UPLOAD_ERR_MEMORY (-112)       // out of memory
#define VELA_UPLOAD_ERR_STATE (-113)        // no file part is waiting to be stored

// ---- Reader over a file descriptor ----------------------------------------------
// The calls below the CGI library's own; tests and tools feed any
// descriptor. Directories given here are used as they are (not resolved
// under the system root).

namespace VELA {
namespace Transfer {

struct UploadReader;

// A reader of a body of `contentLength` bytes on `fd` (not closed by the
// reader), `contentType` being the value of the Content-Type header. 1 with
// `*reader` set; VELA_UPLOAD_ERR_NO_BODY for a length of 0,
// VELA_UPLOAD_ERR_CONTENT_TYPE, VELA_UPLOAD_ERR_ARGUMENT or
// VELA_UPLOAD_ERR_MEMORY with `*reader` null. Nothing is read yet.
int UploadReaderOpen(int fd, unsigned long long contentLength, const char* contentType,
                     UploadReader** reader);
// Frees the reader (null is ignored). Stored files stay.
void UploadReaderFree(UploadReader* reader);

// Reads form fields up to the next file part (its headers read, its content
// not) or the end of the body. `fields` (may be null) receives every field
// read so far by this reader, the earlier calls' included. 1 on success.
int UploadReadFields(UploadReader* reader, PVLIBCSZHASH fields, UploadProgressFn progress);

// The field name and the client's base name of the file part waiting after
// UploadReadFields; null when none waits.
const char* UploadPendingField(UploadReader* reader);
const char* UploadPendingFileName(UploadReader* reader);

// Stores the waiting file part in `dir`. 1 on success with the stored path in
// `path` (`pathSize` bytes; VELA_UPLOAD_ERR_ARGUMENT before anything is read
// when `dir` + "/upload-XXXXXXXXXXXXXXXX" does not fit) and, when
// `fileTable` is given, "<key>" -> path and "<key>_name" -> client's name
// set in it; VELA_UPLOAD_ERR_STATE when no file part waits.
int UploadReadFile(UploadReader* reader, const char* dir, char* path, size_t pathSize,
                   PVLIBCSZHASH fileTable, UploadProgressFn progress);

// Reads the whole rest of the body, storing files in `dir`. On success (1)
// `fields` and `files` receive every field and file of the body (those of
// earlier calls on this reader included) as described at the top. On failure
// the tables are left unchanged and the files this call created are removed.
// `flags` must be 0.
int UploadReadAll(UploadReader* reader, PVLIBCSZHASH fields, PVLIBCSZHASH files, const char* dir,
                  int flags, UploadProgressFn progress);

// Bytes of the body consumed so far, and CONTENT_LENGTH.
unsigned long long UploadConsumed(UploadReader* reader);
unsigned long long UploadContentLength(UploadReader* reader);

}  // namespace Transfer
}  // namespace VELA

// ---- CGI library ------------------------------------------------------------------
// One reader per process over standard input, created by the first of these
// calls from CONTENT_LENGTH and CONTENT_TYPE of the environment (a failure
// to create it is the result of every call). The three loaders share it, so
// fields that one call read are seen by the later ones: a front end may read
// the leading fields, and the handler the rest. `dir` is a path of the system
// (resolved under the system root unless it already lies inside it).

// Reads form fields up to the next file part or the end of the body into the
// handle's parameter table (VelaCgiGetUploadParams: every field read so far
// in this process). `*contentLength` (may be null) receives CONTENT_LENGTH (0
// when the reader could not be created). When a file part waits:
// `fieldName` = its field name, `fileName` and `fieldValue` = the client's
// base name of the file; otherwise the three are "". VELA_UPLOAD_ERR_LIMIT
// when a name does not fit its buffer (the part is left waiting).
// 1 on success.
int VelaCgiLoadUploadParams(VELACGI_CTX* ctx, VELA::Transfer::UploadProgressFn progress,
                            unsigned long long* contentLength, char* fileName, size_t fileNameSize, char* fieldName,
                            size_t fieldNameSize, char* fieldValue, size_t fieldValueSize);

// Stores the waiting file part in `dir`, then reads the fields that follow
// it up to the next file part, as VelaCgiLoadUploadParams does (buffers and
// parameter table updated the same way). The handle's file table
// (VelaCgiGetUploadFiles) then holds this file only: "<key>" -> stored path,
// "<key>_name" -> client's base name. VELA_UPLOAD_ERR_STATE when no file part
// waits. On failure the stored file is removed. 1 on success.
int VelaCgiLoadUploadFileToDir(VELACGI_CTX* ctx, const char* dir, VELA::Transfer::UploadProgressFn progress,
                               char* fileName, size_t fileNameSize, char* fieldName, size_t fieldNameSize,
                               char* fieldValue, size_t fieldValueSize);

// VELA::Transfer::UploadReadAll on the process's reader: the rest of the
// body, files in `dir`, the whole body's fields and files into the two
// tables. `flags` must be 0. 1 on success.
int VelaCgiLoadUploadAll(PVLIBCSZHASH fields, PVLIBCSZHASH files, const char* dir, int flags,
                         VELA::Transfer::UploadProgressFn progress = nullptr);

// The handle's upload tables (owned by the handle, null before the first
// load), valid until the next load or VelaCgiFree.
PVLIBCSZHASH VelaCgiGetUploadParams(VELACGI_CTX* ctx);
PVLIBCSZHASH VelaCgiGetUploadFiles(VELACGI_CTX* ctx);

// Forgets the process's reader, so the next call reads the environment and
// standard input afresh, and removes the process's private upload directory
// (vela/uploaddir.h) with what it holds (tests).
void VelaCgiUploadReset(void);

#pragma GCC visibility pop
