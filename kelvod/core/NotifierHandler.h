#pragma once

#include "utils/HandlerThread.h"

namespace kelvo {

class Notifier;

// The notifier's delivery thread.
class NotifierHandler : public HandlerThread {
public:
    explicit NotifierHandler(Notifier* notifier);

    int32_t handleParcelMessage(const ParcelMessage& msg) override;

private:
    Notifier* mNotifier;
};

} // namespace kelvo
