#pragma once

// The daemon's one logging facility. Every line has the form
// "[<source file base name>] <function># <message>" under the tag "kelvod".
//
//   KLOGE  error: always written; also stored in the database (ErrorLogger).
//   KLOGI  information: written when "persist.kelvod.log.info" is 1.
//   KLOGD  debug: written when "persist.kelvod.log.debug" is 1.
//   KLOGM  module debug: written when the module's bit is in the module mask,
//          whatever the debug switch says.

#include <android/log.h>
#include <cutils/properties.h>
#include <stddef.h>
#include <stdint.h>

#include <atomic>

#include "ErrorLogger.h"

#define KELVO_LOG_TAG "kelvod"

namespace kelvo {

// Module bits of the module mask, named by the words of "dumpsys --log".
enum LogModule : uint32_t {
    LOG_MODULE_AUDIO = 0x1,
    LOG_MODULE_BATTERY = 0x2,
    LOG_MODULE_BLUETOOTH = 0x4,
    LOG_MODULE_CAMERA = 0x8,
    LOG_MODULE_CPU = 0x10,
    LOG_MODULE_DISPLAY = 0x20,
    LOG_MODULE_FLASHLIGHT = 0x40,
    LOG_MODULE_ABNORMALITY = 0x80,
    LOG_MODULE_GNSS = 0x100,
    LOG_MODULE_GPU = 0x200,
    LOG_MODULE_MODEM = 0x400,
    LOG_MODULE_SENSOR = 0x800,
    LOG_MODULE_WIFI = 0x1000,
    LOG_MODULE_DPM = 0x2000,
    LOG_MODULE_SYSTEM = 0x4000,
    LOG_MODULE_THERMAL = 0x8000,
    LOG_MODULE_STORAGE = 0x10000,
    LOG_MODULE_DISPATCHER = 0x20000,
    LOG_MODULE_BUFFEREDLOG = 0x40000,
    LOG_MODULE_ALL = 0x7FFFF,
};

// The switches: one of each for the whole program, read from the properties
// before main and changed later only through the setters below.
extern std::atomic<int32_t> gLogDebugEnable;
extern std::atomic<int32_t> gLogInfoEnable;
extern std::atomic<uint32_t> gLogModuleMask;
// The device's log user type ("ro.logsystem.usertype", -1 when unset), read
// with the switches before main.
extern std::atomic<int32_t> gLogUserType;

// A switch is on only when its property holds exactly 1.
int32_t readLogSwitch(const char* property, int32_t defaultValue);
// Reads both switches and the user type from their properties again and
// clears the module mask.
void loadLogSwitches();

// The base name of a source path: the text after its last '/'. The search is
// bounded by the length of the literal.
template <size_t N>
constexpr const char* logBaseName(const char (&path)[N]) {
    size_t start = 0;
    for (size_t i = 0; i < N && path[i] != '\0'; ++i) {
        if (path[i] == '/') {
            start = i + 1;
        }
    }
    return path + start;
}

// Formats an error line into a 1024-byte buffer, hands it to the error logger
// and writes it to the system log.
void logErrorLine(const char* format, ...) __attribute__((format(printf, 1, 2)));

} // namespace kelvo

#define KELVO_FILE_NAME (::kelvo::logBaseName(__FILE__))

#define KLOGE(format, ...) \
    ::kelvo::logErrorLine("[%s] %s# " format, KELVO_FILE_NAME, __func__, ##__VA_ARGS__)

#define KLOGI(format, ...)                                                                  \
    do {                                                                                    \
        if (::kelvo::gLogInfoEnable.load(std::memory_order_relaxed) == 1) {                 \
            __android_log_print(ANDROID_LOG_INFO, KELVO_LOG_TAG, "[%s] %s# " format,        \
                                KELVO_FILE_NAME, __func__, ##__VA_ARGS__);                  \
        }                                                                                   \
    } while (0)

#define KLOGD(format, ...)                                                                  \
    do {                                                                                    \
        if (::kelvo::gLogDebugEnable.load(std::memory_order_relaxed) == 1) {                \
            __android_log_print(ANDROID_LOG_DEBUG, KELVO_LOG_TAG, "[%s] %s# " format,       \
                                KELVO_FILE_NAME, __func__, ##__VA_ARGS__);                  \
        }                                                                                   \
    } while (0)

#define KLOGM(module, format, ...)                                                          \
    do {                                                                                    \
        if ((::kelvo::gLogModuleMask.load(std::memory_order_relaxed) & (module)) != 0) {    \
            __android_log_print(ANDROID_LOG_DEBUG, KELVO_LOG_TAG, "[%s] %s# " format,       \
                                KELVO_FILE_NAME, __func__, ##__VA_ARGS__);                  \
        }                                                                                   \
    } while (0)

namespace kelvo {

// Switch setters of "dumpsys KelvoService --log".
inline void setLogDebugEnable(bool enable) {
    gLogDebugEnable.store(enable ? 1 : 0, std::memory_order_relaxed);
    property_set("persist.kelvod.log.debug", enable ? "1" : "0");
    KLOGI("Log debug level: %d", enable ? 1 : 0);
}

inline void setLogInfoEnable(bool enable) {
    gLogInfoEnable.store(enable ? 1 : 0, std::memory_order_relaxed);
    property_set("persist.kelvod.log.info", enable ? "1" : "0");
    KLOGI("Log information level: %d", enable ? 1 : 0);
}

inline void setLogModuleEnable(uint32_t bits, bool enable) {
    uint32_t mask;
    if (enable) {
        mask = gLogModuleMask.fetch_or(bits, std::memory_order_relaxed) | bits;
    } else {
        mask = gLogModuleMask.fetch_and(~bits, std::memory_order_relaxed) & ~bits;
    }
    KLOGI("Log module mask: %d", static_cast<int32_t>(mask));
}

} // namespace kelvo
