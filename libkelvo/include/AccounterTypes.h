#pragma once

#include <stdint.h>

namespace kelvo {

// The accounters of the library, one per component; the first int32 of every
// action parcel.
enum AccounterType : int32_t {
    ACCOUNTER_NONE = -1,
    ACCOUNTER_BRIGHTNESS = 0,
    ACCOUNTER_GNSS = 1,
    ACCOUNTER_FLASHLIGHT = 2,
    ACCOUNTER_CPU = 3,
    ACCOUNTER_CAMERA = 4,
    ACCOUNTER_BLUETOOTH = 5,
    ACCOUNTER_GPU = 6,
    ACCOUNTER_WIFI = 7,
    ACCOUNTER_SENSOR = 8,
    ACCOUNTER_AUDIO = 9,
    ACCOUNTER_MODEM = 10,
    ACCOUNTER_DPM = 11,
    ACCOUNTER_TYPE_COUNT = 12,
};

// The second int32 of an action parcel. The fields that follow it:
//   FOREGROUND       int64 time, String8 foreground name
//   SCREEN_STATE     int64 time, bool screen on
//   CHARGER_ONLINE   int64 time, bool charger online
//   BALANCE          int32 reason; BALANCE_AT: int64 time;
//                    BALANCE_SPAN: int64 end, int64 new start
//   ACTIVATE         [allocator key fields], int64 time, String8 element
//   DEACTIVATE       [allocator key fields], int64 time, String8 element
//   DEACTIVATE_ALL   int64 time
//   SET_VALUE        [allocator key fields], the accounter's own value fields
enum AccounterAction : int32_t {
    ACTION_FOREGROUND = 0,
    ACTION_SCREEN_STATE = 1,
    ACTION_CHARGER_ONLINE = 2,
    ACTION_BALANCE = 3,
    ACTION_ACTIVATE = 4,
    ACTION_DEACTIVATE = 5,
    ACTION_DEACTIVATE_ALL = 6,
    ACTION_SET_VALUE = 7,
};

// Reasons of a BALANCE action.
enum BalanceReason : int32_t {
    BALANCE_AT = 0,   // one time: the end and the new start
    BALANCE_SPAN = 1, // an end and a new start; the time between stays unaccounted
};

// Events of LibraryListener::handleLibraryEvent.
enum LibraryEvent : int32_t {
    LIBRARY_EVENT_APPLICATION = 0, // element (application) records
    LIBRARY_EVENT_COMPONENT = 1,   // the component record
};

// Wi-Fi subtypes: the int32 after the action code of every Wi-Fi action.
enum WifiSubtype : int32_t {
    WIFI_INTERFACE_TRAFFIC = 0, // SetValue: int64 tx packets, int64 rx packets
    WIFI_PACKAGE_TRAFFIC = 1,   // SetValue: a traffic batch
    WIFI_HOTSPOT = 2,           // Activate / Deactivate of the hotspot
    WIFI_SCANS = 3,             // SetValue: a scan batch
    WIFI_BAND = 4,              // SetValue: int32 band code
    WIFI_ACTIVITY = 5,          // SetValue: int32 4, four int64 level times
    WIFI_CHARGER = 6,           // SetValue: bool charger online
    WIFI_SUBTYPE_MAX = WIFI_CHARGER,
};

// Modem subtypes: the int32 after the SetValue code of every modem action.
//   0..2   int32 module; module 5: int32 modulation (0 or 1), int32 base
//          usage; int32 level count (0..9), the level times (int32 ms,
//          level 0 first)
//   3      int64 tx packets, int64 rx packets of the interface: the data
//          energy of the residencies so far is split by the next batches
//   4      a traffic batch: int64 time, int32 count, per application String8
//          name, int32 foreground flag, int64 tx packets, rx packets, tx
//          bytes, rx bytes
//   5      bool charger online
enum ModemSubtype : int32_t {
    MODEM_VOICE_RESIDENCY = 0,
    MODEM_IDLE_RESIDENCY = 1,
    MODEM_DATA_RESIDENCY = 2,
    MODEM_INTERFACE_TRAFFIC = 3,
    MODEM_PACKAGE_TRAFFIC = 4,
    MODEM_CHARGER = 5,
};

} // namespace kelvo
