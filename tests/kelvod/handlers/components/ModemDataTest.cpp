// The modem record decoders through their factory: the rows they store and
// the accounter actions they send for each module, against a reference of
// the energy rules computed here in wide arithmetic.

#include <gtest/gtest.h>
#include <string.h>

#include <algorithm>
#include <limits>
#include <string>
#include <vector>

#include "AccounterTypes.h"
#include "common/TestEnv.h"
#include "handlers/components/modem/ModemData.h"
#include "handlers/components/modem/ModemDataOwner.h"

using namespace kelvo;
using android::Parcel;
using kelvo::test::LogCapture;

namespace {

using Words = std::vector<uint32_t>;
using Action = std::vector<int64_t>;  // the int32s after the accounter type and SetValue
using u128 = unsigned __int128;
constexpr int64_t kInt32Max = std::numeric_limits<int32_t>::max();

// Rows and actions handed to the owner, as int32 lists (a row's int64 time
// first, split as written).
class FakeOwner : public ModemDataOwner {
public:
    int32_t logModemData(int32_t index, const Parcel& row) override {
        mIndexes.push_back(index);
        mRows.emplace_back(row.data(), row.data() + row.dataSize());
        return 0;
    }
    int32_t accountingModemData(Parcel& action) override {
        action.setDataPosition(0);
        EXPECT_EQ(ACCOUNTER_MODEM, action.readInt32());
        EXPECT_EQ(ACTION_SET_VALUE, action.readInt32());
        Action fields;
        int32_t v = 0;
        while (action.readInt32(&v) == android::NO_ERROR) {
            fields.push_back(v);
        }
        mActions.push_back(fields);
        return 0;
    }
    std::vector<int32_t> mIndexes;
    std::vector<std::vector<uint8_t>> mRows;
    std::vector<Action> mActions;
};

int64_t clamp(u128 v) {
    return v > static_cast<u128>(kInt32Max) ? kInt32Max : static_cast<int64_t>(v);
}

Action levels(int32_t subtype, int32_t module, std::vector<u128> values) {
    Action a = {subtype, module, static_cast<int64_t>(values.size())};
    for (u128 v : values) {
        a.push_back(clamp(v));
    }
    return a;
}

// Field values picked by index: f[i] * mul >> shift for each index.
std::vector<u128> scaled(const Words& f, std::vector<int> at, u128 mul, int shift = 0) {
    std::vector<u128> out;
    for (int i : at) {
        out.push_back(static_cast<u128>(f[i]) * mul >> shift);
    }
    return out;
}

std::vector<u128> ticks(const Words& f, std::vector<int> at) {
    std::vector<u128> out;
    for (int i : at) {
        out.push_back(static_cast<u128>(f[i] >> 12) * 125);
    }
    return out;
}

// Idle split: c_i * T / D * factor, or per count c_i * (T / D); none for D 0.
std::vector<Action> idle(int32_t module, u128 t, u128 d, std::vector<uint32_t> c, u128 factor,
                         bool perCount = false) {
    if (d == 0) {
        return {};
    }
    std::vector<u128> out;
    for (uint32_t ci : c) {
        out.push_back(perCount ? ci * (t / d) * factor : ci * t / d * factor);
    }
    return {levels(MODEM_SCENARIO_IDLE, module, out)};
}

std::vector<Action> plus(std::vector<Action> a, const std::vector<Action>& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

// The actions a record should give, from the energy rules.
std::vector<Action> reference(int32_t m, const Words& f) {
    switch (m) {
        case 0:
        case 2:
            return idle(m, f[2] >> 12, u128(f[3]) + f[4] + f[5], {f[3], f[4], f[5]}, 125);
        case 1:
            return {levels(0, m, scaled(f, {13, 12, 11, 10, 9, 8, 7}, 5, 2)),
                    levels(2, m, scaled(f, {20, 19, 18, 17, 16, 15, 14}, 5, 2))};
        case 3:
            return {levels(2, m, scaled(f, {11, 10, 9, 8, 7, 6, 5}, 5, 2))};
        case 4:
            return {levels(0, m, ticks(f, {6, 5, 4, 3, 2, 1, 0}))};
        case 5: {
            if (f[10] > 1 || f[8] > 536870910u || f[8] > f[7]) {
                return {};
            }
            std::vector<u128> x;
            u128 s = 0;
            for (int i : {6, 5, 4, 3, 2, 1, 0}) {
                x.push_back(f[i] >> 12);
                s += f[i] >> 12;
            }
            const u128 v = f[9] >> 12, c = f[8] >> 12;
            if (v + s > c) {
                return {};
            }
            x.push_back(c - v - s);
            auto lte = [&](int32_t subtype, u128 base, std::vector<u128> l) {
                Action a = levels(subtype, m, l);
                a.insert(a.begin() + 2, {f[10], clamp(base)});
                return a;
            };
            std::vector<u128> all, voice, rest;
            for (u128 xi : x) {
                all.push_back(xi * 125);
                voice.push_back(v == 0 ? 0 : v * xi / c * 125);
                rest.push_back(xi * 125 - voice.back());
            }
            if (v == 0) {
                return {lte(2, 0, all)};
            }
            return {lte(0, v * 125, voice), lte(2, 0, rest)};
        }
        case 6:
            return idle(m, f[2], f[3], {f[10], f[11], f[12]}, 1, true);
        case 7:
            return idle(m, f[3], f[4], {f[15], f[16], f[17]}, 1, true);
        case 8:
            return plus(idle(m, f[2] >> 12, f[3], {f[7], f[8], f[9]}, 125),
                        {levels(0, m, scaled(f, {32, 31, 30, 29, 28, 27, 26}, 10)),
                         levels(2, m, scaled(f, {25, 24, 23, 22, 21, 20, 19}, 10))});
        case 9:
            return plus(idle(m, f[2] >> 12, f[3], {f[6], f[7], f[8]}, 125),
                        {levels(0, m, scaled(f, {24, 23, 22, 21, 20, 19, 18}, 480)),
                         levels(2, m, scaled(f, {35, 34, 33, 32, 31, 30, 29}, 480))});
        case 11:
            return {levels(2, m, scaled(f, {0}, 10))};
        default:
            return {};
    }
}

// A record as it sits in a block: header (L, SIM, module), then the words,
// after `offset` bytes of padding.
std::vector<uint8_t> packet(int32_t module, uint32_t sim, const Words& words, size_t offset = 0) {
    std::vector<uint8_t> bytes(offset, 0xEE);
    const uint32_t header[3] = {static_cast<uint32_t>(words.size() * 4), sim,
                                static_cast<uint32_t>(module)};
    bytes.insert(bytes.end(), reinterpret_cast<const uint8_t*>(header),
                 reinterpret_cast<const uint8_t*>(header) + sizeof(header));
    bytes.insert(bytes.end(), reinterpret_cast<const uint8_t*>(words.data()),
                 reinterpret_cast<const uint8_t*>(words.data()) + words.size() * 4);
    return bytes;
}

// Large counters, so that 32-bit products would wrap.
Words bigWords(size_t count, int32_t module) {
    Words w(count);
    for (size_t i = 0; i < count; ++i) {
        w[i] = static_cast<uint32_t>(0x9E3779B9u * (i + 1 + module));
    }
    return w;
}

// An LTE record: seven transmit tick counts (low first), cdrx, active, VoLTE,
// band flag.
Words lteRecord(uint32_t txTicks, uint32_t cdrx, uint32_t active, uint32_t volte, uint32_t band) {
    Words w(13, 0);
    for (int i = 0; i < 7; ++i) {
        w[i] = txTicks * (i + 1);
    }
    w[7] = cdrx;
    w[8] = active;
    w[9] = volte;
    w[10] = band;
    return w;
}

struct Decoded {
    int32_t result;
    FakeOwner owner;
};

void decode(int32_t module, const std::vector<uint8_t>& bytes, size_t offset, Decoded* out) {
    std::unique_ptr<ModemData> decoder = ModemData::create(module, &out->owner);
    ASSERT_NE(nullptr, decoder);
    out->result = decoder->setData(bytes.data() + offset, bytes.size() - offset, 123456789, 0, 0);
}

// The row written for a stored record: time, SIM (not for the driver), then
// every counter's 32 bits.
void expectRow(const Decoded& d, int32_t module, uint32_t sim, const Words& words) {
    ASSERT_EQ(1u, d.owner.mRows.size());
    EXPECT_EQ(module + 1, d.owner.mIndexes[0]);
    Parcel row;
    row.setData(d.owner.mRows[0].data(), d.owner.mRows[0].size());
    EXPECT_EQ(123456789, row.readInt64());
    const table_attribute* table = ModemData::table(module);
    ASSERT_NE(nullptr, table);
    EXPECT_STREQ("timestamp", table->columns[0].name);
    EXPECT_EQ(COLUMN_TIME, table->columns[0].type);
    const size_t recordSize =
        ModemData::create(module, const_cast<FakeOwner*>(&d.owner))->recordSize();
    const bool hasSim = module != MODEM_MODULE_DRIVER;
    EXPECT_EQ(static_cast<int32_t>(recordSize / 4 + 1 + hasSim), table->count);
    EXPECT_EQ(hasSim, std::string(table->columns[1].name) == "sim");
    if (hasSim) {
        EXPECT_EQ(static_cast<int32_t>(sim), row.readInt32());
    }
    for (size_t i = 0; i < recordSize / 4; ++i) {
        EXPECT_EQ(static_cast<int32_t>(words[i]), row.readInt32()) << "field " << i;
        EXPECT_EQ(COLUMN_INT, table->columns[i + 1 + hasSim].type);
    }
    EXPECT_EQ(row.dataSize(), row.dataPosition());
}

// One row per module: a record of large counters (a valid one for LTE), its
// row and the actions the rules give.
TEST(ModemDataTest, EachModuleStoresItsRowAndSendsItsLevels) {
    const struct {
        int32_t module;
        size_t words;
        const char* table;
        const char* version;
    } modules[] = {
        {0, 8, "raw_modem_cdma_1x_cas", "1.0"},   {1, 21, "raw_modem_cdma_1x_cproc", "1.1"},
        {2, 8, "raw_modem_cdma_evdo_cas", "1.0"}, {3, 12, "raw_modem_cdma_evdo_cproc", "1.1"},
        {4, 9, "raw_modem_tds_phy", "1.1"},       {5, 13, "raw_modem_lte_phy", "1.1"},
        {6, 15, "raw_modem_tds_rrc", "1.0"},      {7, 19, "raw_modem_lte_rrc", "1.0"},
        {8, 34, "raw_modem_wcdma_phy", "1.1"},    {9, 38, "raw_modem_gsm_phy", "1.1"},
        {10, 72, "raw_modem_driver", "1.0"},      {11, 5, "raw_modem_wcdma_rrc", "1.0"},
    };
    for (const auto& m : modules) {
        SCOPED_TRACE(m.table);
        Words words = m.module == 5 ? lteRecord(40960, 9000000, 8000000, 1234567, 1)
                                    : bigWords(m.words, m.module);
        Decoded d;
        decode(m.module, packet(m.module, 2, words), 0, &d);
        EXPECT_EQ(MODEM_RECORD_ACCOUNTED, d.result);
        expectRow(d, m.module, 2, words);
        EXPECT_EQ(reference(m.module, words), d.owner.mActions);
        EXPECT_STREQ(m.table, ModemData::table(m.module)->name);
        EXPECT_STREQ(m.version, ModemData::table(m.module)->version);
    }
    FakeOwner owner;
    for (int32_t unknown : {-1, 12}) {
        EXPECT_EQ(nullptr, ModemData::create(unknown, &owner));
        EXPECT_EQ(nullptr, ModemData::table(unknown));
    }
}

// A decoder's own refusals keep the block going (result >= 0); only a packet
// that does not fit the bytes handed over is a block fault.
TEST(ModemDataTest, RecordRefusalsAndOddPlacements) {
    LogCapture log;
    const Words rrc = {100, 200, 300, 400, 500};
    const Words noDrx = {7, 7, 7, 0, 7, 7, 7, 7, 7, 7, 7, 7, 7, 7, 7};  // TDS RRC
    struct Case {
        const char* what;
        int32_t module;
        Words words;
        size_t offset;  // bytes before the packet
        size_t cut;     // bytes cut from the end of the block
        int32_t result;
        int32_t actions;  // -1: no row either
        const char* logged;
    } cases[] = {
        {"LTE, no VoLTE", 5, lteRecord(40960, 9000000, 8000000, 0, 0), 0, 0, 0, 1, ""},
        {"LTE, VoLTE", 5, lteRecord(28672, 900000000, 500000000, 4096000, 1), 0, 0, 0, 2, ""},
        {"LTE band flag 2", 5, lteRecord(40960, 9000000, 8000000, 0, 2), 0, 0, 1, 0,
         "unknown band flag=2"},
        {"LTE active above the cdrx time", 5, lteRecord(0, 100, 101, 0, 0), 0, 0, 1, 0,
         "input cdrx active time error=101"},
        {"LTE active above 2^29 - 2", 5, lteRecord(0, ~0u, 536870911, 0, 0), 0, 0, 1, 0,
         "input cdrx active time error=536870911"},
        {"LTE sending longer than active", 5, lteRecord(409600, 9000000, 4096, 0, 0), 0, 0, 1, 0,
         "connect time error!"},
        {"CDMA idle without counts", 0, {0, 0, 409600, 0, 0, 0, 0, 0}, 0, 0, 1, 0, "count is 0"},
        {"RRC without DRX cycles", 6, noDrx, 0, 0, 1, 0, "idle count is 0"},
        {"16-byte WCDMA RRC", 11, {1, 2, 3, 4}, 0, 0, 2, -1, "Invalid input data length 16"},
        {"24-byte WCDMA RRC", 11, {100, 200, 300, 400, 500, 600}, 0, 0, 0, 1, ""},
        {"misaligned record", 8, bigWords(34, 8), 3, 0, 0, 3, ""},
        {"driver record, misaligned", 10, bigWords(72, 10), 1, 0, 0, 0, ""},
        {"data past the block", 11, rrc, 0, 1, -1, -1, ""},
        {"header past the block", 11, rrc, 0, 21, -1, -1, ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        log.clear();
        std::vector<uint8_t> bytes = packet(c.module, 1, c.words, c.offset);
        bytes.resize(bytes.size() - c.cut);
        Decoded d;
        decode(c.module, bytes, c.offset, &d);
        EXPECT_EQ(c.result, d.result);
        EXPECT_EQ(static_cast<size_t>(std::max(c.actions, 0)), d.owner.mActions.size());
        if (c.actions >= 0) {
            expectRow(d, c.module, 1, c.words);
            EXPECT_EQ(reference(c.module, c.words), d.owner.mActions);
        } else {
            EXPECT_TRUE(d.owner.mRows.empty());
        }
        if (*c.logged != '\0') {
            EXPECT_TRUE(log.contains(c.logged));
        }
    }
    FakeOwner owner;
    EXPECT_EQ(MODEM_RECORD_REFUSED, ModemData::create(11, &owner)->setData(nullptr, 0, 1, 0, 0));
    EXPECT_TRUE(log.contains("Invalid pointer, please check!"));
}

}  // namespace
