#include <binder/Parcel.h>
#include <binder/Status.h>

namespace android {
namespace binder {

Status Status::fromExceptionCode(int32_t exceptionCode, const String8& message) {
    Status status;
    status.mException = exceptionCode;
    if (exceptionCode != EX_NONE) {
        status.mMessage = message;
    }
    return status;
}

Status Status::fromServiceSpecificError(int32_t errorCode, const String8& message) {
    Status status = fromExceptionCode(EX_SERVICE_SPECIFIC, message);
    status.mErrorCode = errorCode;
    return status;
}

Status Status::fromStatusT(status_t status) {
    Status out;
    if (status != OK) {
        out.mException = EX_TRANSACTION_FAILED;
        out.mErrorCode = status;
    }
    return out;
}

status_t Status::writeToParcel(Parcel* parcel) const {
    if (parcel == nullptr) {
        return BAD_VALUE;
    }
    if (mException == EX_TRANSACTION_FAILED) {
        // A transport failure travels as the transaction's status.
        return mErrorCode != OK ? mErrorCode : FAILED_TRANSACTION;
    }
    status_t err = parcel->writeInt32(mException);
    if (err != OK || mException == EX_NONE) {
        return err;
    }
    err = parcel->writeString16(String16(mMessage.string(), mMessage.size()));
    if (err == OK && mException == EX_SERVICE_SPECIFIC) {
        err = parcel->writeInt32(mErrorCode);
    }
    return err;
}

status_t Status::readFromParcel(const Parcel& parcel) {
    *this = Status();
    int32_t code = EX_NONE;
    status_t err = parcel.readInt32(&code);
    if (err != OK) {
        mException = EX_BAD_PARCELABLE;
        return err;
    }
    if (code == EX_HAS_REPLY_HEADER) {
        // A header of int32 size (itself included) that this side skips.
        size_t start = parcel.dataPosition();
        int32_t size = 0;
        if (parcel.readInt32(&size) != OK || size < 4 ||
            static_cast<size_t>(size) - 4 > parcel.dataAvail()) {
            mException = EX_BAD_PARCELABLE;
            return BAD_VALUE;
        }
        parcel.setDataPosition(start + static_cast<size_t>(size));
        return OK;
    }
    mException = code;
    if (code == EX_NONE) {
        return OK;
    }
    String16 message;
    err = parcel.readString16(&message);
    if (err != OK && err != UNEXPECTED_NULL) {
        return err;
    }
    mMessage = String8(message);
    if (code == EX_SERVICE_SPECIFIC) {
        err = parcel.readInt32(&mErrorCode);
    }
    return err == UNEXPECTED_NULL ? OK : err;
}

String8 Status::toString8() const {
    if (mException == EX_NONE) {
        return String8("No error");
    }
    String8 out;
    if (mException == EX_TRANSACTION_FAILED) {
        out.appendFormat("Transaction failed: %d", mErrorCode);
    } else if (mException == EX_SERVICE_SPECIFIC) {
        out.appendFormat("Service-specific error %d: %s", mErrorCode, mMessage.string());
    } else {
        out.appendFormat("Exception %d: %s", mException, mMessage.string());
    }
    return out;
}

} // namespace binder
} // namespace android
