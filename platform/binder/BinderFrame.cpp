#include "BinderFrame.h"

#include <binder/BpBinder.h>
#include <binder/IBinder.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

using android::BAD_VALUE;
using android::FAILED_TRANSACTION;
using android::NO_ERROR;
using android::Parcel;
using android::sp;
using android::status_t;

namespace kelvo {

namespace {

inline size_t pad4(size_t n) {
    return (n + 3) & ~static_cast<size_t>(3);
}

void putU32(std::vector<uint8_t>* out, uint32_t v) {
    const uint8_t* p = reinterpret_cast<const uint8_t*>(&v);
    out->insert(out->end(), p, p + sizeof(v));
}

void putU64(std::vector<uint8_t>* out, uint64_t v) {
    const uint8_t* p = reinterpret_cast<const uint8_t*>(&v);
    out->insert(out->end(), p, p + sizeof(v));
}

// A bounds-checked reader over the table.
class TableReader {
public:
    TableReader(const uint8_t* p, size_t size) : mP(p), mSize(size), mPos(0) {}
    bool u32(uint32_t* v) { return take(v, sizeof(*v)); }
    bool u64(uint64_t* v) { return take(v, sizeof(*v)); }
    bool bytes(size_t n, const uint8_t** out) {
        if (n > mSize - mPos) {
            return false;
        }
        *out = mP + mPos;
        mPos += n;
        return true;
    }
    size_t left() const { return mSize - mPos; }

private:
    bool take(void* v, size_t n) {
        if (n > mSize - mPos) {
            return false;
        }
        memcpy(v, mP + mPos, n);
        mPos += n;
        return true;
    }
    const uint8_t* mP;
    size_t mSize;
    size_t mPos;
};

void closeAll(std::vector<int>* fds) {
    for (int fd : *fds) {
        if (fd >= 0) {
            close(fd);
        }
    }
    fds->clear();
}

} // namespace

status_t BinderFrame::checkHeader(const FrameHeader& header) {
    if (header.magic != kMagic || header.reserved != 0) {
        return BAD_VALUE;
    }
    switch (header.kind) {
        case kTransaction:
            if ((header.flags & ~static_cast<uint32_t>(android::IBinder::FLAG_ONEWAY)) != 0) {
                return BAD_VALUE;
            }
            break;
        case kReply:
            if (header.flags != 0) {
                return BAD_VALUE;
            }
            break;
        case kHello:
            if (header.flags != 0 || header.dataSize != 0 || header.tableSize != 0 ||
                header.code != kProtocolVersion || header.target == 0) {
                return BAD_VALUE;
            }
            break;
        default:
            return BAD_VALUE;
    }
    if (header.dataSize > kMaxDataSize || header.tableSize > kMaxTableSize ||
        (header.tableSize != 0 && header.tableSize < 4)) {
        return BAD_VALUE;
    }
    return NO_ERROR;
}

bool BinderFrame::isValidName(const std::string& name) {
    if (name.empty() || name.size() > kMaxNameLength || name == "." || name == "..") {
        return false;
    }
    for (char c : name) {
        bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                  c == '.' || c == '_' || c == '-' || c == ':' || c == '@';
        if (!ok) {
            return false;
        }
    }
    return true;
}

status_t BinderFrame::parseObjects(const uint8_t* data, size_t dataSize, const uint8_t* table,
                                   size_t tableSize, size_t fdCount, std::vector<WireObject>* out) {
    out->clear();
    if (tableSize == 0) {
        return fdCount == 0 ? NO_ERROR : BAD_VALUE;
    }
    if (table == nullptr || tableSize > kMaxTableSize || fdCount > kMaxFds) {
        return BAD_VALUE;
    }
    TableReader in(table, tableSize);
    uint32_t count = 0;
    // Every entry takes at least 8 bytes: a count beyond what is left is a lie.
    if (!in.u32(&count) || count == 0 || count > kMaxObjects || count > in.left() / 8) {
        return BAD_VALUE;
    }
    out->reserve(count);
    size_t fdsSeen = 0;
    size_t nextFree = 0;  // slots are in order and never overlap
    for (uint32_t i = 0; i < count; ++i) {
        WireObject obj;
        if (!in.u32(&obj.offset) || !in.u32(&obj.kind)) {
            return BAD_VALUE;
        }
        size_t offset = obj.offset;
        if (offset < nextFree || offset > dataSize || dataSize - offset < 16) {
            return BAD_VALUE;
        }
        nextFree = offset + 16;
        uint32_t slotKind = 0;
        memcpy(&slotKind, data + offset, sizeof(slotKind));
        if (obj.kind == kObjectBinder) {
            uint32_t nameLen = 0;
            const uint8_t* name = nullptr;
            if (!in.u64(&obj.id) || !in.u64(&obj.incarnation) || !in.u32(&nameLen) ||
                nameLen == 0 || nameLen > kMaxNameLength || !in.bytes(pad4(nameLen), &name)) {
                return BAD_VALUE;
            }
            obj.name.assign(reinterpret_cast<const char*>(name), nameLen);
            for (size_t k = nameLen; k < pad4(nameLen); ++k) {
                if (name[k] != 0) {
                    return BAD_VALUE;
                }
            }
            if (obj.incarnation == 0 || !isValidName(obj.name) || slotKind != Parcel::kSlotBinder) {
                return BAD_VALUE;
            }
        } else if (obj.kind == kObjectFd) {
            if (++fdsSeen > fdCount || slotKind != Parcel::kSlotFd) {
                return BAD_VALUE;
            }
        } else {
            return BAD_VALUE;
        }
        out->push_back(std::move(obj));
    }
    if (in.left() != 0 || fdsSeen != fdCount) {
        out->clear();
        return BAD_VALUE;
    }
    return NO_ERROR;
}

status_t BinderFrame::encodeObjects(const Parcel& parcel, const Exporter& exporter,
                                    std::vector<uint8_t>* table, std::vector<int>* fds) {
    table->clear();
    fds->clear();
    if (parcel.mObjects.empty()) {
        return NO_ERROR;
    }
    if (parcel.mObjects.size() > kMaxObjects) {
        return FAILED_TRANSACTION;
    }
    putU32(table, static_cast<uint32_t>(parcel.mObjects.size()));
    for (const Parcel::Object& obj : parcel.mObjects) {
        if (obj.offset > UINT32_MAX) {
            return FAILED_TRANSACTION;
        }
        putU32(table, static_cast<uint32_t>(obj.offset));
        if (obj.fd >= 0) {
            if (fds->size() >= kMaxFds) {
                return FAILED_TRANSACTION;
            }
            putU32(table, kObjectFd);
            fds->push_back(obj.fd);
            continue;
        }
        WireObject where;
        status_t err = exporter(obj.binder, &where);
        if (err != NO_ERROR) {
            return err;
        }
        if (!isValidName(where.name) || where.incarnation == 0) {
            return BAD_VALUE;
        }
        putU32(table, kObjectBinder);
        putU64(table, where.id);
        putU64(table, where.incarnation);
        putU32(table, static_cast<uint32_t>(where.name.size()));
        table->insert(table->end(), where.name.begin(), where.name.end());
        table->resize(pad4(table->size()), 0);
    }
    return table->size() <= kMaxTableSize ? NO_ERROR : FAILED_TRANSACTION;
}

status_t BinderFrame::fillParcel(Parcel* parcel, uint8_t* data, size_t dataSize,
                                 const std::vector<WireObject>& objects, std::vector<int>* fds,
                                 const Importer& importer) {
    parcel->freeData();
    // Resolve every binder before the parcel takes anything, so a failure
    // leaves it empty.
    std::vector<sp<android::IBinder>> binders(objects.size());
    for (size_t i = 0; i < objects.size(); ++i) {
        if (objects[i].kind == kObjectBinder) {
            binders[i] = importer(objects[i]);
            if (binders[i] == nullptr) {
                free(data);
                closeAll(fds);
                return BAD_VALUE;
            }
        }
    }
    if (dataSize != 0) {
        parcel->mData = data;
        parcel->mDataSize = dataSize;
        parcel->mDataCapacity = dataSize;
    } else {
        free(data);
    }
    parcel->mDataPos = 0;
    size_t nextFd = 0;
    for (size_t i = 0; i < objects.size(); ++i) {
        Parcel::Object obj{objects[i].offset, nullptr, -1};
        uint32_t kind = Parcel::kSlotBinder;
        if (objects[i].kind == kObjectFd) {
            if (nextFd >= fds->size()) {
                parcel->freeData();
                closeAll(fds);
                return BAD_VALUE;
            }
            obj.fd = (*fds)[nextFd];
            (*fds)[nextFd++] = -1;
            kind = Parcel::kSlotFd;
        } else {
            obj.binder = binders[i];
        }
        status_t err = parcel->insertObject(std::move(obj), kind);
        if (err != NO_ERROR) {
            parcel->freeData();
            closeAll(fds);
            return err;
        }
    }
    closeAll(fds);  // none left over after a checked table
    return NO_ERROR;
}

} // namespace kelvo
