#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define CDMA_EVDO_CAS_FIELDS(X) \
    X(pilot_search_total_time) X(pilot_search_num) X(idle_total_time) \
    X(rcv_low_signal_total_times) X(rcv_medium_signal_total_times) X(rcv_high_signal_total_times) \
    X(other_rat_meas_num) X(tch_total_time)
// clang-format on

struct cdma_evdo_cas_data {
    CDMA_EVDO_CAS_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(cdma_evdo_cas_data) == 32, "cdma_evdo_cas_data is 8 uint32 counters");

// EVDO cell search and idle: the idle time split by the share of samples at
// each signal level.
class CdmaEvdoCasData : public ModemData {
public:
    static const table_attribute kTable;

    explicit CdmaEvdoCasData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
