#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define CDMA_1X_CPROC_FIELDS(X) \
    X(pch_drx_count) X(pch_drx_count_80) X(pch_drx_count_160) X(qpch_drx_count) \
    X(qpch_drx_count_60) X(ncell_meas_count_30) X(ncell_meas_count_60) X(voice_tx_pwr_low) \
    X(voice_tx_pwr_mid) X(voice_tx_pwr_mid1) X(voice_tx_pwr_mid2) X(voice_tx_pwr_mid3) \
    X(voice_tx_pwr_mid4) X(voice_tx_pwr_high) X(data_tx_pwr_low) X(data_tx_pwr_mid) \
    X(data_tx_pwr_mid1) X(data_tx_pwr_mid2) X(data_tx_pwr_mid3) X(data_tx_pwr_mid4) \
    X(data_tx_pwr_high)
// clang-format on

struct cdma_1x_cproc_data {
    CDMA_1X_CPROC_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(cdma_1x_cproc_data) == 84, "cdma_1x_cproc_data is 21 uint32 counters");

// CDMA 1x call processing: voice and data time at seven transmit powers.
class Cdma1xCprocData : public ModemData {
public:
    static const table_attribute kTable;

    explicit Cdma1xCprocData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
