#pragma once

#include <stdint.h>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "storage/StorageOperator.h"
#include "utils/HandlerThread.h"

namespace kelvo {

// Base of every handler and routine: one worker thread each, started by the
// agent through early initialization and initialization.
class KelvoOperator : public HandlerThread, public StorageOperator {
public:
    KelvoOperator(const char* name, int32_t accounterType, uint32_t elector);

    // Start-up, on the main thread while the operator's thread idles.
    // earlyInitialize ends the thread and returns -2 when the operator's
    // component is not supported.
    int32_t earlyInitialize();
    int32_t initialize();

    // Posts (sync false; returns the message id) or sends and waits for the
    // receiver's status and reply (sync true).
    int32_t sendCustomizedMessage(int32_t code, const android::Parcel& data,
                                  android::Parcel* reply, bool sync);
    // Posts a record of the log device (int64 time ms, C string text) under
    // its tag id; the message id or a negative code.
    int32_t sendLoggerMessage(int32_t tag, const android::Parcel& data);

    int32_t getAccounterType() const { return mAccounterType; }
    uint32_t getElector() const { return mElector; }

    virtual int32_t lateInitialize();
    virtual void dump(android::String8& out);
    virtual int32_t setConfiguration();
    virtual int32_t checkEnable();
    virtual int32_t handleCustomized(int32_t code, const android::Parcel& data,
                                     android::Parcel* reply);

    int32_t handleParcelMessage(const ParcelMessage& msg) override;

protected:
    int32_t mAccounterType;
    uint32_t mElector;
};

} // namespace kelvo
