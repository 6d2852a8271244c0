// Encryption key sync: an encrypted share's key file travels to the server's key directory over
// SSH.
#include <list>
#include <memory>
#include <string>

#include "platform/records.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "s2s_rsyncer.h"

namespace S2S {

namespace {

constexpr int kKeyPathSize = 4096;

}  // namespace

// The key file's content is opaque here: it is never opened, parsed or logged, only handed to
// rsync by path.
int Rsyncer::SyncEncryptKey(const std::string& shareName) const {
    lastError.clear();
    VURNShare* raw = nullptr;
    const int got = VURNShareGet(shareName.c_str(), &raw);
    ShareRecord share(raw);  // freed on every path below
    if (got < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): Fail to get share '%s', errno=[%d]\n",
                       __LINE__, shareName.c_str(), VLIBCErrGet());
        return kRsyncResultLocalFailure;
    }
    int encrypted = 0;
    if (VLIBShareIsEncryptionGet(share.get(), &encrypted) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): Fail to get status of encryption of share "
                       "'%s', errno=[%d]\n",
                       __LINE__, shareName.c_str(), VLIBCErrGet());
        return kRsyncResultLocalFailure;
    }
    if (!encrypted) {
        return 0;
    }
    int autoMount = 0;
    if (VLIBShareIsAutoDecryptGet(share.get(), &autoMount) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): Fail to get status of encryption of share "
                       "'%s', errno=[%d]\n",
                       __LINE__, shareName.c_str(), VLIBCErrGet());
        return kRsyncResultLocalFailure;
    }
    // An automatically mounted share is opened with its auto-mount key file, so that is the one
    // the server gets.
    char keyFile[kKeyPathSize] = {0};
    if (autoMount) {
        if (VURNShareEncAutoKeyFileGet(share.get(), keyFile, kKeyPathSize) < 0) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] s2s_rsyncer.cpp(%d): SyncEncryptKey: Fail to get auto key file "
                           "path for share '%s', errno=[%d]\n",
                           __LINE__, shareName.c_str(), VLIBCErrGet());
            return kRsyncResultLocalFailure;
        }
    } else if (VURNShareEncKeyFileGet(share.get(), keyFile, kKeyPathSize) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): SyncEncryptKey: Fail to get key file path for "
                       "share '%s', errno=[%d]\n",
                       __LINE__, shareName.c_str(), VLIBCErrGet());
        return kRsyncResultLocalFailure;
    }
    // A share whose key is not stored on this machine has nothing to send.
    if (!VLIBCFileExist(keyFile)) {
        return 0;
    }
    RsyncTask task;
    InitRsyncTask(task, false);
    task.SetCompression(syncInfo.UseCompression());
    task.SetBlockLevelSync(syncInfo.UseBlockLevelSync());
    // The key never travels over the rsync daemon's own channel, whatever the task's setting.
    task.SetSSH(true);
    task.SetServerPort(syncInfo.GetSSHPort());
    const int result =
        task.Execute(keyFile, S2S_PATH_KEY_DIR, cancelChecker, shareName, std::list<std::string>());
    lastError = task.lastError();
    return result;
}

}  // namespace S2S
