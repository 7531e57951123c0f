#pragma once

#include <binder/Parcel.h>
#include <stddef.h>
#include <stdint.h>
#include <string.h>

#include <memory>

#include "handlers/components/modem/ModemDataOwner.h"
#include "storage/TableAttribute.h"

namespace kelvo {

// The modem modules that report a record, in the order of their ids.
enum ModemModule : int32_t {
    MODEM_MODULE_CDMA_1X_CAS = 0,
    MODEM_MODULE_CDMA_1X_CPROC = 1,
    MODEM_MODULE_CDMA_EVDO_CAS = 2,
    MODEM_MODULE_CDMA_EVDO_CPROC = 3,
    MODEM_MODULE_TDS_PHY = 4,
    MODEM_MODULE_LTE_PHY = 5,
    MODEM_MODULE_TDS_RRC = 6,
    MODEM_MODULE_LTE_RRC = 7,
    MODEM_MODULE_WCDMA_PHY = 8,
    MODEM_MODULE_GSM_PHY = 9,
    MODEM_MODULE_DRIVER = 10,
    MODEM_MODULE_WCDMA_RRC = 11,
    MODEM_MODULE_COUNT = 12,
};

// Modem accounter subtypes a decoder sends (the int32 after SetValue).
enum ModemScenario : int32_t {
    MODEM_SCENARIO_VOICE = 0,
    MODEM_SCENARIO_IDLE = 1,
    MODEM_SCENARIO_DATA = 2,
};

// The header of one record as it sits in a modem block, at any offset:
// uint32 data length L, uint32 SIM index, uint32 module id, then L bytes of
// the module's record (uint32 counters).
struct modem_packet_data {
    uint32_t length;
    uint32_t sim;
    uint32_t module;
};
constexpr size_t kModemPacketHeaderSize = sizeof(modem_packet_data);
static_assert(kModemPacketHeaderSize == 12, "modem record header is three uint32");

// What setData made of one record. A refused record never ends the block:
// only the caller's own checks of the block do.
enum ModemRecordResult : int32_t {
    MODEM_RECORD_ACCOUNTED = 0,   // row stored, every action sent
    MODEM_RECORD_STORED = 1,      // row stored; the energy step refused (part of) the record
    MODEM_RECORD_REFUSED = 2,     // dropped (null or short): no row, no action
    MODEM_RECORD_NOT_STORED = 3,  // the owner refused the row (actions were sent)
    // Negative: the packet does not fit in the bytes handed over (a block fault).
};

// The base of the modem record decoders: one per module, created on the
// module's first record and kept by the modem handler. A decoder checks a
// record, turns its residency counters into times per transmit power or
// signal level, hands them to the modem accounter through its owner and
// stores the record as one row of its module's table (owner table number
// module + 1). Runs on the owner's thread only.
class ModemData {
public:
    // The decoder of a module, or null for an unknown module. The owner must
    // outlive the decoder.
    static std::unique_ptr<ModemData> create(int32_t module, ModemDataOwner* owner);
    // The raw table of a module's records, or null for an unknown module.
    static const table_attribute* table(int32_t module);
    // The owner's table number of a module's rows.
    static int32_t tableIndex(int32_t module) { return module + 1; }

    virtual ~ModemData() = default;

    ModemData(const ModemData&) = delete;
    ModemData& operator=(const ModemData&) = delete;

    // packet: a record's header and data as they sit in the block (any
    // alignment); size: the bytes readable from packet. The record is read
    // for its first recordSize() bytes; a longer one is accepted. time: the
    // block's time, stamped on the row; reason and hourlyStamp: the
    // handler's polling reason and hourly stamp. Returns a ModemRecordResult,
    // or -1 when the header or L bytes do not fit in size.
    int32_t setData(const uint8_t* packet, size_t size, int64_t time, int32_t reason,
                    int64_t hourlyStamp);

    int32_t module() const { return mModule; }
    // Smallest data length of the module's record, in bytes.
    size_t recordSize() const { return mRecordSize; }
    // The block time of the last record taken; construction time before.
    int64_t lastUpdateTime() const { return mLastUpdateTime; }

protected:
    ModemData(int32_t module, size_t recordSize, ModemDataOwner* owner);

    // Stores the row of one record; record points at recordSize() bytes of
    // aligned storage. Negative when the owner refused it.
    virtual int32_t logEntry(int32_t sim, const void* record, int64_t time);
    // Sends the record's actions; the number of action groups refused
    // (bad field, no idle count), 0 when all went out.
    virtual int32_t calcEnergy(const void* record) = 0;

    // Sends one SetValue action: subtype, this module, then for the LTE
    // physical layer the modulation and base usage, then the level times.
    int32_t sendLevels(int32_t subtype, const int64_t* levels, int32_t count,
                       int32_t modulation = 0, int64_t baseUsage = 0);
    // Idle times at three signal levels (weak, mid, strong). Split: level i
    // is counts[i] * total / divisor, then * factor. Per count (perCount):
    // counts[i] * (total / divisor), then * factor. Nothing is sent for a
    // divisor of 0. Returns 1 when refused, else 0.
    int32_t sendIdleSplit(uint64_t total, uint64_t divisor, const uint32_t counts[3],
                          uint64_t factor, bool perCount = false);
    // Whether a record with this table has a SIM column.
    bool hasSimColumn() const;

    ModemDataOwner* mOwner;  // not owned; outlives the decoder

private:
    const int32_t mModule;
    const size_t mRecordSize;
    int64_t mLastUpdateTime;
};

// Record layouts are lists of uint32 counters, each written once: the
// record struct takes MODEM_RECORD_FIELD of the list, the table's columns
// MODEM_RECORD_COLUMN.
#define MODEM_RECORD_FIELD(name) uint32_t name;
#define MODEM_RECORD_COLUMN(name) {COLUMN_INT, #name},

// A record read from the decoder's aligned copy.
template <typename Record>
Record readModemRecord(const void* data) {
    Record record;
    memcpy(&record, data, sizeof(record));
    return record;
}

template <size_t N>
constexpr int32_t modemColumnCount(const column_attribute (&)[N]) {
    return static_cast<int32_t>(N);
}

// Bounded integer helpers of the energy step: every product is formed in 64
// bits, and a level sent to the accounter never exceeds INT32_MAX.
int32_t clampModemLevel(uint64_t value);
// A counter for a log line: held at INT32_MAX, not counted as clamped.
inline int32_t modemLogValue(uint32_t value) {
    return value > 0x7FFFFFFFu ? 0x7FFFFFFF : static_cast<int32_t>(value);
}
// A tick counter in ms: t >> 12, then * 125 (t * 125 / 4096, the shift first).
inline int64_t modemTicksToMs(uint32_t ticks) {
    return static_cast<int64_t>(ticks >> 12) * 125;
}

}  // namespace kelvo
