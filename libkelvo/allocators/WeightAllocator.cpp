#include "allocators/WeightAllocator.h"

#include <math.h>

#include "AccounterTypes.h"
#include "LibKelvoLog.h"
#include "accounters/DataAccounter.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

// usage / total * energy in single precision, rounded half away from zero and
// kept inside the int64 range.
int64_t weightedEnergy(int32_t usage, int64_t totalUsage, int64_t totalEnergy) {
    float weighted = static_cast<float>(usage) / static_cast<float>(totalUsage) *
                     static_cast<float>(totalEnergy);
    double rounded = round(static_cast<double>(weighted));
    if (rounded >= 9223372036854775808.0) {
        return INT64_MAX;
    }
    if (rounded < -9223372036854775808.0) {
        return INT64_MIN;
    }
    return static_cast<int64_t>(rounded);
}

} // namespace

WeightAllocator::WeightAllocator(DataAccounter* owner)
    : BaseAllocator(owner),
      mForegroundUsage(0),
      mForegroundEnergy(0),
      mTotalUsage(0),
      mTotalEnergy(0) {}

int32_t WeightAllocator::setPowerValue(const Parcel& action, const Parcel& power) {
    bool hasData = false;
    if (power.readBool(&hasData) != NO_ERROR || !hasData) {
        return 0;
    }
    int64_t start = 0;
    int64_t end = 0;
    int32_t totalUsage = 0;
    int64_t totalEnergy = 0;
    if (power.readInt64(&start) != NO_ERROR || power.readInt64(&end) != NO_ERROR ||
        power.readInt32(&totalUsage) != NO_ERROR || power.readInt64(&totalEnergy) != NO_ERROR) {
        LLOGE("Invalid power value");
        return -1;
    }
    Parcel applications;
    int32_t status = getApplicationData(action, start, end, totalEnergy, applications);
    if (status < 0) {
        LLOGE("Failed to get cpu application data");
        return -1;
    }
    mTotalUsage = totalUsage;
    mTotalEnergy = totalEnergy;

    Parcel component;
    component.writeInt64(start);
    component.writeInt64(end);
    component.writeInt32(mForegroundUsage);
    component.writeInt64(mForegroundEnergy);
    component.writeInt32(mTotalUsage);
    component.writeInt64(mTotalEnergy);
    component.writeBool(mOwner->getScreenState());
    component.writeBool(mOwner->getChargerState());
    int32_t result = status == 0 ? 0 : -1;
    if (mOwner->sendReply(LIBRARY_EVENT_COMPONENT, component) < 0) {
        result = -1;
    }
    if (mOwner->sendReply(LIBRARY_EVENT_APPLICATION, applications) < 0) {
        result = -1;
    }
    return result;
}

int32_t WeightAllocator::getApplicationData(const Parcel& action, int64_t start, int64_t end,
                                            int64_t totalEnergy, Parcel& reply) {
    mForegroundUsage = 0;
    mForegroundEnergy = 0;
    // An empty batch (not even the total) is an interval without applications.
    int64_t totalApplicationUsage = 0;
    action.readInt64(&totalApplicationUsage);
    if (totalApplicationUsage < 1 && action.dataAvail() > 0) {
        LLOGE("Invalid total application usage");
        return -1;
    }
    const String8 foreground = mOwner->getForeground();
    const bool screenOn = mOwner->getScreenState();
    const bool chargerOnline = mOwner->getChargerState();
    while (action.dataAvail() > 0) {
        int32_t uid = 0;
        String8 name;
        cpu_accounter_data usage;
        if (action.readInt32(&uid) != NO_ERROR || action.readString8(&name) != NO_ERROR ||
            action.readInt32(&usage.cpuTime) != NO_ERROR) {
            LLOGE("Cpu application data ends inside an application");
            return 1;
        }
        int64_t energy = weightedEnergy(usage.cpuTime, totalApplicationUsage, totalEnergy);
        bool foregroundApplication = isForegroundName(name, foreground);
        element_data<cpu_accounter_data> record;
        record.start = start;
        record.account(usage, energy, foregroundApplication, screenOn, chargerOnline);
        reply.writeInt32(uid);
        record.writeRecord(reply, end, name);
        if (foregroundApplication) {
            mForegroundUsage = addSaturated(mForegroundUsage, usage.cpuTime);
            mForegroundEnergy = addSaturated(mForegroundEnergy, energy);
        }
    }
    return 0;
}

} // namespace kelvo
