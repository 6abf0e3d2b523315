#include "polling/APIPollingPrivate.h"

namespace VELA {

APIPollingPrivate::APIPollingPrivate(APIPolling* owner, APIRequest* request) : owner_(owner), request_(request)
{
    data_["polling_attribute"] = Json::Value(Json::objectValue);
}

APIPollingPrivate::~APIPollingPrivate() = default;

}  // namespace VELA
