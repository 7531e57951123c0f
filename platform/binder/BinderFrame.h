#pragma once

// The host binder transport's wire format (see docs/architecture.md, "Host
// binder transport"). Every frame is a 32-byte header, the parcel's data
// and its object table; file descriptors travel beside it as SCM_RIGHTS.
// All numbers are little-endian.

#include <binder/Parcel.h>
#include <stddef.h>
#include <stdint.h>
#include <utils/RefBase.h>

#include <functional>
#include <string>
#include <vector>

namespace android {
class IBinder;
} // namespace android

namespace kelvo {

struct FrameHeader {
    uint32_t magic;
    uint16_t kind;
    uint16_t reserved;
    uint32_t code;    // transaction code; a reply's status; a hello's version
    uint32_t flags;   // transaction flags (FLAG_ONEWAY)
    uint64_t target;  // a transaction's object id; a hello's incarnation
    uint32_t dataSize;
    uint32_t tableSize;
};
static_assert(sizeof(FrameHeader) == 32, "the header is 32 bytes on the wire");

// One entry of a frame's object table.
struct WireObject {
    uint32_t offset = 0;  // the object's slot in the data
    uint32_t kind = 0;    // BinderFrame::kObjectBinder or kObjectFd
    // Binders: where the object lives.
    uint64_t id = 0;
    uint64_t incarnation = 0;
    std::string name;
};

class BinderFrame {
public:
    static constexpr uint32_t kMagic = 0x3146424b;  // "KBF1"
    static constexpr uint32_t kProtocolVersion = 1;

    static constexpr uint16_t kTransaction = 1;
    static constexpr uint16_t kReply = 2;
    static constexpr uint16_t kHello = 3;

    static constexpr uint32_t kObjectBinder = 1;
    static constexpr uint32_t kObjectFd = 2;

    // Bounds of one frame.
    static constexpr size_t kMaxDataSize = 1024 * 1024;
    static constexpr size_t kMaxObjects = 256;
    static constexpr size_t kMaxFds = 253;  // what one SCM_RIGHTS message carries
    static constexpr size_t kMaxNameLength = 96;
    static constexpr size_t kMaxTableSize = 4 + kMaxObjects * (8 + 8 + 8 + 4 + kMaxNameLength);

    using Exporter =
        std::function<android::status_t(const android::sp<android::IBinder>&, WireObject*)>;
    using Importer = std::function<android::sp<android::IBinder>(const WireObject&)>;

    // Checks magic, kind, reserved bits and sizes.
    static android::status_t checkHeader(const FrameHeader& header);

    // A name that can stand below the socket folder: 1..kMaxNameLength bytes
    // of letters, digits and "._-:@", not "." or "..".
    static bool isValidName(const std::string& name);

    // Parses and checks a whole object table against the data it describes
    // and the number of descriptors that came with it.
    static android::status_t parseObjects(const uint8_t* data, size_t dataSize,
                                          const uint8_t* table, size_t tableSize, size_t fdCount,
                                          std::vector<WireObject>* out);

    // The object table of parcel, and its descriptors in table order (not
    // duplicated: valid while the parcel lives).
    static android::status_t encodeObjects(const android::Parcel& parcel, const Exporter& exporter,
                                           std::vector<uint8_t>* table, std::vector<int>* fds);

    // Fills parcel with the data (a malloc'd buffer it takes) and the objects;
    // takes the descriptors (closed on failure, as is the buffer).
    static android::status_t fillParcel(android::Parcel* parcel, uint8_t* data, size_t dataSize,
                                        const std::vector<WireObject>& objects,
                                        std::vector<int>* fds, const Importer& importer);
};

} // namespace kelvo
