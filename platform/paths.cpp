// The one place where the system's fixed absolute paths meet S2S_ROOT.
#include <cstdlib>
#include <mutex>
#include <set>
#include <string>

#include "s2s_platform.h"

namespace {

std::mutex intern_mutex;

// Resolved paths are handed out as C strings that must outlive any later S2S_ROOT change, so they
// are interned in a node-based set that is never shrunk (one entry per root and fixed path).
std::set<std::string>& Interned() {
    static auto* paths = new std::set<std::string>();  // deliberately never destroyed: callers may
                                                       // hold pointers during static destruction
    return *paths;
}

}  // namespace

extern "C" const char* S2SPath(const char* fixedPath) {
    if (fixedPath == nullptr || fixedPath[0] != '/') {
        return fixedPath;
    }
    const char* root = std::getenv("S2S_ROOT");
    if (root == nullptr || root[0] == '\0') {
        return fixedPath;
    }
    std::string resolved(root);
    if (resolved.size() > 1 && resolved.back() == '/') {
        resolved.pop_back();
    }
    if (resolved == "/") {
        resolved.clear();
    }
    resolved += fixedPath;
    try {
        std::lock_guard<std::mutex> guard(intern_mutex);
        return Interned().insert(resolved).first->c_str();
    } catch (const std::bad_alloc&) {
        // Falling back to the unredirected path would touch the real system; refuse instead.
        return nullptr;
    }
}
