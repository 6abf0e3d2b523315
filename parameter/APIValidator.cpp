#include "webapi/APIValidator.h"

#include <atomic>
#include <cfloat>
#include <cstdlib>
#include <map>
#include <mutex>
#include <regex.h>

#include "vela/log.h"
#include "vela/vlibc.h"

namespace VELA {

namespace {

// The text formats, as POSIX extended expressions. In the e-mail pattern
// "+-\" is a range (it takes in the digits, the upper-case letters and
// "/:;<=>?@[\"); the workgroup pattern is not anchored, so a name passes when
// any one character lies outside the forbidden set.
constexpr char kEMailPattern[] = "^[a-zA-Z0-9!#$%&'*+-\\/?^_`{|}~\\.\",()<=>]+@([a-zA-Z0-9_&%!#+-\\.]+)$";
constexpr char kNetbiosPattern[] = "^[a-zA-Z][_a-zA-Z0-9-]{0,254}$";
constexpr char kWorkGroupPattern[] = "[^][;:\"<>*+\\/|?,]";
constexpr char kDigitPattern[] = "^([0-9]+)$";
constexpr char kFarlinkIdPattern[] = "^([a-zA-Z0-9-]+)$";

static_assert(sizeof(kEMailPattern) - 1 == 66, "e-mail pattern");
static_assert(sizeof(kNetbiosPattern) - 1 == 30, "netbios pattern");
static_assert(sizeof(kWorkGroupPattern) - 1 == 17, "workgroup pattern");
static_assert(sizeof(kDigitPattern) - 1 == 10, "digit pattern");
static_assert(sizeof(kFarlinkIdPattern) - 1 == 17, "farlink id pattern");

// Absolute margin of the floating-point comparisons.
constexpr double kEpsilon = DBL_EPSILON;

// The C checks below see a text only up to its first NUL byte, so a text
// holding one is refused rather than judged on its prefix.
bool IsCText(std::string const& text) { return text.find('\0') == std::string::npos; }

bool IsNonEmptyCText(std::string const& text) { return !text.empty() && IsCText(text); }

std::mutex g_instanceLock;
std::atomic<APIValidator*> g_instance{nullptr};

}  // namespace

class APIValidatorPrivate {
public:
    APIValidatorPrivate() = default;
    ~APIValidatorPrivate();
    APIValidatorPrivate(APIValidatorPrivate const&) = delete;
    APIValidatorPrivate& operator=(APIValidatorPrivate const&) = delete;

    // The compiled form of `pattern`, compiled on first use and cached by the
    // pattern's address. False for a null or malformed pattern.
    bool GetRegex(char const* pattern, regex_t** out);

private:
    std::mutex lock_;
    std::map<char const*, regex_t*> regexes_;
};

APIValidatorPrivate::~APIValidatorPrivate()
{
    for (auto& entry : regexes_) {
        regfree(entry.second);
        free(entry.second);
    }
}

bool APIValidatorPrivate::GetRegex(char const* pattern, regex_t** out)
{
    if (!pattern || !out) {
        return false;
    }
    std::lock_guard<std::mutex> guard(lock_);
    auto found = regexes_.find(pattern);
    if (found != regexes_.end()) {
        *out = found->second;
        return true;
    }
    regex_t* compiled = static_cast<regex_t*>(calloc(1, sizeof(regex_t)));
    if (!compiled) {
        return false;
    }
    if (regcomp(compiled, pattern, REG_EXTENDED | REG_NOSUB) != 0) {
        VELA::System::Log(LOG_ERR, "%s:%d Invalid pattern", "APIValidator", 57);
        free(compiled);
        return false;
    }
    try {
        regexes_.emplace(pattern, compiled);
    } catch (...) {
        regfree(compiled);
        free(compiled);
        return false;
    }
    *out = compiled;
    return true;
}

APIValidator::APIValidator() : d_(new APIValidatorPrivate()) {}

APIValidator::~APIValidator() { delete d_; }

APIValidator* APIValidator::GetInstance()
{
    APIValidator* instance = g_instance.load(std::memory_order_acquire);
    if (instance) {
        return instance;
    }
    std::lock_guard<std::mutex> guard(g_instanceLock);
    instance = g_instance.load(std::memory_order_relaxed);
    if (!instance) {
        // Lives until the process ends: handlers may validate from static
        // destructors.
        instance = new APIValidator();
        g_instance.store(instance, std::memory_order_release);
    }
    return instance;
}

bool APIValidator::CheckRegex(std::string const& text, char const* pattern)
{
    if (!IsCText(text)) {
        return false;
    }
    regex_t* compiled = nullptr;
    if (!GetInstance()->d_->GetRegex(pattern, &compiled)) {
        return false;
    }
    // regexec takes its own lock in glibc: the shared compiled form is safe.
    return regexec(compiled, text.c_str(), 0, nullptr, 0) == 0;
}

bool APIValidator::IsEMail(std::string const& text) { return !text.empty() && CheckRegex(text, kEMailPattern); }

bool APIValidator::IsNetbios(std::string const& text)
{
    return !text.empty() && CheckRegex(text, kNetbiosPattern);
}

bool APIValidator::IsWorkGroup(std::string const& text)
{
    return !text.empty() && CheckRegex(text, kWorkGroupPattern);
}

bool APIValidator::IsDigit(std::string const& text) { return !text.empty() && CheckRegex(text, kDigitPattern); }

bool APIValidator::IsFarlinkId(std::string const& text)
{
    return !text.empty() && CheckRegex(text, kFarlinkIdPattern);
}

bool APIValidator::IsHostname(std::string const& text)
{
    return IsNonEmptyCText(text) && BlVLIBIsHostname(text.c_str()) != 0;
}

bool APIValidator::IsDomain(std::string const& text)
{
    return IsNonEmptyCText(text) && BlVLIBIsDomain(text.c_str()) != 0;
}

bool APIValidator::IsIP(std::string const& text)
{
    return IsNonEmptyCText(text) && VELANetGetAddrType(text.c_str()) != 0;
}

bool APIValidator::IsIPv4(std::string const& text)
{
    return IsNonEmptyCText(text) && VELANetGetAddrType(text.c_str()) == 2;
}

bool APIValidator::IsIPv6(std::string const& text)
{
    return IsNonEmptyCText(text) && VELANetGetAddrType(text.c_str()) == 10;
}

bool APIValidator::IsPort(int const& v) { return static_cast<unsigned int>(v) <= 65535u; }

template <typename T> bool APIValidator::IsEqual(APIParameter<T> const& p, T const& x)
{
    return !p.IsInvalid() && p.Get() == x;
}

bool APIValidator::IsEqual(APIParameter<std::string> const& p, char const* x)
{
    return !p.IsInvalid() && x && p.Get() == x;
}

bool APIValidator::IsEqual(APIParameter<double> const& p, double x)
{
    if (p.IsInvalid()) {
        return false;
    }
    double diff = p.Get() - x;
    return -kEpsilon <= diff && diff <= kEpsilon;
}

template <typename T> bool APIValidator::IsBetween(APIParameter<T> const& p, T const& min, T const& max)
{
    return !p.IsInvalid() && min <= p.Get() && p.Get() <= max;
}

bool APIValidator::IsBetween(APIParameter<double> const& p, double min, double max)
{
    return !p.IsInvalid() && p.Get() - min > kEpsilon && p.Get() - max < -kEpsilon;
}

template <typename T> bool APIValidator::IsGreater(APIParameter<T> const& p, T const& x)
{
    return !p.IsInvalid() && p.Get() > x;
}

bool APIValidator::IsGreater(APIParameter<double> const& p, double x)
{
    return !p.IsInvalid() && p.Get() - x > kEpsilon;
}

template <typename T> bool APIValidator::IsLess(APIParameter<T> const& p, T const& x)
{
    return !p.IsInvalid() && p.Get() < x;
}

bool APIValidator::IsLess(APIParameter<double> const& p, double x)
{
    return !p.IsInvalid() && p.Get() - x < -kEpsilon;
}

namespace {

// JsonCpp equality: the types must match too (an int 1 is not an unsigned 1).
bool ListHolds(Json::Value const& list, Json::Value const& element)
{
    for (Json::Value const& item : list) {
        if (item == element) {
            return true;
        }
    }
    return false;
}

}  // namespace

bool APIValidator::IsBelong(APIParameter<std::string> const& p, Json::Value const& list)
{
    if (p.IsInvalid() || !list.isArray()) {
        return false;
    }
    return ListHolds(list, Json::Value(p.Get()));
}

// An array or object is checked member value by member value. Null and the
// scalars have no member values, so nothing of them is checked and they pass.
bool APIValidator::IsBelong(APIParameter<Json::Value> const& p, Json::Value const& list)
{
    if (p.IsInvalid() || !list.isArray()) {
        return false;
    }
    Json::Value const& value = p.Get();
    if (!value.isArray() && !value.isObject()) {
        return true;
    }
    for (Json::Value const& element : value) {
        if (!ListHolds(list, element)) {
            return false;
        }
    }
    return true;
}

template bool APIValidator::IsEqual<int>(APIParameter<int> const&, int const&);
template bool APIValidator::IsEqual<long long>(APIParameter<long long> const&, long long const&);
template bool APIValidator::IsEqual<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&);
template bool APIValidator::IsEqual<unsigned long long>(APIParameter<unsigned long long> const&,
                                                        unsigned long long const&);
template bool APIValidator::IsEqual<bool>(APIParameter<bool> const&, bool const&);
template bool APIValidator::IsEqual<std::string>(APIParameter<std::string> const&, std::string const&);
template bool APIValidator::IsEqual<Json::Value>(APIParameter<Json::Value> const&, Json::Value const&);
template bool APIValidator::IsBetween<int>(APIParameter<int> const&, int const&, int const&);
template bool APIValidator::IsBetween<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&,
                                                    unsigned int const&);
template bool APIValidator::IsBetween<unsigned long long>(APIParameter<unsigned long long> const&,
                                                          unsigned long long const&, unsigned long long const&);
template bool APIValidator::IsGreater<int>(APIParameter<int> const&, int const&);
template bool APIValidator::IsGreater<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&);
template bool APIValidator::IsGreater<unsigned long long>(APIParameter<unsigned long long> const&,
                                                          unsigned long long const&);
template bool APIValidator::IsLess<int>(APIParameter<int> const&, int const&);
template bool APIValidator::IsLess<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&);
template bool APIValidator::IsLess<unsigned long long>(APIParameter<unsigned long long> const&,
                                                       unsigned long long const&);

}  // namespace VELA
