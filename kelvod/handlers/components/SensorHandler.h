#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include <deque>
#include <set>
#include <tuple>

#include "handlers/components/TypedComponentHandler.h"

namespace kelvo {

// The sensors, charged by sensor type to the applications that enable them.
// Every enable and disable of a sensor by an application's connection is
// recorded; the handler keeps the set of enabled sensors, so the accounter
// sees one Activate per sensor and connection and one Deactivate when it is
// disabled, however often the service repeats itself. When the device slept,
// the sleep is cut out of every sensor that stayed on (sensors that keep
// waking the device, types 17, 19 and 65545, run through the sleep).
class SensorHandler : public TypedComponentHandler {
public:
    static constexpr uint32_t kElector = 0x4000;

    // Tag indexes.
    enum sensor_tag : int32_t {
        TAG_SENSOR_ENABLE = 0,
        TAG_SENSOR_DISABLE = 1,
    };
    // Customized message of the system handler: int64 suspend start, int64
    // resume time.
    static constexpr int32_t kSystemResume = 0;
    // A disable of this type ends every type of the connection.
    static constexpr int32_t kAnyType = -1;
    // Name and connection buffers, terminator included.
    static constexpr size_t kNameSize = 64;
    static constexpr size_t kConnectionSize = 128;
    // Sensors revised at resume: beyond, the oldest is dropped.
    static constexpr size_t kMaxCached = 512;
    // Enabled sensors followed: beyond, a new enable is refused.
    static constexpr size_t kMaxEnabled = 4096;

    struct sensor_state {
        int32_t type;
        int32_t uid;
        android::String8 name;
        android::String8 connection;
        bool operator<(const sensor_state& o) const {
            return std::tie(type, uid, name, connection) <
                   std::tie(o.type, o.uid, o.name, o.connection);
        }
        bool operator==(const sensor_state& o) const { return !(*this < o) && !(o < *this); }
    };

    SensorHandler();

    static const component_family& family();
    static const table_attribute& stateTable();
    // Whether a sensor type runs through the device's sleep.
    static bool isWakeUpType(int32_t type);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t onVmDied(const android::Parcel& data) override;

protected:
    android::String8 accountedName(const android::String8& name) const override;

private:
    static int32_t parseSensor(const char* text, sensor_state* out);
    int32_t enable(int64_t time, const sensor_state& s);
    int32_t disable(int64_t time, const sensor_state& s);
    int32_t revise(int64_t suspend, int64_t resume);
    void sendSensorAction(int32_t action, int64_t time, const sensor_state& s);

    // Every enabled sensor, wake-up types included.
    std::set<sensor_state> mEnabled;
    // The enabled sensors cut at resume, in the order they were enabled.
    std::deque<sensor_state> mCache;
};

}  // namespace kelvo
