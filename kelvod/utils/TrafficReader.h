#pragma once

#include <stddef.h>
#include <stdint.h>
#include <stdio.h>

#include <functional>
#include <map>
#include <set>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

namespace kelvo {

// The four counters of one key, as last read.
struct traffic_throughput {
    int64_t rxBytes = 0;
    int64_t rxPackets = 0;
    int64_t txBytes = 0;
    int64_t txPackets = 0;
};

// One uid, counter set and interface.
struct traffic_data {
    int32_t uid = 0;
    int32_t counter = 0;  // counter set: 0 background, 1 foreground
    int64_t tag = 0;      // socket tag; only untagged rows (0) are used
    std::string interface;
    int64_t rxBytes = 0;
    int64_t rxPackets = 0;
    int64_t txBytes = 0;
    int64_t txPackets = 0;
};

// One process name and interface (root and system processes), summed over
// the processes of that name. uid and pid are those of the name's first line.
struct pid_traffic_data : traffic_data {
    int32_t pid = 0;
    std::string name;
};

struct interface_traffic_data {
    std::string interface;
    int64_t rxBytes = 0;
    int64_t rxPackets = 0;
    int64_t txBytes = 0;
    int64_t txPackets = 0;
};

// Turns the kernel's cumulative network counters into per-reading increments
// for the interfaces whose names contain a fragment ("wlan", "rmnet"). Three
// views, each read whole at every call:
//   uid view        /proc/net/xt_qtaguid/stats          per uid, counter set, interface
//   process view    /proc/net/proc_netstat/stats        per process name of root and system
//   interface view  /proc/net/xt_qtaguid/iface_stat_all per interface
// Each view keeps the last reading per key and hands out the growth since
// then; a reading in which nothing moved or a counter went backwards hands
// out nothing.
//
// What a view never hands out, so nothing is counted twice or from boot:
//  - anything before its baseline: the first reading that succeeds only
//    stores, whether it is the owner's construction-time call or a later one
//    after that call failed;
//  - keys first seen right after an incomplete reading (line cap, a file
//    position that did not advance, skipped lines): they may have been
//    there all along;
//  - a uid's first sighting after removeUid (the kernel keeps its counters);
//  - an interface whose active flag flipped (it switched counter sources).
// Malformed and over-long lines are skipped, the rest of the file is still
// read; one error line per reading counts them. Keys absent from
// kPruneReadings complete readings are forgotten; a view follows at most
// kMaxKeys keys.
//
// A reader is used on its owner's thread only, never on the CPU handler's:
// process names may be asked of that handler synchronously.
class TrafficReader {
public:
    static constexpr size_t kLineSize = 512;       // with its terminating zero
    static constexpr size_t kInterfaceSize = 128;  // with its terminating zero
    static constexpr size_t kNameSize = 64;        // with its terminating zero
    static constexpr int32_t kMaxLines = 5001;
    static constexpr size_t kMaxKeys = 10000;
    static constexpr uint32_t kPruneReadings = 3;

    static constexpr const char* kUidStatsPath = "/proc/net/xt_qtaguid/stats";
    static constexpr const char* kPidStatsPath = "/proc/net/proc_netstat/stats";
    static constexpr const char* kInterfaceStatsPath = "/proc/net/xt_qtaguid/iface_stat_all";

    // Name of a process by uid and pid: 0 with the name, or a negative code.
    using NameLookup = std::function<int32_t(int32_t uid, int32_t pid, std::string* name)>;

    // The fragment is matched anywhere in an interface name. Without a
    // lookup, names come from the package properties.
    explicit TrafficReader(const char* fragment, NameLookup lookup = nullptr);

    // Read the view's file, update its last readings and append the
    // increments to the list when one is given. 0; -14 when the file cannot
    // be opened (logged once until it opens again); -10 without a title line.
    int32_t getUidTrafficData(std::vector<traffic_data>* out);
    // 0 handing out nothing when the process statistics were absent (or not a
    // regular file) at construction.
    int32_t getPidTrafficData(std::vector<pid_traffic_data>* out);
    int32_t getInterfaceTrafficData(std::vector<interface_traffic_data>* out);

    // Adds counters (each at least 0), held at INT64_MAX; a held sum is
    // counted as saturated.
    static int64_t addCounter(int64_t a, int64_t b);
    static void addThroughput(traffic_throughput* to, int64_t rxBytes, int64_t rxPackets,
                              int64_t txBytes, int64_t txPackets);

    // Forgets the uid's last readings; its next sighting is a baseline only.
    void removeUid(int32_t uid);
    // Every package is accepted.
    static bool checkPackageValidity(const char* /*package*/) { return true; }

    const std::string& fragment() const { return mFragment; }
    bool hasProcessStats() const { return mProcessStats; }
    // Name lookups made so far (a name is asked once per uid and pid and
    // reading).
    uint64_t nameLookups() const { return mNameLookups; }
    // Keys followed by the uid, process and interface views.
    size_t uidKeys() const { return mUids.keys.size(); }
    size_t processKeys() const { return mProcesses.keys.size(); }
    size_t interfaceKeys() const { return mInterfaces.keys.size(); }

private:
    struct stored {
        traffic_throughput last;
        uint32_t seen = 0;  // the reading that last had the key
        int32_t active = -1;
    };
    template <class K>
    struct view {
        std::map<K, stored> keys;
        uint32_t reading = 0;
        bool baselineTaken = false;
        bool lastComplete = true;
        bool openFailed = false;
    };
    // (counter set, uid, interface)
    using UidKey = std::tuple<int32_t, int32_t, std::string>;
    // (process name, interface)
    using ProcessKey = std::pair<std::string, std::string>;

    // How one reading went, line by line.
    struct reading {
        FILE* file = nullptr;
        size_t bytes = 0;
        int32_t lines = 0;
        int32_t skipped = 0;  // malformed or over-long: the reading is not whole
        int32_t invalid = 0;  // well-formed rows refused (negative uid, bad counter set)
        bool complete = true;
    };

    // Opens the view's file; logs a failure once until it opens again.
    FILE* openView(const char* devicePath, bool* openFailed, bool noFollow);
    // The next line into buf without its '\n'. Over-long lines are skipped
    // (their rest discarded) and counted. False at the end or a stop.
    bool nextLine(reading& r, char* buf);
    // Ends a reading: the error line for skipped lines, the state for the
    // next one, pruning after a complete reading.
    template <class K>
    void finishReading(view<K>& v, const reading& r, const char* what);
    // Compares a reading of one key with the last one. True when the growth
    // goes out (in delta). trusted: a key not seen before may go out whole.
    // replace: the last reading follows this one even when nothing goes out.
    // active: the interface's flag, -1 when the view has none.
    template <class K>
    bool account(view<K>& v, const K& key, const traffic_throughput& now, bool trusted,
                 bool replace, int32_t active, traffic_throughput* delta);
    bool belongs(const char* interface) const;
    bool isSystemUid(int32_t uid) const;
    int32_t lookupName(int32_t uid, int32_t pid, std::string* name);

    const std::string mFragment;
    NameLookup mLookup;
    bool mProcessStats = false;
    uint64_t mNameLookups = 0;
    view<UidKey> mUids;
    view<ProcessKey> mProcesses;
    view<std::string> mInterfaces;
    // Uids removed and not seen since.
    std::set<int32_t> mRemovedUids;
};

}  // namespace kelvo
