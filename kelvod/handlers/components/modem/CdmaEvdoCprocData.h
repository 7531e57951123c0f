#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define CDMA_EVDO_CPROC_FIELDS(X) \
    X(drx_count) X(drx_count_80) X(drx_count_160) X(ncell_meas_count_30) X(ncell_meas_count_60) \
    X(ps_tx_pwr_low) X(ps_tx_pwr_mid) X(ps_tx_pwr_mid1) X(ps_tx_pwr_mid2) X(ps_tx_pwr_mid3) \
    X(ps_tx_pwr_mid4) X(ps_tx_pwr_high)
// clang-format on

struct cdma_evdo_cproc_data {
    CDMA_EVDO_CPROC_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(cdma_evdo_cproc_data) == 48, "cdma_evdo_cproc_data is 12 uint32 counters");

// EVDO call processing: packet data time at seven transmit powers.
class CdmaEvdoCprocData : public ModemData {
public:
    static const table_attribute kTable;

    explicit CdmaEvdoCprocData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
