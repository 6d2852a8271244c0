// Control of the sync service's daemon through the platform's service control, and the path
// test the callers use with it. An error reading the daemon's state reads as running.

#include <unistd.h>

#include <string>

#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace S2S {

namespace {

const char kDaemonService[] = "s2s_daemon";
// VLIBServiceStart's "already running": the daemon is where the caller wants it.
constexpr int kErrAlreadyInState = 0xEB00;

}  // namespace

int StartDaemon() {
    if (VLIBServiceStart(kDaemonService, 0) == 0) {
        return 0;
    }
    if (VLIBCErrGet() == kErrAlreadyInState) {
        return 0;
    }
    Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to start daemon, vurnerr=[0x%04X]",
                   __LINE__, VLIBCErrGet());
    return -1;
}

int StopDaemon() {
    if (VLIBServicePause(kDaemonService) == 0) {
        return 0;
    }
    Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to stop daemon, vurnerr=[0x%04X]",
                   __LINE__, VLIBCErrGet());
    return -1;
}

bool IsDaemonRunning() {
    // An error (negative) reads as running: better not to start a second daemon.
    return VLIBServiceIsRunning(kDaemonService) != 0;
}

bool IsPathExist(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

}  // namespace S2S
