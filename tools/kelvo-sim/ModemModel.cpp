#include "ModemModel.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <numeric>
#include <sstream>

namespace kelvo {
namespace sim {

namespace {

constexpr int64_t kMaxResidencyMs = 3600 * 1000;
constexpr int64_t kMaxDelayMs = 600 * 1000;
// Record sizes (bytes) of the modules the model reports.
constexpr uint32_t kLtePhyFields = 13;
constexpr uint32_t kLteRrcFields = 19;
constexpr uint32_t kWcdmaPhyFields = 34;
constexpr uint32_t kDriverFields = 72;

const char* const kIdleNames[] = {"weak", "mid", "strong"};

int64_t monotonicMs() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

// "12", "12.5" or "0.125": seconds with up to three decimals, in ms.
bool parseSeconds(const std::string& text, int64_t low, int64_t high, int64_t* ms) {
    size_t dot = text.find('.');
    std::string whole = text.substr(0, dot);
    std::string fraction = dot == std::string::npos ? "" : text.substr(dot + 1);
    if (whole.empty() || whole.size() > 6 ||
        whole.find_first_not_of("0123456789") != std::string::npos ||
        (dot != std::string::npos && (fraction.empty() || fraction.size() > 3)) ||
        fraction.find_first_not_of("0123456789") != std::string::npos) {
        return false;
    }
    fraction.resize(3, '0');
    *ms = atoll(whole.c_str()) * 1000 + atoll(fraction.c_str());
    return *ms >= low && *ms <= high;
}

bool parseLevel(const std::string& text, int32_t count, int32_t* level) {
    if (text.size() != 1 || text[0] < '0' || text[0] >= '0' + count) {
        return false;
    }
    *level = text[0] - '0';
    return true;
}

int32_t idleLevel(const std::string& text) {
    for (int32_t i = 0; i < ModemModel::kIdleLevels; ++i) {
        if (text == kIdleNames[i]) return i;
    }
    return -1;
}

void put32(std::string* out, uint32_t value) {
    out->append(reinterpret_cast<const char*>(&value), sizeof(value));
}

// One record: its header, then its counters.
void putRecord(std::string* out, uint32_t sim, uint32_t module, const std::vector<uint32_t>& f) {
    put32(out, static_cast<uint32_t>(f.size() * sizeof(uint32_t)));
    put32(out, sim);
    put32(out, module);
    for (uint32_t value : f) put32(out, value);
}

// ms to whole units of 1/8 s, the resolution the tick counters are read at.
uint32_t eighths(int64_t ms) {
    return static_cast<uint32_t>(std::min<int64_t>(ms / 125, UINT32_MAX >> 12));
}

uint32_t counter(int64_t value) {
    return static_cast<uint32_t>(std::min<int64_t>(std::max<int64_t>(value, 0), UINT32_MAX));
}

}  // namespace

int32_t ModemModel::parseStep(const std::vector<std::string>& words, Scenario::Step* step,
                              std::string* reason) {
    const std::string& verb = words[0];
    if (verb == "call" && words.size() >= 2 && (words[1] == "start" || words[1] == "stop")) {
        step->action = Scenario::Action::Modem;
        step->flag = words[1] == "start";
        step->text = step->flag ? "call-start" : "call-stop";
        step->value = 3;
        bool ok = step->flag
                      ? (words.size() == 3 || words.size() == 4) &&
                            (words[2] == "lte" || words[2] == "wcdma") &&
                            (words.size() == 3 || parseLevel(words[3], kWcdmaLevels, &step->value))
                      : words.size() == 2;
        if (!ok) {
            *reason =
                "expected \"at <time> call start lte|wcdma [<level 0..6>]\" or \"at <time> call "
                "stop\"";
            return -1;
        }
        step->tag = step->flag ? words[2] : "";
        return 1;
    }
    if (verb == "modem-answer") {
        step->action = Scenario::Action::Modem;
        static const std::vector<std::string> kFaults = {"",       "short", "count",
                                                         "length", "sim",   "pam"};
        bool ok = false;
        if (words.size() == 3 && words[1] == "delay") {
            step->text = "answer-delay";
            ok = parseSeconds(words[2], 0, kMaxDelayMs, &step->counters[0]);
        } else if (words.size() == 2 && words[1] == "never") {
            step->text = "answer-never";
            ok = true;
        } else if ((words.size() == 2 || words.size() == 3) && words[1] == "malformed") {
            step->text = "answer-malformed";
            auto kind = words.size() == 2 ? kFaults.begin() + 3
                                          : std::find(kFaults.begin() + 1, kFaults.end(), words[2]);
            step->value = static_cast<int32_t>(kind - kFaults.begin());
            ok = kind != kFaults.end();
        }
        if (!ok) {
            *reason =
                "expected \"at <time> modem-answer delay <seconds 0..600>|never|malformed "
                "[short|count|length|sim|pam]\"";
            return -1;
        }
        return 1;
    }
    if (verb != "modem") {
        return 0;
    }
    step->action = Scenario::Action::Modem;
    const std::string kind = words.size() >= 2 ? words[1] : "";
    bool ok = false;
    if (kind == "band") {
        step->text = kind;
        ok = words.size() == 3 && parseLevel(words[2], 2, &step->value);
    } else if (words.size() == 4 && parseSeconds(words[3], 1, kMaxResidencyMs, &step->counters[0])) {
        step->text = kind;
        if (kind == "idle" || kind == "wcdma-idle") {
            step->value = idleLevel(words[2]);
            ok = step->value >= 0;
        } else if (kind == "lte-tx") {
            ok = parseLevel(words[2], kLteLevels, &step->value);
        } else if (kind == "wcdma-voice" || kind == "wcdma-data") {
            ok = parseLevel(words[2], kWcdmaLevels, &step->value);
        }
    }
    if (!ok) {
        *reason =
            "expected \"at <time> modem lte-tx <level 0..7>|wcdma-voice <level 0..6>|"
            "wcdma-data <level 0..6>|idle <weak|mid|strong>|wcdma-idle <weak|mid|strong> "
            "<seconds, up to 3600>\" or \"at <time> modem band 0|1\"";
        return -1;
    }
    return 1;
}

std::string ModemModel::buildBlock(const Residency& r, Fault fault, int32_t answers) {
    std::string records;
    uint32_t count = 0;
    if (fault != Fault::Short && fault != Fault::Count) {
        // LTE physical layer: transmit times from the lowest power (field 0)
        // to the highest (6), then the connected (DRX active) time, which
        // also holds the VoLTE time and the time without transmission.
        std::vector<uint32_t> lte(kLtePhyFields, 0);
        uint32_t active = 0;
        for (int32_t level = 0; level < kLteLevels; ++level) {
            uint32_t units = eighths(r.lteTx[level]);
            if (level < kLteLevels - 1) lte[kLteLevels - 2 - level] = units << 12;
            active += units;
        }
        active = std::min<uint32_t>(active + eighths(r.volte), UINT32_MAX >> 12);
        lte[7] = active << 12;
        lte[8] = active << 12;
        lte[9] = eighths(r.volte) << 12;
        lte[10] = static_cast<uint32_t>(r.band);
        putRecord(&records, fault == Fault::Sim ? 3 : 0, 5, lte);

        // LTE RRC: idle time in ms and the DRX cycles of each signal level;
        // a cycle that divides every level keeps the split exact.
        std::vector<uint32_t> rrc(kLteRrcFields, 0);
        int64_t cycle = 1280;
        int64_t idle = 0;
        for (int64_t ms : r.lteIdle) {
            cycle = std::gcd(cycle, ms);
            idle += ms;
        }
        uint32_t cycles = 0;
        for (int32_t i = 0; i < kIdleLevels; ++i) {
            rrc[15 + i] = counter(r.lteIdle[i] / cycle);
            cycles += rrc[15 + i];
        }
        rrc[3] = counter(idle);
        rrc[4] = cycles;
        rrc[18] = active * 125;
        putRecord(&records, 0, 7, rrc);

        // WCDMA physical layer: the DRX time in ticks with one count per
        // 1/8 s of each level; circuit- (voice) and packet-switched (data)
        // counts of 10 ms, from the weakest signal.
        std::vector<uint32_t> wcdma(kWcdmaPhyFields, 0);
        uint32_t drx = 0;
        for (int32_t i = 0; i < kIdleLevels; ++i) {
            wcdma[7 + i] = eighths(r.wcdmaIdle[i]);
            drx += wcdma[7 + i];
        }
        wcdma[2] = drx << 12;
        wcdma[3] = drx;
        int64_t voice = 0;
        int64_t data = 0;
        for (int32_t level = 0; level < kWcdmaLevels; ++level) {
            wcdma[32 - level] = counter(r.wcdmaVoice[level] / 10);
            wcdma[25 - level] = counter(r.wcdmaData[level] / 10);
            voice += r.wcdmaVoice[level];
            data += r.wcdmaData[level];
        }
        wcdma[16] = counter(voice);
        wcdma[17] = counter(data);
        putRecord(&records, 0, 8, wcdma);

        std::vector<uint32_t> driver(kDriverFields, 0);
        driver[0] = counter(answers);
        driver[1] = counter(answers);
        putRecord(&records, 0, 10, driver);
        count = 4;
        if (fault == Fault::Pam) {
            // Two 20-byte wake-up items and 5 bytes the daemon leaves out.
            std::string items(45, '\0');
            for (size_t i = 0; i < 10; ++i) items[i * 4] = static_cast<char>(i + 1);
            put32(&records, 45);
            put32(&records, 0);
            put32(&records, 12);
            records += items;
            ++count;
        }
        if (fault == Fault::Length) {
            // The first record claims more bytes than the block holds.
            uint32_t past = static_cast<uint32_t>(records.size());
            memcpy(&records[0], &past, sizeof(past));
        }
    }
    std::string block;
    if (fault == Fault::Short) {
        put32(&block, 1);  // four bytes: no room for the header
    } else {
        put32(&block, fault == Fault::Count ? 3 : count);
        put32(&block, static_cast<uint32_t>(records.size()));
        block += records;
    }
    return block;
}

ModemModel::ModemModel(std::string root, Sender sender)
    : mRoot(std::move(root)), mSender(std::move(sender)) {}

ModemModel::~ModemModel() {
    stop();
}

bool ModemModel::layout() const {
    std::string path = mRoot + "/" + controlPath();
    std::string partial;
    std::stringstream in(path.substr(0, path.rfind('/')));
    std::string part;
    while (std::getline(in, part, '/')) {
        partial += part + "/";
        if (!part.empty() && mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) {
            return false;
        }
    }
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) {
        return false;
    }
    close(fd);
    return true;
}

bool ModemModel::start() {
    mInotify = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    if (mInotify < 0 || pipe2(mWakePipe, O_CLOEXEC) != 0 ||
        inotify_add_watch(mInotify, (mRoot + "/" + controlPath()).c_str(),
                          IN_MODIFY | IN_CLOSE_WRITE) < 0) {
        stop();
        return false;
    }
    mThread = std::thread([this] { watch(); });
    return true;
}

void ModemModel::stop() {
    if (mThread.joinable()) {
        char stopByte = 1;
        if (write(mWakePipe[1], &stopByte, 1) != 1) {
            fprintf(stderr, "kelvo-sim: cannot stop the modem: %s\n", strerror(errno));
        }
        mThread.join();
    }
    for (int* fd : {&mInotify, &mWakePipe[0], &mWakePipe[1]}) {
        if (*fd >= 0) close(*fd);
        *fd = -1;
    }
}

void ModemModel::watch() {
    bool modified = false;
    while (true) {
        int timeout = -1;
        {
            std::lock_guard<std::mutex> lock(mLock);
            if (!mQueue.empty()) {
                timeout =
                    static_cast<int>(std::max<int64_t>(0, mQueue.front().dueMonoMs - monotonicMs()));
            }
        }
        struct pollfd fds[2] = {{mInotify, POLLIN, 0}, {mWakePipe[0], POLLIN, 0}};
        if (poll(fds, 2, timeout) < 0 && errno != EINTR) {
            fprintf(stderr, "kelvo-sim: the modem stops watching: %s\n", strerror(errno));
            return;
        }
        if (fds[1].revents != 0) {
            return;
        }
        if (fds[0].revents & POLLIN) {
            alignas(struct inotify_event) char buffer[4096];
            ssize_t got = read(mInotify, buffer, sizeof(buffer));
            for (ssize_t at = 0;
                 got > 0 && at + static_cast<ssize_t>(sizeof(inotify_event)) <= got;) {
                const auto* event = reinterpret_cast<const struct inotify_event*>(buffer + at);
                // A request is a write: an open for writing closed without
                // one (the daemon's check of the file) asks for nothing.
                modified = modified || (event->mask & IN_MODIFY) != 0;
                if ((event->mask & IN_CLOSE_WRITE) != 0) {
                    struct stat st;
                    if (modified && stat((mRoot + "/" + controlPath()).c_str(), &st) == 0 &&
                        st.st_size > 0) {
                        onRequest();
                    }
                    modified = false;
                }
                at += sizeof(inotify_event) + event->len;
            }
        }
        while (true) {
            Request due;
            {
                std::lock_guard<std::mutex> lock(mLock);
                if (mQueue.empty() || mQueue.front().dueMonoMs > monotonicMs()) break;
                due = mQueue.front();
                mQueue.pop_front();
            }
            answer(due);
        }
    }
}

void ModemModel::onRequest() {
    std::lock_guard<std::mutex> lock(mLock);
    ++mRequests;
    if (mAnswer == Answer::Never) {
        return;
    }
    Request request;
    request.dueMonoMs = monotonicMs() + mDelayMs;
    request.requestMs = mNowMs;
    request.fault = mAnswer == Answer::Malformed ? mFault : Fault::None;
    mQueue.push_back(request);
}

void ModemModel::answer(const Request& request) {
    Sent sent;
    std::string block;
    {
        std::lock_guard<std::mutex> lock(mLock);
        sent.requestMs = request.requestMs;
        sent.answerMs = mNowMs;
        sent.fault = request.fault;
        sent.residency = mResidency;
        // The modem starts counting again from its answer.
        int32_t band = mResidency.band;
        mResidency = Residency();
        mResidency.band = band;
        block = buildBlock(sent.residency, sent.fault, static_cast<int32_t>(mSent.size()) + 1);
    }
    sent.result = mSender ? mSender(block) : -1;
    std::lock_guard<std::mutex> lock(mLock);
    mSent.push_back(sent);
}

void ModemModel::accumulateCall(int64_t toMs) {
    if (mInCall && toMs > mNowMs) {
        int64_t span = toMs - mNowMs;
        if (mCallOnLte) {
            mResidency.volte += span;
            mResidency.lteTx[mCallLevel] += span;
        } else {
            mResidency.wcdmaVoice[mCallLevel] += span;
        }
    }
    mNowMs = std::max(mNowMs, toMs);
}

void ModemModel::advanceTo(int64_t ms) {
    std::lock_guard<std::mutex> lock(mLock);
    accumulateCall(ms);
}

void ModemModel::apply(const Scenario::Step& step) {
    std::lock_guard<std::mutex> lock(mLock);
    accumulateCall(step.atMs);
    const std::string& kind = step.text;
    const int64_t ms = step.counters[0];
    if (kind == "lte-tx") {
        mResidency.lteTx[step.value] += ms;
    } else if (kind == "idle") {
        mResidency.lteIdle[step.value] += ms;
    } else if (kind == "wcdma-idle") {
        mResidency.wcdmaIdle[step.value] += ms;
    } else if (kind == "wcdma-voice") {
        mResidency.wcdmaVoice[step.value] += ms;
    } else if (kind == "wcdma-data") {
        mResidency.wcdmaData[step.value] += ms;
    } else if (kind == "band") {
        mResidency.band = step.value;
    } else if (kind == "call-start") {
        mInCall = true;
        mCallOnLte = step.tag == "lte";
        mCallLevel = step.value;
    } else if (kind == "call-stop") {
        mInCall = false;
    } else if (kind == "answer-delay") {
        mAnswer = Answer::Delay;
        mDelayMs = ms;
    } else if (kind == "answer-never") {
        mAnswer = Answer::Never;
    } else if (kind == "answer-malformed") {
        mAnswer = Answer::Malformed;
        mFault = static_cast<Fault>(step.value);
    }
}

int32_t ModemModel::requests() const {
    std::lock_guard<std::mutex> lock(mLock);
    return mRequests;
}

std::vector<ModemModel::Sent> ModemModel::sent() const {
    std::lock_guard<std::mutex> lock(mLock);
    return mSent;
}

ModemModel::Residency ModemModel::pending() const {
    std::lock_guard<std::mutex> lock(mLock);
    return mResidency;
}

}  // namespace sim
}  // namespace kelvo
