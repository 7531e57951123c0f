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

} // namespace kelvo
