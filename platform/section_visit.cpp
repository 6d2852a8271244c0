// One read of a section file for a decision over many of its sections: VLIBCFileVisitSections
// hands each section's pairs to the caller's visitor from the one parsed version of the file.
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "platform/platform_internal.h"
#include "platform/section_file.h"
#include "s2s_platform.h"

extern "C" {

int VLIBCFileVisitSections(const char* file, const char* prefix, VLIBSectionVisitor visit,
                           void* arg) {
    if (file == nullptr || *file == '\0' || visit == nullptr) {
        return s2s_platform::Fail(VLIB_ERR_BAD_PARAMETER);
    }
    const size_t prefixSize = prefix == nullptr ? 0 : std::strlen(prefix);
    try {
        std::shared_ptr<const s2s_platform::SectionDoc> doc;
        if (s2s_platform::LoadSectionFileShared(file, doc) != 0) {
            return -1;
        }
        std::vector<const char*> keys;
        std::vector<const char*> values;
        for (const std::string& name : doc->SectionNames()) {
            if (name.compare(0, prefixSize, prefix == nullptr ? "" : prefix) != 0) {
                continue;
            }
            const s2s_platform::Pairs pairs = doc->SectionPairs(name);
            keys.clear();
            values.clear();
            for (const auto& pair : pairs) {
                keys.push_back(pair.first.c_str());
                values.push_back(pair.second.c_str());
            }
            // The visitor's own failures keep the error it set.
            s2s_platform::SetError(VLIB_ERR_NONE);
            const int stop = visit(arg, name.c_str(), static_cast<int>(pairs.size()), keys.data(),
                                   values.data());
            if (stop != 0) {
                return stop;
            }
        }
    } catch (const std::bad_alloc&) {
        return s2s_platform::Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return s2s_platform::Succeed(0);
}

}  // extern "C"
