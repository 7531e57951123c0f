#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define CDMA_1X_CAS_FIELDS(X) \
    X(pilot_search_total_time) X(pilot_search_num) X(idle_total_time) \
    X(rcv_low_signal_total_times) X(rcv_medium_signal_total_times) X(rcv_high_signal_total_times) \
    X(voice_service_total_time) X(data_service_total_time)
// clang-format on

struct cdma_1x_cas_data {
    CDMA_1X_CAS_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(cdma_1x_cas_data) == 32, "cdma_1x_cas_data is 8 uint32 counters");

// CDMA 1x cell search and idle: the idle time split by the share of samples
// at each signal level.
class Cdma1xCasData : public ModemData {
public:
    static const table_attribute kTable;

    explicit Cdma1xCasData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
