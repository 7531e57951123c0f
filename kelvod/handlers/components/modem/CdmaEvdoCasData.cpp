#include "handlers/components/modem/CdmaEvdoCasData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, CDMA_EVDO_CAS_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute CdmaEvdoCasData::kTable = {"1.0", 1, modemColumnCount(kColumns), kColumns,
                                                 "raw_modem_cdma_evdo_cas"};

CdmaEvdoCasData::CdmaEvdoCasData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_CDMA_EVDO_CAS, sizeof(cdma_evdo_cas_data), owner) {}

int32_t CdmaEvdoCasData::calcEnergy(const void* record) {
    const cdma_evdo_cas_data r = readModemRecord<cdma_evdo_cas_data>(record);
    const uint32_t counts[3] = {r.rcv_low_signal_total_times, r.rcv_medium_signal_total_times,
                                r.rcv_high_signal_total_times};
    const uint64_t samples = static_cast<uint64_t>(counts[0]) + counts[1] + counts[2];
    return sendIdleSplit(r.idle_total_time >> 12, samples, counts, 125);
}

}  // namespace kelvo
