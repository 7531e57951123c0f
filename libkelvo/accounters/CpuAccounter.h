#pragma once

#include <stdint.h>

#include <map>
#include <memory>
#include <set>
#include <vector>

#include <binder/Parcel.h>
#include <utils/String8.h>

#include "accounters/DataAccounter.h"

namespace kelvo {

// Turns the CPU handler's counters into energy: per cluster the core count,
// the idle time and the time at each frequency step; per application its CPU
// time, which the one WeightAllocator uses to split the component energy.
//
// SetValue fields (no allocator key fields): int64 end T, int32 mode (0: the
// pass was triggered by a foreground change at T), bool has data; with data
// uint32 cluster count, then per cluster uint32 id, uint32 core count, int32
// idle time, int32 total step time, uint32 step count and that many int32
// step times; then the application batch of WeightAllocator.
//
// A foreground change at T records the state that held up to T, so that the
// mode-0 pass ending at T is charged to that state rather than the new one.
class CpuAccounter : public DataAccounter {
public:
    // Most clusters and steps a pass may carry; more is a refused parcel.
    static constexpr uint32_t kMaxClusters = 32;
    static constexpr uint32_t kMaxSteps = 64;
    // Most mismatched shapes logged; later ones are accounted silently.
    static constexpr size_t kMaxLoggedShapes = 16;

    // Reads the CPU power profile; the first pass starts at systemBootTime.
    explicit CpuAccounter(int64_t systemBootTime);

    android::String8 getForeground() const override;
    bool getScreenState() const override;
    int32_t sendReply(int32_t event, const android::Parcel& reply) override;

protected:
    std::unique_ptr<BaseAllocator> createAllocators(int32_t key) override;
    int32_t getPowerValue(int32_t key, const android::Parcel& action,
                          android::Parcel& power) override;
    int32_t onActionForeground(const android::Parcel& action) override;
    int32_t onActionBalance(const android::Parcel& action) override;

private:
    struct polling_event {
        bool screenOn;
        android::String8 foreground;
    };
    struct cluster_data {
        uint32_t cores = 0;
        int32_t idle = 0;
        int32_t total = 0;
        std::vector<int32_t> steps;
    };

    void loadProfile();
    // Reads the component data of one pass whole; -1 when a count is out of
    // bounds or the parcel ends first.
    int32_t readClusters(const android::Parcel& action, std::vector<cluster_data>* clusters);
    // Writes int32 usage and int64 energy of the pass.
    void componentAccounting(const std::vector<cluster_data>& clusters, android::Parcel& power);
    // The configured power of a step; a pass with more clusters or steps than
    // the profile uses the last configured ones.
    int64_t stepPower(size_t cluster, size_t step) const;
    void noteShape(const std::vector<cluster_data>& clusters);
    // Drops the event of the mode-0 pass that just ended.
    void releaseEvent();
    // Drops the events no pass can use any more.
    void pruneEvents();

    int64_t mLastAccountTime;
    int32_t mAccountMode;
    int64_t mIdlePower;
    // Per cluster, the power of each frequency step; never changed by a pass.
    std::vector<std::vector<int32_t>> mClusterPowers;
    // At most this many foreground changes wait for their pass.
    static constexpr size_t kMaxEvents = 1024;
    std::map<int64_t, polling_event> mEvents;
    // Pass shapes (step count per cluster) that differed from the profile
    // and were logged.
    std::set<std::vector<uint32_t>> mLoggedShapes;
};

} // namespace kelvo
