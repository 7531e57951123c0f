#include "handlers/DpmHandler.h"

#include <string.h>

#include <limits>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "core/Notifier.h"
#include "handlers/components/ComponentHandler.h"
#include "routines/PollingPayload.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/TimeProvider.h"
#include "utils/devices/DpmDevice.h"
#include "utils/devices/DpmIpNames.h"

using android::Parcel;
using android::String8;

namespace kelvo {

namespace {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 86400000;
constexpr int64_t kDawnMs = 21600000;

constexpr int32_t kCandidateHourlyTick = 1;
constexpr int32_t kCandidateHourlyUpload = 4;
constexpr int32_t kCandidateDailyUpload = 6;
constexpr int32_t kCandidateDawnUpload = 8;

constexpr uint32_t kFieldEnergy = 33;
constexpr uint32_t kFieldTopBlocks = 34;
constexpr uint32_t kClassBlock = 903009043;
constexpr int32_t kTopBlocks = 20;

const column_attribute kRawColumns[] = {
    {COLUMN_TIME, "start_time"}, {COLUMN_TIME, "end_time"},  {COLUMN_INT, "ip"},
    {COLUMN_LONG, "off_time"},   {COLUMN_LONG, "busy_time"}, {COLUMN_LONG, "busy_time_low_voltage"},
    {COLUMN_LONG, "idle_time"},  {COLUMN_LONG, "energy"},    {COLUMN_LONG, "charge_energy"},
};
const column_attribute kHourlyColumns[] = {
    {COLUMN_TIME, "timestamp"},
    {COLUMN_INT, "ip"},
    {COLUMN_LONG, "off_time"},
    {COLUMN_LONG, "busy_time"},
    {COLUMN_LONG, "busy_time_low_voltage"},
    {COLUMN_LONG, "idle_time"},
    {COLUMN_LONG, "energy"},
};
const table_attribute kRaw = {"1.1", 1, 9, kRawColumns, "raw_component_dpm"};
const table_attribute kHourly = {"1.0", 1, 7, kHourlyColumns, "hourly_component_dpm"};

long long ll(int64_t v) {
    return static_cast<long long>(v);
}

// The increase of a counter over its baseline; a reading below it (the
// counter started again) is taken whole.
int64_t increase(int64_t value, int64_t baseline) {
    return value >= baseline ? value - baseline : value;
}

int64_t timesThousand(int64_t value) {
    int64_t out = 0;
    if (__builtin_mul_overflow(value, static_cast<int64_t>(1000), &out)) {
        HealthCounters::add(Health::ValuesSaturated);
        return value < 0 ? std::numeric_limits<int64_t>::min() : std::numeric_limits<int64_t>::max();
    }
    return out;
}

}  // namespace

const table_attribute& DpmHandler::rawTable() {
    return kRaw;
}

const table_attribute& DpmHandler::hourlyTable() {
    return kHourly;
}

DpmHandler::DpmHandler()
    : KelvoOperator("DpmHandler", ACCOUNTER_DPM, kElector),
      mLastReadTime(TimeProvider::getCurrentTime(TIME_TYPE_WALL)) {}

void DpmHandler::addSchemaTable() {
    addSchema(kRaw);
    addSchema(kHourly);
}

void DpmHandler::cleanTables(int64_t time) {
    cleanObsoleteEntries(kRaw.name, time, "end_time");
    cleanObsoleteEntries(kHourly.name, time, "timestamp");
}

int32_t DpmHandler::setConfiguration() {
    int32_t policy = 0;
    if (ComponentHandler::readPolicy(POLICY_DPM, &policy) < 0) {
        KLOGE("Failed to get data source policy for dpm");
        return -2;
    }
    mPolicy = policy;
    KLOGI("Dpm policy: %d", mPolicy);
    mIpIds.clear();
    mDdrLevels.clear();
    switch (mPolicy) {
        case 0:
            KLOGI("Unsupported policy: %d", mPolicy);
            return -2;
        case 1:
            for (const dpm_ip_name& ip : kDpmPolicy1Ips) {
                mIpIds.emplace(ip.name, ip.id);
            }
            return 0;
        case 2:
            for (const dpm_ip_name& ip : kDpmPolicy2Ips) {
                mIpIds.emplace(ip.name, ip.id);
            }
            for (const dpm_ddr_level& level : kDpmDdrLevels) {
                mIpIds.emplace(level.name, level.id);
                mDdrLevels.emplace_back(level.id, level.threshold);
            }
            return 0;
        default:
            KLOGE("Invalid policy: %d", mPolicy);
            return -2;
    }
}

int32_t DpmHandler::checkEnable() {
    if (mPolicy != 1 && mPolicy != 2) {
        KLOGE("DPM is not supported: %d", mPolicy);
        return -2;
    }
    if (!DpmDevice::isReady()) {
        KLOGE("DPM device is not ready");
        return -2;
    }
    int32_t version = DpmDevice::getVersion();
    if (version < 1) {
        KLOGE("DPM is not supported");
        return -2;
    }
    if (setPeriod() < 0) {
        KLOGE("Failed to set period");
        return -2;
    }
    if (resetData() < 0) {
        KLOGE("Failed to reset data");
        return -2;
    }
    mIpCount = DpmDevice::getIpCount();
    if (mIpCount <= 0) {
        KLOGE("Failed to get ip count: %d", mIpCount);
        return -2;
    }
    int32_t ddrCount = DpmDevice::getDdrFreqCount();
    if (ddrCount != kDdrLevels) {
        KLOGE("Failed to get ddr count: %d", ddrCount);
        return -2;
    }
    restartDdr();
    KLOGI("DPM is supported, version: %d, Ip count: %d, Ddr count: %d", version, mIpCount, ddrCount);
    return 0;
}

int32_t DpmHandler::setPeriod() {
    // Bounds the device could not give, or gave upside down, are no bounds.
    int32_t minimum = DpmDevice::getPeriod(0);
    if (minimum < 0) {
        KLOGE("Failed to get minimum period");
        return -2;
    }
    int32_t maximum = DpmDevice::getPeriod(1);
    if (maximum < 0) {
        KLOGE("Failed to get maximum period");
        return -2;
    }
    if (maximum < minimum) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Invalid period: maximum=%d, minimum=%d", maximum, minimum);
        return -2;
    }
    int32_t period = kPreferredPeriod;
    if (maximum < kPreferredPeriod) {
        period = maximum;
    } else if (minimum > kPreferredPeriod) {
        period = minimum;
    }
    return DpmDevice::setPeriod(period) < 0 ? -2 : 0;
}

int32_t DpmHandler::resetData() {
    if (DpmDevice::setEnable(0) < 0) {
        KLOGE("Failed to disable dpm");
        return -2;
    }
    if (DpmDevice::setEnable(1) < 0) {
        KLOGE("Failed to enable dpm");
        return -2;
    }
    return 0;
}

void DpmHandler::restartDdr() {
    mDdrBaselines.fill(ddr_baseline());
    mDdrState = 0;
}

void DpmHandler::setupListeners(Parcel& out) {
    static const int32_t kNotifications[] = {
        NOTIFICATION_DATA_POLLING,
        NOTIFICATION_HOURLY_TICK,
        NOTIFICATION_APPLICATIONS_ACCOUNTING,
        NOTIFICATION_COMPONENT_ACCOUNTING,
        NOTIFICATION_HOURLY_UPLOADING,
        NOTIFICATION_DAILY_UPLOADING,
        NOTIFICATION_DAWN_UPLOADING,
    };
    for (int32_t type : kNotifications) {
        addNotifierListener(type, out);
    }
    addLibraryListener(mAccounterType, out);
}

void DpmHandler::setCandidateElector() {
    Parcel candidates;
    static const int32_t kCandidates[] = {
        kCandidateHourlyTick,   VOTE_APPLICATIONS_ACCOUNTING, VOTE_COMPONENT_ACCOUNTING,
        kCandidateHourlyUpload, kCandidateDailyUpload,        kCandidateDawnUpload,
    };
    for (int32_t c : kCandidates) {
        candidates.writeInt32(c);
    }
    setElector(mElector, candidates);
}

int32_t DpmHandler::onHourlyTick(const Parcel&) {
    return 0;
}

int32_t DpmHandler::readIpData(std::vector<record>* records) {
    std::vector<dpm_ip_record_t> raw;
    if (DpmDevice::getIpData(mIpCount, &raw) < 0) {
        KLOGE("Failed to get ip data");
        return -2;
    }
    std::map<std::string, std::array<int64_t, 4>> readings;
    int32_t count = 0;
    for (const dpm_ip_record_t& bytes : raw) {
        dpm_ip_fields_t fields;
        memcpy(&fields, bytes.bytes, sizeof(fields));
        const std::string name(fields.name, strnlen(fields.name, sizeof(fields.name)));
        std::array<int64_t, 4> values = {fields.offTime, fields.busyTime, fields.busyTimeLowVoltage,
                                         fields.idleTime};
        if (values[0] < 0 || values[1] < 0 || values[2] < 0 || values[3] < 0) {
            HealthCounters::add(Health::DeviceAnswersRefused);
            KLOGE(
                "Invalid DPM data: name=%s, off=%lld, busy_time=%lld, "
                "busy_time_low_voltage=%lld, idle_time=%lld",
                name.c_str(), ll(values[0]), ll(values[1]), ll(values[2]), ll(values[3]));
            continue;
        }
        readings[name] = values;
        auto baseline = mIpBaselines.find(name);
        if (baseline != mIpBaselines.end()) {
            for (size_t i = 0; i < values.size(); ++i) {
                values[i] = increase(values[i], baseline->second[i]);
            }
        }
        KLOGD(
            "DPM data: name=%s, off=%lld, busy_time=%lld, busy_time_low_voltage=%lld, "
            "idle_time=%lld",
            name.c_str(), ll(values[0]), ll(values[1]), ll(values[2]), ll(values[3]));
        if (values[0] == 0 && values[1] == 0 && values[2] == 0 && values[3] == 0) {
            KLOGD("No difference on %s, ignore logging", name.c_str());
            continue;
        }
        auto id = mIpIds.find(name);
        if (id == mIpIds.end()) {
            HealthCounters::add(Health::DeviceAnswersRefused);
            KLOGE("Cannot find ip name: %s", name.c_str());
            continue;
        }
        records->push_back({id->second, values});
        ++count;
    }
    KLOGD("count=%d, number=%zu", count, raw.size());
    // Kept until a reset goes through (see readData).
    mIpBaselines.swap(readings);
    return 0;
}

int32_t DpmHandler::readDdrData(std::vector<record>* records) {
    if (mDdrLevels.empty()) {
        // The policy's table has no bandwidth levels: nothing to look up.
        KLOGD("No ddr bandwidth levels under policy %d", mPolicy);
        return 0;
    }
    int32_t levels = DpmDevice::getDdrFreqCount();
    if (levels != kDdrLevels) {
        KLOGE("Invalid ddr bw count: %d", levels);
        restartDdr();
        return -2;
    }
    dpm_ddr_data_t data;
    if (DpmDevice::getDdrData(levels, &data) < 0) {
        KLOGE("Failed to get ddr data");
        return -2;
    }
    int32_t timeBlock = -1;
    int32_t fluxBlock = -1;
    for (int32_t i = 0; i < 2; ++i) {
        if (data.names[i] == "DDR_FREQ_TIME") {
            timeBlock = i;
        } else if (data.names[i] == "DDR_FREQ_FLUX") {
            fluxBlock = i;
        }
    }
    if (timeBlock < 0 || fluxBlock < 0) {
        HealthCounters::add(Health::DeviceAnswersRefused);
        KLOGE("Invalid ddr ip name: %s %s", data.names[0].c_str(), data.names[1].c_str());
        return -2;
    }
    for (int32_t i = 0; i < kDdrLevels; ++i) {
        const int64_t time = data.values[timeBlock][i];
        const int64_t flux = data.values[fluxBlock][i];
        ddr_baseline& old = mDdrBaselines[i];
        KLOGD("state: %d, ip: %s%d, old time: %lld, flux: %lld, new time: %lld, flux: %lld",
              mDdrState, kDpmDdrLevelPrefix, i, ll(old.time), ll(old.flux), ll(time), ll(flux));
        if (mDdrState == 1) {
            const int64_t deltaTime = increase(time, old.time);
            const int64_t deltaFlux = increase(flux, old.flux);
            if (deltaTime == 0 && deltaFlux == 0) {
                KLOGD("No difference on %s%d, ignore logging", kDpmDdrLevelPrefix, i);
            } else if (deltaTime >= 0 && deltaFlux >= 0) {
                const int64_t bandwidth = deltaTime < 1 ? 0 : deltaFlux / deltaTime;
                KLOGD("delta time: %lld, delta flux: %lld, bw: %lld", ll(deltaTime), ll(deltaFlux),
                      ll(bandwidth));
                const int64_t ms = timesThousand(deltaTime);
                const auto& [id, threshold] = mDdrLevels[i];
                if (bandwidth <= threshold) {
                    records->push_back({id, {ms, deltaFlux, 0, 0}});
                } else {
                    records->push_back({id, {0, 0, ms, deltaFlux}});
                }
            }
        }
        old.time = time;
        old.flux = flux;
    }
    mDdrState = 1;
    return 0;
}

int32_t DpmHandler::readData(int64_t time) {
    std::vector<record> records;
    const int32_t ipResult = readIpData(&records);
    const int32_t ddrResult = readDdrData(&records);
    Parcel action;
    action.writeInt32(mAccounterType);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt64(mLastReadTime);
    action.writeInt64(time);
    action.writeBool(mChargerOnline);
    action.writeInt32(static_cast<int32_t>(records.size()));
    for (const record& r : records) {
        action.writeInt32(r.id);
        for (int64_t v : r.values) {
            action.writeInt64(v);
        }
    }
    feedAccounter(action);
    // Only statistics that were read may be reset: a reset after a failed
    // read would lose what the blocks did since the last one.
    if (ipResult == 0) {
        if (resetData() < 0) {
            KLOGE("Failed to reset data");
        } else {
            mIpBaselines.clear();
        }
    }
    return ipResult < 0 && ddrResult < 0 ? -2 : 0;
}

int32_t DpmHandler::onDataPolling(const Parcel& data) {
    data.setDataPosition(0);
    PollingPayload poll;
    if (PollingPayload::readFrom(data, &poll) < 0) {
        HealthCounters::add(Health::MessagesRefused);
        KLOGE("Invalid data polling message");
        return -5;
    }
    switch (poll.reason) {
        case POLLING_HOURLY_TICK:
            // The hour's read lands in its hour before the vote lets the
            // round go on to the accounting.
            readData(poll.hour);
            mLastReadTime = poll.hour;
            voteCandidate(poll.hour, kCandidateHourlyTick, mElector);
            break;
        case POLLING_TIME_CHANGED:
            readData(poll.time);
            mLastReadTime = poll.newTime;
            break;
        default:
            readData(poll.time);
            mLastReadTime = poll.time;
            if (poll.reason == POLLING_CHARGER) {
                mChargerOnline = poll.online;
            }
            break;
    }
    return 0;
}

int32_t DpmHandler::handleCustomized(int32_t code, const Parcel&, Parcel*) {
    if (code != kCustomizedRead) {
        KLOGE("Unknown customized tag: %d", code);
        return -3;
    }
    const int64_t now = TimeProvider::getCurrentTime(TIME_TYPE_WALL);
    const int32_t ret = readData(now);
    // The next read starts here, so this span is not read twice.
    mLastReadTime = now;
    forceFlushEntries();
    if (ret < 0) {
        KLOGE("Failed to get dpm data");
        return -2;
    }
    return 0;
}

int32_t DpmHandler::handleComponentResult(const Parcel& data) {
    data.setDataPosition(0);
    int32_t count = 0;
    // int64 start, int64 end, int32 id, six int64.
    constexpr size_t kRowBytes = 2 * sizeof(int64_t) + sizeof(int32_t) + 6 * sizeof(int64_t);
    if (data.readInt32(&count) != android::NO_ERROR || count < 0 ||
        static_cast<size_t>(count) > data.dataAvail() / kRowBytes) {
        HealthCounters::add(Health::LibraryParcelRefused);
        KLOGE("Invalid dpm component result: %d", count);
        return -2;
    }
    if (count == 0) {
        return 0;
    }
    Parcel rows;
    for (int32_t r = 0; r < count; ++r) {
        int64_t start = 0;
        int64_t end = 0;
        int32_t ip = 0;
        int64_t v[6] = {};
        bool ok = data.readInt64(&start) == android::NO_ERROR &&
                  data.readInt64(&end) == android::NO_ERROR &&
                  data.readInt32(&ip) == android::NO_ERROR;
        for (int64_t& value : v) {
            ok = ok && data.readInt64(&value) == android::NO_ERROR;
        }
        if (!ok) {
            HealthCounters::add(Health::LibraryParcelRefused);
            KLOGE("Invalid dpm component result: %d", count);
            return -2;
        }
        rows.writeInt64(start);
        rows.writeInt64(end);
        rows.writeInt32(ip);
        for (int64_t value : v) {
            rows.writeInt64(value);
        }
    }
    return insertEntries(kRaw, rows, count, false);
}

int32_t DpmHandler::logComponentAccounting(int64_t time) {
    forceFlushEntries();
    Parcel reply;
    int32_t rows = 0;
    String8 sql = String8::format(
        "SELECT ip, SUM(off_time), SUM(busy_time), SUM(busy_time_low_voltage), SUM(idle_time), "
        "SUM(energy) FROM raw_component_dpm WHERE end_time > %lld AND end_time <= %lld GROUP BY "
        "ip",
        ll(time - kHourMs), ll(time));
    if (queryEntriesSimple(sql, &reply, 6, rows) < 0) {
        KLOGE("Failed to query accounting dpm data");
        return -14;
    }
    if (rows < 1) {
        return 0;
    }
    int64_t total = 0;
    for (int32_t r = 0; r < rows; ++r) {
        int64_t v[6] = {};
        for (int64_t& value : v) {
            if (reply.readInt64(&value) != android::NO_ERROR) {
                KLOGE("Invalid rows: %d", rows);
                return -14;
            }
        }
        if (__builtin_add_overflow(total, v[5], &total)) {
            HealthCounters::add(Health::ValuesSaturated);
            total = std::numeric_limits<int64_t>::max();
        }
    }
    if (total >= 1) {
        updateCompensation(time, mElector, total);
    }
    return logSimpleQueryResult(kHourly, reply, time);
}

int32_t DpmHandler::setPeriodData(Parcel& out, int64_t end, int64_t window, float ratio) {
    int32_t ret = 0;
    std::vector<ComponentHandler::sum_row> total;
    String8 sql = String8::format(
        "SELECT COUNT(*), SUM(energy) FROM hourly_component_dpm WHERE timestamp > %lld AND "
        "timestamp <= %lld",
        ll(end - window), ll(end));
    if (ComponentHandler::querySumRows(sql, false, 1, &total) < 0) {
        KLOGE("Failed to query hourly component data");
        ret = -17;
    } else if (!total.empty()) {
        const int64_t energy = KelvoUtils::scaleEnergy(total[0].v[0], ratio);
        KLOGD("Energy: %lld, Total: %lld", ll(energy), ll(total[0].v[0]));
        if (energy >= 1) {
            DataUploader::formIntData(kFieldEnergy, energy, out);
        }
    }
    Parcel reply;
    int32_t rows = 0;
    sql = String8::format(
        "SELECT ip, SUM(off_time), SUM(busy_time), SUM(busy_time_low_voltage), SUM(idle_time), "
        "SUM(energy) FROM hourly_component_dpm WHERE energy > 0 AND timestamp > %lld AND "
        "timestamp <= %lld GROUP BY ip ORDER BY SUM(energy) DESC LIMIT %d",
        ll(end - window), ll(end), kTopBlocks);
    if (queryEntriesSimple(sql, &reply, 6, rows) < 0) {
        KLOGE("Failed to query top applications data");
        return -17;
    }
    if (rows > kTopBlocks) {
        KLOGE("Invalid row count: %d", rows);
        return -2;
    }
    for (int32_t r = 0; r < rows; ++r) {
        int64_t v[6] = {};
        for (int64_t& value : v) {
            if (reply.readInt64(&value) != android::NO_ERROR) {
                KLOGE("Invalid row count: %d", rows);
                return -2;
            }
        }
        const int64_t energy = KelvoUtils::scaleEnergy(v[5], ratio);
        KLOGD(
            "Ip: %lld, Off: %lld, Busy: %lld, LowBusy: %lld, Idle: %lld, Energy: %lld, "
            "Total: %lld",
            ll(v[0]), ll(v[1]), ll(v[2]), ll(v[3]), ll(v[4]), ll(energy), ll(v[5]));
        if (energy < 1) {
            continue;
        }
        Parcel element;
        DataUploader::formIntData(0, v[0], element);
        for (uint32_t i = 1; i <= 4; ++i) {
            if (v[i] >= 1) {
                DataUploader::formIntData(i, v[i], element);
            }
        }
        DataUploader::formIntData(5, energy, element);
        DataUploader::formClassArray(kFieldTopBlocks, kClassBlock, element, out);
    }
    return ret;
}

int32_t DpmHandler::uploadPeriod(uint32_t event, const Parcel& data, int64_t window,
                                 int32_t candidate) {
    data.setDataPosition(0);
    const float ratio = data.readFloat();
    const int64_t end = data.readInt64();
    forceFlushEntries();
    Parcel out;
    int32_t ret = setPeriodData(out, end, window, ratio);
    if (out.dataSize() > 0 && setEventData(event, out, true) < 0) {
        KLOGE("Failed to set dpm upload data");
        ret = -23;
    }
    // Whatever failed, the round goes on.
    voteCandidate(end, candidate, mElector);
    return ret;
}

int32_t DpmHandler::onHourlyUploading(const Parcel& data) {
    return uploadPeriod(EVENT_HOURLY_COMPONENTS, data, kHourMs, kCandidateHourlyUpload);
}

int32_t DpmHandler::onDailyUploading(const Parcel& data) {
    return uploadPeriod(EVENT_DAILY_COMPONENTS, data, kDayMs, kCandidateDailyUpload);
}

int32_t DpmHandler::onDawnUploading(const Parcel& data) {
    return uploadPeriod(EVENT_DAILY_COMPONENTS, data, kDawnMs, kCandidateDawnUpload);
}

}  // namespace kelvo
