#pragma once

#include <stdint.h>

#include <mutex>

#include <binder/Parcel.h>
#include <utils/RefBase.h>
#include <utils/String8.h>

#include "core/KelvoOperator.h"
#include "storage/KelvoStorage.h"

namespace kelvo {

enum handler_id {
    HANDLER_SYSTEM = 0,
    HANDLER_CPU = 1,
    HANDLER_DISPLAY = 2,
    HANDLER_FLASHLIGHT = 3,
    HANDLER_CAMERA = 4,
    HANDLER_GNSS = 5,
    HANDLER_THERMAL = 6,
    HANDLER_SENSOR = 7,
    HANDLER_WIFI = 8,
    HANDLER_BATTERY = 9,
    HANDLER_AUDIO = 10,
    HANDLER_MODEM = 11,
    HANDLER_GPU = 12,
    HANDLER_BLUETOOTH = 13,
    HANDLER_DPM = 14,
    HANDLER_COUNT = 15,
};

enum routine_id {
    ROUTINE_POLLING = 0,
    ROUTINE_HOURLY = 1,
    ROUTINE_ABNORMALITY = 2,
    ROUTINE_COUNT = 3,
};

// The daemon's central object: creates, owns and starts every handler and
// routine, and routes requests between them by id.
class KelvoAgent : public virtual android::RefBase {
public:
    static constexpr const char* kVersion = "000.1.4.0";

    typedef android::sp<KelvoOperator> (*OperatorFactory)();
    // Ends the process when the database cannot be started (replaceable so
    // tests can watch it).
    typedef void (*ExitHook)(int status);

    // The process-wide agent, created on first use.
    static android::sp<KelvoAgent> getInstance();

    // Runs the start-up sequence; returns the result of starting the
    // dispatcher.
    int32_t initiate();
    // The orderly stop, once the binder pool has returned: buffered rows are
    // written and the database closed (bounded by the synchronous time-out).
    void stop();

    int32_t sendToHandler(int32_t id, int32_t code, const android::Parcel& data,
                          android::Parcel* reply, bool sync);
    int32_t sendToRoutine(int32_t id, int32_t code, const android::Parcel& data,
                          android::Parcel* reply, bool sync);
    void requestQuery(int32_t code, const android::Parcel& data);
    int32_t noteSamplingUpload(const android::String8& a, const android::String8& b);
    int32_t noteRemoteDebug(int32_t kind, const android::String8& text);
    void forceFlushDatabase();
    // Hands one error row (int64 time, String8 text) to the system handler.
    void logError(const android::Parcel& data);
    void handleDump(android::String8& out);
    void cleanTables(int64_t time);
    int64_t getSystemBootTime() const { return mStartTime; }

    android::sp<KelvoStorage> getStorage() const { return mStorage; }
    android::sp<KelvoOperator> getHandler(int32_t id);
    android::sp<KelvoOperator> getRoutine(int32_t id);

    // Replaces what start-up creates for a slot (tests and the simulator);
    // a null factory leaves the slot empty. By default start-up creates the
    // polling routine only.
    static void setHandlerFactory(int32_t id, OperatorFactory factory);
    static void setRoutineFactory(int32_t id, OperatorFactory factory);
    static void setExitHook(ExitHook hook);
    // Puts an operator into a routine slot outside start-up (tests of one
    // operator that need a stand-in routine); null empties the slot.
    void setRoutineForTest(int32_t id, const android::sp<KelvoOperator>& op);

    KelvoAgent();

private:
    void startHandlers();
    void startRoutines();
    void startStorage();
    void startHidlService();
    void startLibrary();
    void publishService();
    void startBatteryListener();
    void initRoutines();
    void initHandlers();
    int32_t startDispatcher();

    void setHandler(int32_t id, const android::sp<KelvoOperator>& op);
    void setRoutine(int32_t id, const android::sp<KelvoOperator>& op);

    int64_t mStartTime;
    android::sp<KelvoStorage> mStorage;
    // Written only during start-up, but read by any thread that logs an
    // error meanwhile: every access goes through the slot lock.
    std::mutex mSlotLock;
    android::sp<KelvoOperator> mHandlers[HANDLER_COUNT];
    android::sp<KelvoOperator> mRoutines[ROUTINE_COUNT];
};

} // namespace kelvo
