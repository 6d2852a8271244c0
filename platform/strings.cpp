// Platform strings, string tables and string lists: the C containers the pairing store and the
// share registry hand across the C interface.
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <new>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/platform_internal.h"
#include "s2s_platform.h"

using s2s_platform::Fail;
using s2s_platform::Succeed;

// Entries keep insertion order so a section read and written back keeps its key order.
struct VLIBSzHash {
    std::vector<std::pair<std::string, std::string>> entries;
    std::unordered_map<std::string, size_t> index;
};

struct VLIBSzList {
    std::vector<std::string> items;
};

extern "C" {

char* VLIBCStrGet(const char* format, ...) {
    if (format == nullptr) {
        s2s_platform::SetError(VLIB_ERR_BAD_PARAMETER);
        return nullptr;
    }
    va_list args;
    va_start(args, format);
    char* out = nullptr;
    int n = vasprintf(&out, format, args);
    va_end(args);
    if (n < 0) {
        s2s_platform::SetError(VLIB_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    s2s_platform::SetError(VLIB_ERR_NONE);
    return out;
}

void VLIBCStrPut(char* str) {
    std::free(str);
}

// The tables and lists cross the C interface as opaque pointers, so they are allocated with new
// here and deleted by the matching Free.
VLIBSzHash* VLIBCSzHashAlloc(int size) {
    if (size < 0) {
        s2s_platform::SetError(VLIB_ERR_BAD_PARAMETER);
        return nullptr;
    }
    VLIBSzHash* hash = new (std::nothrow) VLIBSzHash();
    if (hash == nullptr) {
        s2s_platform::SetError(VLIB_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    try {
        hash->entries.reserve(static_cast<size_t>(size > 4096 ? 4096 : size));
    } catch (const std::bad_alloc&) {
        // The size is only a hint; the table grows when it is used.
    }
    s2s_platform::SetError(VLIB_ERR_NONE);
    return hash;
}

void VLIBCSzHashFree(VLIBSzHash* hash) {
    delete hash;
}

const char* VLIBCSzHashGetValue(const VLIBSzHash* hash, const char* key) {
    if (hash == nullptr || key == nullptr) {
        return nullptr;
    }
    try {
        auto it = hash->index.find(key);
        return it == hash->index.end() ? nullptr : hash->entries[it->second].second.c_str();
    } catch (const std::bad_alloc&) {
        s2s_platform::SetError(VLIB_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
}

int VLIBCSzHashSetValue(VLIBSzHash** hash, const char* key, const char* value) {
    if (hash == nullptr || *hash == nullptr || key == nullptr || key[0] == '\0' ||
        value == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    VLIBSzHash* table = *hash;
    try {
        auto it = table->index.find(key);
        if (it != table->index.end()) {
            table->entries[it->second].second = value;
        } else {
            table->entries.emplace_back(key, value);
            try {
                table->index.emplace(key, table->entries.size() - 1);
            } catch (...) {
                table->entries.pop_back();
                throw;
            }
        }
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(0);
}

int VLIBCSzHashRemove(VLIBSzHash* hash, const char* key) {
    if (hash == nullptr || key == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        auto it = hash->index.find(key);
        if (it == hash->index.end()) {
            return Fail(VLIB_ERR_NOT_FOUND);
        }
        size_t gone = it->second;
        hash->index.erase(it);
        hash->entries.erase(hash->entries.begin() + static_cast<std::ptrdiff_t>(gone));
        for (auto& slot : hash->index) {
            if (slot.second > gone) {
                --slot.second;
            }
        }
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(0);
}

void VLIBCHashRemoveAll(VLIBSzHash* hash) {
    if (hash != nullptr) {
        hash->entries.clear();
        hash->index.clear();
    }
}

int VLIBCSzHashCount(const VLIBSzHash* hash) {
    return hash == nullptr ? 0 : static_cast<int>(hash->entries.size());
}

const char* VLIBCSzHashKeyAt(const VLIBSzHash* hash, int index) {
    if (hash == nullptr || index < 0 || static_cast<size_t>(index) >= hash->entries.size()) {
        return nullptr;
    }
    return hash->entries[static_cast<size_t>(index)].first.c_str();
}

const char* VLIBCSzHashValueAt(const VLIBSzHash* hash, int index) {
    if (hash == nullptr || index < 0 || static_cast<size_t>(index) >= hash->entries.size()) {
        return nullptr;
    }
    return hash->entries[static_cast<size_t>(index)].second.c_str();
}

VLIBSzList* VLIBCSzListAlloc(int size) {
    if (size < 0) {
        s2s_platform::SetError(VLIB_ERR_BAD_PARAMETER);
        return nullptr;
    }
    VLIBSzList* list = new (std::nothrow) VLIBSzList();
    if (list == nullptr) {
        s2s_platform::SetError(VLIB_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    try {
        list->items.reserve(static_cast<size_t>(size > 4096 ? 4096 : size));
    } catch (const std::bad_alloc&) {
        // Only a hint.
    }
    s2s_platform::SetError(VLIB_ERR_NONE);
    return list;
}

void VLIBCSzListFree(VLIBSzList* list) {
    delete list;
}

int VLIBCSzListPush(VLIBSzList** list, const char* str) {
    if (list == nullptr || *list == nullptr || str == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        (*list)->items.emplace_back(str);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(0);
}

void VLIBCSzListRemoveAll(VLIBSzList* list) {
    if (list != nullptr) {
        list->items.clear();
    }
}

int VLIBCSzListCount(const VLIBSzList* list) {
    return list == nullptr ? 0 : static_cast<int>(list->items.size());
}

const char* VLIBCSzListGet(const VLIBSzList* list, int index) {
    if (list == nullptr || index < 0 || static_cast<size_t>(index) >= list->items.size()) {
        return nullptr;
    }
    return list->items[static_cast<size_t>(index)].c_str();
}

}  // extern "C"
