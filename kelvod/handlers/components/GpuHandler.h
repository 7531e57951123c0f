#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// GPU energy per application from the kernel's frequency residency. The
// kernel statistics device reports the busy and idle time per frequency
// step since its previous read; each reading goes to the accounter, which
// charges it to the application in front, and is stored per frequency with
// that application's name. A reading is taken at every foreground change,
// on the hourly poll and on every other data poll while the screen is on.
// No log tags. Screen-off time is charged to "screen_off", which the hourly
// folds and the uploads leave out.
class GpuHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x800;
    static constexpr const char* kScreenOffName = "screen_off";

    GpuHandler();

    static const component_family& family();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void setupListeners(android::Parcel& out) override;
    int32_t lateInitialize() override;
    int32_t onForegroundChanged(const android::Parcel& data) override;
    int32_t onScreenStateChanged(const android::Parcel& data) override;
    int32_t onDataPolling(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;

private:
    // Reads the residency since the previous read and hands it to the
    // accounter (SetValue at `time`), then stores one row per frequency.
    // 0 (also for an empty reading), -18 when the device cannot be read.
    int32_t readFrequency(int64_t time);
    // The day's frequency distribution, an event of its own.
    int32_t setFrequencyDistribution(int64_t end);

    android::String8 mForeground;
    bool mScreenOn;
    bool mChargerOnline;
};

}  // namespace kelvo
