#pragma once

#include <binder/Parcel.h>
#include <stdint.h>

namespace kelvo {

// Types of the messages exchanged between the daemon's threads.
enum message_type {
    MESSAGE_LOGGER = 0,        // what: tag id; body: int64 time ms, C string text
    MESSAGE_NOTIFICATION = 1,  // what: notification type; body: the notification
    MESSAGE_TIMER = 2,         // what: timer id; body: empty
    MESSAGE_STORAGE_ENTRY = 3, // what: storage entry kind; body: the entry
    MESSAGE_BUFFERED_LOG = 4,  // body: one buffered log entry
    MESSAGE_CUSTOMIZED = 5,    // what: the receiver's request code; body: request
};

// The record carried between threads: two integers, a body and, for a
// synchronous request, where the receiver writes its answer. Copying copies
// the body and rewinds it.
class ParcelMessage {
public:
    ParcelMessage();
    explicit ParcelMessage(const android::Parcel& parcel);
    ParcelMessage(int32_t type, int32_t what);
    ParcelMessage(int32_t type, const android::Parcel& parcel);
    ParcelMessage(int32_t type, int32_t what, const android::Parcel& parcel);
    ParcelMessage(int32_t type, int32_t what, const android::Parcel& parcel,
                  android::Parcel* reply);
    ParcelMessage(const ParcelMessage& other);
    ParcelMessage& operator=(const ParcelMessage& other);

    const android::Parcel& getParcel() const { return data; }
    android::Parcel* getReply() const { return reply; }

    int32_t type;
    int32_t what;
    android::Parcel data;
    android::Parcel* reply; // not owned

private:
    void fill(const android::Parcel& parcel);
};

} // namespace kelvo
