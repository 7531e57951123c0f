#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include <atomic>
#include <deque>
#include <map>
#include <memory>

#include "handlers/components/ComponentHandler.h"
#include "handlers/components/ModemBlock.h"
#include "handlers/components/TrafficCollector.h"
#include "handlers/components/modem/ModemDataOwner.h"

namespace kelvo {

class ModemData;

// Cellular modem energy. Two sources meet here: the modem's own statistics
// (a block of per-module residency records the modem sends after each
// request written to its control file, decoded by one ModemData per module)
// and the applications' traffic on the "rmnet" interfaces. The accounter
// reports the idle and call energy per module and splits the data energy
// among the applications by their traffic; at the hour the handler
// redistributes the applications' energy by their packets.
//
// Requests and answers: every poll writes the module list to the control
// file; the answer arrives later as customized tag 1 (int32 S, S bytes).
// Outstanding requests are answered in order and each answer is stamped
// with its request's time; an answer to nothing outstanding (a late one) is
// stamped at its arrival. The hourly request is answered within the
// hourly time-out or the hour is voted for without it.
class ModemHandler : public ComponentHandler, public ModemDataOwner {
public:
    static constexpr uint32_t kElector = 0x40000;
    static constexpr const char* kControlPath = "/sys/devices/platform/tervin_modem_pm_info/mod_on";
    static constexpr const char* kModuleList = "30 33 34 35 36 37 38 39 40 41 42 43";
    static constexpr int32_t kPolicyComponent = 3;
    static constexpr int64_t kHourlyTimeoutMs = 20000;
    static constexpr int64_t kRequestSpacingMs = 5000;
    // Module 12: PAM wake-up items of five uint32, stored in chunks.
    static constexpr uint32_t kPamModule = 12;
    static constexpr size_t kPamItemSize = 20;
    static constexpr int32_t kMaxRowsPerInsert = 5000;
    // Requests remembered while their answers are awaited.
    static constexpr size_t kMaxOutstanding = 16;
    // Tables of logModemData: 0 to kTableCount - 1 (module + 1 for the
    // decoders).
    static constexpr int32_t kTableCount = 20;
    static constexpr int32_t kPamTableIndex = 13;

    enum customized_tag : int32_t {
        TAG_HOURLY_TIMEOUT = 0,
        TAG_MODEM_BLOCK = 1,
    };
    // Component result types.
    enum result_type : int32_t {
        RESULT_VOICE = 0,
        RESULT_IDLE = 1,
        RESULT_DATA = 2,
        RESULT_TYPES = 3,
    };

    ModemHandler();
    // With lookups of the caller's own for the traffic's package and process
    // names (tests and the bench); null ones use the package properties.
    ModemHandler(TrafficCollector::PackageLookup packages, TrafficReader::NameLookup processes);
    ~ModemHandler() override;

    static const component_family& family();
    // Shortens the hourly time-out and the spacing of requests (tests); 0 or
    // less restores the default.
    static void setTimingForTest(int64_t hourlyTimeoutMs, int64_t spacingMs);

    // ModemDataOwner.
    int32_t logModemData(int32_t index, const android::Parcel& row) override;
    int32_t accountingModemData(android::Parcel& action) override;

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t setConfiguration() override;
    int32_t checkEnable() override;
    void setupListeners(android::Parcel& out) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t onDataPolling(const android::Parcel& data) override;
    int32_t onUidRemoved(const android::Parcel& data) override;
    int32_t onScreenStateChanged(const android::Parcel& data) override;
    int32_t onForegroundChanged(const android::Parcel& data) override;
    int32_t onHourlyUploading(const android::Parcel& data) override;
    int32_t onDailyUploading(const android::Parcel& data) override;
    int32_t onDawnUploading(const android::Parcel& data) override;
    int32_t logApplicationsAccounting(int64_t time) override;
    int32_t logComponentAccounting(int64_t time) override;
    int32_t handleApplicationResult(const android::Parcel& data) override;
    int32_t handleComponentResult(const android::Parcel& data) override;
    void dump(android::String8& out) override;

private:
    struct request {
        int32_t reason;
        int64_t time;       // the time the answer is stamped with
        int64_t monotonic;  // when it was written, for its expiry
    };

    int32_t writeControl();
    // Writes a request at time t; waits the spacing first when the last
    // one is too recent and waiting is allowed. 0, or -14.
    int32_t requestData(int64_t time, int32_t reason, bool wait);
    int32_t onHourlyTimeout(const android::Parcel& data);
    int32_t onBlockMessage(const android::Parcel& data);
    // Parses one statistics block (the S bytes) and hands its records to
    // the decoders: 0, -9 for a block refused whole, -3 when a fault ended
    // it after the records before the fault.
    int32_t handleBlock(const uint8_t* data, size_t size, int64_t blockTime, int32_t reason);
    // Ends the hourly wait: cancels the time-out and votes at the stamp.
    void finishHourly();
    int32_t decodeRecord(const ModemBlock::Record& record, int64_t blockTime, int32_t reason);
    int32_t storePamItems(const ModemBlock::Record& record, int64_t blockTime);
    void collectTraffic(int64_t time);
    int32_t redistribute(int64_t time);
    int32_t uploadPeriod(uint32_t event, int64_t end, int64_t window, float ratio,
                         int32_t candidate);

    std::unique_ptr<TrafficCollector> mTraffic;
    std::map<int32_t, std::unique_ptr<ModemData>> mDecoders;
    std::deque<request> mOutstanding;
    int32_t mPollingReason;
    int64_t mHourlyStamp;
    bool mHourlyPending;
    int32_t mPendingTimeout;
    // Monotonic time of the last request, -1 before the first.
    int64_t mLastPollingMonotonic;
    bool mChargerOnline;
    ModemBlock mBlock;

    static std::atomic<int64_t> sHourlyTimeoutMs;
    static std::atomic<int64_t> sSpacingMs;
};

}  // namespace kelvo
