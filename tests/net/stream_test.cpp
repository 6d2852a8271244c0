// PStream, the wire format of local messages: one golden encoding per kind, the map-key rule,
// round trips across small rings, malformed streams in one table (status, log line, what
// arrived), key paths in error logs, truncated and stalled peers, receive limits, depth without
// the call stack, status read from another thread, replaced channel steps, masked passwords.
#include "s2s_stream.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <vector>

#include "net/transport_test_util.h"
#include "s2s_status.h"

namespace {

using S2S::Channel;
using S2S::PObject;
using S2S::PStream;
using s2s_test::LogCapture;
using s2s_test::Peer;
using s2s_test::SocketPair;
using s2s_test::WriteAll;

// One message sent through a real channel; the bytes that reached the peer.
std::string Encode(const PObject& object, unsigned int capacity = 4096) {
    SocketPair pair;
    std::string bytes;
    Peer reader([&] { bytes = s2s_test::ReadToEnd(pair.b()); });
    {
        Channel channel(capacity);
        EXPECT_EQ(0, channel.Open(pair.ReleaseA(), true));
        PStream stream;
        EXPECT_EQ(0, stream.Send(channel, object));
    }  // closing the channel ends the reader
    reader.Join();
    return bytes;
}

// Receives one message from `bytes` (the peer closes after them) into `object`.
int Decode(const std::string& bytes, PObject& object, unsigned int capacity = 4096,
           size_t max_bytes = PStream::kDefaultMaxRecvBytes,
           unsigned int max_depth = PStream::kDefaultMaxRecvDepth) {
    SocketPair pair;
    Peer writer([&] {
        WriteAll(pair.b(), bytes);
        pair.CloseB();
    });
    Channel channel(capacity);
    EXPECT_EQ(0, channel.Open(pair.ReleaseA(), true));
    PStream stream;
    stream.SetRecvLimits(max_bytes, max_depth);
    int ret = stream.Recv(channel, object);
    writer.Join();
    return ret;
}

std::string Bytes(std::initializer_list<int> values) {
    std::string out;
    for (int v : values) {
        out.push_back(static_cast<char>(v));
    }
    return out;
}

PObject Array(std::initializer_list<PObject> items) {
    PObject out;
    out = PObject::Array(items);
    return out;
}

TEST(PStreamTest, PrimitiveEncodings) {
    EXPECT_EQ(Bytes({0x00, 0x00}), Encode(PObject()));
    EXPECT_EQ(Bytes({0x01, 0x01, 0x00}), Encode(PObject(0ULL)));
    EXPECT_EQ(Bytes({0x01, 0x01, 0xFF}), Encode(PObject(255ULL)));
    EXPECT_EQ(Bytes({0x01, 0x02, 0x01, 0x00}), Encode(PObject(256ULL)));
    EXPECT_EQ(Bytes({0x01, 0x04, 0x00, 0x01, 0x00, 0x00}), Encode(PObject(65536ULL)));
    EXPECT_EQ(Bytes({0x01, 0x08, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x00}),
              Encode(PObject(4294967296ULL)));
    EXPECT_EQ(Bytes({0x10, 0x00, 0x00}), Encode(PObject("")));
    EXPECT_EQ(Bytes({0x10, 0x00, 0x03, 'a', 'b', 'c'}), Encode(PObject("abc")));
    PObject array;
    array.asArray();
    EXPECT_EQ(Bytes({0x41, 0x40}), Encode(array));
    PObject map;
    map.asMap();
    EXPECT_EQ(Bytes({0x42, 0x40}), Encode(map));
}

TEST(PStreamTest, MapKeysLoseOneLeadingUnderscore) {
    PObject map;
    map["_a"] = 1ULL;
    EXPECT_EQ(Bytes({0x42, 0x10, 0x00, 0x01, 'a', 0x01, 0x01, 0x01, 0x40}), Encode(map));
    PObject back;
    ASSERT_EQ(0, Decode(Encode(map), back));
    EXPECT_EQ("{\"a\": 1}", back.toString());

    PObject keys;
    keys["__x"] = "v";
    keys[""] = PObject();
    ASSERT_EQ(0, Decode(Encode(keys), back = PObject()));
    EXPECT_EQ("{\"\": null, \"_x\": \"v\"}", back.toString());
}

TEST(PStreamTest, NestedValuesRoundTripAcrossSmallRings) {
    // A task-like map: every kind, nested, with strings longer than the channel capacity.
    PObject task;
    task["name"] = "nightly";
    task["id"] = 42ULL;
    task["big"] = 18446744073709551615ULL;
    task["none"] = PObject();
    task["shares"] = Array({PObject("music"), PObject("photos"), PObject(std::string(300, 'p'))});
    task["sync_info"]["server"] = "10.0.0.2";
    task["sync_info"]["options"]["compress"] = 1ULL;
    task["sync_info"]["options"]["list"] = Array({Array({}), PObject(), PObject(7ULL)});
    std::string bytes = Encode(task, 16);
    EXPECT_EQ(bytes, Encode(task, 4096));  // the ring size never shows on the wire
    PObject back;
    ASSERT_EQ(0, Decode(bytes, back, 16));
    EXPECT_EQ(task.toString(), back.toString());
}

// Streams that break the format: each ends with its status, its log line and what was received
// so far kept (a failing array element is not appended; a failing nested array is dropped whole).
TEST(PStreamTest, MalformedStreamsEndWithTheirStatusLogLineAndWhatArrived) {
    struct Case {
        std::string bytes;
        int status;
        const char *log, *received;
    };
    const int kProtocol = S2S::kStatusProtocolError;
    const Case cases[] = {
        {Bytes({0x00, 0x05}), kProtocol, "): expect length 0, but we've got 5\n", "\"before\""},
        {Bytes({0x01, 0x09, 1, 2, 3, 4, 5, 6, 7, 8, 9}), kProtocol, "", "0"},
        {Bytes({0x01, 0x00}), 0, "", "0"},  // no value bytes: 0
        {Bytes({0x41, 0x01, 0x01, 0x09, 0x07, 0x40}), kProtocol, "", "[9]"},
        {Bytes({0x40}), kProtocol, "", "\"before\""},  // the end tag where a value belongs
        {Bytes({0x41, 0x41, 0x41, 0x01, 0x01, 0x01, 0x41, 0x99}), kProtocol, "", "[]"},
        {Bytes({0x42, 0x01, 0x01, 0x01, 0x40}), kProtocol,
         "): PStream: expect string, but get tag 1\n", "{}"},
        // A string keeps only the bytes before a NUL; the rest is consumed all the same.
        {Bytes({0x10, 0x00, 0x04, 'a', 'b', 0x00, 'c'}), 0, "", "\"ab\""},
        {Bytes({0x41, 0x10, 0x00, 0x02, 0x00, 'x', 0x01, 0x01, 0x05, 0x40}), 0, "", "[\"\", 5]"},
    };
    for (const Case& c : cases) {
        LogCapture log;
        PObject back("before");
        EXPECT_EQ(c.status, Decode(c.bytes, back)) << c.received;
        EXPECT_TRUE(log.Contains(c.log)) << c.log;
        EXPECT_EQ(c.status == 0, !log.Contains("): Error stack: ")) << c.received;
        EXPECT_EQ(c.received, back.toString());
    }
}

TEST(PStreamTest, FailureInsideMapsLogsTheKeyPath) {
    LogCapture log;
    // {"a": {"b": {"c": <tag 0x07>}}}
    std::string bytes = Bytes({0x42, 0x10, 0x00, 0x01, 'a', 0x42, 0x10, 0x00, 0x01, 'b', 0x42, 0x10,
                               0x00, 0x01, 'c', 0x07});
    SocketPair pair;
    ASSERT_TRUE(WriteAll(pair.b(), bytes));
    Channel channel(64);
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
    PStream stream;
    PObject back;
    EXPECT_EQ(S2S::kStatusProtocolError, stream.Recv(channel, back));
    EXPECT_TRUE(log.Contains("): Error stack: a.b.c\n"));
    EXPECT_EQ("", stream.GetHistory());
    // The entries received so far stay; the failing key holds what arrived of its value.
    EXPECT_EQ("{\"a\": {\"b\": {\"c\": null}}}", back.toString());
}

TEST(PStreamTest, ReceivingIntoContainersAddsToThem) {
    PObject back = Array({PObject(1ULL)});
    ASSERT_EQ(0, Decode(Encode(Array({PObject(2ULL)})), back));
    EXPECT_EQ("[1, 2]", back.toString());

    PObject held;
    held["keep"] = "k";
    held["list"] = Array({PObject("x")});
    held["text"] = "old";
    PObject incoming;
    incoming["list"] = Array({PObject("y")});
    incoming["text"] = "new";
    incoming["more"] = 3ULL;
    ASSERT_EQ(0, Decode(Encode(incoming), held));
    EXPECT_EQ("{\"keep\": \"k\", \"list\": [\"x\", \"y\"], \"more\": 3, \"text\": \"new\"}",
              held.toString());

    // A value of another kind is replaced.
    PObject number(5ULL);
    ASSERT_EQ(0, Decode(Encode(Array({})), number));
    EXPECT_EQ("[]", number.toString());
}

TEST(PStreamTest, TruncatedStalledAndClosedPeersEndWithAStatus) {
    LogCapture log(S2S::Logger::Warning);
    PObject message;
    message["list"] = Array({PObject("abc"), PObject(1ULL)});
    std::string bytes = Encode(message);
    for (size_t cut = 0; cut < bytes.size(); ++cut) {
        PObject back;
        EXPECT_EQ(S2S::kStatusIOError, Decode(bytes.substr(0, cut), back)) << cut;
    }
    EXPECT_TRUE(log.Contains("[WARNING] s2s_stream.cpp("));
    EXPECT_TRUE(log.Contains("): Channel: -2\n"));

    // A peer that stalls half-way: the channel's inactivity timeout ends the wait.
    SocketPair pair;
    ASSERT_TRUE(WriteAll(pair.b(), bytes.substr(0, 5)));
    Channel channel(64);
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
    channel.SetTimeout(1);
    PStream stream;
    PObject back;
    EXPECT_EQ(S2S::kStatusIOError, stream.Recv(channel, back));
    EXPECT_TRUE(log.Contains("): Channel: -9\n"));
}

// A map entry read or written whole leaves the key path; a failure right after it names only the
// enclosing keys (or the failing entry's own key).
TEST(PStreamTest, KeyPathAfterFinishedEntries) {
    struct Case {
        std::string bytes;  // the peer closes after them
        const char* stack;
    };
    const std::string a_x =
        Bytes({0x42, 0x10, 0x00, 0x01, 'a', 0x42, 0x10, 0x00, 0x01, 'x', 0x01, 0x01, 0x01});
    for (const Case& c : {
             Case{a_x + Bytes({0x01}), "a"},                               // integer tag as a key
             Case{a_x + Bytes({0x10, 0x00, 0x01, 'y', 0x07}), "a.y"},      // bad value of y
             Case{a_x + Bytes({0x10, 0x00}), "a"},                         // closed inside a key
             Case{a_x + Bytes({0x40}), ""},                                // closed after a
             Case{a_x + Bytes({0x40, 0x10, 0x00, 0x01, 'b', 0x42}), "b"},  // closed inside b
         }) {
        LogCapture log(S2S::Logger::Error);
        PObject back;
        EXPECT_GT(0, Decode(c.bytes, back));
        EXPECT_TRUE(log.Contains(std::string("): Error stack: ") + c.stack + "\n")) << c.stack;
    }

    LogCapture log(S2S::Logger::Warning);
    PObject message;
    message["a"] = 1ULL;
    message["a_key_longer_than_the_ring"] = 2ULL;
    SocketPair pair;
    pair.CloseB();
    Channel channel(16);  // the second key forces a send, which fails
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
    PStream stream;
    EXPECT_EQ(S2S::kStatusIOError, stream.Send(channel, message));
    EXPECT_TRUE(log.Contains("): Error stack: \n"));
    EXPECT_FALSE(log.Contains("): Error stack: a"));
}

TEST(PStreamTest, SendFailureLogsTheKeyPathOfTheFailingValue) {
    LogCapture log(S2S::Logger::Warning);
    PObject message;
    message["a"]["_b"] = std::string(100, 'x');
    SocketPair pair;
    pair.CloseB();
    Channel channel(16);  // the long string forces a send while "a.b" is being written
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
    PStream stream;
    EXPECT_EQ(S2S::kStatusIOError, stream.Send(channel, message));
    EXPECT_TRUE(log.Contains("): Error stack: a.b\n"));
    EXPECT_EQ("", stream.GetHistory());
}

TEST(PStreamTest, ReceiveLimitsRefuseDeepAndLongMessages) {
    LogCapture log(S2S::Logger::Error);
    const unsigned int deepest = PStream::kDefaultMaxRecvDepth;
    PObject back;
    EXPECT_EQ(0, Decode(std::string(deepest, '\x41') + std::string(deepest, '\x40'), back));
    EXPECT_EQ(S2S::kStatusProtocolError,
              Decode(std::string(deepest + 1, '\x41') + std::string(deepest + 1, '\x40'), back));
    EXPECT_TRUE(log.Contains("): PStream: message nested deeper than 512 levels refused\n"));

    // 11 strings of 100 bytes: 1,139 bytes on the wire.
    PObject strings;
    strings.asArray().assign(11, PObject(std::string(100, 'x')));
    const std::string bytes = Encode(strings);
    EXPECT_EQ(0, Decode(bytes, back, 4096, bytes.size(), 0));
    EXPECT_EQ(S2S::kStatusProtocolError, Decode(bytes, back, 4096, 1000, 0));
    EXPECT_TRUE(log.Contains("): PStream: message longer than 1000 bytes refused\n"));
}

TEST(PStreamTest, MillionNestedArraysDecodeWithoutTheCallStack) {
    LogCapture log(S2S::Logger::Error);
    // Without the limits the decoder keeps any depth on the heap.
    const size_t depth = 1000000;
    std::string bytes = std::string(depth, '\x41') + std::string(depth, '\x40');
    PObject back;
    ASSERT_EQ(0, Decode(bytes, back, 81920, 0, 0));
    const PObject* level = &back;
    size_t seen = 0;
    while (level->isArray() && !level->asArray().empty()) {
        level = &level->asArray()[0];
        ++seen;
    }
    EXPECT_EQ(depth - 1, seen);
    // Sending it back needs no call stack either, and gives the same bytes.
    EXPECT_TRUE(Encode(back, 81920) == bytes);

    // Cut before the end tags: the peer's close ends it with a status.
    PObject partial;
    EXPECT_EQ(S2S::kStatusIOError, Decode(std::string(depth, '\x41'), partial, 81920, 0, 0));
    EXPECT_TRUE(partial.isArray());
}

// A received map is stored compactly until a reference into it is asked for; every access must
// see the same map, before and after that change, and a part kept alone must outlive the rest.
TEST(PStreamTest, ReceivedMapsBehaveAsMapsThroughEveryAccess) {
    PObject sent;
    sent["a"] = 1ULL;
    sent["b"]["c"] = "a text longer than a short string";
    sent["b"]["d"] = Array({PObject(1ULL), PObject()});
    sent["z"] = "last";
    const std::string bytes = Encode(sent);
    PObject back;
    ASSERT_EQ(0, Decode(bytes, back));
    const PObject& read = back;
    EXPECT_TRUE(read.hasMember("z"));
    EXPECT_FALSE(read.hasMember("y"));
    EXPECT_TRUE(read["y"].isNull());
    EXPECT_EQ(sent.toString(), read.toString());
    PObject copy = back;
    EXPECT_TRUE(Encode(back) == bytes);  // forwarded as received
    EXPECT_TRUE(Encode(copy) == bytes);

    // References stay valid as the map grows; the copy is independent.
    const PObject& a = copy.asMap().at("a");
    copy["b"]["new"] = 5ULL;
    copy["aa"] = 2ULL;
    EXPECT_EQ(1u, a.asUInt64());
    EXPECT_TRUE(read[1u].hasMember("c"));  // "b", second in key order
    EXPECT_FALSE(read["b"].hasMember("new"));
    EXPECT_EQ(
        "{\"a\": 1, \"aa\": 2, \"b\": {\"c\": \"a text longer than a short string\", "
        "\"d\": [1, null], \"new\": 5}, \"z\": \"last\"}",
        copy.toString());

    PObject part;
    part.swap(back["b"]);
    back.clear();
    EXPECT_EQ("a text longer than a short string", part["c"].asString());

    // Keys out of order, or repeated, on the wire: the later value is received into the entry.
    PObject unordered;
    ASSERT_EQ(0,
              Decode(Bytes({0x42, 0x10, 0x00, 0x01, 'b',  0x01, 0x01, 0x01, 0x10, 0x00, 0x01, 'a',
                            0x01, 0x01, 0x02, 0x10, 0x00, 0x01, 'b',  0x01, 0x01, 0x03, 0x40}),
                     unordered));
    EXPECT_EQ("{\"a\": 2, \"b\": 3}", unordered.toString());
}

TEST(PStreamTest, DeeplyNestedMapsKeepTheWholeKeyPath) {
    LogCapture log(S2S::Logger::Error);
    const size_t depth = 100000;
    std::string level = Bytes({0x42, 0x10, 0x00, 0x01, 'k'});
    std::string bytes;
    bytes.reserve(level.size() * depth + 1);
    for (size_t i = 0; i < depth; ++i) {
        bytes += level;
    }
    bytes += '\x07';
    PObject back;
    EXPECT_EQ(S2S::kStatusProtocolError, Decode(bytes, back, 81920, 0, 0));
    std::string path;
    for (size_t i = 0; i < depth; ++i) {
        path += i ? ".k" : "k";
    }
    EXPECT_TRUE(log.Contains("): Error stack: " + path + "\n"));
}

TEST(PStreamTest, StatusIsReadableFromAnotherThreadDuringTransfer) {
    PObject message;
    for (int i = 0; i < 2000; ++i) {
        message["k" + std::to_string(i)]["inner"] = static_cast<unsigned long long>(i);
    }
    SocketPair pair;
    PStream stream;
    std::atomic<bool> done{false};
    Peer watcher([&] {
        while (!done.load()) {
            std::string path;
            unsigned long long a = 1;
            unsigned long long b = 1;
            stream.GetStatus(path, a, b);
            // Nothing sets the counters but UpdateStatus; a path is always whole keys.
            EXPECT_TRUE(path.empty() || path.compare(0, 1, "k") == 0) << path;
        }
    });
    Peer reader([&] { s2s_test::ReadToEnd(pair.b()); });
    {
        Channel channel(256);
        ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
        ASSERT_EQ(0, stream.Send(channel, message));
    }
    done = true;
    watcher.Join();
    reader.Join();

    stream.UpdateStatus(3, 4);
    std::string path = "x";
    unsigned long long a = 0;
    unsigned long long b = 0;
    stream.GetStatus(path, a, b);
    EXPECT_EQ("", path);
    EXPECT_EQ(3u, a);
    EXPECT_EQ(4u, b);
    stream.ClearHistory();
    stream.GetStatus(path, a, b);
    EXPECT_EQ(0u, a);
    EXPECT_EQ(0u, b);
}

// A channel whose byte and block operations are replaced: the codec must use them (and the same
// bytes must result) rather than going to the rings directly.
class TappedChannel : public Channel {
  public:
    using Channel::Channel;
    int Write(const char* src, unsigned int len) override {
        written.append(src, len);
        return Channel::Write(src, len);
    }
    int Read(char* dst, unsigned int len, unsigned int& count) override {
        int ret = Channel::Read(dst, len, count);
        read.append(dst, count);
        return ret;
    }
    std::string written;
    std::string read;
};

TEST(PStreamTest, ReplacedChannelStepsSeeEveryByte) {
    PObject message;
    message["list"] = Array({PObject("abc"), PObject(300ULL), PObject()});
    message["_k"]["x"] = std::string(100, 'y');
    std::string plain = Encode(message);

    SocketPair pair;
    std::string received;
    Peer reader([&] { received = s2s_test::ReadToEnd(pair.b()); });
    {
        TappedChannel channel(4096);
        ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
        PStream stream;
        ASSERT_EQ(0, stream.Send(channel, message));
        EXPECT_TRUE(channel.written == plain);
    }
    reader.Join();
    EXPECT_TRUE(received == plain);

    SocketPair in;
    ASSERT_TRUE(WriteAll(in.b(), plain));
    TappedChannel channel(4096);
    ASSERT_EQ(0, channel.Open(in.ReleaseA(), true));
    PStream stream;
    PObject back;
    ASSERT_EQ(0, stream.Recv(channel, back));
    EXPECT_TRUE(channel.read == plain);
    EXPECT_EQ("{\"k\": {\"x\": \"" + std::string(100, 'y') + "\"}, \"list\": [\"abc\", 300, null]}",
              back.toString());
}

// A task map's password travels under "pswd"; other maps use names such as "Password". The
// debug lines of both ends show the keys and a mask, never the password itself.
TEST(PStreamTest, DebugLinesNeverShowPasswords) {
    LogCapture log(S2S::Logger::Debug);
    const std::string task_secret = "Tr1cky-task-secret";
    const std::string other_secret = "0ther-secret-value";
    const std::string listed_secret = "listed-secret-value";
    PObject message;
    message["user"] = "admin-user";
    message["pswd"] = task_secret;
    message["_Admin_PassWord"] = other_secret;
    message["old_passwords"] = Array({PObject(listed_secret)});
    message["nested"]["pswd_hint"] = "visible-in-no-log";
    message["nested"]["note"] = "plain-note";

    SocketPair pair;
    PObject back;
    Peer receiver([&] {
        Channel channel(4096);
        EXPECT_EQ(0, channel.Open(pair.ReleaseB(), true));
        PStream stream;
        EXPECT_EQ(0, stream.Recv(channel, back));
    });
    {
        Channel channel(4096);
        ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
        PStream stream;
        ASSERT_EQ(0, stream.Send(channel, message));
    }
    receiver.Join();

    // The values themselves travel unchanged.
    EXPECT_EQ(task_secret, back["pswd"].asString());
    EXPECT_EQ(other_secret, back["Admin_PassWord"].asString());
    ASSERT_EQ(1u, back["old_passwords"].asArray().size());
    EXPECT_EQ(listed_secret, back["old_passwords"].asArray()[0].asString());
    EXPECT_EQ("visible-in-no-log", back["nested"]["pswd_hint"].asString());

    std::string text = log.Text();
    for (const std::string& secret :
         {task_secret, other_secret, listed_secret, std::string("visible-in-no-log")}) {
        EXPECT_EQ(std::string::npos, text.find(secret)) << secret;
    }
    // Sent and received: each of the four masked values appears twice.
    size_t masked = 0;
    for (size_t at = text.find("\"********\"\n"); at != std::string::npos;
         at = text.find("\"********\"\n", at + 1)) {
        ++masked;
    }
    EXPECT_EQ(8u, masked);
    for (const char* line :
         {"):   \"pswd\"\n", "):   \"Admin_PassWord\"\n", "):   \"admin-user\"\n",
          "):     \"pswd_hint\"\n", "):     \"plain-note\"\n"}) {
        EXPECT_NE(std::string::npos, text.find(line)) << line;
    }
}

TEST(PStreamTest, VersionAndSkipOfAnUnknownTag) {
    unsigned major = 9, minor = 9, patch = 9;
    PStream::GetVersion(major, minor, patch);
    EXPECT_EQ("1.0.0",
              std::to_string(major) + "." + std::to_string(minor) + "." + std::to_string(patch));
    Channel channel(16);
    PStream stream;
    EXPECT_EQ(S2S::kStatusProtocolError, stream.Skip(channel, 0x07));
}

}  // namespace
