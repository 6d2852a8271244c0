// Queries about this host: shares, the volumes they live on, the client ID, host names and the
// address to reach a server by. They only read; nothing here changes the host.

#include <errno.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "platform/records.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace S2S {

int GetShareInfo(const std::string& name, ShareInfo& info) {
    if (name.empty()) {
        return -1;
    }
    VURNShare* raw = nullptr;
    const int got = VURNShareGet(name.c_str(), &raw);
    const ShareRecord rec(raw);  // freed on every path below
    if (got != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get share '%s'\n", __LINE__,
                       name.c_str());
        return -1;
    }
    std::string path = rec->path != nullptr ? rec->path : "";
    if (path.empty()) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to get the path of share '%s'\n",
                       __LINE__, name.c_str());
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
