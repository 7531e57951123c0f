#pragma once

#include <stdint.h>

#include <map>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "AccounterTypes.h"
#include "LibKelvoLog.h"
#include "accounters/DataAccounter.h"
#include "allocators/AccounterData.h"
#include "allocators/BaseAllocator.h"

namespace kelvo {

// Most entries one traffic batch may carry.
constexpr int32_t kMaxTrafficEntries = 5000;

// Usage and energy arrive per application in batches (Wi-Fi and modem
// traffic); there is no timing between balances. The usage type T provides:
//   int32_t fillContent(const Parcel& power)  takes what it needs from the
//       power description (read from its start); negative when unusable
//   int32_t calculateEnergy(const Parcel& action, int64_t* energy)  reads one
//       entry's counters from the batch and gives their energy; negative when
//       the batch ends inside them
//   T& operator+=(const T&), void writeToParcel(Parcel&) const
template <typename T>
class TrafficAllocator : public BaseAllocator {
public:
    explicit TrafficAllocator(DataAccounter* owner) : BaseAllocator(owner) {}

    // action: int64 time, int32 count, then per entry String8 name, int32
    // foreground flag (1: foreground) and T's counters. A count above
    // kMaxTrafficEntries refuses the batch; reading stops at the end of the
    // data, so a count larger than the data adds no entry that is not there
    // (the complete entries are kept and the batch reports -1).
    int32_t setPowerValue(const android::Parcel& action, const android::Parcel& power) override {
        int64_t timestamp = 0;
        int32_t count = 0;
        if (action.readInt64(&timestamp) != android::NO_ERROR ||
            action.readInt32(&count) != android::NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
        if (count > kMaxTrafficEntries) {
            LLOGE("Invalid traffic data count(%d)", count);
            return -1;
        }
        const bool screenOn = mOwner->getScreenState();
        const bool chargerOnline = mOwner->getChargerState();
        for (int32_t i = 0; i < count; ++i) {
            android::String8 name;
            int32_t foregroundFlag = 0;
            if (action.readString8(&name) != android::NO_ERROR ||
                action.readInt32(&foregroundFlag) != android::NO_ERROR) {
                LLOGE("Traffic data ends after %d of %d entries", i, count);
                return -1;
            }
            T usage;
            power.setDataPosition(0);
            if (usage.fillContent(power) < 0) {
                LLOGE("Invalid power value");
                return -1;
            }
            int64_t energy = 0;
            if (usage.calculateEnergy(action, &energy) < 0) {
                LLOGE("Traffic data ends after %d of %d entries", i, count);
                return -1;
            }
            mElements[name].account(usage, energy, foregroundFlag == 1, screenOn, chargerOnline);
        }
        return 0;
    }

    // Reply: int32 key, int32 count, then per element in name order a record
    // from the previous balance to end. No component record.
    int32_t balanceAccounting(int64_t end, int64_t newStart, int32_t key) override {
        android::Parcel reply;
        reply.writeInt32(key);
        reply.writeInt32(static_cast<int32_t>(mElements.size()));
        for (const auto& entry : mElements) {
            reply.writeInt64(mLastTimestamp);
            reply.writeInt64(end);
            reply.writeString8(entry.first);
            entry.second.writeBuckets(reply);
        }
        updateLastTimestamp(end, newStart);
        mElements.clear();
        return mOwner->sendReply(LIBRARY_EVENT_APPLICATION, reply);
    }

private:
    std::map<android::String8, element_data<T>> mElements; // by name, the reply order
};

} // namespace kelvo
