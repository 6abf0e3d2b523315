// ASCII string helpers of the platform library.
#include "vela/vlibc.h"

char* VLIBCStrCaseLower(char* sz)
{
    if (sz == nullptr) {
        return nullptr;
    }
    // ASCII only: bytes >= 0x80 (UTF-8 sequences) and the locale are left
    // alone, so the result never depends on LC_CTYPE.
    for (char* p = sz; *p != '\0'; ++p) {
        if (*p >= 'A' && *p <= 'Z') {
            *p = static_cast<char>(*p - 'A' + 'a');
        }
    }
    return sz;
}
