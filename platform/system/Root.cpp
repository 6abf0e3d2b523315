// The system root: the directory under which every absolute path of the
// system is resolved (VELA_ROOT, "/" by default).
#include <cstdlib>
#include <mutex>
#include <string>

#include "vela/log.h"
#include "vela/vlibc.h"

namespace VELA {
namespace System {
namespace {

std::mutex g_rootLock;
std::string g_root;
bool g_rootLoaded = false;

// VELA_ROOT, read with secure_getenv so a set-user-id process ignores it.
// Only an absolute path is accepted; trailing slashes are dropped so that
// Path() can append an absolute path without doubling the separator.
std::string LoadRoot()
{
    const char* env = secure_getenv("VELA_ROOT");
    if (env == nullptr || *env == '\0') {
        return "/";
    }
    if (*env != '/') {
        VELA_LOG_ERR("VELA_ROOT \"%.256s\" is not an absolute path, using /", env);
        return "/";
    }
    std::string root(env);
    while (root.size() > 1 && root.back() == '/') {
        root.pop_back();
    }
    return root;
}

}  // namespace

const std::string& Root()
{
    std::lock_guard<std::mutex> guard(g_rootLock);
    if (!g_rootLoaded) {
        g_root = LoadRoot();
        g_rootLoaded = true;
    }
    return g_root;
}

std::string Path(const std::string& absolute)
{
    const std::string& root = Root();
    if (root == "/") {
        if (!absolute.empty() && absolute[0] == '/') {
            return absolute;
        }
        return "/" + absolute;
    }
    if (!absolute.empty() && absolute[0] == '/') {
        return root + absolute;
    }
    return root + "/" + absolute;
}

void RootReset()
{
    std::lock_guard<std::mutex> guard(g_rootLock);
    g_root.clear();
    g_rootLoaded = false;
}

}  // namespace System
}  // namespace VELA
