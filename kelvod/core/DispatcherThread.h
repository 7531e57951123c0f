#pragma once

#include <utils/Thread.h>

namespace kelvo {

class Dispatcher;

// The plain thread that reads the log device with blocking reads, one record
// per round, until a read fails.
class DispatcherThread : public android::Thread {
public:
    explicit DispatcherThread(Dispatcher* dispatcher);

private:
    bool threadLoop() override;

    // The dispatcher outlives its thread (it waits for it when reset).
    Dispatcher* mDispatcher;
};

} // namespace kelvo
