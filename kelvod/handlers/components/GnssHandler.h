#pragma once

#include <stdint.h>

#include "handlers/components/ComponentHandler.h"

namespace kelvo {

// Location requests per application: every start and stop of a request is
// handed to the GNSS accounter, which keeps the set of active users and
// shares the receiver's power among them. No state of its own.
class GnssHandler : public ComponentHandler {
public:
    static constexpr uint32_t kElector = 0x2;

    // Tag indexes.
    enum gnss_tag : int32_t {
        TAG_GNSS_START = 0,
        TAG_GNSS_STOP = 1,
    };

    GnssHandler();

    static const component_family& family();

    void registerDispatcherTag() override;
    int32_t handleLogger(int64_t time, int32_t tag, const char* text) override;
};

}  // namespace kelvo
