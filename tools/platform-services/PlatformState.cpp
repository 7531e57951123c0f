#include "PlatformState.h"

namespace kelvo {

void PlatformState::setPackages(int32_t uid, const std::vector<std::string>& packages) {
    std::lock_guard<std::mutex> guard(mLock);
    mPackages[uid] = packages;
}

std::vector<std::string> PlatformState::packages(int32_t uid) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mPackages.find(uid);
    return it != mPackages.end() ? it->second : std::vector<std::string>();
}

void PlatformState::setPackageVersion(const std::string& name, int32_t code,
                                      const std::string& version) {
    std::lock_guard<std::mutex> guard(mLock);
    mVersions[name] = {code, version};
}

bool PlatformState::packageVersion(const std::string& name, int32_t& code, std::string& version) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mVersions.find(name);
    if (it == mVersions.end()) {
        return false;
    }
    code = it->second.first;
    version = it->second.second;
    return true;
}

void PlatformState::setProcesses(const std::vector<Process>& processes) {
    std::lock_guard<std::mutex> guard(mLock);
    mProcesses = processes;
}

std::vector<PlatformState::Process> PlatformState::processes() {
    std::lock_guard<std::mutex> guard(mLock);
    return mProcesses;
}

void PlatformState::setBattery(const Battery& battery) {
    std::function<void()> observer;
    {
        std::lock_guard<std::mutex> guard(mLock);
        mBattery = battery;
        observer = mBatteryObserver;
    }
    if (observer) {
        observer();
    }
}

PlatformState::Battery PlatformState::battery() {
    std::lock_guard<std::mutex> guard(mLock);
    return mBattery;
}

void PlatformState::setWakelocks(const std::vector<std::string>& records) {
    std::lock_guard<std::mutex> guard(mLock);
    mWakelocks = records;
}

std::vector<std::string> PlatformState::wakelocks() {
    std::lock_guard<std::mutex> guard(mLock);
    return mWakelocks;
}

void PlatformState::noteReset() {
    std::lock_guard<std::mutex> guard(mLock);
    ++mResets;
}

int32_t PlatformState::resetCount() {
    std::lock_guard<std::mutex> guard(mLock);
    return mResets;
}

void PlatformState::noteTrace(const std::string& path) {
    std::lock_guard<std::mutex> guard(mLock);
    mTraces.push_back(path);
}

std::vector<std::string> PlatformState::traces() {
    std::lock_guard<std::mutex> guard(mLock);
    return mTraces;
}

void PlatformState::grant(const std::string& permission, int32_t uid, bool granted) {
    std::lock_guard<std::mutex> guard(mLock);
    mGrants[{permission, uid}] = granted;
}

bool PlatformState::granted(const std::string& permission, int32_t uid) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mGrants.find({permission, uid});
    return it != mGrants.end() && it->second;
}

void PlatformState::setAudioParameter(const std::string& key, const std::string& value) {
    std::lock_guard<std::mutex> guard(mLock);
    mAudioParameters[key] = value;
}

std::string PlatformState::audioParameter(const std::string& key) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mAudioParameters.find(key);
    return it == mAudioParameters.end() ? std::string() : it->second;
}

void PlatformState::setDelayMs(const std::string& service, int32_t ms) {
    std::lock_guard<std::mutex> guard(mLock);
    mDelays[service] = ms;
}

int32_t PlatformState::delayMs(const std::string& service) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mDelays.find(service);
    return it != mDelays.end() ? it->second : 0;
}

void PlatformState::noteCall(const std::string& service, uint32_t code) {
    std::lock_guard<std::mutex> guard(mLock);
    ++mCalls[{service, code}];
}

int32_t PlatformState::calls(const std::string& service, uint32_t code) {
    std::lock_guard<std::mutex> guard(mLock);
    auto it = mCalls.find({service, code});
    return it != mCalls.end() ? it->second : 0;
}

void PlatformState::setBatteryObserver(std::function<void()> observer) {
    std::lock_guard<std::mutex> guard(mLock);
    mBatteryObserver = std::move(observer);
}

} // namespace kelvo
