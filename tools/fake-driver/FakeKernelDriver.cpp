#include "FakeKernelDriver.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "kelvo/KernelDevice.h"
#include "kelvo/RootPath.h"
#include "utils/devices/DpmDevice.h"
#include "utils/devices/DpmIpNames.h"
#include "utils/devices/KelvoDevice.h"

namespace kelvo {
namespace fake {

namespace {

constexpr size_t kDdrNameBytes = 64;

int listenAt(const std::string& path) {
    struct sockaddr_un addr;
    if (path.size() >= sizeof(addr.sun_path)) {
        return -1;
    }
    std::string parent = path.substr(0, path.find_last_of('/'));
    mkdir(parent.c_str(), 0755);
    unlink(path.c_str());
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return -1;
    }
    if (bind(fd, reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr)) != 0 ||
        listen(fd, 16) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// Reads exactly size bytes, waiting at most the protocol's time-out for each
// part; false on a time-out, an error or a hang-up.
bool readExactly(int fd, uint8_t* data, size_t size, int stopFd) {
    while (size > 0) {
        struct pollfd p[2] = {{fd, POLLIN, 0}, {stopFd, POLLIN, 0}};
        int n = poll(p, 2, KernelDevice::kSocketTimeoutMs);
        if (n <= 0 || (p[1].revents & POLLIN) != 0) {
            if (n < 0 && errno == EINTR) {
                continue;
            }
            return false;
        }
        ssize_t got = recv(fd, data, size, MSG_DONTWAIT);
        if (got < 0 && (errno == EINTR || errno == EAGAIN)) {
            continue;
        }
        if (got <= 0) {
            return false;
        }
        data += got;
        size -= static_cast<size_t>(got);
    }
    return true;
}

bool writeAll(int fd, const uint8_t* data, size_t size) {
    while (size > 0) {
        ssize_t n = send(fd, data, size, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

// Copies what fits of the bytes into the argument at the offset.
void putBytes(std::vector<uint8_t>* argument, size_t offset, const void* bytes, size_t size) {
    if (offset >= argument->size()) {
        return;
    }
    memcpy(argument->data() + offset, bytes, std::min(size, argument->size() - offset));
}

void putInt32(std::vector<uint8_t>* argument, size_t offset, int32_t value) {
    putBytes(argument, offset, &value, sizeof(value));
}

int32_t getInt32(const std::vector<uint8_t>& argument, size_t offset) {
    int32_t value = 0;
    if (offset + sizeof(value) <= argument.size()) {
        memcpy(&value, argument.data() + offset, sizeof(value));
    }
    return value;
}

bool isReportRequest(FakeKernelDriver::Device device, uint32_t request) {
    return device == FakeKernelDriver::Device::Kelvo &&
           (request == KelvoDevice::kRequestPidCpuTime ||
            request == KelvoDevice::kRequestKworkerInfo ||
            request == KelvoDevice::kRequestUeventInfo ||
            request == KelvoDevice::kRequestBinderStats);
}

} // namespace

FakeKernelDriver::~FakeKernelDriver() {
    stop();
}

bool FakeKernelDriver::start() {
    stop();
    mPaths[0] = RootPath::resolve(KelvoDevice::kPath);
    mPaths[1] = RootPath::resolve(DpmDevice::kPath);
    if (pipe2(mStopPipe, O_CLOEXEC) != 0) {
        return false;
    }
    for (int i = 0; i < 2; ++i) {
        mListenFds[i] = listenAt(mPaths[i]);
        if (mListenFds[i] < 0) {
            stop();
            return false;
        }
    }
    mThread = std::thread([this] { serve(); });
    return true;
}

void FakeKernelDriver::stop() {
    if (mStopPipe[1] >= 0) {
        char byte = 1;
        ssize_t ignored = write(mStopPipe[1], &byte, 1);
        (void)ignored;
    }
    if (mThread.joinable()) {
        mThread.join();
    }
    for (int i = 0; i < 2; ++i) {
        if (mListenFds[i] >= 0) {
            close(mListenFds[i]);
            unlink(mPaths[i].c_str());
            mListenFds[i] = -1;
        }
        if (mStopPipe[i] >= 0) {
            close(mStopPipe[i]);
            mStopPipe[i] = -1;
        }
    }
}

void FakeKernelDriver::update(const std::function<void(State&)>& change) {
    std::lock_guard<std::mutex> guard(mLock);
    change(mState);
}

FakeKernelDriver::State FakeKernelDriver::state() const {
    std::lock_guard<std::mutex> guard(mLock);
    return mState;
}

void FakeKernelDriver::failRequest(Device device, uint32_t request, int error, bool hangUp) {
    std::lock_guard<std::mutex> guard(mLock);
    mFailures[{device, request}] = Answer{-1, error, hangUp};
}

void FakeKernelDriver::clearFailures() {
    std::lock_guard<std::mutex> guard(mLock);
    mFailures.clear();
}

std::vector<FakeKernelDriver::Request> FakeKernelDriver::requests() const {
    std::lock_guard<std::mutex> guard(mLock);
    return mRequests;
}

void FakeKernelDriver::clearRequests() {
    std::lock_guard<std::mutex> guard(mLock);
    mRequests.clear();
}

void FakeKernelDriver::setRequestListener(RequestListener listener) {
    std::lock_guard<std::mutex> guard(mLock);
    mListener = std::move(listener);
}

void FakeKernelDriver::setBrightnessSource(BrightnessSource source) {
    std::lock_guard<std::mutex> guard(mLock);
    mBrightnessSource = std::move(source);
}

void FakeKernelDriver::serve() {
    for (;;) {
        struct pollfd p[3] = {{mListenFds[0], POLLIN, 0},
                              {mListenFds[1], POLLIN, 0},
                              {mStopPipe[0], POLLIN, 0}};
        int n = poll(p, 3, -1);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 || (p[2].revents & POLLIN) != 0) {
            return;
        }
        for (int i = 0; i < 2; ++i) {
            if ((p[i].revents & POLLIN) == 0) {
                continue;
            }
            int fd = accept4(mListenFds[i], nullptr, nullptr, SOCK_CLOEXEC);
            if (fd >= 0) {
                serveConnection(fd, i == 0 ? Device::Kelvo : Device::Dpm);
                close(fd);
            }
        }
    }
}

void FakeKernelDriver::serveConnection(int fd, Device device) {
    for (;;) {
        uint8_t header[8];
        if (!readExactly(fd, header, sizeof(header), mStopPipe[0])) {
            return;
        }
        uint32_t request = KernelDevice::getUint32(header);
        uint32_t size = KernelDevice::getUint32(header + 4);
        if (size > KernelDevice::kMaxArgumentBytes) {
            return;
        }
        Request got{device, request, std::vector<uint8_t>(size)};
        if (!readExactly(fd, got.argument.data(), size, mStopPipe[0])) {
            return;
        }
        std::vector<uint8_t> argument = got.argument;
        Answer reply;
        RequestListener listener;
        {
            std::lock_guard<std::mutex> guard(mLock);
            mRequests.push_back(got);
            auto failure = mFailures.find({device, request});
            if (failure != mFailures.end()) {
                reply = failure->second;
            } else {
                reply = answer(device, request, &argument);
                if (isReportRequest(device, request)) {
                    listener = mListener;
                }
            }
        }
        if (reply.hangUp) {
            return;
        }
        uint8_t head[8];
        KernelDevice::putUint32(head, static_cast<uint32_t>(reply.result));
        KernelDevice::putUint32(head + 4, static_cast<uint32_t>(reply.error));
        if (!writeAll(fd, head, sizeof(head)) || !writeAll(fd, argument.data(), argument.size())) {
            return;
        }
        if (listener) {
            listener(got);
        }
    }
}

void FakeKernelDriver::addGpuResidency(int64_t frequency, int64_t busyUs, int64_t idleUs) {
    std::lock_guard<std::mutex> guard(mLock);
    for (GpuStep& step : mState.gpuSteps) {
        if (step.frequency == frequency) {
            step.busyUs += busyUs;
            step.idleUs += idleUs;
            return;
        }
    }
    mState.gpuSteps.push_back({frequency, busyUs, idleUs});
}

bool FakeKernelDriver::useIpNames(int32_t policy) {
    std::vector<DpmIp> ips;
    if (policy == 1) {
        for (const dpm_ip_name& ip : kDpmPolicy1Ips) {
            ips.push_back({ip.name, {}});
        }
    } else if (policy == 2) {
        for (const dpm_ip_name& ip : kDpmPolicy2Ips) {
            ips.push_back({ip.name, {}});
        }
    } else {
        return false;
    }
    std::lock_guard<std::mutex> guard(mLock);
    mState.ips = std::move(ips);
    return true;
}

bool FakeKernelDriver::addIpTime(const std::string& name, DpmTime which, int64_t ms) {
    std::lock_guard<std::mutex> guard(mLock);
    for (DpmIp& ip : mState.ips) {
        if (ip.name == name) {
            ip.times[which] += ms;
            return true;
        }
    }
    return false;
}

bool FakeKernelDriver::addDdr(int32_t level, int64_t seconds, int64_t flux) {
    std::lock_guard<std::mutex> guard(mLock);
    for (size_t i = 0; i < 2; ++i) {
        if (level < 0 || static_cast<size_t>(level) >= mState.ddrValues[i].size()) {
            return false;
        }
    }
    for (size_t i = 0; i < 2; ++i) {
        mState.ddrValues[i][level] += mState.ddrNames[i] == "DDR_FREQ_TIME" ? seconds : flux;
    }
    return true;
}

FakeKernelDriver::Answer FakeKernelDriver::answer(Device device, uint32_t request,
                                                  std::vector<uint8_t>* argument) {
    return device == Device::Kelvo ? answerKelvo(request, argument)
                                   : answerDpm(request, argument);
}

FakeKernelDriver::Answer FakeKernelDriver::answerKelvo(uint32_t request,
                                                       std::vector<uint8_t>* argument) {
    switch (request) {
        case KelvoDevice::kSetGpuEnable:
        case KelvoDevice::kSetLogStatsEnable:
        case KelvoDevice::kSetBrightnessInfoEnable:
        case KelvoDevice::kEnablePidCpuTime:
        case KelvoDevice::kSetBinderStatsEnable:
            mState.flags[request] = !argument->empty() && (*argument)[0] != 0;
            return Answer();
        case KelvoDevice::kGetGpuInfo: {
            int32_t count = mState.gpuCount.value_or(static_cast<int32_t>(mState.gpuSteps.size()));
            putInt32(argument, 0, count);
            for (size_t i = 0; i < mState.gpuSteps.size(); ++i) {
                const GpuStep& s = mState.gpuSteps[i];
                int64_t fields[3] = {s.frequency, s.busyUs, s.idleUs};
                putBytes(argument, 4 + i * sizeof(fields), fields, sizeof(fields));
            }
            mState.gpuSteps.clear();
            return Answer();
        }
        case KelvoDevice::kGetProcessName: {
            auto name = mState.processNames.find(getInt32(*argument, 4));
            if (name == mState.processNames.end()) {
                return Answer{-1, ESRCH, false};
            }
            size_t field = offsetof(process_name_t, processName);
            std::vector<uint8_t> cleared(sizeof(process_name_t::processName), 0);
            putBytes(argument, field, cleared.data(), cleared.size());
            putBytes(argument, field, name->second.data(),
                     std::min(name->second.size(), cleared.size()));
            return Answer();
        }
        case KelvoDevice::kGetBrightnessInfo: {
            uint32_t value = mState.brightness;
            if (!mState.spanBrightness.empty()) {
                value = mState.spanBrightness.front();
                mState.spanBrightness.pop_front();
            } else if (mBrightnessSource) {
                value = mBrightnessSource();
            }
            putBytes(argument, 0, &value, sizeof(value));
            return Answer();
        }
        case KelvoDevice::kRequestPidCpuTime:
        case KelvoDevice::kRequestKworkerInfo:
        case KelvoDevice::kRequestUeventInfo:
        case KelvoDevice::kRequestBinderStats:
            return Answer();
        default:
            return Answer{-1, ENOTTY, false};
    }
}

FakeKernelDriver::Answer FakeKernelDriver::answerDpm(uint32_t request,
                                                     std::vector<uint8_t>* argument) {
    switch (request) {
        case DpmDevice::kGetVersion:
            putInt32(argument, 0, mState.version);
            return Answer();
        case DpmDevice::kSetEnable:
            // Monitoring starts (or stops) from zero.
            mState.enable = getInt32(*argument, 0);
            for (DpmIp& ip : mState.ips) {
                ip.times.fill(0);
            }
            return Answer();
        case DpmDevice::kSetPeriod:
            mState.period = getInt32(*argument, 0);
            return Answer();
        case DpmDevice::kGetPeriod: {
            int32_t which = getInt32(*argument, 0);
            putInt32(argument, 0,
                     which == 0 ? mState.minPeriod : which == 1 ? mState.maxPeriod : mState.period);
            return Answer();
        }
        case DpmDevice::kGetIpCount:
            putInt32(argument, 0,
                     mState.ipCount.value_or(static_cast<int32_t>(mState.ips.size())));
            return Answer();
        case DpmDevice::kGetIpData: {
            // As many records as the caller's capacity and the buffer it
            // sent both hold.
            constexpr size_t kHead = sizeof(dpm_ip_header_t);
            constexpr size_t kRecord = sizeof(dpm_ip_record_t);
            size_t room = argument->size() < kHead ? 0 : (argument->size() - kHead) / kRecord;
            size_t capacity = static_cast<size_t>(std::max(getInt32(*argument, 0), 0));
            size_t written = std::min({mState.ips.size(), capacity, room});
            putInt32(argument, 0, mState.ipCount.value_or(static_cast<int32_t>(written)));
            for (size_t i = 0; i < written; ++i) {
                dpm_ip_fields_t fields;
                memset(&fields, 0, sizeof(fields));
                memcpy(fields.name, mState.ips[i].name.data(),
                       std::min(mState.ips[i].name.size(), sizeof(fields.name)));
                fields.offTime = mState.ips[i].times[DPM_OFF];
                fields.busyTime = mState.ips[i].times[DPM_BUSY];
                fields.busyTimeLowVoltage = mState.ips[i].times[DPM_BUSY_LOW_VOLTAGE];
                fields.idleTime = mState.ips[i].times[DPM_IDLE];
                putBytes(argument, kHead + i * kRecord, &fields, sizeof(fields));
            }
            return Answer();
        }
        case DpmDevice::kGetDdrFreqCount:
            putInt32(argument, 0,
                     mState.ddrCount.value_or(static_cast<int32_t>(mState.ddrValues[0].size())));
            return Answer();
        case DpmDevice::kGetDdrData: {
            size_t steps = mState.ddrValues[0].size();
            size_t blockSize = kDdrNameBytes + steps * sizeof(int64_t);
            for (size_t i = 0; i < 2; ++i) {
                std::vector<uint8_t> block(blockSize, 0);
                memcpy(block.data(), mState.ddrNames[i].data(),
                       std::min(mState.ddrNames[i].size(), kDdrNameBytes));
                for (size_t s = 0; s < steps && s < mState.ddrValues[i].size(); ++s) {
                    memcpy(block.data() + kDdrNameBytes + s * sizeof(int64_t),
                           &mState.ddrValues[i][s], sizeof(int64_t));
                }
                putBytes(argument, i * blockSize, block.data(), block.size());
            }
            return Answer();
        }
        default:
            return Answer{-1, ENOTTY, false};
    }
}

} // namespace fake
} // namespace kelvo
