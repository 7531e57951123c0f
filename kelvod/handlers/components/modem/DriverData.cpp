#include "handlers/components/modem/DriverData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {{COLUMN_TIME, "timestamp"}, DRIVER_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute DriverData::kTable = {"1.0", 1, modemColumnCount(kColumns), kColumns,
                                            "raw_modem_driver"};

DriverData::DriverData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_DRIVER, sizeof(driver_data), owner) {}

int32_t DriverData::calcEnergy(const void* record) {
    // Stored only: no action.
    (void)record;
    return 0;
}

}  // namespace kelvo
