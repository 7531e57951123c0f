#include "DpmDevice.h"

#include <fcntl.h>
#include <string.h>

#include "DeviceQuery.h"
#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

namespace {

// Reads (or exchanges) one int32; a negative value read fails with -2.
int exchangeValue(const char* file, const char* func, uint32_t request, int32_t value,
                  const char* failure, const char* debugFormat) {
    int ret = requestDevice(file, func, DpmDevice::kPath, request, &value, sizeof(value), failure);
    if (ret != 0) {
        return ret;
    }
    if (value < 0) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        logErrorLine("[%s] %s# Invalid value read: %d", file, func, static_cast<int>(value));
        return -2;
    }
    KLOGM(LOG_MODULE_DPM, "%s: %d", debugFormat, static_cast<int>(value));
    return value;
}

int capCount(const char* file, const char* func, int value, int32_t cap) {
    if (value > cap) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        logErrorLine("[%s] %s# Count %d capped at %d", file, func, value, static_cast<int>(cap));
        return cap;
    }
    return value;
}

} // namespace

bool DpmDevice::isReady() {
    int fd = openDevice(kPath, O_RDONLY);
    bool ready = fd >= 0;
    if (ready) {
        closeDevice(fd);
    }
    KLOGM(LOG_MODULE_DPM, "ready: %s", ready ? "true" : "false");
    return ready;
}

int DpmDevice::getVersion() {
    return exchangeValue(KELVO_FILE_NAME, __func__, kGetVersion, 0, "Failed to get version",
                         "version");
}

int DpmDevice::setEnable(int32_t enable) {
    int ret = DEVICE_REQUEST(kPath, kSetEnable, &enable, sizeof(enable),
                             "Failed to set enable state");
    if (ret == 0) {
        KLOGM(LOG_MODULE_DPM, "state: %d", static_cast<int>(enable));
    }
    return ret;
}

int DpmDevice::setPeriod(int32_t period) {
    int ret = DEVICE_REQUEST(kPath, kSetPeriod, &period, sizeof(period), "Failed to set period");
    if (ret == 0) {
        KLOGM(LOG_MODULE_DPM, "period: %d", static_cast<int>(period));
    }
    return ret;
}

int DpmDevice::getIpCount() {
    int count = exchangeValue(KELVO_FILE_NAME, __func__, kGetIpCount, 0, "Failed to get ip count",
                              "count");
    return count < 0 ? count : capCount(KELVO_FILE_NAME, __func__, count, kMaxIpCount);
}

int DpmDevice::getIpData(int32_t capacity, std::vector<dpm_ip_record_t>* records) {
    if (records == nullptr || capacity <= 0 || capacity > kMaxIpCount) {
        KLOGE("Invalid parameter");
        return -5;
    }
    records->clear();
    size_t size = sizeof(dpm_ip_header_t) + static_cast<size_t>(capacity) * sizeof(dpm_ip_record_t);
    std::vector<uint8_t> buffer(size, 0);
    dpm_ip_header_t head = {capacity, 0};
    memcpy(buffer.data(), &head, sizeof(head));
    int ret = DEVICE_REQUEST(kPath, kGetIpData, buffer.data(), buffer.size(),
                             "Failed to get ip data");
    if (ret != 0) {
        return ret;
    }
    memcpy(&head, buffer.data(), sizeof(head));
    if (head.count < 0) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Invalid value read: %d", static_cast<int>(head.count));
        return -2;
    }
    int count = capCount(KELVO_FILE_NAME, __func__, head.count, capacity);
    KLOGM(LOG_MODULE_DPM, "data count: %d", count);
    records->resize(static_cast<size_t>(count));
    if (count > 0) {
        memcpy(records->data(), buffer.data() + sizeof(head),
               static_cast<size_t>(count) * sizeof(dpm_ip_record_t));
    }
    return 0;
}

int DpmDevice::getPeriod(int32_t period) {
    return exchangeValue(KELVO_FILE_NAME, __func__, kGetPeriod, period, "Failed to get period",
                         "period");
}

int DpmDevice::getDdrFreqCount() {
    int count = exchangeValue(KELVO_FILE_NAME, __func__, kGetDdrFreqCount, 0,
                              "Failed to get ddr frequency count", "count");
    return count < 0 ? count : capCount(KELVO_FILE_NAME, __func__, count, kMaxDdrSteps);
}

int DpmDevice::getDdrData(int32_t steps, dpm_ddr_data_t* data) {
    if (data == nullptr || steps < 0 || steps > kMaxDdrSteps) {
        KLOGE("Invalid parameter");
        return -5;
    }
    // Room for the most steps whatever the count, so a kernel that writes
    // more than it announced stays inside the buffer; the request itself
    // names the two blocks' real size.
    dpm_ddr_block_t blocks[2];
    memset(blocks, 0, sizeof(blocks));
    size_t blockSize = sizeof(blocks[0].name) + static_cast<size_t>(steps) * sizeof(int64_t);
    int ret = DEVICE_REQUEST(kPath, kGetDdrData, blocks, 2 * blockSize, "Failed to get ddr data");
    if (ret != 0) {
        return ret;
    }
    const uint8_t* bytes = reinterpret_cast<const uint8_t*>(blocks);
    for (size_t i = 0; i < 2; ++i) {
        const uint8_t* block = bytes + i * blockSize;
        const char* name = reinterpret_cast<const char*>(block);
        data->names[i].assign(name, strnlen(name, sizeof(blocks[0].name)));
        data->values[i].resize(static_cast<size_t>(steps));
        if (steps > 0) {
            memcpy(data->values[i].data(), block + sizeof(blocks[0].name),
                   static_cast<size_t>(steps) * sizeof(int64_t));
        }
    }
    KLOGM(LOG_MODULE_DPM, "data count: %d", static_cast<int>(steps));
    return 0;
}

} // namespace kelvo
