#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define GSM_PHY_FIELDS(X) \
    X(search_time) X(search_count) X(idle_time) X(drx_count) X(drx_count_15) X(drx_count_x) \
    X(rssi_weak) X(rssi_mid) X(rssi_strong) X(ncell_meas_count_less) X(ncell_meas_count_mid) \
    X(ncell_meas_count_more) X(drx_isaic_fn_count) X(drx_daic_fn_count) X(forced_awake_count) \
    X(g_slave_awake_count) X(cell_reselect_count) X(cs_time) X(cs_tx_pwr_low) X(cs_tx_pwr_mid) \
    X(cs_tx_pwr_mid1) X(cs_tx_pwr_mid2) X(cs_tx_pwr_mid3) X(cs_tx_pwr_mid4) X(cs_tx_pwr_high) \
    X(cs_isaic_fn_count) X(cs_daic_fn_count) X(cs_sid_count) X(ps_time) X(ps_tx_pwr_low) \
    X(ps_tx_pwr_mid) X(ps_tx_pwr_mid1) X(ps_tx_pwr_mid2) X(ps_tx_pwr_mid3) X(ps_tx_pwr_mid4) \
    X(ps_tx_pwr_high) X(ps_isaic_fn_count) X(ps_daic_fn_count)
// clang-format on

struct gsm_phy_data {
    GSM_PHY_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(gsm_phy_data) == 152, "gsm_phy_data is 38 uint32 counters");

// GSM physical layer: idle time split by the DRX samples at each signal
// level, and circuit and packet frames (480 ms per count) at seven transmit
// powers.
class GsmPhyData : public ModemData {
public:
    static const table_attribute kTable;

    explicit GsmPhyData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
