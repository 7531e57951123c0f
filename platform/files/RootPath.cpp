#include "kelvo/RootPath.h"

#include <cstdlib>
#include <mutex>

namespace kelvo {

namespace {

struct RootState {
    std::mutex lock;
    std::string root;
    bool loaded = false;
};

// Never destroyed: threads may resolve paths while the process exits.
RootState& state() {
    static RootState* s = new RootState();
    return *s;
}

std::string normalise(const char* root) {
    std::string r = root != nullptr ? root : "";
    while (!r.empty() && r.back() == '/') {
        r.pop_back();
    }
    return r;
}

} // namespace

std::string RootPath::root() {
    RootState& s = state();
    std::lock_guard<std::mutex> guard(s.lock);
    if (!s.loaded) {
        s.root = normalise(getenv("KELVO_ROOT"));
        s.loaded = true;
    }
    return s.root;
}

void RootPath::setRoot(const char* root) {
    RootState& s = state();
    std::lock_guard<std::mutex> guard(s.lock);
    s.root = normalise(root);
    s.loaded = true;
}

std::string RootPath::resolve(const char* path) {
    if (path == nullptr) {
        return std::string();
    }
    if (path[0] != '/') {
        return path;
    }
    return root() + path;
}

} // namespace kelvo
