// Channel, the buffered socket: byte order of integers, the write and read rings (flushing,
// wrapping, partial reads kept), large transfers through small rings, opening by address, path
// and descriptor with their refusals, closed-channel I/O, inactivity timeouts, the abort flag,
// connect timeouts, and subclasses replacing any step.
#include "s2s_channel.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <random>
#include <string>
#include <vector>

#include "net/transport_test_util.h"
#include "s2s_status.h"

namespace {

using S2S::Channel;
using s2s_test::LogCapture;
using s2s_test::Peer;
using s2s_test::ReadExactly;
using s2s_test::SocketPair;
using s2s_test::WriteAll;

// A listening TCP socket on 127.0.0.1 with a kernel-chosen port.
class TcpListener {
  public:
    explicit TcpListener(int backlog = 8) {
        fd_ = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof(addr);
        EXPECT_EQ(0, bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
        EXPECT_EQ(0, listen(fd_, backlog));
        EXPECT_EQ(0, getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len));
        port_ = ntohs(addr.sin_port);
    }
    ~TcpListener() { close(fd_); }
    int fd() const { return fd_; }
    int port() const { return port_; }

  private:
    int fd_;
    int port_;
};

// Opens a channel on one end of a socket pair (the channel owns it from then on).
void Adopt(Channel& channel, SocketPair& pair) {
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
}

double SecondsSince(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

TEST(ChannelTest, IntegersTravelMostSignificantByteFirst) {
    SocketPair pair;
    Channel channel(64);
    Adopt(channel, pair);
    ASSERT_EQ(0, channel.WriteByte(0xAB));
    ASSERT_EQ(0, channel.WriteInt16(0x0102));
    ASSERT_EQ(0, channel.WriteInt32(0x03040506u));
    ASSERT_EQ(0, channel.WriteInt64(0x0708090A0B0C0D0EULL));
    ASSERT_EQ(0, channel.FlushWrite(0));
    EXPECT_EQ(std::string("\xAB\x01\x02\x03\x04\x05\x06\x07\x08\x09\x0A\x0B\x0C\x0D\x0E", 15),
              ReadExactly(pair.b(), 15));

    ASSERT_TRUE(WriteAll(pair.b(), std::string("\xFE\xF1\xF2\x01\x02\x03\x04\x11\x12\x13\x14"
                                               "\x15\x16\x17\x18",
                                               15)));
    unsigned char byte = 0;
    unsigned short u16 = 0;
    unsigned int u32 = 0;
    unsigned long long u64 = 0;
    ASSERT_EQ(0, channel.ReadByte(&byte));
    ASSERT_EQ(0, channel.ReadInt16(&u16));
    ASSERT_EQ(0, channel.ReadInt32(&u32));
    ASSERT_EQ(0, channel.ReadInt64(&u64));
    EXPECT_EQ(0xFE, byte);
    EXPECT_EQ(0xF1F2, u16);
    EXPECT_EQ(0x01020304u, u32);
    EXPECT_EQ(0x1112131415161718ULL, u64);

    EXPECT_EQ(0x0807060504030201ULL, channel.Convert(0x0102030405060708ULL));
    EXPECT_EQ(0x04030201u, channel.Convert(0x01020304u));
    EXPECT_EQ(static_cast<unsigned short>(0x0201),
              channel.Convert(static_cast<unsigned short>(0x0102)));
}

TEST(ChannelTest, FailedIntegerReadLeavesOutputUntouched) {
    SocketPair pair;
    Channel channel(64);
    Adopt(channel, pair);
    ASSERT_TRUE(WriteAll(pair.b(), "\x01"));
    pair.CloseB();
    unsigned int value = 77;
    EXPECT_EQ(S2S::kStatusIOError, channel.ReadInt32(&value));
    EXPECT_EQ(77u, value);
}

TEST(ChannelTest, WriteOfCapacityBytesFlushesFirstAndOneMoreIsRefused) {
    LogCapture log;
    SocketPair pair;
    Channel channel(16);
    Adopt(channel, pair);
    ASSERT_EQ(0, channel.Write("abc", 3));
    // Nothing is sent until room is needed or a flush is asked for.
    char probe;
    EXPECT_EQ(-1, recv(pair.b(), &probe, 1, MSG_DONTWAIT));

    std::string block(16, 'x');
    ASSERT_EQ(0, channel.Write(block.data(), 16));  // needs 3 bytes of room: "abc" goes out
    EXPECT_EQ("abc", ReadExactly(pair.b(), 3));

    std::string too_big(17, 'y');
    EXPECT_EQ(S2S::kStatusInvalidArgument, channel.Write(too_big.data(), 17));
    EXPECT_TRUE(log.Contains("[WARNING] s2s_channel.cpp("));
    EXPECT_TRUE(log.Contains("): Write: Exceed maximum data block size\n"));
    ASSERT_EQ(0, channel.FlushWrite(0));
    EXPECT_EQ(block, ReadExactly(pair.b(), 16));  // the refused write left the buffer as it was
    EXPECT_EQ(-1, recv(pair.b(), &probe, 1, MSG_DONTWAIT));
}

TEST(ChannelTest, ReadEndingAtBufferEndContinuesFromIndexZero) {
    SocketPair pair;
    Channel channel(8);
    Adopt(channel, pair);
    ASSERT_TRUE(WriteAll(pair.b(), "01234567"));
    char out[8] = {};
    ASSERT_EQ(0, channel.Read(out, 5));  // one refill takes all eight bytes
    EXPECT_EQ("01234", std::string(out, 5));

    ASSERT_TRUE(WriteAll(pair.b(), "89AB"));
    ASSERT_EQ(0, channel.ReadMore(4));   // fills the free region at the front: the ring wraps
    ASSERT_EQ(0, channel.Read(out, 3));  // ends exactly at the buffer end
    EXPECT_EQ("567", std::string(out, 3));
    ASSERT_EQ(0, channel.Read(out, 4));
    EXPECT_EQ("89AB", std::string(out, 4));
}

TEST(ChannelTest, PartialReadWhenPeerClosesKeepsBytesBuffered) {
    LogCapture log;
    SocketPair pair;
    Channel channel(64);
    Adopt(channel, pair);
    ASSERT_TRUE(WriteAll(pair.b(), "hello"));
    pair.CloseB();
    char out[16] = {};
    unsigned int count = 0;
    EXPECT_EQ(S2S::kStatusIOError, channel.Read(out, 10, count));
    EXPECT_EQ(5u, count);
    EXPECT_EQ("hello", std::string(out, 5));
    EXPECT_TRUE(
        log.Contains("): Diagnose: select says the socket is readable but actually we "
                     "can't read ... connection closed?\n"));
    // The partial bytes were delivered and also stayed in the read buffer.
    char again[5] = {};
    ASSERT_EQ(0, channel.Read(again, 5));
    EXPECT_EQ("hello", std::string(again, 5));
}

TEST(ChannelTest, LargeTransferThroughSmallRingsKeepsEveryByte) {
    // Random-sized writes and reads through 13-byte rings wrap both rings at every offset.
    SocketPair pair;
    std::string data(200000, '\0');
    std::mt19937 random(42);
    for (char& c : data) {
        c = static_cast<char>(random());
    }
    Peer writer([&] {
        Channel out(13);
        ASSERT_EQ(0, out.Open(pair.ReleaseB(), true));
        std::mt19937 sizes(7);
        size_t done = 0;
        while (done < data.size()) {
            unsigned int len = std::min<size_t>(sizes() % 14, data.size() - done);
            ASSERT_EQ(0, out.Write(data.data() + done, len));
            done += len;
        }
        ASSERT_EQ(0, out.FlushWrite(0));
    });
    Channel in(13);
    Adopt(in, pair);
    std::string got;
    std::mt19937 sizes(9);
    std::vector<char> buf(64);
    while (got.size() < data.size()) {
        unsigned int len = std::min<size_t>(1 + sizes() % 40, data.size() - got.size());
        ASSERT_EQ(0, in.Read(buf.data(), len));
        got.append(buf.data(), len);
    }
    writer.Join();
    EXPECT_TRUE(got == data);
}

TEST(ChannelTest, NullAddressOrNegativePortIsASilentSuccess) {
    Channel channel(16);
    EXPECT_EQ(0, channel.Open(static_cast<const char*>(nullptr), 80));
    EXPECT_EQ(0, channel.Open("127.0.0.1", -1));
    EXPECT_TRUE(channel.IsClosed());
}

// Exposes the descriptor behind the handle.
class ProbeChannel : public Channel {
  public:
    using Channel::Channel;
    using Channel::GetFd;
};

TEST(ChannelTest, TcpOpenReachesPeerAndReportsItsAddress) {
    TcpListener listener;
    ProbeChannel channel(64);
    ASSERT_EQ(0, channel.Open("127.0.0.1", listener.port()));
    int accepted = accept(listener.fd(), nullptr, nullptr);
    ASSERT_GE(accepted, 0);

    std::string ip;
    int port = 0;
    ASSERT_EQ(0, channel.GetPeerInfo(ip, port));
    EXPECT_EQ("127.0.0.1", ip);
    EXPECT_EQ(listener.port(), port);

    // The socket is non-blocking, lingers at most one second and is not inherited by children.
    int fd = channel.GetFd();
    EXPECT_NE(0, fcntl(fd, F_GETFL) & O_NONBLOCK);
    EXPECT_NE(0, fcntl(fd, F_GETFD) & FD_CLOEXEC);
    linger lingering{};
    socklen_t size = sizeof(lingering);
    ASSERT_EQ(0, getsockopt(fd, SOL_SOCKET, SO_LINGER, &lingering, &size));
    EXPECT_EQ(1, lingering.l_onoff);
    EXPECT_EQ(1, lingering.l_linger);

    ASSERT_EQ(0, channel.Write("ping", 4));
    ASSERT_EQ(0, channel.FlushWrite(0));
    EXPECT_EQ("ping", ReadExactly(accepted, 4));
    channel.Close();
    EXPECT_TRUE(channel.IsClosed());
    EXPECT_EQ("", s2s_test::ReadToEnd(accepted));  // the peer sees the close
    close(accepted);

    ip = "stale";
    port = 9;
    LogCapture log;
    EXPECT_EQ(0, channel.GetPeerInfo(ip, port));
    EXPECT_EQ("", ip);
    EXPECT_EQ(0, port);
    EXPECT_TRUE(
        log.Contains("): GetPeerInfo: Attempting to get info of an uninitialized "
                     "channel\n"));
}

TEST(ChannelTest, GetPeerInfoOfDomainSocketFails) {
    LogCapture log;
    SocketPair pair;
    Channel channel(16);
    Adopt(channel, pair);
    std::string ip = "x";
    int port = 5;
    EXPECT_EQ(S2S::kStatusInterrupted, channel.GetPeerInfo(ip, port));
    EXPECT_EQ("", ip);
    EXPECT_EQ(0, port);
    EXPECT_TRUE(log.Contains("): GetPeerInfo: inet_ntop: "));
}

TEST(ChannelTest, ConnectFailuresAndBadArguments) {
    LogCapture log;
    Channel channel(16);
    EXPECT_EQ(S2S::kStatusIOError, channel.Open("not-an-address", 80));
    EXPECT_TRUE(log.Contains("): Invalid argumants (ip: not-an-address, port: 80\n"));
    EXPECT_TRUE(channel.IsClosed());
    EXPECT_EQ(S2S::kStatusInvalidArgument, channel.ConnectWithTimeout(-1, "127.0.0.1", 1));

    s2s_test::TempDir dir("s2s-channel");
    std::string missing = dir / "no-such-socket";
    EXPECT_EQ(S2S::kStatusIOError, channel.Open(missing.c_str()));
    EXPECT_TRUE(log.Contains("): Channel: Can not connect to server at '" + missing + "'. "));
    EXPECT_TRUE(channel.IsClosed());
}

TEST(ChannelTest, DomainSocketOpenAndReopenAfterClose) {
    s2s_test::TempDir dir("s2s-channel");
    std::string path = dir / "sock";
    int listener = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
    ASSERT_EQ(0, bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
    ASSERT_EQ(0, listen(listener, 4));

    Channel channel(32);
    for (int round = 0; round < 2; ++round) {
        ASSERT_EQ(0, channel.Open(path.c_str()));
        int peer = accept(listener, nullptr, nullptr);
        ASSERT_GE(peer, 0);
        ASSERT_EQ(0, channel.WriteInt32(round));
        channel.Close();  // flushes what is buffered, then closes
        EXPECT_EQ(std::string("\0\0\0", 3) + static_cast<char>(round), s2s_test::ReadToEnd(peer));
        close(peer);
        EXPECT_TRUE(channel.IsClosed());
        channel.Close();  // harmless when closed
    }
    close(listener);
}

TEST(ChannelTest, ConnectingAnOpenChannelReplacesTheOldConnection) {
    TcpListener listener;
    Channel channel(32);
    ASSERT_EQ(0, channel.Open("127.0.0.1", listener.port()));
    int first = accept(listener.fd(), nullptr, nullptr);
    ASSERT_GE(first, 0);
    ASSERT_EQ(0, channel.Write("old", 3));
    ASSERT_EQ(0, channel.Open("127.0.0.1", listener.port()));
    int second = accept(listener.fd(), nullptr, nullptr);
    ASSERT_GE(second, 0);
    // The old connection was flushed and closed, not leaked.
    EXPECT_EQ("old", s2s_test::ReadToEnd(first));
    ASSERT_EQ(0, channel.Write("new", 3));
    channel.Close();
    EXPECT_EQ("new", s2s_test::ReadToEnd(second));
    close(first);
    close(second);
}

TEST(ChannelTest, AdoptingRefusesAnOpenChannelAndBadDescriptors) {
    LogCapture log;
    SocketPair pair;
    Channel channel(16);
    int held = pair.ReleaseA();
    ASSERT_EQ(0, channel.Open(held, false));
    EXPECT_TRUE(log.Contains("): Channel: opening socket " + std::to_string(held) + "\n"));
    EXPECT_EQ(S2S::kStatusInvalidArgument, channel.Open(pair.b(), true));
    EXPECT_TRUE(log.Contains("): Open: Channel already opened [" + std::to_string(held) + "]\n"));
    EXPECT_TRUE(log.Contains("): Open: Invalid argument\n"));
    // The refused descriptor still belongs to the caller and works.
    EXPECT_TRUE(WriteAll(pair.b(), "x"));
    channel.Close();

    EXPECT_EQ(S2S::kStatusInvalidArgument, channel.Open(-1, false));
    EXPECT_EQ(S2S::kStatusSystemError, channel.Open(-1, true));
    EXPECT_TRUE(log.Contains("): Open: SetLinger to socket [-1] failed, "));
    EXPECT_TRUE(channel.IsClosed());
}

TEST(ChannelTest, ClosedChannelRefusesIoAndEmptyOperationsDoNothing) {
    LogCapture log;
    Channel channel(16);
    char buf[4];
    EXPECT_EQ(S2S::kStatusIOError, channel.Read(buf, 4));
    EXPECT_EQ(S2S::kStatusIOError, channel.Write("abcd", 4));
    EXPECT_EQ(0, channel.ReadMore(0));
    EXPECT_EQ(0, channel.FlushWrite(0));
    int handle = -1;
    timeval wait{1, 0};
    EXPECT_EQ(S2S::kStatusInvalidArgument, Channel::ReadFd(&handle, buf, 0, wait, nullptr));
    EXPECT_TRUE(log.Contains("): ReadFd: request 0\n"));
}

// Queued bytes are taken without a wait; a set abort flag still wins over them, and a peer that
// has gone is reported as before.
TEST(ChannelTest, ReadFdTakesQueuedBytesUnlessAborted) {
    LogCapture log;
    SocketPair pair;
    ASSERT_TRUE(WriteAll(pair.b(), "abc"));
    int handle = pair.a();
    timeval wait{1, 0};
    char buf[8];
    int flag = 1;
    EXPECT_EQ(S2S::kStatusInterrupted, Channel::ReadFd(&handle, buf, sizeof(buf), wait, &flag));
    flag = 0;
    ASSERT_EQ(3, Channel::ReadFd(&handle, buf, sizeof(buf), wait, &flag));
    EXPECT_EQ("abc", std::string(buf, 3));
    EXPECT_TRUE(log.Contains("): ReadFd: read 3 bytes\n"));
    pair.CloseB();
    EXPECT_EQ(S2S::kStatusIOError, Channel::ReadFd(&handle, buf, sizeof(buf), wait, nullptr));
    EXPECT_TRUE(
        log.Contains("): Diagnose: select says the socket is readable but actually we "
                     "can't read ... connection closed?\n"));
}

TEST(ChannelTest, ReadMoreGivesUpAfterTheInactivityTimeout) {
    LogCapture log;
    SocketPair pair;
    Channel channel(16);
    Adopt(channel, pair);
    channel.SetTimeout(1);
    auto start = std::chrono::steady_clock::now();
    char buf[4];
    EXPECT_EQ(S2S::kStatusConnectionTimeout, channel.Read(buf, 4));
    EXPECT_GE(SecondsSince(start), 0.9);
    EXPECT_LT(SecondsSince(start), 5.0);
    EXPECT_TRUE(log.Contains("[DEBUG] s2s_channel.cpp("));
    EXPECT_TRUE(log.Contains("): select: timeout\n"));
    EXPECT_TRUE(log.Contains("): ReadMore: Channel timeout for 1 seconed\n"));
}

TEST(ChannelTest, FlushWriteTimesOutOnAPeerThatStopsReading) {
    LogCapture log(S2S::Logger::Warning);
    SocketPair pair;
    Channel channel(4096);
    Adopt(channel, pair);
    channel.SetTimeout(1);
    std::string block(4096, 'z');
    int ret = 0;
    // The peer never reads: once the socket buffers are full a write waits, then times out.
    for (int i = 0; i < 100000 && ret == 0; ++i) {
        ret = channel.Write(block.data(), 4096);
    }
    EXPECT_EQ(S2S::kStatusConnectionTimeout, ret);
    EXPECT_TRUE(log.Contains("): FlushWrite: Channel timeout for 1 seconds\n"));
    EXPECT_TRUE(log.Contains("): Write: FlushWrite failed\n"));
}

TEST(ChannelTest, AbortFlagEndsEndlessWaitsFromAnotherThread) {
    SocketPair pair;
    Channel channel(4096);
    Adopt(channel, pair);
    channel.SetTimeout(0);  // wait forever: only the flag can end it
    int flag = 0;
    channel.SetFlag(&flag);
    std::atomic<bool> waiting{false};
    Peer aborter([&] {
        while (!waiting.load()) {
            std::this_thread::yield();
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(200));  // let the wait begin
        __atomic_store_n(&flag, 1, __ATOMIC_SEQ_CST);
    });
    waiting = true;
    auto start = std::chrono::steady_clock::now();
    char buf[4];
    EXPECT_EQ(S2S::kStatusInterrupted, channel.Read(buf, 4));
    EXPECT_LT(SecondsSince(start), 3.0);  // within about one wait interval of the flag
    aborter.Join();

    // A set flag stops a flush before it sends anything.
    ASSERT_EQ(0, channel.Write("data", 4));
    EXPECT_EQ(S2S::kStatusInterrupted, channel.FlushWrite(0));
    char probe;
    EXPECT_EQ(-1, recv(pair.b(), &probe, 1, MSG_DONTWAIT));
    LogCapture log(S2S::Logger::Warning);
    channel.Close();  // the failed flush is reported and the buffers dropped
    EXPECT_TRUE(log.Contains("): FlushWrite: Interrupted\n"));
}

TEST(ChannelTest, ConnectToAPeerThatNeverAnswersCountsThreeSecondsPerQuietWait) {
    // A listener whose accept queue is full drops further connection attempts, so the connect
    // stays pending: a silent peer.
    LogCapture log(S2S::Logger::Warning);
    TcpListener listener(0);
    std::vector<int> fillers;
    for (int i = 0; i < 4; ++i) {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr.sin_port = htons(static_cast<uint16_t>(listener.port()));
        connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
        fillers.push_back(fd);
    }
    Channel channel(16);
    channel.SetTimeout(6);  // two quiet one-second waits
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(S2S::kStatusIOError, channel.Open("127.0.0.1", listener.port()));
    double took = SecondsSince(start);
    EXPECT_GE(took, 1.8);
    EXPECT_LT(took, 4.0);
    EXPECT_TRUE(log.Contains("): Channel timed out during connect (6 seconds), abort anyway\n"));
    EXPECT_TRUE(channel.IsClosed());

    // With no timeout only the abort flag ends it.
    channel.SetTimeout(0);
    int flag = 0;
    channel.SetFlag(&flag);
    Peer aborter([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(1500));
        __atomic_store_n(&flag, 1, __ATOMIC_SEQ_CST);
    });
    EXPECT_EQ(S2S::kStatusIOError, channel.Open("127.0.0.1", listener.port()));
    aborter.Join();
    EXPECT_TRUE(channel.IsClosed());
    for (int fd : fillers) {
        close(fd);
    }
}

// Every internal step goes through the virtual table: a subclass replaces one and sees it used.
class CountingChannel : public Channel {
  public:
    using Channel::Channel;
    int FlushWrite(int want) override {
        flush_wants.push_back(want);
        return Channel::FlushWrite(want);
    }
    int ReadMore(int want) override {
        ++read_mores;
        return Channel::ReadMore(want);
    }
    int SetNonBlock(int fd) override { return fail_nonblock ? -1 : Channel::SetNonBlock(fd); }
    void SwitchChannelOp(int mode) override {
        switch_modes.push_back(mode);
        Channel::SwitchChannelOp(mode);
    }
    std::vector<int> flush_wants;
    std::vector<int> switch_modes;
    int read_mores = 0;
    bool fail_nonblock = false;
};

TEST(ChannelTest, SubclassReplacesAnyStep) {
    SocketPair pair;
    CountingChannel channel(8);
    EXPECT_EQ(std::vector<int>{}, channel.switch_modes);  // the constructor's call is Channel's
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
    ASSERT_EQ(0, channel.Write("abcdef", 6));
    ASSERT_EQ(0, channel.Write("ghijk", 5));  // three bytes over capacity
    EXPECT_EQ(std::vector<int>{3}, channel.flush_wants);
    ASSERT_TRUE(WriteAll(pair.b(), "xy"));
    char buf[2];
    ASSERT_EQ(0, channel.Read(buf, 2));
    EXPECT_EQ(1, channel.read_mores);
    channel.Close();
    EXPECT_EQ((std::vector<int>{3, 0}), channel.flush_wants);
    EXPECT_EQ(std::vector<int>{1}, channel.switch_modes);
    EXPECT_EQ("abcdefghijk", ReadExactly(pair.b(), 11));

    TcpListener listener;
    channel.fail_nonblock = true;
    EXPECT_EQ(S2S::kStatusSystemError, channel.Open("127.0.0.1", listener.port()));
    EXPECT_TRUE(channel.IsClosed());
}

}  // namespace
