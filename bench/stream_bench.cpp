// One message from a sending thread to a receiving thread over a socketpair, per iteration: the
// sender encodes and sends, the receiver reads and decodes, then acknowledges on a second pair so
// that each iteration is one whole delivered message. Side by side for the same data:
//   PStream        Channel + PStream on both ends (the library's own path)
//   Msgpack        msgpack-c packing into a buffer, write(); read() into its streaming unpacker
//   MsgpackPObject the same, and the unpacked value converted to a PObject, the type the
//                  library's callers receive (the like-for-like comparison)
//   Raw            write()/read() of the PStream-encoded bytes with no codec at all (the limit)
//   *Polled        the same anchors with the receiver waiting as the channel must: a wait
//                  bounded to one second (poll) before each read, then the read; what is left
//                  between them and PStream is the codec alone
#include <benchmark/benchmark.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <msgpack.hpp>
#include <string>
#include <thread>

#include "bench/transport_bench_util.h"
#include "s2s_channel.h"
#include "s2s_pobject.h"
#include "s2s_stream.h"

namespace {

using S2S::Channel;
using S2S::PObject;
using S2S::PStream;

constexpr unsigned int kRing = 0x14000;  // the IPC sender's ring

enum class Codec { kPStream, kMsgpack, kMsgpackPObject, kRaw, kMsgpackPolled, kRawPolled };

void Pack(msgpack::packer<msgpack::sbuffer>& pk, const PObject& object) {
    if (object.isNull()) {
        pk.pack_nil();
    } else if (object.isInteger()) {
        pk.pack_uint64(object.asUInt64());
    } else if (object.isString()) {
        const std::string text = object.asString();
        pk.pack_str(static_cast<uint32_t>(text.size()));
        pk.pack_str_body(text.data(), static_cast<uint32_t>(text.size()));
    } else if (object.isArray()) {
        pk.pack_array(static_cast<uint32_t>(object.asArray().size()));
        for (const PObject& item : object.asArray()) {
            Pack(pk, item);
        }
    } else {
        pk.pack_map(static_cast<uint32_t>(object.asMap().size()));
        for (const auto& entry : object.asMap()) {
            pk.pack_str(static_cast<uint32_t>(entry.first.size()));
            pk.pack_str_body(entry.first.data(), static_cast<uint32_t>(entry.first.size()));
            Pack(pk, entry.second);
        }
    }
}

void ToPObject(const msgpack::object& from, PObject& to) {
    switch (from.type) {
        case msgpack::type::POSITIVE_INTEGER:
            to = static_cast<unsigned long long>(from.via.u64);
            break;
        case msgpack::type::STR:
            to = std::string(from.via.str.ptr, from.via.str.size);
            break;
        case msgpack::type::ARRAY: {
            PObject::Array& items = to.asArray();
            items.resize(from.via.array.size);
            for (uint32_t i = 0; i < from.via.array.size; ++i) {
                ToPObject(from.via.array.ptr[i], items[i]);
            }
            break;
        }
        case msgpack::type::MAP: {
            PObject::Map& map = to.asMap();
            for (uint32_t i = 0; i < from.via.map.size; ++i) {
                const msgpack::object_kv& kv = from.via.map.ptr[i];
                ToPObject(kv.val, map[std::string(kv.key.via.str.ptr, kv.key.via.str.size)]);
            }
            break;
        }
        default:
            to.clear();
            break;
    }
}

// The PStream bytes of `message`, for the raw anchor.
std::string Encoded(const PObject& message) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) {
        s2s_bench::Die("socketpair");
    }
    std::string bytes;
    std::thread reader([&] {
        char buf[65536];
        for (ssize_t n; (n = read(fds[1], buf, sizeof(buf))) > 0;) {
            bytes.append(buf, static_cast<size_t>(n));
        }
    });
    {
        Channel channel(kRing);
        PStream stream;
        if (channel.Open(fds[0], true) != 0 || stream.Send(channel, message) != 0) {
            s2s_bench::Die("encode");
        }
    }
    reader.join();
    close(fds[1]);
    return bytes;
}

// One wait of at most a second for `fd` to become readable, as the channel waits; true.
bool WaitReadable(int fd) {
    pollfd entry{fd, POLLIN | POLLPRI, 0};
    for (int ret; (ret = poll(&entry, 1, 1000)) <= 0;) {
        if (ret < 0 && errno != EINTR) {
            s2s_bench::Die("poll");
        }
    }
    return true;
}

void Receive(Codec codec, int fd, int ack, size_t encoded_size) {
    const char done = 'k';
    switch (codec) {
        case Codec::kPStream: {
            Channel channel(kRing);
            if (channel.Open(fd, true) != 0) {
                s2s_bench::Die("open");
            }
            PStream stream;
            for (;;) {
                PObject message;
                if (stream.Recv(channel, message) != 0) {
                    return;  // the sender closed: the run is over
                }
                benchmark::DoNotOptimize(message);
                s2s_bench::WriteAll(ack, &done, 1);
            }
        }
        case Codec::kMsgpack:
        case Codec::kMsgpackPolled:
        case Codec::kMsgpackPObject: {
            msgpack::unpacker unpacker;
            msgpack::object_handle handle;
            for (;;) {
                while (!unpacker.next(handle)) {
                    if (codec == Codec::kMsgpackPolled) {
                        WaitReadable(fd);
                    }
                    unpacker.reserve_buffer(65536);
                    ssize_t n = read(fd, unpacker.buffer(), unpacker.buffer_capacity());
                    if (n <= 0) {
                        close(fd);
                        return;
                    }
                    unpacker.buffer_consumed(static_cast<size_t>(n));
                }
                if (codec == Codec::kMsgpackPObject) {
                    PObject message;
                    ToPObject(handle.get(), message);
                    benchmark::DoNotOptimize(message);
                } else {
                    benchmark::DoNotOptimize(handle.get());
                }
                s2s_bench::WriteAll(ack, &done, 1);
            }
        }
        case Codec::kRaw:
        case Codec::kRawPolled: {
            std::string buf(encoded_size, '\0');
            while ((codec == Codec::kRaw || WaitReadable(fd)) &&
                   s2s_bench::ReadAll(fd, &buf[0], buf.size())) {
                benchmark::DoNotOptimize(buf.data());
                s2s_bench::WriteAll(ack, &done, 1);
            }
            close(fd);
            return;
        }
    }
}

void Exchange(benchmark::State& state, const PObject& message, Codec codec) {
    s2s_bench::IgnoreSigpipe();
    const std::string encoded = Encoded(message);
    int data[2];
    int ack[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, data) != 0 ||
        socketpair(AF_UNIX, SOCK_STREAM, 0, ack) != 0) {
        s2s_bench::Die("socketpair");
    }
    std::thread receiver(Receive, codec, data[1], ack[1], encoded.size());
    char got;
    {
        Channel channel(kRing);
        PStream stream;
        msgpack::sbuffer packed;
        if (codec == Codec::kPStream && channel.Open(data[0], true) != 0) {
            s2s_bench::Die("open");
        }
        for (auto _ : state) {
            switch (codec) {
                case Codec::kPStream:
                    if (stream.Send(channel, message) != 0) {
                        s2s_bench::Die("send");
                    }
                    break;
                case Codec::kMsgpack:
                case Codec::kMsgpackPolled:
                case Codec::kMsgpackPObject: {
                    packed.clear();
                    msgpack::packer<msgpack::sbuffer> pk(packed);
                    Pack(pk, message);
                    s2s_bench::WriteAll(data[0], packed.data(), packed.size());
                    break;
                }
                case Codec::kRaw:
                case Codec::kRawPolled:
                    s2s_bench::WriteAll(data[0], encoded.data(), encoded.size());
                    break;
            }
            if (!s2s_bench::ReadAll(ack[0], &got, 1)) {
                s2s_bench::Die("ack");
            }
        }
        if (codec != Codec::kPStream) {
            close(data[0]);
        }
    }  // the channel closes its end: the receiver sees the end and stops
    receiver.join();
    close(ack[0]);
    close(ack[1]);
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) *
                            static_cast<int64_t>(encoded.size()));
    state.counters["wire_bytes"] = static_cast<double>(encoded.size());
}

const PObject& Task() {
    static const PObject task = s2s_bench::TaskMap();
    return task;
}

const PObject& Large() {
    static const PObject large = s2s_bench::LargeList();
    return large;
}

void BM_TaskMap_PStream(benchmark::State& s) {
    Exchange(s, Task(), Codec::kPStream);
}
void BM_TaskMap_Msgpack(benchmark::State& s) {
    Exchange(s, Task(), Codec::kMsgpack);
}
void BM_TaskMap_MsgpackPObject(benchmark::State& s) {
    Exchange(s, Task(), Codec::kMsgpackPObject);
}
void BM_TaskMap_Raw(benchmark::State& s) {
    Exchange(s, Task(), Codec::kRaw);
}
void BM_TaskMap_MsgpackPolled(benchmark::State& s) {
    Exchange(s, Task(), Codec::kMsgpackPolled);
}
void BM_TaskMap_RawPolled(benchmark::State& s) {
    Exchange(s, Task(), Codec::kRawPolled);
}
void BM_LargeList_PStream(benchmark::State& s) {
    Exchange(s, Large(), Codec::kPStream);
}
void BM_LargeList_Msgpack(benchmark::State& s) {
    Exchange(s, Large(), Codec::kMsgpack);
}
void BM_LargeList_MsgpackPObject(benchmark::State& s) {
    Exchange(s, Large(), Codec::kMsgpackPObject);
}
void BM_LargeList_Raw(benchmark::State& s) {
    Exchange(s, Large(), Codec::kRaw);
}

BENCHMARK(BM_TaskMap_PStream)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK(BM_TaskMap_Msgpack)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK(BM_TaskMap_MsgpackPObject)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK(BM_TaskMap_Raw)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK(BM_TaskMap_MsgpackPolled)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK(BM_TaskMap_RawPolled)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK(BM_LargeList_PStream)
    ->UseRealTime()
    ->MeasureProcessCPUTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(BM_LargeList_Msgpack)
    ->UseRealTime()
    ->MeasureProcessCPUTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(BM_LargeList_MsgpackPObject)
    ->UseRealTime()
    ->MeasureProcessCPUTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(BM_LargeList_Raw)->UseRealTime()->MeasureProcessCPUTime()->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
