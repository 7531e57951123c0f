#include "accounters/CpuAccounter.h"

#include <math.h>

#include <algorithm>
#include <limits>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "LibKelvoLog.h"
#include "allocators/AccounterData.h"
#include "allocators/WeightAllocator.h"
#include "utils/XmlParser.h"

using android::NO_ERROR;
using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

// The profile parameter that holds the idle power; every other parameter is
// a cluster.
constexpr int32_t kIdlePowerParameter = 100;
// The foreground name the CPU handler reports when the screen goes off.
constexpr const char* kScreenOffName = "screen_off";
// uint32 id, uint32 cores, int32 idle, int32 total, uint32 step count.
constexpr size_t kClusterHeaderSize = 5 * sizeof(int32_t);

int64_t multiplySaturated(int64_t a, int64_t b) {
    int64_t product = 0;
    if (__builtin_mul_overflow(a, b, &product)) {
        return (a < 0) != (b < 0) ? std::numeric_limits<int64_t>::min()
                                  : std::numeric_limits<int64_t>::max();
    }
    return product;
}

int32_t saturateToInt32(int64_t value) {
    return static_cast<int32_t>(std::min<int64_t>(
            std::max<int64_t>(value, std::numeric_limits<int32_t>::min()),
            std::numeric_limits<int32_t>::max()));
}

// The idle part of the time t at one step: t / total * idle / cores in single
// precision, rounded half away from zero, within [0, t]. 0 when there is no
// step time or no core to spread the idle time over.
int64_t idleShare(int64_t t, int64_t total, int64_t idle, uint32_t cores) {
    if (total <= 0 || cores == 0 || t == 0 || idle == 0) {
        return 0;
    }
    float share = static_cast<float>(t) / static_cast<float>(total) * static_cast<float>(idle) /
                  static_cast<float>(cores);
    double rounded = round(static_cast<double>(share));
    if (rounded <= 0) {
        return 0;
    }
    if (rounded >= static_cast<double>(t)) {
        return t;
    }
    return static_cast<int64_t>(rounded);
}

} // namespace

CpuAccounter::CpuAccounter(int64_t systemBootTime)
    : mLastAccountTime(systemBootTime), mAccountMode(-1), mIdlePower(0) {
    loadProfile();
}

void CpuAccounter::loadProfile() {
    Parcel request;
    request.writeInt32(PROFILE_CPU);
    request.writeInt32(-1);
    request.writeBool(false);
    request.setDataPosition(0);
    Parcel reply;
    std::vector<config_parameter> parameters;
    if (XmlParser::getInstance()->getXmlConfig(CONFIG_POWER_PROFILE, request, &reply) < 0 ||
        XmlParser::readGroupedReply(reply, false, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        if (parameter.id == kIdlePowerParameter) {
            for (const config_value& value : parameter.values) {
                mIdlePower = value.value;
            }
            continue;
        }
        std::vector<int32_t> powers;
        for (const config_value& value : parameter.values) {
            powers.push_back(value.value);
        }
        mClusterPowers.push_back(std::move(powers));
    }
}

String8 CpuAccounter::getForeground() const {
    if (mAccountMode == 0) {
        auto it = mEvents.find(mLastAccountTime);
        if (it != mEvents.end()) {
            return it->second.foreground;
        }
        LLOGE("There must be an event of this timestamp: %lld",
              static_cast<long long>(mLastAccountTime));
    }
    return mForeground;
}

bool CpuAccounter::getScreenState() const {
    if (mAccountMode == 0) {
        auto it = mEvents.find(mLastAccountTime);
        if (it != mEvents.end()) {
            return it->second.screenOn;
        }
        LLOGE("There must be an event of this timestamp: %lld",
              static_cast<long long>(mLastAccountTime));
    }
    return mScreenOn;
}

int32_t CpuAccounter::sendReply(int32_t event, const Parcel& reply) {
    // The application records are the last reply of a pass.
    if (event == LIBRARY_EVENT_APPLICATION) {
        releaseEvent();
    }
    return DataAccounter::sendReply(event, reply);
}

std::unique_ptr<BaseAllocator> CpuAccounter::createAllocators(int32_t key) {
    return std::make_unique<WeightAllocator>(this);
}

int32_t CpuAccounter::getPowerValue(int32_t key, const Parcel& action, Parcel& power) {
    int64_t end = 0;
    int32_t mode = 0;
    bool hasData = false;
    if (action.readInt64(&end) != NO_ERROR || action.readInt32(&mode) != NO_ERROR ||
        action.readBool(&hasData) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (end < mLastAccountTime) {
        LLOGE("Invalid timestamp, %lld, %lld", static_cast<long long>(end),
              static_cast<long long>(mLastAccountTime));
        return -1;
    }
    if (mode == 0 && mEvents.find(end) == mEvents.end()) {
        LLOGE("There must be an event of this timestamp: %lld", static_cast<long long>(end));
        return -1;
    }
    // The whole component data is read before the pass is committed, so a
    // refused parcel leaves the next pass starting where this one would have.
    // The entry counts the refusal.
    std::vector<cluster_data> clusters;
    if (hasData && readClusters(action, &clusters) < 0) {
        return -1;
    }
    power.writeBool(hasData);
    power.writeInt64(mLastAccountTime);
    power.writeInt64(end);
    mLastAccountTime = end;
    mAccountMode = mode;
    if (hasData) {
        componentAccounting(clusters, power);
    } else {
        // No replies follow.
        releaseEvent();
    }
    pruneEvents();
    return 0;
}

int32_t CpuAccounter::readClusters(const Parcel& action, std::vector<cluster_data>* clusters) {
    uint32_t count = 0;
    if (action.readUint32(&count) != NO_ERROR) {
        LLOGE("Missing cluster count");
        return -1;
    }
    if (count > kMaxClusters || count * kClusterHeaderSize > action.dataAvail()) {
        LLOGE("Invalid cluster count: %u, data left: %zu", count, action.dataAvail());
        return -1;
    }
    clusters->resize(count);
    for (cluster_data& cluster : *clusters) {
        uint32_t id = 0;
        uint32_t steps = 0;
        if (action.readUint32(&id) != NO_ERROR || action.readUint32(&cluster.cores) != NO_ERROR ||
            action.readInt32(&cluster.idle) != NO_ERROR ||
            action.readInt32(&cluster.total) != NO_ERROR ||
            action.readUint32(&steps) != NO_ERROR) {
            LLOGE("Cpu data ends inside a cluster");
            return -1;
        }
        if (steps > kMaxSteps || steps * sizeof(int32_t) > action.dataAvail()) {
            LLOGE("Invalid freq count: %u, data left: %zu", steps, action.dataAvail());
            return -1;
        }
        cluster.steps.resize(steps);
        for (int32_t& time : cluster.steps) {
            if (action.readInt32(&time) != NO_ERROR) {
                return -1;
            }
        }
    }
    return 0;
}

int64_t CpuAccounter::stepPower(size_t cluster, size_t step) const {
    const std::vector<int32_t>& powers =
            mClusterPowers[std::min(cluster, mClusterPowers.size() - 1)];
    if (powers.empty()) {
        return 0;
    }
    return powers[std::min(step, powers.size() - 1)];
}

void CpuAccounter::noteShape(const std::vector<cluster_data>& clusters) {
    std::vector<uint32_t> shape;
    bool matches = clusters.size() == mClusterPowers.size();
    for (const cluster_data& cluster : clusters) {
        shape.push_back(static_cast<uint32_t>(cluster.steps.size()));
        if (matches && cluster.steps.size() != mClusterPowers[shape.size() - 1].size()) {
            matches = false;
        }
    }
    if (matches || mLoggedShapes.count(shape) > 0 || mLoggedShapes.size() >= kMaxLoggedShapes) {
        return;
    }
    mLoggedShapes.insert(shape);
    if (clusters.size() != mClusterPowers.size()) {
        LLOGE("Mismatched cluster count: %zu, config: %zu", clusters.size(),
              mClusterPowers.size());
    }
    for (size_t i = 0; i < clusters.size(); ++i) {
        size_t configured = mClusterPowers[std::min(i, mClusterPowers.size() - 1)].size();
        if (clusters[i].steps.size() != configured) {
            LLOGE("Mismatched freq count: %zu, config: %zu", clusters[i].steps.size(),
                  configured);
        }
    }
}

void CpuAccounter::componentAccounting(const std::vector<cluster_data>& clusters, Parcel& power) {
    const bool hasProfile = !mClusterPowers.empty();
    if (hasProfile) {
        noteShape(clusters);
    }
    int64_t usage = 0;
    int64_t energy = 0;
    for (size_t i = 0; i < clusters.size(); ++i) {
        const cluster_data& cluster = clusters[i];
        const int64_t idle = std::max<int64_t>(cluster.idle, 0);
        const int64_t total = std::max<int64_t>(cluster.total, 0);
        for (size_t f = 0; f < cluster.steps.size(); ++f) {
            const int64_t t = std::max<int64_t>(cluster.steps[f], 0);
            const int64_t active = t - idleShare(t, total, idle, cluster.cores);
            usage = addSaturated(usage, multiplySaturated(active, cluster.cores));
            if (hasProfile) {
                energy = addSaturated(energy, multiplySaturated(stepPower(i, f), active));
            }
        }
        if (hasProfile) {
            energy = addSaturated(energy, multiplySaturated(mIdlePower, idle));
        }
    }
    power.writeInt32(saturateToInt32(usage));
    power.writeInt64(energy / 1000);
}

int32_t CpuAccounter::onActionForeground(const Parcel& action) {
    int64_t timestamp = 0;
    String8 name;
    if (action.readInt64(&timestamp) != NO_ERROR || action.readString8(&name) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    // A second change in the same millisecond keeps the state recorded by the
    // first, but the current state still follows the latest change.
    const bool known = mEvents.find(timestamp) != mEvents.end();
    if (!known && timestamp >= mLastAccountTime) {
        // Changes with no pass to use them: the oldest goes, counted.
        if (mEvents.size() >= kMaxEvents) {
            mEvents.erase(mEvents.begin());
            HealthCounters::add(Health::AccounterEventsDropped);
        }
        mEvents[timestamp] = polling_event{mScreenOn, mForeground};
    }
    // Screen state comes from its own action; a foreground change tells only
    // that the screen went off. Any other name leaves the state as it is.
    if (name == String8(kScreenOffName)) {
        mScreenOn = false;
    }
    mForeground = name;
    if (known) {
        LLOGE("Invalid event");
        return -1;
    }
    return 0;
}

int32_t CpuAccounter::onActionBalance(const Parcel& action) {
    int32_t reason = 0;
    if (action.readInt32(&reason) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (reason != BALANCE_SPAN) {
        LLOGE("Unknown balance reason: %d", reason);
        return -1;
    }
    int64_t end = 0;
    int64_t newStart = 0;
    if (action.readInt64(&end) != NO_ERROR || action.readInt64(&newStart) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    // The weight split keeps no open records: only the next start moves.
    mLastAccountTime = newStart;
    pruneEvents();
    return 0;
}

void CpuAccounter::releaseEvent() {
    if (mAccountMode != 0) {
        return;
    }
    auto it = mEvents.find(mLastAccountTime);
    if (it == mEvents.end()) {
        LLOGE("There must be an event of this timestamp: %lld",
              static_cast<long long>(mLastAccountTime));
        return;
    }
    mEvents.erase(it);
}

void CpuAccounter::pruneEvents() {
    mEvents.erase(mEvents.begin(), mEvents.lower_bound(mLastAccountTime));
}

} // namespace kelvo
