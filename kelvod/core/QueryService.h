#pragma once

#include <binder/IBinder.h>
#include <binder/Parcel.h>
#include <stddef.h>
#include <stdint.h>
#include <utils/String8.h>

#include "storage/StorageOperator.h"
#include "utils/HandlerThread.h"

namespace kelvo {

class KelvoAgent;

// Answers the energy queries of system applications on a thread of its own,
// so that SQL work never blocks a binder thread. A request is a customized
// message whose `what` is the kind; the reply goes to the IKelvoListener
// binder at the end of the request, when there is one and it is alive.
//
// Component reply: int32 0, then for each selected module in ascending order
// int32 module id and its block. Applications reply: int32 1, int32 hour
// count, then per hour int32 n and n times (int64 hour, String16 name, int64
// energy). A block is int32 rows followed by the rows' values, or int32 -1
// when there is no data or the query failed, so a reply always parses.
class QueryService : public HandlerThread, public StorageOperator {
public:
    enum query_kind : int32_t {
        QUERY_COMPONENT = 0,
        QUERY_APPLICATIONS = 1,
    };
    enum module_id : int32_t {
        MODULE_BATTERY = 0,
        MODULE_AUDIO = 1,
        MODULE_BLUETOOTH = 2,
        MODULE_FRONT_CAMERA = 3,
        MODULE_REAR_CAMERA = 4,
        MODULE_CPU = 5,
        MODULE_DISPLAY = 6,
        MODULE_DPM = 7,
        MODULE_FLASHLIGHT = 8,
        MODULE_GNSS = 9,
        MODULE_GPU = 10,
        MODULE_MODEM = 11,
        MODULE_SENSOR = 12,
        MODULE_WIFI = 13,
        MODULE_COUNT = 14,
    };
    // Flag of a component query asking for totals over the raw rows.
    static constexpr int32_t kFlagTotals = 1;
    // Most applications per hour an applications query answers.
    static constexpr int32_t kMaxTopApplications = 100;
    // A block that would take the reply past this size is answered as -1,
    // which keeps the reply within one transaction.
    static constexpr size_t kMaxReplyBytes = 960 * 1024;

    QueryService();

    int32_t handleParcelMessage(const ParcelMessage& msg) override;

    int32_t handleQueryComponent(const android::Parcel& request, android::Parcel* reply);
    int32_t handleQueryApplications(const android::Parcel& request, android::Parcel* reply);

private:
    int32_t queryModule(int32_t module, int64_t start, int64_t end, int32_t flag,
                        android::Parcel* reply);
    int32_t queryMultiData(int64_t start, int64_t end, int32_t flag, const char* table,
                           android::Parcel* reply);
    int32_t querySimpleData(int64_t start, int64_t end, int32_t flag, const char* table,
                            android::Parcel* reply);
    int32_t queryBatteryData(int64_t start, int64_t end, int32_t flag, android::Parcel* reply);
    int32_t queryDpmData(int64_t start, int64_t end, int32_t flag, android::Parcel* reply);
    int32_t queryApplicationsData(int64_t hour, int32_t top, android::Parcel* reply);
    // Runs the query and writes its block; a failed query writes -1 and
    // returns -2.
    int32_t doQueryData(const android::String8& sql, int32_t columns, android::Parcel* reply);
    // Appends a block unless it would take the reply past kMaxReplyBytes.
    static void appendBlock(const android::Parcel& block, android::Parcel* reply);
    void answer(const android::Parcel& request, const android::Parcel& reply);

    // The listener answered last, kept until the next answer: its proxy is
    // then let go on this thread, well after the binder thread that carried
    // the request dropped its own reference.
    android::sp<android::IBinder> mLastListener;
};

}  // namespace kelvo
