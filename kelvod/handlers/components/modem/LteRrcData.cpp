#include "handlers/components/modem/LteRrcData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, LTE_RRC_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute LteRrcData::kTable = {"1.0", 1, modemColumnCount(kColumns), kColumns,
                                            "raw_modem_lte_rrc"};

LteRrcData::LteRrcData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_LTE_RRC, sizeof(lte_rrc_data), owner) {}

int32_t LteRrcData::calcEnergy(const void* record) {
    const lte_rrc_data r = readModemRecord<lte_rrc_data>(record);
    const uint32_t counts[3] = {r.rsrp_weak_cnt, r.rsrp_mid_cnt, r.rsrp_strong_cnt};
    // The idle time of one DRX cycle, times the cycles at each level.
    return sendIdleSplit(r.idle_time, r.idle_drx_cnt, counts, 1, true);
}

int32_t LteRrcData::logEntry(int32_t sim, const void* record, int64_t time) {
    KLOGM(LOG_MODULE_MODEM, "log rrc data, sim=%d", sim);
    return ModemData::logEntry(sim, record, time);
}

}  // namespace kelvo
