#include "response/APIResponsePrivate.h"

#include <algorithm>
#include <cstring>
#include <sstream>

#include "polling/TaskAccess.h"
#include "response/Cookie.h"
#include "vela/log.h"
#include "webapi/APIError.h"
#include "webapi/APIRequest.h"

namespace VELA {

namespace {

// A header line ends at CR or LF; a name or value holding one would let the
// caller's text start a header (or the body) of its own.
bool IsHeaderText(const std::string& text)
{
    return !Cookie::HasLineBreak(text);
}

}  // namespace

APIResponsePrivate::APIResponsePrivate(APIRequest* request, APIResponse* owner)
    : request_(request), owner_(owner)
{
    data_["headers"] = Json::Value(Json::objectValue);
    data_["setCookie"] = Json::Value(Json::arrayValue);
    data_["success"] = Json::Value(Json::objectValue);
    data_["option"] = Json::Value(Json::objectValue);
}

APIResponsePrivate::~APIResponsePrivate() = default;

void APIResponsePrivate::SetError(int code, const Json::Value& details)
{
    // Built aside and then swapped in, so `details` may even be part of the
    // old body.
    Json::Value body(Json::objectValue);
    if (code != 0) {
        body["success"] = false;
        Json::Value& error = body["error"];
        error["code"] = code;
        if (!details.isNull()) {
            error["errors"] = details;
        }
    } else {
        body["success"] = true;
        if (!details.isNull()) {
            body["data"] = details;
        }
    }
    // "body" is not a section SetData could write: it is replaced whole.
    data_["body"].swap(body);
    errorCode_ = code;

    if (request_ && request_->IsPollingTask()) {
        UpdatePollingTask(data_["body"]);
    }
}

void APIResponsePrivate::UpdatePollingTask(const Json::Value& body)
{
    if (!task_) {
        task_.reset(new TARN::Task(request_->GetEnv("task_user").asString(), request_->GetEnv("task_id").asString()));
    }
    TaskAccess access;
    if (!access.Ok() || !task_->beginUpdate()) {
        VELA_LOG_ERR("cannot record the answer of task [%s]", request_->GetPollingTaskId().c_str());
        return;
    }
    task_->setProperty("body", body);
    task_->setProperty("task_run", true);
    if (task_->endUpdate()) {
        return;
    }
    VELA_LOG_ERR("cannot record the answer of task [%s]", request_->GetPollingTaskId().c_str());
    // An answer too large for the record: the status says so instead of
    // showing an older answer as the last one.
    Json::Value failed(Json::objectValue);
    failed["success"] = false;
    failed["error"]["code"] = WEBAPI_ERR_NO_RESPONSE;
    failed["error"]["errors"]["reason"] = "the answer could not be recorded";
    if (task_->beginUpdate()) {
        task_->setProperty("body", failed);
        task_->setProperty("task_run", true);
        task_->endUpdate();
    }
}

Json::Value APIResponsePrivate::GetBody() const
{
    const Json::Value* body = data_.find("body", "body" + 4);
    return body ? *body : Json::Value(Json::objectValue);
}

Json::Value APIResponsePrivate::GetSection(const char* section) const
{
    const Json::Value* sec = data_.find(section, section + strlen(section));
    return sec ? *sec : Json::Value();
}

bool APIResponsePrivate::SetHeader(const std::string& name, const std::string& value)
{
    if (name.empty() || !IsHeaderText(name) || !IsHeaderText(value)) {
        return false;
    }
    return SetData("headers", name, Json::Value(value), true);
}

std::string APIResponsePrivate::GetHeaderString(const std::string& name, const std::string& def) const
{
    const Json::Value* headers = data_.find("headers", "headers" + 7);
    if (!headers || !headers->isObject()) {
        return def;
    }
    const Json::Value* entry = headers->find(name.data(), name.data() + name.size());
    return entry && entry->isString() ? entry->asString() : def;
}

bool APIResponsePrivate::SetStatus(int code, const std::string& message)
{
    // The message ends up on the status line, so it is held to the same rule
    // as a header value; nothing is written when it breaks it.
    if (!IsHeaderText(message) || !SetHeader("Status", std::to_string(code))) {
        return false;
    }
    return SetData("option", "statusMsg", Json::Value(message), true);
}

int APIResponsePrivate::GetStatus() const
{
    // A header that does not start with a number in range reads as 0.
    std::istringstream in(GetHeaderString("Status", "200"));
    int code = 0;
    if (!(in >> code)) {
        return 0;
    }
    return code;
}

bool APIResponsePrivate::Redirect(const std::string& path)
{
    if (!request_ || path.empty()) {
        return false;
    }
    Json::Value host = request_->GetEnv("HTTP_HOST", Json::Value(""));
    std::string location = request_->GetURLProto() + "://" + (host.isString() ? host.asString() : "");
    if (path[0] != '/') {
        location += "/";
    }
    location += path;
    if (!SetHeader("Location", location)) {
        return false;
    }
    return SetStatus(HTTP_STATUS_FOUND, "");
}

bool APIResponsePrivate::GetOption(const char* key, bool def) const
{
    const Json::Value* option = data_.find("option", "option" + 6);
    if (!option || !option->isObject()) {
        return def;
    }
    const Json::Value* entry = option->find(key, key + strlen(key));
    return entry && entry->isBool() ? entry->asBool() : def;
}

bool APIResponsePrivate::SetOption(const char* key, bool value)
{
    return SetData("option", key, Json::Value(value), false);
}

void APIResponsePrivate::AddCallback(APICallbackFn fn, void* arg)
{
    if (!fn) {
        return;
    }
    const std::pair<APICallbackFn, void*> entry(fn, arg);
    if (std::find(callbacks_.begin(), callbacks_.end(), entry) != callbacks_.end()) {
        return;
    }
    callbacks_.push_back(entry);
}

time_t APIResponsePrivate::CookieReferenceTime() const
{
    if (request_ && request_->HasParam("client_time")) {
        return Cookie::ParseClientTime(request_->GetParam("client_time", Json::Value(0)));
    }
    return time(nullptr);
}

bool APIResponsePrivate::AddCookie(const std::string& name, const std::string& value,
                                   const std::string& path, long expireMinutes,
                                   const std::string& domain, bool secure, bool httpOnly,
                                   const std::string& sameSite)
{
    if (name.empty() || path.empty()) {
        return false;
    }
    if (!Cookie::IsValidName(name)) {
        VELA::System::Log(LOG_ERR, "%s(%d)%s: key[%s] contains invalid character", "APIResponse", 84,
                          "AddCookie", name.c_str());
        return false;
    }
    // The value is URL-encoded ("a\nb" goes out as "a%0Ab"), but path and
    // domain go into the line as they are: a line break there would end the
    // Set-Cookie header early.
    if (Cookie::HasLineBreak(path) || Cookie::HasLineBreak(domain)) {
        VELA_LOG_ERR("cookie [%s] refused: line break in path or domain", name.c_str());
        return false;
    }
    if (!sameSite.empty() && sameSite != "Strict" && sameSite != "Lax" && sameSite != "None") {
        VELA_LOG_ERR("cookie [%s] refused: SameSite must be Strict, Lax or None", name.c_str());
        return false;
    }
    // An expiry past what time_t or struct tm can hold is refused rather than
    // clamped: a silently different date would be worse than no cookie.
    time_t reference = expireMinutes > 0 ? CookieReferenceTime() : 0;
    std::string line;
    if (!Cookie::BuildLine(name, value, path, expireMinutes, reference, domain, secure, httpOnly,
                           line)) {
        VELA_LOG_ERR("cookie [%s] refused: expiry of %ld minutes from %lld is out of range",
                     name.c_str(), expireMinutes, static_cast<long long>(reference));
        return false;
    }
    if (!sameSite.empty()) {
        line += "; SameSite=" + sameSite;
    }
    // APIBase::SetData writes object sections only; this one is an array.
    Json::Value& cookies = data_["setCookie"];
    if (!cookies.isArray() && !cookies.isNull()) {
        return false;
    }
    cookies.append(Json::Value(line));
    return true;
}

Json::Value APIResponsePrivate::GetCookies() const
{
    Json::Value cookies = GetSection("setCookie");
    return cookies.isArray() ? cookies : Json::Value(Json::arrayValue);
}

}  // namespace VELA
