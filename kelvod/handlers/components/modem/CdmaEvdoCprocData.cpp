#include "handlers/components/modem/CdmaEvdoCprocData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, CDMA_EVDO_CPROC_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute CdmaEvdoCprocData::kTable = {"1.1", 1, modemColumnCount(kColumns), kColumns,
                                                   "raw_modem_cdma_evdo_cproc"};

CdmaEvdoCprocData::CdmaEvdoCprocData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_CDMA_EVDO_CPROC, sizeof(cdma_evdo_cproc_data), owner) {}

namespace {

// A transmit count in ms: * 5 / 4, the product first, in 64 bits.
int64_t cdmaCountToMs(uint32_t count) {
    return clampModemLevel(static_cast<uint64_t>(count) * 5 >> 2);
}

}  // namespace

int32_t CdmaEvdoCprocData::calcEnergy(const void* record) {
    const cdma_evdo_cproc_data r = readModemRecord<cdma_evdo_cproc_data>(record);
    const int64_t data[7] = {cdmaCountToMs(r.ps_tx_pwr_high), cdmaCountToMs(r.ps_tx_pwr_mid4),
                             cdmaCountToMs(r.ps_tx_pwr_mid3), cdmaCountToMs(r.ps_tx_pwr_mid2),
                             cdmaCountToMs(r.ps_tx_pwr_mid1), cdmaCountToMs(r.ps_tx_pwr_mid),
                             cdmaCountToMs(r.ps_tx_pwr_low)};
    KLOGM(LOG_MODULE_MODEM, "module=%d, ps tx high=%d, tx mid=%d %d %d %d %d, tx low=%d", module(),
          static_cast<int32_t>(data[0]), static_cast<int32_t>(data[1]),
          static_cast<int32_t>(data[2]), static_cast<int32_t>(data[3]),
          static_cast<int32_t>(data[4]), static_cast<int32_t>(data[5]),
          static_cast<int32_t>(data[6]));
    sendLevels(MODEM_SCENARIO_DATA, data, 7);
    return 0;
}

}  // namespace kelvo
