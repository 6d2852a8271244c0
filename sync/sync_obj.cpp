// The sync model's value classes: event paths, server info validation, task copies.
#include "s2s_logger.h"
#include "s2s_sync_obj.h"
#include "sync/message_lines.h"

namespace S2S {

namespace {

constexpr unsigned kMaxPort = 65535;

}  // namespace

void Event::SetRelativePath(const std::string& path) {
    if (!path.empty() && path[0] == '/') {
        relative_path_ = path;
    } else {
        relative_path_ = "/" + path;
    }
}

bool SyncInfo::Validate() const {
    if (server_ip_.empty() && server_name_.empty()) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Empty server ip and name\n",
                       kLineEmptyServer);
        return false;
    }
    if (user_.empty()) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Empty user name '%s'\n",
                       kLineEmptyUser, user_.c_str());
        return false;
    }
    // Checked whether or not SSH is in use; 0 means "not set" and is fine.
    if (ssh_port_ > kMaxPort) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid SSH port '%u'\n",
                       kLineBadSSHPort, ssh_port_);
        return false;
    }
    return true;
}

TaskInfo::~TaskInfo() = default;

void SyncTask::SetInfo(const TaskInfo& info) {
    info_ = info;
}

}  // namespace S2S
