#pragma once

// The subset of binder's Parcel that the daemon uses, in binder's flat format:
// little-endian values aligned to 4 bytes, String8 as (int32 byte length,
// bytes, NUL, padding), String16 as (int32 length in UTF-16 units or -1 for
// null, units, NUL unit, padding), C strings with their NUL padded to 4, raw
// blocks padded to 4. A read past the end never touches memory outside the
// buffer: the value reads return 0 or an empty value and the status-returning
// variants report NOT_ENOUGH_DATA.
//
// Binder objects and file descriptors take a 16-byte slot in the data (uint32
// kind, uint32 0, uint64 0) and an entry in the parcel's object table, which
// holds the object itself (a strong reference, or a descriptor the parcel
// owns). Reading one needs both: bytes alone, however they were made, never
// give an object. Objects survive appendFrom (descriptors are duplicated);
// writing over a slot, shrinking the data or freeing it drops its object.

#include <android-base/unique_fd.h>
#include <stddef.h>
#include <stdint.h>
#include <utils/Errors.h>
#include <utils/RefBase.h>
#include <utils/String16.h>
#include <utils/String8.h>

#include <vector>

namespace kelvo {
class BinderFrame;
} // namespace kelvo

namespace android {

class IBinder;
class IPCThreadState;

class Parcel {
public:
    Parcel();
    ~Parcel();
    // Like binder's, a parcel is not copyable: copy its bytes and objects with
    // appendFrom.
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
    // Plain bytes: the parcel's objects are dropped.
    status_t setData(const uint8_t* buffer, size_t len);

    // Appends len bytes of parcel starting at offset, with the objects whose
    // slots lie wholly inside them.
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

    // Binder objects. A null binder is written and read back as null.
    status_t writeStrongBinder(const sp<IBinder>& val);
    sp<IBinder> readStrongBinder() const;
    // UNEXPECTED_NULL for a null binder, BAD_TYPE when no object is there
    // (the cursor then stays put).
    status_t readStrongBinder(sp<IBinder>* val) const;
    status_t readNullableStrongBinder(sp<IBinder>* val) const;

    // File descriptors. The parcel keeps its own descriptor: a duplicate of
    // fd, or fd itself when takeOwnership (then it closes it).
    status_t writeFileDescriptor(int fd, bool takeOwnership = false);
    status_t writeDupFileDescriptor(int fd);
    status_t writeUniqueFileDescriptor(const base::unique_fd& fd);
    // The parcel's descriptor, valid while the parcel keeps it; BAD_TYPE
    // (cursor left alone) when none is there.
    int readFileDescriptor() const;
    // A duplicate the caller owns.
    status_t readUniqueFileDescriptor(base::unique_fd* val) const;

    size_t objectsCount() const { return mObjects.size(); }
    bool hasFileDescriptors() const;

    // The header of every request: int32 kInterfaceTokenHeader, then the
    // interface descriptor as a String16.
    static constexpr int32_t kInterfaceTokenHeader = 0x4b544f4b;  // "KOTK"
    status_t writeInterfaceToken(const String16& interface);
    status_t writeInterfaceToken(const char16_t* str, size_t len);
    // Reads the header and tells whether it names interface.
    bool enforceInterface(const String16& interface, IPCThreadState* threadState = nullptr) const;
    bool enforceInterface(const char16_t* interface, size_t len,
                          IPCThreadState* threadState = nullptr) const;
    // Reads the header and tells whether it names binder's own descriptor.
    bool checkInterface(IBinder* binder) const;

    // The exception header of a reply (binder::Status): int32 0 for none.
    status_t writeNoException();
    // The exception code of a reply (0 for none). A non-zero code's message
    // (and service-specific error) is read past as well.
    int32_t readExceptionCode() const;

private:
    friend class kelvo::BinderFrame;

    struct Object {
        size_t offset;
        sp<IBinder> binder;
        int fd;  // owned; -1 for a binder
    };

    // The slot kinds (first word of an object's slot).
    static constexpr uint32_t kSlotBinder = 0x4b424e44;  // "DNBK"
    static constexpr uint32_t kSlotNull = 0x4b4e554c;    // "LUNK"
    static constexpr uint32_t kSlotFd = 0x4b46445f;      // "_DFK"
    static constexpr size_t kSlotSize = 16;

    status_t writeSlot(uint32_t kind, Object* object);
    // The object whose slot starts at the cursor, or null.
    const Object* objectAtCursor(uint32_t* kind) const;
    // Drops (and closes) the objects whose slots overlap [start, end).
    void dropObjects(size_t start, size_t end);
    void releaseObjects();
    // Adds an object whose slot is already in the data (transport and
    // appendFrom); checks the slot.
    status_t insertObject(Object&& object, uint32_t kind);

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
    // Sorted by offset; slots never overlap.
    std::vector<Object> mObjects;
};

} // namespace android
