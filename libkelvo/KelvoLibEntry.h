#pragma once

#include <stdint.h>

#include <binder/Parcel.h>
#include <utils/StrongPointer.h>

#include "AccounterTypes.h"
#include "LibraryListener.h"

namespace kelvo {

// The accounting library's entry surface. Everything crosses it in parcels.

// Starts the library with the daemon's start time (wall clock, ms).
void startLibrary(int64_t systemBootTime);

// Runs one database action (sql_action) on the library's one SQL connection.
// Only the storage thread calls it. Negative on failure.
int32_t doSqliteOperation(int32_t action, const android::Parcel* in, android::Parcel* out);

// Sets the one listener that receives the results of the accounter of the
// type (AccounterType), replacing an earlier one; the accounter is created if
// needed. 0, or -1 for a null listener or an unknown type.
int32_t registerLibraryListener(int32_t type, const android::sp<LibraryListener>& listener);

// Clears the accounter's listener. 0, or -1 for an unknown type.
int32_t unregisterLibraryListener(int32_t type);

// Hands one accounting action to its accounter: int32 AccounterType, int32
// AccounterAction, then the action's fields (AccounterTypes.h). Read from its
// start. The accounter's listener gets the results from inside this call, on
// the caller's thread. 0, or -1 on failure.
int32_t setDataAccounter(const android::Parcel& action);

// The display handler's effective energy accounting policy (1: levels in
// hundredths, 2: in ten-thousandths), which the brightness accounter scales
// its powers by from then on; until it is set, the configured policy holds.
// Set it again whenever the effective policy changes (a driver that refuses
// policy 2 leaves policy 1). 0, or -1 for a policy other than 1 or 2.
int32_t setDisplayEnergyPolicy(int32_t policy);

// Elements of the configuration file.
enum ConfigElement {
    CONFIG_POWER_PROFILE = 0,         // the library's own: refused by getXmlConfig
    CONFIG_ABNORMALITY_THRESHOLD = 1, // grouped
    CONFIG_COMPONENT_POLICY = 2,      // simple; components: ConfigPolicyComponent
    CONFIG_FILTER = 3,                // simple; 0 abnormality routine, 1 system handler
    CONFIG_SETTINGS = 4,              // simple; 0 energy compensation
    CONFIG_TEXT = 1000,               // text; 0 the configuration's version
};

// Components of CONFIG_COMPONENT_POLICY: each handler's data-source policy.
enum ConfigPolicyComponent {
    POLICY_DISPLAY = 0,
    POLICY_GPU = 1,
    POLICY_AUDIO = 2,
    POLICY_MODEM = 3,
    POLICY_DPM = 4,
    POLICY_CAMERA = 5,
};

// Reads one piece of the configuration file (elements 1 to 1000). Request:
// int32 component id, and for grouped elements int32 parameter id (-1 for
// all) and bool keyed. The reply is rewound to 0; a reply shorter than the
// caller needs counts as a failed lookup. 0, or -1 on failure.
int32_t getXmlConfig(int32_t element, const android::Parcel& request, android::Parcel* reply);

} // namespace kelvo
