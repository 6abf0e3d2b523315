#include "response/Cookie.h"

#include <cctype>
#include <climits>
#include <cstdint>
#include <limits>
#include <locale.h>
#include <type_traits>

#include "request/RequestFacts.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace VELA {
namespace Cookie {

const char* const kExpiredDate = "Thu, 01-Jan-1970 00:00:01 GMT";

static_assert(std::is_integral<time_t>::value && std::is_signed<time_t>::value,
              "the expiry arithmetic assumes a signed integral time_t");

bool IsValidName(const std::string& name)
{
    return VELA::System::IsCheckedName(name, VELA::System::kNameId, name.size());
}

bool HasLineBreak(const std::string& text)
{
    return text.find_first_of("\r\n") != std::string::npos;
}

time_t ParseClientTime(const Json::Value& value)
{
    return static_cast<time_t>(RequestFacts::CheckedInteger(value, std::numeric_limits<time_t>::min(),
                                                            std::numeric_limits<time_t>::max(), 0));
}

// The "C" locale for strftime_l, so a locale the process may have set can not
// change the day and month names. Created once; null if that failed.
static locale_t CLocale()
{
    static const locale_t loc = newlocale(LC_ALL_MASK, "C", static_cast<locale_t>(0));
    return loc;
}

bool FormatExpiry(time_t reference, long minutes, std::string& out)
{
    time_t seconds = 0;
    time_t when = 0;
    if (__builtin_mul_overflow(minutes, 60, &seconds) ||
        __builtin_add_overflow(reference, seconds, &when)) {
        return false;
    }
    struct tm tm {};
    if (!gmtime_r(&when, &tm)) {
        return false;  // the year does not fit struct tm
    }
    locale_t loc = CLocale();
    if (loc == static_cast<locale_t>(0)) {
        return false;
    }
    char buf[1024];
    size_t len = strftime_l(buf, sizeof(buf), "%a, %d-%b-%Y %H:%M:%S GMT", &tm, loc);
    if (len == 0) {
        return false;
    }
    out.assign(buf, len);
    return true;
}

bool BuildLine(const std::string& name, const std::string& value, const std::string& path,
               long expireMinutes, time_t reference, const std::string& domain, bool secure,
               bool httpOnly, std::string& line)
{
    std::string text = name + "=" + WebAPIUtil::URLEncode(value) + "; path=" + path;
    if (expireMinutes < 0) {
        text += "; expires=";
        text += kExpiredDate;
    } else if (expireMinutes > 0) {
        std::string date;
        if (!FormatExpiry(reference, expireMinutes, date)) {
            return false;
        }
        text += "; expires=" + date;
    }
    if (!domain.empty()) {
        text += "; domain=" + domain;
    }
    if (secure) {
        text += "; secure";
    }
    if (httpOnly) {
        text += "; httponly";
    }
    line.swap(text);
    return true;
}

}  // namespace Cookie
}  // namespace VELA
