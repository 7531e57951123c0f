#include "DeathNotifier.h"

#include <binder/BpBinder.h>
#include <errno.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include "BinderHost.h"
#include "BinderPeer.h"

namespace kelvo {

DeathNotifier::DeathNotifier(uint32_t generation)
    : mGeneration(generation),
      mWakeFd(BinderHost::adoptFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK))),
      mStarted(false) {}

void DeathNotifier::startLocked() {
    if (!mStarted) {
        mStarted = true;
        std::thread([this] { run(); }).detach();
    }
}

void DeathNotifier::watch(const std::shared_ptr<BinderPeer>& peer, int fd) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        mWatches.push_back({peer, fd});
        startLocked();
    }
    wake();
}

void DeathNotifier::postDeath(const std::shared_ptr<BinderPeer>& peer) {
    {
        std::lock_guard<std::mutex> guard(mLock);
        mDead.push_back(peer);
        startLocked();
    }
    wake();
}

void DeathNotifier::wake() {
    uint64_t one = 1;
    ssize_t ignored = write(mWakeFd, &one, sizeof(one));
    (void)ignored;
}

void DeathNotifier::tell(const std::shared_ptr<BinderPeer>& peer) {
    for (const android::sp<android::BpBinder>& proxy : peer->proxies()) {
        proxy->sendObituary();
    }
}

void DeathNotifier::run() {
    prctl(PR_SET_NAME, "binder:death", 0, 0, 0);
    std::vector<struct pollfd> pfds;
    std::vector<std::weak_ptr<BinderPeer>> watched;
    for (;;) {
        std::vector<std::shared_ptr<BinderPeer>> dead;
        {
            std::lock_guard<std::mutex> guard(mLock);
            dead.swap(mDead);
            // Dead or forgotten peers need no watching any more.
            for (auto it = mWatches.begin(); it != mWatches.end();) {
                std::shared_ptr<BinderPeer> peer = it->peer.lock();
                if (peer == nullptr || !peer->isAlive()) {
                    BinderHost::closeFd(it->fd, mGeneration);
                    it = mWatches.erase(it);
                } else {
                    ++it;
                }
            }
            pfds.assign(1, {mWakeFd, POLLIN, 0});
            watched.clear();
            for (const Watch& w : mWatches) {
                pfds.push_back({w.fd, POLLIN | POLLRDHUP, 0});
                watched.push_back(w.peer);
            }
        }
        for (const std::shared_ptr<BinderPeer>& peer : dead) {
            tell(peer);
        }
        if (!dead.empty()) {
            continue;  // look at the list again before waiting
        }
        dead.clear();
        int n = poll(pfds.data(), pfds.size(), -1);
        if (n < 0) {
            continue;
        }
        if (pfds[0].revents != 0) {
            uint64_t count = 0;
            ssize_t ignored = read(mWakeFd, &count, sizeof(count));
            (void)ignored;
        }
        for (size_t i = 1; i < pfds.size(); ++i) {
            if (pfds[i].revents == 0) {
                continue;
            }
            char byte;
            ssize_t got = recv(pfds[i].fd, &byte, 1, MSG_DONTWAIT);
            if (got > 0 || (got < 0 && (errno == EAGAIN || errno == EINTR))) {
                continue;  // nothing is ever sent on a watch: ignore it
            }
            // Closed or reset: the server is gone.
            if (std::shared_ptr<BinderPeer> peer = watched[i - 1].lock()) {
                peer->markDead();
            }
        }
    }
}

} // namespace kelvo
