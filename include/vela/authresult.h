// Verdict of the login-session check, as the CGI library reports it and the
// request keeps it. On its own so that a handler's view of the request needs
// nothing else from the CGI library.
#pragma once

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

// Verdict of the login-session check (VelaCgiIsAuthorizedEx).
enum _tag_authorized_result_ : int {
    AUTH_RESULT_AUTHORIZED = 1,       // valid session
    AUTH_RESULT_TIMEOUT = -1,         // idle timeout passed
    AUTH_RESULT_NO_SESSION = -2,      // no such session
    AUTH_RESULT_REJECTED = -3,        // refused by the platform
    AUTH_RESULT_NONE = -4,            // no verdict was ever stored
    AUTH_RESULT_UNAUTHENTICATED = -5, // not authenticated
    AUTH_RESULT_TOKEN_MISSING = -7,   // anti-forgery token missing or wrong
    AUTH_RESULT_IP_MISMATCH = -8,     // client address differs from the session's
};
typedef enum _tag_authorized_result_ AUTHORIZED_RESULT;
// The same type without the trailing underscore, the spelling some handler
// code uses: `_tag_authorized_result v = AUTH_RESULT_AUTHORIZED;` compiles
// as with the name above.
typedef enum _tag_authorized_result_ _tag_authorized_result;

#pragma GCC visibility pop
