// Parcel encoding and decoding of a record mix as the daemon's messages carry
// them: an int32 id, an int64 value and a String8 name of about 24 chars.

#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdio>
#include <vector>

#include <binder/Parcel.h>

using android::Parcel;
using android::String8;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int kRecordsPerParcel = 256;

std::vector<String8> makeNames() {
    std::vector<String8> names;
    for (int i = 0; i < 16; ++i) {
        char text[32];
        snprintf(text, sizeof(text), "component.power_rail_%03d", i * 7);
        names.emplace_back(text);
    }
    return names;
}

void BM_ParcelWriteRead(benchmark::State& state) {
    const std::vector<String8> names = makeNames();
    uint64_t bytes = 0;
    uint64_t check = 0;
    Clock::time_point start = Clock::now();
    for (auto _ : state) {
        Parcel p;
        for (int i = 0; i < kRecordsPerParcel; ++i) {
            p.writeInt32(i);
            p.writeInt64(static_cast<int64_t>(i) * 1000003);
            p.writeString8(names[i % names.size()]);
        }
        p.setDataPosition(0);
        for (int i = 0; i < kRecordsPerParcel; ++i) {
            check += static_cast<uint64_t>(p.readInt32());
            check += static_cast<uint64_t>(p.readInt64());
            check += p.readString8().size();
        }
        bytes += p.dataSize();
    }
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    benchmark::DoNotOptimize(check);
    // Each byte is written once and read once.
    state.counters["parcel_rw_mb_per_s"] = bytes / seconds / 1e6;
}
BENCHMARK(BM_ParcelWriteRead)->MinTime(1.0)->UseRealTime();

} // namespace
