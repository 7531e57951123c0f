#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define TDS_RRC_FIELDS(X) \
    X(search_time) X(search_cnt) X(idle_time) X(idle_drx_cnt) X(inter_meas_cnt) \
    X(inter_meas_time) X(irat_g_meas_cnt) X(irat_g_meas_time) X(irat_l_meas_cnt) \
    X(irat_l_meas_time) X(rscp_weak_cnt) X(rscp_mid_cnt) X(rscp_strong_cnt) X(cs_time) X(ps_time)
// clang-format on

struct tds_rrc_data {
    TDS_RRC_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(tds_rrc_data) == 60, "tds_rrc_data is 15 uint32 counters");

// TD-SCDMA radio resource control: idle time per DRX cycle, times the cycles
// at each signal level.
class TdsRrcData : public ModemData {
public:
    static const table_attribute kTable;

    explicit TdsRrcData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
