#include "webapi/APIParameter.h"

#include <utility>

namespace VELA {

template <typename T> class APIParameterPrivate {
public:
    bool set = false;
    bool reset = false;
    bool invalid = false;
    T value{};
    bool isDefault = false;
};

namespace {

// Per-type conversions behind ParseValue. Each stores into `out` and returns
// true, or returns false; they may throw when JsonCpp refuses a conversion,
// the caller catches. A value is an integer exactly when JsonCpp classifies
// it so (isInt / isUInt for 32-bit targets, isInt64 / isUInt64 for 64-bit):
// an integral double such as 3.0 is one.

bool Convert(Json::Value const& v, Json::ValueType, int& out)
{
    if (!v.isInt()) {
        return false;
    }
    out = v.asInt();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType, long long& out)
{
    if (!v.isInt64() && !v.isUInt64()) {
        return false;
    }
    // Above the signed range asInt64 throws: refused.
    out = v.asInt64();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType, unsigned int& out)
{
    if (!v.isInt() && !v.isUInt()) {
        return false;
    }
    // An integer of the int kind that is not an unsigned one is negative.
    if (!v.isUInt()) {
        return false;
    }
    out = v.asUInt();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType, unsigned long long& out)
{
    if (!v.isInt64() && !v.isUInt64()) {
        return false;
    }
    if (!v.isUInt64()) {
        return false;
    }
    out = v.asUInt64();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType, bool& out)
{
    if (!v.isBool()) {
        return false;
    }
    out = v.asBool();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType, double& out)
{
    if (!v.isNumeric()) {
        return false;
    }
    out = v.asDouble();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType, std::string& out)
{
    if (!v.isString()) {
        return false;
    }
    out = v.asString();
    return true;
}

bool Convert(Json::Value const& v, Json::ValueType type, Json::Value& out)
{
    if (v.type() != type) {
        return false;
    }
    out = v;
    return true;
}

// Builds a parameter from the member `name` of `obj`; see the factories.
template <typename T>
APIParameter<T> FromMember(Json::Value const& obj, std::string const& name, PARAM_NECESSITY necessity,
                           Json::ValueType type, bool (*validator)(T const&))
{
    APIParameter<T> param;
    if (!obj.isObject()) {
        param.MarkInvalid();
        return param;
    }
    Json::Value const* member = obj.find(name.data(), name.data() + name.size());
    if (member) {
        // The outcome is recorded in the flags.
        (void)param.CheckValueTypeAndGet(*member, type, validator);
    } else if (necessity == PARAM_REQUIRED) {
        param.MarkInvalid();
    }
    return param;
}

}  // namespace

template <typename T> APIParameter<T>::APIParameter() : d_(new APIParameterPrivate<T>()) {}

template <typename T>
APIParameter<T>::APIParameter(APIParameter const& other) : d_(new APIParameterPrivate<T>(*other.d_))
{
}

template <typename T> APIParameter<T>& APIParameter<T>::operator=(APIParameter const& other)
{
    if (this != &other) {
        *d_ = *other.d_;
    }
    return *this;
}

template <typename T> APIParameter<T>::~APIParameter() { delete d_; }

template <typename T> T const& APIParameter<T>::Get() const { return d_->value; }

template <typename T> T const& APIParameter<T>::Get(T const& fallback) const
{
    if (!d_->set || d_->invalid) {
        return fallback;
    }
    return d_->value;
}

template <typename T> bool APIParameter<T>::IsSet() const { return d_->set; }
template <typename T> bool APIParameter<T>::IsReset() const { return d_->reset; }
template <typename T> bool APIParameter<T>::IsInvalid() const { return d_->invalid; }
template <typename T> bool APIParameter<T>::IsDefault() const { return d_->isDefault; }

template <typename T> void APIParameter<T>::MarkSet() { d_->set = true; }
template <typename T> void APIParameter<T>::MarkReset() { d_->reset = true; }
template <typename T> void APIParameter<T>::MarkInvalid() { d_->invalid = true; }
template <typename T> void APIParameter<T>::MarkDefault() { d_->isDefault = true; }

template <typename T> bool APIParameter<T>::SetDefault(T const& d)
{
    if (d_->invalid) {
        return false;
    }
    if (d_->set) {
        return true;
    }
    d_->value = d;
    d_->isDefault = true;
    d_->set = true;
    return true;
}

template <typename T> bool APIParameter<T>::operator==(T const& value) const { return d_->value == value; }
template <typename T> bool APIParameter<T>::operator!=(T const& value) const { return !(d_->value == value); }

template <typename T> bool APIParameter<T>::operator==(APIParameter const& other) const
{
    return d_->value == other.d_->value;
}

template <typename T> bool APIParameter<T>::operator!=(APIParameter const& other) const
{
    return !(d_->value == other.d_->value);
}

template <typename T>
bool APIParameter<T>::CheckValueTypeAndGet(Json::Value const& v, Json::ValueType type, Validator validator)
{
    d_->set = true;
    if (v.isNull()) {
        d_->reset = true;
        return true;
    }
    if (!ParseValue(v, type)) {
        d_->invalid = true;
        return false;
    }
    if (!validator) {
        return true;
    }
    if (!validator(d_->value)) {
        d_->invalid = true;
        return false;
    }
    return true;
}

template <typename T> bool APIParameter<T>::ParseValue(Json::Value const& v, Json::ValueType type)
{
    try {
        T parsed{};
        if (!Convert(v, type, parsed)) {
            return false;
        }
        d_->value = std::move(parsed);
        return true;
    } catch (...) {
        // JsonCpp refused the conversion (or memory ran out): not a value of
        // this type.
        return false;
    }
}

template <typename T>
APIParameter<T> APIParameterFactoryBasicImpl<T>::FromJson(Json::Value const& obj, std::string const& name,
                                                          PARAM_NECESSITY necessity,
                                                          bool (*validator)(T const&))
{
    return FromMember<T>(obj, name, necessity, Json::nullValue, validator);
}

APIParameter<Json::Value> APIParameterFactory::ArrayFromJson(Json::Value const& obj, std::string const& name,
                                                             PARAM_NECESSITY necessity,
                                                             bool (*validator)(Json::Value const&))
{
    return FromMember<Json::Value>(obj, name, necessity, Json::arrayValue, validator);
}

APIParameter<Json::Value> APIParameterFactory::ObjectFromJson(Json::Value const& obj, std::string const& name,
                                                              PARAM_NECESSITY necessity,
                                                              bool (*validator)(Json::Value const&))
{
    return FromMember<Json::Value>(obj, name, necessity, Json::objectValue, validator);
}

template class APIParameter<int>;
template class APIParameter<long long>;
template class APIParameter<unsigned int>;
template class APIParameter<unsigned long long>;
template class APIParameter<bool>;
template class APIParameter<double>;
template class APIParameter<std::string>;
template class APIParameter<Json::Value>;

template class APIParameterFactoryBasicImpl<int>;
template class APIParameterFactoryBasicImpl<long long>;
template class APIParameterFactoryBasicImpl<unsigned int>;
template class APIParameterFactoryBasicImpl<unsigned long long>;
template class APIParameterFactoryBasicImpl<bool>;
template class APIParameterFactoryBasicImpl<double>;
template class APIParameterFactoryBasicImpl<std::string>;

}  // namespace VELA
