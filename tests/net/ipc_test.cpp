// IPC senders and listeners: the request/reply contract (reply, one-way message, a peer gone, the
// receive limits, a subclass's receive), one trip to a server in another process over a domain
// socket, the listener's socket files and port probing, and the refusals of both ends.
#include "s2s_ipc.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <future>
#include <string>

#include "net/net_util.h"

namespace {

using S2S::IPCListener;
using S2S::IPCSender;
using S2S::PObject;
using s2s_test::LogCapture;
using s2s_test::TempDir;

bool Exists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

// A bound TCP socket on 127.0.0.1:port (not listening); -1 when the port is taken.
int Occupy(int port) {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{AF_INET, htons(static_cast<uint16_t>(port)), {htonl(INADDR_LOOPBACK)}, {}};
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        s2s_test::CloseFd(fd);
    }
    return fd;
}

PObject Request() {
    PObject request;
    request["action"] = "status";
    request["task_id"] = 7ULL;
    request["shares"].asArray().push_back(PObject("music"));
    return request;
}

// A subclass changes the exchange: the request/reply form must use its receive.
class TaggingSender : public IPCSender {
  public:
    int recv(PObject& obj) override {
        int ret = IPCSender::recv(obj);
        obj["via_subclass"] = 1ULL;
        return ret;
    }
};

TEST(IPCTest, RequestReplyOneWayReceiveLimitsAndAPeerGone) {
    LogCapture log(S2S::Logger::Error);
    IPCListener listener;
    const int port = listener.prepare(0);
    ASSERT_GT(port, 0);
    // Answers each request with itself plus "seen", except one holding "quiet"; takes nothing
    // nested deeper than two levels, and ends at the first refusal.
    auto server = std::async(std::launch::async, [&] {
        IPCSender end;
        end.SetRecvLimits(0, 2);
        PObject request;
        if (!listener.isReady() || end.assign(listener.accept()) != 0) {
            return -1;
        }
        for (int n = 0; end.recv(request = PObject()) == 0; ++n) {
            request["seen"] = static_cast<unsigned long long>(n);
            if (!request.hasMember("quiet") && end.send(request) != 0) {
                return -1;
            }
        }
        return 0;
    });
    TaggingSender client;
    ASSERT_EQ(0, client.connect(port));
    PObject reply;
    ASSERT_EQ(0, client.send(Request(), true, reply));
    EXPECT_EQ(
        "{\"action\": \"status\", \"seen\": 0, \"shares\": [\"music\"], \"task_id\": 7, "
        "\"via_subclass\": 1}",
        reply.toString());
    PObject quiet = Request(), untouched("untouched");
    quiet["quiet"] = 1ULL;
    ASSERT_EQ(0, client.send(quiet, false, untouched));
    EXPECT_EQ("untouched", untouched.asString());
    PObject deep = Request();
    deep["shares"].asArray()[0] = PObject::Array({PObject(1ULL)});
    EXPECT_EQ(-1, client.send(deep, true, reply));  // refused, and the server has gone
    EXPECT_EQ(0, server.get());
    EXPECT_TRUE(log.Contains("): PStream: message nested deeper than 2 levels refused\n"));
}

// A sender keeps one stream for all its messages: the byte limit counts each message alone.
TEST(IPCTest, EveryMessageOfOneSenderStartsClean) {
    s2s_test::SocketPair pair;
    IPCSender a, b;
    ASSERT_EQ(0, a.assign(pair.ReleaseA()));
    ASSERT_EQ(0, b.assign(pair.ReleaseB()));
    b.SetRecvLimits(64, 2);  // one request is 52 bytes
    for (int i = 0; i < 10; ++i) {
        PObject got;
        ASSERT_EQ(0, a.send(Request()));
        ASSERT_EQ(0, b.recv(got));
        EXPECT_EQ(Request().toString(), got.toString());
    }
}

TEST(IPCTest, RequestAndReplyWithServerInAnotherProcessOverADomainSocket) {
    TempDir dir("s2s-ipc");
    const std::string path = dir / "daemon.sock";
    IPCListener listener;
    ASSERT_EQ(0, listener.prepare(path));
    s2s_test::Child child([&] {
        IPCSender server;
        PObject request;
        int ok = listener.isReady() && server.assign(listener.accept()) == 0 &&
                 server.recv(request) == 0;
        request["pid"] = static_cast<unsigned long long>(getpid());
        return ok && server.send(request) == 0 ? 0 : 1;
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

TEST(IPCTest, DomainListenersAreNotReplacedAndRemoveOnlySockets) {
    LogCapture log(S2S::Logger::Error);
    TempDir dir("s2s-ipc");
    IPCListener listener;
    ASSERT_EQ(0, listener.prepare(dir / "s"));
    const int first = listener.getFD();
    EXPECT_EQ(-1, listener.prepare(dir / "other"));
    EXPECT_TRUE(first == listener.getFD() && !Exists(dir / "other"));
    IPCSender client;
    EXPECT_EQ(0, client.connect(dir / "s"));  // the first socket still serves
    EXPECT_TRUE(listener.isReady());

    // A stale socket file left by a crashed listener is replaced; anything else is left alone.
    int stale = IPCListener::OpenDomainSocket(dir / "stale");
    s2s_test::CloseFd(stale);
    IPCListener second, third;
    EXPECT_EQ(0, second.prepare(dir / "stale"));
    s2s_test::WriteFile(dir / "file", "data");
    EXPECT_EQ(-1, third.prepare(dir / "file"));
    EXPECT_EQ("data", s2s_test::ReadFile(dir / "file"));
    EXPECT_TRUE(log.Contains("[ERROR] s2s_ipc.cpp("));
    EXPECT_TRUE(log.Contains("): bind: Address already in use (98)\n"));
    EXPECT_EQ(-1, third.prepare(std::string(200, 'x')));  // longer than an address holds
    EXPECT_EQ(-1, third.prepare(std::string()));
    EXPECT_EQ(-1, third.getFD());

    // A TCP listener replacing a domain one takes the socket file along.
    EXPECT_GT(second.prepare(0), 0);
    EXPECT_FALSE(Exists(dir / "stale"));
}

TEST(IPCTest, TcpListenerProbesUpwardToTheLastPort) {
    LogCapture log(S2S::Logger::Info);
    // A port p taken while p+1 is free.
    int port = 0, held = -1;
    for (int tries = 0; tries < 50 && held < 0; ++tries) {
        port = s2s_test::FreeTcpPort();
        int next = port < 65535 ? Occupy(port + 1) : -1;
        held = next >= 0 ? Occupy(port) : -1;
        s2s_test::CloseFd(next);
    }
    ASSERT_GE(held, 0);
    IPCListener listener;
    EXPECT_EQ(port + 1, listener.prepare(port));
    s2s_test::CloseFd(held);
    const std::string p = std::to_string(port);
    EXPECT_TRUE(log.Contains("[INFO] s2s_ipc.cpp("));
    EXPECT_TRUE(log.Contains("): Try to bind port: " + p + "\n"));
    EXPECT_TRUE(log.Contains("): Bind port " + p + " failed, try next one\n"));
    // The success line names the port asked for; the listening line the real one.
    EXPECT_TRUE(log.Contains("): Bind port " + p + " success\n"));
    EXPECT_TRUE(log.Contains("): listening on port " + std::to_string(port + 1) + "\n"));

    held = Occupy(65535);  // if someone else holds it, it is taken all the same
    EXPECT_EQ(-1, listener.prepare(65535));
    s2s_test::CloseFd(held);
    EXPECT_TRUE(log.Contains("): Try to bind port: 65536\n"));
    EXPECT_TRUE(log.Contains("): Port number exceeds 65536\n"));
    EXPECT_TRUE(log.Contains("): find available port failed\n"));
    EXPECT_EQ(-1, listener.getFD());
    EXPECT_EQ(-1, listener.accept());
}

TEST(IPCTest, FixedPortSocketsWaitsAndRefusals) {
    LogCapture log(S2S::Logger::Debug);
    EXPECT_EQ(-1, IPCListener::OpenSocket(0));
    EXPECT_EQ(-1, IPCListener::CloseSocket(-1) | IPCListener::CloseDomainSocket(-1));
    const int port = s2s_test::FreeTcpPort();
    const int fd = IPCListener::OpenSocket(port);
    ASSERT_GE(fd, 0);
    EXPECT_TRUE(log.Contains("): listening on port " + std::to_string(port) + "\n"));
    EXPECT_EQ(-1, IPCListener::OpenSocket(port));  // taken now
    IPCSender client;
    EXPECT_EQ(0, client.connect(port));
    client.close();
    EXPECT_EQ(0, IPCListener::CloseSocket(fd));

    // Readiness waits at most the timeout; with no socket it is false at once.
    IPCListener listener;
    const auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(listener.isReady());
    ASSERT_GT(listener.prepare(0), 0);
    listener.setTimeout(timeval{0, 200000});
    EXPECT_FALSE(listener.isReady());
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - start;
    EXPECT_TRUE(took.count() >= 0.15 && took.count() < 2.0) << took.count();

    IPCSender nowhere;
    PObject obj;
    EXPECT_EQ(-1, nowhere.connect(s2s_test::TempDir().path() + "/missing"));
    EXPECT_EQ(-1, nowhere.assign(-1));
    EXPECT_EQ(-1, nowhere.recv(obj));
    EXPECT_EQ(-1, nowhere.send(obj));
}

}  // namespace
