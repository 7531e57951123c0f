#include "handlers/components/modem/Cdma1xCasData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, CDMA_1X_CAS_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute Cdma1xCasData::kTable = {"1.0", 1, modemColumnCount(kColumns), kColumns,
                                               "raw_modem_cdma_1x_cas"};

Cdma1xCasData::Cdma1xCasData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_CDMA_1X_CAS, sizeof(cdma_1x_cas_data), owner) {}

int32_t Cdma1xCasData::calcEnergy(const void* record) {
    const cdma_1x_cas_data r = readModemRecord<cdma_1x_cas_data>(record);
    const uint32_t counts[3] = {r.rcv_low_signal_total_times, r.rcv_medium_signal_total_times,
                                r.rcv_high_signal_total_times};
    const uint64_t samples = static_cast<uint64_t>(counts[0]) + counts[1] + counts[2];
    return sendIdleSplit(r.idle_total_time >> 12, samples, counts, 125);
}

}  // namespace kelvo
