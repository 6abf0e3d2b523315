// libsqlite3, loaded on first use (not installed).
//
// The platform library does not link libsqlite3: a CGI process that never
// touches a sharing link must not pay for loading it. sqlite3.h is used only
// for types and prototypes; the first caller of LazySqlite() opens
// libsqlite3.so.0 with dlopen and resolves every function below with dlsym.
// The library stays loaded for the life of the process.
#pragma once

#include <sqlite3.h>

namespace VELA {
namespace sharing {

#define VELA_SQLITE_FUNCTIONS(X)  \
    X(sqlite3_open_v2)            \
    X(sqlite3_close_v2)           \
    X(sqlite3_busy_timeout)       \
    X(sqlite3_exec)               \
    X(sqlite3_prepare_v2)         \
    X(sqlite3_bind_text)          \
    X(sqlite3_bind_int64)         \
    X(sqlite3_step)               \
    X(sqlite3_column_text)        \
    X(sqlite3_column_bytes)       \
    X(sqlite3_column_int64)       \
    X(sqlite3_finalize)           \
    X(sqlite3_changes)            \
    X(sqlite3_errmsg)             \
    X(sqlite3_extended_result_codes)

struct SqliteApi {
#define VELA_SQLITE_MEMBER(name) decltype(&::name) name = nullptr;
    VELA_SQLITE_FUNCTIONS(VELA_SQLITE_MEMBER)
#undef VELA_SQLITE_MEMBER
};

// The resolved functions, or null when libsqlite3.so.0 cannot be opened or
// lacks one of them (logged once per process). Thread-safe.
const SqliteApi* LazySqlite();

}  // namespace sharing
}  // namespace VELA
