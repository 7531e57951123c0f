#include "core/KelvoAgent.h"

#include <hidl/HidlTransportSupport.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <vector>
#include <cstdlib>

#include "HealthCounters.h"
#include "KelvoLibEntry.h"
#include "KelvoLog.h"
#include "binder/KelvoService.h"
#include "binder/managers/BatteryManager.h"
#include "core/BufferedLogServer.h"
#include "core/Dispatcher.h"
#include "core/AppsAccounting.h"
#include "handlers/components/BatteryHandler.h"
#include "handlers/components/AudioHandler.h"
#include "handlers/components/BluetoothHandler.h"
#include "handlers/components/CpuHandler.h"
#include "handlers/components/DisplayHandler.h"
#include "handlers/components/FlashlightHandler.h"
#include "handlers/components/GnssHandler.h"
#include "handlers/components/GpuHandler.h"
#include "handlers/components/WifiHandler.h"
#include "handlers/components/SensorHandler.h"
#include "handlers/components/CameraHandler.h"
#include "handlers/components/ModemHandler.h"
#include "handlers/SystemHandler.h"
#include "handlers/DpmHandler.h"
#include "hidl/KelvoManager.h"
#include "handlers/ThermalHandler.h"
#include "routines/AbnormalityRoutine.h"
#include "routines/HourlyRoutine.h"
#include "routines/PollingRoutine.h"
#include "storage/DataUploader.h"
#include "utils/KelvoUtils.h"
#include "utils/TimeProvider.h"

namespace kelvo {

namespace {

// Creation order of the handlers, by id.
const int32_t kHandlerCreationOrder[HANDLER_COUNT] = {
        HANDLER_SYSTEM, HANDLER_CPU,      HANDLER_DISPLAY, HANDLER_FLASHLIGHT, HANDLER_SENSOR,
        HANDLER_CAMERA, HANDLER_GNSS,     HANDLER_THERMAL, HANDLER_WIFI,       HANDLER_BATTERY,
        HANDLER_AUDIO,  HANDLER_MODEM,    HANDLER_GPU,     HANDLER_BLUETOOTH,  HANDLER_DPM,
};

android::sp<KelvoOperator> makeSystemHandler() {
    return new SystemHandler();
}

android::sp<KelvoOperator> makeCpuHandler() {
    return new CpuHandler();
}

android::sp<KelvoOperator> makeDisplayHandler() {
    return new DisplayHandler();
}

android::sp<KelvoOperator> makeGnssHandler() {
    return new GnssHandler();
}

android::sp<KelvoOperator> makeFlashlightHandler() {
    return new FlashlightHandler();
}

android::sp<KelvoOperator> makeWifiHandler() {
    return new WifiHandler();
}

android::sp<KelvoOperator> makeBatteryHandler() {
    return new BatteryHandler();
}

android::sp<KelvoOperator> makeAudioHandler() {
    return new AudioHandler();
}

android::sp<KelvoOperator> makeBluetoothHandler() {
    return new BluetoothHandler();
}

android::sp<KelvoOperator> makeSensorHandler() {
    return new SensorHandler();
}

android::sp<KelvoOperator> makeGpuHandler() {
    return new GpuHandler();
}

android::sp<KelvoOperator> makeCameraHandler() {
    return new CameraHandler();
}

android::sp<KelvoOperator> makeDpmHandler() {
    return new DpmHandler();
}

android::sp<KelvoOperator> makeModemHandler() {
    return new ModemHandler();
}

android::sp<KelvoOperator> makeThermalHandler() {
    return new ThermalHandler();
}

android::sp<KelvoOperator> makePollingRoutine() {
    return new PollingRoutine();
}

android::sp<KelvoOperator> makeHourlyRoutine() {
    return new HourlyRoutine();
}

android::sp<KelvoOperator> makeAbnormalityRoutine() {
    return new AbnormalityRoutine();
}

// What start-up creates for each slot; tests and the simulator replace them.
struct Factories {
    Factories() {
        handlers[HANDLER_SYSTEM] = &makeSystemHandler;
        handlers[HANDLER_CPU] = &makeCpuHandler;
        routines[ROUTINE_POLLING] = &makePollingRoutine;
        routines[ROUTINE_HOURLY] = &makeHourlyRoutine;
        handlers[HANDLER_GNSS] = &makeGnssHandler;
        handlers[HANDLER_FLASHLIGHT] = &makeFlashlightHandler;
        handlers[HANDLER_DISPLAY] = &makeDisplayHandler;
        handlers[HANDLER_BATTERY] = &makeBatteryHandler;
        routines[ROUTINE_ABNORMALITY] = &makeAbnormalityRoutine;
        handlers[HANDLER_WIFI] = &makeWifiHandler;
        handlers[HANDLER_AUDIO] = &makeAudioHandler;
        routines[ROUTINE_ABNORMALITY] = &makeAbnormalityRoutine;
        handlers[HANDLER_BLUETOOTH] = &makeBluetoothHandler;
        handlers[HANDLER_SENSOR] = &makeSensorHandler;
        handlers[HANDLER_GPU] = &makeGpuHandler;
        handlers[HANDLER_CAMERA] = &makeCameraHandler;
        handlers[HANDLER_DPM] = &makeDpmHandler;
        handlers[HANDLER_MODEM] = &makeModemHandler;
        handlers[HANDLER_THERMAL] = &makeThermalHandler;
    }

    std::mutex lock;
    KelvoAgent::OperatorFactory handlers[HANDLER_COUNT] = {};
    KelvoAgent::OperatorFactory routines[ROUTINE_COUNT] = {};
};

Factories& factories() {
    static Factories* f = new Factories();
    return *f;
}

// _exit: the other threads still run, so no static destructor may run under
// them.
std::atomic<KelvoAgent::ExitHook> gExitHook{&_exit};

// Taken only to create the agent. Its constructor takes other locks (the
// schema registry's, the storage thread's), so the lock is never needed once
// the agent exists: neither later callers nor the error forwarding path,
// which runs under whatever lock the failing code holds, take it.
std::mutex gInstanceLock;
// Set once and never destroyed.
std::atomic<android::sp<KelvoAgent>*> gInstance{nullptr};

void forwardError(const android::Parcel& data) {
    android::sp<KelvoAgent>* instance = gInstance.load(std::memory_order_acquire);
    if (instance != nullptr) {
        (*instance)->logError(data);
    }
}

} // namespace

android::sp<KelvoAgent> KelvoAgent::getInstance() {
    android::sp<KelvoAgent>* instance = gInstance.load(std::memory_order_acquire);
    if (instance != nullptr) {
        return *instance;
    }
    std::lock_guard<std::mutex> guard(gInstanceLock);
    instance = gInstance.load(std::memory_order_relaxed);
    if (instance == nullptr) {
        // Errors raised while the agent is built reach the system log only:
        // the sink is installed only once the agent exists.
        instance = new android::sp<KelvoAgent>(new KelvoAgent());
        gInstance.store(instance, std::memory_order_release);
        ErrorLogger::setSink(forwardError);
    }
    return *instance;
}

void KelvoAgent::setHandlerFactory(int32_t id, OperatorFactory factory) {
    if (id < 0 || id >= HANDLER_COUNT) {
        return;
    }
    std::lock_guard<std::mutex> guard(factories().lock);
    factories().handlers[id] = factory;
}

void KelvoAgent::setRoutineFactory(int32_t id, OperatorFactory factory) {
    if (id < 0 || id >= ROUTINE_COUNT) {
        return;
    }
    std::lock_guard<std::mutex> guard(factories().lock);
    factories().routines[id] = factory;
}

void KelvoAgent::setRoutineForTest(int32_t id, const android::sp<KelvoOperator>& op) {
    if (id >= 0 && id < ROUTINE_COUNT) {
        setRoutine(id, op);
    }
}

void KelvoAgent::setHandlerForTest(int32_t id, const android::sp<KelvoOperator>& op) {
    if (id >= 0 && id < HANDLER_COUNT) {
        setHandler(id, op);
    }
}

void KelvoAgent::setExitHook(ExitHook hook) {
    gExitHook = hook != nullptr ? hook : &_exit;
}

KelvoAgent::KelvoAgent() : mStartTime(TimeProvider::getCurrentTime(TIME_TYPE_WALL)) {
    mStorage = new KelvoStorage(this);
    mQueryService = new QueryService();
}

android::sp<KelvoOperator> KelvoAgent::getHandler(int32_t id) {
    if (id < 0 || id >= HANDLER_COUNT) {
        return nullptr;
    }
    std::lock_guard<std::mutex> guard(mSlotLock);
    return mHandlers[id];
}

android::sp<KelvoOperator> KelvoAgent::getRoutine(int32_t id) {
    if (id < 0 || id >= ROUTINE_COUNT) {
        return nullptr;
    }
    std::lock_guard<std::mutex> guard(mSlotLock);
    return mRoutines[id];
}

void KelvoAgent::setHandler(int32_t id, const android::sp<KelvoOperator>& op) {
    std::lock_guard<std::mutex> guard(mSlotLock);
    mHandlers[id] = op;
}

void KelvoAgent::setRoutine(int32_t id, const android::sp<KelvoOperator>& op) {
    std::lock_guard<std::mutex> guard(mSlotLock);
    mRoutines[id] = op;
}

int32_t KelvoAgent::initiate() {
    startHandlers();
    startRoutines();
    startStorage();
    startHidlService();
    startLibrary();
    publishService();
    // Listening before any operator registers for its entries.
    BufferedLogServer::getInstance()->start();
    initRoutines();
    initHandlers();
    // The registrar's first report opens the battery handler's first span
    // (a phone booted on the charger counts as charging from then on): the
    // handlers listen before it can come.
    startBatteryListener();
    return startDispatcher();
}

void KelvoAgent::startHandlers() {
    OperatorFactory made[HANDLER_COUNT];
    {
        std::lock_guard<std::mutex> guard(factories().lock);
        std::copy(std::begin(factories().handlers), std::end(factories().handlers), made);
    }
    for (int32_t id : kHandlerCreationOrder) {
        if (made[id] != nullptr) {
            setHandler(id, made[id]());
        }
    }
    for (int32_t id = 0; id < HANDLER_COUNT; ++id) {
        android::sp<KelvoOperator> handler = getHandler(id);
        if (handler != nullptr && handler->earlyInitialize() < 0) {
            setHandler(id, nullptr);
        }
    }
}

void KelvoAgent::startRoutines() {
    OperatorFactory made[ROUTINE_COUNT];
    {
        std::lock_guard<std::mutex> guard(factories().lock);
        std::copy(std::begin(factories().routines), std::end(factories().routines), made);
    }
    for (int32_t id = 0; id < ROUTINE_COUNT; ++id) {
        if (made[id] != nullptr) {
            setRoutine(id, made[id]());
        }
    }
    for (int32_t id = 0; id < ROUTINE_COUNT; ++id) {
        android::sp<KelvoOperator> routine = getRoutine(id);
        if (routine != nullptr && routine->earlyInitialize() < 0) {
            setRoutine(id, nullptr);
        }
    }
}

void KelvoAgent::startStorage() {
    for (int32_t id = 0; id < HANDLER_COUNT; ++id) {
        android::sp<KelvoOperator> handler = getHandler(id);
        if (handler != nullptr) {
            handler->addSchemaTable();
        }
    }
    for (int32_t id = 0; id < ROUTINE_COUNT; ++id) {
        android::sp<KelvoOperator> routine = getRoutine(id);
        if (routine != nullptr) {
            routine->addSchemaTable();
        }
    }
    AppsAccounting::getInstance()->addSchemaTable();
    DataUploader::getInstance()->addSchemaTable();
    if (mStorage->startConnection() < 0) {
        KLOGE("Failed to start storage");
        mStorage->closeConnection();
        // The next start builds a fresh database; its journal goes with it.
        KelvoUtils::deleteDatabaseFiles(KelvoStorage::kDatabasePath);
        gExitHook.load()(0);
    }
}

void KelvoAgent::stop() {
    if (mStorage != nullptr && mStorage->shutdown() < 0) {
        KLOGE("Failed to stop storage");
    }
}

void KelvoAgent::startHidlService() {
    // Vendor calls are served by a pool of their own, apart from the binder
    // pool the main thread joins.
    android::hardware::configureRpcThreadpool(KelvoManager::kThreadPoolSize, false);
    android::sp<KelvoManager> manager = new KelvoManager(this);
    android::status_t err = manager->registerAsService(KelvoManager::kInstanceName);
    if (err == android::NO_ERROR) {
        KLOGI("Register kelvo manager hidl service success");
    } else {
        KLOGI("Failed to register kelvo manager hidl service: %d", err);
    }
}

void KelvoAgent::startLibrary() {
    kelvo::startLibrary(mStartTime);
}

void KelvoAgent::publishService() {
    android::status_t err = KelvoService::publish(this);
    if (err != android::NO_ERROR) {
        KLOGE("Failed to publish %s: %d", KelvoService::kServiceName, err);
    }
}

void KelvoAgent::startBatteryListener() {
    // The registrar may come up after the daemon: registration goes on in
    // the background until it succeeds, and start-up does not wait for it.
    BatteryManager::getInstance()->registerInBackground();
}

void KelvoAgent::initRoutines() {
    for (int32_t id = 0; id < ROUTINE_COUNT; ++id) {
        android::sp<KelvoOperator> routine = getRoutine(id);
        if (routine != nullptr) {
            routine->initialize();
        }
    }
}

void KelvoAgent::initHandlers() {
    for (int32_t id = 0; id < HANDLER_COUNT; ++id) {
        android::sp<KelvoOperator> handler = getHandler(id);
        if (handler != nullptr) {
            handler->initialize();
        }
    }
}

int32_t KelvoAgent::startDispatcher() {
    return Dispatcher::getInstance()->startDispatchMessage();
}

int32_t KelvoAgent::sendToHandler(int32_t id, int32_t code, const android::Parcel& data,
                                  android::Parcel* reply, bool sync) {
    if (id < 0 || id >= HANDLER_COUNT) {
        KLOGE("Invalid parameter");
        return -5;
    }
    android::sp<KelvoOperator> handler = getHandler(id);
    if (handler == nullptr) {
        return -11;
    }
    return handler->sendCustomizedMessage(code, data, reply, sync);
}

int32_t KelvoAgent::sendToRoutine(int32_t id, int32_t code, const android::Parcel& data,
                                  android::Parcel* reply, bool sync) {
    if (id < 0 || id >= ROUTINE_COUNT) {
        KLOGE("Invalid parameter");
        return -5;
    }
    android::sp<KelvoOperator> routine = getRoutine(id);
    if (routine == nullptr) {
        KLOGE("Invalid routine");
        return -11;
    }
    return routine->sendCustomizedMessage(code, data, reply, sync);
}

void KelvoAgent::requestQuery(int32_t code, const android::Parcel& data) {
    if (mQueryService->sendMessage(ParcelMessage(MESSAGE_CUSTOMIZED, code, data)) < 0) {
        KLOGE("Failed to post query: %d", code);
    }
}

int32_t KelvoAgent::noteSamplingUpload(const android::String8& a, const android::String8& b) {
    return mStorage == nullptr ? -1 : mStorage->samplingUpload(a, b);
}

int32_t KelvoAgent::noteRemoteDebug(int32_t kind, const android::String8& text) {
    return mStorage == nullptr ? -1 : mStorage->remoteDebug(kind, text);
}

void KelvoAgent::forceFlushDatabase() {
    if (mStorage != nullptr) {
        mStorage->flushAllEntries();
    }
}

void KelvoAgent::logError(const android::Parcel& data) {
    android::sp<KelvoOperator> system = getHandler(HANDLER_SYSTEM);
    if (system == nullptr || system->sendCustomizedMessage(3, data, nullptr, false) < 0) {
        HealthCounters::add(Health::ErrorRowsDropped);
    }
}

void KelvoAgent::handleDump(android::String8& out) {
    std::vector<android::sp<KelvoOperator>> operators;
    for (int32_t id = 0; id < HANDLER_COUNT; ++id) {
        operators.push_back(getHandler(id));
    }
    for (int32_t id = 0; id < ROUTINE_COUNT; ++id) {
        operators.push_back(getRoutine(id));
    }
    // A busy or stuck operator costs its own wait once, never the whole
    // dump: the waits share one budget.
    int64_t start = TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC);
    for (const android::sp<KelvoOperator>& op : operators) {
        if (op == nullptr) {
            continue;
        }
        int64_t left = kDumpBudgetMs - (TimeProvider::getCurrentTime(TIME_TYPE_MONOTONIC) - start);
        op->requestDump(out, std::max<int64_t>(std::min(kDumpWaitMs, left), 1));
    }
}

void KelvoAgent::cleanTables(int64_t time) {
    for (int32_t id = 0; id < HANDLER_COUNT; ++id) {
        android::sp<KelvoOperator> handler = getHandler(id);
        if (handler != nullptr) {
            handler->cleanTables(time);
        }
    }
    for (int32_t id = 0; id < ROUTINE_COUNT; ++id) {
        android::sp<KelvoOperator> routine = getRoutine(id);
        if (routine != nullptr) {
            routine->cleanTables(time);
        }
    }
    AppsAccounting::getInstance()->cleanTables(time);
    DataUploader::getInstance()->cleanTables(time);
}

} // namespace kelvo
