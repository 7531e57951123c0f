#pragma once

// The subset of binder's Parcel that the daemon uses, in binder's flat format:
// little-endian values aligned to 4 bytes, String8 as (int32 byte length,
// bytes, NUL, padding), String16 as (int32 length in UTF-16 units or -1 for
// null, units, NUL unit, padding), C strings with their NUL padded to 4, raw
// blocks padded to 4. A read past the end never touches memory outside the
// buffer: the value reads return 0 or an empty value and the status-returning
// variants report NOT_ENOUGH_DATA.

#include <stddef.h>
#include <stdint.h>

#include <utils/Errors.h>
#include <utils/String16.h>
#include <utils/String8.h>

namespace android {

class Parcel {
public:
    Parcel();
    ~Parcel();
    // Like binder's, a parcel is not copyable: copy its bytes with appendFrom.
    Parcel(const Parcel&) = delete;
    Parcel& operator=(const Parcel&) = delete;

    const uint8_t* data() const { return mData; }
    size_t dataSize() const { return mDataSize; }
    size_t dataAvail() const;
    size_t dataPosition() const { return mDataPos; }
    size_t dataCapacity() const { return mDataCapacity; }

    status_t setDataSize(size_t size);
    // The read/write position is a cursor, so a const parcel can be rewound.
    void setDataPosition(size_t pos) const;
    status_t setDataCapacity(size_t size);
    status_t setData(const uint8_t* buffer, size_t len);

    // Appends len bytes of parcel starting at offset.
    status_t appendFrom(const Parcel* parcel, size_t start, size_t len);

    void freeData();

    // Writes: each returns NO_ERROR or NO_MEMORY / BAD_VALUE.
    status_t write(const void* data, size_t len);
    void* writeInplace(size_t len);
    status_t writeInt32(int32_t val);
    status_t writeUint32(uint32_t val);
    status_t writeInt64(int64_t val);
    status_t writeUint64(uint64_t val);
    status_t writeFloat(float val);
    status_t writeDouble(double val);
    status_t writeBool(bool val);
    status_t writeCString(const char* str);
    status_t writeString8(const String8& str);
    status_t writeString16(const String16& str);
    status_t writeString16(const char16_t* str, size_t len);

    // Reads.
    status_t read(void* outData, size_t len) const;
    const void* readInplace(size_t len) const;
    int32_t readInt32() const;
    status_t readInt32(int32_t* pArg) const;
    uint32_t readUint32() const;
    status_t readUint32(uint32_t* pArg) const;
    int64_t readInt64() const;
    status_t readInt64(int64_t* pArg) const;
    uint64_t readUint64() const;
    status_t readUint64(uint64_t* pArg) const;
    float readFloat() const;
    status_t readFloat(float* pArg) const;
    double readDouble() const;
    status_t readDouble(double* pArg) const;
    bool readBool() const;
    status_t readBool(bool* pArg) const;
    const char* readCString() const;
    String8 readString8() const;
    status_t readString8(String8* pArg) const;
    String16 readString16() const;
    status_t readString16(String16* pArg) const;
    // Returns the units in place (length in *outLen) or null for a null or
    // malformed string.
    const char16_t* readString16Inplace(size_t* outLen) const;

private:
    template <typename T>
    status_t writeAligned(T val);
    template <typename T>
    status_t readAligned(T* pArg) const;
    template <typename T>
    T readAligned() const;
    status_t growData(size_t len);
    status_t continueWrite(size_t desired);
    status_t finishWrite(size_t len);

    uint8_t* mData;
    size_t mDataSize;
    size_t mDataCapacity;
    mutable size_t mDataPos;
    // The object table (binder objects and file descriptors) joins here when
    // the binder transport carries them.
};

} // namespace android
