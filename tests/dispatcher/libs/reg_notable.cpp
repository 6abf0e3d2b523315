// A check table but no GetAPITable: the library loads, its tables do not.
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

_tag_API_CHECK_TABLE g_checks[] = {
    {nullptr, 0, nullptr, nullptr, nullptr, nullptr},
};

}  // namespace

HANDLER_EXPORT _tag_API_CHECK_TABLE* GetAPICheckTable(void) { return g_checks; }
