#pragma once

#include <stdint.h>

#include <string>

namespace kelvo {

// What the daemon dropped, refused or capped. Every place that loses
// something on purpose counts it here, so a dump says why data is missing.
// Add a cause at the end of the list and give it a name in kHealthNames.
enum class Health : uint32_t {
    LogRecordMalformed,      // log-device record that failed to decode
    LogRecordUnknownTag,     // log-device record with no receiver for its tag
    LoggerMessageRefused,    // logger message an operator could not take
    BufferedEntryRefused,    // buffered-log entry with a bad length or magic
    StorageEntryRefused,     // storage entry parcel refused (short, null, bad kind)
    LibraryParcelRefused,    // accounting-library parcel refused
    ErrorLinesSuppressed,    // error lines over the daily cap (not stored)
    ErrorRowsDropped,        // error lines not stored for another reason
    FlushRowsAbandoned,      // buffered rows lost by a failed flush
    InsertsDeferred,         // flushes put off because the tables were not ready
    UploadFailures,          // upload events that could not be built or sent
    UploadRecordsRefused,    // single upload records refused
    MessagesDropped,         // queued messages dropped by a stopping thread
    MessagesRefused,         // messages refused by a thread that was not accepting
    FilesDeleted,            // database or backup files deleted by a clean
    BufferedClientRefused,   // buffered-log peer refused (untrusted uid, client cap)
    DeviceAnswersRefused,    // kernel device answers refused or capped (bad value, count, name)
    AccounterEventsDropped,  // oldest timeline events dropped by an accounter at its cap
    TimerRearmRetries,       // timers that could not be re-armed at once (retried later)
    ValuesSaturated,         // values clamped to their stored or sent width
    SettingsRefused,         // property values refused (not a number, out of range): default used
    AccounterStateCapped,    // accounter state grown from log text refused at its cap
    RoutineRequestsRefused,  // hourly-round requests refused (bad parcel, elector, candidate, round)
    CpuReportsRefused,       // per-process CPU reports dropped (bad length or count)
    CpuReportsLate,          // CPU passes run without their per-process report
    CpuEntriesCapped,        // processes or uids not followed: their maps were full
    CpuCounterLinesIgnored,  // frequency residency lines beyond the known steps
    ServiceRequestsRefused,  // binder requests refused or cut (caller, path, push message, query, reply size)
    AbnormalityInputRefused, // abnormality reports, records or rows refused or over their cap
    SystemReadingsRefused,   // wakeup-source or memory lines skipped, system state over its cap
    TrafficReadingsRefused,  // traffic lines skipped or refused, keys or lists over their cap
    BatteryReadingsKept,     // battery values that could not be read (the last good one kept)
    HandlerStateCapped,      // component handler state grown from messages refused or trimmed at its cap
    ModemRecordsRefused,     // modem records dropped (null, short) or not accounted (bad field, no idle count)
    ModemBlocksRefused,      // modem statistics blocks refused whole or ended early by a record, answers given up
    HidlEventsRefused,       // manager service events refused (type, size, memory) or not handed on
    ThermalInputRefused,     // thermal triggers refused (repeated, too near, over the day's limit) and thermal statistics refused or cut
    Count
};

class HealthCounters {
public:
    // Most named queue high-water marks kept; more names are counted in
    // "queue_slots_full" and not tracked.
    static constexpr int kMaxQueues = 48;

    // Relaxed atomic add: cheap enough for every hot path.
    static void add(Health which, uint64_t n = 1);
    static uint64_t get(Health which);
    static const char* name(Health which);

    // A slot for a named queue's high-water mark; the same name gets the
    // same slot. Returns -1 when every slot is taken.
    static int queueSlot(const char* name);
    // Raises the slot's mark to depth when it is higher.
    static void noteQueueDepth(int slot, uint64_t depth);
    static uint64_t queueHighWater(const char* name);

    // "name value" lines, causes first, then "queue_high_water.<name> <n>".
    static std::string format();

    // Sets every counter and mark back to 0 (tests).
    static void resetForTest();
};

}  // namespace kelvo
