#include "KelvoDevice.h"

#include <string.h>

#include "DeviceQuery.h"
#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

namespace {

int setFlag(const char* file, const char* func, uint32_t request, bool enable,
            const char* failure) {
    uint8_t flag = enable ? 1 : 0;
    return requestDevice(file, func, KelvoDevice::kPath, request, &flag, sizeof(flag), failure);
}

int sendTimestamp(const char* file, const char* func, uint32_t request, int64_t timestamp,
                  const char* failure) {
    return requestDevice(file, func, KelvoDevice::kPath, request, &timestamp, sizeof(timestamp),
                         failure);
}

int sendTransmit(const char* file, const char* func, uint32_t request,
                 const dev_transmit_t* transmit, const char* failure) {
    if (transmit == nullptr) {
        logErrorLine("[%s] %s# Invalid parameter", file, func);
        return -5;
    }
    dev_transmit_t block = *transmit;
    return requestDevice(file, func, KelvoDevice::kPath, request, &block, sizeof(block), failure);
}

} // namespace

dev_transmit_t KelvoDevice::makeTransmit(int64_t timestamp, int32_t reason) {
    dev_transmit_t block;
    block.length = static_cast<int32_t>(sizeof(block) - sizeof(block.length));
    block.timestamp = timestamp;
    block.reason = reason;
    return block;
}

int KelvoDevice::setGpuEnable(bool enable) {
    return setFlag(KELVO_FILE_NAME, __func__, kSetGpuEnable, enable,
                   "Failed to ebable gpu infomation collection");
}

int KelvoDevice::getGpuInfo(gpu_info_t* info) {
    if (info == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    memset(info, 0, sizeof(*info));
    int ret = DEVICE_REQUEST(kPath, kGetGpuInfo, info, sizeof(*info), "Failed to get gpu info");
    if (ret != 0) {
        return ret;
    }
    if (info->count < 0 || info->count > kMaxGpuSteps) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Invalid gpu frequency count: %d", static_cast<int>(info->count));
        info->count = 0;
        return -2;
    }
    return 0;
}

int KelvoDevice::requestPidCpuTime(const dev_transmit_t* transmit) {
    return sendTransmit(KELVO_FILE_NAME, __func__, kRequestPidCpuTime, transmit,
                        "Failed to request pid cputime");
}

int KelvoDevice::getProcessName(int32_t pid, const char* threadName, std::string* processName) {
    if (processName == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    processName->clear();
    process_name_t block;
    memset(&block, 0, sizeof(block));
    block.pid = pid;
    if (threadName != nullptr) {
        memcpy(block.threadName, threadName, strnlen(threadName, sizeof(block.threadName) - 1));
    }
    int ret = DEVICE_REQUEST(kPath, kGetProcessName, &block, sizeof(block),
                             "Failed to get process name");
    if (ret != 0) {
        return ret;
    }
    size_t length = strnlen(block.processName, sizeof(block.processName));
    if (length == 0) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Failed to get process name");
        return -2;
    }
    processName->assign(block.processName, length);
    return 0;
}

int KelvoDevice::setLogStatsEnable(bool enable) {
    return setFlag(KELVO_FILE_NAME, __func__, kSetLogStatsEnable, enable,
                   "Failed to enable kworker logging");
}

int KelvoDevice::requestKworkerInfo(int64_t timestamp) {
    return sendTimestamp(KELVO_FILE_NAME, __func__, kRequestKworkerInfo, timestamp,
                         "Failed to request kworker info");
}

int KelvoDevice::requestUeventInfo(int64_t timestamp) {
    return sendTimestamp(KELVO_FILE_NAME, __func__, kRequestUeventInfo, timestamp,
                         "Failed to request uevent info");
}

int KelvoDevice::setBrightnessInfoEnable(bool enable) {
    return setFlag(KELVO_FILE_NAME, __func__, kSetBrightnessInfoEnable, enable,
                   "Failed to set brightness switch");
}

int KelvoDevice::getBrightnessInfo(uint32_t* brightness) {
    if (brightness == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    uint32_t value = 0;
    int ret = DEVICE_REQUEST(kPath, kGetBrightnessInfo, &value, sizeof(value),
                             "Failed to get brightness");
    if (ret == 0) {
        *brightness = value;
    }
    return ret;
}

int KelvoDevice::enablePidCpuTime(bool enable) {
    return setFlag(KELVO_FILE_NAME, __func__, kEnablePidCpuTime, enable,
                   "Failed to enable process cpu time statistics");
}

int KelvoDevice::setBinderStatsEnable(bool enable) {
    return setFlag(KELVO_FILE_NAME, __func__, kSetBinderStatsEnable, enable,
                   "Failed to ebable binder stats collection");
}

int KelvoDevice::requestBinderStats(const dev_transmit_t* transmit) {
    return sendTransmit(KELVO_FILE_NAME, __func__, kRequestBinderStats, transmit,
                        "Failed to request binder stats info");
}

} // namespace kelvo
