// The private side of APIRequest: the keyed store with its eight categories
// ("environ", "cookie", "reqLib", "session", "param", "attr", "url",
// "userAgent") and the derivations of URL, client kind and session facts.
#pragma once

#include <json/json.h>
#include <string>
#include <sys/types.h>

#include "base/APIBase.h"
#include "vela/sharing.h"
#include "webapi/APIParameter.h"
#include "webapi/APIRequest.h"

namespace VELA {

class APIRequestPrivate : public APIBase {
public:
    explicit APIRequestPrivate(APIRequest* owner);
    APIRequestPrivate(const APIRequestPrivate& other, APIRequest* owner);
    ~APIRequestPrivate() override;

    void InitEnv(const Json::Value& env);
    void InitParam(const Json::Value& request, bool reset);
    void InitAPIInfo(const Json::Value& info);
    void InitSession(const Json::Value& session);

    void InitCookie();
    void InitRequestMethod();
    // Re-reads the sharing id and session id; with a sharing id, looks the
    // link, the visitor session and the token binding them up.
    void InitSharing();
    // Derives the sharing URL once ("url"/"urlSharing", sharingURLType).
    void InitSharingURL();
    void InitURL();
    bool ParseProtocol();
    bool ParseHostAndPort();
    bool ParsePathAndName();
    void InitUA();
    uid_t GetLoginUID();
    bool DecryptParam(Json::Value& params);
    bool DecryptAESParam(Json::Value& params);
    void SetAPIDesc(const Json::Value& params);

    // Reads "section"/"key" as text ("" when absent or not a string).
    std::string GetText(const char* section, const char* key);
    // Reads "section"/"key" with the JSON library's boolean conversion,
    // `def` when absent or not convertible.
    bool GetBool(const char* section, const char* key, bool def);

    template <typename T>
    APIParameter<T> GetAndCheckParam(const std::string& name, bool required, Json::ValueType type,
                                     bool (*validator)(T const&));
    APIParameter<Json::Value> GetAndCheckUnitArrayParam(const std::string& name, bool required,
                                                        bool (*validator)(Json::Value const&));

    std::string apiClass;
    int apiVersion = 0;
    std::string apiMethod;
    int requestMethod = REQUEST_METHOD_UNKNOWN;
    APIRequest* owner = nullptr;
    Json::Value sharingInfo;
    std::string sharingID;
    std::string sharingSID;
    sharing::record::Entry sharingEntry;
    sharing::record::Session sharingSession;
    sharing::record::Token sharingToken;
    sharing::_tag_SHARING_URL_TYPE sharingURLType = sharing::SHARING_URL_TYPE_NONE;
};

}  // namespace VELA
