#include "handlers/components/modem/ModemData.h"

#include <string.h>

#include <limits>

#include "AccounterTypes.h"
#include "HealthCounters.h"
#include "KelvoLog.h"
#include "handlers/components/modem/Cdma1xCasData.h"
#include "handlers/components/modem/Cdma1xCprocData.h"
#include "handlers/components/modem/CdmaEvdoCasData.h"
#include "handlers/components/modem/CdmaEvdoCprocData.h"
#include "handlers/components/modem/DriverData.h"
#include "handlers/components/modem/GsmPhyData.h"
#include "handlers/components/modem/LtePhyData.h"
#include "handlers/components/modem/LteRrcData.h"
#include "handlers/components/modem/TdsPhyData.h"
#include "handlers/components/modem/TdsRrcData.h"
#include "handlers/components/modem/WcdmaPhyData.h"
#include "handlers/components/modem/WcdmaRrcData.h"
#include "utils/TimeProvider.h"

using android::Parcel;

namespace kelvo {

namespace {

// The largest record of any module (the driver's, 72 counters).
constexpr size_t kMaxRecordWords = 72;
constexpr uint64_t kInt32Max = static_cast<uint64_t>(std::numeric_limits<int32_t>::max());

}  // namespace

int32_t clampModemLevel(uint64_t value) {
    if (value > kInt32Max) {
        HealthCounters::add(Health::ValuesSaturated);
        return std::numeric_limits<int32_t>::max();
    }
    return static_cast<int32_t>(value);
}

std::unique_ptr<ModemData> ModemData::create(int32_t module, ModemDataOwner* owner) {
    if (owner == nullptr) {
        KLOGE("Invalid owner");
        return nullptr;
    }
    switch (module) {
        case 0:
            return std::make_unique<Cdma1xCasData>(owner);
        case 1:
            return std::make_unique<Cdma1xCprocData>(owner);
        case 2:
            return std::make_unique<CdmaEvdoCasData>(owner);
        case 3:
            return std::make_unique<CdmaEvdoCprocData>(owner);
        case 4:
            return std::make_unique<TdsPhyData>(owner);
        case 5:
            return std::make_unique<LtePhyData>(owner);
        case 6:
            return std::make_unique<TdsRrcData>(owner);
        case 7:
            return std::make_unique<LteRrcData>(owner);
        case 8:
            return std::make_unique<WcdmaPhyData>(owner);
        case 9:
            return std::make_unique<GsmPhyData>(owner);
        case 10:
            return std::make_unique<DriverData>(owner);
        case 11:
            return std::make_unique<WcdmaRrcData>(owner);
        default:
            return nullptr;
    }
}

const table_attribute* ModemData::table(int32_t module) {
    switch (module) {
        case 0:
            return &Cdma1xCasData::kTable;
        case 1:
            return &Cdma1xCprocData::kTable;
        case 2:
            return &CdmaEvdoCasData::kTable;
        case 3:
            return &CdmaEvdoCprocData::kTable;
        case 4:
            return &TdsPhyData::kTable;
        case 5:
            return &LtePhyData::kTable;
        case 6:
            return &TdsRrcData::kTable;
        case 7:
            return &LteRrcData::kTable;
        case 8:
            return &WcdmaPhyData::kTable;
        case 9:
            return &GsmPhyData::kTable;
        case 10:
            return &DriverData::kTable;
        case 11:
            return &WcdmaRrcData::kTable;
        default:
            return nullptr;
    }
}

ModemData::ModemData(int32_t module, size_t recordSize, ModemDataOwner* owner)
    : mOwner(owner),
      mModule(module),
      mRecordSize(recordSize),
      mLastUpdateTime(TimeProvider::getCurrentTime(TIME_TYPE_WALL)) {}

bool ModemData::hasSimColumn() const {
    return mModule != MODEM_MODULE_DRIVER;
}

int32_t ModemData::setData(const uint8_t* packet, size_t size, int64_t time, int32_t reason,
                           int64_t hourlyStamp) {
    (void)reason;
    (void)hourlyStamp;
    if (packet == nullptr) {
        KLOGE("Invalid pointer, please check!");
        HealthCounters::add(Health::ModemRecordsRefused);
        return MODEM_RECORD_REFUSED;
    }
    if (size < kModemPacketHeaderSize) {
        KLOGE("Record header past the end of the block: %zu bytes", size);
        return -1;
    }
    modem_packet_data header;
    memcpy(&header, packet, sizeof(header));
    if (header.length > size - kModemPacketHeaderSize) {
        KLOGE("Record length %u past the end of the block: %zu bytes", header.length,
              size - kModemPacketHeaderSize);
        return -1;
    }
    if (header.module != static_cast<uint32_t>(mModule)) {
        KLOGE("Record of module %u refused by the decoder of module %d", header.module, mModule);
        HealthCounters::add(Health::ModemRecordsRefused);
        return MODEM_RECORD_REFUSED;
    }
    if (header.length < mRecordSize) {
        KLOGE("Invalid input data length %d", modemLogValue(header.length));
        HealthCounters::add(Health::ModemRecordsRefused);
        return MODEM_RECORD_REFUSED;
    }
    // Records sit at any offset of the block: the counters are read from an
    // aligned copy.
    uint32_t record[kMaxRecordWords] = {};
    memcpy(record, packet + kModemPacketHeaderSize, mRecordSize);
    mLastUpdateTime = time;
    const int32_t refused = calcEnergy(record);
    if (logEntry(clampModemLevel(header.sim), record, time) < 0) {
        return MODEM_RECORD_NOT_STORED;
    }
    return refused > 0 ? MODEM_RECORD_STORED : MODEM_RECORD_ACCOUNTED;
}

int32_t ModemData::logEntry(int32_t sim, const void* record, int64_t time) {
    const uint32_t* fields = static_cast<const uint32_t*>(record);
    Parcel row;
    row.writeInt64(time);
    if (hasSimColumn()) {
        row.writeInt32(sim);
    }
    // The columns are int32: a counter keeps its 32 bits, so one above
    // INT32_MAX reads back as itself once taken as unsigned.
    for (size_t i = 0; i < mRecordSize / sizeof(uint32_t); ++i) {
        row.writeInt32(static_cast<int32_t>(fields[i]));
    }
    row.setDataPosition(0);
    return mOwner->logModemData(tableIndex(mModule), row);
}

int32_t ModemData::sendLevels(int32_t subtype, const int64_t* levels, int32_t count,
                              int32_t modulation, int64_t baseUsage) {
    Parcel action;
    action.writeInt32(ACCOUNTER_MODEM);
    action.writeInt32(ACTION_SET_VALUE);
    action.writeInt32(subtype);
    action.writeInt32(mModule);
    if (mModule == MODEM_MODULE_LTE_PHY) {
        action.writeInt32(modulation);
        action.writeInt32(clampModemLevel(baseUsage < 0 ? 0 : static_cast<uint64_t>(baseUsage)));
    }
    action.writeInt32(count);
    for (int32_t i = 0; i < count; ++i) {
        action.writeInt32(clampModemLevel(levels[i] < 0 ? 0 : static_cast<uint64_t>(levels[i])));
    }
    action.setDataPosition(0);
    return mOwner->accountingModemData(action);
}

int32_t ModemData::sendIdleSplit(uint64_t total, uint64_t divisor, const uint32_t counts[3],
                                 uint64_t factor, bool perCount) {
    if (divisor == 0) {
        KLOGI("idle count is 0");
        if (total > 0) {
            // Idle time without the counts to split it by is lost.
            HealthCounters::add(Health::ModemRecordsRefused);
        }
        return 1;
    }
    int64_t levels[3] = {};
    for (int32_t i = 0; i < 3; ++i) {
        // Exact in 128 bits: a count, a total and a factor of 32 bits each.
        const unsigned __int128 share =
            perCount ? static_cast<unsigned __int128>(counts[i]) * (total / divisor) * factor
                     : static_cast<unsigned __int128>(counts[i]) * total / divisor * factor;
        levels[i] =
            clampModemLevel(share > kInt32Max ? kInt32Max + 1 : static_cast<uint64_t>(share));
    }
    KLOGM(LOG_MODULE_MODEM, "module=%d, idle weak=%d, mid=%d, strong=%d", mModule,
          static_cast<int32_t>(levels[0]), static_cast<int32_t>(levels[1]),
          static_cast<int32_t>(levels[2]));
    sendLevels(MODEM_SCENARIO_IDLE, levels, 3);
    return 0;
}

}  // namespace kelvo
