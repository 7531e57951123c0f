#pragma once

#include <stdint.h>

#include <binder/Parcel.h>
#include <utils/RefBase.h>

namespace kelvo {

// Receives the results of one accounter. The accounter calls it from inside
// setDataAccounter, on the caller's thread, with the reply rewound to its
// start; the reply layouts belong to the allocators.
//
// The library keeps a strong reference to a registered listener until it is
// unregistered or replaced, so a listener must live on the heap and be held
// through android::sp.
class LibraryListener : public virtual android::RefBase {
public:
    // event: LIBRARY_EVENT_APPLICATION or LIBRARY_EVENT_COMPONENT. The result
    // goes back to the allocator that sent the reply; negative means the
    // listener could not take the record.
    virtual int32_t handleLibraryEvent(int32_t event, const android::Parcel& reply) = 0;

protected:
    ~LibraryListener() override = default;
};

} // namespace kelvo
