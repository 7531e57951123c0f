#include "handlers/components/modem/GsmPhyData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, GSM_PHY_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute GsmPhyData::kTable = {"1.1", 1, modemColumnCount(kColumns), kColumns,
                                            "raw_modem_gsm_phy"};

GsmPhyData::GsmPhyData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_GSM_PHY, sizeof(gsm_phy_data), owner) {}

namespace {

// A count of 480 ms units in ms, in 64 bits.
int64_t unitsToMs(uint32_t units) {
    return clampModemLevel(static_cast<uint64_t>(units) * 480);
}

}  // namespace

int32_t GsmPhyData::calcEnergy(const void* record) {
    const gsm_phy_data r = readModemRecord<gsm_phy_data>(record);
    const uint32_t counts[3] = {r.rssi_weak, r.rssi_mid, r.rssi_strong};
    const int32_t refused = sendIdleSplit(r.idle_time >> 12, r.drx_count, counts, 125);
    const int64_t voice[7] = {unitsToMs(r.cs_tx_pwr_high), unitsToMs(r.cs_tx_pwr_mid4),
                              unitsToMs(r.cs_tx_pwr_mid3), unitsToMs(r.cs_tx_pwr_mid2),
                              unitsToMs(r.cs_tx_pwr_mid1), unitsToMs(r.cs_tx_pwr_mid),
                              unitsToMs(r.cs_tx_pwr_low)};
    KLOGM(LOG_MODULE_MODEM, "module=%d, cs tx high=%d, tx mid=%d %d %d %d %d, tx low=%d", module(),
          static_cast<int32_t>(voice[0]), static_cast<int32_t>(voice[1]),
          static_cast<int32_t>(voice[2]), static_cast<int32_t>(voice[3]),
          static_cast<int32_t>(voice[4]), static_cast<int32_t>(voice[5]),
          static_cast<int32_t>(voice[6]));
    sendLevels(MODEM_SCENARIO_VOICE, voice, 7);
    const int64_t data[7] = {unitsToMs(r.ps_tx_pwr_high), unitsToMs(r.ps_tx_pwr_mid4),
                             unitsToMs(r.ps_tx_pwr_mid3), unitsToMs(r.ps_tx_pwr_mid2),
                             unitsToMs(r.ps_tx_pwr_mid1), unitsToMs(r.ps_tx_pwr_mid),
                             unitsToMs(r.ps_tx_pwr_low)};
    KLOGM(LOG_MODULE_MODEM, "module=%d, ps tx high=%d, tx mid=%d %d %d %d %d, tx low=%d", module(),
          static_cast<int32_t>(data[0]), static_cast<int32_t>(data[1]),
          static_cast<int32_t>(data[2]), static_cast<int32_t>(data[3]),
          static_cast<int32_t>(data[4]), static_cast<int32_t>(data[5]),
          static_cast<int32_t>(data[6]));
    sendLevels(MODEM_SCENARIO_DATA, data, 7);
    return refused;
}

}  // namespace kelvo
