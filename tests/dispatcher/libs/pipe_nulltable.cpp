// A handler library whose GetAPITable has no table to give.
#include "webapi/APITable.h"

#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

HANDLER_EXPORT _tag_API_TABLE* GetAPITable(void) { return nullptr; }
