#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "handlers/components/ComponentHandler.h"
#include "handlers/components/TrafficCollector.h"

namespace kelvo {

// Wi-Fi energy per application. The accounter is fed measured quantities:
// per-application traffic increments of the "wlan" interfaces, scan counts,
// the time the link spent active at each signal level, the band, the hotspot
// and the charger state. Every data poll, screen change and foreground
// change books what happened since the previous one, so each increment
// carries the screen and foreground state it happened in.
//
// Results come back as application lists (header 1: a count, then rows with
// per-bucket share of the level time, tx and rx bytes and energy) and as
// the hotspot's record (header 0: the family's duration and energy row),
// both stored in raw_applications_wifi.
class WifiHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x8000;
    // Most records of one batch handed to the accounter.
    static constexpr int32_t kMaxBatchRecords = 5000;
    // Most uids with pending scans; scans of further uids are refused.
    static constexpr size_t kMaxScanUids = 5000;
    static constexpr int32_t kSignalLevels = 5;

    enum wifi_tag : int32_t {
        TAG_WIFI_ON = 0,
        TAG_WIFI_OFF = 1,
        TAG_WIFI_AP_ON = 2,
        TAG_WIFI_AP_OFF = 3,
        TAG_WIFI_SCAN_STARTED = 4,
        TAG_WIFI_BAND = 5,
        TAG_WIFI_ACTIVITY = 6,
        TAG_WIFI_SIGNAL_LEVEL = 7,
    };

    WifiHandler();
    // With lookups of the caller's own for the traffic's package and process
    // names (tests and the bench); null ones use the package properties.
    WifiHandler(TrafficCollector::PackageLookup packages, TrafficReader::NameLookup processes);
    ~WifiHandler() override;

    static const component_family& family();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void setupListeners(android::Parcel& out) override;
    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t onDataPolling(const android::Parcel& data) override;
    int32_t onUidRemoved(const android::Parcel& data) override;
    int32_t onScreenStateChanged(const android::Parcel& data) override;
    int32_t onForegroundChanged(const android::Parcel& data) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    void dump(android::String8& out) override;

private:
    struct scan_data {
        android::String8 name;
        uint32_t background = 0;
        uint32_t foreground = 0;
    };

    int32_t onScanStarted(int64_t time, const char* text);
    int32_t onBand(int64_t time, const char* text);
    int32_t onSignalLevel(const char* text);
    // Books the time since the activity start to the current level while
    // the link is active.
    void subtotalActivity();
    void changeActivity(int64_t time, bool active);

    // The five collectors, in their order.
    void pollAll(int64_t time);
    void collectActivity(int64_t time);
    void collectScans(int64_t time);

    int32_t sendSetValue(int32_t subtype, const android::Parcel& fields);
    // "Can not find name" once per uid and hour at error level.
    void logMissingName(int64_t time, int32_t uid);
    int32_t storeApplicationList(const android::Parcel& data);
    int32_t storeHotspotResult(const android::Parcel& data);

    std::unique_ptr<TrafficCollector> mTraffic;
    std::map<int32_t, scan_data> mScanData;
    // Scans of uids removed since the last scans collector.
    std::vector<scan_data> mRemovedScans;
    int32_t mActivityState;
    int64_t mActivityStart;  // monotonic ms
    int32_t mSignalLevel;
    int64_t mDistribution[kSignalLevels];
    bool mScreenOn;
    // Uids whose missing name was logged as an error in mNameLogHour.
    std::set<int32_t> mNameLogged;
    int64_t mNameLogHour;
};

}  // namespace kelvo
