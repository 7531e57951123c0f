#include "accounters/WifiAccounter.h"

#include <vector>

#include "HealthCounters.h"
#include "LibKelvoLog.h"
#include "accounters/PowerProfile.h"
#include "allocators/AccounterData.h"
#include "allocators/SoleAllocator.h"
#include "allocators/TrafficAllocator.h"
#include "core/KelvoLibAgent.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

namespace {

// Profile parameters of the Wi-Fi component.
enum WifiProfileParameter : int32_t {
    PARAMETER_HOTSPOT = 0,     // unkeyed, the last value
    PARAMETER_TX = 1,          // keyed by band, one value per level
    PARAMETER_RX = 2,          // keyed by band, one value per level
    PARAMETER_SCAN = 3,        // unkeyed, the last value
    PARAMETER_BAND_FIXED = 4,  // keyed by band
    PARAMETER_COUNT = 5,
};

// Band codes of subtype 4.
constexpr int32_t kBandCode5GHz = 1;
constexpr int32_t kBandCode24GHz = 2;

// A profile key names a band; any other key counts as band 0.
int32_t bandOfKey(int32_t key) {
    return key == 1 ? 1 : 0;
}

}  // namespace

WifiAccounter::WifiAccounter()
    : mReplyKey(-1),
      mBand(0),
      mTotals{},
      mLevelTimes{},
      mHotspotPower(0),
      mScanPower(0),
      mBandPower{},
      mTxPower{},
      mRxPower{} {
    readProfile();
}

void WifiAccounter::readProfile() {
    for (int32_t id = 0; id < PARAMETER_COUNT; ++id) {
        const bool keyed = id == PARAMETER_TX || id == PARAMETER_RX || id == PARAMETER_BAND_FIXED;
        std::vector<config_parameter> parameters;
        if (PowerProfile::readGrouped(PROFILE_WIFI, id, keyed, &parameters) < 0) {
            LLOGE("Get power profile failed");
            continue;
        }
        for (const config_parameter& parameter : parameters) {
            if (parameter.id != id) {
                LLOGE("Unknown wifi subtype: %d", parameter.id);
                break;
            }
            int32_t filled[2] = {0, 0};
            for (const config_value& value : parameter.values) {
                const int32_t band = bandOfKey(value.key);
                switch (id) {
                    case PARAMETER_HOTSPOT:
                        mHotspotPower = value.value;
                        break;
                    case PARAMETER_SCAN:
                        mScanPower = value.value;
                        break;
                    case PARAMETER_BAND_FIXED:
                        mBandPower[band] = value.value;
                        break;
                    default: {
                        // Values beyond the last level are ignored.
                        if (filled[band] < kWifiLevels) {
                            int32_t(&table)[2][kWifiLevels] =
                                id == PARAMETER_TX ? mTxPower : mRxPower;
                            table[band][filled[band]++] = value.value;
                        }
                        break;
                    }
                }
            }
        }
    }
}

void WifiAccounter::prepareReply(Parcel& reply) {
    reply.writeInt32(mReplyKey);
}

std::unique_ptr<BaseAllocator> WifiAccounter::createAllocators(int32_t key) {
    if (key == kHotspotKey) {
        auto allocator = std::make_unique<SoleAllocator<accounter_data>>(this);
        PowerProfile::setFixedPower(allocator.get(), mHotspotPower);
        return allocator;
    }
    if (key == kTrafficKey) {
        auto allocator = std::make_unique<TrafficAllocator<wifi_accounter_data>>(this);
        // The first batch's records start when the system did.
        const int64_t bootTime = KelvoLibAgent::getInstance()->getSystemBootTime();
        allocator->updateLastTimestamp(bootTime, bootTime);
        return allocator;
    }
    return nullptr;
}

int32_t WifiAccounter::keyOfSubtype(int32_t subtype) const {
    switch (subtype) {
        case WIFI_HOTSPOT:
            return kHotspotKey;
        case WIFI_PACKAGE_TRAFFIC:
        case WIFI_SCANS:
        case WIFI_BAND:
        case WIFI_ACTIVITY:
            return kTrafficKey;
        case WIFI_INTERFACE_TRAFFIC:
        case WIFI_CHARGER:
            return mReplyKey;
        default:
            return -1;
    }
}

int32_t WifiAccounter::getAllocatorKey(const Parcel& action) {
    int32_t subtype = -1;
    if (action.readInt32(&subtype) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (subtype < 0 || subtype > WIFI_SUBTYPE_MAX) {
        LLOGE("Unknown wifi subtype: %d", subtype);
        return -1;
    }
    const int32_t key = keyOfSubtype(subtype);
    if (key >= 0) {
        mReplyKey = key;
    }
    return key;
}

// Each allocator's records open with its own key: the hotspot's stopped by
// a framework death is read as the hotspot, whatever the last action was.
int32_t WifiAccounter::onActionDeactivateAll(const Parcel& action) {
    int64_t timestamp = 0;
    if (action.readInt64(&timestamp) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    const int32_t lastKey = mReplyKey;
    for (auto& entry : mAllocators) {
        mReplyKey = entry.first;
        if (entry.second->removeAllElements(timestamp) < 0) {
            LLOGE("Failed to remove all elements");
        }
    }
    mReplyKey = lastKey;
    return 0;
}

int32_t WifiAccounter::onActionSetValue(const Parcel& action) {
    int32_t subtype = -1;
    if (action.readInt32(&subtype) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    switch (subtype) {
        case WIFI_INTERFACE_TRAFFIC:
            return addTotals(action);
        case WIFI_PACKAGE_TRAFFIC:
        case WIFI_SCANS:
            return setBatch(subtype, action);
        case WIFI_BAND:
            return setBand(action);
        case WIFI_ACTIVITY:
            return addLevelTimes(action);
        case WIFI_CHARGER: {
            bool chargerOnline = false;
            if (action.readBool(&chargerOnline) != NO_ERROR) {
                LLOGE("Invalid parameter");
                return -1;
            }
            mChargerOnline = chargerOnline;
            return 0;
        }
        default:
            // The hotspot (2) is started and stopped, never given a value.
            LLOGE("Unknown wifi subtype: %d", subtype);
            return -1;
    }
}

int32_t WifiAccounter::addTotals(const Parcel& action) {
    int64_t totals[2] = {0, 0};
    if (action.readInt64(&totals[0]) != NO_ERROR || action.readInt64(&totals[1]) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    for (int32_t i = 0; i < 2; ++i) {
        if (totals[i] >= 1) {
            mTotals[i] = addSaturated(mTotals[i], totals[i]);
        }
    }
    return 0;
}

int32_t WifiAccounter::setBand(const Parcel& action) {
    int32_t code = 0;
    if (action.readInt32(&code) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (code == kBandCode5GHz) {
        mBand = 1;
    } else if (code == kBandCode24GHz) {
        mBand = 0;
    } else if (code == 0) {
        // No band known (not connected): the last band stays.
        LLOGI("Unknown wifi band: %d", code);
    } else {
        LLOGE("Unknown wifi band: %d", code);
    }
    return 0;
}

int32_t WifiAccounter::addLevelTimes(const Parcel& action) {
    int32_t count = 0;
    if (action.readInt32(&count) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (count != kWifiLevels) {
        LLOGE("Wifi signal level count not match: %d", count);
        HealthCounters::add(Health::LibraryParcelRefused);
        return -1;
    }
    int64_t times[kWifiLevels] = {};
    for (int64_t& time : times) {
        if (action.readInt64(&time) != NO_ERROR) {
            LLOGE("Invalid parameter");
            return -1;
        }
        if (time < 0) {
            LLOGE("Invalid wifi level time: %lld", static_cast<long long>(time));
            HealthCounters::add(Health::LibraryParcelRefused);
            return -1;
        }
    }
    for (int32_t i = 0; i < kWifiLevels; ++i) {
        mLevelTimes[i] = addSaturated(mLevelTimes[i], times[i]);
    }
    return 0;
}

int32_t WifiAccounter::setBatch(int32_t subtype, const Parcel& action) {
    BaseAllocator* allocator = obtainAllocator(kTrafficKey);
    if (allocator == nullptr) {
        return -1;
    }
    Parcel power;
    power.writeInt32(subtype);
    if (subtype == WIFI_SCANS) {
        power.writeInt32(mScanPower);
    } else {
        power.writeInt64(mTotals[0]);
        power.writeInt64(mTotals[1]);
        power.writeInt32(mBandPower[mBand]);
        for (int32_t i = 0; i < kWifiLevels; ++i) {
            power.writeInt32(mTxPower[mBand][i]);
            power.writeInt32(mRxPower[mBand][i]);
            power.writeInt64(mLevelTimes[i]);
        }
    }
    power.setDataPosition(0);
    if (allocator->setPowerValue(action, power) < 0) {
        LLOGE("Failed to set power value");
        return -1;
    }
    if (subtype == WIFI_PACKAGE_TRAFFIC) {
        // This batch has been weighted by them.
        mTotals[0] = mTotals[1] = 0;
        for (int64_t& time : mLevelTimes) {
            time = 0;
        }
    }
    return 0;
}

}  // namespace kelvo
