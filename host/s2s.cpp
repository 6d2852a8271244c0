// Host services of the sync library: the inter-process file lock, temporary files, control of
// the sync service's daemon, and the local share, volume, host and address queries.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace S2S {

namespace {

const char kDaemonService[] = "s2s_daemon";
// VLIBServiceStart's "already running": the daemon is where the caller wants it.
constexpr int kErrAlreadyInState = 0xEB00;

}  // namespace

// --- SimpleFileLock / LockFactory ------------------------------------------------

SimpleFileLock::SimpleFileLock(const std::string& path) : locked(false), fd(-1) {
    fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s.cpp(%d): Fail to open lock file at '%s', error:'%s'\n",
                       __LINE__, path.c_str(), strerror(errno));
    }
}

SimpleFileLock::~SimpleFileLock() {
    if (fd >= 0) {
        close(fd);
        fd = -1;
    }
}

SimpleFileLock::SimpleFileLock(SimpleFileLock&& other) noexcept
    : locked(other.locked), fd(other.fd) {
    other.locked = false;
    other.fd = -1;
}

SimpleFileLock& SimpleFileLock::operator=(SimpleFileLock&& other) noexcept {
    if (this != &other) {
        if (fd >= 0) {
            close(fd);
        }
        locked = other.locked;
        fd = other.fd;
        other.locked = false;
        other.fd = -1;
    }
    return *this;
}

int SimpleFileLock::ExLock() {
    if (locked) {
        return 0;
    }
    if (fd < 0) {
        return -1;
    }
    if (flock(fd, LOCK_EX) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to lock, error:'%s'\n", __LINE__,
                       strerror(errno));
        return -1;
    }
    locked = true;
    return 0;
}

int SimpleFileLock::UnLock() {
    if (!locked) {
        return 0;
    }
    if (fd < 0) {
        return -1;
    }
    if (flock(fd, LOCK_UN) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to unlock, error:'%s'\n", __LINE__,
                       strerror(errno));
        return -1;
    }
    locked = false;
    return 0;
}

LockFactory::LockFactory(const std::string& path) : path(path) {}

SimpleFileLock LockFactory::GetLock() const {
    return SimpleFileLock(path);
}

// --- temporary files ----------------------------------------------------------------

namespace {

// Output files of remote commands are written with content the server chose. Were the directory
// open to another user, that user could swap a reserved name for a symbolic link and have the
// content written wherever the link points, with this program's rights. So the directory must be
// a real directory owned by this program's user (root on a server) that nobody else can enter.
// Its parent is sticky (/tmp), so only its owner can rename or remove it once it is checked.
bool PrepareTempDir(const std::string& dir, std::string& error) {
    // Missing parents occur only below S2S_ROOT (/tmp itself always exists).
    for (size_t pos = 1; pos < dir.size(); ++pos) {
        if (dir[pos] == '/') {
            mkdir(dir.substr(0, pos).c_str(), 0755);
        }
    }
    if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
        error = "cannot create the temporary directory " + dir + ": " + strerror(errno);
        return false;
    }
    struct stat st;
    if (lstat(dir.c_str(), &st) != 0) {
        error = "cannot check the temporary directory " + dir + ": " + strerror(errno);
        return false;
    }
    const std::string me = geteuid() == 0 ? "root" : "user " + std::to_string(geteuid());
    if (!S_ISDIR(st.st_mode)) {
        error = "the temporary directory " + dir +
                " is not a directory (a link or a file stands in its place); remove it, it is "
                "created again at first use";
        return false;
    }
    if (st.st_uid != geteuid()) {
        error = "the temporary directory " + dir + " belongs to user " + std::to_string(st.st_uid) +
                ", not to " + me +
                "; refusing to use it (remove it, it is created again at first use)";
        return false;
    }
    if ((st.st_mode & 077) != 0) {
        char mode[8];
        snprintf(mode, sizeof(mode), "%04o", static_cast<unsigned>(st.st_mode & 07777));
        error = "the temporary directory " + dir + " has mode " + mode +
                "; other users must have no access to it, refusing to use it (chmod 700 " + dir +
                ")";
        return false;
    }
    return true;
}

}  // namespace

bool PrepareTempDir(std::string& error) {
    const char* dir = S2SPath(S2S_PATH_TEMP_DIR);
    if (dir == nullptr) {
        error = "out of memory";
        return false;
    }
    return PrepareTempDir(std::string(dir), error);
}

std::string GetTempFile(std::string& error) {
    const char* dir = S2SPath(S2S_PATH_TEMP_DIR);
    const char* tmpl = S2SPath(S2S_PATH_TEMP_TEMPLATE);
    if (dir == nullptr || tmpl == nullptr) {
        error = "out of memory";
        return std::string();
    }
    if (!PrepareTempDir(dir, error)) {
        return std::string();
    }
    std::string name(tmpl);
    // O_EXCL (always set by mkostemp) never follows a link; O_NOFOLLOW says so once more.
    int fd = mkostemp(&name[0], O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) {
        error = "cannot create a temporary file in " + std::string(dir) + ": " + strerror(errno);
        return std::string();
    }
    // The empty file stays: it reserves the name until PutTempFile.
    close(fd);
    return name;
}

std::string GetTempFile() {
    std::string error;
    std::string name = GetTempFile(error);
    if (name.empty()) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): %s\n", __LINE__, error.c_str());
    }
    return name;
}

void PutTempFile(const std::string& path) {
    if (path.empty()) {
        return;
    }
    if (unlink(path.c_str()) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to unlink temp file '%s' [%d]\n",
                       __LINE__, path.c_str(), errno);
    }
}

// --- daemon control ------------------------------------------------------------------

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

// --- share, volume, host and address queries ---------------------------------------

int GetShareInfo(const std::string& name, ShareInfo& info) {
    if (name.empty()) {
        return -1;
    }
    VURNShare* rec = nullptr;
    if (VURNShareGet(name.c_str(), &rec) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get share '%s'\n", __LINE__,
                       name.c_str());
        VURNShareFree(rec);
        return -1;
    }
    std::string path = rec->path != nullptr ? rec->path : "";
    if (path.empty()) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get the path of share '%s'\n",
                       __LINE__, name.c_str());
        VURNShareFree(rec);
        return -1;
    }
    std::string module_path = path;
    std::string module_name = name;
    if ((rec->status & 0x2) != 0) {
        char buffer[4096] = {0};
        if (VLIBShareEncryptPathGet(path.c_str(), buffer, 4095) < 0) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] s2s.cpp(%d): Fail to get encrypted path of share '%s'\n",
                           __LINE__, name.c_str());
            VURNShareFree(rec);
            return -1;
        }
        module_path = buffer;
        module_name = "@" + name + "@";
    }
    info.name = name;
    info.path = path;
    info.modulePath = module_path;
    info.moduleName = module_name;
    info.status = rec->status;
    info.encKeyLen = rec->keyLen;
    VURNShareFree(rec);
    return 0;
}

int GetVolumeInfo(const std::string& shareName, VolumeInfo& info) {
    ShareInfo share;
    if (GetShareInfo(shareName, share) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get share info\n", __LINE__);
        return -1;
    }
    VURNVolumeRecord record;
    std::memset(&record, 0, sizeof(record));
    if (VolumePathParseEx(share.GetPath().c_str(), &record) != 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s.cpp(%d): Fail to get volume info of share '%s'\n", __LINE__,
                       shareName.c_str());
        return -1;
    }
    info.path = record.path;
    info.type = record.type;
    return 0;
}

int IsValidShare(const std::string& name, bool& valid) {
    if (VLIBCIsPortBox()) {
        // The PortBox model class syncs the shares of its share bin, whatever their volume.
        valid = VURNShareIsInSharebin(name.c_str()) == 1;
        return 0;
    }
    VolumeInfo volume;
    if (GetVolumeInfo(name, volume) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get volume info\n", __LINE__);
        return -1;
    }
    valid = volume.IsInternal();
    return 0;
}

std::string GetClientID() {
    char buffer[1024];
    std::memset(buffer, 0, sizeof(buffer));
    if (VURNHAIsRunning()) {
        // Both machines of an HA pair present the pair's serial number; no MAC fallback there.
        VLIBGetSerialNumber(buffer, sizeof(buffer));
        if (buffer[0] == '\0') {
            Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get ha sn and mac\n",
                           __LINE__);
            return "";
        }
        return buffer;
    }
    // Servers keep client IDs in 36-byte fields: at most 35 characters of the serial number.
    VLIBGetSerialNumber(buffer, 36);
    if (buffer[0] != '\0') {
        return buffer;
    }
    VLIBNetIfInfo interfaces[1];
    if (VLIBNetGetInterfaceInfo(interfaces, 1, 1) > 0) {
        const unsigned char* mac = interfaces[0].mac;
        snprintf(buffer, sizeof(buffer), "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2],
                 mac[3], mac[4], mac[5]);
        return buffer;
    }
    return "";
}

std::string GetHostName(unsigned skip) {
    char buffer[64];
    std::memset(buffer, 0, sizeof(buffer));
    if (VURNLnxGetHostname(buffer) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to call VURNLnxGetHostname\n",
                       __LINE__);
        return "";
    }
    std::string host(buffer);
    // Servers take the name's tail, not its head: a long name loses its first `skip` characters.
    if (skip < host.size()) {
        host = host.substr(skip);
    }
    return host;
}

int GetUsableIP(const std::string& serverName, const std::string& serverIP,
                std::vector<std::string>& ips) {
    VURNBkpIPEntry entries[20];
    std::memset(entries, 0, sizeof(entries));
    int count = VURNBkpGetUsableIPList(serverName.c_str(), serverIP.c_str(), entries, 20);
    if (count < 1) {
        return -1;
    }
    for (int i = 0; i < count; ++i) {
        ips.push_back(entries[i].addr);
    }
    return 0;
}

}  // namespace S2S
