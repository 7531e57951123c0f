#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define LTE_RRC_FIELDS(X) \
    X(search_time) X(search_cnt) X(bg_l_cnt) X(idle_time) X(idle_drx_cnt) X(inter_meas_cnt) \
    X(inter_meas_time) X(irat_g_meas_cnt) X(irat_g_meas_time) X(irat_t_meas_cnt) \
    X(irat_t_meas_time) X(irat_w_meas_cnt) X(irat_w_meas_time) X(irat_c_meas_cnt) \
    X(irat_c_meas_time) X(rsrp_weak_cnt) X(rsrp_mid_cnt) X(rsrp_strong_cnt) X(conn_time)
// clang-format on

struct lte_rrc_data {
    LTE_RRC_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(lte_rrc_data) == 76, "lte_rrc_data is 19 uint32 counters");

// LTE radio resource control: idle time per DRX cycle, times the cycles at
// each signal level.
class LteRrcData : public ModemData {
public:
    static const table_attribute kTable;

    explicit LteRrcData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
    int32_t logEntry(int32_t sim, const void* record, int64_t time) override;
};

}  // namespace kelvo
