// Section-file costs by file size: one section read, one value read, one section written
// (a whole-file atomic replacement with two fsyncs), and the enumeration of section names.
//
// Reads are served from the per-process cache once a file has been left alone for a second; the
// fixtures wait for that, so the plain figures are the steady state. The "Uncached" variants drop
// the cache before each read, which is what the first read of a file, or a read after a write,
// costs: one read and parse of the whole file.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>

#include "platform/section_file.h"
#include "s2s_platform.h"

namespace {

// A scratch file with `sections` sections of 4 pairs each, removed at the end.
class ScratchFile {
  public:
    explicit ScratchFile(int sections) {
        char dir[] = "/tmp/s2s-bench-XXXXXX";
        dir_ = mkdtemp(dir);
        path_ = dir_ + "/bench.info";
        VLIBSzHash* pairs = VLIBCSzHashAlloc(4);
        VLIBCSzHashSetValue(&pairs, "CompleteID", "0123456789ABCDEF");
        VLIBCSzHashSetValue(&pairs, "RunningID", "0123456789ABCDEF");
        VLIBCSzHashSetValue(&pairs, "ServerName", "backup-server.example");
        VLIBCSzHashSetValue(&pairs, "status", "1700000000");
        std::string text;
        for (int i = 0; i < sections; ++i) {
            text += "[SHARE_" + std::to_string(i) + "]\n";
            for (int k = 0; k < VLIBCSzHashCount(pairs); ++k) {
                text += std::string("\t") + VLIBCSzHashKeyAt(pairs, k) + "=\"" +
                        VLIBCSzHashValueAt(pairs, k) + "\"\n";
            }
        }
        VLIBCSzHashFree(pairs);
        FILE* f = fopen(path_.c_str(), "w");
        fwrite(text.data(), 1, text.size(), f);
        fclose(f);
        // A file changed within the last second is re-read and compared on every read.
        std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    }
    ~ScratchFile() {
        unlink(path_.c_str());
        rmdir(dir_.c_str());
    }
    const char* path() const { return path_.c_str(); }

  private:
    std::string dir_;
    std::string path_;
};

void BM_GetSection(benchmark::State& state) {
    ScratchFile file(static_cast<int>(state.range(0)));
    std::string last = "SHARE_" + std::to_string(state.range(0) - 1);
    VLIBSzHash* out = VLIBCSzHashAlloc(8);
    for (auto _ : state) {
        VLIBCHashRemoveAll(out);
        if (VLIBCFileGetSection(file.path(), last.c_str(), &out) != 1) {
            state.SkipWithError("read failed");
            break;
        }
    }
    VLIBCSzHashFree(out);
}
BENCHMARK(BM_GetSection)->Arg(10)->Arg(100)->Arg(1000);

void BM_GetSectionUncached(benchmark::State& state) {
    ScratchFile file(static_cast<int>(state.range(0)));
    std::string last = "SHARE_" + std::to_string(state.range(0) - 1);
    VLIBSzHash* out = VLIBCSzHashAlloc(8);
    for (auto _ : state) {
        s2s_platform::ForgetSectionFile(file.path());
        VLIBCHashRemoveAll(out);
        if (VLIBCFileGetSection(file.path(), last.c_str(), &out) != 1) {
            state.SkipWithError("read failed");
            break;
        }
    }
    VLIBCSzHashFree(out);
}
BENCHMARK(BM_GetSectionUncached)->Arg(10)->Arg(100)->Arg(1000);

void BM_GetSectionValue(benchmark::State& state) {
    ScratchFile file(static_cast<int>(state.range(0)));
    char buf[36];
    for (auto _ : state) {
        if (VLIBCFileGetSectionValue(file.path(), "SHARE_0", "RunningID", buf, sizeof(buf)) < 0) {
            state.SkipWithError("read failed");
            break;
        }
    }
}
BENCHMARK(BM_GetSectionValue)->Arg(10)->Arg(1000);

void BM_SetSection(benchmark::State& state) {
    ScratchFile file(static_cast<int>(state.range(0)));
    VLIBSzHash* values = VLIBCSzHashAlloc(1);
    long n = 0;
    for (auto _ : state) {
        std::string stamp = std::to_string(n++);
        VLIBCSzHashSetValue(&values, "status", stamp.c_str());
        if (VLIBCFileSetSection(file.path(), "TASK_bench", nullptr, values, nullptr) != 1) {
            state.SkipWithError("write failed");
            break;
        }
    }
    VLIBCSzHashFree(values);
}
BENCHMARK(BM_SetSection)->Arg(10)->Arg(1000)->Unit(benchmark::kMillisecond);

void BM_EnumSection(benchmark::State& state) {
    ScratchFile file(static_cast<int>(state.range(0)));
    VLIBSzList* list = VLIBCSzListAlloc(1024);
    for (auto _ : state) {
        VLIBCSzListRemoveAll(list);
        VLIBCFileEnumSection(file.path(), &list);
    }
    VLIBCSzListFree(list);
}
BENCHMARK(BM_EnumSection)->Arg(1000);

void BM_EnumSectionUncached(benchmark::State& state) {
    ScratchFile file(static_cast<int>(state.range(0)));
    VLIBSzList* list = VLIBCSzListAlloc(1024);
    for (auto _ : state) {
        s2s_platform::ForgetSectionFile(file.path());
        VLIBCSzListRemoveAll(list);
        VLIBCFileEnumSection(file.path(), &list);
    }
    VLIBCSzListFree(list);
}
BENCHMARK(BM_EnumSectionUncached)->Arg(1000);

}  // namespace

BENCHMARK_MAIN();
