// The usable addresses of a server: the address the caller was given, then what the resolver
// knows for the server's name.
#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <cstring>
#include <string>

#include "platform/platform_internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

using S2S::Logger;
using s2s_platform::Fail;
using s2s_platform::Succeed;

static_assert(sizeof(VURNBkpIPEntry) == 52, "address entries are 52-byte records");

namespace {

// Adds `addr` unless it is listed already. False when the list is full.
bool Add(VURNBkpIPEntry* entries, int max, int& count, const char* addr, int family) {
    for (int i = 0; i < count; ++i) {
        if (std::strcmp(entries[i].addr, addr) == 0) {
            return true;
        }
    }
    if (count >= max) {
        return false;
    }
    std::memset(&entries[count], 0, sizeof(entries[count]));
    std::strncpy(entries[count].addr, addr, sizeof(entries[count].addr) - 1);
    entries[count].family = family;
    ++count;
    return true;
}

}  // namespace

extern "C" int VURNBkpGetUsableIPList(const char* serverName, const char* serverIP,
                                      VURNBkpIPEntry* entries, int max) {
    if (entries == nullptr || max <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    int count = 0;
    if (serverIP != nullptr && serverIP[0] != '\0') {
        unsigned char raw[sizeof(struct in6_addr)];
        char text[INET6_ADDRSTRLEN];
        int family = inet_pton(AF_INET, serverIP, raw) == 1    ? AF_INET
                     : inet_pton(AF_INET6, serverIP, raw) == 1 ? AF_INET6
                                                               : 0;
        if (family != 0 && inet_ntop(family, raw, text, sizeof(text)) != nullptr) {
            Add(entries, max, count, text, family);
        } else {
            Logger::LogMsg(Logger::Error, "[ERROR] address.cpp(%d): '%s' is not an IP address\n",
                           __LINE__, serverIP);
        }
    }
    if (serverName != nullptr && serverName[0] != '\0' && count < max) {
        struct addrinfo hints;
        std::memset(&hints, 0, sizeof(hints));
        hints.ai_family = AF_INET;
        hints.ai_socktype = SOCK_STREAM;
        struct addrinfo* found = nullptr;
        int rc = getaddrinfo(serverName, nullptr, &hints, &found);
        if (rc != 0) {
            Logger::LogMsg(Logger::Error, "[ERROR] address.cpp(%d): Fail to resolve '%s': %s\n",
                           __LINE__, serverName, gai_strerror(rc));
        } else {
            for (struct addrinfo* a = found; a != nullptr; a = a->ai_next) {
                char text[INET_ADDRSTRLEN];
                const auto* in = reinterpret_cast<const struct sockaddr_in*>(a->ai_addr);
                if (a->ai_family == AF_INET &&
                    inet_ntop(AF_INET, &in->sin_addr, text, sizeof(text)) != nullptr &&
                    !Add(entries, max, count, text, AF_INET)) {
                    break;
                }
            }
            freeaddrinfo(found);
        }
    }
    if (count == 0) {
        s2s_platform::SetError(VLIB_ERR_RESOLVE);
        return 0;
    }
    return Succeed(count);
}
