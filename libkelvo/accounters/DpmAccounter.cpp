#include "accounters/DpmAccounter.h"

#include <limits>
#include <vector>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

constexpr size_t kCoefficients = 4;

struct block_times {
    int32_t id;
    std::array<int64_t, 4> times;
};

int64_t saturate(bool overflow, int64_t value, bool negative, bool* clamped) {
    if (!overflow) {
        return value;
    }
    *clamped = true;
    return negative ? std::numeric_limits<int64_t>::min() : std::numeric_limits<int64_t>::max();
}

}  // namespace

DpmAccounter::DpmAccounter() {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_DPM, -1, false, &parameters) < 0) {
        LLOGE("No dpm power configuration");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        if (parameter.values.size() < kCoefficients) {
            // A block with part of its coefficients would be charged for
            // some of its times only: it counts 0 instead.
            HealthCounters::add(Health::SettingsRefused);
            LLOGE("Invalid dpm power configuration: ip=%d, values=%zu", parameter.id,
                  parameter.values.size());
            continue;
        }
        if (parameter.values.size() > kCoefficients) {
            LLOGE("Extra dpm coefficients ignored: ip=%d, values=%zu", parameter.id,
                  parameter.values.size());
        }
        std::array<int64_t, 4> c;
        for (size_t i = 0; i < kCoefficients; ++i) {
            c[i] = parameter.values[i].value;
        }
        mCoefficients.emplace(parameter.id, c);  // the first of an id stays
    }
    if (mCoefficients.empty()) {
        LLOGE("No dpm power configuration");
    }
}

int64_t DpmAccounter::blockEnergy(int32_t id, const std::array<int64_t, 4>& times) const {
    auto found = mCoefficients.find(id);
    if (found == mCoefficients.end()) {
        return 0;
    }
    bool clamped = false;
    int64_t sum = 0;
    for (size_t i = 0; i < kCoefficients; ++i) {
        int64_t product = 0;
        const bool negative = (times[i] < 0) != (found->second[i] < 0);
        const bool productOverflow = __builtin_mul_overflow(times[i], found->second[i], &product);
        product = saturate(productOverflow, product, negative, &clamped);
        int64_t total = 0;
        const bool sumOverflow = __builtin_add_overflow(sum, product, &total);
        sum = saturate(sumOverflow, total, product < 0, &clamped);
    }
    if (clamped) {
        HealthCounters::add(Health::ValuesSaturated);
    }
    return sum / 1000;
}

int32_t DpmAccounter::onActionSetValue(const Parcel& action) {
    int64_t start = 0;
    int64_t end = 0;
    bool charging = false;
    int32_t count = 0;
    if (action.readInt64(&start) != NO_ERROR || action.readInt64(&end) != NO_ERROR ||
        action.readBool(&charging) != NO_ERROR || action.readInt32(&count) != NO_ERROR ||
        count < 0) {
        HealthCounters::add(Health::LibraryParcelRefused);
        LLOGE("Invalid dpm data: count=%d", count);
        return -1;
    }
    // The count is the sender's word: the records end where the data does.
    std::vector<block_times> blocks;
    for (int32_t i = 0; i < count; ++i) {
        block_times block;
        bool ok = action.readInt32(&block.id) == NO_ERROR;
        for (size_t t = 0; ok && t < kCoefficients; ++t) {
            ok = action.readInt64(&block.times[t]) == NO_ERROR;
        }
        if (!ok) {
            HealthCounters::add(Health::LibraryParcelRefused);
            LLOGE("Dpm data ends after %zu of %d records", blocks.size(), count);
            break;
        }
        blocks.push_back(block);
    }
    mChargerOnline = charging;
    Parcel reply;
    reply.writeInt32(static_cast<int32_t>(blocks.size()));
    for (const block_times& block : blocks) {
        const int64_t energy = blockEnergy(block.id, block.times);
        reply.writeInt64(start);
        reply.writeInt64(end);
        reply.writeInt32(block.id);
        for (int64_t t : block.times) {
            reply.writeInt64(t);
        }
        reply.writeInt64(charging ? 0 : energy);
        reply.writeInt64(charging ? energy : 0);
        LLOGD("ip: %d, energy: %lld, charging: %d", block.id, static_cast<long long>(energy),
              charging ? 1 : 0);
    }
    sendReply(LIBRARY_EVENT_COMPONENT, reply);
    return 0;
}

}  // namespace kelvo
