// Internals of the usage counter (APIRunner::IncreaseCounter).
#pragma once

#include "vela/export.h"

namespace VELA {

// Forgets the per-process answers of the counter (the data-collection
// switch and whether the counter directory is ready), so that the next
// count reads them again. For tests, which change the system root
// (exported for them: vela/export.h).
VELA_EXPORT void ResetUsageCounterState();

}  // namespace VELA
