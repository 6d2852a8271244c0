// PStream, the wire format of local messages: one golden encoding per kind (and per integer
// width), the map-key rule, round trips across small rings, malformed streams in one table
// (status, log line, what arrived), key paths in error logs, truncated and stalled peers, receive
// limits, depth without the call stack, received maps, the status counters, replaced channel
// steps, masked passwords.
#include "s2s_stream.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <string>

#include "net/net_util.h"
#include "s2s_status.h"

namespace {

using S2S::Channel;
using S2S::PObject;
using S2S::PStream;
using s2s_test::LogCapture;
using s2s_test::SocketPair;
const int kProtocol = S2S::kStatusProtocolError;

// One message sent by `with` (a fresh PStream by default) through `channel` (a fresh Channel by
// default) opened on a socket pair; the bytes that reached the peer.
std::string Encode(const PObject& object, unsigned int capacity = 4096, Channel* channel = nullptr,
                   PStream* with = nullptr) {
    SocketPair pair;
    auto reader = std::async(std::launch::async, [&] { return s2s_test::ReadToEnd(pair.b); });
    {
        Channel own(capacity);
        Channel& out = channel != nullptr ? *channel : own;
        EXPECT_EQ(0, out.Open(pair.ReleaseA(), true));
        PStream own_stream;
        EXPECT_EQ(0, (with != nullptr ? *with : own_stream).Send(out, object));
        out.Close();
    }
    return reader.get();
}

// Receives one message from `bytes` (the peer closes after them) into `object`.
int Decode(const std::string& bytes, PObject& object, unsigned int capacity = 4096,
           size_t max_bytes = PStream::kDefaultMaxRecvBytes,
           unsigned int max_depth = PStream::kDefaultMaxRecvDepth, Channel* channel = nullptr) {
    SocketPair pair;
    auto writer = std::async(std::launch::async, [&] {
        s2s_test::WriteAll(pair.b, bytes);
        s2s_test::CloseFd(pair.b);
    });
    Channel own(capacity);
    Channel& in = channel != nullptr ? *channel : own;
    EXPECT_EQ(0, in.Open(pair.ReleaseA(), true));
    PStream stream;
    stream.SetRecvLimits(max_bytes, max_depth);
    return stream.Recv(in, object);
}

std::string Bytes(std::initializer_list<int> values) {
    return std::string(values.begin(), values.end());
}

PObject Array(std::initializer_list<PObject> items) {
    PObject out;
    out = PObject::Array(items);
    return out;
}

TEST(PStreamTest, GoldenEncodingsAndTheMapKeyRule) {
    PObject array, map, underscored, keys;
    array.asArray();
    map.asMap();
    underscored["_a"] = 1ULL;  // the wire drops one leading underscore
    keys["__x"] = "v";
    keys[""] = PObject();
    const struct {
        PObject object;
        std::string bytes;
        const char* back;
    } golden[] = {
        {PObject(), Bytes({0x00, 0x00}), "null"},
        {PObject(0ULL), Bytes({0x01, 0x01, 0x00}), "0"},
        {PObject(255ULL), Bytes({0x01, 0x01, 0xFF}), "255"},
        {PObject(256ULL), Bytes({0x01, 0x02, 0x01, 0x00}), "256"},
        {PObject(65536ULL), Bytes({0x01, 0x04, 0x00, 0x01, 0x00, 0x00}), "65536"},
        {PObject(4294967296ULL),
         Bytes({0x01, 0x08, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x00}), "4294967296"},
        {PObject(""), Bytes({0x10, 0x00, 0x00}), "\"\""},
        {PObject("abc"), Bytes({0x10, 0x00, 0x03, 'a', 'b', 'c'}), "\"abc\""},
        {array, Bytes({0x41, 0x40}), "[]"},
        {map, Bytes({0x42, 0x40}), "{}"},
        {underscored, Bytes({0x42, 0x10, 0x00, 0x01, 'a', 0x01, 0x01, 0x01, 0x40}), "{\"a\": 1}"},
        {keys,
         Bytes({0x42, 0x10, 0x00, 0x00, 0x00, 0x00, 0x10, 0x00, 0x02, '_', 'x', 0x10, 0x00, 0x01,
                'v', 0x40}),
         "{\"\": null, \"_x\": \"v\"}"},
    };
    for (const auto& g : golden) {
        SCOPED_TRACE(g.back);
        EXPECT_EQ(g.bytes, Encode(g.object));
        PObject back;
        EXPECT_EQ(0, Decode(g.bytes, back));
        EXPECT_EQ(g.back, back.toString());
    }
    unsigned major = 9, minor = 9, patch = 9;
    PStream::GetVersion(major, minor, patch);
    EXPECT_EQ(100u, major * 100 + minor * 10 + patch);
}

TEST(PStreamTest, NestedValuesRoundTripAcrossSmallRings) {
    // A task-like map: every kind, nested, with strings longer than the channel capacity.
    PObject task;
    task["name"] = "nightly";
    task["big"] = 18446744073709551615ULL;
    task["none"] = PObject();
    task["shares"] = Array({PObject("music"), PObject(std::string(300, 'p'))});
    task["sync_info"]["options"]["list"] = Array({Array({}), PObject(), PObject(7ULL)});
    const std::string bytes = Encode(task, 16);
    EXPECT_EQ(bytes, Encode(task, 4096));  // the ring size never shows on the wire
    PObject back;
    ASSERT_EQ(0, Decode(bytes, back, 16));
    EXPECT_EQ(task.toString(), back.toString());

    // Bytes that wrapped to the front of a ring whose head was left at its very end.
    SocketPair pair;
    Channel ring(8);
    ASSERT_EQ(0, ring.Open(pair.ReleaseA(), true));
    char skipped[4];
    s2s_test::WriteAll(pair.b, "JJJJ" + Bytes({0x41, 0x01}));
    ASSERT_EQ(0, ring.ReadMore(1));
    ASSERT_EQ(0, ring.Read(skipped, 4));
    s2s_test::WriteAll(pair.b, Bytes({0x01, 0x05, 0x01, 0x01, 0x07, 0x40}));
    ASSERT_EQ(0, ring.ReadMore(1));
    ASSERT_EQ(0, ring.ReadMore(1));
    ASSERT_EQ(0, PStream().Recv(ring, back));
    EXPECT_EQ("[5, 7]", back.toString());
}

// Streams that break the format: each ends with its status, its log line and what was received
// so far kept (a failing array element is not appended; a failing nested array is dropped whole;
// the entries of maps stay, the failing key holding what arrived of its value).
TEST(PStreamTest, MalformedStreamsEndWithTheirStatusLogLineAndWhatArrived) {
    const struct {
        std::string bytes;
        int status;
        const char *log, *received;
    } cases[] = {
        // First: only empty keys, while the thread's key scratch holds nothing yet.
        {Bytes({0x42, 0x10, 0x00, 0x00}), S2S::kStatusIOError, "", "{\"\": null}"},
        {Bytes({0x00, 0x05}), kProtocol, "): expect length 0, but we've got 5\n", "\"before\""},
        {Bytes({0x01, 0x09, 1, 2, 3, 4, 5, 6, 7, 8, 9}), kProtocol, "", "0"},
        {Bytes({0x01, 0x00}), 0, "", "0"},  // no value bytes: 0
        {Bytes({0x41, 0x01, 0x01, 0x09, 0x07, 0x40}), kProtocol, "", "[9]"},
        {Bytes({0x40}), kProtocol, "", "\"before\""},  // the end tag where a value belongs
        {Bytes({0x41, 0x41, 0x41, 0x01, 0x01, 0x01, 0x41, 0x99}), kProtocol, "", "[]"},
        {Bytes({0x42, 0x01, 0x01, 0x01, 0x40}), kProtocol,
         "): PStream: expect string, but get tag 1\n", "{}"},
        {Bytes({0x42, 0x10, 0x00, 0x01, 'a', 0x42, 0x10, 0x00, 0x01, 'b', 0x42, 0x10, 0x00, 0x01,
                'c', 0x07}),
         kProtocol, "): Error stack: a.b.c\n", "{\"a\": {\"b\": {\"c\": null}}}"},
        // A string keeps only the bytes before a NUL; the rest is consumed all the same.
        {Bytes({0x10, 0x00, 0x04, 'a', 'b', 0x00, 'c'}), 0, "", "\"ab\""},
        {Bytes({0x41, 0x10, 0x00, 0x02, 0x00, 'x', 0x01, 0x01, 0x05, 0x40}), 0, "", "[\"\", 5]"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.received);
        LogCapture log;
        PObject back("before");
        EXPECT_EQ(c.status, Decode(c.bytes, back));
        EXPECT_TRUE(log.Contains(c.log)) << c.log;
        EXPECT_EQ(c.status == 0, !log.Contains("): Error stack: "));
        EXPECT_EQ(c.received, back.toString());
    }
    Channel channel(16);
    PStream stream;
    EXPECT_EQ(kProtocol, stream.Skip(channel, 0x07));
}

// A map entry read or written whole leaves the key path; a failure right after it names only the
// enclosing keys (or the failing entry's own key). The path is cleared after the failure.
TEST(PStreamTest, FailuresLogTheKeyPathOfWhatWasInTransfer) {
    const std::string a_x =
        Bytes({0x42, 0x10, 0x00, 0x01, 'a', 0x42, 0x10, 0x00, 0x01, 'x', 0x01, 0x01, 0x01});
    const std::pair<std::string, const char*> received[] = {
        {a_x + Bytes({0x01}), "a"},                               // an integer tag as a key
        {a_x + Bytes({0x10, 0x00, 0x01, 'y', 0x07}), "a.y"},      // a bad value of y
        {a_x + Bytes({0x10, 0x00}), "a"},                         // closed inside a key
        {a_x + Bytes({0x40}), ""},                                // closed after a
        {a_x + Bytes({0x40, 0x10, 0x00, 0x01, 'b', 0x42}), "b"},  // closed inside b
    };
    for (const auto& [bytes, stack] : received) {
        LogCapture log(S2S::Logger::Error);
        PObject back;
        EXPECT_GT(0, Decode(bytes, back));
        EXPECT_TRUE(log.Contains(std::string("): Error stack: ") + stack + "\n")) << stack;
    }
    // Sent to a peer that has gone, through a ring small enough to need a send mid-message.
    PObject finished, inside;
    finished["a"] = 1ULL;
    finished["a_key_longer_than_the_ring"] = 2ULL;
    inside["a"]["_b"] = std::string(100, 'x');
    for (const auto& [message, stack] : {std::pair(finished, "\n"), std::pair(inside, "a.b\n")}) {
        LogCapture log(S2S::Logger::Warning);
        SocketPair pair;
        s2s_test::CloseFd(pair.b);
        Channel channel(16);
        ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
        PStream stream;
        EXPECT_EQ(S2S::kStatusIOError, stream.Send(channel, message));
        EXPECT_TRUE(log.Contains(std::string("): Error stack: ") + stack)) << stack;
        EXPECT_EQ(std::string(stack) == "\n", !log.Contains("): Error stack: a"));
        EXPECT_EQ("", stream.GetHistory());
    }
    // The status another thread may read: the path and two counters only UpdateStatus sets.
    PStream stream;
    std::string path = "x";
    unsigned long long a = 0, b = 0;
    stream.UpdateStatus(3, 4);
    stream.GetStatus(path, a, b);
    EXPECT_EQ(":3:4", path + ":" + std::to_string(a) + ":" + std::to_string(b));
    stream.ClearHistory();
    stream.GetStatus(path, a, b);
    EXPECT_EQ(0u, a + b);
    // Read by another thread while a message is sent, they are always whole.
    PObject message;
    for (int i = 0; i < 2000; ++i) {
        message["k" + std::to_string(i)]["inner"] = static_cast<unsigned long long>(i);
    }
    std::atomic<bool> done{false};
    auto watcher = std::async(std::launch::async, [&] {
        bool whole = true;
        for (std::string key; !done.load();) {
            stream.GetStatus(key, a, b);
            whole = whole && (key.empty() || key[0] == 'k') && a + b == 0;
        }
        return whole;
    });
    EXPECT_FALSE(Encode(message, 256, nullptr, &stream).empty());
    done = true;
    EXPECT_TRUE(watcher.get());
}

TEST(PStreamTest, ReceivingIntoContainersAddsToThemAndReplacesOtherKinds) {
    PObject back = Array({PObject(1ULL)});
    ASSERT_EQ(0, Decode(Encode(Array({PObject(2ULL)})), back));
    EXPECT_EQ("[1, 2]", back.toString());
    PObject held, incoming;
    held["keep"] = "k";
    held["list"] = Array({PObject("x")});
    held["text"] = "old";
    incoming["list"] = Array({PObject("y")});
    incoming["text"] = "new";
    ASSERT_EQ(0, Decode(Encode(incoming), held));
    EXPECT_EQ("{\"keep\": \"k\", \"list\": [\"x\", \"y\"], \"text\": \"new\"}", held.toString());
    PObject number(5ULL);
    ASSERT_EQ(0, Decode(Encode(Array({})), number));
    EXPECT_EQ("[]", number.toString());
}

TEST(PStreamTest, TruncatedStalledAndClosedPeersEndWithAStatus) {
    LogCapture log(S2S::Logger::Warning);
    PObject message;
    message["list"] = Array({PObject("abc"), PObject(1ULL)});
    const std::string bytes = Encode(message);
    for (size_t cut = 0; cut < bytes.size(); ++cut) {
        PObject back;
        EXPECT_EQ(S2S::kStatusIOError, Decode(bytes.substr(0, cut), back)) << cut;
    }
    // A peer that stalls half-way: the channel's inactivity timeout ends the wait.
    SocketPair pair;
    ASSERT_TRUE(s2s_test::WriteAll(pair.b, bytes.substr(0, 5)));
    Channel channel(64);
    ASSERT_EQ(0, channel.Open(pair.ReleaseA(), true));
    channel.SetTimeout(1);
    PStream stream;
    PObject back;
    EXPECT_EQ(S2S::kStatusIOError, stream.Recv(channel, back));
    EXPECT_TRUE(log.Contains("): Channel: -9\n"));
}

TEST(PStreamTest, ReceiveLimitsRefuseDeepAndLongMessages) {
    LogCapture log(S2S::Logger::Error);
    const size_t bytes_limit = PStream::kDefaultMaxRecvBytes;
    const unsigned int deepest = PStream::kDefaultMaxRecvDepth;
    PObject back;
    EXPECT_EQ(0, Decode(std::string(deepest, '\x41') + std::string(deepest, '\x40'), back));
    EXPECT_EQ(kProtocol,
              Decode(std::string(deepest + 1, '\x41') + std::string(deepest + 1, '\x40'), back));
    EXPECT_TRUE(log.Contains("): PStream: message nested deeper than 512 levels refused\n"));
    // Maps inside an array count their levels like any other container.
    const std::string nested = Bytes({0x41, 0x42, 0x10, 0x00, 0x01, 'a', 0x42, 0x10, 0x00, 0x01,
                                      'b', 0x01, 0x01, 0x01, 0x40, 0x40, 0x40});
    EXPECT_EQ(kProtocol, Decode(nested, back, 4096, bytes_limit, 2));
    EXPECT_EQ(0, Decode(nested, back, 4096, bytes_limit, 3));
    // 11 strings of 100 bytes: 1,139 bytes on the wire.
    PObject strings;
    strings.asArray().assign(11, PObject(std::string(100, 'x')));
    const std::string bytes = Encode(strings);
    EXPECT_EQ(0, Decode(bytes, back, 4096, bytes.size(), 0));
    EXPECT_EQ(kProtocol, Decode(bytes, back, 4096, 1000, 0));
    EXPECT_TRUE(log.Contains("): PStream: message longer than 1000 bytes refused\n"));
}

TEST(PStreamTest, MillionNestedArraysDecodeWithoutTheCallStack) {
    LogCapture log(S2S::Logger::Error);
    // Without the limits the decoder keeps any depth on the heap.
    const size_t depth = 1000000;
    const std::string bytes = std::string(depth, '\x41') + std::string(depth, '\x40');
    PObject back;
    ASSERT_EQ(0, Decode(bytes, back, 81920, 0, 0));
    const PObject* level = &back;
    size_t seen = 0;
    for (; level->isArray() && !level->asArray().empty(); ++seen) {
        level = &level->asArray()[0];
    }
    EXPECT_EQ(depth - 1, seen);
    // Sending it back needs no call stack either, and gives the same bytes.
    EXPECT_TRUE(Encode(back, 81920) == bytes);
    // Cut before the end tags: the peer's close ends it with a status.
    PObject partial;
    EXPECT_EQ(S2S::kStatusIOError, Decode(std::string(depth, '\x41'), partial, 81920, 0, 0));
    EXPECT_TRUE(partial.isArray());
}

// A received map or array is stored compactly until a reference into it is asked for; every access
// must see the same value, before and after that change, and a part kept alone must outlive the
// rest of its message.
TEST(PStreamTest, ReceivedMapsAndArraysBehaveAsThemselvesThroughEveryAccess) {
    PObject sent;
    sent["a"] = 1ULL;
    sent["b"]["c"] = "a text longer than a short string";
    sent["b"]["d"] = Array({PObject(1ULL), PObject(), PObject("an item longer than a short one")});
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
        "\"d\": [1, null, \"an item longer than a short one\"], \"new\": 5}, \"z\": \"last\"}",
        copy.toString());

    // The array: read in place, then through a reference that stays valid as it changes.
    PObject again;
    ASSERT_EQ(0, Decode(bytes, again));
    PObject list;
    list.swap(again["b"]["d"]);
    again.clear();
    const PObject& items = list;
    EXPECT_FALSE(items.isEmpty());
    EXPECT_EQ("[1, null, \"an item longer than a short one\"]", items.toString());
    PObject list_copy = list;
    const PObject& third = items[2u];
    list.asArray()[0] = 7ULL;
    EXPECT_EQ("an item longer than a short one", third.asString());
    EXPECT_EQ(7u, items[0u].asUInt64());
    EXPECT_EQ(3u, list_copy.asArray().size());

    // A request of leaves and containers of leaves, empty ones too, is released in one step.
    PObject request;
    request["empty"].asArray();
    request["none"].asMap();
    request["names"] = Array({PObject("a"), PObject("b")});
    PObject request_back;
    ASSERT_EQ(0, Decode(Encode(request), request_back));
    EXPECT_EQ(request.toString(), request_back.toString());

    PObject part;
    part.swap(back["b"]);
    back.clear();
    EXPECT_EQ("a text longer than a short string", part["c"].asString());
    EXPECT_EQ(1u, static_cast<const PObject&>(part)["d"][0u].asUInt64());

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
    std::string bytes, path;
    for (size_t i = 0; i < depth; ++i) {
        bytes += Bytes({0x42, 0x10, 0x00, 0x01, 'k'});
        path += i ? ".k" : "k";
    }
    PObject back;
    EXPECT_EQ(kProtocol, Decode(bytes + '\x07', back, 81920, 0, 0));
    EXPECT_TRUE(log.Contains("): Error stack: " + path + "\n"));
}

// A channel whose block operations are replaced: the codec must use them (and the same bytes
// must result) rather than go to the rings directly.
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
    std::string written, read;
};

// A channel whose steps run transfers of their own on the same thread (progress notes).
class NotingChannel : public Channel {
  public:
    using Channel::Channel;
    int Write(const char* src, unsigned int len) override {
        notes += Encode(PObject(static_cast<unsigned long long>(len))).size();
        return Channel::Write(src, len);
    }
    int Read(char* dst, unsigned int len, unsigned int& count) override {
        PObject note;
        notes += Decode(Encode(Array({PObject(1ULL)})), note) == 0 ? 1 : 0;
        return Channel::Read(dst, len, count);
    }
    size_t notes = 0;
};

TEST(PStreamTest, ReplacedChannelStepsSeeEveryByte) {
    PObject message;
    message["list"] = Array({PObject("abc"), PObject(300ULL), PObject()});
    message["_k"]["x"] = std::string(100, 'y');
    const std::string plain = Encode(message);
    TappedChannel out(4096), in(4096);
    EXPECT_TRUE(Encode(message, 0, &out) == plain);
    EXPECT_TRUE(out.written == plain);
    PObject back;
    ASSERT_EQ(0, Decode(plain, back, 0, 0, 0, &in));
    EXPECT_TRUE(in.read == plain);
    EXPECT_EQ("{\"k\": {\"x\": \"" + std::string(100, 'y') + "\"}, \"list\": [\"abc\", 300, null]}",
              back.toString());
    // Steps that send and receive messages of their own leave the outer message whole.
    NotingChannel noting_out(4096), noting_in(4096);
    EXPECT_TRUE(Encode(message, 0, &noting_out) == plain);
    PObject again;
    ASSERT_EQ(0, Decode(plain, again, 0, PStream::kDefaultMaxRecvBytes,
                        PStream::kDefaultMaxRecvDepth, &noting_in));
    EXPECT_EQ(back.toString(), again.toString());
    EXPECT_TRUE(noting_out.notes > 0 && noting_in.notes > 0);
}

// A task map's password travels under "pswd"; other maps use names such as "Password". The
// debug lines of both ends show the keys and a mask, never the password itself.
TEST(PStreamTest, DebugLinesNeverShowPasswords) {
    LogCapture log(S2S::Logger::Debug);
    PObject message;
    message["user"] = "admin-user";
    message["pswd"] = "Tr1cky-task-secret";
    message["_Admin_PassWord"] = "0ther-secret-value";
    message["old_passwords"] = Array({PObject("listed-secret-value")});
    message["nested"]["pswd_hint"] = "visible-in-no-log";
    message["nested"]["note"] = "plain-note";
    PObject back;
    ASSERT_EQ(0, Decode(Encode(message), back));
    // The values themselves travel unchanged.
    message["Admin_PassWord"] = message["_Admin_PassWord"];
    message.asMap().erase("_Admin_PassWord");
    EXPECT_EQ(message.toString(), back.toString());

    const std::string text = log.Text();
    for (const char* secret :
         {"Tr1cky-task-secret", "0ther-secret-value", "listed-secret-value", "visible-in-no-log"}) {
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

}  // namespace
