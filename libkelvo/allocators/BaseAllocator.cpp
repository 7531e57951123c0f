#include "allocators/BaseAllocator.h"

#include "LibKelvoLog.h"

namespace kelvo {

BaseAllocator::BaseAllocator(DataAccounter* owner) : mOwner(owner), mLastTimestamp(0) {}

BaseAllocator::~BaseAllocator() = default;

void BaseAllocator::updateElement(int64_t timestamp) {}

int32_t BaseAllocator::addElement(const android::String8& name, int64_t timestamp) {
    LLOGI("Please implement this function in subclass");
    return 0;
}

int32_t BaseAllocator::removeElement(const android::String8& name, int64_t timestamp) {
    LLOGI("Please implement this function in subclass");
    return 0;
}

int32_t BaseAllocator::removeAllElements(int64_t timestamp) {
    LLOGI("Please implement this function in subclass");
    return 0;
}

int32_t BaseAllocator::balanceAccounting(int64_t end, int64_t newStart, int32_t key) {
    LLOGI("Please implement this function in subclass");
    return 0;
}

int32_t BaseAllocator::setPowerValue(const android::Parcel& action, const android::Parcel& power) {
    int64_t timestamp = 0;
    if (power.readInt64(&timestamp) != android::NO_ERROR) {
        LLOGE("Invalid power value");
        return -1;
    }
    updateElement(timestamp);
    size_t start = power.dataPosition();
    size_t length = power.dataSize() > start ? power.dataSize() - start : 0;
    mPowerValue.setDataSize(0);
    mPowerValue.setDataPosition(0);
    if (mPowerValue.appendFrom(&power, start, length) != android::NO_ERROR) {
        LLOGE("Failed to keep power value");
        mPowerValue.setDataSize(0);
        mPowerValue.setDataPosition(0);
        return -1;
    }
    mPowerValue.setDataPosition(0);
    return 0;
}

void BaseAllocator::updateLastTimestamp(int64_t end, int64_t newStart) {
    if (end == newStart && mLastTimestamp >= end) {
        return;
    }
    mLastTimestamp = newStart;
}

} // namespace kelvo
