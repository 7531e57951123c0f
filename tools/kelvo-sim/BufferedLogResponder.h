#pragma once

#include <stdint.h>

#include <atomic>
#include <functional>
#include <string>

namespace kelvo {
namespace sim {

// A framework client of the daemon's buffered-log socket, as the simulator
// plays it: connects under `name` (retrying every 500 ms), waits for the
// daemon's requests and sends the reply `answer` gives for each (none when
// it returns false), until `stop` is set. A failed receive or send closes
// the connection and connects again. `sent` (optional) runs after each
// reply that went out.
class BufferedLogResponder {
public:
    using Answer = std::function<bool(int32_t magic, const std::string& data, int32_t* replyMagic,
                                      std::string* reply)>;

    static void serve(const char* name, const std::atomic<bool>& stop, const Answer& answer,
                      const std::function<void()>& sent = nullptr);
};

}  // namespace sim
}  // namespace kelvo
