// Internals of the usage counter (APIRunner::IncreaseCounter).
#pragma once

namespace VELA {

// Forgets the per-process answers of the counter (the data-collection
// switch and whether the counter directory is ready), so that the next
// count reads them again. For tests, which change the system root.
void ResetUsageCounterState();

}  // namespace VELA
