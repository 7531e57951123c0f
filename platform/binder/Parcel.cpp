#include <binder/IBinder.h>
#include <binder/Parcel.h>
#include <binder/Status.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>

namespace android {

namespace {

// Largest parcel and largest single item, as binder limits them.
constexpr size_t kMaxSize = INT32_MAX;

inline size_t padSize(size_t s) {
    return (s + 3) & ~static_cast<size_t>(3);
}

// True when p points into the size bytes at base.
bool pointsInto(const void* p, const uint8_t* base, size_t size) {
    uintptr_t at = reinterpret_cast<uintptr_t>(p);
    uintptr_t start = reinterpret_cast<uintptr_t>(base);
    return base != nullptr && at >= start && at - start < size;
}

} // namespace

Parcel::Parcel() : mData(nullptr), mDataSize(0), mDataCapacity(0), mDataPos(0) {}

Parcel::~Parcel() {
    freeData();
}

size_t Parcel::dataAvail() const {
    return mDataPos < mDataSize ? mDataSize - mDataPos : 0;
}

void Parcel::freeData() {
    releaseObjects();
    free(mData);
    mData = nullptr;
    mDataSize = 0;
    mDataCapacity = 0;
    mDataPos = 0;
}

status_t Parcel::continueWrite(size_t desired) {
    if (desired > kMaxSize) {
        return BAD_VALUE;
    }
    if (desired == mDataCapacity) {
        return NO_ERROR;
    }
    if (desired == 0) {
        freeData();
        return NO_ERROR;
    }
    uint8_t* data = static_cast<uint8_t*>(realloc(mData, desired));
    if (data == nullptr) {
        return NO_MEMORY;
    }
    if (desired > mDataCapacity) {
        memset(data + mDataCapacity, 0, desired - mDataCapacity);
    }
    mData = data;
    mDataCapacity = desired;
    if (mDataSize > desired) {
        mDataSize = desired;
    }
    if (mDataPos > desired) {
        mDataPos = desired;
    }
    return NO_ERROR;
}

status_t Parcel::growData(size_t len) {
    if (len > kMaxSize || mDataPos > kMaxSize - len) {
        return BAD_VALUE;
    }
    size_t needed = mDataPos + len;
    if (needed <= mDataCapacity) {
        return NO_ERROR;
    }
    size_t newSize = needed < kMaxSize / 3 ? (needed * 3) / 2 : kMaxSize;
    if (newSize < 64) {
        newSize = 64;
    }
    return continueWrite(newSize);
}

status_t Parcel::finishWrite(size_t len) {
    if (!mObjects.empty()) {
        // Plain bytes written over a slot take its object away.
        dropObjects(mDataPos, mDataPos + len);
    }
    mDataPos += len;
    if (mDataPos > mDataSize) {
        mDataSize = mDataPos;
    }
    return NO_ERROR;
}

status_t Parcel::setDataSize(size_t size) {
    if (size > kMaxSize) {
        return BAD_VALUE;
    }
    if (size > mDataCapacity) {
        status_t err = continueWrite(size);
        if (err != NO_ERROR) {
            return err;
        }
    } else if (size > mDataSize) {
        memset(mData + mDataSize, 0, size - mDataSize);
    }
    if (size < mDataSize) {
        dropObjects(size, SIZE_MAX);
        // Bytes past the end are kept zero, so that growing the parcel again
        // or writing beyond its end never brings dropped data back.
        memset(mData + size, 0, mDataSize - size);
    }
    mDataSize = size;
    if (mDataPos > size) {
        mDataPos = size;
    }
    return NO_ERROR;
}

void Parcel::setDataPosition(size_t pos) const {
    mDataPos = pos > kMaxSize ? kMaxSize : pos;
}

status_t Parcel::setDataCapacity(size_t size) {
    if (size > mDataCapacity) {
        return continueWrite(size);
    }
    return NO_ERROR;
}

status_t Parcel::setData(const uint8_t* buffer, size_t len) {
    if (len > kMaxSize || (buffer == nullptr && len != 0)) {
        return BAD_VALUE;
    }
    if (len == 0) {
        freeData();
        return NO_ERROR;
    }
    // Copy before releasing the old buffer: the source may lie inside it.
    uint8_t* data = static_cast<uint8_t*>(malloc(len));
    if (data == nullptr) {
        return NO_MEMORY;
    }
    memcpy(data, buffer, len);
    freeData();
    mData = data;
    mDataSize = len;
    mDataCapacity = len;
    return NO_ERROR;
}

status_t Parcel::appendFrom(const Parcel* parcel, size_t start, size_t len) {
    if (parcel == nullptr) {
        return BAD_VALUE;
    }
    if (len == 0) {
        return NO_ERROR;
    }
    if (start > parcel->mDataSize || len > parcel->mDataSize - start) {
        return BAD_VALUE;
    }
    // Copy the objects first (the source may be this very parcel, and the
    // copy below may write over their slots).
    std::vector<Object> copied;
    for (const Object& obj : parcel->mObjects) {
        if (obj.offset < start || obj.offset - start > len ||
            len - (obj.offset - start) < kSlotSize) {
            continue;
        }
        Object copy{obj.offset - start, obj.binder, -1};
        if (obj.fd >= 0) {
            copy.fd = fcntl(obj.fd, F_DUPFD_CLOEXEC, 0);
            if (copy.fd < 0) {
                for (Object& o : copied) {
                    if (o.fd >= 0) {
                        close(o.fd);
                    }
                }
                return FAILED_TRANSACTION;
            }
        }
        copied.push_back(std::move(copy));
    }
    status_t err = growData(len);
    if (err != NO_ERROR) {
        for (Object& o : copied) {
            if (o.fd >= 0) {
                close(o.fd);
            }
        }
        return err;
    }
    size_t at = mDataPos;
    // Read the source only after growing: it may be this very parcel.
    memmove(mData + mDataPos, parcel->mData + start, len);
    finishWrite(len);
    for (Object& o : copied) {
        uint32_t kind = o.fd >= 0 ? kSlotFd : kSlotBinder;
        o.offset += at;
        insertObject(std::move(o), kind);
    }
    return NO_ERROR;
}

void* Parcel::writeInplace(size_t len) {
    if (len > kMaxSize) {
        return nullptr;
    }
    size_t padded = padSize(len);
    if (padded < len || growData(padded) != NO_ERROR) {
        return nullptr;
    }
    uint8_t* out = mData + mDataPos;
    if (padded != len) {
        memset(out + len, 0, padded - len);
    }
    finishWrite(padded);
    return out;
}

status_t Parcel::write(const void* data, size_t len) {
    if (len != 0 && data == nullptr) {
        return BAD_VALUE;
    }
    if (len > kMaxSize) {
        return BAD_VALUE;
    }
    if (len != 0 && pointsInto(data, mData, mDataCapacity)) {
        // Bytes of this very parcel (a string just read in place, say): the
        // write may move the buffer under them, so it goes from a copy.
        void* copy = malloc(len);
        if (copy == nullptr) {
            return NO_MEMORY;
        }
        memcpy(copy, data, len);
        status_t err = write(copy, len);
        free(copy);
        return err;
    }
    void* out = writeInplace(len);
    if (out == nullptr) {
        return NO_MEMORY;
    }
    if (len != 0) {
        memcpy(out, data, len);
    }
    return NO_ERROR;
}

template <typename T>
status_t Parcel::writeAligned(T val) {
    static_assert(sizeof(T) % 4 == 0, "aligned values only");
    status_t err = growData(sizeof(T));
    if (err != NO_ERROR) {
        return err;
    }
    memcpy(mData + mDataPos, &val, sizeof(T));
    return finishWrite(sizeof(T));
}

status_t Parcel::writeInt32(int32_t val) { return writeAligned(val); }
status_t Parcel::writeUint32(uint32_t val) { return writeAligned(val); }
status_t Parcel::writeInt64(int64_t val) { return writeAligned(val); }
status_t Parcel::writeUint64(uint64_t val) { return writeAligned(val); }
status_t Parcel::writeFloat(float val) { return writeAligned(val); }
status_t Parcel::writeDouble(double val) { return writeAligned(val); }
status_t Parcel::writeBool(bool val) { return writeInt32(val ? 1 : 0); }

status_t Parcel::writeCString(const char* str) {
    if (str == nullptr) {
        return BAD_VALUE;
    }
    return write(str, strlen(str) + 1);
}

status_t Parcel::writeString8(const String8& str) {
    size_t len = str.size();
    if (len >= kMaxSize) {
        return BAD_VALUE;
    }
    size_t start = mDataPos;
    status_t err = writeInt32(static_cast<int32_t>(len));
    if (err == NO_ERROR) {
        err = write(str.string(), len + 1);
    }
    if (err != NO_ERROR) {
        mDataPos = start;
    }
    return err;
}

status_t Parcel::writeString16(const String16& str) {
    return writeString16(str.string(), str.size());
}

status_t Parcel::writeString16(const char16_t* str, size_t len) {
    if (str == nullptr) {
        return writeInt32(-1);
    }
    if (len >= kMaxSize / sizeof(char16_t)) {
        return BAD_VALUE;
    }
    if (len != 0 && pointsInto(str, mData, mDataCapacity)) {
        // Units of this very parcel: write them from a copy, as write() does.
        char16_t* copy = static_cast<char16_t*>(malloc(len * sizeof(char16_t)));
        if (copy == nullptr) {
            return NO_MEMORY;
        }
        memcpy(copy, str, len * sizeof(char16_t));
        status_t err = writeString16(copy, len);
        free(copy);
        return err;
    }
    size_t start = mDataPos;
    status_t err = writeInt32(static_cast<int32_t>(len));
    if (err == NO_ERROR) {
        size_t bytes = len * sizeof(char16_t);
        uint8_t* out = static_cast<uint8_t*>(writeInplace(bytes + sizeof(char16_t)));
        if (out == nullptr) {
            err = NO_MEMORY;
        } else {
            memcpy(out, str, bytes);
            memset(out + bytes, 0, sizeof(char16_t));
        }
    }
    if (err != NO_ERROR) {
        mDataPos = start;
    }
    return err;
}

const void* Parcel::readInplace(size_t len) const {
    if (len > kMaxSize) {
        return nullptr;
    }
    size_t padded = padSize(len);
    if (mDataPos > mDataSize || padded > mDataSize - mDataPos) {
        return nullptr;
    }
    const void* out = mData + mDataPos;
    mDataPos += padded;
    return out;
}

status_t Parcel::read(void* outData, size_t len) const {
    if (len > kMaxSize) {
        return BAD_VALUE;
    }
    if (len != 0 && outData == nullptr) {
        return BAD_VALUE;
    }
    const void* in = readInplace(len);
    if (in == nullptr) {
        return NOT_ENOUGH_DATA;
    }
    if (len != 0) {
        memcpy(outData, in, len);
    }
    return NO_ERROR;
}

template <typename T>
status_t Parcel::readAligned(T* pArg) const {
    if (mDataPos > mDataSize || sizeof(T) > mDataSize - mDataPos) {
        return NOT_ENOUGH_DATA;
    }
    memcpy(pArg, mData + mDataPos, sizeof(T));
    mDataPos += sizeof(T);
    return NO_ERROR;
}

template <typename T>
T Parcel::readAligned() const {
    T result{};
    if (readAligned(&result) != NO_ERROR) {
        return T{};
    }
    return result;
}

int32_t Parcel::readInt32() const { return readAligned<int32_t>(); }
status_t Parcel::readInt32(int32_t* pArg) const { return readAligned(pArg); }
uint32_t Parcel::readUint32() const { return readAligned<uint32_t>(); }
status_t Parcel::readUint32(uint32_t* pArg) const { return readAligned(pArg); }
int64_t Parcel::readInt64() const { return readAligned<int64_t>(); }
status_t Parcel::readInt64(int64_t* pArg) const { return readAligned(pArg); }
uint64_t Parcel::readUint64() const { return readAligned<uint64_t>(); }
status_t Parcel::readUint64(uint64_t* pArg) const { return readAligned(pArg); }
float Parcel::readFloat() const { return readAligned<float>(); }
status_t Parcel::readFloat(float* pArg) const { return readAligned(pArg); }
double Parcel::readDouble() const { return readAligned<double>(); }
status_t Parcel::readDouble(double* pArg) const { return readAligned(pArg); }

bool Parcel::readBool() const {
    return readInt32() != 0;
}

status_t Parcel::readBool(bool* pArg) const {
    int32_t v = 0;
    status_t err = readInt32(&v);
    if (err == NO_ERROR && pArg != nullptr) {
        *pArg = v != 0;
    }
    return err;
}

const char* Parcel::readCString() const {
    if (mDataPos >= mDataSize) {
        return nullptr;
    }
    const char* str = reinterpret_cast<const char*>(mData + mDataPos);
    size_t avail = mDataSize - mDataPos;
    const void* nul = memchr(str, '\0', avail);
    if (nul == nullptr) {
        return nullptr;
    }
    size_t used = padSize(static_cast<const char*>(nul) - str + 1);
    mDataPos += used < avail ? used : avail;
    return str;
}

status_t Parcel::readString8(String8* pArg) const {
    size_t start = mDataPos;
    int32_t size = 0;
    status_t err = readInt32(&size);
    if (err != NO_ERROR) {
        return err;
    }
    if (size < 0 || size == INT32_MAX) {
        mDataPos = start;
        return BAD_VALUE;
    }
    const char* str = static_cast<const char*>(readInplace(static_cast<size_t>(size) + 1));
    if (str == nullptr || str[size] != '\0') {
        mDataPos = start;
        return str == nullptr ? NOT_ENOUGH_DATA : BAD_VALUE;
    }
    if (pArg != nullptr) {
        pArg->setTo(str, static_cast<size_t>(size));
    }
    return NO_ERROR;
}

String8 Parcel::readString8() const {
    String8 out;
    if (readString8(&out) != NO_ERROR) {
        return String8();
    }
    return out;
}

const char16_t* Parcel::readString16Inplace(size_t* outLen) const {
    if (outLen != nullptr) {
        *outLen = 0;
    }
    size_t start = mDataPos;
    int32_t size = 0;
    if (readInt32(&size) != NO_ERROR) {
        return nullptr;
    }
    if (size < 0 || static_cast<size_t>(size) >= kMaxSize / sizeof(char16_t)) {
        if (size != -1) {
            mDataPos = start; // malformed length: leave the cursor alone
        }
        return nullptr;
    }
    const uint8_t* units = static_cast<const uint8_t*>(
            readInplace((static_cast<size_t>(size) + 1) * sizeof(char16_t)));
    // The cursor may sit at any offset: look at the terminator bytewise.
    char16_t terminator = 1;
    if (units != nullptr) {
        memcpy(&terminator, units + static_cast<size_t>(size) * sizeof(char16_t),
               sizeof(terminator));
    }
    const char16_t* str = reinterpret_cast<const char16_t*>(units);
    if (str == nullptr || terminator != 0) {
        mDataPos = start;
        return nullptr;
    }
    if (outLen != nullptr) {
        *outLen = static_cast<size_t>(size);
    }
    return str;
}

status_t Parcel::readString16(String16* pArg) const {
    size_t start = mDataPos;
    size_t len = 0;
    const char16_t* str = readString16Inplace(&len);
    if (str == nullptr) {
        if (pArg != nullptr) {
            *pArg = String16();
        }
        // A null string (-1) moved the cursor past its length; anything else
        // is malformed or missing.
        return mDataPos != start ? UNEXPECTED_NULL : NOT_ENOUGH_DATA;
    }
    if (pArg != nullptr) {
        pArg->setTo(str, len);
    }
    return NO_ERROR;
}

String16 Parcel::readString16() const {
    String16 out;
    readString16(&out);
    return out;
}

// ---------------------------------------------------------------------------
// The object table.

void Parcel::releaseObjects() {
    // Move the table out first: closing may run destructors that touch
    // other parcels, never this one.
    std::vector<Object> objects;
    objects.swap(mObjects);
    for (Object& obj : objects) {
        if (obj.fd >= 0) {
            close(obj.fd);
        }
    }
}

void Parcel::dropObjects(size_t start, size_t end) {
    auto first = std::find_if(mObjects.begin(), mObjects.end(),
                              [start](const Object& o) { return o.offset + kSlotSize > start; });
    auto last = first;
    while (last != mObjects.end() && last->offset < end) {
        if (last->fd >= 0) {
            close(last->fd);
            last->fd = -1;
        }
        ++last;
    }
    mObjects.erase(first, last);
}

status_t Parcel::insertObject(Object&& object, uint32_t kind) {
    auto fail = [&object]() {
        if (object.fd >= 0) {
            close(object.fd);
            object.fd = -1;
        }
        return BAD_VALUE;
    };
    if (object.offset > mDataSize || mDataSize - object.offset < kSlotSize) {
        return fail();
    }
    uint32_t word = 0;
    memcpy(&word, mData + object.offset, sizeof(word));
    if (word != kind || (kind == kSlotFd) != (object.fd >= 0) ||
        (kind == kSlotBinder && object.binder == nullptr)) {
        return fail();
    }
    auto pos = std::lower_bound(mObjects.begin(), mObjects.end(), object.offset,
                                [](const Object& o, size_t offset) { return o.offset < offset; });
    if ((pos != mObjects.end() && pos->offset < object.offset + kSlotSize) ||
        (pos != mObjects.begin() && std::prev(pos)->offset + kSlotSize > object.offset)) {
        return fail();
    }
    mObjects.insert(pos, std::move(object));
    return NO_ERROR;
}

status_t Parcel::writeSlot(uint32_t kind, Object* object) {
    uint8_t* slot = static_cast<uint8_t*>(writeInplace(kSlotSize));
    if (slot == nullptr) {
        if (object != nullptr && object->fd >= 0) {
            close(object->fd);
        }
        return NO_MEMORY;
    }
    memset(slot, 0, kSlotSize);
    memcpy(slot, &kind, sizeof(kind));
    if (object == nullptr) {
        return NO_ERROR;
    }
    object->offset = static_cast<size_t>(slot - mData);
    return insertObject(std::move(*object), kind);
}

const Parcel::Object* Parcel::objectAtCursor(uint32_t* kind) const {
    *kind = 0;
    if (mDataPos > mDataSize || mDataSize - mDataPos < kSlotSize) {
        return nullptr;
    }
    memcpy(kind, mData + mDataPos, sizeof(*kind));
    auto pos = std::lower_bound(mObjects.begin(), mObjects.end(), mDataPos,
                                [](const Object& o, size_t offset) { return o.offset < offset; });
    if (pos == mObjects.end() || pos->offset != mDataPos) {
        return nullptr;
    }
    return &*pos;
}

status_t Parcel::writeStrongBinder(const sp<IBinder>& val) {
    if (val == nullptr) {
        return writeSlot(kSlotNull, nullptr);
    }
    Object obj{0, val, -1};
    return writeSlot(kSlotBinder, &obj);
}

status_t Parcel::readNullableStrongBinder(sp<IBinder>* val) const {
    uint32_t kind = 0;
    const Object* obj = objectAtCursor(&kind);
    if (kind == kSlotNull && obj == nullptr) {
        mDataPos += kSlotSize;
        if (val != nullptr) {
            val->clear();
        }
        return NO_ERROR;
    }
    if (obj == nullptr || kind != kSlotBinder || obj->binder == nullptr) {
        return mDataPos <= mDataSize && mDataSize - mDataPos >= kSlotSize ? BAD_TYPE
                                                                          : NOT_ENOUGH_DATA;
    }
    mDataPos += kSlotSize;
    if (val != nullptr) {
        *val = obj->binder;
    }
    return NO_ERROR;
}

status_t Parcel::readStrongBinder(sp<IBinder>* val) const {
    status_t err = readNullableStrongBinder(val);
    if (err == NO_ERROR && val != nullptr && *val == nullptr) {
        return UNEXPECTED_NULL;
    }
    return err;
}

sp<IBinder> Parcel::readStrongBinder() const {
    sp<IBinder> val;
    readNullableStrongBinder(&val);
    return val;
}

status_t Parcel::writeFileDescriptor(int fd, bool takeOwnership) {
    if (fd < 0) {
        return BAD_VALUE;
    }
    Object obj{0, nullptr, fd};
    if (!takeOwnership) {
        obj.fd = fcntl(fd, F_DUPFD_CLOEXEC, 0);
        if (obj.fd < 0) {
            return BAD_VALUE;
        }
    }
    return writeSlot(kSlotFd, &obj);
}

status_t Parcel::writeDupFileDescriptor(int fd) {
    return writeFileDescriptor(fd, false);
}

status_t Parcel::writeUniqueFileDescriptor(const base::unique_fd& fd) {
    return writeFileDescriptor(fd.get(), false);
}

int Parcel::readFileDescriptor() const {
    uint32_t kind = 0;
    const Object* obj = objectAtCursor(&kind);
    if (obj == nullptr || kind != kSlotFd || obj->fd < 0) {
        return BAD_TYPE;
    }
    mDataPos += kSlotSize;
    return obj->fd;
}

status_t Parcel::readUniqueFileDescriptor(base::unique_fd* val) const {
    int fd = readFileDescriptor();
    if (fd < 0) {
        return BAD_TYPE;
    }
    int copy = fcntl(fd, F_DUPFD_CLOEXEC, 0);
    if (copy < 0) {
        return BAD_VALUE;
    }
    if (val != nullptr) {
        val->reset(copy);
    } else {
        close(copy);
    }
    return NO_ERROR;
}

bool Parcel::hasFileDescriptors() const {
    return std::any_of(mObjects.begin(), mObjects.end(), [](const Object& o) { return o.fd >= 0; });
}

status_t Parcel::writeInterfaceToken(const String16& interface) {
    return writeInterfaceToken(interface.string(), interface.size());
}

status_t Parcel::writeInterfaceToken(const char16_t* str, size_t len) {
    size_t start = mDataPos;
    status_t err = writeInt32(kInterfaceTokenHeader);
    if (err == NO_ERROR) {
        err = writeString16(str, len);
    }
    if (err != NO_ERROR) {
        mDataPos = start;
    }
    return err;
}

bool Parcel::enforceInterface(const String16& interface, IPCThreadState* threadState) const {
    return enforceInterface(interface.string(), interface.size(), threadState);
}

bool Parcel::enforceInterface(const char16_t* interface, size_t len,
                              IPCThreadState* threadState) const {
    int32_t header = 0;
    if (readInt32(&header) != NO_ERROR || header != kInterfaceTokenHeader) {
        return false;
    }
    size_t got = 0;
    const char16_t* str = readString16Inplace(&got);
    if (str == nullptr || got != len) {
        return false;
    }
    return len == 0 || memcmp(str, interface, len * sizeof(char16_t)) == 0;
}

bool Parcel::checkInterface(IBinder* binder) const {
    return binder != nullptr && enforceInterface(binder->getInterfaceDescriptor());
}

status_t Parcel::writeNoException() {
    return binder::Status::ok().writeToParcel(this);
}

int32_t Parcel::readExceptionCode() const {
    binder::Status status;
    status.readFromParcel(*this);
    return status.exceptionCode();
}

} // namespace android
