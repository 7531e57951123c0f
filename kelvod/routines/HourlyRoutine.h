#pragma once

#include <binder/Parcel.h>
#include <stdint.h>
#include <utils/String8.h>

#include <atomic>
#include <map>
#include <string>

#include "core/KelvoOperator.h"
#include "utils/TimerCallback.h"

namespace kelvo {

// Drives what happens once an hour, once a day at midnight and once at dawn.
// At every full hour it opens a voting round keyed by the start of that hour
// and steps it through its candidates: each step is announced to every
// operator by a notification, and the round moves on when every elector
// registered for the step has voted, or at the vote time-out. Between steps
// it flushes the database, balances the applications accounting, starts the
// hour's abnormality check and sends the uploads. It also collects the energy
// reports behind the compensation ratio, catches up an hour missed while the
// device was off, and withholds uploads on a day whose clock moved by an hour
// or more.
//
// Rounds step one at a time: a round opened while another steps waits, by
// hour, until that one finishes. Everything runs on the routine's thread.
class HourlyRoutine : public KelvoOperator {
public:
    // Requests of MESSAGE_CUSTOMIZED (what).
    enum request_code : int32_t {
        REQUEST_VOTE = 0,          // int64 round hour, int32 candidate, uint32 elector
        REQUEST_VOTE_TIMEOUT = 1,  // int64 round hour, int32 candidate (sent to itself)
        REQUEST_OFFSET = 2,        // reply: int64 last tick, int64 ms until the next tick
        REQUEST_COMPENSATION = 3,  // int64 round hour, uint32 elector, int64 energy
        REQUEST_ELECTOR = 4,       // uint32 elector bit, int32 candidates to the end
    };
    enum round_type : int8_t {
        ROUND_HOURLY = 0,
        ROUND_DAWN = 1,    // opened at 06:xx local
        ROUND_DAILY = 2,   // opened at 00:xx local
        ROUND_REBOOT = 3,  // catch-up of an hour of another day
    };

    // The `what` of the hourly timer's MESSAGE_TIMER.
    static constexpr int32_t kHourlyTimerId = 1;
    static constexpr int64_t kVoteTimeoutMs = 60000;
    static constexpr int32_t kCandidateCount = 8;
    static constexpr uint32_t kMaxElector = 0x3FFFFFF;
    // The battery handler's elector: its energy reports are the measurement.
    static constexpr uint32_t kBatteryElector = 64;
    // Stored clock changes at least this large withhold the day's uploads.
    static constexpr int64_t kTimeChangeLimitMs = 3600000;

    HourlyRoutine();
    // Removes its timer: the manager keeps a timer until told.
    ~HourlyRoutine() override;

    // Shortens the vote time-out (tests); 0 or less restores it.
    static void setVoteTimeoutMs(int64_t ms);

    void addSchemaTable() override;
    void cleanTables(int64_t time) override;
    int32_t setConfiguration() override;
    void setupListeners(android::Parcel& out) override;
    int32_t lateInitialize() override;
    int32_t handleTimerExpired(int32_t id) override;
    int32_t handleTimerRearm(int32_t id) override;
    int32_t handleCustomized(int32_t code, const android::Parcel& data,
                             android::Parcel* reply) override;
    int32_t onTimeChanged(const android::Parcel& data) override;
    int32_t onBootCompleted(const android::Parcel& data) override;
    int32_t onShutDown(const android::Parcel& data) override;

private:
    struct voting_round {
        int8_t type;
        int64_t start;      // wall-clock time the round was opened
        int32_t timeout;    // id of the pending time-out message, -1 when none
        uint32_t pending;   // electors that have not voted for the candidate
        int32_t candidate;  // current step, 1 to 8
        int64_t battery;
        int64_t powerModel;
        int64_t free;
    };
    typedef std::map<int64_t, voting_round> RoundMap;

    static constexpr int64_t kNoRound = INT64_MIN;

    int32_t armTimer();
    int32_t tick();
    int32_t handleVote(const android::Parcel& data);
    int32_t handleVoteTimeout(const android::Parcel& data);
    int32_t handleOffset(android::Parcel* reply);
    int32_t handleCompensation(const android::Parcel& data);
    int32_t handleSetElector(const android::Parcel& data);

    // Adds a round; it steps at once when no other round does, else waits.
    int32_t openRound(int64_t hour, int8_t type, int32_t candidate);
    void startNextRound();
    void startRound(int64_t hour, voting_round& round);
    // Moves the round to the candidate and announces it.
    void moveTo(int64_t hour, voting_round& round, int32_t candidate);
    void notifyVoting(int32_t notification, int64_t hour, voting_round& round);
    // Runs the work after the round's current candidate and moves it on.
    int32_t updateRound(int64_t hour);
    int32_t followType(int64_t hour, voting_round& round, bool uploaded);
    void roundFinished(int64_t hour);
    int32_t checkLastTick(int64_t time);
    bool checkUpload();
    void updateDailyCompensation(int64_t hour, voting_round& round);
    float computeRatio(const voting_round& round) const;
    void logCompensation(const char* kind, int64_t start, int64_t hour, const voting_round& round,
                         float ratio, bool store);
    int32_t uploadEnergyCompensationData(float ratio, uint32_t event);
    int32_t uploadEvents(const uint32_t* events, size_t count, int64_t start, int64_t end);
    void sendToAbnormality(int64_t hour);
    void refused();
    static std::string hourText(int64_t hour);

    android::sp<TimerCallback> mTimer;
    int64_t mLastTick;
    uint32_t mElectors[kCandidateCount];
    bool mCompensationEnabled;
    bool mLastTickCheckPending;
    RoundMap mRounds;
    // Key of the round that steps now, kNoRound when none.
    int64_t mActiveHour;

    static std::atomic<int64_t> sVoteTimeoutMs;
};

}  // namespace kelvo
