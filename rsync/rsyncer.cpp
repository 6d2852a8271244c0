// Rsyncer's life cycle, its share-information cache, the start of a share's sync and its data
// runs.
#include <list>
#include <string>

#include "core/protocol.h"
#include "rsync/path_list.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_rsyncer.h"

namespace S2S {

namespace {

namespace protocol = S2S::protocol;

const char* Flag(bool on) {
    return on ? protocol::kOne : protocol::kZero;
}

}  // namespace

Rsyncer::Rsyncer() : serverVersion(-1), versionResult(0), cancelChecker(nullptr) {}

Rsyncer::~Rsyncer() = default;

int Rsyncer::Initialize(const SyncInfo& info) {
    Clear();
    syncInfo = info;
    return TestServer();
}

void Rsyncer::Adopt(const SyncInfo& info, const std::string& address, int version) {
    syncInfo = info;
    syncInfo.SetServerIP(address);
    serverVersion = version;
    versionResult = 0;
}

int Rsyncer::Connect(const SyncInfo& info) {
    const int rc = Initialize(info);
    if (rc != 0 || serverVersion >= 0) {
        return rc;
    }
    Logger::LogMsg(Logger::Error,
                   "[ERROR] s2s_rsyncer.cpp(%d): The server answered but its version is unknown "
                   "[%d]\n",
                   __LINE__, versionResult);
    return kRsyncResultNoVersion;
}

// Re-initialising an Rsyncer deliberately keeps the share cache and the server version: a share's
// facts are read once per Rsyncer, and a version learnt earlier still lets TestServer succeed.
void Rsyncer::Clear() {}

int Rsyncer::GetShareInfo(const std::string& name, ShareInfo& info) {
    std::map<std::string, ShareInfo>::const_iterator it = shareInfoCache.find(name);
    if (it != shareInfoCache.end()) {
        info = it->second;
        return 0;
    }
    if (::S2S::GetShareInfo(name, info) < 0) {
        return -1;
    }
    shareInfoCache[name] = info;
    return 0;
}

int Rsyncer::InitRsyncTask(RsyncTask& task, bool isTest) const {
    task.SetServerIP(syncInfo.GetServerIP());
    task.SetUser(syncInfo.GetUser());
    task.SetPassword(syncInfo.GetPassword());
    task.SetSSH(syncInfo.UseSSH());
    task.SetTestTask(isTest);
    // Without SSH the wrapper keeps the rsync daemon's port, whatever SSH port the task holds.
    if (syncInfo.UseSSH()) {
        task.SetServerPort(syncInfo.GetSSHPort());
    }
    return 0;
}

int Rsyncer::GenStartSyncShareCmd(const std::string& shareName, bool withAttributes,
                                  std::list<std::string>& lines) {
    if (shareName.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): GenStartSyncShareCmd: Empty parameter\n",
                       __LINE__);
        return -1;
    }
    ShareInfo info;
    if (GetShareInfo(shareName, info) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to get share info\n",
                       __LINE__);
        return -1;
    }
    // The volume is asked each time: only the share's own facts are cached.
    VolumeInfo volume;
    if (GetVolumeInfo(shareName, volume) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to get volume info\n",
                       __LINE__);
        return -1;
    }
    ParamList params;
    params.emplace_back(protocol::kKeyVolumeName, volume.GetName());
    params.emplace_back(protocol::kKeyShareName, info.GetName());
    if (withAttributes) {
        params.emplace_back(protocol::kKeyIsEncrypt, Flag(info.IsEncrypted()));
        params.emplace_back(protocol::kKeyIsAutomount, Flag(info.IsAutoMount()));
        params.emplace_back(protocol::kKeyIsEnableACL, Flag(info.IsACL()));
        params.emplace_back(protocol::kKeyIsWinShare, Flag(info.IsWinShare()));
        params.emplace_back(protocol::kKeyLenEncKey, std::to_string(info.GetEncryptKeyLen()));
    }
    return GenCommandLines(protocol::kSyncStart, params, lines);
}

int Rsyncer::StartSyncShare(const std::string& shareName, bool withAttributes, int& result) {
    std::list<std::string> lines;
    if (GenStartSyncShareCmd(shareName, withAttributes, lines) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): StartSyncShare: Fail to write command file\n",
                       __LINE__);
        return -1;
    }
    RunCommandLines(lines, false, result);
    return 0;
}

int Rsyncer::StartSyncShare(const std::string& shareName, int& result) {
    if (StartSyncShare(shareName, true, result) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): Fail to start sync share '%s' with ACL\n",
                       __LINE__, shareName.c_str());
        return -1;
    }
    // A server that does not know the attribute keys asks for the plain form once; every other
    // answer is the caller's to judge.
    if (result == kRsyncResultRetryPlain) {
        if (StartSyncShare(shareName, false, result) < 0) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] s2s_rsyncer.cpp(%d): Fail to start sync share '%s'\n", __LINE__,
                           shareName.c_str());
            return -1;
        }
    }
    return 0;
}

int Rsyncer::RunSync(unsigned long long /*id*/, const std::string& shareName,
                     const std::string& relPath, const std::list<std::string>& excludes,
                     int& result) {
    ShareInfo info;
    if (GetShareInfo(shareName, info) < 0) {
        maxDelete = -1;
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to get share info\n",
                       __LINE__);
        return -1;
    }
    if (relPath == "/") {
        // The trailing slash sends the share's contents rather than the directory itself.
        return Transfer(shareName, info.GetModulePath() + "/", false, "", excludes, result);
    }
    // "/." anchors the relative path: what follows it is recreated under the share on the server.
    return Transfer(shareName, info.GetModulePath() + "/." + relPath, true, "", excludes, result);
}

int Rsyncer::RunSyncPaths(const std::string& shareName, const std::vector<std::string>& paths,
                          const std::list<std::string>& excludes, int& result) {
    ShareInfo info;
    PathList list;
    std::string why;
    if (GetShareInfo(shareName, info) < 0 || !list.Write(paths, why)) {
        maxDelete = -1;
        lastError = why.empty() ? "the facts of share '" + shareName + "' cannot be read" : why;
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): %s\n", __LINE__,
                       lastError.c_str());
        return -1;
    }
    return Transfer(shareName, info.GetModulePath() + "/", false, list.File(), excludes, result);
}

int Rsyncer::Transfer(const std::string& shareName, const std::string& src, bool relative,
                      const std::string& listFile, const std::list<std::string>& excludes,
                      int& result) {
    // The limit belongs to this run alone; the next one starts without it.
    const long long limit = maxDelete;
    maxDelete = -1;
    ShareInfo info;
    if (GetShareInfo(shareName, info) < 0) {
        return -1;
    }
    RsyncTask task;
    InitRsyncTask(task, false);
    task.SetCompression(syncInfo.UseCompression());
    task.SetBlockLevelSync(syncInfo.UseBlockLevelSync());
    task.SetSyncACL(true);
    task.setBandwidthLimit(syncInfo.GetMaxBandwidth());
    if (progressCallback) {
        task.setProgressCallback(progressCallback);
    }
    task.SetMaxDelete(limit);
    task.SetRelativePath(relative);
    task.setFilesFrom(listFile);
    // A path that vanished before it could be sent counts as done.
    if (!IsPathExist(src)) {
        lastError.clear();
        result = 0;
        return 0;
    }
    // An encrypted share goes as its ciphertext directory under "@name@".
    result = task.Execute(src, info.GetModuleName(), cancelChecker, "", excludes);
    lastError = task.lastError();
    return 0;
}

}  // namespace S2S
