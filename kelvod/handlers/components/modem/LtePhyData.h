#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define LTE_PHY_FIELDS(X) \
    X(low_tx_power_time_cnt) X(mid_tx_power_time_cnt) X(mid1_tx_power_time_cnt) \
    X(mid2_tx_power_time_cnt) X(mid3_tx_power_time_cnt) X(mid4_tx_power_time_cnt) \
    X(high_tx_power_time_cnt) X(cdrx_time_cnt) X(cdrx_active_time_cnt) X(volte_time_cnt) \
    X(band_flag) X(last_collect_timestamp) X(last_rpt_timestamp)
// clang-format on

struct lte_phy_data {
    LTE_PHY_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(lte_phy_data) == 52, "lte_phy_data is 13 uint32 counters");

// LTE physical layer: connected time at seven transmit powers plus the
// active connected-DRX time that transmitted at none (an eighth level); the
// VoLTE share of every level is charged as voice, the rest as data.
class LtePhyData : public ModemData {
public:
    static const table_attribute kTable;

    explicit LtePhyData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
