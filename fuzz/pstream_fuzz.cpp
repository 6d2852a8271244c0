// Feeds arbitrary bytes to the stream decoder through a real socket pair, the way a peer process
// would. Whatever arrives, the decoder must end with a status: no crash, no stack overflow on deep
// nesting, no read past a buffer, no hang. A value that decodes must encode and decode again.
//
// The first input byte picks the state of the receiving object (receiving into a container adds
// to it), the ring size of the receiving channel (small rings wrap at every offset) and a nesting
// limit. Every input is decoded twice, straight from the rings and the general way through a
// channel with a replaced step, and both must agree.
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "s2s_channel.h"
#include "s2s_logger.h"
#include "s2s_pobject.h"
#include "s2s_status.h"
#include "s2s_stream.h"

namespace {

// Larger inputs would not fit the socket buffer in one write; the format is byte-oriented, so
// nothing is lost by the bound.
constexpr size_t kMaxInput = 64 * 1024;
constexpr unsigned int kWideRing = 0x14000;

bool WriteAll(int fd, const uint8_t* data, size_t size) {
    while (size > 0) {
        ssize_t n = write(fd, data, size);
        if (n <= 0) {
            return false;
        }
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

// A channel with a replaced step: the codec then takes its general way for every value, never
// the direct one over the rings, so the two can be held against each other.
class SteppedChannel : public S2S::Channel {
  public:
    using Channel::Channel;
    int Read(char* dst, unsigned int len, unsigned int& count) override {
        return Channel::Read(dst, len, count);
    }
};

// Decodes `size` bytes into `object` through a channel with the given ring (a stepped one when
// `general`), with a nesting limit of `depth` levels.
int DecodeBytes(const uint8_t* data, size_t size, unsigned int ring, S2S::PObject& object,
                bool general = false, unsigned int depth = S2S::PStream::kDefaultMaxRecvDepth) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) {
        abort();
    }
    if (!WriteAll(fds[1], data, size)) {
        abort();
    }
    close(fds[1]);  // the peer is done: a truncated message ends with a status, not a wait
    S2S::Channel plain(ring);
    SteppedChannel stepped(ring);
    S2S::Channel& channel = general ? stepped : plain;
    if (channel.Open(fds[0], true) != 0) {
        abort();
    }
    channel.SetTimeout(5);
    S2S::PStream stream;
    stream.SetRecvLimits(S2S::PStream::kDefaultMaxRecvBytes, depth);
    int ret = stream.Recv(channel, object);
    if (stream.GetHistory() != "") {
        abort();  // every message leaves the key path empty
    }
    return ret;
}

// Encodes `object` through a channel; the bytes that reached the peer.
std::string EncodeObject(const S2S::PObject& object) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) {
        abort();
    }
    {
        S2S::Channel channel(kWideRing);
        if (channel.Open(fds[0], true) != 0) {
            abort();
        }
        channel.SetTimeout(5);
        S2S::PStream stream;
        if (stream.Send(channel, object) != 0) {
            abort();
        }
    }
    std::string bytes;
    char buf[65536];
    for (;;) {
        ssize_t n = read(fds[1], buf, sizeof(buf));
        if (n <= 0) {
            break;
        }
        bytes.append(buf, static_cast<size_t>(n));
    }
    close(fds[1]);
    return bytes;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    signal(SIGPIPE, SIG_IGN);
    // Silent: the log would only slow the search down.
    S2S::Logger::Initialize(S2S::Logger::Stderr, 0, "", 0);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 1 || size > kMaxInput) {
        return 0;
    }
    uint8_t mode = data[0];
    static const unsigned int kRings[] = {1, 2, 3, 7, 16, 64, 4096, kWideRing};
    unsigned int ring = kRings[mode & 7];
    // The next bits: a small nesting limit (or the default).
    static const unsigned int kDepths[] = {S2S::PStream::kDefaultMaxRecvDepth, 1, 2, 3};
    const unsigned int depth = kDepths[(mode >> 5) & 3];
    auto start = [mode](S2S::PObject& object) {
        switch ((mode >> 3) & 3) {
            case 1:
                object.asArray().push_back(S2S::PObject(1ULL));
                break;
            case 2:
                object["a"] = "held";
                object["b"].asArray();
                break;
            case 3:
                object = "text";
                break;
            default:
                break;
        }
    };
    S2S::PObject object;
    start(object);
    int ret = DecodeBytes(data + 1, size - 1, ring, object, false, depth);
    if (ret != S2S::kStatusSuccessful && ret != S2S::kStatusIOError &&
        ret != S2S::kStatusProtocolError) {
        abort();
    }
    // The general way reaches the same status and the same value, whatever it got of it.
    S2S::PObject general;
    start(general);
    if (DecodeBytes(data + 1, size - 1, ring, general, true, depth) != ret ||
        general.toString() != object.toString()) {
        abort();
    }
    if (ret == S2S::kStatusSuccessful) {
        // What was accepted can be sent on and read back (keys may lose an underscore on the way,
        // so the bytes need not be the same).
        std::string bytes = EncodeObject(object);
        S2S::PObject again;
        if (DecodeBytes(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size(), kWideRing,
                        again) != S2S::kStatusSuccessful) {
            abort();
        }
        // A copy, and the value with every container turned into its std form, print the same.
        S2S::PObject copy(object);
        std::vector<const S2S::PObject*> pending{&object};
        while (!pending.empty()) {
            const S2S::PObject* value = pending.back();
            pending.pop_back();
            if (value->isArray()) {
                for (const S2S::PObject& item : value->asArray()) {
                    pending.push_back(&item);
                }
            } else if (value->isMap()) {
                for (const auto& entry : value->asMap()) {
                    pending.push_back(&entry.second);
                }
            }
        }
        if (copy.toString() != object.toString()) {
            abort();
        }
    }
    return 0;
}
