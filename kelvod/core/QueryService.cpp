#include "core/QueryService.h"

#include <binder/IBinder.h>
#include <utils/String16.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "binder/IKelvoListener.h"
#include "core/KelvoAgent.h"

namespace kelvo {

namespace {

constexpr int32_t kNoData = -1;
// The DPM handler stores its current counters when asked with this code.
constexpr int32_t kDpmStoreCounters = 0;

struct module_form {
    const char* table;    // table name part of the multi and simple forms
    bool simple;          // one energy column instead of foreground/background
    const char* failure;  // what a failed query logs
};

// By module id; battery and DPM have forms of their own.
const module_form kModules[QueryService::MODULE_COUNT] = {
    {nullptr, false, nullptr},
    {"audio", false, "Failed to query audio data"},
    {"bluetooth", false, "Failed to query bluetooth data"},
    {"front_camera", false, "Failed to query front camera data"},
    {"rear_camera", false, "Failed to query rear camera data"},
    {"cpu", false, "Failed to query cpu data"},
    {"backlight", true, "Failed to query dispaly data"},
    {nullptr, false, nullptr},
    {"flashlight", false, "Failed to query flashlight data"},
    {"gnss", false, "Failed to query gnss data"},
    {"gpu", true, "Failed to query gpu data"},
    {"modem", false, "Failed to query modem data"},
    {"sensor", false, "Failed to query sensor data"},
    {"wifi", false, "Failed to query wifi data"},
};

long long ll(int64_t value) {
    return static_cast<long long>(value);
}

// A total over no rows is one NULL row: asking for at least one row turns it
// into no row at all, so the block says "no data".
constexpr const char* kSomeRows = " HAVING COUNT(*) > 0";

}  // namespace

QueryService::QueryService() : HandlerThread("QueryService", -2) {}

int32_t QueryService::handleParcelMessage(const ParcelMessage& msg) {
    if (msg.type != MESSAGE_CUSTOMIZED) {
        KLOGE("Unknown message type: %d", msg.type);
        return -3;
    }
    const android::Parcel& request = msg.getParcel();
    android::Parcel reply;
    int32_t ret;
    switch (msg.what) {
        case QUERY_COMPONENT:
            ret = handleQueryComponent(request, &reply);
            break;
        case QUERY_APPLICATIONS:
            ret = handleQueryApplications(request, &reply);
            break;
        default:
            KLOGE("Unknown message argument: %d", msg.what);
            return -2;
    }
    if (ret != -5) {
        answer(request, reply);
    }
    return ret;
}

void QueryService::answer(const android::Parcel& request, const android::Parcel& reply) {
    if (request.dataAvail() == 0) {
        return;  // nobody to answer
    }
    android::sp<android::IBinder> binder;
    if (request.readNullableStrongBinder(&binder) != android::NO_ERROR || binder == nullptr) {
        KLOGE("Invalid query listener");
        HealthCounters::add(Health::ServiceRequestsRefused);
        return;
    }
    android::sp<IKelvoListener> listener = android::interface_cast<IKelvoListener>(binder);
    if (listener == nullptr || !binder->isBinderAlive()) {
        return;
    }
    if (reply.dataSize() == 0) {
        KLOGE("Empty query response");
        return;
    }
    listener->onQueryResponse(reply);
    mLastListener = binder;
}

int32_t QueryService::handleQueryComponent(const android::Parcel& request, android::Parcel* reply) {
    int64_t start = 0;
    int64_t end = 0;
    int32_t mask = 0;
    int32_t flag = 0;
    if (request.readInt64(&start) != android::NO_ERROR ||
        request.readInt64(&end) != android::NO_ERROR ||
        request.readInt32(&mask) != android::NO_ERROR ||
        request.readInt32(&flag) != android::NO_ERROR) {
        KLOGE("Invalid component query request");
        HealthCounters::add(Health::ServiceRequestsRefused);
        return -5;
    }
    KLOGD("start=%lld, end=%lld, mask=0x%04x, flag=%d", ll(start), ll(end), mask, flag);
    reply->writeInt32(QUERY_COMPONENT);
    int32_t ret = 0;
    for (int32_t module = 0; module < MODULE_COUNT; ++module) {
        if ((static_cast<uint32_t>(mask) & (1u << module)) != 0) {
            reply->writeInt32(module);
            ret = queryModule(module, start, end, flag, reply);
        }
    }
    return ret;
}

int32_t QueryService::queryModule(int32_t module, int64_t start, int64_t end, int32_t flag,
                                  android::Parcel* reply) {
    if (module == MODULE_BATTERY) {
        return queryBatteryData(start, end, flag, reply);
    }
    if (module == MODULE_DPM) {
        return queryDpmData(start, end, flag, reply);
    }
    const module_form& form = kModules[module];
    int32_t ret = form.simple ? querySimpleData(start, end, flag, form.table, reply)
                              : queryMultiData(start, end, flag, form.table, reply);
    if (ret < 0) {
        KLOGE("%s", form.failure);
    }
    return ret;
}

int32_t QueryService::queryMultiData(int64_t start, int64_t end, int32_t flag, const char* table,
                                     android::Parcel* reply) {
    android::String8 sql;
    if (flag == kFlagTotals) {
        sql.appendFormat(
            "SELECT SUM(foreground_energy), SUM(background_energy) FROM "
            "raw_applications_%s WHERE start_time >= %lld AND end_time <= %lld%s",
            table, ll(start), ll(end), kSomeRows);
    } else {
        sql.appendFormat(
            "SELECT timestamp, SUM(foreground_energy + background_energy) FROM "
            "hourly_component_%s WHERE timestamp > %lld AND timestamp <= %lld "
            "GROUP BY timestamp",
            table, ll(start), ll(end));
    }
    return doQueryData(sql, 2, reply);
}

int32_t QueryService::querySimpleData(int64_t start, int64_t end, int32_t flag, const char* table,
                                      android::Parcel* reply) {
    android::String8 sql;
    int32_t columns = 2;
    if (flag == kFlagTotals) {
        sql.appendFormat(
            "SELECT SUM(energy) FROM raw_applications_%s WHERE start_time >= %lld "
            "AND end_time <= %lld%s",
            table, ll(start), ll(end), kSomeRows);
        columns = 1;
    } else {
        sql.appendFormat(
            "SELECT timestamp, SUM(energy) FROM hourly_component_%s WHERE "
            "timestamp > %lld AND timestamp <= %lld GROUP BY timestamp",
            table, ll(start), ll(end));
    }
    return doQueryData(sql, columns, reply);
}

int32_t QueryService::queryBatteryData(int64_t start, int64_t end, int32_t flag,
                                       android::Parcel* reply) {
    android::String8 sql;
    int32_t columns = 2;
    if (flag == kFlagTotals) {
        sql.appendFormat(
            "SELECT SUM(discharge_screen_on_gas_gauge + "
            "discharge_screen_off_gas_gauge) FROM raw_component_battery WHERE "
            "start_time >= %lld AND end_time <= %lld%s",
            ll(start), ll(end), kSomeRows);
        columns = 1;
    } else {
        sql.appendFormat(
            "SELECT timestamp, SUM(discharge_screen_on_gas_gauge + "
            "discharge_screen_off_gas_gauge) FROM hourly_component_battery WHERE "
            "timestamp > %lld AND timestamp <= %lld GROUP BY timestamp",
            ll(start), ll(end));
    }
    return doQueryData(sql, columns, reply);
}

int32_t QueryService::queryDpmData(int64_t start, int64_t end, int32_t flag,
                                   android::Parcel* reply) {
    // The DPM handler first stores what it counted so far.
    android::Parcel dpmReply;
    if (KelvoAgent::getInstance()->sendToHandler(HANDLER_DPM, kDpmStoreCounters, android::Parcel(),
                                                 &dpmReply, true) < 0) {
        KLOGE("Failed to send message to dpm");
        reply->writeInt32(kNoData);
        return -2;
    }
    android::String8 sql;
    int32_t columns = 2;
    if (flag == kFlagTotals) {
        sql.appendFormat(
            "SELECT ip, SUM(off_time), SUM(busy_time), SUM(busy_time_low_voltage), "
            "SUM(idle_time), SUM(energy) FROM raw_component_dpm WHERE start_time "
            ">= %lld AND end_time <= %lld GROUP BY ip ORDER BY SUM(energy) DESC",
            ll(start), ll(end));
        columns = 6;
    } else {
        sql.appendFormat(
            "SELECT timestamp, SUM(energy) FROM hourly_component_dpm WHERE "
            "timestamp > %lld AND timestamp <= %lld GROUP BY timestamp",
            ll(start), ll(end));
    }
    return doQueryData(sql, columns, reply);
}

int32_t QueryService::doQueryData(const android::String8& sql, int32_t columns,
                                  android::Parcel* reply) {
    android::Parcel result;
    int32_t rows = 0;
    if (queryEntriesSimple(sql, &result, columns, rows) < 0) {
        KLOGE("Failed to query data");
        reply->writeInt32(kNoData);
        return -2;
    }
    if (rows < 1 || result.dataAvail() == 0) {
        reply->writeInt32(kNoData);
        return 0;
    }
    android::Parcel block;
    block.writeInt32(rows);
    block.appendFrom(&result, result.dataPosition(), result.dataAvail());
    appendBlock(block, reply);
    return 0;
}

void QueryService::appendBlock(const android::Parcel& block, android::Parcel* reply) {
    if (reply->dataSize() + block.dataSize() > kMaxReplyBytes) {
        KLOGE("Query reply too large: %zu + %zu bytes", reply->dataSize(), block.dataSize());
        HealthCounters::add(Health::ServiceRequestsRefused);
        reply->writeInt32(kNoData);
        return;
    }
    reply->appendFrom(&block, 0, block.dataSize());
}

int32_t QueryService::handleQueryApplications(const android::Parcel& request,
                                              android::Parcel* reply) {
    int64_t start = 0;
    int64_t end = 0;
    int32_t top = 0;
    if (request.readInt64(&start) != android::NO_ERROR ||
        request.readInt64(&end) != android::NO_ERROR ||
        request.readInt32(&top) != android::NO_ERROR) {
        KLOGE("Invalid applications query request");
        HealthCounters::add(Health::ServiceRequestsRefused);
        return -5;
    }
    KLOGD("start=%lld, end=%lld, top=%d", ll(start), ll(end), top);
    if (top > kMaxTopApplications) {
        HealthCounters::add(Health::ServiceRequestsRefused);
        top = kMaxTopApplications;
    }
    reply->writeInt32(QUERY_APPLICATIONS);
    android::String8 sql;
    sql.appendFormat(
        "SELECT timestamp FROM hourly_applications_accounting WHERE timestamp > %lld "
        "AND timestamp <= %lld GROUP BY timestamp ORDER BY timestamp",
        ll(start), ll(end));
    android::Parcel hours;
    if (doQueryData(sql, 1, &hours) < 0) {
        reply->writeInt32(kNoData);
        return -2;
    }
    hours.setDataPosition(0);
    int32_t count = hours.readInt32();
    reply->writeInt32(count);
    for (int32_t i = 0; i < count; ++i) {
        int64_t hour = hours.readInt64();
        if (queryApplicationsData(hour, top, reply) < 0) {
            KLOGE("Failed to query applications data, timestamp = %lld", ll(hour));
        }
    }
    return 0;
}

int32_t QueryService::queryApplicationsData(int64_t hour, int32_t top, android::Parcel* reply) {
    if (top < 1) {
        reply->writeInt32(kNoData);
        return 0;
    }
    android::String8 sql;
    sql.appendFormat(
        "SELECT timestamp, name, SUM(foreground_energy + background_energy) FROM "
        "hourly_applications_accounting WHERE timestamp = %lld GROUP BY name ORDER "
        "BY SUM(foreground_energy + background_energy) DESC LIMIT %d",
        ll(hour), top);
    android::Parcel rows;
    if (doQueryData(sql, 3, &rows) < 0) {
        KLOGE("Failed to query applications");
        reply->writeInt32(kNoData);
        return -2;
    }
    rows.setDataPosition(0);
    int32_t n = rows.readInt32();
    android::Parcel block;
    block.writeInt32(n);
    for (int32_t i = 0; i < n; ++i) {
        block.writeInt64(rows.readInt64());
        block.writeString16(android::String16(rows.readString8()));
        block.writeInt64(rows.readInt64());
    }
    if (n < 1) {
        reply->writeInt32(kNoData);
        return 0;
    }
    appendBlock(block, reply);
    return 0;
}

}  // namespace kelvo
