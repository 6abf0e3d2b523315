#include "sharing/LazySqlite.h"

#include "system/LazyLibrary.h"

namespace VELA {
namespace sharing {

namespace {

bool Resolve(void* handle, SqliteApi& api, const char*& missing)
{
    VELA_SQLITE_FUNCTIONS(VELA_LAZY_RESOLVE)
    return true;
}

System::LazyLibrary<SqliteApi> g_sqlite("libsqlite3.so.0", "sharing links", Resolve);

}  // namespace

const SqliteApi* LazySqlite() { return g_sqlite.Get(); }

}  // namespace sharing
}  // namespace VELA
