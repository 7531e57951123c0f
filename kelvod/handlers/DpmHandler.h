#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

#include <array>
#include <map>
#include <string>
#include <vector>

#include "core/KelvoOperator.h"
#include "storage/TableAttribute.h"

namespace kelvo {

// The energy of the system-on-chip's IP blocks from the power monitor
// (DpmDevice). At every data poll it reads how long each block was off,
// busy, busy at low voltage and idle since the last read, and the DDR's
// cumulative time and traffic per bandwidth level; the accounter turns them
// into energy and the results are stored per block. No log tags.
//
// The monitor's block statistics are reset after each good read, so a read
// covers the time since the previous one. When a reset fails, the values
// just reported are kept per block and taken off the next read, so no time
// is counted twice. The DDR counters are never reset: each read takes the
// increase over the previous one (the first read only sets the baselines).
class DpmHandler : public KelvoOperator {
public:
    static constexpr uint32_t kElector = 0x200000;
    // Customized message: read now and flush (the query service's request).
    static constexpr int32_t kCustomizedRead = 0;
    static constexpr int32_t kDdrLevels = 4;
    static constexpr int32_t kPreferredPeriod = 1000;

    static const table_attribute& rawTable();
    static const table_attribute& hourlyTable();

    DpmHandler();

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t setConfiguration() override;
    int32_t checkEnable() override;
    void setupListeners(android::Parcel& out) override;
    void setCandidateElector() override;
    int32_t onDataPolling(const android::Parcel& data) override;
    // The hour is read by the hourly data poll.
    int32_t onHourlyTick(const android::Parcel& data) override;
    int32_t onHourlyUploading(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onDawnUploading(const android::Parcel& data) override;
    int32_t logComponentAccounting(int64_t time) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t handleComponentResult(const android::Parcel& data) override;

private:
    struct record {
        int32_t id;
        std::array<int64_t, 4> values;
    };
    struct ddr_baseline {
        int64_t time = 0;
        int64_t flux = 0;
    };

    int32_t setPeriod();
    int32_t resetData();
    // Reads the blocks and the DDR at `time` and hands them to the
    // accounter. 0 when at least one part was read, else -2.
    int32_t readData(int64_t time);
    int32_t readIpData(std::vector<record>* records);
    int32_t readDdrData(std::vector<record>* records);
    void restartDdr();
    int32_t uploadPeriod(uint32_t event, const android::Parcel& data, int64_t window,
                         int32_t candidate);
    int32_t setPeriodData(android::Parcel& out, int64_t end, int64_t window, float ratio);

    int32_t mPolicy = 0;
    std::map<std::string, int32_t> mIpIds;
    // By DDR level index: its id and threshold; empty under policy 1.
    std::vector<std::pair<int32_t, int64_t>> mDdrLevels;
    int32_t mIpCount = 0;
    std::array<ddr_baseline, kDdrLevels> mDdrBaselines;
    int32_t mDdrState = 0;
    // The values of the last read whose reset failed, by block name.
    std::map<std::string, std::array<int64_t, 4>> mIpBaselines;
    int64_t mLastReadTime;
    bool mChargerOnline = false;
};

}  // namespace kelvo
