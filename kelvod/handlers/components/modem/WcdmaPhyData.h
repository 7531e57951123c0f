#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define WCDMA_PHY_FIELDS(X) \
    X(cell_search_total_time) X(cell_search_total_cnt) X(drx_total_time) X(drx_total_cnt) \
    X(drx_total_work_cnt) X(drx_work_short_time_cnt) X(drx_work_long_time_cnt) \
    X(drx_weak_signal_cnt) X(drx_normal_signal_cnt) X(drx_strong_signal_cnt) \
    X(pch_weak_signal_cnt) X(pch_normal_signal_cnt) X(pch_strong_signal_cnt) \
    X(drx_force_wake_cnt) X(drx_inter_meas_cnt) X(drx_inter_rat_meas_cnt) X(cs_total_time) \
    X(ps_total_time) X(cs_and_ps_total_time) X(ps_strong_signal_cnt) X(ps_normal_signal_cnt) \
    X(ps_normal1_signal_cnt) X(ps_normal2_signal_cnt) X(ps_normal3_signal_cnt) \
    X(ps_normal4_signal_cnt) X(ps_weak_signal_cnt) X(cs_strong_signal_cnt) \
    X(cs_normal_signal_cnt) X(cs_normal1_signal_cnt) X(cs_normal2_signal_cnt) \
    X(cs_normal3_signal_cnt) X(cs_normal4_signal_cnt) X(cs_weak_signal_cnt) X(slave_work_time)
// clang-format on

struct wcdma_phy_data {
    WCDMA_PHY_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(wcdma_phy_data) == 136, "wcdma_phy_data is 34 uint32 counters");

// WCDMA physical layer: DRX time split by the samples at each signal level,
// and circuit and packet time (10 ms frames) at seven signal levels.
class WcdmaPhyData : public ModemData {
public:
    static const table_attribute kTable;

    explicit WcdmaPhyData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
