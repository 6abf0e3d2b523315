// Handles of login sessions: what names a session to an administrator
// (listing, ending it) without showing its id, which is a credential.
#include <cstring>
#include <string>

#include "session/LazyCrypto.h"
#include "session/SessionStore.h"
#include "vela/session.h"

int VELA::Session::HandleOf(const char* sid, std::string& handle)
{
    handle.clear();
    if (!IsId(sid, VELA_SESSION_ID_LEN)) {
        return -1;
    }
    const CryptoApi* api = LazyCrypto();
    if (api == nullptr) {
        return -1;
    }
    unsigned char md[32];
    unsigned int mdLen = 0;
    if (api->EVP_Digest(sid, VELA_SESSION_ID_LEN, md, &mdLen, api->EVP_sha256(), nullptr) != 1 ||
        mdLen != sizeof(md)) {
        LogCryptoError(*api, "session handle: SHA-256 failed");
        return -1;
    }
    static const char kHex[] = "0123456789abcdef";
    try {
        for (size_t i = 0; i < VELA_SESSION_HANDLE_LEN / 2; ++i) {
            handle.push_back(kHex[md[i] >> 4]);
            handle.push_back(kHex[md[i] & 15]);
        }
    } catch (const std::exception&) {
        handle.clear();
        return -1;
    }
    return 0;
}

bool VELA::Session::IsHandle(const char* text)
{
    if (text == nullptr || strnlen(text, VELA_SESSION_HANDLE_LEN + 1) != VELA_SESSION_HANDLE_LEN) {
        return false;
    }
    for (size_t i = 0; i < VELA_SESSION_HANDLE_LEN; ++i) {
        const char c = text[i];
        if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'))) {
            return false;
        }
    }
    return true;
}
