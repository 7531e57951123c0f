#include "KelvoLog.h"

#include <cstdarg>
#include <cstdio>

namespace kelvo {

int32_t readLogSwitch(const char* property, int32_t defaultValue) {
    char value[PROPERTY_VALUE_MAX];
    if (property_get(property, value, "") <= 0) {
        return defaultValue == 1 ? 1 : 0;
    }
    // Any stored value other than the number 1 means off.
    return property_get_int32(property, 0) == 1 ? 1 : 0;
}

// Read before main runs.
std::atomic<int32_t> gLogDebugEnable{readLogSwitch("persist.kelvod.log.debug", 1)};
std::atomic<int32_t> gLogInfoEnable{readLogSwitch("persist.kelvod.log.info", 1)};
std::atomic<uint32_t> gLogModuleMask{0};
std::atomic<int32_t> gLogUserType{property_get_int32("ro.logsystem.usertype", -1)};

void loadLogSwitches() {
    gLogDebugEnable.store(readLogSwitch("persist.kelvod.log.debug", 1));
    gLogInfoEnable.store(readLogSwitch("persist.kelvod.log.info", 1));
    gLogModuleMask.store(0);
    gLogUserType.store(property_get_int32("ro.logsystem.usertype", -1));
}

void logErrorLine(const char* format, ...) {
    char buffer[1024];
    va_list args;
    va_start(args, format);
    int n = vsnprintf(buffer, sizeof(buffer), format, args);
    va_end(args);
    if (n < 0) {
        buffer[0] = '\0';
    }
    ErrorLogger::toDatabase(buffer);
    __android_log_print(ANDROID_LOG_ERROR, KELVO_LOG_TAG, "%s", buffer);
}

} // namespace kelvo
