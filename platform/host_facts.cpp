// Host facts: serial number, HA state and model class from the host file, the host name, network
// interfaces, and the volume that holds a path.
#include <arpa/inet.h>
#include <errno.h>
#include <ifaddrs.h>
#include <limits.h>
#include <net/if.h>
#include <net/if_arp.h>
#include <netinet/in.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <cstring>
#include <map>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "platform/env.h"
#include "platform/platform_internal.h"
#include "platform/section_file.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

using S2S::Logger;
using s2s_platform::Fail;
using s2s_platform::SectionDoc;
using s2s_platform::Succeed;

namespace {

// The host file, or an empty document when there is none (a machine without recorded facts).
// -1 when it exists but cannot be read or parsed (logged by the loader).
int LoadHostConf(SectionDoc& doc) {
    const char* path = S2SPath(S2S_PATH_HOST_CONF);
    if (path == nullptr) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    if (s2s_platform::LoadSectionFile(path, doc) != 0) {
        if (VLIBCErrGet() == VLIB_ERR_FILE_NOT_FOUND) {
            doc = SectionDoc();
            return Succeed(0);
        }
        return -1;
    }
    return 0;
}

std::string HostValue(const SectionDoc& doc, const char* key) {
    std::string value;
    doc.GetValue("host", key, value);
    return s2s_platform::Trim(value);
}

// Firmware fills an unset serial number with one of these.
bool IsPlaceholderSerial(const std::string& serial) {
    static const char* const kPlaceholders[] = {"none",
                                                "not specified",
                                                "to be filled by o.e.m.",
                                                "default string",
                                                "system serial number",
                                                "0123456789",
                                                "0",
                                                "n/a",
                                                "not applicable",
                                                "chassis serial number"};
    std::string lower = serial;
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    for (const char* p : kPlaceholders) {
        if (lower == p) {
            return true;
        }
    }
    return lower.find_first_not_of("0 ") == std::string::npos;
}

std::string DmiSerial() {
    std::string text;
    const char* path = S2SPath(S2S_PATH_DMI_SERIAL);
    if (path == nullptr || s2s_platform::Env::Default()->ReadWholeFile(path, text, 4096) != 0) {
        return std::string();
    }
    text = s2s_platform::Trim(text.substr(0, text.find('\n')));
    for (char c : text) {
        if (static_cast<unsigned char>(c) < 0x20 || static_cast<unsigned char>(c) > 0x7E) {
            return std::string();
        }
    }
    return IsPlaceholderSerial(text) ? std::string() : text;
}

// Mount points in mountinfo escape blanks, tabs, newlines and backslashes as \ooo.
std::string UnescapeMountPath(const std::string& text) {
    std::string out;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] == '\\' && i + 3 < text.size() &&
            std::isdigit(static_cast<unsigned char>(text[i + 1])) &&
            std::isdigit(static_cast<unsigned char>(text[i + 2])) &&
            std::isdigit(static_cast<unsigned char>(text[i + 3]))) {
            out += static_cast<char>((text[i + 1] - '0') * 64 + (text[i + 2] - '0') * 8 +
                                     (text[i + 3] - '0'));
            i += 3;
        } else {
            out += text[i];
        }
    }
    return out;
}

struct Mount {
    std::string path;
    std::string device;  // "major:minor"
};

bool ReadMounts(std::vector<Mount>& mounts) {
    std::string text;
    if (s2s_platform::Env::Default()->ReadWholeFile("/proc/self/mountinfo", text, 16u << 20) != 0) {
        return false;
    }
    size_t pos = 0;
    while (pos < text.size()) {
        size_t end = text.find('\n', pos);
        if (end == std::string::npos) {
            end = text.size();
        }
        std::string line = text.substr(pos, end - pos);
        pos = end + 1;
        // Fields: id parent major:minor root mount-point ...
        std::vector<std::string> fields;
        size_t start = 0;
        while (fields.size() < 5 && start < line.size()) {
            size_t blank = line.find(' ', start);
            if (blank == std::string::npos) {
                blank = line.size();
            }
            fields.push_back(line.substr(start, blank - start));
            start = blank + 1;
        }
        if (fields.size() == 5) {
            mounts.push_back(Mount{UnescapeMountPath(fields[4]), fields[2]});
        }
    }
    return !mounts.empty();
}

// True when `path` is `prefix` or lies below it.
bool Contains(const std::string& prefix, const std::string& path) {
    if (prefix == "/") {
        return !path.empty() && path[0] == '/';
    }
    return path.compare(0, prefix.size(), prefix) == 0 &&
           (path.size() == prefix.size() || path[prefix.size()] == '/');
}

bool ReadFlag(const std::string& path) {
    std::string text;
    return s2s_platform::Env::Default()->ReadWholeFile(path, text, 64) == 0 &&
           s2s_platform::Trim(text) == "1";
}

// A block device counts as external when it (or the disk of a partition) is removable or hangs
// off a USB bus.
bool IsExternalDevice(const std::string& device) {
    std::string sys = "/sys/dev/block/" + device;
    char resolved[PATH_MAX];
    if (realpath(sys.c_str(), resolved) == nullptr) {
        return false;  // not a block device (tmpfs, overlay, network file systems)
    }
    std::string real(resolved);
    if (real.find("/usb") != std::string::npos) {
        return true;
    }
    if (ReadFlag(real + "/removable")) {
        return true;
    }
    struct stat st;
    return stat((real + "/partition").c_str(), &st) == 0 && ReadFlag(real + "/../removable");
}

std::string StripSlashes(std::string path) {
    while (path.size() > 1 && path.back() == '/') {
        path.pop_back();
    }
    return path;
}

// A volume as host.conf lists it, compared with resolved paths: a listed path reached through a
// symbolic link names the directory it leads to. One that cannot be resolved is taken as written.
std::string ListedVolume(const std::string& listed) {
    std::string path = StripSlashes(listed);
    char resolved[PATH_MAX];
    if (!path.empty() && path[0] == '/' && realpath(path.c_str(), resolved) != nullptr) {
        path = resolved;
    }
    return path;
}

// A [volumes] value: "internal" or "external", optionally followed by ",directory" for a volume
// that is a plain directory of a larger file system rather than a mount point of its own.
bool ParseVolumeValue(const std::string& value, int& type, bool& directory) {
    std::string word = value;
    directory = false;
    const size_t comma = value.find(',');
    if (comma != std::string::npos) {
        if (s2s_platform::Trim(value.substr(comma + 1)) != "directory") {
            return false;
        }
        directory = true;
        word = s2s_platform::Trim(value.substr(0, comma));
    }
    if (word == "internal") {
        type = VURN_VOLUME_TYPE_INTERNAL;
    } else if (word == "external") {
        type = VURN_VOLUME_TYPE_EXTERNAL;
    } else {
        return false;
    }
    return true;
}

// The frame of a fact read from the host file into the caller's buffer: the buffer is checked
// and emptied first, then `fill` gets the loaded file and gives the result. -1 when the file
// cannot be loaded; running out of memory anywhere is VLIB_ERR_OUT_OF_MEMORY.
template <typename Fill>
int HostFactInto(char* buf, int size, Fill fill) {
    if (buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    buf[0] = '\0';
    try {
        SectionDoc doc;
        if (LoadHostConf(doc) != 0) {
            return -1;
        }
        return fill(doc);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

}  // namespace

extern "C" {

int VLIBGetSerialNumber(char* buf, int size) {
    return HostFactInto(buf, size, [&](const SectionDoc& doc) {
        std::string serial = HostValue(doc, "serial");
        if (serial.empty()) {
            serial = DmiSerial();
        }
        // Serial numbers name this machine towards servers, which take letters, digits and
        // "-_.:" only; firmware of virtual machines reports serials with blanks and other
        // characters ("VMware-56 4d ..."). Each such byte becomes '-', so any serial gives an
        // identity a server accepts, the same one every time.
        for (char& c : serial) {
            const unsigned char u = static_cast<unsigned char>(c);
            if (!(std::isalnum(u) && u < 0x80) && c != '-' && c != '_' && c != '.' && c != ':') {
                c = '-';
            }
        }
        // The caller's size is the limit: a longer serial number is cut, as callers expect.
        size_t n = std::min(serial.size(), static_cast<size_t>(size - 1));
        std::memcpy(buf, serial.data(), n);
        buf[n] = '\0';
        return Succeed(0);
    });
}

int VURNHAIsRunning(void) {
    try {
        SectionDoc doc;
        if (LoadHostConf(doc) != 0) {
            return 0;
        }
        std::string ha = HostValue(doc, "ha");
        if (!ha.empty() && ha != "yes" && ha != "no") {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] host_facts.cpp(%d): Invalid ha value '%s' in '%s'\n", __LINE__,
                           ha.c_str(), S2SPath(S2S_PATH_HOST_CONF));
            s2s_platform::SetError(VLIB_ERR_BAD_FORMAT);
            return 0;
        }
        return Succeed(ha == "yes" ? 1 : 0);
    } catch (const std::bad_alloc&) {
        s2s_platform::SetError(VLIB_ERR_OUT_OF_MEMORY);
        return 0;
    }
}

int VLIBGetModelClass(char* buf, int size) {
    return HostFactInto(buf, size, [&](const SectionDoc& doc) {
        return s2s_platform::CopyOut(HostValue(doc, "model_class"), buf, size);
    });
}

int VLIBCIsPortBox(void) {
    char model[256];
    return VLIBGetModelClass(model, sizeof(model)) >= 0 && std::strcmp(model, "portbox") == 0 ? 1
                                                                                              : 0;
}

int VURNLnxGetHostname(char* buf) {
    if (buf == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    char name[HOST_NAME_MAX + 2] = {0};
    if (gethostname(name, sizeof(name) - 1) != 0) {
        int saved = errno;
        buf[0] = '\0';
        Logger::LogMsg(Logger::Error,
                       "[ERROR] host_facts.cpp(%d): gethostname failed, error:'%s'\n", __LINE__,
                       std::strerror(saved));
        return Fail(VLIB_ERR_IO);
    }
    size_t n = std::min(std::strlen(name), static_cast<size_t>(VURN_HOSTNAME_MAX - 1));
    std::memcpy(buf, name, n);
    buf[n] = '\0';
    return Succeed(0);
}

int VLIBNetGetInterfaceInfo(VLIBNetIfInfo* list, int max, int flags) {
    if (list == nullptr || max <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    struct ifaddrs* addrs = nullptr;
    if (getifaddrs(&addrs) != 0) {
        int saved = errno;
        Logger::LogMsg(Logger::Error, "[ERROR] host_facts.cpp(%d): getifaddrs failed, error:'%s'\n",
                       __LINE__, std::strerror(saved));
        return Fail(s2s_platform::ErrorFromErrno(saved));
    }
    int sock = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    int count = 0;
    try {
        // One entry per interface. Physical devices come first, then virtual ones, each in
        // kernel index order: the first interface is then a real network card, whose address
        // survives a reboot (bridges, tunnels and the like often get random ones).
        std::map<std::pair<int, unsigned>, VLIBNetIfInfo> found;
        for (struct ifaddrs* a = addrs; a != nullptr; a = a->ifa_next) {
            if (a->ifa_name == nullptr || (a->ifa_flags & IFF_LOOPBACK) != 0 ||
                std::strlen(a->ifa_name) >= sizeof(VLIBNetIfInfo::name)) {
                continue;
            }
            unsigned index = if_nametoindex(a->ifa_name);
            if (index == 0) {
                continue;
            }
            struct stat st;
            std::string device = std::string("/sys/class/net/") + a->ifa_name + "/device";
            std::pair<int, unsigned> order(stat(device.c_str(), &st) == 0 ? 0 : 1, index);
            auto it = found.find(order);
            if (it == found.end()) {
                VLIBNetIfInfo info;
                std::memset(&info, 0, sizeof(info));
                std::strcpy(info.name, a->ifa_name);
                info.up = (a->ifa_flags & IFF_UP) != 0 ? 1 : 0;
                if (sock >= 0) {
                    struct ifreq req;
                    std::memset(&req, 0, sizeof(req));
                    std::strcpy(req.ifr_name, a->ifa_name);
                    if (ioctl(sock, SIOCGIFHWADDR, &req) == 0 &&
                        (req.ifr_hwaddr.sa_family == ARPHRD_ETHER ||
                         req.ifr_hwaddr.sa_family == ARPHRD_IEEE802)) {
                        std::memcpy(info.mac, req.ifr_hwaddr.sa_data, 6);
                    }
                }
                it = found.emplace(order, info).first;
            }
            if (a->ifa_addr != nullptr && a->ifa_addr->sa_family == AF_INET &&
                it->second.ipv4[0] == '\0') {
                const auto* in = reinterpret_cast<const struct sockaddr_in*>(a->ifa_addr);
                inet_ntop(AF_INET, &in->sin_addr, it->second.ipv4, sizeof(it->second.ipv4));
            }
        }
        for (const auto& entry : found) {
            const VLIBNetIfInfo& info = entry.second;
            static const unsigned char kZero[6] = {0, 0, 0, 0, 0, 0};
            if ((flags & VLIB_NETIF_WITH_MAC) != 0 && std::memcmp(info.mac, kZero, 6) == 0) {
                continue;
            }
            if (count == max) {
                break;
            }
            list[count++] = info;
        }
    } catch (const std::bad_alloc&) {
        count = -1;
    }
    if (sock >= 0) {
        close(sock);
    }
    freeifaddrs(addrs);
    return count < 0 ? Fail(VLIB_ERR_OUT_OF_MEMORY) : Succeed(count);
}

int VolumePathParseEx(const char* path, VURNVolumeRecord* volume) {
    if (path == nullptr || path[0] == '\0' || volume == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    std::memset(volume, 0, sizeof(*volume));
    try {
        char resolved[PATH_MAX];
        if (realpath(path, resolved) == nullptr) {
            int saved = errno;
            Logger::LogMsg(Logger::Error,
                           "[ERROR] host_facts.cpp(%d): Fail to resolve path '%s', error:'%s'\n",
                           __LINE__, path, std::strerror(saved));
            return Fail(s2s_platform::ErrorFromErrno(saved));
        }
        std::string real(resolved);
        std::vector<Mount> mounts;
        if (!ReadMounts(mounts)) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] host_facts.cpp(%d): Fail to read the mount table\n", __LINE__);
            return Fail(VLIB_ERR_IO);
        }
        SectionDoc conf;
        if (LoadHostConf(conf) != 0) {
            return -1;
        }
        std::string best;
        std::string device;
        for (const Mount& m : mounts) {
            if (Contains(m.path, real) && m.path.size() >= best.size()) {
                best = m.path;
                device = m.device;
            }
        }
        // Volumes named in the host file count as mount points too: a volume may be a directory
        // of a larger file system.
        std::string listed_type;
        for (const auto& pair : conf.SectionPairs("volumes")) {
            std::string vol = ListedVolume(pair.first);
            if (!vol.empty() && vol[0] == '/' && Contains(vol, real) && vol.size() >= best.size()) {
                best = vol;
                device.clear();
            }
        }
        if (best.empty()) {
            Logger::LogMsg(Logger::Error, "[ERROR] host_facts.cpp(%d): No volume holds '%s'\n",
                           __LINE__, real.c_str());
            return Fail(VLIB_ERR_NOT_FOUND);
        }
        for (const auto& pair : conf.SectionPairs("volumes")) {
            if (ListedVolume(pair.first) == best) {
                listed_type = s2s_platform::Trim(pair.second);
            }
        }
        int type = VURN_VOLUME_TYPE_INTERNAL;
        bool directory = false;
        if (listed_type.empty()) {
            type = !device.empty() && IsExternalDevice(device) ? VURN_VOLUME_TYPE_EXTERNAL
                                                               : VURN_VOLUME_TYPE_INTERNAL;
        } else if (!ParseVolumeValue(listed_type, type, directory)) {
            Logger::LogMsg(
                Logger::Error,
                "[ERROR] host_facts.cpp(%d): Invalid volume type '%s' for '%s' in '%s'\n", __LINE__,
                listed_type.c_str(), best.c_str(), S2SPath(S2S_PATH_HOST_CONF));
            return Fail(VLIB_ERR_BAD_FORMAT);
        }
        if (best.size() >= sizeof(volume->path)) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] host_facts.cpp(%d): Volume path '%s' is too long\n", __LINE__,
                           best.c_str());
            return Fail(VLIB_ERR_BUFFER_TOO_SMALL);
        }
        std::memcpy(volume->path, best.c_str(), best.size() + 1);
        volume->type = type;
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(0);
}

int VURNVolumeIsMounted(const char* volumePath) {
    if (volumePath == nullptr || volumePath[0] != '/') {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        std::string volume = StripSlashes(volumePath);
        char resolved[PATH_MAX];
        if (realpath(volume.c_str(), resolved) != nullptr) {
            volume = resolved;
        }
        std::vector<Mount> mounts;
        if (!ReadMounts(mounts)) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] host_facts.cpp(%d): Fail to read the mount table\n", __LINE__);
            return Fail(VLIB_ERR_IO);
        }
        for (const Mount& m : mounts) {
            if (m.path == volume) {
                return Succeed(1);
            }
        }
        SectionDoc conf;
        if (LoadHostConf(conf) != 0) {
            return -1;
        }
        // A listed volume is a mount path unless it says it is a directory; one that is not
        // listed was found in the mount table and is gone from it now.
        for (const auto& pair : conf.SectionPairs("volumes")) {
            if (StripSlashes(pair.first) != StripSlashes(volumePath) &&
                ListedVolume(pair.first) != volume) {
                continue;
            }
            int type = 0;
            bool directory = false;
            if (!ParseVolumeValue(s2s_platform::Trim(pair.second), type, directory)) {
                Logger::LogMsg(
                    Logger::Error,
                    "[ERROR] host_facts.cpp(%d): Invalid volume type '%s' for '%s' in '%s'\n",
                    __LINE__, pair.second.c_str(), pair.first.c_str(), S2SPath(S2S_PATH_HOST_CONF));
                return Fail(VLIB_ERR_BAD_FORMAT);
            }
            return Succeed(directory ? 1 : 0);
        }
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(0);
}

}  // extern "C"
