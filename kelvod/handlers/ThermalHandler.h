#pragma once

#include <stdint.h>

#include <atomic>
#include <vector>

#include "core/KelvoOperator.h"
#include "handlers/ThermalRecords.h"
#include "storage/TableAttribute.h"

namespace kelvo {

// High-temperature episodes and the power-management application's daily
// thermal statistics. An accepted enter and its exit make every operator
// close its periods (the abnormality-thermal notification); a while after
// the exit the episode's usage and energy per component are summed from the
// raw tables and uploaded at once. Once a day "Pelmora" is asked for its
// thermal statistics, which are stored and uploaded.
class ThermalHandler : public KelvoOperator {
public:
    enum thermal_tag : int32_t {
        TAG_HIGH_TEMP_ENTER = 0,
        TAG_HIGH_TEMP_EXIT = 1,
    };
    enum thermal_message : int32_t {
        MESSAGE_RECORD_EPISODE = 1,  // int64 start, int64 end
        MESSAGE_ANSWER_TIMEOUT = 2,  // int64 day stamp of the request
    };
    static constexpr uint32_t kElector = 0x10000;
    static constexpr int32_t kCandidateDailyTick = 5;
    static constexpr const char* kSender = "Pelmora";
    static constexpr int32_t kSenderType = 0;
    // An enter must come this long after the previous start.
    static constexpr int64_t kMinEnterSpacingMs = 599999;
    static constexpr int32_t kDailyLimit = 10;
    static constexpr int32_t kDailyLimitDebugUser = 20;
    // Every operator has written its rows for the episode by then.
    static constexpr int64_t kRecordDelayMs = 60000;
    // The daily statistics' vote is cast without them after this long.
    static constexpr int64_t kAnswerWaitMs = 20000;
    static constexpr int32_t kMaxRowsPerInsert = 5000;
    static constexpr int32_t kMaxRangeIndex = 20;

    ThermalHandler();
    ~ThermalHandler() override;

    // Shortens the two waits (tests); 0 or less restores each.
    static void setDelaysForTest(int64_t recordMs, int64_t answerMs);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    void setupListeners(android::Parcel& out) override;
    void registerDispatcherTag() override;
    void setCandidateElector() override;
    void dump(android::String8& out) override;

    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t handleBufferedLog(const android::Parcel& data) override;
    int32_t onDailyTick(const android::Parcel& data) override;

private:
    int32_t enterEpisode(int64_t time);
    int32_t exitEpisode(int64_t time);
    int32_t recordEpisode(int64_t start, int64_t end);
    int32_t handleDaily(const uint8_t* data, size_t size);
    void storeDaily(const ThermalRecords::daily& daily);
    void uploadShell(const ThermalRecords::daily& daily);
    void storeScene(int64_t dayStamp, const ThermalRecords::heat_scene& scene);
    // Casts the vote of the pending daily request, once.
    void voteAnswered();
    // Votes for the daily tick of the hour, or holds the vote until the
    // episodes waiting to be summed are.
    void voteDaily(int64_t hour);
    int32_t refuse(int32_t ret);

    int32_t mState = 1;  // 1 normal, 0 high temperature
    int32_t mCount = 0;  // episodes started since the last daily tick
    int64_t mStart = 0;
    int64_t mEnd = 0;
    int64_t mDayStamp = 0;
    // Day stamp of the request whose answer is awaited; -1 when none.
    int64_t mPendingDay = -1;
    // Episodes posted to be summed, and daily votes waiting for them.
    int32_t mRecordsPending = 0;
    std::vector<int64_t> mHeldVotes;

    static std::atomic<int64_t> sRecordDelayMs;
    static std::atomic<int64_t> sAnswerWaitMs;
};

}  // namespace kelvo
