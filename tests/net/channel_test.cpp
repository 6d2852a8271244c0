// Channel, the buffered socket. One table of the read, write and wait contracts (byte order of
// integers, the rings, partial reads, refusals of a closed channel, inactivity and connect
// timeouts, the abort flag, subclasses replacing steps), each row with its status, log line and
// the bytes that moved; then opening by address, path and descriptor, and a large transfer
// through small rings.
#include "s2s_channel.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <chrono>
#include <functional>
#include <future>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "net/net_util.h"
#include "s2s_status.h"

namespace {

using namespace S2S;
using s2s_test::ReadExactly;
using s2s_test::SocketPair;
using s2s_test::WriteAll;

// Every internal step goes through the virtual table: this subclass sees the ones it replaces.
class CountingChannel : public Channel {
  public:
    using Channel::Channel;
    using Channel::GetFd;
    int FlushWrite(int want) override {
        flushes += std::to_string(want) + " ";
        return Channel::FlushWrite(want);
    }
    int ReadMore(int want) override {
        ++read_mores;
        return Channel::ReadMore(want);
    }
    int SetNonBlock(int fd) override { return fail_nonblock ? -1 : Channel::SetNonBlock(fd); }
    void SwitchChannelOp(int mode) override {
        switches += std::to_string(mode);
        Channel::SwitchChannelOp(mode);
    }
    std::string flushes, switches;
    int read_mores = 0;
    bool fail_nonblock = false;
};

// What arrived at the peer so far without waiting ("-" when nothing).
std::string Pending(int fd) {
    char buf[64];
    ssize_t n = recv(fd, buf, sizeof(buf), MSG_DONTWAIT);
    return n > 0 ? std::string(buf, static_cast<size_t>(n)) : "-";
}

// The statuses of steps taken in order (a braced list is evaluated left to right), or-ed.
int Steps(std::initializer_list<int> statuses) {
    int all = 0;
    for (int status : statuses) {
        all |= status;
    }
    return all;
}

// A connect to a listener whose accept queue is full stays pending: a silent peer.
int OpenToSilentPeer(Channel& channel) {
    s2s_test::Listener full(0);
    int fillers[4];
    for (int& fd : fillers) {
        fd = full.Connect(SOCK_NONBLOCK);
    }
    int ret = channel.Open("127.0.0.1", full.port());
    for (int& fd : fillers) {
        s2s_test::CloseFd(fd);
    }
    return ret;
}

struct Contract {
    const char* name;
    unsigned int capacity, timeout;
    // Runs on a channel adopted from `pair.a` with `flag` as its abort flag; returns the status of
    // the step under test and appends what moved to `got`.
    std::function<int(CountingChannel&, SocketPair&, int& flag, std::string& got)> run;
    int status;
    const char* log;  // a line the run leaves in the log
    std::string got;
    double seconds;  // how long the run takes (give or take one wait interval)
};

TEST(ChannelTest, ReadWriteAndWaitContracts) {
    const Contract contracts[] = {
        {"integers travel most significant byte first; a failed read leaves the output", 64, 60,
         [](CountingChannel& c, SocketPair& p, int&, std::string& got) {
             EXPECT_EQ(0, Steps({c.WriteByte(0xAB), c.WriteInt16(0x0102), c.WriteInt32(0x03040506u),
                                 c.WriteInt64(0x0708090A0B0C0D0EULL), c.FlushWrite(0)}));
             got = ReadExactly(p.b, 15);
             WriteAll(p.b, got + "\x01");
             s2s_test::CloseFd(p.b);
             unsigned char u8 = 0;
             unsigned short u16 = 0;
             unsigned int u32 = 0;
             unsigned long long u64 = 0;
             EXPECT_EQ(0, Steps({c.ReadByte(&u8), c.ReadInt16(&u16), c.ReadInt32(&u32),
                                 c.ReadInt64(&u64)}));
             EXPECT_TRUE(u8 == 0xAB && u16 == 0x0102 && u32 == 0x03040506u &&
                         u64 == 0x0708090A0B0C0D0EULL);
             EXPECT_EQ(0x0807060504030201ULL, c.Convert(0x0102030405060708ULL));
             EXPECT_EQ(0x04030201u, c.Convert(0x01020304u));
             EXPECT_EQ(0x0201, c.Convert(static_cast<unsigned short>(0x0102)));
             int ret = c.ReadInt32(&u32);
             EXPECT_EQ(0x03040506u, u32);
             return ret;
         },
         kStatusIOError, "", "\xAB\x01\x02\x03\x04\x05\x06\x07\x08\x09\x0A\x0B\x0C\x0D\x0E", 0},
        {"a partial read delivers the bytes and keeps them buffered", 64, 60,
         [](CountingChannel& c, SocketPair& p, int&, std::string& got) {
             WriteAll(p.b, "hello");
             s2s_test::CloseFd(p.b);
             char out[16];
             unsigned int count = 0;
             int ret = c.Read(out, 10, count);
             got.assign(out, count);
             got += c.Read(out, 5) == 0 ? std::string(out, 5) : "?";
             return ret;
         },
         kStatusIOError,
         "): Diagnose: select says the socket is readable but actually we can't read ... "
         "connection closed?\n",
         "hellohello", 0},
        {"writes buffer until room is needed; one byte over the capacity is refused", 16, 60,
         [](CountingChannel& c, SocketPair& p, int&, std::string& got) {
             c.Write("abc", 3);
             got = Pending(p.b) + "|";
             c.Write("0123456789abcdef", 16);  // needs three bytes of room: "abc" goes out
             got += ReadExactly(p.b, 3) + "|";
             int ret = c.Write(std::string(17, 'y').data(), 17);
             c.FlushWrite(0);  // the refused write left the ring as it was
             got += ReadExactly(p.b, 16) + "|";
             got += Pending(p.b) + "|" + c.flushes;
             return ret;
         },
         kStatusInvalidArgument, "): Write: Exceed maximum data block size\n",
         "-|abc|0123456789abcdef|-|3 0 ", 0},
        {"a read ending at the ring's end continues from index zero", 8, 60,
         [](CountingChannel& c, SocketPair& p, int&, std::string& got) {
             char out[12];
             WriteAll(p.b, "01234567");
             int ret = c.Read(out, 5);  // one refill takes all eight bytes
             WriteAll(p.b, "89AB");
             // The refill wraps; the next read ends at the ring's end, the last one starts at 0.
             ret |= Steps({c.ReadMore(4), c.Read(out + 5, 3), c.Read(out + 8, 4)});
             got = std::string(out, 12) + " " + std::to_string(c.read_mores);
             return ret;
         },
         0, "", "0123456789AB 2", 0},
        {"a closed channel refuses reads and writes; empty steps do nothing", 16, 60,
         [](CountingChannel& c, SocketPair&, int&, std::string& got) {
             c.Close();
             char buf[4];
             int handle = -1;
             for (int status :
                  {c.Read(buf, 4), c.Write("abcd", 4), c.ReadMore(0), c.FlushWrite(0)}) {
                 got += std::to_string(status);
             }
             return Channel::ReadFd(&handle, buf, 0, timeval{1, 0}, nullptr);
         },
         kStatusInvalidArgument, "): ReadFd: request 0\n", "-2-200", 0},
        {"ReadFd takes queued bytes at once unless the abort flag is set", 16, 60,
         [](CountingChannel& c, SocketPair& p, int& flag, std::string& got) {
             c.Write("abc", 3);
             c.FlushWrite(0);
             char buf[8];
             flag = 1;
             got = std::to_string(Channel::ReadFd(&p.b, buf, 8, timeval{1, 0}, &flag)) + "|";
             flag = 0;
             int n = Channel::ReadFd(&p.b, buf, 8, timeval{1, 0}, &flag);
             got += std::string(buf, n > 0 ? n : 0);
             c.Close();
             return Channel::ReadFd(&p.b, buf, 8, timeval{1, 0}, &flag);
         },
         kStatusIOError, "): ReadFd: read 3 bytes\n", "-1|abc", 0},
        {"a read gives up after the inactivity timeout", 16, 1,
         [](CountingChannel& c, SocketPair&, int&, std::string&) {
             char buf[4];
             return c.Read(buf, 4);
         },
         kStatusConnectionTimeout, "): ReadMore: Channel timeout for 1 seconed\n", "", 1},
        {"a flush gives up on a peer that stops reading", 4096, 1,
         [](CountingChannel& c, SocketPair&, int&, std::string&) {
             std::string block(4096, 'z');
             int ret = 0;
             for (int i = 0; i < 100000 && ret == 0; ++i) {
                 ret = c.Write(block.data(), 4096);
             }
             return ret;
         },
         kStatusConnectionTimeout, "): FlushWrite: Channel timeout for 1 seconds\n", "", 1},
        {"the abort flag ends an endless read from another thread", 16, 0,
         [](CountingChannel& c, SocketPair&, int& flag, std::string&) {
             auto aborter = std::async(std::launch::async, [&] {
                 std::this_thread::sleep_for(std::chrono::milliseconds(200));
                 __atomic_store_n(&flag, 1, __ATOMIC_SEQ_CST);
             });
             char buf[4];
             return c.Read(buf, 4);
         },
         kStatusInterrupted, "", "", 0.2},
        {"a set abort flag stops a flush before it sends; closing reports it", 16, 60,
         [](CountingChannel& c, SocketPair& p, int& flag, std::string& got) {
             c.Write("data", 4);
             flag = 1;
             int ret = c.FlushWrite(0);
             c.Close();
             got = Pending(p.b);
             return ret;
         },
         kStatusInterrupted, "): FlushWrite: Interrupted\n", "-", 0},
        {"a silent peer's connect counts three seconds per quiet wait, or ends on the flag", 16, 3,
         [](CountingChannel& c, SocketPair&, int& flag, std::string& got) {
             int ret = OpenToSilentPeer(c);
             flag = 1;
             got = std::to_string(OpenToSilentPeer(c)) + (c.IsClosed() ? " closed" : " open");
             return ret;
         },
         kStatusIOError, "): Channel timed out during connect (3 seconds), abort anyway\n",
         "-2 closed", 1},
    };
    for (const Contract& row : contracts) {
        SCOPED_TRACE(row.name);
        s2s_test::LogCapture log;
        SocketPair pair;
        int flag = 0;
        CountingChannel channel(row.capacity);
        ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
        channel.SetTimeout(row.timeout);
        channel.SetFlag(&flag);
        std::string got;
        const auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(row.status, row.run(channel, pair, flag, got));
        const std::chrono::duration<double> took = std::chrono::steady_clock::now() - start;
        EXPECT_EQ(row.got, got);
        EXPECT_TRUE(log.Contains(row.log)) << row.log;
        EXPECT_GE(took.count(), row.seconds * 0.9);
        EXPECT_LT(took.count(), row.seconds + 1.5);
        channel.SetFlag(nullptr);
    }
}

TEST(ChannelTest, OpeningReachesThePeerReplacesTheOldConnectionAndRefusesBadArguments) {
    s2s_test::LogCapture log;
    s2s_test::Listener listener;
    CountingChannel channel(64);
    ASSERT_EQ(0, channel.Open("127.0.0.1", listener.port()));
    int first = listener.Accept();
    std::string ip;
    int port = 0;
    ASSERT_EQ(0, channel.GetPeerInfo(ip, port));
    EXPECT_EQ("127.0.0.1:" + std::to_string(listener.port()), ip + ":" + std::to_string(port));
    // Non-blocking, lingering at most one second, not inherited by children.
    const int fd = channel.GetFd();
    linger lingering{};
    socklen_t size = sizeof(lingering);
    ASSERT_EQ(0, getsockopt(fd, SOL_SOCKET, SO_LINGER, &lingering, &size));
    EXPECT_TRUE(lingering.l_onoff == 1 && lingering.l_linger == 1);
    EXPECT_TRUE((fcntl(fd, F_GETFL) & O_NONBLOCK) && (fcntl(fd, F_GETFD) & FD_CLOEXEC));
    // Opening again flushes and closes the old connection rather than leaking it.
    ASSERT_EQ(0, channel.Write("old", 3));
    ASSERT_EQ(0, channel.Open("127.0.0.1", listener.port()));
    int second = listener.Accept();
    EXPECT_EQ("old", s2s_test::ReadToEnd(first));
    ASSERT_EQ(0, channel.Write("new", 3));
    channel.Close();
    EXPECT_EQ("new", s2s_test::ReadToEnd(second));
    s2s_test::CloseFd(first);
    s2s_test::CloseFd(second);
    ip = "stale";
    EXPECT_EQ(0, channel.GetPeerInfo(ip, port));
    EXPECT_EQ(":0", ip + ":" + std::to_string(port));

    // A domain socket: opened, flushed on close; it has no IPv4 peer.
    s2s_test::TempDir dir("s2s-channel");
    int domain = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{AF_UNIX, {}};
    std::snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", (dir / "sock").c_str());
    ASSERT_EQ(0, bind(domain, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
    ASSERT_EQ(0, listen(domain, 4));
    ASSERT_EQ(0, channel.Open((dir / "sock").c_str()));
    int peer = accept(domain, nullptr, nullptr);
    EXPECT_EQ(kStatusInterrupted, channel.GetPeerInfo(ip, port));
    ASSERT_EQ(0, channel.WriteInt32(7));
    channel.Close();
    channel.Close();  // harmless when closed
    EXPECT_EQ(std::string("\0\0\0\7", 4), s2s_test::ReadToEnd(peer));
    s2s_test::CloseFd(peer);
    s2s_test::CloseFd(domain);

    // Refusals. A null address or a negative port is a silent success that opens nothing.
    EXPECT_EQ(0, channel.Open(static_cast<const char*>(nullptr), 80));
    EXPECT_EQ(0, channel.Open("127.0.0.1", -1));
    EXPECT_TRUE(channel.IsClosed());
    EXPECT_EQ(kStatusIOError, channel.Open("not-an-address", 80));
    EXPECT_EQ(kStatusInvalidArgument, channel.ConnectWithTimeout(-1, "127.0.0.1", 1));
    EXPECT_EQ(kStatusIOError, channel.Open((dir / "missing").c_str()));
    channel.fail_nonblock = true;
    EXPECT_EQ(kStatusSystemError, channel.Open("127.0.0.1", listener.port()));
    channel.fail_nonblock = false;
    // Adopting a descriptor: refused over an open channel (the caller still owns it), and for -1.
    SocketPair pair;
    const std::string held = std::to_string(pair.a);
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), false));
    EXPECT_EQ(kStatusInvalidArgument, channel.Open(pair.b, true));
    EXPECT_TRUE(WriteAll(pair.b, "x"));
    channel.Close();
    EXPECT_EQ(kStatusInvalidArgument, channel.Open(-1, false));
    EXPECT_EQ(kStatusSystemError, channel.Open(-1, true));
    EXPECT_TRUE(channel.IsClosed());
    EXPECT_EQ("11111", channel.switches);  // each close; the constructor's own call is Channel's
    for (const std::string& line : std::initializer_list<std::string>{
             "GetPeerInfo: Attempting to get info of an uninitialized channel\n",
             "GetPeerInfo: inet_ntop: ", "Invalid argumants (ip: not-an-address, port: 80\n",
             "Channel: Can not connect to server at '" + dir / "missing" + "'. ",
             "Channel: opening socket " + held + "\n",
             "Open: Channel already opened [" + held + "]\n", "Open: Invalid argument\n",
             "Open: SetLinger to socket [-1] failed, "}) {
        EXPECT_TRUE(log.Contains("): " + line)) << line;
    }
}

TEST(ChannelTest, LargeTransferThroughSmallRingsKeepsEveryByte) {
    // Random-sized writes and reads through 13-byte rings wrap both rings at every offset.
    SocketPair pair;
    std::string data(200000, '\0');
    std::mt19937 random(42);
    for (char& c : data) {
        c = static_cast<char>(random());
    }
    auto writer = std::async(std::launch::async, [&] {
        Channel out(13);
        int ret = out.Open(pair.ReleaseB(), true);
        std::mt19937 sizes(7);
        for (size_t done = 0, len = 0; ret == 0 && done < data.size(); done += len) {
            len = std::min<size_t>(sizes() % 14, data.size() - done);
            ret = out.Write(data.data() + done, static_cast<unsigned int>(len));
        }
        return ret | out.FlushWrite(0);
    });
    Channel in(13);
    ASSERT_EQ(0, in.Open(pair.ReleaseA(), true));
    std::string got;
    std::mt19937 sizes(9);
    char buf[64];
    while (got.size() < data.size()) {
        unsigned int len = std::min<size_t>(1 + sizes() % 40, data.size() - got.size());
        ASSERT_EQ(0, in.Read(buf, len));
        got.append(buf, len);
    }
    EXPECT_EQ(0, writer.get());
    EXPECT_TRUE(got == data);
}

// The channel waits with poll; WaitFd keeps select. Both give the same status and readiness on
// every state of a socket, and only the channel's wait serves a descriptor beyond select's sets,
// end to end through a channel.
class WaitingChannel : public Channel {
  public:
    using Channel::PollFd;
    using Channel::WaitFd;
};

TEST(ChannelTest, ThePollWaitAgreesWithSelectAndServesDescriptorsBeyondItsSets) {
    const timeval brief{0, 20000};
    struct Outcome {
        int status;
        bool ready, exception;
        bool operator==(const Outcome& o) const {
            return status == o.status && ready == o.ready && exception == o.exception;
        }
    };
    auto by_select = [&](int fd, bool write, int* flag) {
        fd_set ready_set;
        fd_set except_set;
        int status =
            write ? WaitingChannel::WaitFd(fd, nullptr, &ready_set, &except_set, brief, flag)
                  : WaitingChannel::WaitFd(fd, &ready_set, nullptr, &except_set, brief, flag);
        bool ok = status == 0;
        return Outcome{status, ok && FD_ISSET(fd, &ready_set), ok && FD_ISSET(fd, &except_set)};
    };
    auto by_poll = [&](int fd, bool write, int* flag) {
        Outcome out{0, false, false};
        out.status = WaitingChannel::PollFd(fd, write, brief, flag, out.ready, out.exception);
        return out;
    };
    SocketPair quiet;
    SocketPair fed;
    ASSERT_TRUE(WriteAll(fed.b, "x"));
    SocketPair closed;
    s2s_test::CloseFd(closed.b);
    s2s_test::Listener listener;
    int urgent_peer = listener.Connect(0);
    int urgent = listener.Accept();
    ASSERT_EQ(1, send(urgent_peer, "!", 1, MSG_OOB));
    int stop = 1;
    struct Row {
        const char* what;
        int fd;
        bool write;
        int* flag;
        Outcome expected;
    } rows[] = {
        {"nothing to read: one quiet interval",
         quiet.a,
         false,
         nullptr,
         {kStatusConnectionTimeout, false, false}},
        {"bytes to read", fed.a, false, nullptr, {0, true, false}},
        {"room to write", quiet.a, true, nullptr, {0, true, false}},
        {"peer gone: readable (the receive finds the end)",
         closed.a,
         false,
         nullptr,
         {0, true, false}},
        {"urgent data: an exception", urgent, false, nullptr, {0, false, true}},
        {"abort flag set", quiet.a, false, &stop, {kStatusInterrupted, false, false}},
        {"no descriptor", -1, false, nullptr, {kStatusSystemError, false, false}},
    };
    for (const Row& row : rows) {
        EXPECT_EQ(row.expected, by_select(row.fd, row.write, row.flag)) << row.what;
        EXPECT_EQ(row.expected, by_poll(row.fd, row.write, row.flag)) << row.what;
    }
    s2s_test::CloseFd(urgent);
    s2s_test::CloseFd(urgent_peer);

    // A negative interval is refused alike.
    bool ready = false;
    bool exception = false;
    EXPECT_EQ(kStatusSystemError,
              WaitingChannel::PollFd(quiet.a, false, timeval{-1, 0}, nullptr, ready, exception));
    // A peer that hung up while our side is full: the write ends at once with the peer gone.
    {
        SocketPair full;
        CountingChannel writer(4096);
        ASSERT_EQ(0, writer.Open(full.ReleaseA(), true));
        while (send(writer.GetFd(), "x", 1, MSG_DONTWAIT) == 1) {
        }
        shutdown(full.b, SHUT_RDWR);
        EXPECT_EQ(kStatusIOError,
                  Steps({writer.Write(std::string(100, 'y').data(), 100), writer.FlushWrite(0)}));
    }

    // A descriptor past FD_SETSIZE: select cannot wait on it, the channel can (under the usual
    // soft limit of 1024 descriptors the limit is raised for this).
    rlimit limit{};
    getrlimit(RLIMIT_NOFILE, &limit);
    const rlimit saved = limit;
    if (limit.rlim_cur < FD_SETSIZE + 64 && limit.rlim_max >= FD_SETSIZE + 64) {
        limit.rlim_cur = FD_SETSIZE + 64;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
    SocketPair pair;
    const int high = fcntl(pair.a, F_DUPFD_CLOEXEC, FD_SETSIZE + 8);
    if (high < 0) {
        setrlimit(RLIMIT_NOFILE, &saved);
        GTEST_SKIP() << "no descriptor past FD_SETSIZE under this limit";
    }
    EXPECT_EQ(kStatusSystemError, by_select(high, false, nullptr).status);
    CountingChannel channel(64);
    ASSERT_EQ(0, channel.Open(high, true));
    std::thread peer([&] { WriteAll(pair.b, std::string("\0\0\0\x2a", 4)); });
    unsigned int value = 0;
    EXPECT_EQ(0, channel.ReadInt32(&value));
    EXPECT_EQ(42u, value);
    EXPECT_EQ(0, channel.WriteInt32(7));
    channel.Close();  // flushes
    EXPECT_EQ(std::string("\0\0\0\7", 4), ReadExactly(pair.b, 4));
    peer.join();
    setrlimit(RLIMIT_NOFILE, &saved);
}

}  // namespace
