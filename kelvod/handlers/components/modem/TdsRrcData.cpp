#include "handlers/components/modem/TdsRrcData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, TDS_RRC_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute TdsRrcData::kTable = {"1.0", 1, modemColumnCount(kColumns), kColumns,
                                            "raw_modem_tds_rrc"};

TdsRrcData::TdsRrcData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_TDS_RRC, sizeof(tds_rrc_data), owner) {}

int32_t TdsRrcData::calcEnergy(const void* record) {
    const tds_rrc_data r = readModemRecord<tds_rrc_data>(record);
    const uint32_t counts[3] = {r.rscp_weak_cnt, r.rscp_mid_cnt, r.rscp_strong_cnt};
    // The idle time of one DRX cycle, times the cycles at each level.
    return sendIdleSplit(r.idle_time, r.idle_drx_cnt, counts, 1, true);
}

}  // namespace kelvo
