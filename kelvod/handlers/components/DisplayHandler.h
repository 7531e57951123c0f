#pragma once

#include <stdint.h>
#include <utils/String8.h>

#include <atomic>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// The backlight, charged to the application in front. The display handler
// is where every other operator learns the foreground application and the
// screen state: it derives both from the foreground and brightness messages
// and broadcasts them. It also records how long each brightness level was
// held (with and without the charger) and the ambient-light levels seen, and
// uploads both distributions once a day.
//
// Under policy 1 every brightness message sets the accounter's level; under
// policy 2 the kernel statistics device reports the effective brightness of
// each span instead, read whenever a span ends (foreground change, hour,
// day, charger, clock, balance or shut-down).
class DisplayHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x1;

    // Tag indexes; the four ambient tags carry ambient types 0..3 in order.
    enum display_tag : int32_t {
        TAG_FOREGROUND_CHANGED = 0,
        TAG_BRIGHTNESS = 1,
        TAG_AUTO_AMBIENT_LIGHT = 2,
        TAG_MANUAL_AMBIENT_LIGHT = 3,
        TAG_APP_AMBIENT_LIGHT = 4,
        TAG_FRONT_AMBIENT_LIGHT = 5,
    };

    static constexpr int32_t kPolicyLevels = 1;
    static constexpr int32_t kPolicyAdvanced = 2;
    static constexpr int32_t kMaxBrightness = 255;
    static constexpr uint32_t kMaxAdvancedBrightness = 10000;
    static constexpr int32_t kAmbientLevels = 6;
    // Pause before each foreground notification, so that the foreground
    // application's own start-up records reach the others first.
    static constexpr int64_t kForegroundNotificationDelayMs = 200;

    static constexpr const char* kScreenOffName = "screen_off";
    static constexpr const char* kPowerOffName = "power_off";
    static constexpr const char* kLauncherName = "com.tovaro.android.launcher";

    DisplayHandler();

    static const component_family& family();
    // Shortens the foreground notification delay (tests); a negative value
    // restores kForegroundNotificationDelayMs.
    static void setForegroundNotificationDelayMs(int64_t ms);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t setConfiguration() override;
    int32_t checkEnable() override;
    void setupListeners(android::Parcel& out) override;
    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t onChargerOnlineChanged(const android::Parcel& data) override;
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onDailyTick(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onTimeChanged(const android::Parcel& data) override;
    int32_t onAbnormalityThermal(const android::Parcel& data) override;
    int32_t onForceBalance(const android::Parcel& data) override;
    int32_t onShutDown(const android::Parcel& data) override;

private:
    int32_t handleBrightness(int64_t time, const char* text);
    int32_t handleForeground(int64_t time, const char* text);
    int32_t handleAmbientLight(int64_t time, int32_t type, const char* text);
    void changeForeground(int64_t time, const android::String8& name);
    void changeScreen(int64_t time, bool on);
    // Records the span of the level held since the last brightness time,
    // ending at `time`, then starts a new one with `level`.
    void closeSpan(int64_t time, int32_t level);
    // Policy 2: hands the device's value for the span since the last report
    // to the accounter, and starts the next span at `time`.
    void reportAdvanced(int64_t time);
    void sendSetValue(int64_t time, int32_t value);
    // The daily statistics event: screen-off time, the backlight and the
    // ambient-light distributions.
    int32_t setDailyStatistics(int64_t end);

    bool mChargerOnline;
    bool mScreenOn;
    int32_t mLastBrightness;
    int64_t mLastBrightnessTime;
    android::String8 mForeground;
    // Start of the span the next advanced value describes; -1 until the
    // first report, which starts from the system's boot.
    int64_t mAdvancedReportTime;

    static std::atomic<int64_t> sForegroundDelayMs;
};

}  // namespace kelvo
