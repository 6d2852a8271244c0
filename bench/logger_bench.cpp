// What a log call costs on the hot path: a message the level filters out (every channel write
// logs at DEBUG) against one that is formatted and written to a file.
#include <benchmark/benchmark.h>

#include <unistd.h>

#include <cstdio>
#include <string>

#include "s2s_logger.h"

namespace {

void BM_FilteredMessage(benchmark::State& state) {
    S2S::Logger::Initialize(S2S::Logger::Stdout, S2S::Logger::Error, "", 0);
    for (auto _ : state) {
        S2S::Logger::LogMsg(S2S::Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): wrote %d bytes\n",
                            __LINE__, 4096);
    }
}
BENCHMARK(BM_FilteredMessage)->Threads(1)->Threads(2);

void BM_WrittenMessage(benchmark::State& state) {
    char path[] = "/tmp/s2s-logger-bench.XXXXXX";
    int fd = mkstemp(path);
    if (fd >= 0) {
        close(fd);
    }
    S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Debug, path, 2);
    for (auto _ : state) {
        S2S::Logger::LogMsg(S2S::Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): wrote %d bytes\n",
                            __LINE__, 4096);
    }
    S2S::Logger::Destroy();
    std::remove(path);
    std::remove((std::string(path) + "_0").c_str());
    std::remove((std::string(path) + "_1").c_str());
}
BENCHMARK(BM_WrittenMessage);

}  // namespace

BENCHMARK_MAIN();
