#include "utils/TrafficReader.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utils/String8.h>

#include "HealthCounters.h"
#include "KelvoLog.h"
#include "kelvo/RootPath.h"
#include "utils/PackageProperty.h"

namespace kelvo {

namespace {

constexpr int32_t kPerUser = 100000;
constexpr int32_t kRootAppId = 0;
constexpr int32_t kSystemAppId = 1000;
// Bytes a reading consumes at most, over-long lines included.
constexpr size_t kMaxReadingBytes = TrafficReader::kMaxLines * TrafficReader::kLineSize;

// Splits the line in place at every separator (whitespace when sep is 0,
// runs counting once); empty fields only with a separator. The number of
// fields, at most max.
int32_t splitFields(char* line, char sep, char** fields, int32_t max) {
    int32_t n = 0;
    char* p = line;
    if (sep == 0) {
        while (*p != '\0' && n < max) {
            while (*p == ' ' || *p == '\t') ++p;
            if (*p == '\0') break;
            fields[n++] = p;
            while (*p != '\0' && *p != ' ' && *p != '\t') ++p;
            if (*p != '\0') *p++ = '\0';
        }
        return n;
    }
    while (n < max) {
        fields[n++] = p;
        char* end = strchr(p, sep);
        if (end == nullptr) break;
        *end = '\0';
        p = end + 1;
    }
    return n;
}

bool parseInt64(const char* text, int base, int64_t* out) {
    if (*text == '\0') return false;
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text, &end, base);
    if (errno != 0 || *end != '\0') return false;
    *out = value;
    return true;
}

bool parseInt32(const char* text, int32_t* out) {
    int64_t value = 0;
    if (!parseInt64(text, 10, &value) || value < INT32_MIN || value > INT32_MAX) return false;
    *out = static_cast<int32_t>(value);
    return true;
}

// A token that fills its whole buffer may have been cut: refused.
bool fits(const char* text, size_t size) {
    return *text != '\0' && strlen(text) < size - 1;
}

bool parseCounters(char* const* fields, const int order[4], traffic_throughput* out) {
    int64_t* targets[4] = {&out->rxBytes, &out->rxPackets, &out->txBytes, &out->txPackets};
    for (int i = 0; i < 4; ++i) {
        if (!parseInt64(fields[order[i]], 10, targets[i])) return false;
    }
    return true;
}

bool negative(const traffic_throughput& t) {
    return t.rxBytes < 0 || t.rxPackets < 0 || t.txBytes < 0 || t.txPackets < 0;
}

// Rows that never carried a packet are left out without a word.
bool moved(const traffic_throughput& t) {
    return t.rxPackets >= 1 || t.txPackets >= 1;
}

}  // namespace

TrafficReader::TrafficReader(const char* fragment, NameLookup lookup)
    : mFragment(fragment != nullptr ? fragment : ""), mLookup(std::move(lookup)) {
    if (!mLookup) {
        mLookup = [](int32_t uid, int32_t pid, std::string* name) {
            android::String8 found;
            int32_t ret = PackageProperty::getInstance()->queryPackageByUidAndPid(uid, pid, found);
            if (ret == 0) name->assign(found.string());
            return ret;
        };
    }
    struct stat st;
    std::string path = RootPath::resolve(kPidStatsPath);
    mProcessStats = lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

FILE* TrafficReader::openView(const char* devicePath, bool* openFailed, bool noFollow) {
    std::string path = RootPath::resolve(devicePath);
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | (noFollow ? O_NOFOLLOW : 0));
    FILE* file = fd >= 0 ? fdopen(fd, "r") : nullptr;
    if (file == nullptr) {
        int error = errno;
        if (fd >= 0) close(fd);
        if (!*openFailed) {
            KLOGE("Failed to open %s: (%s)", devicePath, strerror(error));
        }
        *openFailed = true;
        return nullptr;
    }
    *openFailed = false;
    return file;
}

bool TrafficReader::nextLine(reading& r, char* buf) {
    for (;;) {
        size_t len = 0;
        bool longLine = false;
        bool nul = false;
        int c = getc_unlocked(r.file);
        if (c == EOF) return false;
        while (c != EOF && c != '\n') {
            if (++r.bytes > kMaxReadingBytes) {
                KLOGE("Invalid traffic size, reading stopped after %zu bytes", kMaxReadingBytes);
                HealthCounters::add(Health::TrafficReadingsRefused);
                r.complete = false;
                return false;
            }
            if (len + 1 < kLineSize) {
                buf[len++] = static_cast<char>(c);
                nul = nul || c == '\0';
            } else {
                longLine = true;
            }
            c = getc_unlocked(r.file);
        }
        buf[len] = '\0';
        if (++r.lines > kMaxLines) {
            KLOGE("Invalid traffic count: %d", r.lines - 1);
            HealthCounters::add(Health::TrafficReadingsRefused);
            r.complete = false;
            return false;
        }
        if (!longLine && !nul) return true;
        ++r.skipped;
    }
}

template <class K>
void TrafficReader::finishReading(view<K>& v, const reading& r, const char* what) {
    if (r.skipped > 0 || r.invalid > 0) {
        KLOGE("Skipped %d malformed and %d invalid lines of %s traffic", r.skipped, r.invalid, what);
        HealthCounters::add(Health::TrafficReadingsRefused, r.skipped + r.invalid);
    }
    bool complete = r.complete && r.skipped == 0;
    v.baselineTaken = true;
    v.lastComplete = complete;
    if (!complete) return;
    for (auto it = v.keys.begin(); it != v.keys.end();) {
        if (v.reading - it->second.seen >= kPruneReadings) {
            it = v.keys.erase(it);
        } else {
            ++it;
        }
    }
}

template <class K>
bool TrafficReader::account(view<K>& v, const K& key, const traffic_throughput& now, bool trusted,
                            bool replace, int32_t active, traffic_throughput* delta) {
    auto it = v.keys.find(key);
    if (it == v.keys.end()) {
        if (v.keys.size() >= kMaxKeys) {
            HealthCounters::add(Health::TrafficReadingsRefused);
            return false;
        }
        stored& s = v.keys[key];
        s.last = now;
        s.seen = v.reading;
        s.active = active;
        *delta = now;
        return trusted && v.baselineTaken && v.lastComplete;
    }
    stored& s = it->second;
    s.seen = v.reading;
    if (s.active != active) {
        // Another counter source from now on: nothing to compare with.
        s.active = active;
        s.last = now;
        return false;
    }
    delta->rxBytes = now.rxBytes - s.last.rxBytes;
    delta->rxPackets = now.rxPackets - s.last.rxPackets;
    delta->txBytes = now.txBytes - s.last.txBytes;
    delta->txPackets = now.txPackets - s.last.txPackets;
    bool moved = (delta->rxPackets >= 1 || delta->txPackets >= 1) && delta->rxBytes >= 0 &&
                 delta->rxPackets >= 0 && delta->txBytes >= 0 && delta->txPackets >= 0;
    if (moved || replace) {
        s.last = now;
    }
    return moved;
}

int64_t TrafficReader::addCounter(int64_t a, int64_t b) {
    int64_t sum = 0;
    if (__builtin_add_overflow(a, b, &sum)) {
        HealthCounters::add(Health::ValuesSaturated);
        return INT64_MAX;
    }
    return sum;
}

void TrafficReader::addThroughput(traffic_throughput* to, int64_t rxBytes, int64_t rxPackets,
                                  int64_t txBytes, int64_t txPackets) {
    to->rxBytes = addCounter(to->rxBytes, rxBytes);
    to->rxPackets = addCounter(to->rxPackets, rxPackets);
    to->txBytes = addCounter(to->txBytes, txBytes);
    to->txPackets = addCounter(to->txPackets, txPackets);
}

bool TrafficReader::belongs(const char* interface) const {
    return strstr(interface, mFragment.c_str()) != nullptr;
}

bool TrafficReader::isSystemUid(int32_t uid) const {
    int32_t appId = uid % kPerUser;
    return appId == kRootAppId || appId == kSystemAppId;
}

int32_t TrafficReader::lookupName(int32_t uid, int32_t pid, std::string* name) {
    ++mNameLookups;
    return mLookup(uid, pid, name);
}

int32_t TrafficReader::getUidTrafficData(std::vector<traffic_data>* out) {
    reading r;
    r.file = openView(kUidStatsPath, &mUids.openFailed, false);
    if (r.file == nullptr) return -14;
    char line[kLineSize];
    if (!nextLine(r, line)) {
        fclose(r.file);
        KLOGE("Failed to parse uid traffic title");
        return -10;
    }
    ++mUids.reading;
    std::set<int32_t> removedSeen;
    while (nextLine(r, line)) {
        // idx iface acct_tag_hex uid_tag_int cnt_set rx_bytes rx_packets tx_bytes tx_packets
        char* f[9];
        traffic_data row;
        int64_t tag = 0;
        static const int kOrder[4] = {5, 6, 7, 8};
        traffic_throughput now;
        if (splitFields(line, 0, f, 9) != 9 || !fits(f[1], kInterfaceSize) ||
            !parseInt64(f[2], 16, &tag) || !parseInt32(f[3], &row.uid) ||
            !parseInt32(f[4], &row.counter) || !parseCounters(f, kOrder, &now)) {
            ++r.skipped;
            continue;
        }
        if (mProcessStats && row.uid >= 0 && isSystemUid(row.uid)) continue;
        if (!belongs(f[1]) || tag != 0) continue;
        if (row.uid < 0 || row.counter < 0 || row.counter >= 2 || negative(now)) {
            ++r.invalid;
            continue;
        }
        if (!moved(now)) continue;
        bool trusted = true;
        if (mRemovedUids.count(row.uid) != 0) {
            removedSeen.insert(row.uid);
            trusted = false;
        }
        traffic_throughput delta;
        UidKey key(row.counter, row.uid, f[1]);
        if (account(mUids, key, now, trusted, true, -1, &delta) && out != nullptr) {
            row.interface = f[1];
            row.rxBytes = delta.rxBytes;
            row.rxPackets = delta.rxPackets;
            row.txBytes = delta.txBytes;
            row.txPackets = delta.txPackets;
            out->push_back(std::move(row));
        }
    }
    fclose(r.file);
    finishReading(mUids, r, "uid");
    for (int32_t uid : removedSeen) {
        mRemovedUids.erase(uid);
    }
    return 0;
}

int32_t TrafficReader::getPidTrafficData(std::vector<pid_traffic_data>* out) {
    if (!mProcessStats) return 0;
    reading r;
    r.file = openView(kPidStatsPath, &mProcesses.openFailed, true);
    if (r.file == nullptr) return -14;
    char line[kLineSize];
    if (!nextLine(r, line)) {
        fclose(r.file);
        KLOGE("Failed to parse pid traffic title");
        return -10;
    }
    ++mProcesses.reading;
    struct sum {
        traffic_throughput t;
        int32_t uid;
        int32_t pid;
    };
    std::map<ProcessKey, sum> sums;
    // Names of this reading by (uid, pid); empty: the lookup failed.
    std::map<std::pair<int32_t, int32_t>, std::string> names;
    while (nextLine(r, line)) {
        // iface \t uid \t pid \t [name] \t rx_bytes \t tx_bytes \t rx_packets \t tx_packets
        char* f[9];
        int32_t uid = 0;
        int32_t pid = 0;
        static const int kOrder[4] = {4, 6, 5, 7};
        traffic_throughput now;
        if (splitFields(line, '\t', f, 9) != 8 || !fits(f[0], kInterfaceSize) ||
            !parseInt32(f[1], &uid) || !parseInt32(f[2], &pid) ||
            (*f[3] != '\0' && !fits(f[3], kNameSize)) || !parseCounters(f, kOrder, &now)) {
            ++r.skipped;
            continue;
        }
        if (uid < 0 || !isSystemUid(uid) || !belongs(f[0])) continue;
        std::string name;
        if (pid < 1) {
            name = f[3];
        } else {
            auto cached = names.find({uid, pid});
            if (cached == names.end()) {
                if (lookupName(uid, pid, &name) != 0) name.clear();
                cached = names.emplace(std::make_pair(uid, pid), name).first;
            }
            name = cached->second;
            if (name.empty()) {
                // This reading's sum of the name may be short: do not let it
                // lower the last one.
                r.complete = false;
                continue;
            }
        }
        if (name.empty()) continue;
        if (negative(now)) {
            ++r.invalid;
            continue;
        }
        if (!moved(now)) continue;
        auto it = sums.find({name, f[0]});
        if (it == sums.end()) {
            sums.emplace(ProcessKey(name, f[0]), sum{now, uid, pid});
            continue;
        }
        addThroughput(&it->second.t, now.rxBytes, now.rxPackets, now.txBytes, now.txPackets);
    }
    fclose(r.file);
    // A lower sum (a process of the name ended) becomes the new last reading
    // only when the reading is whole.
    bool complete = r.complete && r.skipped == 0;
    for (const auto& entry : sums) {
        traffic_throughput delta;
        if (account(mProcesses, entry.first, entry.second.t, true, complete, -1, &delta) &&
            out != nullptr) {
            pid_traffic_data row;
            row.uid = entry.second.uid;
            row.pid = entry.second.pid;
            row.name = entry.first.first;
            row.interface = entry.first.second;
            row.rxBytes = delta.rxBytes;
            row.rxPackets = delta.rxPackets;
            row.txBytes = delta.txBytes;
            row.txPackets = delta.txPackets;
            out->push_back(std::move(row));
        }
    }
    finishReading(mProcesses, r, "pid");
    return 0;
}

int32_t TrafficReader::getInterfaceTrafficData(std::vector<interface_traffic_data>* out) {
    reading r;
    r.file = openView(kInterfaceStatsPath, &mInterfaces.openFailed, false);
    if (r.file == nullptr) return -14;
    ++mInterfaces.reading;
    char line[kLineSize];
    while (nextLine(r, line)) {
        // iface active stored(rx_bytes rx_packets tx_bytes tx_packets) device(the same four)
        char* f[10];
        int32_t active = 0;
        static const int kStored[4] = {2, 3, 4, 5};
        static const int kDevice[4] = {6, 7, 8, 9};
        traffic_throughput total;
        traffic_throughput device;
        if (splitFields(line, 0, f, 10) != 10 || !fits(f[0], kInterfaceSize) ||
            !parseInt32(f[1], &active) || !parseCounters(f, kStored, &total) ||
            !parseCounters(f, kDevice, &device)) {
            ++r.skipped;
            continue;
        }
        active = active != 0 ? 1 : 0;
        const traffic_throughput& now = active != 0 ? device : total;
        if (!belongs(f[0])) continue;
        if (negative(now) || !moved(now)) {
            KLOGD("Invalid value rb: %lld, rp: %lld, tb: %lld, tp: %lld",
                  static_cast<long long>(now.rxBytes), static_cast<long long>(now.rxPackets),
                  static_cast<long long>(now.txBytes), static_cast<long long>(now.txPackets));
            continue;
        }
        traffic_throughput delta;
        if (account(mInterfaces, std::string(f[0]), now, true, true, active, &delta) &&
            out != nullptr) {
            interface_traffic_data row;
            row.interface = f[0];
            row.rxBytes = delta.rxBytes;
            row.rxPackets = delta.rxPackets;
            row.txBytes = delta.txBytes;
            row.txPackets = delta.txPackets;
            out->push_back(std::move(row));
        }
    }
    fclose(r.file);
    finishReading(mInterfaces, r, "interface");
    return 0;
}

void TrafficReader::removeUid(int32_t uid) {
    for (int32_t counter = 0; counter < 2; ++counter) {
        auto from = mUids.keys.lower_bound(UidKey(counter, uid, std::string()));
        auto to = from;
        size_t removed = 0;
        while (to != mUids.keys.end() && std::get<0>(to->first) == counter &&
               std::get<1>(to->first) == uid) {
            ++to;
            ++removed;
        }
        mUids.keys.erase(from, to);
        KLOGD("remove uid=%d counter=%zu", uid, removed);
    }
    if (mRemovedUids.size() < kMaxKeys) {
        mRemovedUids.insert(uid);
    } else {
        HealthCounters::add(Health::TrafficReadingsRefused);
    }
}

}  // namespace kelvo
