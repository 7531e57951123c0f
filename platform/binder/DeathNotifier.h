#pragma once

// The death thread ("binder:death"): watches one connection per peer that
// has death recipients, and tells the recipients of dead peers, on this
// thread only.

#include <memory>
#include <mutex>
#include <thread>
#include <vector>

namespace kelvo {

class BinderPeer;

class DeathNotifier {
public:
    explicit DeathNotifier(uint32_t generation);
    DeathNotifier(const DeathNotifier&) = delete;
    DeathNotifier& operator=(const DeathNotifier&) = delete;

    // Watches fd (taken) for the peer's death.
    void watch(const std::shared_ptr<BinderPeer>& peer, int fd);
    // Has the peer's recipients told.
    void postDeath(const std::shared_ptr<BinderPeer>& peer);
    // A watched peer went away: its connection can close.
    void wake();

private:
    struct Watch {
        std::weak_ptr<BinderPeer> peer;
        int fd;
    };

    void startLocked();
    void run();
    static void tell(const std::shared_ptr<BinderPeer>& peer);

    const uint32_t mGeneration;
    const int mWakeFd;
    std::mutex mLock;
    bool mStarted;
    std::vector<Watch> mWatches;
    std::vector<std::shared_ptr<BinderPeer>> mDead;
};

} // namespace kelvo
