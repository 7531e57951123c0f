// Message passing through HandlerThread: asynchronous throughput and the
// round trip of a synchronous request with a reply, next to the floor of a
// hand-over between two threads measured in the same stretch of time.

#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <thread>
#include <string>
#include <vector>

#include <binder/Parcel.h>

#include "ThreadPingPong.h"
#include "utils/HandlerThread.h"
#include "utils/ParcelMessage.h"

using android::Parcel;
using kelvo::HandlerThread;
using kelvo::ParcelMessage;
using Clock = std::chrono::steady_clock;

namespace {

// Reads each body, answers synchronous requests with the sequence number plus
// one, and counts what it handled.
class CountingThread : public HandlerThread {
public:
    CountingThread() : HandlerThread("BenchHandler", 0) {}

    int32_t handleParcelMessage(const ParcelMessage& msg) override {
        const Parcel& body = msg.getParcel();
        int32_t seq = body.readInt32();
        int64_t stamp = body.readInt64();
        mChecksum += static_cast<uint64_t>(seq) ^ static_cast<uint64_t>(stamp);
        if (msg.getReply() != nullptr) {
            msg.getReply()->writeInt32(seq + 1);
        }
        mHandled.fetch_add(1, std::memory_order_release);
        return seq & 0x7fff;
    }

    uint64_t handled() const { return mHandled.load(std::memory_order_acquire); }

private:
    std::atomic<uint64_t> mHandled{0};
    uint64_t mChecksum = 0; // only the handler thread touches it
};

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    size_t n = values.size();
    return n % 2 == 1 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

ParcelMessage makeMessage(int32_t seq, Parcel* reply) {
    Parcel body;
    body.writeInt32(seq);
    body.writeInt64(0x5eed0000LL + seq);
    return ParcelMessage(kelvo::MESSAGE_CUSTOMIZED, 1, body, reply);
}

// Waits until the thread serves requests: a first synchronous round trip.
bool warmUp(CountingThread* thread) {
    Parcel reply;
    return thread->sendMessageSync(makeMessage(0, &reply)) == 0 && reply.readInt32() == 1;
}

void stop(const android::sp<CountingThread>& thread) {
    thread->requestThreadExit();
    thread->join();
}

// One sender, one handler thread. At most `window` messages are in flight:
// the looper's work per message grows with its queue length (its queue is a
// vector shifted on every removal), so an unbounded burst would measure the
// queue rather than the hand-over. The headline figure keeps 64 in flight; a
// second figure shows the cost of a deeper queue.
void BM_HandlerAsyncThroughput(benchmark::State& state) {
    constexpr uint64_t kMessages = 100000;
    const uint64_t kWindow = static_cast<uint64_t>(state.range(0));
    constexpr int kRounds = 5;

    android::sp<CountingThread> thread = new CountingThread();
    if (!warmUp(thread.get())) {
        state.SkipWithError("handler thread did not answer");
        stop(thread);
        return;
    }
    std::vector<double> rates;
    for (auto _ : state) {
        for (int round = 0; round < kRounds; ++round) {
            uint64_t base = thread->handled();
            Clock::time_point start = Clock::now();
            for (uint64_t sent = 0; sent < kMessages; ++sent) {
                while (sent - (thread->handled() - base) >= kWindow) {
                    std::this_thread::yield();
                }
                if (thread->sendMessage(makeMessage(static_cast<int32_t>(sent), nullptr)) < 0) {
                    state.SkipWithError("sendMessage failed");
                    stop(thread);
                    return;
                }
            }
            while (thread->handled() - base < kMessages) {
                std::this_thread::yield();
            }
            double seconds = std::chrono::duration<double>(Clock::now() - start).count();
            rates.push_back(kMessages / seconds);
        }
    }
    stop(thread);
    state.counters[kWindow == 64 ? "handler_async_msgs_per_s"
                                 : "handler_async_msgs_per_s_window" + std::to_string(kWindow)] =
            median(rates);
}
BENCHMARK(BM_HandlerAsyncThroughput)
        ->Arg(64)
        ->Arg(256)
        ->Iterations(1)
        ->UseRealTime()
        ->Unit(benchmark::kMillisecond);

// Blocks of synchronous round trips alternate with blocks of the raw
// ping-pong, so that both medians see the same wake-up latencies (on a
// shared machine they move between runs, and even within one).
void BM_HandlerSyncRoundTrip(benchmark::State& state) {
    constexpr int kRoundTrips = 5000;
    constexpr int kBlock = 250;

    android::sp<CountingThread> thread = new CountingThread();
    ThreadPingPong floor;
    if (!warmUp(thread.get()) || !floor.ok()) {
        state.SkipWithError("handler thread or ping-pong did not answer");
        stop(thread);
        return;
    }
    std::vector<double> micros;
    std::vector<double> floorMicros;
    micros.reserve(kRoundTrips);
    floorMicros.reserve(kRoundTrips);
    for (auto _ : state) {
        for (int i = 1; i <= kRoundTrips; ++i) {
            if (i % kBlock == 1) {
                for (int j = 0; j < kBlock; ++j) {
                    floorMicros.push_back(floor.roundTripUs());
                }
            }
            Parcel reply;
            ParcelMessage msg = makeMessage(i, &reply);
            Clock::time_point start = Clock::now();
            int32_t status = thread->sendMessageSync(msg);
            Clock::time_point end = Clock::now();
            if (status != (i & 0x7fff) || reply.readInt32() != i + 1) {
                state.SkipWithError("wrong status or reply");
                stop(thread);
                return;
            }
            micros.push_back(std::chrono::duration<double, std::micro>(end - start).count());
        }
    }
    stop(thread);
    state.counters["handler_sync_roundtrip_us_p50"] = median(micros);
    state.counters["raw_thread_pingpong_us_p50"] = median(floorMicros);
}
BENCHMARK(BM_HandlerSyncRoundTrip)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);

} // namespace
