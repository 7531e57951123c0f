#pragma once

// The exception header of a reply: int32 exception code (0 for none); for
// any other code a String16 message follows, and for EX_SERVICE_SPECIFIC an
// int32 error code after it.

#include <stdint.h>
#include <utils/Errors.h>
#include <utils/String8.h>

namespace android {

class Parcel;

namespace binder {

class Status {
public:
    enum Exception : int32_t {
        EX_NONE = 0,
        EX_SECURITY = -1,
        EX_BAD_PARCELABLE = -2,
        EX_ILLEGAL_ARGUMENT = -3,
        EX_NULL_POINTER = -4,
        EX_ILLEGAL_STATE = -5,
        EX_NETWORK_MAIN_THREAD = -6,
        EX_UNSUPPORTED_OPERATION = -7,
        EX_SERVICE_SPECIFIC = -8,
        EX_PARCELABLE = -9,
        EX_HAS_REPLY_HEADER = -128,
        EX_TRANSACTION_FAILED = -129,
    };

    Status() = default;
    static Status ok() { return Status(); }
    static Status fromExceptionCode(int32_t exceptionCode, const String8& message = String8());
    static Status fromServiceSpecificError(int32_t errorCode, const String8& message = String8());
    // A transport failure: never written to a parcel.
    static Status fromStatusT(status_t status);

    bool isOk() const { return mException == EX_NONE; }
    int32_t exceptionCode() const { return mException; }
    int32_t serviceSpecificErrorCode() const { return mErrorCode; }
    status_t transactionError() const {
        return mException == EX_TRANSACTION_FAILED ? mErrorCode : OK;
    }
    const String8& exceptionMessage() const { return mMessage; }

    status_t writeToParcel(Parcel* parcel) const;
    // A malformed header gives EX_BAD_PARCELABLE and its status_t.
    status_t readFromParcel(const Parcel& parcel);

    String8 toString8() const;

private:
    int32_t mException = EX_NONE;
    int32_t mErrorCode = 0;
    String8 mMessage;
};

} // namespace binder
} // namespace android
