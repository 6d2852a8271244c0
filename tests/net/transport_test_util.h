// Helpers of the transport tests: connected socket pairs, a peer thread
// that is always joined, and a process-wide SIGPIPE disposition (the library leaves it alone; a
// program using it ignores the signal, as these tests do).
#ifndef S2S_TESTS_NET_TRANSPORT_TEST_UTIL_H
#define S2S_TESTS_NET_TRANSPORT_TEST_UTIL_H

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <utility>

#include "s2s_logger.h"
#include "support/test_util.h"

namespace s2s_test {

// Also keeps the log of tests that do not capture it on standard error rather than in syslog.
// Runs from main(), after every static object of the library exists.
class TransportEnvironment : public ::testing::Environment {
  public:
    void SetUp() override {
        signal(SIGPIPE, SIG_IGN);
        S2S::Logger::Initialize(S2S::Logger::Stderr, S2S::Logger::Error, "", 0);
    }
};
inline ::testing::Environment* const kTransportEnvironment =
    ::testing::AddGlobalTestEnvironment(new TransportEnvironment);  // gtest owns it

// Two connected stream sockets; whichever end was not released is closed on destruction.
class SocketPair {
  public:
    explicit SocketPair(int domain = AF_UNIX) {
        int fds[2] = {-1, -1};
        if (socketpair(domain, SOCK_STREAM, 0, fds) != 0) {
            ADD_FAILURE() << "socketpair failed";
        }
        a_ = fds[0];
        b_ = fds[1];
    }
    ~SocketPair() {
        CloseA();
        CloseB();
    }
    SocketPair(const SocketPair&) = delete;
    SocketPair& operator=(const SocketPair&) = delete;

    int a() const { return a_; }
    int b() const { return b_; }
    // Hands an end over to its new owner (a Channel that closes it).
    int ReleaseA() { return std::exchange(a_, -1); }
    int ReleaseB() { return std::exchange(b_, -1); }
    void CloseA() {
        if (a_ >= 0) {
            close(std::exchange(a_, -1));
        }
    }
    void CloseB() {
        if (b_ >= 0) {
            close(std::exchange(b_, -1));
        }
    }

  private:
    int a_;
    int b_;
};

// A thread that is joined when the object goes, whatever the test did in between.
class Peer {
  public:
    template <typename F>
    explicit Peer(F&& body) : thread_(std::forward<F>(body)) {}
    ~Peer() { Join(); }
    Peer(const Peer&) = delete;
    Peer& operator=(const Peer&) = delete;
    void Join() {
        if (thread_.joinable()) {
            thread_.join();
        }
    }

  private:
    std::thread thread_;
};

// Writes all of `data` to a blocking descriptor; false on failure.
inline bool WriteAll(int fd, const std::string& data) {
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = write(fd, data.data() + done, data.size() - done);
        if (n <= 0) {
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

// Reads exactly `len` bytes from a blocking descriptor (fewer if the peer closes first).
inline std::string ReadExactly(int fd, size_t len) {
    std::string out(len, '\0');
    size_t done = 0;
    while (done < len) {
        ssize_t n = read(fd, &out[done], len - done);
        if (n <= 0) {
            break;
        }
        done += static_cast<size_t>(n);
    }
    out.resize(done);
    return out;
}

// Reads until the peer closes.
inline std::string ReadToEnd(int fd) {
    std::string out;
    char buf[65536];
    for (;;) {
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n <= 0) {
            return out;
        }
        out.append(buf, static_cast<size_t>(n));
    }
}

}  // namespace s2s_test

#endif  // S2S_TESTS_NET_TRANSPORT_TEST_UTIL_H
