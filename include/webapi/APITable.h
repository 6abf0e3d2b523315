// The tables a handler library exports.
//
// A handler library is a shared object named by the "lib" key of its API
// description. It exports, with C linkage:
//   _tag_API_TABLE* GetAPITable(void);             required
//   _tag_API_CHECK_TABLE* GetAPICheckTable(void);  optional
// Each returns the first entry of a static array that ends with an entry
// whose API name is null. Libraries are built apart from the framework, so
// the layout below is binding: every member takes one machine word.
//
//   static _tag_API_TABLE table[] = {
//       {"VELA.Sample", 1, "echo", Echo},
//       {nullptr, 0, nullptr, nullptr},
//   };
//   extern "C" _tag_API_TABLE* GetAPITable(void) { return table; }
//
// A handler reports its outcome only through the response. A check returns
// false to refuse the call and then sets the response's error itself. The
// check of the terminating entry, when not null, vets every call that no
// other entry names.
#pragma once

namespace VELA {
class APIRequest;
class APIResponse;
}  // namespace VELA

typedef void (*APIHandlerFn)(VELA::APIRequest*, VELA::APIResponse*);
typedef bool (*APICheckFn)(VELA::APIRequest*, VELA::APIResponse*);

typedef struct _tag_API_TABLE {
    const char* api;      // dotted API name; null ends the table
    int version;          // padded to one word
    const char* method;
    APIHandlerFn handler;
} API_TABLE;

typedef struct _tag_API_CHECK_TABLE {
    const char* api;      // null ends the table; its check still counts
    int version;
    const char* method;
    APICheckFn check;
    void* reserved1;      // set to null
    void* reserved2;      // set to null
} API_CHECK_TABLE;

static_assert(sizeof(_tag_API_TABLE) == 4 * sizeof(void*), "API table entries are four words");
static_assert(sizeof(_tag_API_CHECK_TABLE) == 6 * sizeof(void*), "check table entries are six words");

extern "C" {
typedef _tag_API_TABLE* (*GetAPITableFn)(void);
typedef _tag_API_CHECK_TABLE* (*GetAPICheckTableFn)(void);
}
