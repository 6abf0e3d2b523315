#include "Pam.h"

#include <cstdlib>
#include <cstring>
#include <security/pam_appl.h>

#include "vela/log.h"
#include "vela/user.h"
#include "vela/vlibc.h"

namespace VelaAuth {

namespace {

const char kService[] = "vela-webapi";

struct Secret {
    const char* text;
    size_t len;
};

void DropReplies(struct pam_response* replies, int count)
{
    for (int i = 0; i < count; ++i) {
        if (replies[i].resp != nullptr) {
            explicit_bzero(replies[i].resp, strlen(replies[i].resp));
            free(replies[i].resp);
        }
    }
    free(replies);
}

// The conversation: the password for each prompt that does not echo,
// nothing for information and error messages, and a refusal for any other
// prompt (the user name was given to pam_start; nothing else is known).
int Converse(int count, const struct pam_message** messages, struct pam_response** out, void* data)
{
    if (count <= 0 || count > PAM_MAX_NUM_MSG || messages == nullptr || out == nullptr) {
        return PAM_CONV_ERR;
    }
    const Secret* secret = static_cast<const Secret*>(data);
    auto* replies =
        static_cast<struct pam_response*>(calloc(static_cast<size_t>(count), sizeof(struct pam_response)));
    if (replies == nullptr) {
        return PAM_BUF_ERR;
    }
    for (int i = 0; i < count; ++i) {
        switch (messages[i]->msg_style) {
        case PAM_PROMPT_ECHO_OFF:
            replies[i].resp = strndup(secret->text, secret->len);
            if (replies[i].resp == nullptr) {
                DropReplies(replies, count);
                return PAM_BUF_ERR;
            }
            break;
        case PAM_ERROR_MSG:
        case PAM_TEXT_INFO:
            break;
        default:
            VELA_LOG_ERR("PAM asked a question other than the password (style %d), refused",
                         messages[i]->msg_style);
            DropReplies(replies, count);
            return PAM_CONV_ERR;
        }
    }
    *out = replies;
    return PAM_SUCCESS;
}

}  // namespace

PamResult CheckPassword(const std::string& account, const char* password, size_t passwordLen,
                        const std::string& clientIP, std::string& user, std::string& reason)
{
    Secret secret{password, passwordLen};
    const struct pam_conv conv = {Converse, &secret};
    const std::string confdir = VELA::System::Path("/etc/pam.d");
    pam_handle_t* pamh = nullptr;
    int rc = pam_start_confdir(kService, account.c_str(), &conv, confdir.c_str(), &pamh);
    if (rc != PAM_SUCCESS) {
        reason = pamh != nullptr ? pam_strerror(pamh, rc) : "failed";
        VELA_LOG_ERR("pam_start_confdir(%s, %s): %s (is %s/%s there?)", kService, confdir.c_str(), reason.c_str(),
                     confdir.c_str(), kService);
        if (pamh != nullptr) {
            pam_end(pamh, rc);
        }
        return PamResult::Error;
    }
    if (!clientIP.empty()) {
        pam_set_item(pamh, PAM_RHOST, clientIP.c_str());
    }
    PamResult result = PamResult::Ok;
    rc = pam_authenticate(pamh, PAM_SILENT | PAM_DISALLOW_NULL_AUTHTOK);
    if (rc == PAM_SUCCESS) {
        rc = pam_acct_mgmt(pamh, PAM_SILENT | PAM_DISALLOW_NULL_AUTHTOK);
        if (rc == PAM_NEW_AUTHTOK_REQD) {
            result = PamResult::Expired;
        } else if (rc != PAM_SUCCESS) {
            result = PamResult::Denied;
        }
    } else {
        result = PamResult::Denied;
    }
    reason = pam_strerror(pamh, rc);
    if (result != PamResult::Denied) {
        const void* item = nullptr;
        const char* name = nullptr;
        if (pam_get_item(pamh, PAM_USER, &item) == PAM_SUCCESS) {
            name = static_cast<const char*>(item);
        }
        if (name == nullptr || VELAUserNameIsValid(name) != 1) {
            VELA_LOG_ERR("PAM accepted the login but holds no valid user name");
            result = PamResult::Error;
        } else {
            user = name;
        }
    }
    pam_end(pamh, rc);
    return result;
}

}  // namespace VelaAuth
