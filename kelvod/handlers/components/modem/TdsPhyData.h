#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define TDS_PHY_FIELDS(X) \
    X(low_tx_power_time_cnt) X(mid_tx_power_time_cnt) X(mid1_tx_power_time_cnt) \
    X(mid2_tx_power_time_cnt) X(mid3_tx_power_time_cnt) X(mid4_tx_power_time_cnt) \
    X(high_tx_power_time_cnt) X(dch_enter_time) X(dch_exit_time)
// clang-format on

struct tds_phy_data {
    TDS_PHY_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(tds_phy_data) == 36, "tds_phy_data is 9 uint32 counters");

// TD-SCDMA physical layer: dedicated channel time at seven transmit powers,
// charged as voice.
class TdsPhyData : public ModemData {
public:
    static const table_attribute kTable;

    explicit TdsPhyData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
