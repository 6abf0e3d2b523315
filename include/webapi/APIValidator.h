// Ready-made checks for handlers: pass them as validators to the
// APIRequest::GetAndCheck* getters, or call them directly. Every check
// returns false rather than throwing; an invalid parameter never passes a
// numeric or membership check.
#pragma once

#include <json/json.h>
#include <string>

#include "webapi/APIParameter.h"

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
class APIValidatorPrivate;
#pragma GCC visibility pop

class VELA_EXPORT APIValidator {
public:
    // The process-wide instance, created on first use (thread-safe).
    static APIValidator* GetInstance();

    // True when `text` matches the POSIX extended expression `pattern`
    // anywhere (unless the pattern is anchored). Compiled expressions are
    // cached by the pattern's address: pass string constants.
    static bool CheckRegex(std::string const& text, char const* pattern);

    // Text formats; the empty text never passes.
    static bool IsEMail(std::string const& text);
    static bool IsNetbios(std::string const& text);
    static bool IsWorkGroup(std::string const& text);
    static bool IsDigit(std::string const& text);
    static bool IsFarlinkId(std::string const& text);
    static bool IsHostname(std::string const& text);
    static bool IsDomain(std::string const& text);
    static bool IsIP(std::string const& text);
    static bool IsIPv4(std::string const& text);
    static bool IsIPv6(std::string const& text);

    // 0 <= v <= 65535.
    static bool IsPort(int const& v);

    // Equality of the value: strings byte for byte, JSON by JSON equality.
    template <typename T> static bool IsEqual(APIParameter<T> const& p, T const& x);
    static bool IsEqual(APIParameter<std::string> const& p, char const* x);
    // |value - x| <= epsilon.
    static bool IsEqual(APIParameter<double> const& p, double x);

    // Integers: min <= value <= max. Doubles: both ends excluded, with an
    // absolute margin of the machine epsilon.
    template <typename T> static bool IsBetween(APIParameter<T> const& p, T const& min, T const& max);
    static bool IsBetween(APIParameter<double> const& p, double min, double max);
    template <typename T> static bool IsGreater(APIParameter<T> const& p, T const& x);
    static bool IsGreater(APIParameter<double> const& p, double x);
    template <typename T> static bool IsLess(APIParameter<T> const& p, T const& x);
    static bool IsLess(APIParameter<double> const& p, double x);

    // `list` is an array holding the string.
    static bool IsBelong(APIParameter<std::string> const& p, Json::Value const& list);
    // `list` is an array holding every element (member value) of the value.
    // A value without elements passes: null, an empty array or object, and
    // any number, string or boolean, whether `list` holds it or not. Check
    // a single value with the string form above or with IsEqual.
    static bool IsBelong(APIParameter<Json::Value> const& p, Json::Value const& list);

private:
    APIValidator();
    ~APIValidator();
    APIValidator(APIValidator const&) = delete;
    APIValidator& operator=(APIValidator const&) = delete;

    APIValidatorPrivate* d_;
    friend class APIValidatorPrivate;
};

// Instantiated in the library for the types the framework documents.
extern template bool APIValidator::IsEqual<int>(APIParameter<int> const&, int const&);
extern template bool APIValidator::IsEqual<long long>(APIParameter<long long> const&, long long const&);
extern template bool APIValidator::IsEqual<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&);
extern template bool APIValidator::IsEqual<unsigned long long>(APIParameter<unsigned long long> const&,
                                                               unsigned long long const&);
extern template bool APIValidator::IsEqual<bool>(APIParameter<bool> const&, bool const&);
extern template bool APIValidator::IsEqual<std::string>(APIParameter<std::string> const&, std::string const&);
extern template bool APIValidator::IsEqual<Json::Value>(APIParameter<Json::Value> const&, Json::Value const&);
extern template bool APIValidator::IsBetween<int>(APIParameter<int> const&, int const&, int const&);
extern template bool APIValidator::IsBetween<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&,
                                                           unsigned int const&);
extern template bool APIValidator::IsBetween<unsigned long long>(APIParameter<unsigned long long> const&,
                                                                 unsigned long long const&,
                                                                 unsigned long long const&);
extern template bool APIValidator::IsGreater<int>(APIParameter<int> const&, int const&);
extern template bool APIValidator::IsGreater<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&);
extern template bool APIValidator::IsGreater<unsigned long long>(APIParameter<unsigned long long> const&,
                                                                 unsigned long long const&);
extern template bool APIValidator::IsLess<int>(APIParameter<int> const&, int const&);
extern template bool APIValidator::IsLess<unsigned int>(APIParameter<unsigned int> const&, unsigned int const&);
extern template bool APIValidator::IsLess<unsigned long long>(APIParameter<unsigned long long> const&,
                                                              unsigned long long const&);

}  // namespace VELA

#pragma GCC visibility pop
