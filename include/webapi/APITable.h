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

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

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

// A sharing check library (<root>/usr/lib/sharing/permission_lib/<project>.so,
// one per application that makes sharing links) decides which calls a
// visitor of its links may make. It exports, with C linkage:
//   int GetAPISharingCheckTable(_tag_API_SHARING_CHECK_TABLE** table);
// which stores the first entry of a static array (ended by an entry whose
// api pattern is null) and returns non-zero. The first entry that matches
// the call (version, then api, then method) gives the check; a call that no
// entry matches is refused. Patterns are POSIX extended regular expressions,
// unanchored unless written with ^ and $, or "*" for every name:
//
//   static _tag_API_SHARING_CHECK_TABLE table[] = {
//       {"^VELA\\.Sample\\.Share$", 1, "^download$", CheckDownload},
//       {"^VELA\\.Sample\\.Share$", 0, "*", CheckAny},
//       {nullptr, 0, nullptr, nullptr},
//   };
//
// The check runs as the owner and group of the library file and returns
// true to let the visitor go on.
typedef struct _tag_API_SHARING_CHECK_TABLE {
    const char* api;      // api pattern or "*"; null ends the table
    int version;          // 0: every version
    const char* method;   // method pattern or "*"
    APICheckFn check;
} API_SHARING_CHECK_TABLE;

static_assert(sizeof(_tag_API_TABLE) == 4 * sizeof(void*), "API table entries are four words");
static_assert(sizeof(_tag_API_SHARING_CHECK_TABLE) == 4 * sizeof(void*), "sharing check entries are four words");
static_assert(sizeof(_tag_API_CHECK_TABLE) == 6 * sizeof(void*), "check table entries are six words");

extern "C" {
typedef _tag_API_TABLE* (*GetAPITableFn)(void);
typedef _tag_API_CHECK_TABLE* (*GetAPICheckTableFn)(void);
typedef int (*GetAPISharingCheckTableFn)(_tag_API_SHARING_CHECK_TABLE** table);
}

#pragma GCC visibility pop
