#include "accounters/ModemAccounter.h"

#include <limits>
#include <vector>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/ModemAccounterData.h"
#include "allocators/TrafficAllocator.h"
#include "core/KelvoLibAgent.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

constexpr int32_t kLteModule = 5;
constexpr int32_t kWcdmaRrcModule = 11;
// Profile: the special power is key 3 of mode 1.
constexpr int32_t kSpecialPowerMode = 1;
constexpr int32_t kSpecialPowerKey = 3;

// Scenarios by residency subtype (voice, idle, data), and the code each
// scenario is reported with.
constexpr int32_t kScenarioOfSubtype[] = {1, 0, 2};
constexpr int32_t kCodeOfScenario[] = {1, 0, 2};
constexpr int32_t kVoiceScenario = 1;
constexpr int32_t kDataScenario = 2;

// The power mode of a module; -1 for a module without one.
int32_t modeOfModule(int32_t module) {
    static const int32_t kModes[] = {2, 2, 3, 3, 4, 5, 4, 5, 1, 0, -1, 1};
    return module >= 0 && module <= ModemAccounter::kMaxModule ? kModes[module] : -1;
}

int64_t clampToInt64(__int128 value) {
    constexpr int64_t kMax = std::numeric_limits<int64_t>::max();
    constexpr int64_t kMin = std::numeric_limits<int64_t>::min();
    if (value > kMax || value < kMin) {
        HealthCounters::add(Health::ValuesSaturated);
        return value > 0 ? kMax : kMin;
    }
    return static_cast<int64_t>(value);
}

}  // namespace

ModemAccounter::ModemAccounter()
    : mLastBalance(KelvoLibAgent::getInstance()->getSystemBootTime()),
      mTotalTraffic(0),
      mDataEnergy(0),
      mPower{},
      mSpecialPower(0) {
    readProfile();
}

void ModemAccounter::readProfile() {
    std::vector<config_parameter> parameters;
    if (PowerProfile::readGrouped(PROFILE_MODEM, -1, true, &parameters) < 0) {
        LLOGE("Get power profile failed");
        return;
    }
    for (const config_parameter& parameter : parameters) {
        if (parameter.id < 0 || parameter.id >= kModes) {
            continue;
        }
        int32_t filled[kTables] = {};
        for (const config_value& value : parameter.values) {
            if (value.key >= 0 && value.key < kTables) {
                // Values past the last level are ignored.
                if (filled[value.key] < kLevels) {
                    mPower[parameter.id][value.key][filled[value.key]++] = value.value;
                }
            } else if (value.key == kSpecialPowerKey && parameter.id == kSpecialPowerMode) {
                mSpecialPower = value.value;
            }
        }
    }
}

std::unique_ptr<BaseAllocator> ModemAccounter::createAllocators(int32_t key) {
    if (key != kTrafficKey) {
        return nullptr;
    }
    auto allocator = std::make_unique<TrafficAllocator<modem_accounter_data>>(this);
    // The first batch's records start when the system did.
    const int64_t bootTime = KelvoLibAgent::getInstance()->getSystemBootTime();
    allocator->updateLastTimestamp(bootTime, bootTime);
    return allocator;
}

int32_t ModemAccounter::onActionSetValue(const Parcel& action) {
    int32_t subtype = -1;
    if (action.readInt32(&subtype) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    switch (subtype) {
        case MODEM_VOICE_RESIDENCY:
        case MODEM_IDLE_RESIDENCY:
        case MODEM_DATA_RESIDENCY:
            return accountModule(kScenarioOfSubtype[subtype], action);
        case MODEM_INTERFACE_TRAFFIC:
            return setInterfaceTraffic(action);
        case MODEM_PACKAGE_TRAFFIC:
            return setBatch(action);
        case MODEM_CHARGER: {
            bool chargerOnline = false;
            if (action.readBool(&chargerOnline) != NO_ERROR) {
                LLOGE("Invalid parameter");
                return -1;
            }
            mChargerOnline = chargerOnline;
            return 0;
        }
        default:
            LLOGE("Unknown modem subtype: %d", subtype);
            HealthCounters::add(Health::LibraryParcelRefused);
            return -1;
    }
}

int32_t ModemAccounter::accountModule(int32_t scenario, const Parcel& action) {
    int32_t module = -1;
    if (action.readInt32(&module) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (module < 0 || module > kMaxModule) {
        LLOGE("Invalid module: %d", module);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    const int32_t mode = modeOfModule(module);
    if (mode < 0) {
        LLOGE("Unknown module: %d", module);
        LLOGE("Invalid mode index: %d", mode);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    int32_t table = scenario;
    int64_t usage = 0;
    if (module == kLteModule) {
        int32_t modulation = 0;
        int32_t baseUsage = 0;
        if (action.readInt32(&modulation) != NO_ERROR || action.readInt32(&baseUsage) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
        if (modulation != 0 && modulation != 1) {
            LLOGE("Unknown modulation type: %d", modulation);
        }
        table = modulation == 1 ? 1 : 2;
        usage = baseUsage > 0 ? baseUsage : 0;
    }
    int32_t count = 0;
    if (action.readInt32(&count) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (count < 0 || count > kMaxLevelCount) {
        LLOGE("Invalid signal level size: %d", count);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    int32_t times[kMaxLevelCount] = {};
    for (int32_t i = 0; i < count; ++i) {
        if (action.readInt32(&times[i]) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
    }
    // A voice residency of the LTE module reports its time as the base.
    const bool usageIsBase = module == kLteModule && scenario == kVoiceScenario;
    __int128 energy = 0;
    for (int32_t i = 0; i < count; ++i) {
        if (times[i] < 1) {
            continue;
        }
        if (!usageIsBase) {
            usage += times[i];
        }
        const int32_t power = module == kWcdmaRrcModule ? mSpecialPower : mPower[mode][table][i];
        energy += static_cast<__int128>(times[i]) * power;
    }
    residency& entry = mResidency[scenario][module];
    entry.usage = addSaturated(entry.usage, usage);
    entry.energy = addSaturated(entry.energy, clampToInt64(energy / 1000));
    return 0;
}

int32_t ModemAccounter::setInterfaceTraffic(const Parcel& action) {
    int64_t tx = 0;
    int64_t rx = 0;
    if (action.readInt64(&tx) != NO_ERROR || action.readInt64(&rx) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    mTotalTraffic = addSaturated(tx, rx);
    int64_t energy = 0;
    for (const auto& entry : mResidency[kDataScenario]) {
        energy = addSaturated(energy, entry.second.energy);
    }
    mDataEnergy = energy;
    return 0;
}

int32_t ModemAccounter::setBatch(const Parcel& action) {
    BaseAllocator* allocator = obtainAllocator(kTrafficKey);
    if (allocator == nullptr) {
        return -1;
    }
    Parcel power;
    power.writeInt64(mDataEnergy);
    power.writeInt64(mTotalTraffic);
    power.setDataPosition(0);
    if (allocator->setPowerValue(action, power) < 0) {
        LLOGE("Failed to set power value");
        return -1;
    }
    return 0;
}

void ModemAccounter::writeComponentRecord(Parcel& reply, int64_t end) const {
    reply.writeBool(mChargerOnline);
    for (int32_t scenario = 0; scenario < kScenarios; ++scenario) {
        reply.writeInt32(kCodeOfScenario[scenario]);
        reply.writeInt32(static_cast<int32_t>(mResidency[scenario].size()));
        for (const auto& entry : mResidency[scenario]) {
            reply.writeInt64(mLastBalance);
            reply.writeInt64(end);
            reply.writeInt32(entry.first);
            reply.writeInt64(entry.second.usage);
            reply.writeInt64(entry.second.energy);
        }
    }
}

int32_t ModemAccounter::onActionBalance(const Parcel& action) {
    int32_t reason = 0;
    if (action.readInt32(&reason) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    int64_t end = 0;
    int64_t newStart = 0;
    if (reason == BALANCE_AT) {
        if (action.readInt64(&end) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
        newStart = end;
    } else if (reason == BALANCE_SPAN) {
        if (action.readInt64(&end) != NO_ERROR || action.readInt64(&newStart) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
    } else {
        LLOGE("Unknown balance reason: %d", reason);
        return -1;
    }
    int32_t result = 0;
    Parcel reply;
    writeComponentRecord(reply, end);
    for (auto& scenario : mResidency) {
        scenario.clear();
    }
    if (sendReply(LIBRARY_EVENT_COMPONENT, reply) < 0) {
        result = -1;
    }
    for (auto& entry : mAllocators) {
        if (entry.second->balanceAccounting(end, newStart, entry.first) < 0) {
            LLOGE("Failed to balance accounting data");
            result = -1;
        }
    }
    mLastBalance = newStart;
    // The data energy and traffic belonged to the block before: a later
    // batch without a new block of its own must not split them again.
    mDataEnergy = 0;
    mTotalTraffic = 0;
    return result;
}

}  // namespace kelvo
