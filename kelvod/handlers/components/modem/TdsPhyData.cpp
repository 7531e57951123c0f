#include "handlers/components/modem/TdsPhyData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, TDS_PHY_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute TdsPhyData::kTable = {"1.1", 1, modemColumnCount(kColumns), kColumns,
                                            "raw_modem_tds_phy"};

TdsPhyData::TdsPhyData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_TDS_PHY, sizeof(tds_phy_data), owner) {}

int32_t TdsPhyData::calcEnergy(const void* record) {
    const tds_phy_data r = readModemRecord<tds_phy_data>(record);
    const int64_t voice[7] = {
        modemTicksToMs(r.high_tx_power_time_cnt), modemTicksToMs(r.mid4_tx_power_time_cnt),
        modemTicksToMs(r.mid3_tx_power_time_cnt), modemTicksToMs(r.mid2_tx_power_time_cnt),
        modemTicksToMs(r.mid1_tx_power_time_cnt), modemTicksToMs(r.mid_tx_power_time_cnt),
        modemTicksToMs(r.low_tx_power_time_cnt)};
    KLOGM(LOG_MODULE_MODEM, "module=%d, tx high=%d, tx mid=%d %d %d %d %d, tx low=%d", module(),
          static_cast<int32_t>(voice[0]), static_cast<int32_t>(voice[1]),
          static_cast<int32_t>(voice[2]), static_cast<int32_t>(voice[3]),
          static_cast<int32_t>(voice[4]), static_cast<int32_t>(voice[5]),
          static_cast<int32_t>(voice[6]));
    sendLevels(MODEM_SCENARIO_VOICE, voice, 7);
    return 0;
}

}  // namespace kelvo
