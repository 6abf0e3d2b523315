// The response a handler fills in: the JSON result, headers, status,
// cookies, output options and functions to run after the reply.
//
// Body format:
//   success  {"success": true, "data": <data>}     ("data" only when not null)
//   error    {"success": false, "error": {"code": <int>, "errors": <details>}}
//            ("errors" only when not null)
// The last SetSuccess/SetError wins. Failures are reported by false returns,
// never by exceptions.
#pragma once

#include <json/json.h>
#include <string>
#include <utility>
#include <vector>

#include "webapi/APIError.h"

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

class APIRequest;
// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
class APIResponsePrivate;
#pragma GCC visibility pop

typedef void (*APICallbackFn)(void*);
// Functions to run after the reply, in order, without duplicates.
typedef std::vector<std::pair<APICallbackFn, void*>> APICallbackList;

class VELA_EXPORT APIResponse {
public:
    // `request` may be null; it is not owned. The header "Content-type" starts
    // as JSON in UTF-8.
    explicit APIResponse(APIRequest* request);
    APIResponse(const APIResponse&) = delete;
    APIResponse& operator=(const APIResponse&) = delete;
    virtual ~APIResponse();

    void SetSuccess(Json::Value const& data = Json::Value());
    // `code` 0 is a success with `details` as data.
    void SetError(int code, Json::Value const& details = Json::Value());
    // The code of the last SetError/SetSuccess, 0 when none.
    int GetError() const;
    // A copy of the body; an empty object before the first SetSuccess/SetError.
    Json::Value GetBody() const;

    bool HasHeader(std::string const& name) const;
    // Replaces an earlier value of the same name. Refused (false) when the
    // name is empty or the name or value holds CR or LF, so no handler text
    // can add a header line of its own.
    bool SetHeader(std::string const& name, std::string const& value);
    std::string GetHeader(std::string const& name, std::string const& defaultValue = "") const;
    Json::Value GetHeaders() const;

    // Header "Status" = `code`; option "statusMsg" = `message`.
    bool SetStatus(_tag_HTTP_STATUS_CODE code, std::string const& message);
    // 200 unless a status was set.
    int GetStatus() const;
    // "Location" = <proto>://<HTTP_HOST>/<path>, status 302. The path is
    // always on the current host; a missing leading "/" is added. False
    // without a request or for an empty path.
    bool Redirect(std::string const& path);

    // Whether the front end writes the header block and JSON body (true
    // unless a handler writes its own output, as a download does).
    bool IsEnableOutput() const;
    bool SetEnableOutput(bool enable);
    bool GetHttpdRestart() const;
    bool SetHttpdRestart(bool restart);

    // The message sent to the client as the header "x-request-error".
    std::string GetServerError() const;
    bool SetServerError(std::string const& message);
    bool HasServerError() const;

    // Appends (fn, arg) unless a null fn or already listed.
    void SetCallbackFunc(APICallbackFn fn, void* arg);
    const APICallbackList& GetCallbackFuncs() const;
    // Adds every pair of another response's list (GetCallbackFuncs), in
    // order, without duplicates; null is ignored.
    void SetCallbackFuncs(const void* list);

    // Appends one Set-Cookie line. `name`: letters, digits, "_" and "-" only;
    // `path` required. `expireMinutes` > 0 expires that many minutes after
    // the reference time (the request's "client_time" when given, else now),
    // 0 lasts the browser session, < 0 deletes the cookie. The value is
    // URL-encoded, so any bytes may be in it; `domain` is written when
    // non-empty. A path or domain holding CR or LF refuses the cookie.
    bool AddCookie(std::string const& name, std::string const& value, std::string const& path,
                   long expireMinutes, std::string const& domain, bool secure, bool httpOnly);
    // The same, with "; SameSite=<sameSite>" at the end of the line:
    // `sameSite` is "Strict", "Lax" or "None" (browsers take "None" only
    // with `secure`); "" adds nothing; anything else refuses the cookie.
    bool AddCookie(std::string const& name, std::string const& value, std::string const& path,
                   long expireMinutes, std::string const& domain, bool secure, bool httpOnly,
                   std::string const& sameSite);
    // The Set-Cookie lines, in call order.
    Json::Value GetCookies() const;

    // The private object; for the framework's own use.
    APIResponsePrivate* GetPrivate() const { return d_; }

private:
    APIResponsePrivate* d_;
};

}  // namespace VELA

#pragma GCC visibility pop
