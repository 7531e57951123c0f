#pragma once

// Small accounters, a recording listener and parcel builders for driving the
// accounting library through its entry functions.

#include <stdint.h>

#include <initializer_list>
#include <memory>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>
#include <utils/StrongPointer.h>

#include "AccounterTypes.h"
#include "KelvoLibEntry.h"
#include "LibraryListener.h"
#include "accounters/DataAccounter.h"
#include "allocators/AccounterData.h"
#include "allocators/SharedAllocator.h"
#include "allocators/SoleAllocator.h"
#include "allocators/TrafficAllocator.h"
#include "allocators/WeightAllocator.h"
#include "core/KelvoLibAgent.h"

namespace kelvo {
namespace test {

using Bytes = std::vector<uint8_t>;

inline Bytes bytesOf(const android::Parcel& p) {
    return Bytes(p.data(), p.data() + p.dataSize());
}

// The key for which the test accounters have no allocator.
constexpr int32_t kKeyWithoutAllocator = 99;

// Allocator key fields: int32 key (remembered for prepareReply). SetValue
// fields: int64 time, int32 power.
template <typename Allocator>
class KeyedTestAccounter : public DataAccounter {
public:
    void prepareReply(android::Parcel& reply) override { reply.writeInt32(mLastKey); }

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override {
        if (key == kKeyWithoutAllocator) {
            return nullptr;
        }
        return std::make_unique<Allocator>(this);
    }

    int32_t getAllocatorKey(const android::Parcel& action) override {
        mLastKey = action.readInt32();
        return mLastKey;
    }

    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override {
        int64_t timestamp = 0;
        int32_t value = 0;
        if (action.readInt64(&timestamp) != android::NO_ERROR ||
            action.readInt32(&value) != android::NO_ERROR) {
            return -1;
        }
        power.writeInt64(timestamp);
        power.writeInt32(value);
        return 0;
    }

private:
    int32_t mLastKey = 0;
};

// A traffic usage: int64 bytes per entry, energy bytes * P / 1000 where P is
// the int32 power description.
struct test_traffic_data {
    int64_t bytes = 0;
    int32_t power = 0;

    int32_t fillContent(const android::Parcel& description) {
        return description.readInt32(&power) == android::NO_ERROR ? 0 : -1;
    }
    int32_t calculateEnergy(const android::Parcel& action, int64_t* energy) {
        if (action.readInt64(&bytes) != android::NO_ERROR) {
            return -1;
        }
        *energy = bytes * power / 1000;
        return 0;
    }
    test_traffic_data& operator+=(const test_traffic_data& other) {
        bytes += other.bytes;
        return *this;
    }
    void writeToParcel(android::Parcel& out) const { out.writeInt64(bytes); }
};

// SetValue fields: int32 key, int32 power, then the traffic batch.
class TrafficTestAccounter : public DataAccounter {
protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override {
        return std::make_unique<TrafficAllocator<test_traffic_data>>(this);
    }
    int32_t getAllocatorKey(const android::Parcel& action) override { return action.readInt32(); }
    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override {
        power.writeInt32(action.readInt32());
        return 0;
    }
};

// SetValue fields: int64 start, int64 end, int32 component usage, int64
// component energy, then the application batch.
class WeightTestAccounter : public DataAccounter {
protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override {
        return std::make_unique<WeightAllocator>(this);
    }
    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override {
        power.writeBool(true);
        power.writeInt64(action.readInt64());
        power.writeInt64(action.readInt64());
        power.writeInt32(action.readInt32());
        power.writeInt64(action.readInt64());
        return 0;
    }
};

// Sole and shared accounters of the tests, with their types.
using SoleTestAccounter = KeyedTestAccounter<SoleAllocator<accounter_data>>;
using SharedTestAccounter = KeyedTestAccounter<SharedAllocator<accounter_data>>;
using SensorTestAccounter = KeyedTestAccounter<SharedAllocator<sensor_accounter_data>>;
constexpr int32_t kSole = ACCOUNTER_FLASHLIGHT;
constexpr int32_t kShared = ACCOUNTER_GNSS;
constexpr int32_t kSensor = ACCOUNTER_SENSOR;
constexpr int32_t kTraffic = ACCOUNTER_WIFI;
constexpr int32_t kWeight = ACCOUNTER_CPU;

// Starts every test from an empty accounter table with the test accounters
// installed, and leaves it empty.
class LibraryFixture {
public:
    LibraryFixture() {
        KelvoLibAgent* agent = KelvoLibAgent::getInstance();
        agent->resetAccountersForTest();
        agent->setAccounterFactoryForTest(kSole,
                                          [] { return std::make_unique<SoleTestAccounter>(); });
        agent->setAccounterFactoryForTest(kShared,
                                          [] { return std::make_unique<SharedTestAccounter>(); });
        agent->setAccounterFactoryForTest(kSensor,
                                          [] { return std::make_unique<SensorTestAccounter>(); });
        agent->setAccounterFactoryForTest(kTraffic,
                                          [] { return std::make_unique<TrafficTestAccounter>(); });
        agent->setAccounterFactoryForTest(kWeight,
                                          [] { return std::make_unique<WeightTestAccounter>(); });
    }
    ~LibraryFixture() { KelvoLibAgent::getInstance()->resetAccountersForTest(); }
};

struct Reply {
    int32_t event;
    Bytes bytes;
};

// Keeps every reply; refuses (-1) those whose first int32 is refusedPrefix.
class RecordingListener : public LibraryListener {
public:
    int32_t handleLibraryEvent(int32_t event, const android::Parcel& reply) override {
        mPosition.push_back(reply.dataPosition());
        mReplies.push_back({event, bytesOf(reply)});
        if (mRefuse && reply.dataSize() >= 4 && reply.readInt32() == mRefusedPrefix) {
            return -1;
        }
        return 0;
    }
    void refuse(int32_t prefix) {
        mRefuse = true;
        mRefusedPrefix = prefix;
    }

    std::vector<Reply> mReplies;
    std::vector<size_t> mPosition; // where each reply stood when it arrived

private:
    bool mRefuse = false;
    int32_t mRefusedPrefix = 0;
};

// The six buckets of an expected record; usage in the unit of the record.
struct Buckets {
    int64_t usage[BUCKET_COUNT] = {};
    int64_t energy[BUCKET_COUNT] = {};
    Buckets& set(int32_t bucket, int64_t u, int64_t e) {
        usage[bucket] = u;
        energy[bucket] = e;
        return *this;
    }
};

// A parcel written field by field: an action (int32 type, int32 action, then
// its fields) or an expected reply.
class Fields {
public:
    Fields() : mParcel(std::make_unique<android::Parcel>()) {}
    Fields(int32_t type, int32_t action) : Fields() { i32(type).i32(action); }
    Fields& i32(int32_t v) { return put(mParcel->writeInt32(v)); }
    Fields& i64(int64_t v) { return put(mParcel->writeInt64(v)); }
    Fields& str(const char* v) { return put(mParcel->writeString8(android::String8(v))); }
    Fields& flag(bool v) { return put(mParcel->writeBool(v)); }
    // Usage and energy per bucket; usage is int32 in timed records, int64
    // in traffic records.
    Fields& buckets(const Buckets& b, bool wideUsage = false) {
        for (int32_t i = 0; i < BUCKET_COUNT; ++i) {
            wideUsage ? i64(b.usage[i]) : i32(static_cast<int32_t>(b.usage[i]));
            i64(b.energy[i]);
        }
        return *this;
    }
    int32_t send() const { return setDataAccounter(*mParcel); }
    const android::Parcel& parcel() const { return *mParcel; }
    Bytes bytes() const { return bytesOf(*mParcel); }

private:
    Fields& put(android::status_t) { return *this; }
    std::unique_ptr<android::Parcel> mParcel; // parcels do not copy; builders move
};

// The actions of the keyed test accounters.
inline int32_t setPower(int32_t type, int32_t key, int64_t time, int32_t power) {
    return Fields(type, ACTION_SET_VALUE).i32(key).i64(time).i32(power).send();
}
inline int32_t activate(int32_t type, int32_t key, int64_t time, const char* name) {
    return Fields(type, ACTION_ACTIVATE).i32(key).i64(time).str(name).send();
}
inline int32_t deactivate(int32_t type, int32_t key, int64_t time, const char* name) {
    return Fields(type, ACTION_DEACTIVATE).i32(key).i64(time).str(name).send();
}
inline int32_t balanceAt(int32_t type, int64_t time) {
    return Fields(type, ACTION_BALANCE).i32(BALANCE_AT).i64(time).send();
}

// Expected replies of timed allocators: an element's record names it.
inline Bytes elementReply(int32_t prefix, int64_t start, int64_t end, const char* name,
                          const Buckets& b) {
    return Fields().i32(prefix).i64(start).i64(end).str(name).buckets(b).bytes();
}
inline Bytes componentReply(int32_t prefix, int64_t start, int64_t end, const Buckets& b) {
    return Fields().i32(prefix).i64(start).i64(end).buckets(b).bytes();
}

// Discharging with the screen on, no foreground: background and screen_on.
inline Buckets screenOnBackground(int64_t usage, int64_t energy) {
    return Buckets().set(BUCKET_BACKGROUND, usage, energy).set(BUCKET_SCREEN_ON, usage, energy);
}
inline Buckets screenOnForeground(int64_t usage, int64_t energy) {
    return Buckets().set(BUCKET_FOREGROUND, usage, energy).set(BUCKET_SCREEN_ON, usage, energy);
}
// Two states of one record, bucket by bucket.
inline Buckets operator+(Buckets a, const Buckets& b) {
    for (int32_t i = 0; i < BUCKET_COUNT; ++i) {
        a.set(i, a.usage[i] + b.usage[i], a.energy[i] + b.energy[i]);
    }
    return a;
}

// The bytes of the listener's replies from index `from` on.
inline std::vector<Bytes> replyBytes(const RecordingListener& listener, size_t from = 0) {
    std::vector<Bytes> out;
    for (size_t i = from; i < listener.mReplies.size(); ++i) {
        out.push_back(listener.mReplies[i].bytes);
    }
    return out;
}

inline android::sp<RecordingListener> listenTo(int32_t type) {
    android::sp<RecordingListener> listener = new RecordingListener();
    registerLibraryListener(type, listener);
    return listener;
}

} // namespace test
} // namespace kelvo
