#include "storage/DataUploader.h"

#include <cstring>
#include <string>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "storage/StorageManager.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

constexpr uint32_t kDynamicPathId = 0xFFFFFFFF;
constexpr int32_t kDatetimeLimit = 20;

const column_attribute kResultColumns[] = {
        {COLUMN_TIME, "timestamp"},
        {COLUMN_INT, "eventid"},
        {COLUMN_INT, "result"},
};
const table_attribute kResultTable = {"1.0", 1, 3, kResultColumns, "debug_upload_result"};

} // namespace

const table_attribute& DataUploader::resultTable() {
    return kResultTable;
}

DataUploader* DataUploader::getInstance() {
    static std::mutex lock;
    static DataUploader* instance = nullptr;
    std::lock_guard<std::mutex> guard(lock);
    if (instance == nullptr) {
        instance = new DataUploader();
    }
    return instance;
}

DataUploader::DataUploader() {
    // The file manager's daily copy on beta devices goes out through here.
    StorageManager::setDailyUploadHook(&DataUploader::uploadDailyData);
}

DataUploader::~DataUploader() {
    std::lock_guard<std::mutex> guard(mLock);
    for (auto& entry : mEvents) {
        zendrel_destroy_eventobj(entry.second);
    }
    mEvents.clear();
}

void DataUploader::addSchemaTable() {
    addSchema(kResultTable);
}

void DataUploader::cleanTables(int64_t time) {
    cleanObsoleteEntries(kResultTable.name, time, "timestamp");
}

int32_t DataUploader::uploadDailyData(int64_t from, int64_t to) {
    android::Parcel data;
    formDatetimeData(0, from, data);
    formDatetimeData(1, to, data);
    return getInstance()->setAndUploadEvent(EVENT_DAILY_DATABASE, data, true);
}

// A record: uint32 parameter id, the kind (an int8 carried in an int32 word,
// as binder carries bytes), then the value.
void DataUploader::formIntData(uint32_t id, int64_t value, android::Parcel& out) {
    out.writeUint32(id);
    out.writeInt32(UPLOAD_INT);
    out.writeInt64(value);
}

void DataUploader::formCharData(uint32_t id, const char* text, int32_t limit,
                                android::Parcel& out, int8_t kind) {
    if (text == nullptr) {
        KLOGE("Invalid parameter");
        return;
    }
    // A text shorter than its limit is kept whole, a longer one is cut to
    // limit - 1 characters; a limit below 1 leaves nothing.
    size_t keep = limit < 1 ? 0 : strnlen(text, static_cast<size_t>(limit));
    if (limit >= 1 && keep >= static_cast<size_t>(limit)) {
        keep = static_cast<size_t>(limit) - 1;
    }
    std::string cut(text, keep);
    out.writeUint32(id);
    out.writeInt32(kind);
    out.writeCString(cut.c_str());
}

void DataUploader::formVarcharData(uint32_t id, const char* text, int32_t limit,
                                   android::Parcel& out) {
    formCharData(id, text, limit, out, UPLOAD_TEXT);
}

void DataUploader::formDatetimeData(uint32_t id, int64_t time, android::Parcel& out) {
    TimeProvider provider(time);
    formCharData(id, provider.toString(TIME_FORMAT_DATE, true), kDatetimeLimit, out, UPLOAD_TEXT);
}

void DataUploader::formDynamicPathData(const char* path, int32_t limit, android::Parcel& out) {
    formCharData(kDynamicPathId, path, limit, out, UPLOAD_DYNAMIC_PATH);
}

void DataUploader::formNested(uint32_t id, int8_t kind, uint32_t classId,
                              const android::Parcel& content, android::Parcel& out) {
    if (content.dataSize() == 0) {
        KLOGI("Content is empty");
        return;
    }
    content.setDataPosition(0);
    out.writeUint32(id);
    out.writeInt32(kind);
    out.writeUint32(classId);
    out.writeUint32(static_cast<uint32_t>(content.dataSize()));
    out.appendFrom(&content, 0, content.dataSize());
}

void DataUploader::formClassData(uint32_t id, uint32_t classId, const android::Parcel& content,
                                 android::Parcel& out) {
    formNested(id, UPLOAD_CLASS, classId, content, out);
}

void DataUploader::formClassArray(uint32_t id, uint32_t classId, const android::Parcel& content,
                                  android::Parcel& out) {
    formNested(id, UPLOAD_CLASS_ARRAY, classId, content, out);
}

int32_t DataUploader::setEventParam(uint32_t event, zendrel_eventobj* object,
                                    const android::Parcel& data) {
    int32_t result = 0;
    while (data.dataAvail() > 0) {
        uint32_t id = 0;
        int32_t kind = -1;
        if (data.readUint32(&id) != android::NO_ERROR ||
            data.readInt32(&kind) != android::NO_ERROR) {
            KLOGE("Truncated upload record for eventid(%u)", event);
            return -3;
        }
        const uint16_t param = static_cast<uint16_t>(id & 0xFFFF);
        int ret = 0;
        switch (kind) {
            case UPLOAD_INT: {
                int64_t value = 0;
                if (data.readInt64(&value) != android::NO_ERROR) {
                    KLOGE("Truncated upload record for eventid(%u)", event);
                    return -3;
                }
                ret = zendrel_set_param(object, param, value);
                break;
            }
            case UPLOAD_TEXT:
            case UPLOAD_DYNAMIC_PATH: {
                const char* text = data.readCString();
                if (text == nullptr) {
                    // A text without its end cannot be read, nor anything after it.
                    KLOGE("Invalid text of parameter(%hu) for eventid(%u)", param, event);
                    return -3;
                }
                ret = kind == UPLOAD_TEXT ? zendrel_set_param(object, param, text)
                                          : zendrel_add_and_del_dynamic_path(object, text);
                break;
            }
            case UPLOAD_CLASS:
            case UPLOAD_CLASS_ARRAY: {
                uint32_t classId = 0;
                uint32_t length = 0;
                if (data.readUint32(&classId) != android::NO_ERROR ||
                    data.readUint32(&length) != android::NO_ERROR || length > data.dataAvail()) {
                    KLOGE("Invalid nested length of parameter(%hu) for eventid(%u)", param,
                          event);
                    return -3;
                }
                android::Parcel nested;
                nested.appendFrom(&data, data.dataPosition(), length);
                nested.setDataPosition(0);
                data.setDataPosition(data.dataPosition() + length);
                zendrel_eventobj* child = zendrel_create_eventobj(classId);
                if (child == nullptr) {
                    KLOGE("Failed to create event object");
                    HealthCounters::add(Health::UploadRecordsRefused);
                    result = -20;
                    continue;
                }
                if (setEventParam(classId, child, nested) != 0) {
                    KLOGE("Failed to set event parameters");
                    HealthCounters::add(Health::UploadRecordsRefused);
                    zendrel_destroy_eventobj(child);
                    result = -21;
                    continue;
                }
                ret = kind == UPLOAD_CLASS ? zendrel_set_param(object, param, child)
                                           : zendrel_fill_array_param(object, param, child);
                // The library keeps its own copy.
                zendrel_destroy_eventobj(child);
                break;
            }
            default:
                KLOGE("Unknown upload type: %d", kind);
                return -3;
        }
        if (ret != 0) {
            KLOGE("Failed to set parameter(%hu) for eventid(%u)", param, event);
            HealthCounters::add(Health::UploadRecordsRefused);
            result = -21;
        }
    }
    return result;
}

int32_t DataUploader::setEvent(uint32_t event, const android::Parcel& data, bool create) {
    data.setDataPosition(0);
    if (data.dataSize() == 0) {
        KLOGI("Data is empty");
        return 0;
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mEvents.find(event);
    if (it == mEvents.end()) {
        if (!create) {
            return 0;
        }
        zendrel_eventobj* object = zendrel_create_eventobj(event);
        if (object == nullptr) {
            KLOGE("Failed to create event object");
            HealthCounters::add(Health::UploadFailures);
            return -20;
        }
        it = mEvents.emplace(event, object).first;
    }
    int32_t ret = setEventParam(event, it->second, data);
    if (ret == -3) {
        // The parcel itself is broken: what it already set cannot be told
        // from what it did not, so the event goes.
        KLOGE("Failed to set event parameters");
        HealthCounters::add(Health::UploadFailures);
        zendrel_destroy_eventobj(it->second);
        mEvents.erase(it);
        return -21;
    }
    if (ret < 0) {
        // Single records were refused and skipped; the event keeps the
        // rest, and what the other senders gathered in it.
        KLOGE("Failed to set some parameters of eventid(%u)", event);
        return -21;
    }
    return 0;
}

int32_t DataUploader::setEventData(uint32_t event, const android::Parcel& data, bool create) {
    return setEvent(event, data, create);
}

int32_t DataUploader::sendEvent(uint32_t event, zendrel_eventobj* object) {
    if (object == nullptr) {
        KLOGE("Invalid parameter");
        return -5;
    }
    bool sent = zendrel_send_event(object) >= 0;
    android::Parcel row;
    row.writeInt64(TimeProvider::getCurrentTime(TIME_TYPE_WALL));
    row.writeInt32(static_cast<int32_t>(event));
    row.writeInt32(sent ? 0 : -1);
    insertEntries(kResultTable, row, 1, false);
    zendrel_destroy_eventobj(object);
    if (!sent) {
        HealthCounters::add(Health::UploadFailures);
    }
    return sent ? 0 : -22;
}

int32_t DataUploader::setAndUploadEvent(uint32_t event, const android::Parcel& data,
                                        bool create) {
    // Refused single records still let the rest of the event go out now;
    // the caller hears of them all the same.
    int32_t set = setEvent(event, data, create);
    if (set < 0) {
        KLOGE("Failed to set event(%u) data", event);
    }
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mEvents.find(event);
    if (it == mEvents.end()) {
        return set < 0 ? -21 : 0;
    }
    zendrel_eventobj* object = it->second;
    mEvents.erase(it);
    if (sendEvent(event, object) < 0) {
        KLOGE("Failed to send event: %u", event);
        return -22;
    }
    KLOGD("Upload eventid(%u) success", event);
    return set < 0 ? -21 : 0;
}

int32_t DataUploader::uploadEvent() {
    std::lock_guard<std::mutex> guard(mLock);
    for (auto& entry : mEvents) {
        if (sendEvent(entry.first, entry.second) == 0) {
            KLOGD("Upload eventid(%u) success", entry.first);
        } else {
            KLOGE("Failed to send event: %u", entry.first);
        }
    }
    mEvents.clear();
    return 0;
}

} // namespace kelvo
