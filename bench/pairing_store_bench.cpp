// The pairing store's costs: deciding on 1,000 shares, a status page over 1,000 task sections,
// and update throughput with one and with eight writer processes. The store lives under a
// temporary S2S_ROOT below $TMPDIR (or /tmp), so the figures include the file system's syncs.
#include <benchmark/benchmark.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "s2s_platform.h"
#include "s2s_server.h"

namespace {

constexpr int kShares = 1000;
constexpr int kTasks = 1000;

const char* StoreFile() {
    return S2SPath(S2S_PATH_PAIRING_STORE);
}

// The fixtures are written in the store's own syntax in one go: building 1,000 sections through
// the locked update path would sync the file 1,000 times before measuring anything.
void WriteStore(const std::string& text) {
    std::ofstream out(StoreFile(), std::ios::trunc);
    out << text;
}

// The same by rename, the way writers replace the file: a new file each time.
void ReplaceStore(const std::string& text) {
    const std::string temp = std::string(StoreFile()) + ".bench";
    {
        std::ofstream out(temp, std::ios::trunc);
        out << text;
    }
    std::rename(temp.c_str(), StoreFile());
}

std::string Section(const std::string& name,
                    const std::vector<std::pair<std::string, std::string>>& pairs) {
    std::string text = "[" + name + "]\n";
    for (const auto& pair : pairs) {
        text += "\t" + pair.first + "=\"" + pair.second + "\"\n";
    }
    return text;
}

// A third of the shares is bound to the asking client, a third to another, a third is free.
// range(0) 1: the store is rewritten (by rename, as writers do) before each decision, so each one
// reads and parses the whole file once; 0: the store stays as it is.
void BM_CheckIfSharePaired(benchmark::State& state) {
    std::string text = Section("PairedClientInfo", {{"s2sEnabled", "yes"}});
    VLIBSzList* shares = VLIBCSzListAlloc(kShares);
    for (int i = 0; i < kShares; ++i) {
        const std::string name = "share" + std::to_string(i);
        const char* owner = i % 3 == 0 ? "client-A" : i % 3 == 1 ? "client-B" : "";
        text += Section("SHARE_" + name, {{"CompleteID", owner}, {"RunningID", owner}});
        VLIBCSzListPush(&shares, name.c_str());
    }
    WriteStore(text);
    VLIBSzList* refused = VLIBCSzListAlloc(kShares);
    for (auto _ : state) {
        if (state.range(0) != 0) {
            state.PauseTiming();
            ReplaceStore(text);
            state.ResumeTiming();
        }
        int result = S2SCheckIfSharePaired(shares, "client-A", &refused);
        if (result != 214 || VLIBCSzListCount(refused) != kShares / 3) {
            state.SkipWithError("unexpected decision");
            break;
        }
    }
    state.SetItemsProcessed(state.iterations() * kShares);
    VLIBCSzListFree(refused);
    VLIBCSzListFree(shares);
}
BENCHMARK(BM_CheckIfSharePaired)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

// No task is busy, so the scan reads every task section. range(0) as for BM_CheckIfSharePaired.
void BM_GetStatus(benchmark::State& state) {
    std::string text = Section("PairedClientInfo", {{"s2sEnabled", "yes"},
                                                    {"clientID", "S2SMULTI-SRC-SUPPORT"},
                                                    {"serverName", "S2SMULTI-SRC-SUPPORT"}});
    for (int i = 0; i < kTasks; ++i) {
        text += Section("TASK_" + std::to_string(i), {{"status", i % 2 ? "idle" : "1000000000"}});
    }
    WriteStore(text);
    for (auto _ : state) {
        if (state.range(0) != 0) {
            state.PauseTiming();
            ReplaceStore(text);
            state.ResumeTiming();
        }
        s2s_svr_status status;
        if (s2s_svr_get_status(&status) != 0 || status.busy != 0) {
            state.SkipWithError("unexpected status");
            break;
        }
        s2s_svr_put_status(&status);
    }
    state.SetItemsProcessed(state.iterations() * kTasks);
}
BENCHMARK(BM_GetStatus)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

// `range(0)` processes, each updating its own task section and one shared share section.
void BM_Update(benchmark::State& state) {
    constexpr int kUpdatesPerProcess = 25;
    const int processes = static_cast<int>(state.range(0));
    WriteStore(Section("PairedClientInfo", {{"s2sEnabled", "yes"}}));
    for (auto _ : state) {
        std::vector<pid_t> children;
        for (int p = 0; p < processes; ++p) {
            pid_t pid = fork();
            if (pid == 0) {
                VLIBSzHash* values = VLIBCSzHashAlloc(4);
                int failed = 0;
                for (int i = 0; i < kUpdatesPerProcess; ++i) {
                    VLIBCSzHashSetValue(&values, "status", std::to_string(i).c_str());
                    failed |= S2SServerUpdateTask(std::to_string(p).c_str(), values);
                    VLIBCSzHashSetValue(&values, "RunningID", std::to_string(p).c_str());
                    failed |= S2SServerUpdateShare("common", values);
                }
                VLIBCSzHashFree(values);
                _exit(failed != 0 ? 1 : 0);
            }
            children.push_back(pid);
        }
        bool ok = true;
        for (pid_t pid : children) {
            int status = 0;
            ok = waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0 &&
                 ok;
        }
        if (!ok) {
            state.SkipWithError("a writer failed");
            break;
        }
    }
    state.SetItemsProcessed(state.iterations() * processes * kUpdatesPerProcess * 2);
}
BENCHMARK(BM_Update)->Arg(1)->Arg(8)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace

int main(int argc, char** argv) {
    const char* base = std::getenv("TMPDIR");
    std::string pattern =
        std::string(base != nullptr && *base != '\0' ? base : "/tmp") + "/s2s-pairing-bench.XXXXXX";
    if (mkdtemp(&pattern[0]) == nullptr) {
        perror("mkdtemp");
        return 1;
    }
    std::filesystem::create_directories(pattern + "/usr/vurn/etc");
    setenv("S2S_ROOT", pattern.c_str(), 1);

    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    std::filesystem::remove_all(pattern);
    return 0;
}
