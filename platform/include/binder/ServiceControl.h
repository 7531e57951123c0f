#pragma once

// Host-only controls of the binder transport, for tests and the simulated
// platform services: stopping a service as if its process had died, and the
// time getService waits for a name.

#include <utils/Errors.h>
#include <utils/String16.h>

#include <string>

namespace kelvo {

class ServiceControl {
public:
    // How long getService waits for a name to appear by default.
    static constexpr int kDefaultServiceWaitMs = 5000;

    static void setServiceWaitMs(int ms);
    static int serviceWaitMs();

    // Stops serving the name from this process: its socket goes and every
    // connection to it closes, so proxies to it die and their death
    // recipients are told. NAME_NOT_FOUND when this process does not serve it.
    static android::status_t stopService(const android::String16& name);

    // The folder holding the sockets: <root>/dev/binder.
    static std::string socketDir();
};

} // namespace kelvo
