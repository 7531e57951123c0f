#pragma once

namespace kelvo {

// Test hooks of the host property store.
class HostProperties {
public:
    // Forgets every value and reads the property files of the current root again.
    static void reload();
    // Sets a value in memory without Android's restrictions (read-only
    // properties included); nothing is written to disk.
    static void setForTest(const char* key, const char* value);
};

} // namespace kelvo
