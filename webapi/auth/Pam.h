// The password check of the login API through PAM, service "vela-webapi",
// whose configuration is read from <root>/etc/pam.d (pam_start_confdir).
#pragma once

#include <string>

namespace VelaAuth {

enum class PamResult {
    Ok,       // authenticated and the account may log in now
    Denied,   // wrong password, unknown or locked account, any refusal
    Expired,  // right password, but it has expired and must be changed first
    Error,    // PAM could not be started or named no valid user (logged)
};

// Checks `password` (`passwordLen` bytes, no NUL) of `account` coming from
// `clientIP` ("" when unknown; given to PAM as PAM_RHOST): pam_authenticate,
// then pam_acct_mgmt. The conversation answers the password to every
// PAM_PROMPT_ECHO_OFF prompt and nothing else; the copies handed to PAM are
// wiped by PAM when it frees them. On Ok and Expired `user` receives the
// name PAM settled on (PAM_USER). `reason` receives PAM's words for the
// outcome, for the log.
PamResult CheckPassword(const std::string& account, const char* password, size_t passwordLen,
                        const std::string& clientIP, std::string& user, std::string& reason);

}  // namespace VelaAuth
