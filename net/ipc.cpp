// IPCListener and IPCSender: the listening socket (TCP on 127.0.0.1 with upward port probing, or a
// domain socket at a path) and the connection end that carries one PObject per message. Every
// failed system call is logged with its errno before -1 goes back.
#include "s2s_ipc.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstring>

#include "s2s_logger.h"
#include "s2s_stream.h"

namespace S2S {

namespace {

constexpr int kBacklog = 8;
constexpr int kMaxPort = 65535;
// The address length the service's domain-socket peers use: the whole sockaddr_un.
constexpr socklen_t kDomainAddrLen = 110;

void LogCallFailure(int line, const char* call) {
    int err = errno;
    Logger::LogMsg(Logger::Error, "[ERROR] s2s_ipc.cpp(%d): %s: %s (%d)\n", line, call,
                   std::strerror(err), err);
}

sockaddr_in LoopbackAddress(int port) {
    sockaddr_in addr;
    std::memset(&addr, 0, sizeof(addr));
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = inet_addr("127.0.0.1");
    addr.sin_port = htons(static_cast<uint16_t>(port));
    return addr;
}

// A TCP socket for a listener on 127.0.0.1, closed on exec: the service runs rsync children,
// which must not inherit its listeners. -1 (logged) on failure.
int NewTcpSocket() {
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, IPPROTO_TCP);
    if (fd < 0) {
        LogCallFailure(__LINE__, "socket");
    }
    return fd;
}

// Starts listening on the bound TCP socket `fd`; on failure the socket is closed (and the failure
// logged) and false returned.
bool ListenOrClose(int fd) {
    if (::listen(fd, kBacklog) == 0) {
        return true;
    }
    LogCallFailure(__LINE__, "listen");
    IPCListener::CloseSocket(fd);
    return false;
}

}  // namespace

// --- IPCListener ---------------------------------------------------------------------------

IPCListener::IPCListener() : timeout_{3, 0}, fd_(-1) {}

IPCListener::~IPCListener() {
    close();
}

void IPCListener::setTimeout(timeval timeout) {
    timeout_ = timeout;
}

int IPCListener::prepare(int port) {
    // A listener already held is replaced; a domain one takes its socket file along.
    close();
    int fd = NewTcpSocket();
    if (fd < 0) {
        return -1;
    }
    int bound = do_bind(fd, port);
    if (bound < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_ipc.cpp(%d): find available port failed\n",
                       __LINE__);
        CloseSocket(fd);
        return -1;
    }
    if (!ListenOrClose(fd)) {
        return -1;
    }
    // The port the system really bound (it differs from the probed one only for port 0).
    sockaddr_in addr;
    socklen_t len = sizeof(addr);
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) == 0) {
        bound = ntohs(addr.sin_port);
    }
    fd_ = fd;
    Logger::LogMsg(Logger::Info, "[INFO] s2s_ipc.cpp(%d): listening on port %d\n", __LINE__, bound);
    return bound;
}

int IPCListener::prepare(const std::string& path) {
    if (fd_ >= 0) {
        return -1;  // unlike prepare(int), an open listener is never replaced here
    }
    int fd = OpenDomainSocket(path);
    if (fd < 0) {
        return -1;
    }
    fd_ = fd;
    domain_path_ = path;
    return 0;
}

bool IPCListener::isReady() {
    if (fd_ < 0 || fd_ >= FD_SETSIZE) {
        return false;
    }
    fd_set read_set;
    FD_ZERO(&read_set);
    FD_SET(fd_, &read_set);
    timeval wait = timeout_;
    return ::select(fd_ + 1, &read_set, nullptr, nullptr, &wait) > 0;
}

int IPCListener::accept() {
    if (fd_ == -1) {
        return -1;
    }
    return ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
}

void IPCListener::close() {
    if (fd_ == -1) {
        return;
    }
    if (!domain_path_.empty()) {
        CloseDomainSocket(fd_);
    } else {
        CloseSocket(fd_);
    }
    fd_ = -1;
    domain_path_.clear();
}

int IPCListener::do_bind(int fd, int port) {
    if (port < 0) {
        errno = EINVAL;
        LogCallFailure(__LINE__, "bind");
        return -1;
    }
    for (int p = port;; ++p) {
        Logger::LogMsg(Logger::Info, "[INFO] s2s_ipc.cpp(%d): Try to bind port: %d\n", __LINE__, p);
        if (p > kMaxPort) {
            Logger::LogMsg(Logger::Error, "[ERROR] s2s_ipc.cpp(%d): Port number exceeds 65536\n",
                           __LINE__);
            return -1;
        }
        sockaddr_in addr = LoopbackAddress(p);
        if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0) {
            // Names the port that was asked for, as it always did; "listening on port" follows
            // with the real one.
            Logger::LogMsg(Logger::Info, "[INFO] s2s_ipc.cpp(%d): Bind port %d success\n", __LINE__,
                           port);
            return p;
        }
        LogCallFailure(__LINE__, "bind");
        Logger::LogMsg(Logger::Info, "[INFO] s2s_ipc.cpp(%d): Bind port %d failed, try next one\n",
                       __LINE__, p);
    }
}

int IPCListener::OpenSocket(int port) {
    if (port < 1 || port > kMaxPort) {
        return -1;
    }
    int fd = NewTcpSocket();
    if (fd < 0) {
        return -1;
    }
    sockaddr_in addr = LoopbackAddress(port);
    if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        LogCallFailure(__LINE__, "bind");
        CloseSocket(fd);
        return -1;
    }
    if (!ListenOrClose(fd)) {
        return -1;
    }
    Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_ipc.cpp(%d): listening on port %d\n", __LINE__,
                   port);
    return fd;
}

int IPCListener::OpenDomainSocket(const std::string& path) {
    if (path.empty()) {
        return -1;
    }
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        LogCallFailure(__LINE__, "socket");
        return -1;
    }
    sockaddr_un addr;
    std::memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    // A path that does not fit the address would be cut short and bind a different name.
    if (path.size() >= sizeof(addr.sun_path) || path.find('\0') != std::string::npos) {
        errno = ENAMETOOLONG;
        LogCallFailure(__LINE__, "bind");
        ::close(fd);
        return -1;
    }
    std::memcpy(addr.sun_path, path.c_str(), path.size());
    // Only a stale socket file is removed: a path that names anything else is left alone and the
    // bind below reports it.
    struct stat st;
    if (::lstat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
        ::unlink(path.c_str());
    }
    int on = 1;
    (void)::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof(on));
    if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), kDomainAddrLen) != 0) {
        LogCallFailure(__LINE__, "bind");
        // Not bound, so there is no file of ours to remove.
        ::close(fd);
        return -1;
    }
    if (::listen(fd, kBacklog) != 0) {
        LogCallFailure(__LINE__, "listen");
        CloseDomainSocket(fd);
        return -1;
    }
    Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_ipc.cpp(%d): listening on domain socket '%s'\n",
                   __LINE__, path.c_str());
    return fd;
}

int IPCListener::CloseSocket(int fd) {
    if (fd == -1) {
        return -1;
    }
    ::shutdown(fd, SHUT_RDWR);
    ::close(fd);
    return 0;
}

int IPCListener::CloseDomainSocket(int fd) {
    if (fd < 0) {
        return -1;
    }
    sockaddr_un addr;
    std::memset(&addr, 0, sizeof(addr));
    socklen_t len = sizeof(addr);
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
        LogCallFailure(__LINE__, "getsockname");
        ::close(fd);
        return 0;
    }
    ::close(fd);
    // An unnamed socket reports no path (or an abstract one, starting with NUL): nothing to remove.
    size_t path_len =
        len > offsetof(sockaddr_un, sun_path) ? len - offsetof(sockaddr_un, sun_path) : 0;
    if (addr.sun_family == AF_UNIX && path_len > 0 && addr.sun_path[0] != '\0') {
        std::string path(addr.sun_path, strnlen(addr.sun_path, path_len));
        ::unlink(path.c_str());
    }
    return 0;
}

// --- IPCSender -----------------------------------------------------------------------------

IPCSender::IPCSender() : channel_(kCapacity) {
    stream_.emplace();
}

IPCSender::~IPCSender() {
    close();
}

int IPCSender::connect(int port) {
    return channel_.Open("127.0.0.1", port) < 0 ? -1 : 0;
}

int IPCSender::connect(const std::string& path) {
    return channel_.Open(path.c_str()) < 0 ? -1 : 0;
}

int IPCSender::assign(int fd) {
    return channel_.Open(fd, true) < 0 ? -1 : 0;
}

int IPCSender::send(const PObject& obj) {
    return stream_->Send(channel_, obj) < 0 ? -1 : 0;
}

int IPCSender::send(const PObject& obj, bool wait_reply, PObject& reply) {
    if (send(obj) < 0) {
        return -1;
    }
    return wait_reply ? recv(reply) : 0;
}

int IPCSender::recv(PObject& obj) {
    stream_->SetRecvLimits(max_recv_bytes_, max_recv_depth_);
    return stream_->Recv(channel_, obj) < 0 ? -1 : 0;
}

void IPCSender::close() {
    channel_.Close();
    stream_.emplace();
}

}  // namespace S2S
