#pragma once

#include <stdint.h>

#include <map>
#include <mutex>

#include <binder/Parcel.h>
#include <utils/String8.h>
#include <zendrel/zendrel.h>

#include "storage/StorageOperator.h"

namespace kelvo {

// Event ids of the uploads.
enum upload_event : uint32_t {
    EVENT_HOURLY_COMPONENTS = 903001060,
    EVENT_HOURLY_APPLICATIONS = 903001061,
    EVENT_DAILY_COMPONENTS = 903001050,
    EVENT_DAILY_APPLICATIONS = 903001051,
    EVENT_DAILY_SYSTEM = 903001052,
    EVENT_DAILY_USERS = 903001053,
    EVENT_THERMAL_SHELL = 903001054,
    EVENT_THERMAL_SCENE = 903001055,
    EVENT_THERMAL_ABNORMALITY = 903002050,
    EVENT_DAILY_DATABASE = 903999001,
};

// Kinds of the records of an upload parcel.
enum upload_kind : int8_t {
    UPLOAD_INT = 0,          // int64
    UPLOAD_TEXT = 1,         // C string
    UPLOAD_CLASS = 2,        // uint32 class, uint32 byte count, nested upload parcel
    UPLOAD_CLASS_ARRAY = 3,  // as UPLOAD_CLASS; appends one element
    UPLOAD_DYNAMIC_PATH = 4, // C string path (parameter id 0xFFFFFFFF)
};

// The single gateway to the device's event library. Operators describe an
// event's parameters in an upload parcel; accumulated events wait, one object
// per event id, until the hourly routine sends them; immediate events are
// sent at once. Every send is recorded in debug_upload_result.
class DataUploader : public StorageOperator {
public:
    static DataUploader* getInstance();

    // Adds the parameters to the pending object of the event; without
    // `create` an event nobody filled yet is left alone (0).
    int32_t setEventData(uint32_t event, const android::Parcel& data, bool create);
    // As setEventData, then sends that event alone.
    int32_t setAndUploadEvent(uint32_t event, const android::Parcel& data, bool create);
    // Sends every pending event in ascending id order; always 0.
    int32_t uploadEvent();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;

    // Builders of upload parcels. Texts longer than limit - 1 are cut.
    static void formIntData(uint32_t id, int64_t value, android::Parcel& out);
    static void formVarcharData(uint32_t id, const char* text, int32_t limit,
                                android::Parcel& out);
    static void formDatetimeData(uint32_t id, int64_t time, android::Parcel& out);
    static void formCharData(uint32_t id, const char* text, int32_t limit, android::Parcel& out,
                             int8_t kind);
    static void formClassData(uint32_t id, uint32_t classId, const android::Parcel& content,
                              android::Parcel& out);
    static void formClassArray(uint32_t id, uint32_t classId, const android::Parcel& content,
                               android::Parcel& out);
    static void formDynamicPathData(const char* path, int32_t limit, android::Parcel& out);

    static const table_attribute& resultTable();

private:
    DataUploader();
    ~DataUploader() override;

    int32_t setEvent(uint32_t event, const android::Parcel& data, bool create);
    int32_t setEventParam(uint32_t event, zendrel_eventobj* object, const android::Parcel& data);
    int32_t sendEvent(uint32_t event, zendrel_eventobj* object);
    static void formNested(uint32_t id, int8_t kind, uint32_t classId,
                           const android::Parcel& content, android::Parcel& out);
    static int32_t uploadDailyData(int64_t from, int64_t to);

    std::mutex mLock;
    std::map<uint32_t, zendrel_eventobj*> mEvents;
};

} // namespace kelvo
