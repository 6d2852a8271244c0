// Whether a task definition may be saved or run. Kept apart from the value classes because it is
// the one part of the sync model that asks the host about its shares.
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_sync_obj.h"
#include "sync/message_lines.h"

namespace S2S {

bool TaskInfo::Validate() const {
    if (!sync_info_.Validate()) {
        return false;
    }
    if (!schedule_.Validate()) {
        return false;
    }
    // Deliberately without a trailing newline, unlike their neighbours: these texts are matched
    // exactly by the readers of this log.
    if (name_.empty()) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Empty task name",
                       kLineEmptyName);
        return false;
    }
    if (share_list_.empty()) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Empty share list",
                       kLineEmptyShares);
        return false;
    }
    for (const std::string& share : share_list_) {
        bool valid = false;
        if (IsValidShare(share, valid) < 0 || !valid) {
            Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Share '%s' is not valid\n",
                           kLineInvalidShare, share.c_str());
            return false;
        }
    }
    return true;
}

}  // namespace S2S
