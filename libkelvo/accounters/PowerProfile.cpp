#include "accounters/PowerProfile.h"

#include <iterator>
#include <limits>

#include <binder/Parcel.h>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "LibKelvoLog.h"

using android::NO_ERROR;
using android::Parcel;

namespace kelvo {

int32_t PowerProfile::readSimple(int32_t component, std::vector<int32_t>* values) {
    values->clear();
    Parcel request;
    request.writeInt32(component);
    request.setDataPosition(0);
    Parcel reply;
    if (XmlParser::getInstance()->getXmlConfig(CONFIG_POWER_PROFILE, request, &reply) < 0) {
        return -1;
    }
    reply.setDataPosition(0);
    int32_t value = 0;
    while (reply.readInt32(&value) == NO_ERROR) {
        values->push_back(value);
    }
    return values->empty() ? -1 : 0;
}

int32_t PowerProfile::readGrouped(int32_t component, int32_t parameter, bool keyed,
                                  std::vector<config_parameter>* parameters) {
    parameters->clear();
    Parcel request;
    request.writeInt32(component);
    request.writeInt32(parameter);
    request.writeBool(keyed);
    request.setDataPosition(0);
    Parcel reply;
    if (XmlParser::getInstance()->getXmlConfig(CONFIG_POWER_PROFILE, request, &reply) < 0 ||
        XmlParser::readGroupedReply(reply, keyed, parameters) < 0) {
        return -1;
    }
    return parameters->empty() ? -1 : 0;
}

int32_t PowerProfile::readPolicy(int32_t component, int32_t* policy) {
    Parcel request;
    request.writeInt32(component);
    request.setDataPosition(0);
    Parcel reply;
    if (XmlParser::getInstance()->getXmlConfig(CONFIG_COMPONENT_POLICY, request, &reply) < 0) {
        return -1;
    }
    reply.setDataPosition(0);
    return reply.readInt32(policy) == NO_ERROR ? 0 : -1;
}

int32_t PowerProfile::clampPower(int64_t power) {
    constexpr int64_t kMax = std::numeric_limits<int32_t>::max();
    constexpr int64_t kMin = std::numeric_limits<int32_t>::min();
    if (power > kMax || power < kMin) {
        HealthCounters::add(Health::ValuesSaturated);
        return static_cast<int32_t>(power > kMax ? kMax : kMin);
    }
    return static_cast<int32_t>(power);
}

int32_t PowerProfile::nearestPower(const std::map<int64_t, int32_t>& table, int64_t key,
                                   bool* exact) {
    *exact = false;
    if (table.empty()) {
        return 0;
    }
    auto above = table.lower_bound(key);
    if (above != table.end() && above->first == key) {
        *exact = true;
        return above->second;
    }
    if (above == table.begin()) {
        return above->second;
    }
    auto below = std::prev(above);
    if (above == table.end()) {
        return below->second;
    }
    // Both differences are positive; compared without overflow.
    uint64_t toBelow = static_cast<uint64_t>(key) - static_cast<uint64_t>(below->first);
    uint64_t toAbove = static_cast<uint64_t>(above->first) - static_cast<uint64_t>(key);
    return toAbove < toBelow ? above->second : below->second;
}

int32_t PowerProfile::setFixedPower(BaseAllocator* allocator, int32_t power) {
    Parcel description;
    description.writeInt64(0);
    description.writeInt32(power);
    description.setDataPosition(0);
    return allocator->setPowerValue(Parcel(), description);
}

} // namespace kelvo
