#pragma once

#include <stdint.h>

#include <string>
#include <vector>

#include "Scenario.h"

namespace kelvo {
namespace sim {

// The Wi-Fi steps of a scenario, played as the framework's log-device
// records:
//   at <t> wifi on|off            KELVO_TAG_WIFI_ON / KELVO_TAG_WIFI_OFF
//   at <t> wifi ap-on|ap-off      the hotspot (KELVO_TAG_WIFI_AP_ON / _OFF)
//   at <t> wifi active|idle       KELVO_TAG_WIFI_ACTIVITY activity=1 / 0
//   at <t> wifi band <0..2>       KELVO_TAG_WIFI_BAND band=<n>
//   at <t> wifi level <0..4>      KELVO_TAG_WIFI_SIGNAL_LEVEL level=<n>
//   at <t> wifi scan <uid>        KELVO_TAG_WIFI_SCAN_STARTED uid=<uid>
// A step keeps its record kind in `value` and its number in `pid`.
class WifiRecords {
public:
    static bool parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                          std::string* reason);
    // The tag and text of a step's record.
    static void record(const Scenario::Step& step, std::string* tag, std::string* text);
};

}  // namespace sim
}  // namespace kelvo
