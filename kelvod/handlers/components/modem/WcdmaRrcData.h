#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define WCDMA_RRC_FIELDS(X) \
    X(fach_time) X(ura_pch_time) X(cell_pch_time) X(dch_time) X(idle_time)
// clang-format on

struct wcdma_rrc_data {
    WCDMA_RRC_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(wcdma_rrc_data) == 20, "wcdma_rrc_data is 5 uint32 counters");

// WCDMA radio resource control: forward access channel time (10 ms frames),
// charged as data at the special power.
class WcdmaRrcData : public ModemData {
public:
    static const table_attribute kTable;

    explicit WcdmaRrcData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
