// The host binder transport between two processes: the median round trip
// of a small two-way transaction, next to the floors of a socket round trip
// between two threads and between two processes measured in the same
// stretch of time, and the rate of one-way calls a service takes in. The
// service runs in a forked child on a private root.

#include <benchmark/benchmark.h>
#include <binder/Binder.h>
#include <binder/IServiceManager.h>
#include <binder/Parcel.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "SocketEcho.h"
#include "kelvo/RootPath.h"

using android::IBinder;
using android::Parcel;
using android::sp;
using android::String16;
using Clock = std::chrono::steady_clock;

namespace {

enum : uint32_t {
    kEcho = IBinder::FIRST_CALL_TRANSACTION,  // int32, int64 -> int32
    kNote,                                    // int32 (one-way)
    kNoted,                                   // -> int32 calls noted so far
};

class BenchService : public android::BBinder {
protected:
    android::status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply,
                                 uint32_t flags) override {
        switch (code) {
            case kEcho:
                reply->writeInt32(data.readInt32() + 1);
                return android::NO_ERROR;
            case kNote:
                mNoted++;
                return android::NO_ERROR;
            case kNoted:
                reply->writeInt32(mNoted.load());
                return android::NO_ERROR;
            default:
                return BBinder::onTransact(code, data, reply, flags);
        }
    }

private:
    std::atomic<int32_t> mNoted{0};
};

// A child process serving the bench service on a root of its own.
class RemoteService {
public:
    RemoteService() {
        char tmpl[] = "/tmp/kelvo-bench-XXXXXX";
        mRoot = mkdtemp(tmpl) != nullptr ? tmpl : "/tmp";
        kelvo::RootPath::setRoot(mRoot.c_str());
        mPid = fork();
        if (mPid == 0) {
            android::defaultServiceManager()->addService(String16("bench"), new BenchService());
            for (;;) {
                pause();
            }
        }
        mService = android::defaultServiceManager()->getService(String16("bench"));
    }
    ~RemoteService() {
        mService.clear();
        if (mPid > 0) {
            kill(mPid, SIGKILL);
            waitpid(mPid, nullptr, 0);
        }
        std::string cmd = "rm -rf '" + mRoot + "'";
        if (mRoot.rfind("/tmp/kelvo-bench-", 0) == 0) {
            int ignored = system(cmd.c_str());
            (void)ignored;
        }
        kelvo::RootPath::setRoot("");
    }
    const sp<IBinder>& service() const { return mService; }

private:
    std::string mRoot;
    pid_t mPid = -1;
    sp<IBinder> mService;
};

double median(std::vector<double>* values) {
    std::nth_element(values->begin(), values->begin() + values->size() / 2, values->end());
    return (*values)[values->size() / 2];
}

void BM_BinderRoundTrip(benchmark::State& state) {
    RemoteService remote;
    if (remote.service() == nullptr) {
        state.SkipWithError("no bench service");
        return;
    }
    SocketEcho threadFloor(false);
    SocketEcho processFloor(true);
    if (!threadFloor.ok() || !processFloor.ok()) {
        state.SkipWithError("no socket floor");
        return;
    }
    constexpr int kWarmUp = 500;
    constexpr int kCalls = 20000;
    // Blocks of calls alternate with blocks of socket round trips, so that
    // all medians see the same wake-up latencies.
    constexpr int kBlock = 500;
    std::vector<double> micros;
    std::vector<double> threadMicros;
    std::vector<double> processMicros;
    micros.reserve(kCalls);
    for (auto _ : state) {
        for (int i = 0; i < kWarmUp + kCalls; ++i) {
            if (i >= kWarmUp && (i - kWarmUp) % kBlock == 0) {
                for (int j = 0; j < kBlock; ++j) {
                    threadMicros.push_back(threadFloor.roundTripUs());
                    processMicros.push_back(processFloor.roundTripUs());
                }
            }
            Parcel data;
            Parcel reply;
            data.writeInt32(i);
            data.writeInt64(i);
            Clock::time_point start = Clock::now();
            android::status_t err = remote.service()->transact(kEcho, data, &reply);
            double us = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
            if (err != android::NO_ERROR || reply.readInt32() != i + 1) {
                state.SkipWithError("round trip failed");
                return;
            }
            if (i >= kWarmUp) {
                micros.push_back(us);
            }
        }
    }
    for (const std::vector<double>* floor : {&threadMicros, &processMicros}) {
        if (*std::min_element(floor->begin(), floor->end()) < 0) {
            state.SkipWithError("socket round trip failed");
            return;
        }
    }
    state.counters["binder_roundtrip_us_p50"] = median(&micros);
    state.counters["raw_unix_socket_roundtrip_us_p50"] = median(&threadMicros);
    state.counters["raw_unix_socket_process_roundtrip_us_p50"] = median(&processMicros);
}
BENCHMARK(BM_BinderRoundTrip)->Iterations(1)->UseRealTime();

void BM_BinderOneway(benchmark::State& state) {
    RemoteService remote;
    if (remote.service() == nullptr) {
        state.SkipWithError("no bench service");
        return;
    }
    constexpr int kCalls = 50000;
    double seconds = 0;
    for (auto _ : state) {
        Clock::time_point start = Clock::now();
        for (int i = 0; i < kCalls; ++i) {
            Parcel data;
            data.writeInt32(i);
            if (remote.service()->transact(kNote, data, nullptr, IBinder::FLAG_ONEWAY) !=
                android::NO_ERROR) {
                state.SkipWithError("one-way call failed");
                return;
            }
        }
        // Counted once the service has taken every call in.
        int32_t noted = 0;
        Clock::time_point deadline = Clock::now() + std::chrono::seconds(60);
        while (noted < kCalls && Clock::now() < deadline) {
            Parcel data;
            Parcel reply;
            remote.service()->transact(kNoted, data, &reply);
            noted = reply.readInt32();
            if (noted < kCalls) {
                std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
        }
        if (noted < kCalls) {
            state.SkipWithError("one-way calls lost");
            return;
        }
        seconds = std::chrono::duration<double>(Clock::now() - start).count();
    }
    state.counters["binder_oneway_per_s"] = kCalls / seconds;
}
BENCHMARK(BM_BinderOneway)->Iterations(1)->UseRealTime();

} // namespace
