// The private side of APIResponse: the keyed store with its sections
//   "headers"    header name -> string value ("Content-type", "Status", ...)
//   "setCookie"  array of Set-Cookie lines, in call order
//   "success"    kept for the layout of the store; nothing writes it
//   "option"     output options ("statusMsg", "isDownload", "restart_httpd")
//   "body"       the JSON result, created by the first SetError/SetSuccess
// plus the error code and the functions to run after the reply.
#pragma once

#include <json/json.h>
#include <ctime>
#include <memory>
#include <string>

#include "base/APIBase.h"
#include "vela/task.h"
#include "webapi/APIResponse.h"

namespace VELA {

class APIRequest;

class APIResponsePrivate : public APIBase {
public:
    // `request` may be null and is not owned; `owner` is the public object.
    APIResponsePrivate(APIRequest* request, APIResponse* owner);
    ~APIResponsePrivate() override;

    APIResponsePrivate(const APIResponsePrivate&) = delete;
    APIResponsePrivate& operator=(const APIResponsePrivate&) = delete;

    // Replaces the body with a success (code 0) or error body and records
    // the code.
    void SetError(int code, const Json::Value& details);
    int GetError() const { return errorCode_; }
    Json::Value GetBody() const;

    // Header writes refuse an empty name and CR/LF in the name or value.
    bool SetHeader(const std::string& name, const std::string& value);
    std::string GetHeaderString(const std::string& name, const std::string& def) const;

    bool SetStatus(int code, const std::string& message);
    int GetStatus() const;
    bool Redirect(const std::string& path);

    bool GetOption(const char* key, bool def) const;
    bool SetOption(const char* key, bool value);

    void AddCallback(APICallbackFn fn, void* arg);
    const APICallbackList& Callbacks() const { return callbacks_; }

    // `sameSite`: "", "Strict", "Lax" or "None" (see APIResponse::AddCookie).
    bool AddCookie(const std::string& name, const std::string& value, const std::string& path,
                   long expireMinutes, const std::string& domain, bool secure, bool httpOnly,
                   const std::string& sameSite);
    Json::Value GetCookies() const;

    // A copy of a whole section (null when missing).
    Json::Value GetSection(const char* section) const;

    APIRequest* Request() const { return request_; }
    APIResponse* Owner() const { return owner_; }

private:
    // The reference time of cookie expiry: the request's "client_time" when
    // present (0 when it is not an integer), else now.
    time_t CookieReferenceTime() const;

    // A polling task's record receives the body it answered (the record's
    // "body" = `body`, "task_run" = true, inside one update).
    void UpdatePollingTask(const Json::Value& body);

    APIRequest* request_;
    APIResponse* owner_;
    int errorCode_ = 0;
    APICallbackList callbacks_;
    // The polling task this response answers for, made on first use.
    std::unique_ptr<TARN::Task> task_;
};

}  // namespace VELA
