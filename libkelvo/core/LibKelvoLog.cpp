#include "LibKelvoLog.h"

#include <cutils/properties.h>

namespace kelvo {

namespace {

constexpr const char* kDebugProperty = "persist.libkelvo.log.debug";
constexpr const char* kInfoProperty = "persist.libkelvo.log.info";

} // namespace

int32_t readLibLogSwitch(const char* property, int32_t defaultValue) {
    char value[PROPERTY_VALUE_MAX];
    if (property_get(property, value, "") <= 0) {
        return defaultValue == 1 ? 1 : 0;
    }
    // Any stored value other than the number 1 means off.
    return property_get_int32(property, 0) == 1 ? 1 : 0;
}

// Read before main runs.
std::atomic<int32_t> gLibLogDebugEnable{readLibLogSwitch(kDebugProperty, 0)};
std::atomic<int32_t> gLibLogInfoEnable{readLibLogSwitch(kInfoProperty, 1)};

void loadLibLogSwitches() {
    gLibLogDebugEnable.store(readLibLogSwitch(kDebugProperty, 0));
    gLibLogInfoEnable.store(readLibLogSwitch(kInfoProperty, 1));
}

} // namespace kelvo
