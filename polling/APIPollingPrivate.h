// State of an APIPolling: its request, its last error and the attributes of
// the next task, kept in the keyed store (section "polling_attribute").
#pragma once

#include "base/APIBase.h"

namespace VELA {

class APIPolling;
class APIRequest;

class APIPollingPrivate : public APIBase {
public:
    explicit APIPollingPrivate(APIPolling* owner, APIRequest* request = nullptr);
    ~APIPollingPrivate() override;

    APIPolling* owner_;
    APIRequest* request_;
    int error_ = 0;
};

}  // namespace VELA
