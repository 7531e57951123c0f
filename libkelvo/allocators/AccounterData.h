#pragma once

// Usage types of the allocators and the record every allocator keeps per
// element: six (usage, energy) buckets.
//
// A usage type T of the timed allocators (SoleAllocator, SharedAllocator)
// provides:
//   void setInterval(int64_t start, int64_t end)   the usage of one interval
//   int64_t calculateEnergy(const Parcel& power)  the energy of that usage
//                                                  under the power description
//   T& operator+=(const T&)                        saturating sum
//   T operator-(const T&) const                    difference, never below 0
//   T portion(int64_t k, int64_t n) const          this * k / n, 0 when n is 0
//   void writeToParcel(Parcel&) const
// The usage types of TrafficAllocator are described there.

#include <stdint.h>
#include <string.h>

#include <limits>

#include <binder/Parcel.h>
#include <utils/String8.h>

namespace kelvo {

// The six buckets of a record, in reply order. Discharging time counts in a
// foreground/background bucket and in a screen bucket; charging time only in
// one of the last two.
enum accounting_bucket : int32_t {
    BUCKET_FOREGROUND = 0,
    BUCKET_BACKGROUND = 1,
    BUCKET_SCREEN_ON = 2,
    BUCKET_SCREEN_OFF = 3,
    BUCKET_CHARGE_FOREGROUND = 4,
    BUCKET_CHARGE_BACKGROUND = 5,
    BUCKET_COUNT = 6,
};

// The length of [start, end] as an int32 duration: computed in 64 bits,
// never negative, at most INT32_MAX.
inline int32_t clampDuration(int64_t start, int64_t end) {
    if (end <= start) {
        return 0;
    }
    // end > start, so the unsigned difference is exact.
    uint64_t diff = static_cast<uint64_t>(end) - static_cast<uint64_t>(start);
    constexpr uint64_t kMax = static_cast<uint64_t>(std::numeric_limits<int32_t>::max());
    return static_cast<int32_t>(diff > kMax ? kMax : diff);
}

inline int32_t addSaturated(int32_t a, int32_t b) {
    int64_t sum = static_cast<int64_t>(a) + b;
    if (sum > std::numeric_limits<int32_t>::max()) {
        return std::numeric_limits<int32_t>::max();
    }
    if (sum < std::numeric_limits<int32_t>::min()) {
        return std::numeric_limits<int32_t>::min();
    }
    return static_cast<int32_t>(sum);
}

inline int64_t addSaturated(int64_t a, int64_t b) {
    int64_t sum = 0;
    if (__builtin_add_overflow(a, b, &sum)) {
        return b > 0 ? std::numeric_limits<int64_t>::max() : std::numeric_limits<int64_t>::min();
    }
    return sum;
}

// value * k / n truncated toward zero, without forming the product: value is
// split into quotient and remainder by n first. 0 when n is not positive.
// Callers pass 0 <= k <= n.
inline int64_t scaleValue(int64_t value, int64_t k, int64_t n) {
    if (n <= 0) {
        return 0;
    }
    return (value / n) * k + (value % n) * k / n;
}

// True when the element counts as the foreground application: a foreground is
// known and the element's name contains it (a process of the foreground
// package counts too). With no foreground known, nothing is foreground.
inline bool isForegroundName(const android::String8& name, const android::String8& foreground) {
    return foreground.size() > 0 && strstr(name.c_str(), foreground.c_str()) != nullptr;
}

// Usage measured in time: an int32 duration in ms. The energy of an interval
// is duration * P / kDivisor, P being the int32 at the start of the power
// description.
template <int64_t kDivisor>
struct timed_accounter_data {
    int32_t duration = 0;

    void setInterval(int64_t start, int64_t end) { duration = clampDuration(start, end); }

    int64_t calculateEnergy(const android::Parcel& power) const {
        if (duration == 0) {
            return 0;
        }
        power.setDataPosition(0);
        int64_t powerValue = power.readInt32();
        return static_cast<int64_t>(duration) * powerValue / kDivisor;
    }

    timed_accounter_data& operator+=(const timed_accounter_data& other) {
        duration = addSaturated(duration, other.duration);
        return *this;
    }

    timed_accounter_data operator-(const timed_accounter_data& other) const {
        timed_accounter_data result;
        int64_t diff = static_cast<int64_t>(duration) - other.duration;
        result.duration = diff > 0 ? static_cast<int32_t>(diff) : 0;
        return result;
    }

    timed_accounter_data portion(int64_t k, int64_t n) const {
        timed_accounter_data result;
        result.duration = static_cast<int32_t>(scaleValue(duration, k, n));
        return result;
    }

    void writeToParcel(android::Parcel& out) const { out.writeInt32(duration); }
};

// Components charged by time at a power per second (energy / 1000).
using accounter_data = timed_accounter_data<1000>;
// Sensors: their powers carry one more decimal (energy / 10000).
using sensor_accounter_data = timed_accounter_data<10000>;

// GPU usage: the interval's duration and the busy time of the batch it
// charges. A batch (the power description: int32 count, then per frequency
// step int32 power, int64 busy ms, int64 idle ms) is charged by the first
// accounting step of zero length, which is the step the GPU handler takes at
// the time of its reading; the step marks the batch consumed (count 0), so a
// second step at the same time charges nothing. A step over time charges
// nothing and consumes the batch as well: the reading belonged to its own
// time.
struct gpu_accounter_data {
    int32_t duration = 0;
    int64_t busy = 0;

    void setInterval(int64_t start, int64_t end) { duration = clampDuration(start, end); }

    int64_t calculateEnergy(android::Parcel& power) {
        busy = 0;
        power.setDataPosition(0);
        int32_t count = 0;
        if (power.readInt32(&count) != android::NO_ERROR || count <= 0) {
            return 0;
        }
        int64_t energy = 0;
        if (duration == 0) {
            for (int32_t i = 0; i < count; ++i) {
                int32_t stepPower = 0;
                int64_t stepBusy = 0;
                int64_t stepIdle = 0;
                if (power.readInt32(&stepPower) != android::NO_ERROR ||
                    power.readInt64(&stepBusy) != android::NO_ERROR ||
                    power.readInt64(&stepIdle) != android::NO_ERROR) {
                    break;
                }
                if (stepBusy < 1) {
                    continue;
                }
                busy = addSaturated(busy, stepBusy);
                int64_t product = 0;
                if (__builtin_mul_overflow(stepBusy, static_cast<int64_t>(stepPower), &product)) {
                    product = stepPower < 0 ? std::numeric_limits<int64_t>::min()
                                            : std::numeric_limits<int64_t>::max();
                }
                energy = addSaturated(energy, product);
            }
        }
        power.setDataPosition(0);
        power.writeInt32(0);
        power.setDataPosition(0);
        return energy / 1000;
    }

    gpu_accounter_data& operator+=(const gpu_accounter_data& other) {
        duration = addSaturated(duration, other.duration);
        busy = addSaturated(busy, other.busy);
        return *this;
    }

    void writeToParcel(android::Parcel& out) const {
        out.writeInt32(duration);
        out.writeInt64(busy);
    }
};

// CPU time of one application, given per batch; its energy comes from the
// weight split of WeightAllocator.
struct cpu_accounter_data {
    int32_t cpuTime = 0;

    cpu_accounter_data& operator+=(const cpu_accounter_data& other) {
        cpuTime = addSaturated(cpuTime, other.cpuTime);
        return *this;
    }

    void writeToParcel(android::Parcel& out) const { out.writeInt32(cpuTime); }
};

// One record: where it started and its six buckets.
template <typename T>
struct element_data {
    int64_t start = 0;
    T usage[BUCKET_COUNT] = {};
    int64_t energy[BUCKET_COUNT] = {};

    void add(int32_t bucket, const T& u, int64_t e) {
        usage[bucket] += u;
        energy[bucket] = addSaturated(energy[bucket], e);
    }

    // Sorts one interval into its buckets by the state that held during it.
    void account(const T& u, int64_t e, bool foreground, bool screenOn, bool chargerOnline) {
        if (chargerOnline) {
            add(foreground ? BUCKET_CHARGE_FOREGROUND : BUCKET_CHARGE_BACKGROUND, u, e);
            return;
        }
        add(foreground ? BUCKET_FOREGROUND : BUCKET_BACKGROUND, u, e);
        add(screenOn ? BUCKET_SCREEN_ON : BUCKET_SCREEN_OFF, u, e);
    }

    void clearBuckets() {
        for (int32_t i = 0; i < BUCKET_COUNT; ++i) {
            usage[i] = T();
            energy[i] = 0;
        }
    }

    void writeBuckets(android::Parcel& out) const {
        for (int32_t i = 0; i < BUCKET_COUNT; ++i) {
            usage[i].writeToParcel(out);
            out.writeInt64(energy[i]);
        }
    }

    // An element record: start, end, name, buckets.
    void writeRecord(android::Parcel& out, int64_t end, const android::String8& name) const {
        out.writeInt64(start);
        out.writeInt64(end);
        out.writeString8(name);
        writeBuckets(out);
    }

    // A component record: as an element record without the name.
    void writeComponentRecord(android::Parcel& out, int64_t end) const {
        out.writeInt64(start);
        out.writeInt64(end);
        writeBuckets(out);
    }
};

} // namespace kelvo
