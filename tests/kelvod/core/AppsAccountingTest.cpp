#include <stdlib.h>
#include <time.h>

#include "core/AppsAccounting.h"
#include "kelvo/PowerLog.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/DataUploader.h"
#include "utils/PackageProperty.h"

using android::Parcel;
using android::String8;
using kelvo::AppsAccounting;
using kelvo::DataUploader;
using kelvo::test::DirectDb;

namespace {

// 2026-12-06 10:00:00 UTC, hours in ms.
constexpr int64_t kTen = 1796551200000LL;
constexpr int64_t kHour = 3600000;

// One record: time, name, code, then the 32-bit fields (shared sub-key)
// and 64-bit fields in the order of the code's kind.
void record(int64_t t, const char* name, int32_t code, std::initializer_list<int32_t> lead,
            std::initializer_list<int64_t> energies, std::initializer_list<int32_t> values,
            int32_t expected = 0) {
    Parcel p;
    p.writeInt64(t);
    p.writeString8(String8(name));
    p.writeInt32(code);
    for (int32_t v : lead) p.writeInt32(v);
    for (int64_t e : energies) p.writeInt64(e);
    for (int32_t v : values) p.writeInt32(v);
    EXPECT_EQ(expected, AppsAccounting::getInstance()->addAppsData(p));
}

void common(int64_t t, const char* name, int32_t code, int64_t fg, int64_t bg, int64_t on,
            int64_t off, int32_t v1, int32_t v2, int32_t v3, int32_t v4) {
    record(t, name, code, {}, {fg, bg, on, off}, {v1, v2, v3, v4});
}

void shared(int64_t t, const char* name, int32_t code, int32_t key, int64_t fg, int32_t v1) {
    record(t, name, code, {key}, {fg, 0, fg, 0}, {v1, 0, v1, 0});
}

void network(int64_t t, const char* name, int32_t code, int64_t fg, int64_t bytes) {
    record(t, name, code, {}, {fg, 0, fg, 0, bytes, 0, bytes, 0}, {});
}

class AppsAccountingTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        setenv("TZ", "UTC", 1);
        tzset();
        AppsAccounting::getInstance()->addSchemaTable();
        DataUploader::getInstance()->addSchemaTable();
    }
    void TearDown() override {
        AgentStorageTest::TearDown();
        unsetenv("TZ");
        tzset();
    }
    Json::Value sentEvent() {
        DataUploader::getInstance()->uploadEvent();
        std::vector<Json::Value> sent = events();
        return sent.empty() ? Json::Value() : sent.back();
    }
};

} // namespace

TEST_F(AppsAccountingTest, RecordsMergePerHourApplicationAndComponent) {
    // Two CPU records of one application in one hour: one row, summed.
    common(kTen + 60000, "com.a", kelvo::APPS_CPU, 10, 5, 12, 3, 100, 50, 120, 30);
    common(kTen + 120000, "com.a", kelvo::APPS_CPU, 1, 2, 3, 0, 10, 20, 30, 0);
    // 10:59:59.999 and 11:00:00 go to two hours.
    common(kTen + kHour - 1, "com.b", kelvo::APPS_GNSS, 4, 0, 4, 0, 40, 0, 40, 0);
    common(kTen + kHour, "com.b", kelvo::APPS_GNSS, 6, 0, 6, 0, 60, 0, 60, 0);
    // Only screen-off energy: no foreground or background energy, no row.
    common(kTen, "com.c", kelvo::APPS_AUDIO, 0, 0, 0, 9, 0, 0, 0, 90);
    // Shared: the largest per-kind sum, not the total.
    shared(kTen, "com.d", kelvo::APPS_BLUETOOTH, 1, 3, 5);
    shared(kTen, "com.d", kelvo::APPS_BLUETOOTH, 2, 4, 9);
    record(kTen, "com.e", kelvo::APPS_DISPLAY, {}, {70, 700}, {});
    network(kTen, "com.f", kelvo::APPS_WIFI, 8, 4096);
    // Unknown codes are refused; a record shorter than its kind adds nothing.
    record(kTen, "com.x", -1, {}, {}, {}, -5);
    record(kTen, "com.short", kelvo::APPS_CPU, {}, {99}, {}, -5);
    ASSERT_EQ(0, AppsAccounting::getInstance()->balanceAccount());
    EXPECT_EQ((std::vector<std::string>{
                      "1796554800000 com.a 5 11 7 15 3 110 70 150 30",
                      "1796554800000 com.b 7 4 0 4 0 40 0 40 0",
                      "1796554800000 com.d 2 7 0 7 0 9 0 9 0",
                      "1796554800000 com.e 1 70 0 70 0 700 0 700 0",
                      "1796554800000 com.f 10 8 0 8 0 4096 0 4096 0",
                      "1796558400000 com.b 7 6 0 6 0 60 0 60 0",
              }),
              rows("SELECT timestamp || ' ' || name || ' ' || component || ' ' || "
                   "foreground_energy || ' ' || background_energy || ' ' || screen_on_energy || "
                   "' ' || screen_off_energy || ' ' || value1 || ' ' || value2 || ' ' || value3 "
                   "|| ' ' || value4 FROM hourly_applications_accounting ORDER BY timestamp, "
                   "name"));
    // The store was emptied: a second balance writes nothing more.
    AppsAccounting::getInstance()->balanceAccount();
    EXPECT_EQ(std::vector<std::string>{"6"},
              rows("SELECT COUNT(*) FROM hourly_applications_accounting"));
}

TEST_F(AppsAccountingTest, ALargeBalanceIsWrittenInChunksAndNamesWithoutFieldsAreLogged) {
    for (int i = 0; i < 6000; ++i) {
        std::string name = "com.app" + std::to_string(i);
        common(kTen, name.c_str(), kelvo::APPS_CPU, 1, 1, 1, 1, 1, 1, 1, 1);
    }
    // Energy but no durations: listed first among the day's names, no fields.
    common(kTen, "com.silent", kelvo::APPS_CPU, 9, 0, 9, 0, 0, 0, 0, 0);
    ASSERT_EQ(0, AppsAccounting::getInstance()->balanceAccount());
    EXPECT_EQ(std::vector<std::string>{"6001"},
              rows("SELECT COUNT(*) FROM hourly_applications_accounting"));
    mStorage->flushAllEntries();
    ASSERT_EQ(0, AppsAccounting::getInstance()->uploadDailyAppsAccounting(kTen + kHour, 1.0f));
    EXPECT_NE(std::string::npos, mRoot->readFile(KELVO_POWER_LOG_FILE).find("\tapps\tcom.silent#"));
}

TEST_F(AppsAccountingTest, UploadsTheTopApplicationsInEnergyOrder) {
    // Twelve applications with growing energy; the hourly upload keeps ten.
    for (int i = 1; i <= 12; ++i) {
        std::string name = "com.app" + std::to_string(i);
        common(kTen, name.c_str(), kelvo::APPS_CPU, i * 10, 0, i * 10, 0, i, 0, i, 0);
    }
    common(kTen, "it's.quoted", kelvo::APPS_CPU, 5, 0, 5, 0, 1, 0, 1, 0);
    network(kTen, "modem_idle", kelvo::APPS_MODEM, 1000, 0);
    AppsAccounting::getInstance()->balanceAccount();
    mStorage->flushAllEntries();

    ASSERT_EQ(0, AppsAccounting::getInstance()->uploadHourlyAppsAccounting(kTen + kHour, 0.5f));
    Json::Value e = sentEvent();
    EXPECT_EQ(903001061u, e["event"].asUInt());
    // Field 2 holds the largest consumer, the idle modem: unscaled.
    EXPECT_EQ("modem_idle", e["params"]["2"]["params"]["15"]["params"]["0"].asString());
    EXPECT_EQ(1000, e["params"]["2"]["params"]["10"]["params"]["4"].asInt64());
    // Then com.app12 with its CPU energy scaled by one half.
    EXPECT_EQ("com.app12", e["params"]["3"]["params"]["15"]["params"]["0"].asString());
    const Json::Value& cpu = e["params"]["3"]["params"]["2"]["params"];
    EXPECT_EQ(60, cpu["4"].asInt64());
    EXPECT_EQ(12, cpu["5"].asInt64());
    EXPECT_EQ(60, cpu["0"].asInt64());
    EXPECT_FALSE(cpu.isMember("6")); // no background time
    EXPECT_TRUE(e["params"].isMember("11"));
    EXPECT_FALSE(e["params"].isMember("12")); // ten applications only

    // An hour without a battery report has ratio 0: energies go unscaled,
    // never to 0.
    ASSERT_EQ(0, AppsAccounting::getInstance()->uploadHourlyAppsAccounting(kTen + kHour, 0.0f));
    EXPECT_EQ(120, sentEvent()["params"]["3"]["params"]["2"]["params"]["4"].asInt64());

    // The daily upload takes twenty, the quoted name included, and notes
    // the names in the power log.
    ASSERT_EQ(0, AppsAccounting::getInstance()->uploadDailyAppsAccounting(kTen + kHour, 1.0f));
    e = sentEvent();
    EXPECT_EQ(903001051u, e["event"].asUInt());
    EXPECT_EQ("com.app1", e["params"]["14"]["params"]["15"]["params"]["0"].asString());
    EXPECT_EQ("it's.quoted", e["params"]["15"]["params"]["15"]["params"]["0"].asString());
    std::string power = mRoot->readFile(KELVO_POWER_LOG_FILE);
    EXPECT_NE(std::string::npos, power.find("\t215\t\tapps\tmodem_idle#com.app12#com.app11#"));
}

TEST_F(AppsAccountingTest, PackageStrategiesAreLoadedOnceAndAFailureLoggedOnce) {
    kelvo::PackageProperty* property = kelvo::PackageProperty::getInstance();
    property->clearPackageStrategy();
    kelvo::test::LogCapture log;
    // No strategy table yet: one failed load, logged once, not retried.
    EXPECT_EQ(-17, property->getPackageStrategy(String8("com.a")));
    EXPECT_EQ(-17, property->getPackageStrategy(String8("com.b")));
    EXPECT_EQ(1u, log.count("Failed to query package strategy", ANDROID_LOG_ERROR));
    EXPECT_EQ(1u, log.count("raw_pelmora_strategy", ANDROID_LOG_ERROR));

    DirectDb db(dbPath());
    ASSERT_EQ(SQLITE_OK, db.exec("CREATE TABLE raw_pelmora_strategy (name TEXT, type INTEGER); "
                                 "INSERT INTO raw_pelmora_strategy VALUES ('com.a', 3)"));
    property->clearPackageStrategy();
    EXPECT_EQ(3, property->getPackageStrategy(String8("com.a")));
    // Loaded: the table is not asked again.
    ASSERT_EQ(SQLITE_OK, db.exec("DROP TABLE raw_pelmora_strategy"));
    EXPECT_EQ(0, property->getPackageStrategy(String8("com.b")));
    EXPECT_EQ(3, property->getPackageStrategy(String8("com.a")));
    EXPECT_EQ(1u, log.count("Failed to query package strategy", ANDROID_LOG_ERROR));
    property->clearPackageStrategy();
}
