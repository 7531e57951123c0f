#pragma once

#include <binder/Parcel.h>
#include <stddef.h>
#include <stdint.h>

#include <functional>
#include <map>
#include <string>

#include "storage/TableAttribute.h"
#include "utils/TrafficReader.h"

namespace kelvo {

// Columns of a handler's per-package and per-interface traffic tables.
inline const column_attribute kTrafficPackageColumns[] = {
    {COLUMN_TIME, "timestamp"},  {COLUMN_TEXT, "name"},      {COLUMN_INT, "uid"},
    {COLUMN_TEXT, "interface"},  {COLUMN_INT, "foreground"}, {COLUMN_LONG, "rx_bytes"},
    {COLUMN_LONG, "rx_packets"}, {COLUMN_LONG, "tx_bytes"},  {COLUMN_LONG, "tx_packets"},
};
inline const column_attribute kTrafficInterfaceColumns[] = {
    {COLUMN_TIME, "timestamp"},  {COLUMN_TEXT, "interface"}, {COLUMN_LONG, "rx_bytes"},
    {COLUMN_LONG, "rx_packets"}, {COLUMN_LONG, "tx_bytes"},  {COLUMN_LONG, "tx_packets"},
};
inline const table_attribute kRawWifiPackageTraffic = {"1.0", 1, 9, kTrafficPackageColumns,
                                                       "raw_wifi_package_traffic"};
inline const table_attribute kRawWifiInterfaceTraffic = {"1.0", 1, 6, kTrafficInterfaceColumns,
                                                         "raw_wifi_interface_traffic"};
inline const table_attribute kRawModemPackageTraffic = {"1.0", 1, 9, kTrafficPackageColumns,
                                                        "raw_modem_package_traffic"};
inline const table_attribute kRawModemInterfaceTraffic = {"1.0", 1, 6, kTrafficInterfaceColumns,
                                                          "raw_modem_interface_traffic"};

// What tells one user of the traffic collector from another.
struct traffic_collector_config {
    const char* fragment;      // interface name fragment of the reader: "wlan", "rmnet"
    int32_t accounterType;     // 7 Wi-Fi, 10 modem
    int32_t interfaceSubtype;  // SetValue subtype of the interface packets: 0 Wi-Fi, 3 modem
    int32_t packageSubtype;    // SetValue subtype of the package records: 1 Wi-Fi, 4 modem
    const table_attribute* packageTable;
    const table_attribute* interfaceTable;
    // Error lines of a baseline reading that failed.
    const char* interfaceBaselineError;
    const char* packageBaselineError;
    const char* pidBaselineError;
};

inline const traffic_collector_config kWifiTrafficConfig = {
    "wlan",
    7,
    0,
    1,
    &kRawWifiPackageTraffic,
    &kRawWifiInterfaceTraffic,
    "Failed to initialize interface traffic",
    "Failed to initialize packages traffic",
    "Failed to initialize pid traffic",
};
inline const traffic_collector_config kModemTrafficConfig = {
    "rmnet",
    10,
    3,
    4,
    &kRawModemPackageTraffic,
    &kRawModemInterfaceTraffic,
    "Failed to get interface traffic",
    "Failed to get traffic data.",
    "Failed to get pid traffic",
};

// The traffic half of a handler that charges network use (Wi-Fi, modem): it
// owns the traffic reader of the handler's interfaces and turns each poll's
// increments into accounter actions and raw rows. Used on the owning
// handler's thread only (never the CPU handler's).
//
// The owner:
//  - constructs it with its configuration, a sink that hands an action
//    parcel to its accounter (KelvoOperator::feedAccounter), and optionally
//    the package lookup by uid and the process-name lookup (tests, bench);
//  - calls takeBaseline() once at construction;
//  - registers config.packageTable and config.interfaceTable among its tables;
//  - at each poll at time t, in this order: collectInterfaces(t), its own
//    collectors, collectSystem(t, foreground), collectPackages(t); and
//    collectSystem(t, old foreground) alone before a foreground change;
//  - calls removeUid(uid) when a uid is removed.
//
// Actions (after int32 accounter type, int32 SetValue, int32 subtype):
//   interface subtype: int64 tx packets, int64 rx packets (sums over this
//     poll's interface increments), sent when a packet moved;
//   package subtype: int64 t, int32 n, then n records of String8 name, int32
//     counter set (1 foreground), int64 tx packets, int64 rx packets, int64
//     tx bytes, int64 rx bytes; sent with 1 to kMaxRecords records. The uid
//     increments come first, then the system processes collected since the
//     last package poll (background, then foreground).
// Rows: one interface row per interface increment; one package row per uid
// increment with a name (its counter set as `foreground`) and per process
// increment (`foreground` 0).
class TrafficCollector {
public:
    static constexpr size_t kMaxInterfaceRows = 5000;
    static constexpr size_t kMaxSystemRows = 1000;
    static constexpr size_t kMaxSystemNames = 1000;
    static constexpr size_t kMaxInterfacesPerName = 20;
    static constexpr int32_t kMaxRecords = 5000;
    static constexpr int64_t kHourMs = 3600 * 1000;
    // Uids whose missing name was reported this hour, remembered at most.
    static constexpr size_t kMaxReportedUids = 1000;

    using ActionSink = std::function<int32_t(const android::Parcel& action)>;
    // Package name of a uid: 0 with the name, or a negative code.
    using PackageLookup = std::function<int32_t(int32_t uid, std::string* name)>;

    TrafficCollector(const traffic_collector_config& config, ActionSink sink,
                     PackageLookup packages = nullptr,
                     TrafficReader::NameLookup processes = nullptr);

    // The first readings of the three views, counted as nothing.
    void takeBaseline();
    // 0, or -2 when the interface view could not be read.
    int32_t collectInterfaces(int64_t time);
    // Process increments, booked foreground when the name is the current
    // foreground; kept until the next collectPackages. 0, or -2.
    int32_t collectSystem(int64_t time, const std::string& foreground);
    // 0, or -2 when the uid view could not be read (the system traffic
    // collected before is still sent).
    int32_t collectPackages(int64_t time);
    void removeUid(int32_t uid);
    // The application in front (the launcher until the first change).
    const std::string& foreground() const { return mForeground; }
    // Books the process increments so far to the old foreground, then
    // takes the new one.
    void changeForeground(int64_t time, const std::string& package);

    TrafficReader& reader() { return mReader; }
    const traffic_collector_config& config() const { return mConfig; }
    // Package lookups made so far.
    uint64_t packageLookups() const { return mPackageLookups; }
    // (name, interface) entries of system traffic waiting for collectPackages.
    size_t pendingSystemEntries() const;

private:
    // Process name -> interface -> counters, per counter set.
    using SystemMap = std::map<std::string, std::map<std::string, traffic_throughput>>;

    void beginAction(android::Parcel& action, int32_t subtype) const;
    // Appends one package record while fewer than kMaxRecords are there.
    bool appendRecord(android::Parcel& records, int32_t* count, const std::string& name,
                      int32_t counter, const traffic_throughput& t);
    // Appends one map's entries; empties it.
    void drainSystem(SystemMap& map, int32_t counter, android::Parcel& records, int32_t* count);
    // "Can not find name": an error once per uid and hour, debug after.
    void reportMissingName(int32_t uid, int64_t time);

    const traffic_collector_config mConfig;
    ActionSink mSink;
    PackageLookup mPackages;
    TrafficReader mReader;
    SystemMap mSystem[2];
    std::map<int32_t, int64_t> mMissingNameHour;
    uint64_t mPackageLookups = 0;
    std::string mForeground = "com.tovaro.android.launcher";
};

}  // namespace kelvo
