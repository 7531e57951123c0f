#pragma once

#include <stdint.h>

#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// The simulated phone's modem. The scenario's "modem" steps and calls add
// residency (time per module and signal level); the daemon asks for the
// modem's statistics by writing the module list to the control file
// <root>/sys/devices/platform/tervin_modem_pm_info/mod_on. Every write (a
// close after a modification) is a request; after the scenario's delay it is
// answered with one statistics block holding the residency accumulated since
// the previous answer, sent to the manager service as event 100 (which
// hands the daemon's modem the block's size S, then its S bytes):
//   uint32 n, uint32 length of what follows, n records of uint32 L,
//   uint32 SIM, uint32 module, L bytes of uint32 counters.
// Records: LTE physical layer (5, times in ticks of 1/32768 s), LTE RRC
// (7, idle in ms), WCDMA physical layer (8, DRX time in ticks, transmit
// counts of 10 ms) and the driver (10). A scenario may also leave requests
// unanswered or answer them with a malformed block.
class ModemModel {
public:
    static constexpr int32_t kLteLevels = 8;    // 0 the highest transmit power; 7 no transmission
    static constexpr int32_t kWcdmaLevels = 7;  // 0 the weakest signal
    static constexpr int32_t kIdleLevels = 3;   // weak, mid, strong
    static constexpr int32_t kEventType = 100;

    // Residency of one answer, in ms.
    struct Residency {
        int64_t lteTx[kLteLevels] = {};
        int64_t volte = 0;
        int32_t band = 0;  // the LTE record's band flag
        int64_t lteIdle[kIdleLevels] = {};
        int64_t wcdmaIdle[kIdleLevels] = {};
        int64_t wcdmaVoice[kWcdmaLevels] = {};
        int64_t wcdmaData[kWcdmaLevels] = {};
    };

    enum class Answer { Delay, Never, Malformed };
    // What a malformed answer breaks (a well-formed "pam" block carries an
    // extra wake-up record of 45 bytes).
    enum class Fault { None, Short, Count, Length, Sim, Pam };

    struct Sent {
        int64_t requestMs = 0;  // scenario time of the request
        int64_t answerMs = 0;   // scenario time of the answer
        Fault fault = Fault::None;
        Residency residency;
        int32_t result = 0;  // the manager service's
    };

    using Sender = std::function<int32_t(const std::string& block)>;

    static std::string controlPath() { return "sys/devices/platform/tervin_modem_pm_info/mod_on"; }

    // "modem ...", "modem-answer ..." and "call start|stop ...": 1 parsed
    // into the step, 0 another verb, -1 a bad line (reason set).
    static int32_t parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                             std::string* reason);

    // The block's bytes for a residency; `answers` numbers the driver
    // record's counts.
    static std::string buildBlock(const Residency& residency, Fault fault, int32_t answers);

    ModemModel(std::string root, Sender sender);
    ~ModemModel();

    // Creates the control file (empty); false with errno set.
    bool layout() const;
    // Watches the control file and answers requests; stop() ends it.
    bool start();
    void stop();

    // A modem step at its time.
    void apply(const Scenario::Step& step);
    // The scenario's time moves on (calls accumulate).
    void advanceTo(int64_t ms);

    int32_t requests() const;
    std::vector<Sent> sent() const;
    // Residency no answer has carried yet.
    Residency pending() const;

private:
    struct Request {
        int64_t dueMonoMs = 0;
        int64_t requestMs = 0;
        Fault fault = Fault::None;
    };

    void watch();
    void onRequest();
    void answer(const Request& request);
    void accumulateCall(int64_t toMs);

    std::string mRoot;
    Sender mSender;
    mutable std::mutex mLock;
    Residency mResidency;
    int64_t mNowMs = 0;
    bool mInCall = false;
    bool mCallOnLte = true;
    int32_t mCallLevel = 3;
    Answer mAnswer = Answer::Delay;
    Fault mFault = Fault::None;
    int64_t mDelayMs = 500;
    int32_t mRequests = 0;
    std::deque<Request> mQueue;
    std::vector<Sent> mSent;
    int mInotify = -1;
    int mWakePipe[2] = {-1, -1};
    std::thread mThread;
};

}  // namespace sim
}  // namespace kelvo
