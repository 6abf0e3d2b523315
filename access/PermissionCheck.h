// The session permission check of a call: whether its method needs a login,
// the login-session / access-token verdict of the platform with its cache,
// the user classes and the application privilege of the API.
//
// A runner owns one PermissionCheck for its life and hands it the calls of
// its permission hooks. The verdict of the platform (VelaCgiIsAuthorizedEx,
// VelaAccessTokenGrant) is asked at most once per value of "allowTimeout"
// and kept in the check: {"permResult": [verdict with timeout allowed,
// verdict without]}, null until asked. A token's verdict holds for the one
// API and method it was granted for: every call of a compound request is
// checked on its own.
#pragma once

#include <json/json.h>
#include <string>

#include "vela/cgi.h"
#include "vela/export.h"

namespace VELA {

class APIRequest;
class APIResponse;
class APIRunner;

// Exported for the tests (VELA_EXPORT: see vela/export.h).
class VELA_EXPORT PermissionCheck {
public:
    // `runner` answers the method attributes the check reads ("allowTimeout",
    // "skipCheckIP", the method's own "allowUser") and holds the request
    // whose session is checked: the call the runner built.
    explicit PermissionCheck(APIRunner& runner);
    ~PermissionCheck();
    PermissionCheck(const PermissionCheck&) = delete;
    PermissionCheck& operator=(const PermissionCheck&) = delete;

    // From the API's "authLevel" (absent or not a number: 1): a login is
    // needed unless it is 0 (true for a null request); a refusal is not
    // enforced when it is 2 (false for a null request).
    static bool NeedPermission(const APIRequest* req);
    static bool SkipPermission(const APIRequest* req);

    // The session check of the runner's request: the error code of the
    // platform's verdict (0 allowed, 105, 106, 119 or 150), the verdict and
    // the session facts stored in the request. `cgi` is the runner's CGI
    // handle; null (a runner built by hand) uses one of the check's own.
    int CheckPermission(bool allowTimeout, VELACGI_CTX* cgi);
    // The same for `req`, which may be another call of the same client (a
    // call of a compound request): a cached session verdict is given with
    // the session facts it produced; a verdict that an access token gave
    // holds only for the API and method it was asked for, and another call
    // asks the platform again.
    int CheckRequest(APIRequest* req, bool allowTimeout, VELACGI_CTX* cgi);
    // The whole check of `req`: the session check with the method's
    // "allowTimeout", its error code and server-error word on `resp`, then
    // the user classes and the application privilege (105). True when the
    // call may go on; the session facts are rebuilt with "appPriv".
    bool CheckPermission(APIRequest* req, APIResponse* resp, VELACGI_CTX* cgi);

    // The check of a call relayed to a peer: the session check (error code
    // and server-error word on `resp`, as above), then the relay privilege
    // (kRelayPrivilege, vela/relay.h: administrators hold it, others when
    // granted) from the client's address, else 105. The relayed call's own
    // rules ("allowUser", "appPriv") are the peer's to judge.
    bool CheckRelay(APIRequest* req, APIResponse* resp, bool allowTimeout, VELACGI_CTX* cgi);

    // The rules of the whole check that do not depend on a session, for a
    // caller that already acts as the user of `req`'s session facts
    // ("username", "isAdmin"), the API's description handed to `req`
    // (APIRunner::AddAPIInfo): an "authLevel" of 0 admits everyone;
    // otherwise the user's class must be in "allowUser" and the user must
    // hold the API's "appPriv" from `req`'s client address (when none is
    // known, only rules without addresses apply); a refusal is not enforced
    // when "authLevel" is 2. Logs no refusal, sets no error, stores nothing.
    bool UserMayCall(APIRequest* req);

    // {"permResult": [verdict with timeout allowed, without]}.
    const Json::Value& Verdicts() const { return permission_; }

private:
    // What a cached verdict was given with: the session facts stored in
    // the request, and, for a verdict of an access token, the call it was
    // granted for ("<api>\n<method>"; empty for a session's verdict).
    struct Given {
        Json::Value session;
        std::string tokenCall;
    };

    Json::Value& Slot(bool allowTimeout);
    VELACGI_CTX* Handle(VELACGI_CTX* cgi);
    // The session or token check of the request, its code recorded and, on
    // a refusal, the server-error word set. True when allowed.
    bool SessionAllowed(APIRequest* req, APIResponse* resp, bool allowTimeout, VELACGI_CTX* cgi);
    int AskPlatform(APIRequest* req, VELACGI_CTX* cgi, bool allowTimeout, Given& given);
    // Whether the method's (or else the API's) "allowUser" admits `cls`.
    bool ClassAdmitted(APIRequest* req, const std::string& cls);
    bool CheckUserClass(APIRequest* req, APIResponse* resp, const std::string& user);

    APIRunner& runner_;
    VELACGI_CTX* ownCgi_;     // the handle of a check without the runner's
    Json::Value permission_;  // {"permResult": [with timeout allowed, without]}
    Given given_[2];          // beside each slot
};

}  // namespace VELA
