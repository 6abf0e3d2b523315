#include "base/APIBase.h"

namespace VELA {

APIBase::APIBase() : data_(Json::objectValue) {}

APIBase::~APIBase() = default;

bool APIBase::HasData(const std::string& section, const std::string& key)
{
    const Json::Value* sec = data_.find(section.data(), section.data() + section.size());
    if (!sec || !sec->isObject() || key.empty()) {
        return false;
    }
    return sec->find(key.data(), key.data() + key.size()) != nullptr;
}

bool APIBase::SetData(const std::string& section, const Json::Value& object, bool stringsOnly)
{
    Json::Value* sec = data_.find(section.data(), section.data() + section.size())
                           ? &data_[section]
                           : nullptr;
    if (!sec || !object.isObject() || object.empty() || !(sec->isObject() || sec->isNull())) {
        return false;
    }
    for (auto it = object.begin(); it != object.end(); ++it) {
        if (!stringsOnly || it->isString()) {
            (*sec)[it.name()] = *it;
        }
    }
    return true;
}

bool APIBase::SetData(const std::string& section, const std::string& key, const Json::Value& value,
                      bool stringsOnly)
{
    if (!data_.find(section.data(), section.data() + section.size()) || key.empty()) {
        return false;
    }
    if (stringsOnly && !value.isString()) {
        return false;
    }
    Json::Value& sec = data_[section];
    if (!(sec.isObject() || sec.isNull())) {
        return false;
    }
    sec[key] = value;
    return true;
}

const Json::Value& APIBase::GetData(const std::string& section, const std::string& key,
                                    const Json::Value& defaultValue)
{
    const Json::Value* sec = data_.find(section.data(), section.data() + section.size());
    if (!sec) {
        return defaultValue;
    }
    if (key.empty()) {
        return *sec;
    }
    if (!sec->isObject()) {
        return defaultValue;
    }
    const Json::Value* entry = sec->find(key.data(), key.data() + key.size());
    return entry ? *entry : defaultValue;
}

bool APIBase::ClearData(const std::string& section, const std::string& key)
{
    if (section.empty() || !data_.find(section.data(), section.data() + section.size())) {
        return false;
    }
    Json::Value& sec = data_[section];
    if (key.empty()) {
        sec.clear();
        return true;
    }
    if (!sec.isObject() || !sec.isMember(key)) {
        return false;
    }
    sec.removeMember(key);
    return true;
}

}  // namespace VELA
