// Typed request parameters.
//
// An APIParameter<T> carries one value and four flags telling the handler how
// the value came about:
//   set      the parameter was found (or given a default);
//   reset    it was present with the JSON value null (the value stays zero);
//   invalid  wrong JSON type, out of range, refused by the validator, or
//            required and missing;
//   default  the value came from SetDefault().
// Instantiated for int, long long, unsigned int, unsigned long long, bool,
// double, std::string and Json::Value.
#pragma once

#include <json/json.h>
#include <string>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

// Whether a parameter must be present: 0 means required, anything else
// optional.
enum PARAM_NECESSITY {
    PARAM_REQUIRED = 0,
    PARAM_OPTIONAL = 1,
};

// Defined inside the library, not exported.
#pragma GCC visibility push(hidden)
template <typename T> class APIParameterPrivate;
#pragma GCC visibility pop

template <typename T> class VELA_EXPORT APIParameter {
public:
    typedef bool (*Validator)(T const&);

    APIParameter();
    APIParameter(APIParameter const& other);
    APIParameter& operator=(APIParameter const& other);
    ~APIParameter();

    // The stored value, whatever the flags.
    T const& Get() const;
    // `fallback` when the parameter is not set or is invalid, else the value
    // (a reset parameter is set: it gives its zero value).
    T const& Get(T const& fallback) const;

    bool IsSet() const;
    bool IsReset() const;
    bool IsInvalid() const;
    bool IsDefault() const;

    // Each sets its flag; no operation clears a flag.
    void MarkSet();
    void MarkReset();
    void MarkInvalid();
    void MarkDefault();

    // Invalid: false, nothing changes. Already set (reset included): true,
    // nothing changes. Otherwise the value becomes `d`, set and default.
    bool SetDefault(T const& d);

    // Compare values only; flags are ignored.
    bool operator==(T const& value) const;
    bool operator!=(T const& value) const;
    bool operator==(APIParameter const& other) const;
    bool operator!=(APIParameter const& other) const;

    // Marks the parameter set, then: null marks it reset (true); a value
    // ParseValue refuses marks it invalid (false); a validator that refuses
    // the stored value marks it invalid (false, the value stays readable).
    bool CheckValueTypeAndGet(Json::Value const& v, Json::ValueType type, Validator validator);
    // The per-type conversion: stores the value and returns true, or returns
    // false with the value unchanged. Only the Json::Value form reads `type`.
    // Never throws.
    bool ParseValue(Json::Value const& v, Json::ValueType type);

private:
    APIParameterPrivate<T>* d_;
};

extern template class VELA_EXPORT APIParameter<int>;
extern template class VELA_EXPORT APIParameter<long long>;
extern template class VELA_EXPORT APIParameter<unsigned int>;
extern template class VELA_EXPORT APIParameter<unsigned long long>;
extern template class VELA_EXPORT APIParameter<bool>;
extern template class VELA_EXPORT APIParameter<double>;
extern template class VELA_EXPORT APIParameter<std::string>;
extern template class VELA_EXPORT APIParameter<Json::Value>;

// Builds typed parameters from any JSON object (for example a sub-object of a
// parameter). `obj` not an object: invalid. Member present: parsed and
// validated as CheckValueTypeAndGet says. Member missing: invalid when
// required, untouched when optional. Defaults are the caller's (SetDefault).
template <typename T> class VELA_EXPORT APIParameterFactoryBasicImpl {
public:
    static APIParameter<T> FromJson(Json::Value const& obj, std::string const& name,
                                    PARAM_NECESSITY necessity, bool (*validator)(T const&) = nullptr);
};

extern template class VELA_EXPORT APIParameterFactoryBasicImpl<int>;
extern template class VELA_EXPORT APIParameterFactoryBasicImpl<long long>;
extern template class VELA_EXPORT APIParameterFactoryBasicImpl<unsigned int>;
extern template class VELA_EXPORT APIParameterFactoryBasicImpl<unsigned long long>;
extern template class VELA_EXPORT APIParameterFactoryBasicImpl<bool>;
extern template class VELA_EXPORT APIParameterFactoryBasicImpl<double>;
extern template class VELA_EXPORT APIParameterFactoryBasicImpl<std::string>;

class VELA_EXPORT APIParameterFactory {
public:
    // The member must be a JSON array.
    static APIParameter<Json::Value> ArrayFromJson(Json::Value const& obj, std::string const& name,
                                                   PARAM_NECESSITY necessity,
                                                   bool (*validator)(Json::Value const&) = nullptr);
    // The member must be a JSON object.
    static APIParameter<Json::Value> ObjectFromJson(Json::Value const& obj, std::string const& name,
                                                    PARAM_NECESSITY necessity,
                                                    bool (*validator)(Json::Value const&) = nullptr);
};

}  // namespace VELA

#pragma GCC visibility pop
