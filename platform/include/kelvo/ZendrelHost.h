#pragma once

#include <stdint.h>

// The host event library writes every sent event as one JSON line to
// <root>/data/log/zendrel/events.jsonl:
//   {"event":903001060,"params":{"0":"2026-12-06 10:00:00","35":97,
//     "5":{"class":903009021,"params":{...}},"7":[{"class":...},...]},
//    "dynamic_paths":["/data/..."]}
// Parameters are keyed by their decimal id; integers stay integers, texts
// strings, children objects, arrays lists.

#define KELVO_ZENDREL_EVENTS_FILE "/data/log/zendrel/events.jsonl"

namespace kelvo {

// Test hooks of the host event library.
class ZendrelHost {
public:
    enum Call {
        CALL_CREATE = 0,
        CALL_SET_PARAM = 1,
        CALL_FILL_ARRAY = 2,
        CALL_DYNAMIC_PATH = 3,
        CALL_SEND = 4,
    };
    // Makes the call fail for objects of this event or class id.
    static void failCall(Call call, uint32_t id);
    static void clearFailures();
    // Objects created and not yet destroyed (leak checks).
    static int32_t liveObjects();
};

} // namespace kelvo
