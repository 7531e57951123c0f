#include "handlers/components/modem/LtePhyData.h"

#include "HealthCounters.h"
#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, LTE_PHY_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute LtePhyData::kTable = {"1.1", 1, modemColumnCount(kColumns), kColumns,
                                            "raw_modem_lte_phy"};

LtePhyData::LtePhyData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_LTE_PHY, sizeof(lte_phy_data), owner) {}

namespace {

// Most active connected-DRX ticks a record may carry.
constexpr uint32_t kMaxCdrxActiveTicks = 536870910;
constexpr int32_t kLteLevels = 8;

}  // namespace

int32_t LtePhyData::calcEnergy(const void* record) {
    const lte_phy_data r = readModemRecord<lte_phy_data>(record);
    if (r.band_flag != 0 && r.band_flag != 1) {
        KLOGE("unknown band flag=%d", modemLogValue(r.band_flag));
        HealthCounters::add(Health::ModemRecordsRefused);
        return 1;
    }
    if (r.cdrx_active_time_cnt > kMaxCdrxActiveTicks || r.cdrx_active_time_cnt > r.cdrx_time_cnt) {
        KLOGE("input cdrx active time error=%d", modemLogValue(r.cdrx_active_time_cnt));
        HealthCounters::add(Health::ModemRecordsRefused);
        return 1;
    }
    // Ticks of 1/4096 of 125 ms, highest transmit power first; every value
    // below 2^20 after the shift, so the sums and products fit easily.
    const uint32_t ticks[7] = {r.high_tx_power_time_cnt, r.mid4_tx_power_time_cnt,
                               r.mid3_tx_power_time_cnt, r.mid2_tx_power_time_cnt,
                               r.mid1_tx_power_time_cnt, r.mid_tx_power_time_cnt,
                               r.low_tx_power_time_cnt};
    uint64_t x[kLteLevels] = {};
    uint64_t transmitting = 0;
    for (int32_t i = 0; i < 7; ++i) {
        x[i] = ticks[i] >> 12;
        transmitting += x[i];
    }
    const uint64_t volte = r.volte_time_cnt >> 12;
    const uint64_t active = r.cdrx_active_time_cnt >> 12;
    if (volte + transmitting > active) {
        KLOGE("connect time error!");
        HealthCounters::add(Health::ModemRecordsRefused);
        return 1;
    }
    // Active without transmitting: the eighth level.
    x[7] = active - volte - transmitting;
    KLOGM(LOG_MODULE_MODEM, "module=%d, tx high=%d, tx mid=%d %d %d %d %d, tx low=%d", module(),
          static_cast<int32_t>(x[0]), static_cast<int32_t>(x[1]), static_cast<int32_t>(x[2]),
          static_cast<int32_t>(x[3]), static_cast<int32_t>(x[4]), static_cast<int32_t>(x[5]),
          static_cast<int32_t>(x[6]));
    const int32_t band = static_cast<int32_t>(r.band_flag);
    int64_t data[kLteLevels] = {};
    if (volte == 0) {
        for (int32_t i = 0; i < kLteLevels; ++i) {
            data[i] = static_cast<int64_t>(x[i] * 125);
        }
        sendLevels(MODEM_SCENARIO_DATA, data, kLteLevels, band, 0);
        return 0;
    }
    // The VoLTE share of each level; active >= volte > 0.
    int64_t voice[kLteLevels] = {};
    for (int32_t i = 0; i < kLteLevels; ++i) {
        const uint64_t share = volte * x[i] / active;
        voice[i] = static_cast<int64_t>(share * 125);
        data[i] = static_cast<int64_t>(x[i] * 125) - voice[i];
    }
    sendLevels(MODEM_SCENARIO_VOICE, voice, kLteLevels, band, static_cast<int64_t>(volte * 125));
    sendLevels(MODEM_SCENARIO_DATA, data, kLteLevels, band, 0);
    return 0;
}

}  // namespace kelvo
