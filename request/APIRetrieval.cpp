// Typed parameters of a request: APIRequest::GetAndCheck* and the lookups in
// the "param" section behind them.
#include "request/APIRequestPrivate.h"
#include "webapi/APIRequest.h"

namespace VELA {

namespace {

const char kParamSection[] = "param";

// Forwards to the private object; a request without one has no parameters.
template <typename T>
APIParameter<T> Retrieve(APIRequestPrivate* priv, std::string const& name, PARAM_NECESSITY necessity,
                         Json::ValueType type, bool (*validator)(T const&))
{
    if (!priv) {
        APIParameter<T> param;
        if (necessity == PARAM_REQUIRED) {
            param.MarkInvalid();
        }
        return param;
    }
    return priv->GetAndCheckParam<T>(name, necessity == PARAM_REQUIRED, type, validator);
}

}  // namespace

template <typename T>
APIParameter<T> APIRequestPrivate::GetAndCheckParam(const std::string& name, bool required, Json::ValueType type,
                                                    bool (*validator)(T const&))
{
    APIParameter<T> param;
    if (!HasData(kParamSection, name)) {
        if (required) {
            param.MarkInvalid();
        }
        return param;
    }
    const Json::Value none;
    const Json::Value value = GetData(kParamSection, name, none);
    // The outcome is recorded in the flags.
    (void)param.CheckValueTypeAndGet(value, type, validator);
    return param;
}

APIParameter<Json::Value> APIRequestPrivate::GetAndCheckUnitArrayParam(const std::string& name, bool required,
                                                                       bool (*validator)(Json::Value const&))
{
    APIParameter<Json::Value> param;
    if (!HasData(kParamSection, name)) {
        if (required) {
            param.MarkInvalid();
        }
        return param;
    }
    const Json::Value none;
    Json::Value value = GetData(kParamSection, name, none);
    if (!value.isArray()) {
        // A single value, null included, is a one-element array: [null] is
        // set and not reset.
        Json::Value unit(Json::arrayValue);
        unit.append(value);
        value.swap(unit);
    }
    (void)param.CheckValueTypeAndGet(value, Json::arrayValue, validator);
    return param;
}

template APIParameter<int> APIRequestPrivate::GetAndCheckParam<int>(const std::string&, bool, Json::ValueType,
                                                                    bool (*)(int const&));
template APIParameter<bool> APIRequestPrivate::GetAndCheckParam<bool>(const std::string&, bool, Json::ValueType,
                                                                      bool (*)(bool const&));
template APIParameter<double> APIRequestPrivate::GetAndCheckParam<double>(const std::string&, bool,
                                                                          Json::ValueType,
                                                                          bool (*)(double const&));
template APIParameter<std::string> APIRequestPrivate::GetAndCheckParam<std::string>(
    const std::string&, bool, Json::ValueType, bool (*)(std::string const&));
template APIParameter<Json::Value> APIRequestPrivate::GetAndCheckParam<Json::Value>(
    const std::string&, bool, Json::ValueType, bool (*)(Json::Value const&));
template APIParameter<long long> APIRequestPrivate::GetAndCheckParam<long long>(const std::string&, bool,
                                                                                Json::ValueType,
                                                                                bool (*)(long long const&));
template APIParameter<unsigned int> APIRequestPrivate::GetAndCheckParam<unsigned int>(
    const std::string&, bool, Json::ValueType, bool (*)(unsigned int const&));
template APIParameter<unsigned long long> APIRequestPrivate::GetAndCheckParam<unsigned long long>(
    const std::string&, bool, Json::ValueType, bool (*)(unsigned long long const&));

APIParameter<int> APIRequest::GetAndCheckInt(const std::string& name, PARAM_NECESSITY necessity,
                                             bool (*validator)(int const&)) const
{
    return Retrieve<int>(GetPrivate(), name, necessity, Json::intValue, validator);
}

APIParameter<bool> APIRequest::GetAndCheckBool(const std::string& name, PARAM_NECESSITY necessity,
                                               bool (*validator)(bool const&)) const
{
    return Retrieve<bool>(GetPrivate(), name, necessity, Json::booleanValue, validator);
}

APIParameter<double> APIRequest::GetAndCheckReal(const std::string& name, PARAM_NECESSITY necessity,
                                                 bool (*validator)(double const&)) const
{
    return Retrieve<double>(GetPrivate(), name, necessity, Json::realValue, validator);
}

APIParameter<std::string> APIRequest::GetAndCheckString(const std::string& name, PARAM_NECESSITY necessity,
                                                        bool (*validator)(std::string const&)) const
{
    return Retrieve<std::string>(GetPrivate(), name, necessity, Json::stringValue, validator);
}

APIParameter<Json::Value> APIRequest::GetAndCheckArray(const std::string& name, PARAM_NECESSITY necessity,
                                                       bool (*validator)(Json::Value const&)) const
{
    return Retrieve<Json::Value>(GetPrivate(), name, necessity, Json::arrayValue, validator);
}

APIParameter<Json::Value> APIRequest::GetAndCheckObject(const std::string& name, PARAM_NECESSITY necessity,
                                                        bool (*validator)(Json::Value const&)) const
{
    return Retrieve<Json::Value>(GetPrivate(), name, necessity, Json::objectValue, validator);
}

// Only the Json::Value conversion reads the type; the integral ones ignore it.
template <typename T>
APIParameter<T> APIRequest::GetAndCheckIntegral(const std::string& name, PARAM_NECESSITY necessity,
                                                bool (*validator)(T const&)) const
{
    return Retrieve<T>(GetPrivate(), name, necessity, Json::objectValue, validator);
}

template APIParameter<long long> APIRequest::GetAndCheckIntegral<long long>(const std::string&, PARAM_NECESSITY,
                                                                            bool (*)(long long const&)) const;
template APIParameter<unsigned int> APIRequest::GetAndCheckIntegral<unsigned int>(
    const std::string&, PARAM_NECESSITY, bool (*)(unsigned int const&)) const;
template APIParameter<unsigned long long> APIRequest::GetAndCheckIntegral<unsigned long long>(
    const std::string&, PARAM_NECESSITY, bool (*)(unsigned long long const&)) const;

APIParameter<Json::Value> APIRequest::GetAndCheckUnitArray(const std::string& name, PARAM_NECESSITY necessity,
                                                           bool (*validator)(Json::Value const&)) const
{
    APIRequestPrivate* priv = GetPrivate();
    if (!priv) {
        APIParameter<Json::Value> param;
        if (necessity == PARAM_REQUIRED) {
            param.MarkInvalid();
        }
        return param;
    }
    return priv->GetAndCheckUnitArrayParam(name, necessity == PARAM_REQUIRED, validator);
}

}  // namespace VELA
