// One poll's wakelock pass: the wakeup-source table of 400 kernel sources
// read against its baseline and 200 framework partial wakelock records
// folded into theirs, every source growing between passes.

#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <string>
#include <vector>

#include "handlers/KernelWakelockReader.h"
#include "handlers/PartialWakelockTracker.h"

namespace {

constexpr int kSources = 400;
constexpr int kPartials = 200;

void writeSources(const std::string& path, long long base) {
    std::ofstream out(path, std::ios::trunc);
    out << "name\t\tactive_count\tevent_count\twakeup_count\texpire_count\tactive_since\t"
           "total_time\tmax_time\tlast_change\tprevent_suspend_time\n";
    for (int i = 0; i < kSources; ++i) {
        out << "source_" << i << "\t\t" << base / 1000 << "\t\t0\t\t0\t\t0\t\t0\t\t" << base + i
            << "\t\t0\t\t0\t\t0\n";
    }
}

void BM_WakelockPass(benchmark::State& state) {
    char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
    std::string dir = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
    const std::string path = dir + "/wakeup_sources";
    kelvo::KernelWakelockReader kernel;
    kelvo::PartialWakelockTracker partial(false);
    long long held = 1000;
    double totalMs = 0;
    int64_t passes = 0;
    for (auto _ : state) {
        state.PauseTiming();
        held += 1500;
        writeSources(path, held);
        std::vector<std::string> texts;
        texts.reserve(kPartials);
        for (int i = 0; i < kPartials; ++i) {
            texts.push_back("uid=" + std::to_string(10000 + i) +
                            " prevent_time=" + std::to_string(held) + " ws_name=com.bench.app" +
                            std::to_string(i) + " tag=*job*/sync" + std::to_string(i));
        }
        state.ResumeTiming();
        auto start = std::chrono::steady_clock::now();
        std::vector<kelvo::KernelWakelockReader::increment> k;
        kernel.read(path, &k);
        std::vector<kelvo::PartialWakelockTracker::increment> p;
        partial.update(texts, &p);
        benchmark::DoNotOptimize(k.size() + p.size());
        totalMs +=
            std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
                .count();
        ++passes;
    }
    state.counters["wakelock_pass_ms"] = passes > 0 ? totalMs / passes : 0;
    unlink(path.c_str());
    rmdir(dir.c_str());
}
BENCHMARK(BM_WakelockPass)->Iterations(50)->Unit(benchmark::kMillisecond);

}  // namespace
