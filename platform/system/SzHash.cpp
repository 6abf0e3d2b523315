// The string table: string keys to string values in insertion order, keys
// unique. Entries live in a vector (the order) and an index map from key to
// position (the lookup).
#include <new>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "vela/vlibc.h"

struct _tag_VLIBCSZHASH_ {
    std::vector<std::pair<std::string, std::string>> entries;
    std::unordered_map<std::string, size_t> index;
};

namespace {
// A hint only: a hostile or mistaken size must not reserve gigabytes.
constexpr int kMaxReserve = 4096;
}  // namespace

PVLIBCSZHASH VLIBCSzHashAlloc(int size)
{
    PVLIBCSZHASH hash = new (std::nothrow) VLIBCSZHASH();
    if (hash == nullptr) {
        return nullptr;
    }
    const size_t reserve = static_cast<size_t>(size <= 0 ? 0 : (size > kMaxReserve ? kMaxReserve : size));
    try {
        hash->entries.reserve(reserve);
        hash->index.reserve(reserve);
    } catch (const std::exception&) {
        delete hash;
        return nullptr;
    }
    return hash;
}

void VLIBCSzHashFree(PVLIBCSZHASH hash) { delete hash; }

int VLIBCSzHashSetValue(PVLIBCSZHASH hash, const char* key, const char* value)
{
    if (hash == nullptr || key == nullptr || value == nullptr) {
        return -1;
    }
    try {
        auto found = hash->index.find(key);
        if (found != hash->index.end()) {
            hash->entries[found->second].second.assign(value);
            return 0;
        }
        hash->entries.emplace_back(key, value);
        try {
            hash->index.emplace(key, hash->entries.size() - 1);
        } catch (const std::exception&) {
            hash->entries.pop_back();  // keep the vector and the index in step
            return -1;
        }
    } catch (const std::exception&) {
        return -1;
    }
    return 0;
}

const char* VLIBCSzHashGetValue(PVLIBCSZHASH hash, const char* key)
{
    if (hash == nullptr || key == nullptr) {
        return nullptr;
    }
    try {
        auto found = hash->index.find(key);
        if (found == hash->index.end()) {
            return nullptr;
        }
        return hash->entries[found->second].second.c_str();
    } catch (const std::exception&) {
        return nullptr;  // building the lookup key ran out of memory
    }
}

int VLIBCSzHashCount(PVLIBCSZHASH hash)
{
    return hash == nullptr ? 0 : static_cast<int>(hash->entries.size());
}

const char* VLIBCSzHashKeyAt(PVLIBCSZHASH hash, int index)
{
    if (hash == nullptr || index < 0 || static_cast<size_t>(index) >= hash->entries.size()) {
        return nullptr;
    }
    return hash->entries[static_cast<size_t>(index)].first.c_str();
}

const char* VLIBCSzHashValueAt(PVLIBCSZHASH hash, int index)
{
    if (hash == nullptr || index < 0 || static_cast<size_t>(index) >= hash->entries.size()) {
        return nullptr;
    }
    return hash->entries[static_cast<size_t>(index)].second.c_str();
}
