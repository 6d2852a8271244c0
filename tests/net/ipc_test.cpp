// IPC senders and listeners: request and reply over TCP loopback and over a domain socket to
// another process, one-way messages, listener files (never replaced, only sockets removed), port
// probing, readiness waits, failures of fixed-port sockets and senders, and the virtual receive.
#include "s2s_ipc.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "net/transport_test_util.h"

namespace {

using S2S::IPCListener;
using S2S::IPCSender;
using S2S::PObject;
using s2s_test::LogCapture;
using s2s_test::Peer;
using s2s_test::TempDir;

// A bound TCP socket on 127.0.0.1:port (not listening); -1 when the port is taken.
int Occupy(int port) {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = htons(static_cast<uint16_t>(port));
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

bool Exists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

// Serves one request on `listener`: the reply is the request with "seen" = 1 added.
void ServeOne(IPCListener& listener) {
    bool ready = false;
    for (int i = 0; i < 10 && !ready; ++i) {
        ready = listener.isReady();
    }
    ASSERT_TRUE(ready);
    int fd = listener.accept();
    ASSERT_GE(fd, 0);
    IPCSender server;
    ASSERT_EQ(0, server.assign(fd));
    PObject request;
    ASSERT_EQ(0, server.recv(request));
    request["seen"] = 1ULL;
    ASSERT_EQ(0, server.send(request));
}

PObject Request() {
    PObject request;
    request["action"] = "status";
    request["task_id"] = 7ULL;
    request["shares"].asArray().push_back(PObject("music"));
    return request;
}

TEST(IPCTest, RequestAndReplyOverTcpLoopback) {
    IPCListener listener;
    int port = listener.prepare(0);
    ASSERT_GT(port, 0);
    EXPECT_GE(listener.getFD(), 0);
    Peer server([&] { ServeOne(listener); });
    IPCSender client;
    ASSERT_EQ(0, client.connect(port));
    PObject reply;
    ASSERT_EQ(0, client.send(Request(), true, reply));
    EXPECT_EQ("{\"action\": \"status\", \"seen\": 1, \"shares\": [\"music\"], \"task_id\": 7}",
              reply.toString());
    server.Join();
    // The server has closed: the next exchange fails with -1, the cause in the log.
    LogCapture log(S2S::Logger::Warning);
    EXPECT_EQ(-1, client.send(Request(), true, reply));
    client.close();
}

TEST(IPCTest, RequestAndReplyOverDomainSocketWithServerInAnotherProcess) {
    TempDir dir("s2s-ipc");
    std::string path = dir / "daemon.sock";
    IPCListener listener;
    ASSERT_EQ(0, listener.prepare(path));
    // The serving process: answers one request.
    s2s_test::Child child([&] {
        int fd = listener.isReady() ? listener.accept() : -1;
        IPCSender server;
        PObject request;
        int ok = fd >= 0 && server.assign(fd) == 0 && server.recv(request) == 0;
        request["pid"] = static_cast<unsigned long long>(getpid());
        ok = ok && server.send(request) == 0;
        server.close();
        return ok ? 0 : 1;
    });
    IPCSender client;
    ASSERT_EQ(0, client.connect(path));
    PObject reply;
    ASSERT_EQ(0, client.send(Request(), true, reply));
    EXPECT_EQ(static_cast<unsigned long long>(child.pid()), reply["pid"].asUInt64());
    EXPECT_EQ("status", reply["action"].asString());
    EXPECT_EQ(0, child.Wait());

    // Closing removes the socket file (the child's copy of the listener did not).
    EXPECT_TRUE(Exists(path));
    listener.close();
    EXPECT_FALSE(Exists(path));
    EXPECT_EQ(-1, listener.getFD());
}

TEST(IPCTest, OneWayMessageLeavesReplyUntouched) {
    TempDir dir("s2s-ipc");
    std::string path = dir / "s";
    IPCListener listener;
    ASSERT_EQ(0, listener.prepare(path));
    PObject received;
    Peer server([&] {
        int fd = listener.accept();
        IPCSender end;
        ASSERT_EQ(0, end.assign(fd));
        ASSERT_EQ(0, end.recv(received));
    });
    IPCSender client;
    ASSERT_EQ(0, client.connect(path));
    PObject reply("untouched");
    ASSERT_EQ(0, client.send(Request(), false, reply));
    server.Join();
    EXPECT_EQ("untouched", reply.asString());
    EXPECT_EQ(7u, received["task_id"].asUInt64());
}

TEST(IPCTest, DomainListenerIsNotReplacedAndRemovesOnlySockets) {
    TempDir dir("s2s-ipc");
    std::string path = dir / "s";
    IPCListener listener;
    ASSERT_EQ(0, listener.prepare(path));
    int first = listener.getFD();
    EXPECT_EQ(-1, listener.prepare(dir / "other"));
    EXPECT_EQ(first, listener.getFD());
    EXPECT_FALSE(Exists(dir / "other"));
    IPCSender client;
    EXPECT_EQ(0, client.connect(path));  // the first socket still serves
    EXPECT_TRUE(listener.isReady());

    // A stale socket file left by a crashed listener is replaced.
    std::string stale = dir / "stale";
    int fd = IPCListener::OpenDomainSocket(stale);
    ASSERT_GE(fd, 0);
    close(fd);  // closed without removing the file
    ASSERT_TRUE(Exists(stale));
    IPCListener second;
    EXPECT_EQ(0, second.prepare(stale));

    // Anything else at the path is left alone and the listener fails.
    LogCapture log(S2S::Logger::Error);
    std::string file = dir / "file";
    s2s_test::WriteFile(file, "data");
    IPCListener third;
    EXPECT_EQ(-1, third.prepare(file));
    EXPECT_EQ("data", s2s_test::ReadFile(file));
    EXPECT_TRUE(log.Contains("[ERROR] s2s_ipc.cpp("));
    EXPECT_TRUE(log.Contains("): bind: Address already in use (98)\n"));
    EXPECT_EQ(-1, third.prepare(std::string(200, 'x')));  // longer than an address holds
    EXPECT_EQ(-1, third.prepare(std::string()));
    EXPECT_EQ(-1, third.getFD());

    // A TCP listener replacing a domain one takes the socket file along.
    IPCListener switching;
    ASSERT_EQ(0, switching.prepare(dir / "switch"));
    EXPECT_GT(switching.prepare(0), 0);
    EXPECT_FALSE(Exists(dir / "switch"));
    switching.close();
}

TEST(IPCTest, TcpListenerProbesUpwardAndCloseTouchesNoFile) {
    LogCapture log(S2S::Logger::Info);
    // Find a port p that is free to take while p+1 is free too.
    int port = 0;
    int held = -1;
    for (int tries = 0; tries < 50 && held < 0; ++tries) {
        port = s2s_test::FreeTcpPort();
        if (port >= 65535) {
            continue;
        }
        int next = Occupy(port + 1);
        if (next < 0) {
            continue;
        }
        close(next);
        held = Occupy(port);
    }
    ASSERT_GE(held, 0);
    IPCListener listener;
    int got = listener.prepare(port);
    close(held);
    EXPECT_EQ(port + 1, got);
    std::string p = std::to_string(port);
    EXPECT_TRUE(log.Contains("[INFO] s2s_ipc.cpp("));
    EXPECT_TRUE(log.Contains("): Try to bind port: " + p + "\n"));
    EXPECT_TRUE(log.Contains("): bind: Address already in use (98)\n"));
    EXPECT_TRUE(log.Contains("): Bind port " + p + " failed, try next one\n"));
    // The success line names the port asked for; the listening line the real one.
    EXPECT_TRUE(log.Contains("): Bind port " + p + " success\n"));
    EXPECT_TRUE(log.Contains("): listening on port " + std::to_string(port + 1) + "\n"));

    // prepare(int) replaces a listener already held.
    int again = listener.prepare(0);
    EXPECT_GT(again, 0);
    IPCSender client;
    EXPECT_EQ(0, client.connect(again));
    listener.close();
    EXPECT_EQ(-1, listener.getFD());
    EXPECT_EQ(-1, listener.accept());
}

TEST(IPCTest, ProbingPastTheLastPortFails) {
    LogCapture log(S2S::Logger::Info);
    int held = Occupy(65535);  // if someone else holds it, it is taken all the same
    IPCListener listener;
    EXPECT_EQ(-1, listener.prepare(65535));
    EXPECT_TRUE(log.Contains("): Try to bind port: 65536\n"));
    EXPECT_TRUE(log.Contains("[ERROR] s2s_ipc.cpp("));
    EXPECT_TRUE(log.Contains("): Port number exceeds 65536\n"));
    EXPECT_TRUE(log.Contains("): find available port failed\n"));
    EXPECT_EQ(-1, listener.getFD());
    if (held >= 0) {
        close(held);
    }
}

TEST(IPCTest, IsReadyWaitsAtMostTheTimeout) {
    IPCListener idle;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(idle.isReady());  // no socket: false at once
    EXPECT_EQ(-1, idle.accept());

    IPCListener listener;
    ASSERT_GT(listener.prepare(0), 0);
    listener.setTimeout(timeval{0, 200000});
    EXPECT_FALSE(listener.isReady());
    double took = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    EXPECT_GE(took, 0.15);
    EXPECT_LT(took, 2.0);
}

TEST(IPCTest, FixedPortSocketsAndSenderFailures) {
    EXPECT_EQ(-1, IPCListener::OpenSocket(0));
    EXPECT_EQ(-1, IPCListener::CloseSocket(-1));
    EXPECT_EQ(-1, IPCListener::CloseDomainSocket(-1));
    LogCapture log(S2S::Logger::Debug);
    int port = s2s_test::FreeTcpPort();
    int fd = IPCListener::OpenSocket(port);
    ASSERT_GE(fd, 0);
    EXPECT_TRUE(log.Contains("[DEBUG] s2s_ipc.cpp("));
    EXPECT_TRUE(log.Contains("): listening on port " + std::to_string(port) + "\n"));
    EXPECT_EQ(-1, IPCListener::OpenSocket(port));  // taken now
    IPCSender client;
    EXPECT_EQ(0, client.connect(port));
    client.close();
    EXPECT_EQ(0, IPCListener::CloseSocket(fd));

    TempDir dir("s2s-ipc");
    IPCSender nowhere;
    EXPECT_EQ(-1, nowhere.connect(dir / "missing"));
    EXPECT_EQ(-1, nowhere.assign(-1));
    PObject obj;
    EXPECT_EQ(-1, nowhere.recv(obj));
    EXPECT_EQ(-1, nowhere.send(obj));
}

// A subclass changes the exchange; the request/reply form uses its recv.
class TaggingSender : public IPCSender {
  public:
    int recv(PObject& obj) override {
        int ret = IPCSender::recv(obj);
        obj["via_subclass"] = 1ULL;
        return ret;
    }
};

TEST(IPCTest, RequestReplyCallsRecvThroughTheVirtualTable) {
    IPCListener listener;
    int port = listener.prepare(0);
    ASSERT_GT(port, 0);
    Peer server([&] { ServeOne(listener); });
    TaggingSender client;
    ASSERT_EQ(0, client.connect(port));
    PObject reply;
    ASSERT_EQ(0, client.send(Request(), true, reply));
    EXPECT_EQ(1u, reply["via_subclass"].asUInt64());
    EXPECT_EQ(1u, reply["seen"].asUInt64());
}

}  // namespace
