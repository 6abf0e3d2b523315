#include "webapi/APIResponse.h"

#include "response/APIResponsePrivate.h"

namespace VELA {

APIResponse::APIResponse(APIRequest* request) : d_(new APIResponsePrivate(request, this))
{
    SetHeader("Content-type", "application/json; charset=\"UTF-8\"");
}

APIResponse::~APIResponse() { delete d_; }

void APIResponse::SetSuccess(Json::Value const& data) { d_->SetError(0, data); }

void APIResponse::SetError(int code, Json::Value const& details) { d_->SetError(code, details); }

int APIResponse::GetError() const { return d_->GetError(); }

Json::Value APIResponse::GetBody() const { return d_->GetBody(); }

bool APIResponse::HasHeader(std::string const& name) const { return d_->HasData("headers", name); }

bool APIResponse::SetHeader(std::string const& name, std::string const& value)
{
    return d_->SetHeader(name, value);
}

std::string APIResponse::GetHeader(std::string const& name, std::string const& defaultValue) const
{
    return d_->GetHeaderString(name, defaultValue);
}

Json::Value APIResponse::GetHeaders() const
{
    Json::Value headers = d_->GetSection("headers");
    return headers.isObject() ? headers : Json::Value(Json::objectValue);
}

bool APIResponse::SetStatus(_tag_HTTP_STATUS_CODE code, std::string const& message)
{
    return d_->SetStatus(code, message);
}

int APIResponse::GetStatus() const { return d_->GetStatus(); }

bool APIResponse::Redirect(std::string const& path) { return d_->Redirect(path); }

// "isDownload" is true for the normal output; a handler that writes its own
// output turns it off.
bool APIResponse::IsEnableOutput() const { return d_->GetOption("isDownload", true); }

bool APIResponse::SetEnableOutput(bool enable) { return d_->SetOption("isDownload", enable); }

bool APIResponse::GetHttpdRestart() const { return d_->GetOption("restart_httpd", false); }

bool APIResponse::SetHttpdRestart(bool restart) { return d_->SetOption("restart_httpd", restart); }

std::string APIResponse::GetServerError() const { return d_->GetHeaderString("x-request-error", ""); }

bool APIResponse::SetServerError(std::string const& message)
{
    return d_->SetHeader("x-request-error", message);
}

bool APIResponse::HasServerError() const { return d_->HasData("headers", "x-request-error"); }

void APIResponse::SetCallbackFunc(APICallbackFn fn, void* arg) { d_->AddCallback(fn, arg); }

const APICallbackList& APIResponse::GetCallbackFuncs() const { return d_->Callbacks(); }

void APIResponse::SetCallbackFuncs(const void* list)
{
    if (!list) {
        return;
    }
    const APICallbackList& other = *static_cast<const APICallbackList*>(list);
    // A copy first: `list` may be this response's own list.
    const APICallbackList pairs(other);
    for (const auto& entry : pairs) {
        d_->AddCallback(entry.first, entry.second);
    }
}

bool APIResponse::AddCookie(std::string const& name, std::string const& value,
                            std::string const& path, long expireMinutes, std::string const& domain,
                            bool secure, bool httpOnly)
{
    return d_->AddCookie(name, value, path, expireMinutes, domain, secure, httpOnly, "");
}

bool APIResponse::AddCookie(std::string const& name, std::string const& value,
                            std::string const& path, long expireMinutes, std::string const& domain,
                            bool secure, bool httpOnly, std::string const& sameSite)
{
    return d_->AddCookie(name, value, path, expireMinutes, domain, secure, httpOnly, sameSite);
}

Json::Value APIResponse::GetCookies() const { return d_->GetCookies(); }

}  // namespace VELA
