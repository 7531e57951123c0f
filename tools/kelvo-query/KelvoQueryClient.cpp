#include "KelvoQueryClient.h"

#include <binder/IServiceManager.h>
#include <inttypes.h>
#include <utils/String8.h>

#include "QueryListener.h"
#include "binder/KelvoService.h"
#include "core/QueryService.h"

namespace kelvo {

namespace {

const char* const kModuleNames[QueryService::MODULE_COUNT] = {
    "battery", "audio",      "bluetooth", "front_camera", "rear_camera", "cpu",    "display",
    "dpm",     "flashlight", "gnss",      "gpu",          "modem",       "sensor", "wifi",
};

// Values per row of a module's block.
int32_t columnsOf(int32_t module, int32_t flag) {
    if (flag != QueryService::kFlagTotals) {
        return 2;
    }
    switch (module) {
        case QueryService::MODULE_BATTERY:
        case QueryService::MODULE_DISPLAY:
        case QueryService::MODULE_GPU:
            return 1;
        case QueryService::MODULE_DPM:
            return 6;
        default:
            return 2;
    }
}

std::string format(const char* fmt, int64_t value) {
    char buf[32];
    snprintf(buf, sizeof(buf), fmt, value);
    return buf;
}

}  // namespace

android::sp<IKelvoService> KelvoQueryClient::connect() {
    android::sp<android::IBinder> binder =
        android::defaultServiceManager()->getService(android::String16(KelvoService::kServiceName));
    return binder == nullptr ? nullptr : android::interface_cast<IKelvoService>(binder);
}

KelvoQueryClient::KelvoQueryClient(const android::sp<IKelvoService>& service) : mService(service) {}

bool KelvoQueryClient::queryComponent(int64_t start, int64_t end, int32_t mask, int32_t flag,
                                      android::Parcel* response, int timeoutMs) {
    android::Parcel query;
    query.writeInt64(start);
    query.writeInt64(end);
    query.writeInt32(mask);
    query.writeInt32(flag);
    return send(IKelvoService::REQUEST_QUERY_COMPONENT, query, response, timeoutMs);
}

bool KelvoQueryClient::queryApplications(int64_t start, int64_t end, int32_t top,
                                         android::Parcel* response, int timeoutMs) {
    android::Parcel query;
    query.writeInt64(start);
    query.writeInt64(end);
    query.writeInt32(top);
    return send(IKelvoService::REQUEST_QUERY_APPLICATIONS, query, response, timeoutMs);
}

bool KelvoQueryClient::send(uint32_t code, const android::Parcel& fields, android::Parcel* response,
                            int timeoutMs) {
    if (mService == nullptr) {
        return false;
    }
    android::sp<QueryListener> listener = new QueryListener();
    android::Parcel query;
    query.appendFrom(&fields, 0, fields.dataSize());
    query.writeStrongBinder(listener);
    if (code == IKelvoService::REQUEST_QUERY_COMPONENT) {
        mService->requestQueryComponent(query);
    } else {
        mService->requestQueryApplications(query);
    }
    return listener->waitResponse(response, timeoutMs);
}

std::string KelvoQueryClient::formatComponent(const android::Parcel& response, int32_t flag) {
    response.setDataPosition(0);
    int32_t kind = -1;
    if (response.readInt32(&kind) != android::NO_ERROR || kind != QueryService::QUERY_COMPONENT) {
        return "malformed reply\n";
    }
    std::string out;
    int32_t module = 0;
    while (response.readInt32(&module) == android::NO_ERROR) {
        if (module < 0 || module >= QueryService::MODULE_COUNT) {
            return out + "malformed reply\n";
        }
        out += kModuleNames[module];
        int32_t rows = 0;
        if (response.readInt32(&rows) != android::NO_ERROR) {
            return out + "\nmalformed reply\n";
        }
        if (rows < 0) {
            out += ": no data\n";
            continue;
        }
        out += ":\n";
        int32_t columns = columnsOf(module, flag);
        for (int32_t r = 0; r < rows; ++r) {
            std::string line = " ";
            for (int32_t c = 0; c < columns; ++c) {
                int64_t value = 0;
                if (response.readInt64(&value) != android::NO_ERROR) {
                    return out + "malformed reply\n";
                }
                line += format(" %" PRId64, value);
            }
            out += line + "\n";
        }
    }
    return out;
}

std::string KelvoQueryClient::formatApplications(const android::Parcel& response) {
    response.setDataPosition(0);
    int32_t kind = -1;
    int32_t hours = 0;
    if (response.readInt32(&kind) != android::NO_ERROR || kind != QueryService::QUERY_APPLICATIONS ||
        response.readInt32(&hours) != android::NO_ERROR) {
        return "malformed reply\n";
    }
    if (hours < 0) {
        return "no data\n";
    }
    std::string out;
    for (int32_t h = 0; h < hours; ++h) {
        int32_t rows = 0;
        if (response.readInt32(&rows) != android::NO_ERROR) {
            return out + "malformed reply\n";
        }
        out += "hour " + std::to_string(h + 1) + (rows < 0 ? ": no data\n" : ":\n");
        for (int32_t r = 0; r < rows; ++r) {
            int64_t hour = 0;
            android::String16 name;
            int64_t energy = 0;
            if (response.readInt64(&hour) != android::NO_ERROR ||
                response.readString16(&name) != android::NO_ERROR ||
                response.readInt64(&energy) != android::NO_ERROR) {
                return out + "malformed reply\n";
            }
            out += format("  %" PRId64, hour) + " " + android::String8(name).string() +
                   format(" %" PRId64, energy) + "\n";
        }
    }
    return out;
}

}  // namespace kelvo
