#pragma once

#include <stdint.h>

#include <map>
#include <mutex>
#include <string>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "storage/StorageOperator.h"

namespace kelvo {

// Component codes of the applications accounting.
enum apps_component : int32_t {
    APPS_AUDIO = 0,
    APPS_DISPLAY = 1,
    APPS_BLUETOOTH = 2,
    APPS_FRONT_CAMERA = 3,
    APPS_REAR_CAMERA = 4,
    APPS_CPU = 5,
    APPS_FLASHLIGHT = 6,
    APPS_GNSS = 7,
    APPS_GPU = 8,
    APPS_MODEM = 9,
    APPS_WIFI = 10,
    APPS_SENSOR = 11,
    APPS_COMPONENT_COUNT = 12,
};

// Merges, per clock hour and application, the energy every component handler
// attributed to it, writes one hourly_applications_accounting row per (hour,
// application, component) at each balance, and uploads the applications with
// the highest energy. Runs on its callers' threads; one mutex guards it.
class AppsAccounting : public StorageOperator {
public:
    static AppsAccounting* getInstance();

    // One record: int64 start of the interval, String8 application, int32
    // component code, then the component's data (common, shared, display or
    // network layout).
    int32_t addAppsData(const android::Parcel& record);
    // Writes everything held as rows and clears it.
    int32_t balanceAccount();
    int32_t uploadHourlyAppsAccounting(int64_t end, float scale);
    int32_t uploadDailyAppsAccounting(int64_t end, float scale);
    int32_t uploadDawnAppsAccounting(int64_t end, float scale);
    // The upload field of a component's energy class, -1 for an unknown code.
    static int32_t getSubEventId(int32_t component);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;

    static const table_attribute& table();

private:
    struct component_slot {
        bool used = false;
        int64_t energy[4] = {0, 0, 0, 0};
        // Common and network values are summed here; display keeps its
        // energy in energy[0] and its duration in value[0].
        int64_t value[4] = {0, 0, 0, 0};
        // Shared components: per sub-key sums of each value.
        std::map<int32_t, int64_t> shared[4];
    };
    struct app_components_data {
        component_slot slots[APPS_COMPONENT_COUNT];
    };

    AppsAccounting() = default;
    int32_t uploadAppsAccounting(uint32_t event, int64_t start, int64_t end, float scale);
    int32_t queryAppsComponent(int64_t start, int64_t end, const android::String8& name,
                               android::Parcel& object, float scale);
    static void writeRow(android::Parcel& rows, int64_t hour, const std::string& name,
                         int32_t component, const int64_t energy[4], const int64_t value[4]);

    std::mutex mLock;
    std::map<int64_t, std::map<std::string, app_components_data>> mStore;
};

} // namespace kelvo
