#include "core/KelvoLibAgent.h"

#include <mutex>

#include "LibKelvoLog.h"
#include "accounters/AudioAccounter.h"
#include "accounters/BluetoothAccounter.h"
#include "accounters/BrightnessAccounter.h"
#include "accounters/CameraAccounter.h"
#include "accounters/CpuAccounter.h"
#include "accounters/DpmAccounter.h"
#include "accounters/FlashlightAccounter.h"
#include "accounters/GnssAccounter.h"
#include "accounters/GpuAccounter.h"
#include "accounters/ModemAccounter.h"
#include "accounters/SensorAccounter.h"
#include "accounters/WifiAccounter.h"
#include "SqlTypes.h"

namespace kelvo {

KelvoLibAgent* KelvoLibAgent::getInstance() {
    static std::mutex sEntryLock;
    static KelvoLibAgent* sInstance = nullptr;
    std::lock_guard<std::mutex> guard(sEntryLock);
    if (sInstance == nullptr) {
        sInstance = new KelvoLibAgent();
    }
    return sInstance;
}

namespace {

// The built-in accounter of each type. A type whose accounter does not exist
// yet has an empty entry.
KelvoLibAgent::AccounterFactory builtInFactory(int32_t type) {
    switch (type) {
        case ACCOUNTER_BRIGHTNESS:
            return [] { return std::make_unique<BrightnessAccounter>(); };
        case ACCOUNTER_GNSS:
            return [] { return std::make_unique<GnssAccounter>(); };
        case ACCOUNTER_FLASHLIGHT:
            return [] { return std::make_unique<FlashlightAccounter>(); };
        case ACCOUNTER_CAMERA:
            return [] { return std::make_unique<CameraAccounter>(); };
        case ACCOUNTER_BLUETOOTH:
            return [] { return std::make_unique<BluetoothAccounter>(); };
        case ACCOUNTER_GPU:
            return [] { return std::make_unique<GpuAccounter>(); };
        case ACCOUNTER_SENSOR:
            return [] { return std::make_unique<SensorAccounter>(); };
        case ACCOUNTER_AUDIO:
            return [] { return std::make_unique<AudioAccounter>(); };
        case ACCOUNTER_WIFI:
            return [] { return std::make_unique<WifiAccounter>(); };
        case ACCOUNTER_DPM:
            return [] { return std::make_unique<DpmAccounter>(); };
        case ACCOUNTER_MODEM:
            return [] { return std::make_unique<ModemAccounter>(); };
        case ACCOUNTER_CPU:
            return [] {
                return std::make_unique<CpuAccounter>(
                        KelvoLibAgent::getInstance()->getSystemBootTime());
            };
        default:
            return nullptr;
    }
}

} // namespace

KelvoLibAgent::KelvoLibAgent() : mSystemBootTime(0) {
    for (int32_t type = 0; type < ACCOUNTER_TYPE_COUNT; ++type) {
        mFactories[type] = builtInFactory(type);
    }
}

void KelvoLibAgent::start(int64_t systemBootTime) {
    mSystemBootTime.store(systemBootTime, std::memory_order_relaxed);
    LLOGI("KELVO library starting");
}

int32_t KelvoLibAgent::doSqliteOperation(int32_t action, const android::Parcel* in,
                                         android::Parcel* out) {
    switch (action) {
        case SQL_OPEN_CONNECTION:
            return mSqlOperator.openConnection(in);
        case SQL_CLOSE_CONNECTION:
            return mSqlOperator.closeConnection();
        case SQL_BEGIN_TRANSACTION:
            return mSqlOperator.beginTranscation();
        case SQL_COMMIT_TRANSACTION:
            return mSqlOperator.commitTranscation();
        case SQL_VACUUM_DATABASE:
            return mSqlOperator.vacuumDatabase();
        case SQL_CREATE_TABLE:
            return mSqlOperator.createTable(in);
        case SQL_INSERT_ENTRIES:
            return mSqlOperator.insertEntries(in);
        case SQL_EXECUTE_ENTRY:
            return mSqlOperator.executeEntry(in);
        case SQL_SIMPLE_QUERY:
            return mSqlOperator.simpleQueryEntries(in, out);
        case SQL_BACKUP_COPY:
            return mSqlOperator.backupCopy(in);
        default:
            LLOGE("Unknown action: %d", action);
            return -1;
    }
}

DataAccounter* KelvoLibAgent::findAccounter(int32_t type) {
    if (type < 0 || type >= ACCOUNTER_TYPE_COUNT) {
        LLOGE("Invalid accounter type: %d", type);
        return nullptr;
    }
    std::lock_guard<std::mutex> guard(mAccounterLock);
    if (mAccounters[type] == nullptr) {
        if (mFactories[type] == nullptr) {
            LLOGE("Unknown accounter type: %d", type);
            return nullptr;
        }
        mAccounters[type] = mFactories[type]();
    }
    return mAccounters[type].get();
}

int32_t KelvoLibAgent::registerListener(int32_t type, const android::sp<LibraryListener>& listener) {
    if (listener == nullptr) {
        LLOGE("Invalid parameter");
        return -1;
    }
    DataAccounter* accounter = findAccounter(type);
    if (accounter == nullptr) {
        LLOGE("Failed to find accounter by type: %d", type);
        return -1;
    }
    accounter->registerListener(listener);
    return 0;
}

int32_t KelvoLibAgent::unregisterListener(int32_t type) {
    DataAccounter* accounter = findAccounter(type);
    if (accounter == nullptr) {
        LLOGE("Failed to find accounter by type: %d", type);
        return -1;
    }
    accounter->unregisterListener();
    return 0;
}

int32_t KelvoLibAgent::setDataAccounter(const android::Parcel& action) {
    action.setDataPosition(0);
    int32_t type = ACCOUNTER_NONE;
    if (action.readInt32(&type) != android::NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    DataAccounter* accounter = findAccounter(type);
    if (accounter == nullptr) {
        LLOGE("Failed to find accounter by type: %d", type);
        return -1;
    }
    return accounter->handleAction(action);
}

int32_t KelvoLibAgent::setDisplayEnergyPolicy(int32_t policy) {
    auto* accounter =
            dynamic_cast<BrightnessAccounter*>(findAccounter(ACCOUNTER_BRIGHTNESS));
    if (accounter == nullptr) {
        LLOGE("Failed to find accounter by type: %d", ACCOUNTER_BRIGHTNESS);
        return -1;
    }
    return accounter->setEffectivePolicy(policy);
}

void KelvoLibAgent::setAccounterFactoryForTest(int32_t type, AccounterFactory factory) {
    if (type < 0 || type >= ACCOUNTER_TYPE_COUNT) {
        return;
    }
    std::lock_guard<std::mutex> guard(mAccounterLock);
    mFactories[type] = factory != nullptr ? std::move(factory) : builtInFactory(type);
}

void KelvoLibAgent::resetAccountersForTest() {
    std::lock_guard<std::mutex> guard(mAccounterLock);
    for (int32_t type = 0; type < ACCOUNTER_TYPE_COUNT; ++type) {
        mAccounters[type].reset();
        mFactories[type] = builtInFactory(type);
    }
}

} // namespace kelvo
