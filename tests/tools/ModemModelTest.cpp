#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <fstream>
#include <mutex>
#include <string>
#include <vector>

#include "ModemModel.h"
#include "ModemTruth.h"
#include "Scenario.h"

namespace kelvo {
namespace sim {
namespace {

struct Record {
    uint32_t sim = 0;
    uint32_t module = 0;
    std::vector<uint32_t> fields;
};

// Reads a block as the daemon must: the header, then records while they fit.
struct Block {
    size_t size = 0;
    uint32_t count = 0;
    std::vector<Record> records;
    bool truncated = false;  // a record claimed more than the block holds
};

Block readBlock(const std::string& bytes) {
    Block block;
    block.size = bytes.size();
    if (block.size < 8) return block;
    memcpy(&block.count, bytes.data(), 4);
    size_t at = 8;
    while (at + 12 <= bytes.size()) {
        uint32_t head[3];
        memcpy(head, bytes.data() + at, 12);
        if (head[0] > bytes.size() - at - 12) {
            block.truncated = true;
            break;
        }
        Record r{head[1], head[2], std::vector<uint32_t>(head[0] / 4)};
        memcpy(r.fields.data(), bytes.data() + at + 12, r.fields.size() * 4);
        block.records.push_back(r);
        at += 12 + head[0];
    }
    return block;
}

const Record* find(const Block& block, uint32_t module) {
    for (const Record& r : block.records) {
        if (r.module == module) return &r;
    }
    return nullptr;
}

// A modem on a fresh root whose answers are kept.
class Modem {
public:
    Modem() {
        char pattern[] = "/tmp/modem-test-XXXXXX";
        mRoot = mkdtemp(pattern);
        mModel.reset(new ModemModel(mRoot, [this](const std::string& block) {
            std::lock_guard<std::mutex> lock(mLock);
            mBlocks.push_back(block);
            mArrived.notify_all();
            return 0;
        }));
        EXPECT_TRUE(mModel->layout());
        EXPECT_TRUE(mModel->start());
    }
    ~Modem() {
        mModel.reset();
        system(("rm -rf " + mRoot).c_str());
    }
    void play(const std::string& lines) {
        ASSERT_TRUE(mScenario.parse("start 10:00:00\nduration 10:00\n" + lines, "m.scn", &mError))
            << mError;
        for (const Scenario::Step& step : mScenario.steps()) mModel->apply(step);
    }
    // What the daemon does to ask: the module list written, then closed.
    void request(bool write = true) {
        int fd = open((mRoot + "/" + ModemModel::controlPath()).c_str(), O_WRONLY | O_CLOEXEC);
        ASSERT_GE(fd, 0);
        if (write) {
            ASSERT_EQ(5, ::write(fd, "30 33", 5));
        }
        close(fd);
    }
    // The n-th block, waiting up to waitMs; empty when none came.
    std::string block(size_t n, int waitMs) {
        std::unique_lock<std::mutex> lock(mLock);
        mArrived.wait_for(lock, std::chrono::milliseconds(waitMs),
                          [&] { return mBlocks.size() > n; });
        return mBlocks.size() > n ? mBlocks[n] : "";
    }
    std::unique_ptr<ModemModel> mModel;

private:
    std::string mRoot;
    Scenario mScenario;
    std::string mError;
    std::mutex mLock;
    std::condition_variable mArrived;
    std::vector<std::string> mBlocks;
};

// Where a scenario's residency lands: module, field, and the ms the daemon
// reads from it (ticks >> 12 x 125, counts of 10 ms, or ms x the RRC's
// cycle, idle_time / idle_drx_cnt).
struct Placement {
    const char* name;
    const char* lines;
    uint32_t module;
    size_t field;
    enum { Ticks, Tens, Cycles } unit;
    uint32_t ms;
};

const Placement kPlacements[] = {
    {"lte highest power", "at 1 modem lte-tx 0 2\n", 5, 6, Placement::Ticks, 2000},
    {"lte lowest power", "at 1 modem lte-tx 6 1.5\n", 5, 0, Placement::Ticks, 1500},
    {"lte connected sums every level", "at 1 modem lte-tx 7 3\nat 2 modem lte-tx 2 1\n", 5, 8,
     Placement::Ticks, 4000},
    {"lte below an eighth of a second", "at 1 modem lte-tx 1 0.1\n", 5, 5, Placement::Ticks, 0},
    {"volte call time", "at 1 call start lte 2\nat 11 call stop\n", 5, 9, Placement::Ticks, 10000},
    {"volte call is connected time", "at 1 call start lte\nat 5 call stop\n", 5, 8,
     Placement::Ticks, 8000},
    {"band flag", "at 1 modem band 1\n", 5, 10, Placement::Tens, 10},
    {"lte idle weak", "at 1 modem idle weak 7.68\nat 1 modem idle strong 2.56\n", 7, 15,
     Placement::Cycles, 7680},
    {"lte idle mid", "at 1 modem idle mid 3.333\n", 7, 16, Placement::Cycles, 3333},
    {"wcdma voice weakest", "at 1 modem wcdma-voice 0 4\n", 8, 32, Placement::Tens, 4000},
    {"wcdma call strongest", "at 1 call start wcdma 6\nat 3 call stop\n", 8, 26, Placement::Tens,
     2000},
    {"wcdma data", "at 1 modem wcdma-data 1 0.55\n", 8, 24, Placement::Tens, 550},
    {"wcdma idle time", "at 1 modem wcdma-idle mid 5\nat 1 modem wcdma-idle weak 1\n", 8, 2,
     Placement::Ticks, 6000},
};

void PrintTo(const Placement& c, std::ostream* os) {
    *os << c.name;
}

class ModemBlockTest : public ::testing::TestWithParam<Placement> {};

TEST_P(ModemBlockTest, ResidencyLandsInItsFieldAsTheDaemonReadsIt) {
    const Placement& c = GetParam();
    Modem modem;
    modem.play(c.lines);
    modem.mModel->advanceTo(60000);
    modem.request();
    const std::string bytes = modem.block(0, 3000);
    ASSERT_FALSE(bytes.empty());
    const Block block = readBlock(bytes);
    ASSERT_EQ(4u, block.count);
    ASSERT_EQ(4u, block.records.size());
    ASSERT_FALSE(block.truncated);
    const std::pair<uint32_t, size_t> sizes[] = {{5, 52}, {7, 76}, {8, 136}, {10, 288}};
    for (const auto& [module, size] : sizes) {
        const Record* r = find(block, module);
        ASSERT_NE(nullptr, r) << module;
        EXPECT_EQ(size, r->fields.size() * 4) << module;
        EXPECT_EQ(0u, r->sim);
    }
    const Record& r = *find(block, c.module);
    const uint32_t raw = r.fields[c.field];
    uint32_t ms = raw;
    if (c.unit == Placement::Ticks) ms = (raw >> 12) * 125;
    if (c.unit == Placement::Tens) ms = raw * 10;
    if (c.unit == Placement::Cycles) ms = raw * (r.fields[3] / r.fields[4]);
    EXPECT_EQ(c.ms, ms);
    if (c.module == 5) {
        // The daemon refuses more transmit and VoLTE time than connected time.
        uint32_t sum = r.fields[9] >> 12;
        for (size_t i = 0; i < 7; ++i) sum += r.fields[i] >> 12;
        EXPECT_LE(sum, r.fields[8] >> 12);
        EXPECT_LE(r.fields[8], r.fields[7]);
    }
}

INSTANTIATE_TEST_SUITE_P(Residency, ModemBlockTest, ::testing::ValuesIn(kPlacements),
                         [](const ::testing::TestParamInfo<Placement>& info) {
                             std::string name;
                             for (const char* p = info.param.name; *p != '\0'; ++p) {
                                 name += isalnum(static_cast<unsigned char>(*p)) ? *p : '_';
                             }
                             return name;
                         });

// Each request is answered after the scenario's delay, never, or with the
// fault asked for; residency is carried by the next well-formed answer only.
TEST(ModemAnswerTest, RequestsAreAnsweredAsTheScenarioSays) {
    struct Case {
        const char* answer;
        int earliestMs;  // no block before
        bool answered;
        bool (*check)(const Block&);
    };
    const Case kCases[] = {
        {"delay 0.6", 300, true, [](const Block& b) { return b.records.size() == 4; }},
        {"never", 1200, false, nullptr},
        {"malformed short", 0, true, [](const Block& b) { return b.size < 8; }},
        {"malformed count", 0, true,
         [](const Block& b) { return b.size == 8 && b.count > b.records.size(); }},
        {"malformed", 0, true, [](const Block& b) { return b.truncated && b.records.empty(); }},
        {"malformed sim", 0, true,
         [](const Block& b) { return !b.records.empty() && b.records[0].sim == 3; }},
        {"malformed pam", 0, true,
         [](const Block& b) {
             const Record* r = find(b, 12);
             return b.count == 5 && r != nullptr && !b.truncated;
         }},
    };
    for (const Case& c : kCases) {
        SCOPED_TRACE(c.answer);
        Modem modem;
        modem.play(std::string("at 0 modem-answer ") + c.answer + "\nat 1 modem lte-tx 3 4\n");
        modem.request(false);  // opened and closed without a write: no request
        modem.request();
        EXPECT_EQ("", modem.block(0, c.earliestMs));
        const std::string bytes = c.answered ? modem.block(0, 3000) : "";
        ASSERT_EQ(c.answered, !bytes.empty());
        EXPECT_EQ(1, modem.mModel->requests());
        if (c.answered) {
            EXPECT_TRUE(c.check(readBlock(bytes)));
            // The answer took the residency: the next one starts from zero.
            EXPECT_EQ(0, modem.mModel->pending().lteTx[3]);
        } else {
            EXPECT_EQ(4000, modem.mModel->pending().lteTx[3]);
        }
    }
}

// The truth follows the decoders' rules: idle and transmit levels at their
// tables' powers, a VoLTE call's share V x x_i / C of each LTE level, a level
// past the configured powers at 0.
TEST(ModemTruthTest, EnergyFollowsTheRecordsAndTheProfile) {
    char path[] = "/tmp/modem-profile-XXXXXX";
    int fd = mkstemp(path);
    ASSERT_GE(fd, 0);
    close(fd);
    std::ofstream(path) << "<config><element id=\"0\"><component id=\"8\">"
                           "<parameter id=\"1\"><value key=\"0\">4</value><value key=\"1\">200"
                           "</value><value key=\"2\">300</value><value key=\"2\">100</value>"
                           "</parameter><parameter id=\"5\"><value key=\"0\">3</value>"
                           "<value key=\"0\">2</value><value key=\"1\">500</value>"
                           "<value key=\"2\">400</value><value key=\"2\">200</value>"
                           "</parameter></component></element></config>";
    ModemTruth::Profile profile;
    ASSERT_TRUE(ModemTruth::readProfile(path, &profile));
    unlink(path);
    struct Case {
        const char* name;
        ModemModel::Residency residency;
        int64_t idle, voice, data;
    };
    ModemModel::Residency idle, lte, volte, band, wcdma;
    idle.lteIdle[0] = 10000;   // 10 s x 3
    idle.lteIdle[1] = 5000;    // 5 s x 2
    idle.wcdmaIdle[2] = 2000;  // past the one idle power
    lte.lteTx[0] = 2000;       // 2 s x 400
    lte.lteTx[1] = 1000;       // 1 s x 200
    volte.lteTx[0] = 4000;     // C = 8 s: half of it the call's
    volte.volte = 4000;
    band.lteTx[0] = 2000;  // 2 s x 500: the voice table, for data too
    band.band = 1;
    wcdma.wcdmaVoice[0] = 1005;
    wcdma.wcdmaData[1] = 3000;
    const Case kCases[] = {
        {"idle", idle, 40, 0, 0},     {"lte data", lte, 0, 0, 1000}, {"volte", volte, 0, 800, 800},
        {"band 1", band, 0, 0, 1000}, {"wcdma", wcdma, 0, 200, 300},
    };
    for (const Case& c : kCases) {
        SCOPED_TRACE(c.name);
        ModemTruth::Energy e = ModemTruth::energyOf(c.residency, profile);
        EXPECT_EQ(c.idle, e.idle);
        EXPECT_EQ(c.voice, e.voice);
        EXPECT_EQ(c.data, e.data);
    }
}

}  // namespace
}  // namespace sim
}  // namespace kelvo
