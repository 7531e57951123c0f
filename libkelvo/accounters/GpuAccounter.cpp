#include "accounters/GpuAccounter.h"

#include <vector>

#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SoleAllocator.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

// int64 frequency, int64 busy, int64 idle.
constexpr size_t kEntrySize = 3 * sizeof(int64_t);
constexpr int64_t kHertzPerMegahertz = 1000000;
constexpr int32_t kGpuKey = 0;

struct gpu_entry {
    int64_t hertz;
    int64_t busy;
    int64_t idle;
};

// Hz to MHz, rounded to the nearest (halves away from zero).
int64_t toMegahertz(int64_t hertz) {
    const int64_t whole = hertz / kHertzPerMegahertz;
    const int64_t rest = hertz % kHertzPerMegahertz;
    if (rest >= kHertzPerMegahertz / 2) {
        return whole + 1;
    }
    if (rest <= -kHertzPerMegahertz / 2) {
        return whole - 1;
    }
    return whole;
}

} // namespace

GpuAccounter::GpuAccounter() {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_GPU, -1, true, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        for (const config_value& value : parameter.values) {
            mPowers.emplace(value.key, value.value); // the first of a key stays
        }
    }
}

std::unique_ptr<BaseAllocator> GpuAccounter::createAllocators(int32_t key) {
    return std::make_unique<SoleAllocator<gpu_accounter_data>>(this);
}

int32_t GpuAccounter::frequencyPower(int64_t hertz) const {
    const int64_t megahertz = toMegahertz(hertz);
    bool exact = false;
    int32_t power = PowerProfile::nearestPower(mPowers, megahertz, &exact);
    if (!exact && !mPowers.empty()) {
        LLOGI("Invalid gpu frequency: %lld, find best power", static_cast<long long>(megahertz));
    }
    return power;
}

int32_t GpuAccounter::getPowerValue(int32_t key, const Parcel& action, Parcel& power) {
    int64_t timestamp = 0;
    bool chargerOnline = false;
    int32_t count = 0;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readBool(&chargerOnline) != NO_ERROR ||
        action.readInt32(&count) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (count < 0 || static_cast<size_t>(count) > action.dataAvail() / kEntrySize) {
        LLOGE("Invalid gpu count: %d, data left: %zu", count, action.dataAvail());
        return -1;
    }
    std::vector<gpu_entry> entries(count);
    for (gpu_entry& entry : entries) {
        if (action.readInt64(&entry.hertz) != NO_ERROR ||
            action.readInt64(&entry.busy) != NO_ERROR || action.readInt64(&entry.idle) != NO_ERROR) {
            return -1;
        }
    }
    mChargerOnline = chargerOnline;
    power.writeInt64(timestamp);
    power.writeInt32(count);
    for (const gpu_entry& entry : entries) {
        power.writeInt32(frequencyPower(entry.hertz));
        power.writeInt64(entry.busy);
        power.writeInt64(entry.idle);
    }
    return 0;
}

int32_t GpuAccounter::onActionForeground(const Parcel& action) {
    return moveForegroundElement(kGpuKey, action);
}

} // namespace kelvo
