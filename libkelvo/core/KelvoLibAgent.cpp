#include "core/KelvoLibAgent.h"

#include <mutex>

#include "LibKelvoLog.h"
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

KelvoLibAgent::KelvoLibAgent() : mSystemBootTime(0) {}

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

} // namespace kelvo
