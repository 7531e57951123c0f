#include "handlers/components/modem/WcdmaRrcData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, WCDMA_RRC_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute WcdmaRrcData::kTable = {"1.0", 1, modemColumnCount(kColumns), kColumns,
                                              "raw_modem_wcdma_rrc"};

WcdmaRrcData::WcdmaRrcData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_WCDMA_RRC, sizeof(wcdma_rrc_data), owner) {}

int32_t WcdmaRrcData::calcEnergy(const void* record) {
    const wcdma_rrc_data r = readModemRecord<wcdma_rrc_data>(record);
    KLOGM(LOG_MODULE_MODEM, "module=%d, fach=%d, ura_pch=%d, cell_pch=%d, dch=%d, idle=%d",
          module(), modemLogValue(r.fach_time), modemLogValue(r.ura_pch_time),
          modemLogValue(r.cell_pch_time), modemLogValue(r.dch_time), modemLogValue(r.idle_time));
    // FACH time in 10 ms frames.
    const int64_t fach[1] = {clampModemLevel(static_cast<uint64_t>(r.fach_time) * 10)};
    sendLevels(MODEM_SCENARIO_DATA, fach, 1);
    return 0;
}

}  // namespace kelvo
