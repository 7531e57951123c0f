#pragma once

// The accounting library's logging. Lines have the daemon's form
// "[<source file base name>] <function># <message>" under the tag "kelvod",
// but the library keeps its own switches and never reaches the daemon's
// error table.
//
//   LLOGE  error: always written to the system log.
//   LLOGI  information: written when "persist.libkelvo.log.info" is 1.
//   LLOGD  debug: written when "persist.libkelvo.log.debug" is 1.

#include <android/log.h>
#include <stddef.h>
#include <stdint.h>

#include <atomic>

#define LIBKELVO_LOG_TAG "kelvod"

namespace kelvo {

// The switches, read from the properties before main.
extern std::atomic<int32_t> gLibLogDebugEnable;
extern std::atomic<int32_t> gLibLogInfoEnable;

// 1 when the property holds exactly the number 1, 0 when it holds anything
// else, the default when it is unset.
int32_t readLibLogSwitch(const char* property, int32_t defaultValue);
// Reads both switches from their properties again.
void loadLibLogSwitches();

// The base name of a source path: the text after its last '/'.
template <size_t N>
constexpr const char* libLogBaseName(const char (&path)[N]) {
    size_t start = 0;
    for (size_t i = 0; i < N && path[i] != '\0'; ++i) {
        if (path[i] == '/') {
            start = i + 1;
        }
    }
    return path + start;
}

} // namespace kelvo

#define LIBKELVO_FILE_NAME (::kelvo::libLogBaseName(__FILE__))

#define LLOGE(format, ...)                                                       \
    __android_log_print(ANDROID_LOG_ERROR, LIBKELVO_LOG_TAG, "[%s] %s# " format, \
                        LIBKELVO_FILE_NAME, __func__, ##__VA_ARGS__)

#define LLOGI(format, ...)                                                              \
    do {                                                                                \
        if (::kelvo::gLibLogInfoEnable.load(std::memory_order_relaxed) == 1) {          \
            __android_log_print(ANDROID_LOG_INFO, LIBKELVO_LOG_TAG, "[%s] %s# " format, \
                                LIBKELVO_FILE_NAME, __func__, ##__VA_ARGS__);           \
        }                                                                               \
    } while (0)

#define LLOGD(format, ...)                                                               \
    do {                                                                                 \
        if (::kelvo::gLibLogDebugEnable.load(std::memory_order_relaxed) == 1) {          \
            __android_log_print(ANDROID_LOG_DEBUG, LIBKELVO_LOG_TAG, "[%s] %s# " format, \
                                LIBKELVO_FILE_NAME, __func__, ##__VA_ARGS__);            \
        }                                                                                \
    } while (0)
