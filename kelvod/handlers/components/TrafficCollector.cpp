#include "handlers/components/TrafficCollector.h"

#include <inttypes.h>
#include <utils/String8.h>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "storage/StorageOperator.h"
#include "utils/PackageProperty.h"

namespace kelvo {

using android::Parcel;
using android::String8;

namespace {

void writeInterfaceRow(Parcel& rows, int64_t time, const interface_traffic_data& d) {
    rows.writeInt64(time);
    rows.writeString8(String8(d.interface.c_str()));
    rows.writeInt64(d.rxBytes);
    rows.writeInt64(d.rxPackets);
    rows.writeInt64(d.txBytes);
    rows.writeInt64(d.txPackets);
}

void writePackageRow(Parcel& rows, int64_t time, const std::string& name, const traffic_data& d,
                     int32_t foreground) {
    rows.writeInt64(time);
    rows.writeString8(String8(name.c_str()));
    rows.writeInt32(d.uid);
    rows.writeString8(String8(d.interface.c_str()));
    rows.writeInt32(foreground);
    rows.writeInt64(d.rxBytes);
    rows.writeInt64(d.rxPackets);
    rows.writeInt64(d.txBytes);
    rows.writeInt64(d.txPackets);
}

}  // namespace

TrafficCollector::TrafficCollector(const traffic_collector_config& config, ActionSink sink,
                                   PackageLookup packages, TrafficReader::NameLookup processes)
    : mConfig(config),
      mSink(std::move(sink)),
      mPackages(std::move(packages)),
      mReader(config.fragment, std::move(processes)) {
    if (!mPackages) {
        mPackages = [](int32_t uid, std::string* name) {
            String8 found;
            int32_t ret = PackageProperty::getInstance()->queryPackageByUid(uid, found);
            if (ret == 0) name->assign(found.string());
            return ret;
        };
    }
}

void TrafficCollector::takeBaseline() {
    if (mReader.getInterfaceTrafficData(nullptr) != 0) {
        KLOGE("%s", mConfig.interfaceBaselineError);
    }
    if (mReader.getUidTrafficData(nullptr) != 0) {
        KLOGE("%s", mConfig.packageBaselineError);
    }
    if (mReader.getPidTrafficData(nullptr) != 0) {
        KLOGE("%s", mConfig.pidBaselineError);
    }
}

void TrafficCollector::beginAction(Parcel& action, int32_t subtype) const {
    action.writeInt32(mConfig.accounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt32(subtype);
}

int32_t TrafficCollector::collectInterfaces(int64_t time) {
    std::vector<interface_traffic_data> data;
    if (mReader.getInterfaceTrafficData(&data) != 0) {
        KLOGE("Failed to read interface traffic data");
        return -2;
    }
    if (data.empty()) return 0;
    if (data.size() > kMaxInterfaceRows) {
        KLOGE("Invalid traffic data size: %zu", data.size());
        HealthCounters::add(Health::TrafficReadingsRefused);
        return 0;
    }
    Parcel rows;
    int64_t tx = 0;
    int64_t rx = 0;
    for (const interface_traffic_data& d : data) {
        writeInterfaceRow(rows, time, d);
        tx = TrafficReader::addCounter(tx, d.txPackets);
        rx = TrafficReader::addCounter(rx, d.rxPackets);
    }
    StorageOperator::insertEntries(*mConfig.interfaceTable, rows, static_cast<int32_t>(data.size()),
                                   false);
    if (rx > 0 || tx >= 1) {
        Parcel action;
        beginAction(action, mConfig.interfaceSubtype);
        action.writeInt64(tx);
        action.writeInt64(rx);
        mSink(action);
    }
    return 0;
}

int32_t TrafficCollector::collectSystem(int64_t time, const std::string& foreground) {
    std::vector<pid_traffic_data> data;
    if (mReader.getPidTrafficData(&data) != 0) {
        KLOGE("Failed to read pid traffic");
        return -2;
    }
    if (data.empty()) return 0;
    if (data.size() > kMaxSystemRows) {
        KLOGE("Invalid system traffic data size: %zu", data.size());
        HealthCounters::add(Health::TrafficReadingsRefused);
        return 0;
    }
    Parcel rows;
    for (const pid_traffic_data& d : data) {
        int32_t index = d.name == foreground ? 1 : 0;
        KLOGD("system uid=%d pid=%d name=%s ifname=%s counter=%d tp=%" PRId64 " rp=%" PRId64
              " tb=%" PRId64 " rb=%" PRId64,
              d.uid, d.pid, d.name.c_str(), d.interface.c_str(), index, d.txPackets, d.rxPackets,
              d.txBytes, d.rxBytes);
        TrafficReader::addThroughput(&mSystem[index][d.name][d.interface], d.rxBytes, d.rxPackets,
                                     d.txBytes, d.txPackets);
        writePackageRow(rows, time, d.name, d, 0);
    }
    StorageOperator::insertEntries(*mConfig.packageTable, rows, static_cast<int32_t>(data.size()),
                                   false);
    return 0;
}

bool TrafficCollector::appendRecord(Parcel& records, int32_t* count, const std::string& name,
                                    int32_t counter, const traffic_throughput& t) {
    if (*count >= kMaxRecords) {
        return false;
    }
    records.writeString8(String8(name.c_str()));
    records.writeInt32(counter);
    records.writeInt64(t.txPackets);
    records.writeInt64(t.rxPackets);
    records.writeInt64(t.txBytes);
    records.writeInt64(t.rxBytes);
    ++*count;
    return true;
}

void TrafficCollector::drainSystem(SystemMap& map, int32_t counter, Parcel& records,
                                   int32_t* count) {
    if (map.size() > kMaxSystemNames) {
        KLOGE("Invalid system traffic data count(%zu)", map.size());
        HealthCounters::add(Health::TrafficReadingsRefused, map.size());
        map.clear();
        return;
    }
    size_t dropped = 0;
    for (const auto& name : map) {
        if (name.second.size() > kMaxInterfacesPerName) {
            KLOGE("Invalid interface count(%zu)", name.second.size());
            dropped += name.second.size();
            continue;
        }
        for (const auto& iface : name.second) {
            const traffic_throughput& t = iface.second;
            if (!appendRecord(records, count, name.first, counter, t)) {
                ++dropped;
                continue;
            }
            KLOGD("system name=%s counter=%d tp=%" PRId64 " rp=%" PRId64 " tb=%" PRId64
                  " rb=%" PRId64,
                  name.first.c_str(), counter, t.txPackets, t.rxPackets, t.txBytes, t.rxBytes);
        }
    }
    if (dropped > 0) {
        KLOGE("Invalid traffic data size(%d) while increasing, %zu system entries dropped", *count,
              dropped);
        HealthCounters::add(Health::TrafficReadingsRefused, dropped);
    }
    map.clear();
}

void TrafficCollector::reportMissingName(int32_t uid, int64_t time) {
    int64_t hour = time / kHourMs;
    auto it = mMissingNameHour.find(uid);
    if (it != mMissingNameHour.end() && it->second == hour) {
        KLOGD("Can not find name for uid=%d", uid);
        return;
    }
    if (mMissingNameHour.size() >= kMaxReportedUids) {
        mMissingNameHour.clear();
    }
    mMissingNameHour[uid] = hour;
    KLOGE("Can not find name for uid=%d", uid);
}

int32_t TrafficCollector::collectPackages(int64_t time) {
    std::vector<traffic_data> data;
    int32_t ret = 0;
    if (mReader.getUidTrafficData(&data) != 0) {
        KLOGE("Failed to read traffic data");
        ret = -2;
    }
    Parcel records;
    int32_t count = 0;
    if (data.size() > static_cast<size_t>(kMaxRecords)) {
        KLOGE("Invalid traffic list size(%zu)", data.size());
        HealthCounters::add(Health::TrafficReadingsRefused, data.size());
        data.clear();
    }
    Parcel rows;
    int32_t rowCount = 0;
    // One lookup per uid and poll.
    std::map<int32_t, std::string> names;
    for (const traffic_data& d : data) {
        auto it = names.find(d.uid);
        if (it == names.end()) {
            std::string name;
            ++mPackageLookups;
            if (mPackages(d.uid, &name) != 0 || name.empty()) {
                name.clear();
                reportMissingName(d.uid, time);
            }
            it = names.emplace(d.uid, name).first;
        }
        if (it->second.empty()) continue;
        traffic_throughput t{d.rxBytes, d.rxPackets, d.txBytes, d.txPackets};
        appendRecord(records, &count, it->second, d.counter, t);
        writePackageRow(rows, time, it->second, d, d.counter);
        ++rowCount;
    }
    if (rowCount > 0) {
        StorageOperator::insertEntries(*mConfig.packageTable, rows, rowCount, false);
    }
    drainSystem(mSystem[0], 0, records, &count);
    drainSystem(mSystem[1], 1, records, &count);
    if (count >= 1) {
        Parcel action;
        beginAction(action, mConfig.packageSubtype);
        action.writeInt64(time);
        action.writeInt32(count);
        action.appendFrom(&records, 0, records.dataSize());
        mSink(action);
    }
    return ret;
}

void TrafficCollector::changeForeground(int64_t time, const std::string& package) {
    collectSystem(time, mForeground);
    mForeground = package;
}

void TrafficCollector::removeUid(int32_t uid) {
    mReader.removeUid(uid);
    mMissingNameHour.erase(uid);
}

size_t TrafficCollector::pendingSystemEntries() const {
    size_t n = 0;
    for (const SystemMap& map : mSystem) {
        for (const auto& name : map) n += name.second.size();
    }
    return n;
}

}  // namespace kelvo
