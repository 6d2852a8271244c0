// Socket helpers of the transport tests: a connected socket pair, a loopback TCP listener, whole
// writes and reads on blocking descriptors. The programs ignore SIGPIPE (the library leaves the
// signal to the program) and keep the log of tests that do not capture it on standard error.
#ifndef S2S_TESTS_NET_NET_UTIL_H
#define S2S_TESTS_NET_NET_UTIL_H

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <utility>

#include "support/test_util.h"

namespace s2s_test {

struct NetEnvironment : ::testing::Environment {
    void SetUp() override {
        signal(SIGPIPE, SIG_IGN);
        S2S::Logger::Initialize(S2S::Logger::Stderr, S2S::Logger::Error, "", 0);
    }
};
inline ::testing::Environment* const kNetEnvironment =
    ::testing::AddGlobalTestEnvironment(new NetEnvironment);  // gtest owns it

inline void CloseFd(int& fd) {
    if (fd >= 0) {
        close(std::exchange(fd, -1));
    }
}

// Two connected stream sockets; an end not released is closed on destruction.
struct SocketPair : NoCopy {
    explicit SocketPair(int domain = AF_UNIX) {
        int fds[2] = {-1, -1};
        EXPECT_EQ(0, socketpair(domain, SOCK_STREAM, 0, fds));
        a = fds[0];
        b = fds[1];
    }
    ~SocketPair() {
        CloseFd(a);
        CloseFd(b);
    }
    int ReleaseA() { return std::exchange(a, -1); }  // to a Channel that closes it
    int ReleaseB() { return std::exchange(b, -1); }
    int a, b;
};

// A listening TCP socket on 127.0.0.1 with a kernel-chosen port.
class Listener : NoCopy {
  public:
    explicit Listener(int backlog = 8) {
        sockaddr_in addr{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
        socklen_t len = sizeof(addr);
        if (bind(fd_, reinterpret_cast<sockaddr*>(&addr), len) != 0 || listen(fd_, backlog) != 0 ||
            getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
            throw std::runtime_error("listener");
        }
        port_ = ntohs(addr.sin_port);
    }
    ~Listener() { close(fd_); }
    int port() const { return port_; }
    // A connected socket, or -1 when nobody came within 20 seconds.
    int Accept() {
        pollfd pfd = {fd_, POLLIN, 0};
        return poll(&pfd, 1, 20000) == 1 ? accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC) : -1;
    }
    // A plain connection to it (non-blocking ones may still be pending).
    int Connect(int flags = 0) const {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | flags, 0);
        sockaddr_in addr{
            AF_INET, htons(static_cast<uint16_t>(port_)), {htonl(INADDR_LOOPBACK)}, {}};
        int ret = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
        return ret == 0 || flags != 0 ? fd : -1;
    }

  private:
    int fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int port_ = 0;
};

inline bool WriteAll(int fd, const std::string& data) {
    return write(fd, data.data(), data.size()) == static_cast<ssize_t>(data.size());
}

// `len` bytes (fewer when the peer closes first).
inline std::string ReadExactly(int fd, size_t len) {
    std::string out(len, '\0');
    ssize_t n = recv(fd, out.data(), len, MSG_WAITALL);
    out.resize(n > 0 ? static_cast<size_t>(n) : 0);
    return out;
}

inline std::string ReadToEnd(int fd) {
    std::string out;
    char buf[65536];
    for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;) {
        out.append(buf, static_cast<size_t>(n));
    }
    return out;
}

}  // namespace s2s_test

#endif  // S2S_TESTS_NET_NET_UTIL_H
