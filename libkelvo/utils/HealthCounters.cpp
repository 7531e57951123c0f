#include "HealthCounters.h"

#include <string.h>

#include <atomic>
#include <mutex>

namespace kelvo {

namespace {

const char* const kHealthNames[] = {
        "log_records_malformed",     "log_records_unknown_tag", "logger_messages_refused",
        "buffered_entries_refused",  "storage_entries_refused", "library_parcels_refused",
        "error_lines_suppressed",    "error_rows_dropped",      "flush_rows_abandoned",
        "inserts_deferred",          "upload_failures",         "upload_records_refused",
        "messages_dropped",          "messages_refused",        "files_deleted",
        "buffered_client_refused",   "device_answers_refused",  "accounter_events_dropped",
        "timer_rearm_retries",       "values_saturated",        "settings_refused",
        "accounter_state_capped",    "routine_requests_refused", "cpu_reports_refused",
        "cpu_reports_late",          "cpu_entries_capped",      "cpu_counter_lines_ignored",
        "service_requests_refused",  "abnormality_input_refused", "system_readings_refused",
        "traffic_readings_refused",
        "battery_readings_kept",
        "handler_state_capped",
        "modem_records_refused",
        "modem_blocks_refused",
        "hidl_events_refused",
        "thermal_input_refused",
};
static_assert(sizeof(kHealthNames) / sizeof(kHealthNames[0]) ==
                      static_cast<size_t>(Health::Count),
              "every cause needs a name");

constexpr size_t kQueueNameLength = 32;

struct queue_slot {
    char name[kQueueNameLength];
    std::atomic<uint64_t> highWater{0};
};

std::atomic<uint64_t> gCounters[static_cast<size_t>(Health::Count)];
std::atomic<uint64_t> gQueueSlotsFull{0};
queue_slot gQueues[HealthCounters::kMaxQueues];
std::atomic<int> gQueueCount{0};
std::mutex gQueueLock;  // taken only to add a slot

int findQueueLocked(const char* name, int count) {
    for (int i = 0; i < count; ++i) {
        if (strncmp(gQueues[i].name, name, kQueueNameLength - 1) == 0) return i;
    }
    return -1;
}

}  // namespace

void HealthCounters::add(Health which, uint64_t n) {
    size_t index = static_cast<size_t>(which);
    if (index >= static_cast<size_t>(Health::Count)) return;
    gCounters[index].fetch_add(n, std::memory_order_relaxed);
}

uint64_t HealthCounters::get(Health which) {
    size_t index = static_cast<size_t>(which);
    if (index >= static_cast<size_t>(Health::Count)) return 0;
    return gCounters[index].load(std::memory_order_relaxed);
}

const char* HealthCounters::name(Health which) {
    size_t index = static_cast<size_t>(which);
    if (index >= static_cast<size_t>(Health::Count)) return "unknown";
    return kHealthNames[index];
}

int HealthCounters::queueSlot(const char* name) {
    if (name == nullptr) return -1;
    std::lock_guard<std::mutex> lock(gQueueLock);
    int count = gQueueCount.load(std::memory_order_relaxed);
    int slot = findQueueLocked(name, count);
    if (slot >= 0) return slot;
    if (count >= kMaxQueues) {
        gQueueSlotsFull.fetch_add(1, std::memory_order_relaxed);
        return -1;
    }
    strncpy(gQueues[count].name, name, kQueueNameLength - 1);
    gQueues[count].name[kQueueNameLength - 1] = '\0';
    gQueues[count].highWater.store(0, std::memory_order_relaxed);
    gQueueCount.store(count + 1, std::memory_order_release);
    return count;
}

void HealthCounters::noteQueueDepth(int slot, uint64_t depth) {
    if (slot < 0 || slot >= gQueueCount.load(std::memory_order_acquire)) return;
    std::atomic<uint64_t>& mark = gQueues[slot].highWater;
    uint64_t current = mark.load(std::memory_order_relaxed);
    while (depth > current &&
           !mark.compare_exchange_weak(current, depth, std::memory_order_relaxed)) {
    }
}

uint64_t HealthCounters::queueHighWater(const char* name) {
    std::lock_guard<std::mutex> lock(gQueueLock);
    int slot = findQueueLocked(name, gQueueCount.load(std::memory_order_relaxed));
    return slot < 0 ? 0 : gQueues[slot].highWater.load(std::memory_order_relaxed);
}

std::string HealthCounters::format() {
    std::string out;
    for (size_t i = 0; i < static_cast<size_t>(Health::Count); ++i) {
        out += kHealthNames[i];
        out += ' ';
        out += std::to_string(gCounters[i].load(std::memory_order_relaxed));
        out += '\n';
    }
    out += "queue_slots_full " +
           std::to_string(gQueueSlotsFull.load(std::memory_order_relaxed)) + "\n";
    std::lock_guard<std::mutex> lock(gQueueLock);
    int count = gQueueCount.load(std::memory_order_relaxed);
    for (int i = 0; i < count; ++i) {
        out += "queue_high_water.";
        out += gQueues[i].name;
        out += ' ';
        out += std::to_string(gQueues[i].highWater.load(std::memory_order_relaxed));
        out += '\n';
    }
    return out;
}

void HealthCounters::resetForTest() {
    for (auto& counter : gCounters) counter.store(0, std::memory_order_relaxed);
    gQueueSlotsFull.store(0, std::memory_order_relaxed);
    std::lock_guard<std::mutex> lock(gQueueLock);
    int count = gQueueCount.load(std::memory_order_relaxed);
    for (int i = 0; i < count; ++i) gQueues[i].highWater.store(0, std::memory_order_relaxed);
}

}  // namespace kelvo
