// Task records belong to the identity the server runs as (root on an
// appliance). A handler that runs as the login user with the way back kept
// ("grantable") regains that identity for the few calls that touch a
// record; a process that runs as root, or as the one user of an
// unprivileged install, uses its own.
#pragma once

#include <memory>

#include "webapi/APIUtils.h"

namespace VELA {

class TaskAccess {
public:
    TaskAccess();
    // False when the records cannot be reached: the process is neither the
    // records' owner nor able to become it.
    bool Ok() const { return ok_; }

private:
    std::unique_ptr<RunAsRootGuard> guard_;
    bool ok_ = true;
};

}  // namespace VELA
