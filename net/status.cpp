// The messages of the status codes. The table is indexed by the code's absolute value, so its order
// is the numbering itself: entries are only ever appended.
#include "s2s_status.h"

#include <cstdlib>

namespace S2S {

namespace {

// The texts are part of what peers and log readers see; their spelling is kept as it always was.
const char* const kMessages[] = {
    "Successful",
    "Interrupted",
    "I/O error",
    "System error",
    "Invalid argument",
    "Protocal error",
    "Authentication failure",
    "Server error",
    "Event conflict",
    "Connection timeout",
    "Incompatible version",
    "No such entry",
    "Invalid username",
    "Password and username not matched",
    "ZEM disabled",
    "User quota not enough",
    "Disk is full",
    "Sync Folder is miss",
    "View missing/invalid",
    "no permission ",
    "pull event by path, but the path is missing",
    "connection about by setting flag",
    "Local Disk is full",
    "file locked or no permission",
    "ssl certificate verify fail",
    "permission is read-only",
};

constexpr long kMessageCount = sizeof(kMessages) / sizeof(kMessages[0]);

}  // namespace

const char* StatusMessage(int status) {
    long index = std::labs(static_cast<long>(status));  // INT_MIN has no int absolute value
    return index < kMessageCount ? kMessages[index] : "Unknown error";
}

}  // namespace S2S
