#include "handlers/components/modem/WcdmaPhyData.h"

#include "KelvoLog.h"

namespace kelvo {

namespace {

const column_attribute kColumns[] = {
    {COLUMN_TIME, "timestamp"}, {COLUMN_INT, "sim"}, WCDMA_PHY_FIELDS(MODEM_RECORD_COLUMN)};

}  // namespace

const table_attribute WcdmaPhyData::kTable = {"1.1", 1, modemColumnCount(kColumns), kColumns,
                                              "raw_modem_wcdma_phy"};

WcdmaPhyData::WcdmaPhyData(ModemDataOwner* owner)
    : ModemData(MODEM_MODULE_WCDMA_PHY, sizeof(wcdma_phy_data), owner) {}

namespace {

// A count of 10 ms frames in ms, in 64 bits.
int64_t framesToMs(uint32_t frames) {
    return clampModemLevel(static_cast<uint64_t>(frames) * 10);
}

}  // namespace

int32_t WcdmaPhyData::calcEnergy(const void* record) {
    const wcdma_phy_data r = readModemRecord<wcdma_phy_data>(record);
    const uint32_t counts[3] = {r.drx_weak_signal_cnt, r.drx_normal_signal_cnt,
                                r.drx_strong_signal_cnt};
    const int32_t refused = sendIdleSplit(r.drx_total_time >> 12, r.drx_total_cnt, counts, 125);
    const int64_t voice[7] = {
        framesToMs(r.cs_weak_signal_cnt),    framesToMs(r.cs_normal4_signal_cnt),
        framesToMs(r.cs_normal3_signal_cnt), framesToMs(r.cs_normal2_signal_cnt),
        framesToMs(r.cs_normal1_signal_cnt), framesToMs(r.cs_normal_signal_cnt),
        framesToMs(r.cs_strong_signal_cnt)};
    KLOGM(LOG_MODULE_MODEM, "module=%d, voice weak=%d, mid=%d %d %d %d %d, strong=%d", module(),
          static_cast<int32_t>(voice[0]), static_cast<int32_t>(voice[1]),
          static_cast<int32_t>(voice[2]), static_cast<int32_t>(voice[3]),
          static_cast<int32_t>(voice[4]), static_cast<int32_t>(voice[5]),
          static_cast<int32_t>(voice[6]));
    sendLevels(MODEM_SCENARIO_VOICE, voice, 7);
    const int64_t data[7] = {
        framesToMs(r.ps_weak_signal_cnt),    framesToMs(r.ps_normal4_signal_cnt),
        framesToMs(r.ps_normal3_signal_cnt), framesToMs(r.ps_normal2_signal_cnt),
        framesToMs(r.ps_normal1_signal_cnt), framesToMs(r.ps_normal_signal_cnt),
        framesToMs(r.ps_strong_signal_cnt)};
    KLOGM(LOG_MODULE_MODEM, "module=%d, data weak=%d, mid=%d %d %d %d %d, strong=%d", module(),
          static_cast<int32_t>(data[0]), static_cast<int32_t>(data[1]),
          static_cast<int32_t>(data[2]), static_cast<int32_t>(data[3]),
          static_cast<int32_t>(data[4]), static_cast<int32_t>(data[5]),
          static_cast<int32_t>(data[6]));
    sendLevels(MODEM_SCENARIO_DATA, data, 7);
    return refused;
}

}  // namespace kelvo
