// Feeds untrusted bytes to the modem record decoders: the first byte picks
// the module (-1 to 12), the rest is a record as it sits in a block, at an
// odd offset. Besides the sanitizers, checks that a packet is refused as a
// block fault exactly when it does not fit, that rows go to the module's
// table with one int32 per column after the time, and that every action
// carries at most nine levels, none negative.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "AccounterTypes.h"
#include "handlers/components/modem/ModemData.h"

using android::Parcel;
using kelvo::ModemData;

namespace {

void check(bool condition) {
    if (!condition) {
        abort();
    }
}

class CheckingOwner : public kelvo::ModemDataOwner {
public:
    explicit CheckingOwner(int32_t module) : mModule(module) {}

    int32_t logModemData(int32_t index, const Parcel& row) override {
        check(index == mModule + 1);
        const kelvo::table_attribute* table = ModemData::table(mModule);
        check(table != nullptr);
        // int64 time, then one int32 per column.
        check(row.dataSize() == 8 + static_cast<size_t>(table->count - 1) * 4);
        ++mRows;
        return 0;
    }

    int32_t accountingModemData(Parcel& action) override {
        action.setDataPosition(0);
        check(action.readInt32() == kelvo::ACCOUNTER_MODEM);
        check(action.readInt32() == kelvo::ACTION_SET_VALUE);
        const int32_t subtype = action.readInt32();
        check(subtype >= 0 && subtype <= 2);
        check(action.readInt32() == mModule);
        if (mModule == kelvo::MODEM_MODULE_LTE_PHY) {
            const int32_t modulation = action.readInt32();
            check(modulation == 0 || modulation == 1);
            check(action.readInt32() >= 0);
        }
        const int32_t count = action.readInt32();
        check(count >= 1 && count <= 9);
        for (int32_t i = 0; i < count; ++i) {
            int32_t level = -1;
            check(action.readInt32(&level) == android::NO_ERROR && level >= 0);
        }
        check(action.dataPosition() == action.dataSize());
        return 0;
    }

    int32_t mRows = 0;

private:
    const int32_t mModule;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 1) {
        return 0;
    }
    const int32_t module = static_cast<int32_t>(data[0] % 14) - 1;
    CheckingOwner owner(module);
    std::unique_ptr<ModemData> decoder = ModemData::create(module, &owner);
    check((decoder == nullptr) == (module < 0 || module >= kelvo::MODEM_MODULE_COUNT));
    if (decoder == nullptr) {
        return 0;
    }
    // An odd offset, as inside a block.
    std::vector<uint8_t> bytes(size);
    memcpy(bytes.data() + 1, data + 1, size - 1);
    const uint8_t* packet = bytes.data() + 1;
    const size_t available = size - 1;
    const int32_t result = decoder->setData(packet, available, 1000, 0, 0);
    uint32_t length = 0;
    if (available >= kelvo::kModemPacketHeaderSize) {
        memcpy(&length, packet, sizeof(length));
    }
    const bool fits = available >= kelvo::kModemPacketHeaderSize &&
                      length <= available - kelvo::kModemPacketHeaderSize;
    check((result == -1) == !fits);
    check(result >= -1 && result <= kelvo::MODEM_RECORD_NOT_STORED);
    check(owner.mRows == (result == kelvo::MODEM_RECORD_ACCOUNTED ||
                          result == kelvo::MODEM_RECORD_STORED));
    return 0;
}
