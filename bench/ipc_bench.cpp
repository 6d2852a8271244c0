// One IPC request/reply round trip per iteration: IPCSender::send(request, true, reply) against a
// serving thread (IPCListener, accept, IPCSender::assign, recv, send), over a domain socket and
// over TCP loopback. The anchor is a raw ping-pong of the same encoded bytes over the same kind
// of socket: write the request, read it whole, write the reply, read it whole. A second raw case
// (*_select) reads as the channel does: the socket non-blocking and each receive preceded by a
// select of at most one second; it is no anchor, it shows what that wait discipline costs alone.
//
// Where the two threads run decides the figures on a small shared machine: left to the scheduler,
// the same binary alternates between two modes several times apart (a wake-up on the same core
// or across cores, with idle exits in between). --pin=one (the default) keeps both threads on
// one core, --pin=two puts the client on one core and the serving thread on another, --pin=none
// leaves them to the scheduler. The same placement applies to every case, anchors included.
#include <arpa/inet.h>
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <pthread.h>
#include <sched.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "bench/transport_bench_util.h"
#include "s2s_channel.h"
#include "s2s_ipc.h"
#include "s2s_stream.h"

namespace {

using S2S::IPCListener;
using S2S::IPCSender;
using S2S::PObject;

enum class Placement { kNone, kOneCore, kTwoCores };
Placement g_placement = Placement::kOneCore;

// The core a thread of the measurement runs on (`serving` tells the two threads apart); nothing
// is changed with --pin=none.
void Place(bool serving) {
    if (g_placement == Placement::kNone) {
        return;
    }
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(g_placement == Placement::kTwoCores && serving ? 1 : 0, &set);
    if (pthread_setaffinity_np(pthread_self(), sizeof(set), &set) != 0) {
        s2s_bench::Die("pthread_setaffinity_np");
    }
}

PObject Reply() {
    PObject reply;
    reply["result"] = 0ULL;
    reply["task_id"] = 17ULL;
    reply["status"] = "queued";
    return reply;
}

// The PStream bytes of `message`.
std::string Encoded(const PObject& message) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) {
        s2s_bench::Die("socketpair");
    }
    {
        S2S::Channel channel(IPCSender::kCapacity);
        S2S::PStream stream;
        if (channel.Open(fds[0], true) != 0 || stream.Send(channel, message) != 0) {
            s2s_bench::Die("encode");
        }
    }
    std::string bytes;
    char buf[65536];
    for (ssize_t n; (n = read(fds[1], buf, sizeof(buf))) > 0;) {
        bytes.append(buf, static_cast<size_t>(n));
    }
    close(fds[1]);
    return bytes;
}

// A listener on a fresh domain socket path or a kernel-chosen loopback port; removes its path.
struct Endpoint {
    explicit Endpoint(bool domain) {
        if (domain) {
            char dir[] = "/tmp/s2s-ipc-bench.XXXXXX";
            if (mkdtemp(dir) == nullptr) {
                s2s_bench::Die("mkdtemp");
            }
            directory = dir;
            path = directory + "/daemon.sock";
            if (listener.prepare(path) != 0) {
                s2s_bench::Die("prepare");
            }
        } else {
            port = listener.prepare(0);
            if (port <= 0) {
                s2s_bench::Die("prepare");
            }
        }
    }
    ~Endpoint() {
        listener.close();
        if (!directory.empty()) {
            rmdir(directory.c_str());
        }
    }
    int Connect(IPCSender& sender) const {
        return path.empty() ? sender.connect(port) : sender.connect(path);
    }
    IPCListener listener;
    std::string directory;
    std::string path;
    int port = 0;
};

void BM_IPC(benchmark::State& state, bool domain) {
    s2s_bench::IgnoreSigpipe();
    const PObject request = s2s_bench::TaskMap();
    const PObject answer = Reply();
    Endpoint endpoint(domain);
    Place(false);
    std::thread server([&] {
        Place(true);
        int fd = endpoint.listener.accept();
        IPCSender end;
        if (fd < 0 || end.assign(fd) != 0) {
            s2s_bench::Die("accept");
        }
        for (;;) {
            PObject message;
            if (end.recv(message) != 0 || end.send(answer) != 0) {
                return;  // the client closed: the run is over
            }
        }
    });
    {
        IPCSender client;
        if (endpoint.Connect(client) != 0) {
            s2s_bench::Die("connect");
        }
        for (auto _ : state) {
            PObject reply;
            if (client.send(request, true, reply) != 0) {
                s2s_bench::Die("round trip");
            }
            benchmark::DoNotOptimize(reply);
        }
    }
    server.join();
    state.counters["request_bytes"] = static_cast<double>(Encoded(request).size());
}

// Fills `data` from the non-blocking `fd`, waiting for readability before each receive as the
// channel does; false when the peer closed before the first byte.
bool ReadAllAfterSelect(int fd, char* data, size_t size) {
    size_t done = 0;
    while (done < size) {
        fd_set read_set;
        FD_ZERO(&read_set);
        FD_SET(fd, &read_set);
        timeval wait = {1, 0};
        int ready = select(fd + 1, &read_set, nullptr, nullptr, &wait);
        if (ready < 0) {
            s2s_bench::Die("select");
        }
        if (ready == 0) {
            continue;
        }
        ssize_t n = recv(fd, data + done, size - done, 0);
        if (n <= 0) {
            if (n == 0 && done == 0) {
                return false;
            }
            s2s_bench::Die("recv");
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

bool ReadWhole(int fd, char* data, size_t size, bool after_select) {
    return after_select ? ReadAllAfterSelect(fd, data, size) : s2s_bench::ReadAll(fd, data, size);
}

void MakeNonBlocking(int fd) {
    if (fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK) != 0) {
        s2s_bench::Die("fcntl");
    }
}

void BM_RawPingPong(benchmark::State& state, bool domain, bool after_select) {
    s2s_bench::IgnoreSigpipe();
    const std::string request = Encoded(s2s_bench::TaskMap());
    const std::string answer = Encoded(Reply());
    Endpoint endpoint(domain);
    Place(false);
    std::thread server([&] {
        Place(true);
        int fd = endpoint.listener.accept();
        if (fd < 0) {
            s2s_bench::Die("accept");
        }
        if (after_select) {
            MakeNonBlocking(fd);
        }
        std::string buf(request.size(), '\0');
        while (ReadWhole(fd, &buf[0], buf.size(), after_select)) {
            s2s_bench::WriteAll(fd, answer.data(), answer.size());
        }
        close(fd);
    });
    {
        // A plain blocking socket of the same kind.
        int fd = -1;
        if (domain) {
            fd = socket(AF_UNIX, SOCK_STREAM, 0);
            sockaddr_un addr{};
            addr.sun_family = AF_UNIX;
            std::snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", endpoint.path.c_str());
            if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
                s2s_bench::Die("connect");
            }
        } else {
            fd = socket(AF_INET, SOCK_STREAM, 0);
            sockaddr_in addr{};
            addr.sin_family = AF_INET;
            addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
            addr.sin_port = htons(static_cast<uint16_t>(endpoint.port));
            if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
                s2s_bench::Die("connect");
            }
        }
        if (after_select) {
            MakeNonBlocking(fd);
        }
        std::string buf(answer.size(), '\0');
        for (auto _ : state) {
            s2s_bench::WriteAll(fd, request.data(), request.size());
            if (!ReadWhole(fd, &buf[0], buf.size(), after_select)) {
                s2s_bench::Die("reply");
            }
            benchmark::DoNotOptimize(buf.data());
        }
        close(fd);
    }
    server.join();
    state.counters["request_bytes"] = static_cast<double>(request.size());
}

BENCHMARK_CAPTURE(BM_IPC, domain_socket, true)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK_CAPTURE(BM_RawPingPong, domain_socket, true, false)
    ->UseRealTime()
    ->MeasureProcessCPUTime();
BENCHMARK_CAPTURE(BM_IPC, tcp_loopback, false)->UseRealTime()->MeasureProcessCPUTime();
BENCHMARK_CAPTURE(BM_RawPingPong, tcp_loopback, false, false)
    ->UseRealTime()
    ->MeasureProcessCPUTime();
BENCHMARK_CAPTURE(BM_RawPingPong, domain_socket_select, true, true)
    ->UseRealTime()
    ->MeasureProcessCPUTime();
BENCHMARK_CAPTURE(BM_RawPingPong, tcp_loopback_select, false, true)
    ->UseRealTime()
    ->MeasureProcessCPUTime();

}  // namespace

// --pin=none|one|two is taken out before the benchmark library reads the other flags.
int main(int argc, char** argv) {
    int kept = 1;
    for (int i = 1; i < argc; ++i) {
        const char* arg = argv[i];
        if (std::strncmp(arg, "--pin=", 6) != 0) {
            argv[kept++] = argv[i];
        } else if (std::strcmp(arg + 6, "none") == 0) {
            g_placement = Placement::kNone;
        } else if (std::strcmp(arg + 6, "one") == 0) {
            g_placement = Placement::kOneCore;
        } else if (std::strcmp(arg + 6, "two") == 0) {
            g_placement = Placement::kTwoCores;
        } else {
            std::fprintf(stderr, "%s: --pin takes none, one or two\n", argv[0]);
            return 2;
        }
    }
    argc = kept;
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
