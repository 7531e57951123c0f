#include "FakeDriverReporter.h"

#include <cstring>

#include "utils/devices/KelvoDevice.h"

namespace kelvo {
namespace fake {

FakeDriverReporter::FakeDriverReporter(FakeKernelDriver& driver)
    : mDriver(driver), mShared(std::make_shared<Shared>()) {
    mShared->driver = &driver;
}

FakeDriverReporter::~FakeDriverReporter() {
    stop();
}

void FakeDriverReporter::start() {
    {
        std::lock_guard<std::mutex> guard(mShared->lock);
        mShared->active = true;
    }
    std::shared_ptr<Shared> shared = mShared;
    mDriver.setRequestListener(
            [shared](const FakeKernelDriver::Request& request) { shared->answer(request); });
}

void FakeDriverReporter::stop() {
    mDriver.setRequestListener(nullptr);
    std::lock_guard<std::mutex> guard(mShared->lock);
    mShared->active = false;
    mShared->client.close();
    mShared->connected = false;
}

void FakeDriverReporter::setBodyProvider(BodyProvider provider) {
    std::lock_guard<std::mutex> guard(mShared->lock);
    mShared->body = std::move(provider);
}

size_t FakeDriverReporter::sent() const {
    std::lock_guard<std::mutex> guard(mShared->lock);
    return mShared->sent;
}

size_t FakeDriverReporter::failed() const {
    std::lock_guard<std::mutex> guard(mShared->lock);
    return mShared->failed;
}

int32_t FakeDriverReporter::magicOf(uint32_t request) {
    switch (request) {
        case KelvoDevice::kRequestPidCpuTime:
            return MAGIC_PID_CPU_TIME;
        case KelvoDevice::kRequestKworkerInfo:
            return MAGIC_KWORKER;
        case KelvoDevice::kRequestUeventInfo:
            return MAGIC_UEVENT;
        case KelvoDevice::kRequestBinderStats:
            return MAGIC_BINDER_STATS;
        default:
            return -1;
    }
}

bool FakeDriverReporter::parseRequest(const FakeKernelDriver::Request& request, Report* report) {
    int32_t magic = magicOf(request.request);
    if (request.device != FakeKernelDriver::Device::Kelvo || magic < 0) {
        return false;
    }
    Report got{request.request, magic, 0, 0};
    const std::vector<uint8_t>& arg = request.argument;
    if (magic == MAGIC_KWORKER || magic == MAGIC_UEVENT) {
        if (arg.size() < sizeof(int64_t)) {
            return false;
        }
        memcpy(&got.time, arg.data(), sizeof(got.time));
    } else {
        dev_transmit_t transmit;
        if (arg.size() < sizeof(transmit)) {
            return false;
        }
        memcpy(&transmit, arg.data(), sizeof(transmit));
        got.time = transmit.timestamp;
        got.reason = transmit.reason;
    }
    *report = got;
    return true;
}

namespace {

template <typename T>
void append(std::string* out, T value) {
    out->append(reinterpret_cast<const char*>(&value), sizeof(value));
}

void appendText(std::string* out, const std::string& text, size_t field) {
    std::string cut = text.substr(0, field);
    cut.resize(field, '\0');
    *out += cut;
}

}  // namespace

std::string FakeDriverReporter::reportBody(const Report& report,
                                           const FakeKernelDriver::State& state) {
    std::string body;
    switch (report.magic) {
        case MAGIC_KWORKER:
            append<int32_t>(&body, static_cast<int32_t>(state.kworkers.size()));
            for (const FakeKernelDriver::Kworker& k : state.kworkers) {
                appendText(&body, k.symbol, 64);
                append<int64_t>(&body, k.count);
                append<int64_t>(&body, k.timeMs);
            }
            break;
        case MAGIC_UEVENT:
            append<int32_t>(&body, static_cast<int32_t>(state.uevents.size()));
            for (const FakeKernelDriver::Uevent& u : state.uevents) {
                appendText(&body, u.devpath, 128);
                append<int32_t>(&body, u.action);
                append<int32_t>(&body, u.count);
            }
            break;
        case MAGIC_BINDER_STATS:
            append<int32_t>(&body, static_cast<int32_t>(state.binderCalls.size()));
            for (const FakeKernelDriver::BinderCall& b : state.binderCalls) {
                append<int32_t>(&body, b.serviceUid);
                append<int32_t>(&body, b.servicePid);
                appendText(&body, b.service, 48);
                append<int32_t>(&body, b.clientUid);
                append<int32_t>(&body, b.clientPid);
                appendText(&body, b.client, 48);
                append<int32_t>(&body, b.count);
            }
            break;
        default:
            break;
    }
    return body;
}

void FakeDriverReporter::Shared::answer(const FakeKernelDriver::Request& request) {
    Report report;
    if (!parseRequest(request, &report)) {
        return;
    }
    std::lock_guard<std::mutex> guard(lock);
    if (!active) {
        return;
    }
    std::string data(sizeof(report.time) + sizeof(report.reason), '\0');
    memcpy(&data[0], &report.time, sizeof(report.time));
    memcpy(&data[sizeof(report.time)], &report.reason, sizeof(report.reason));
    if (body) {
        data += body(report);
    } else if (driver != nullptr) {
        // The listener runs outside the driver's lock.
        data += reportBody(report, driver->state());
    }
    if (sendLocked(report.magic, data)) {
        ++sent;
    } else {
        ++failed;
    }
}

bool FakeDriverReporter::Shared::sendLocked(int32_t magic, const std::string& data) {
    // A connection the daemon closed (it restarted, or refused the name
    // before its receivers existed) is made again before the entry goes.
    for (int attempt = 0; attempt < 2; ++attempt) {
        if (connected && client.waitClosed(0)) {
            connected = false;
        }
        if (!connected) {
            connected = client.connect(kClientName) == 0;
        }
        if (connected && client.send(magic, data.data(), data.size()) == 0) {
            return true;
        }
        client.close();
        connected = false;
    }
    return false;
}

} // namespace fake
} // namespace kelvo
