// Owning handles for the platform's C records: string hashes, string lists and share records.
// Each handle frees its record with the platform's own release function on every path (the
// release functions ignore null). The C interface keeps its C shape; these exist on the C++ side
// only. For the C calls that fill or grow a record through a pointer to pointer, release the
// record into a raw pointer, make the call and reset the handle with what it left there.
#ifndef S2S_PLATFORM_RECORDS_H
#define S2S_PLATFORM_RECORDS_H

#include <memory>

#include "s2s_platform.h"

namespace S2S {

template <typename Record, void (*Release)(Record*)>
struct PlatformRecordFree {
    void operator()(Record* record) const { Release(record); }
};

using HashRecord = std::unique_ptr<VLIBSzHash, PlatformRecordFree<VLIBSzHash, VLIBCSzHashFree>>;
using ListRecord = std::unique_ptr<VLIBSzList, PlatformRecordFree<VLIBSzList, VLIBCSzListFree>>;
using ShareRecord = std::unique_ptr<VURNShare, PlatformRecordFree<VURNShare, VURNShareFree>>;

}  // namespace S2S

#endif  // S2S_PLATFORM_RECORDS_H
