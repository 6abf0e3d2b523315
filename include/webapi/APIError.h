// Error codes the framework puts into responses. Handlers may use their own
// codes beside these; codes not listed here are theirs.
#pragma once

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

enum _tag_WEBAPI_ERR {
    WEBAPI_ERR_NONE = 0,
    WEBAPI_ERR_BAD_REQUEST = 101,           // malformed request, or it could not be set up
    WEBAPI_ERR_NO_SUCH_API = 102,           // API not described
    WEBAPI_ERR_NO_SUCH_METHOD = 103,        // method not in the API's description
    WEBAPI_ERR_NOT_SUPPORTED_VERSION = 104, // version outside minVersion..maxVersion
    WEBAPI_ERR_NO_PERMISSION = 105,         // permission denied
    WEBAPI_ERR_SESSION_TIMEOUT = 106,       // login session timed out
    WEBAPI_ERR_SESSION_INTERRUPT = 107,     // the platform refused the session
    WEBAPI_ERR_UPLOAD_FAILED = 108,         // receiving the upload failed
    WEBAPI_ERR_RELAY_FAILED = 109,          // relaying to another service failed
    WEBAPI_ERR_COMPOUND_OR_FORK = 110,      // no "compound" parameter, or a task could not fork
    WEBAPI_ERR_LOAD_LIBRARY = 111,          // the handler library could not be opened
    WEBAPI_ERR_COMPOUND_STOPPED = 112,      // skipped after an earlier error (stop_when_error)
    WEBAPI_ERR_COMPOUND_TRANSFER = 113,     // compound entry allows upload or download
    WEBAPI_ERR_TASK_ACCESS = 114,           // polling task access neither "admin" nor "everyone"
    WEBAPI_ERR_UPLOAD_NOT_ALLOWED = 115,    // upload to a method without "allowUpload"
    WEBAPI_ERR_DEMO_MODE = 116,             // demo mode and the method disallows it
    WEBAPI_ERR_NO_RESPONSE = 117,           // the handler answered nothing, or set-up failed
    WEBAPI_ERR_PROCESS_NAME = 118,          // naming the process failed
    WEBAPI_ERR_NOT_AUTHENTICATED = 119,     // not logged in
    WEBAPI_ERR_METHOD_NOT_IN_TABLE = 121,   // method missing from the library's table
    WEBAPI_ERR_SHARING_FIRST = 122,         // 122..127: sharing-link refusals
    WEBAPI_ERR_SHARING_NO_LINK = 122,       // no such link, or a malformed link id
    WEBAPI_ERR_SHARING_LINK_ENDED = 123,    // link revoked, expired, or every use spent
    WEBAPI_ERR_SHARING_NO_SESSION = 124,    // no visitor session of this link: open the link again
    WEBAPI_ERR_SHARING_SESSION_TIMEOUT = 125, // the visitor session ended: open the link again
    WEBAPI_ERR_SHARING_REFUSED = 126,       // not a sharing call, the method or the application refuses it,
                                            // or the link could not be checked
    WEBAPI_ERR_SHARING_REMOTE_IP = 127,     // the session belongs to another client address
    WEBAPI_ERR_SHARING_LAST = 127,
    WEBAPI_ERR_REMOTE_IP = 150,             // client address refused for this session
    // Background tasks (APIPolling), named after what went wrong:
    WEBAPI_ERR_POLLING_FINISH_FAILED = 501,       // the task could not be marked finished
    WEBAPI_ERR_POLLING_BAD_PARAMETER = 502,       // no request, or bad parameters
    WEBAPI_ERR_POLLING_BAD_TASK_ID = 503,         // malformed task id, or its owner refused
    WEBAPI_ERR_POLLING_NO_ADMIN_PERMISSION = 505, // the "admin" group asked by a non-administrator
    WEBAPI_ERR_POLLING_SIGNAL_FAILED = 506,       // the task's worker could not be signalled
    WEBAPI_ERR_POLLING_NO_SUCH_TASK = 508,        // no task of that id
};

// HTTP status codes; the value is the code itself.
enum _tag_HTTP_STATUS_CODE {
    HTTP_STATUS_OK = 200,
    HTTP_STATUS_PARTIAL_CONTENT = 206,
    HTTP_STATUS_MOVED_PERMANENTLY = 301,
    HTTP_STATUS_FOUND = 302,
    HTTP_STATUS_NOT_MODIFIED = 304,
    HTTP_STATUS_BAD_REQUEST = 400,
    HTTP_STATUS_UNAUTHORIZED = 401,
    HTTP_STATUS_FORBIDDEN = 403,
    HTTP_STATUS_NOT_FOUND = 404,
    HTTP_STATUS_RANGE_NOT_SATISFIABLE = 416,
    HTTP_STATUS_INTERNAL_SERVER_ERROR = 500,
    HTTP_STATUS_SERVICE_UNAVAILABLE = 503,
};

#pragma GCC visibility pop
