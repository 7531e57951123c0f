#pragma once

#include <stdint.h>

#include <binder/Parcel.h>

namespace kelvo {

// What a modem record decoder needs from the handler that owns it: a place
// to store its rows and a way to the modem accounter. The modem handler
// implements it; tests may supply their own. Called on the owner's thread.
class ModemDataOwner {
public:
    virtual ~ModemDataOwner() = default;
    // Stores one row (an entry record in the table's column order) in the
    // owner's table number `index`: module id + 1 for the decoders. 0, or -3
    // for an index outside the owner's tables.
    virtual int32_t logModemData(int32_t index, const android::Parcel& row) = 0;
    // Hands a modem accounter action (int32 10, int32 SetValue, subtype...)
    // to the accounting library, reading it from its start.
    virtual int32_t accountingModemData(android::Parcel& action) = 0;
};

}  // namespace kelvo
