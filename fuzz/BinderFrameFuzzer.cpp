// Frames of the host binder transport as a server or client receives them:
// header checks, the object table against its data and descriptors, the
// parcel built from them, and reading, copying and re-encoding its objects.
//
// Input: one byte giving the number of descriptors that came with the
// frame (modulo 4), then the frame (32-byte header, data, object table).

#include <binder/Binder.h>
#include <binder/Parcel.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <vector>

#include "BinderFrame.h"

using android::BBinder;
using android::IBinder;
using android::NO_ERROR;
using android::Parcel;
using android::sp;
using kelvo::BinderFrame;
using kelvo::FrameHeader;
using kelvo::WireObject;

namespace {

// Reads whatever the parcel holds at every 4-byte position.
void readEverything(const Parcel& p) {
    for (size_t pos = 0; pos <= p.dataSize(); pos += 4) {
        p.setDataPosition(pos);
        sp<IBinder> binder;
        p.readNullableStrongBinder(&binder);
        p.setDataPosition(pos);
        int fd = p.readFileDescriptor();
        if (fd >= 0 && fcntl(fd, F_GETFD) == -1) {
            __builtin_trap();  // a descriptor the parcel does not hold
        }
        p.setDataPosition(pos);
        p.readExceptionCode();
        p.setDataPosition(pos);
        p.enforceInterface(android::String16("x"));
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* input, size_t size) {
    if (size < 1 + sizeof(FrameHeader)) {
        return 0;
    }
    size_t fdCount = input[0] % 4;
    FrameHeader header;
    memcpy(&header, input + 1, sizeof(header));
    const uint8_t* rest = input + 1 + sizeof(header);
    size_t left = size - 1 - sizeof(header);
    if (BinderFrame::checkHeader(header) != NO_ERROR ||
        static_cast<size_t>(header.dataSize) + header.tableSize > left) {
        return 0;
    }
    std::vector<WireObject> objects;
    if (BinderFrame::parseObjects(rest, header.dataSize, rest + header.dataSize, header.tableSize,
                                  fdCount, &objects) != NO_ERROR) {
        return 0;
    }
    std::vector<int> fds;
    for (size_t i = 0; i < fdCount; ++i) {
        fds.push_back(open("/dev/null", O_RDONLY | O_CLOEXEC));
    }
    uint8_t* data = static_cast<uint8_t*>(malloc(header.dataSize + 1));
    memcpy(data, rest, header.dataSize);
    static sp<IBinder>* local = new sp<IBinder>(new BBinder());
    Parcel parcel;
    // Odd ids stand for objects that cannot be reached.
    android::status_t err = BinderFrame::fillParcel(
        &parcel, data, header.dataSize, objects, &fds,
        [](const WireObject& w) -> sp<IBinder> { return w.id % 2 == 0 ? *local : nullptr; });
    if (err != NO_ERROR) {
        return 0;
    }
    readEverything(parcel);

    // Copies of ranges chosen by the input keep whole objects only.
    size_t start = header.target % (parcel.dataSize() + 1);
    size_t len = header.code % (parcel.dataSize() - start + 1);
    Parcel copy;
    copy.writeInt32(1);
    if (copy.appendFrom(&parcel, start, len) == NO_ERROR) {
        readEverything(copy);
    }
    // Whatever the parcel holds encodes to a table that parses again.
    std::vector<uint8_t> table;
    std::vector<int> outFds;
    auto exporter = [](const sp<IBinder>&, WireObject* w) {
        w->name = "fuzz";
        w->incarnation = 1;
        w->id = 2;
        return NO_ERROR;
    };
    for (Parcel* p : {&parcel, &copy}) {
        if (BinderFrame::encodeObjects(*p, exporter, &table, &outFds) == NO_ERROR) {
            std::vector<WireObject> again;
            if (BinderFrame::parseObjects(p->data(), p->dataSize(), table.data(), table.size(),
                                          outFds.size(), &again) != NO_ERROR ||
                again.size() != p->objectsCount()) {
                __builtin_trap();
            }
        }
    }
    return 0;
}
