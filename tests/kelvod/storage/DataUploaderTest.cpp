#include "HealthCounters.h"
#include "KelvoLog.h"
#include "kelvo/ZendrelHost.h"
#include "kelvod/storage/StorageTestUtil.h"
#include "storage/DataUploader.h"

using android::Parcel;
using kelvo::DataUploader;
using kelvo::ZendrelHost;
using kelvo::test::LogCapture;

namespace {

class DataUploaderTest : public kelvo::test::AgentStorageTest {
protected:
    void addTables() override {
        mUploader->addSchemaTable();
        ZendrelHost::clearFailures();
        mLiveBefore = ZendrelHost::liveObjects();
    }
    void TearDown() override {
        AgentStorageTest::TearDown();
        ZendrelHost::clearFailures();
    }
    std::vector<std::string> results() {
        return rows("SELECT eventid || ':' || result FROM debug_upload_result ORDER BY id");
    }

    DataUploader* mUploader = DataUploader::getInstance();
    int32_t mLiveBefore = 0;
};

} // namespace

TEST_F(DataUploaderTest, NestedClassesArraysAndTextsArriveIntact) {
    Parcel first;
    DataUploader::formIntData(3, 42, first);
    DataUploader::formVarcharData(4, "com.example.app", 64, first);
    Parcel element;
    DataUploader::formIntData(0, 7, element);
    DataUploader::formVarcharData(1, "gnss", 8, element);
    Parcel other;
    DataUploader::formIntData(0, 8, other);
    Parcel klass;
    DataUploader::formIntData(2, -5, klass);
    DataUploader::formClassData(5, 903009021, klass, first);
    DataUploader::formClassArray(6, 903009022, element, first);
    DataUploader::formClassArray(6, 903009022, other, first);
    DataUploader::formDynamicPathData("/data/log/kelvo/upload/kelvo-1.db", 128, first);
    ASSERT_EQ(0, mUploader->setEventData(kelvo::EVENT_HOURLY_COMPONENTS, first, true));
    // Accumulated: a second operator adds to the same event.
    Parcel second;
    DataUploader::formDatetimeData(0, 0, second);
    ASSERT_EQ(0, mUploader->setEventData(kelvo::EVENT_HOURLY_COMPONENTS, second, false));
    EXPECT_TRUE(events().empty());
    EXPECT_EQ(0, mUploader->uploadEvent());

    std::vector<Json::Value> sent = events();
    ASSERT_EQ(1u, sent.size());
    const Json::Value& e = sent[0];
    EXPECT_EQ(903001060u, e["event"].asUInt());
    EXPECT_EQ(42, e["params"]["3"].asInt64());
    EXPECT_EQ("com.example.app", e["params"]["4"].asString());
    EXPECT_EQ(903009021u, e["params"]["5"]["class"].asUInt());
    EXPECT_EQ(-5, e["params"]["5"]["params"]["2"].asInt64());
    ASSERT_EQ(2u, e["params"]["6"].size());
    EXPECT_EQ(7, e["params"]["6"][0]["params"]["0"].asInt64());
    EXPECT_EQ("gnss", e["params"]["6"][0]["params"]["1"].asString());
    EXPECT_EQ(8, e["params"]["6"][1]["params"]["0"].asInt64());
    EXPECT_EQ("/data/log/kelvo/upload/kelvo-1.db", e["dynamic_paths"][0].asString());
    EXPECT_EQ(19u, e["params"]["0"].asString().size());
    EXPECT_EQ(std::vector<std::string>{"903001060:0"}, results());
    // Children are freed right after they are attached; the event after it is sent.
    EXPECT_EQ(mLiveBefore, ZendrelHost::liveObjects());
}

TEST_F(DataUploaderTest, BrokenParcelsDiscardTheEventAndNeverReadPastTheData) {
    Parcel good;
    DataUploader::formIntData(0, 1, good);
    ASSERT_EQ(0, mUploader->setEventData(kelvo::EVENT_DAILY_COMPONENTS, good, true));

    LogCapture log;
    Parcel bad;
    DataUploader::formIntData(1, 2, bad);
    bad.writeUint32(2);
    bad.writeInt32(5); // unknown kind
    EXPECT_EQ(-21, mUploader->setEventData(kelvo::EVENT_DAILY_COMPONENTS, bad, true));
    EXPECT_TRUE(log.contains("Unknown upload type: 5"));

    // A nested length beyond the data left.
    Parcel lying;
    lying.writeUint32(3);
    lying.writeInt32(kelvo::UPLOAD_CLASS);
    lying.writeUint32(903009021);
    lying.writeUint32(4096);
    lying.writeInt64(1);
    EXPECT_EQ(-21, mUploader->setEventData(kelvo::EVENT_DAILY_APPLICATIONS, lying, true));
    EXPECT_TRUE(log.contains("Invalid nested length"));

    // A text without its terminator.
    Parcel unterminated;
    unterminated.writeUint32(4);
    unterminated.writeInt32(kelvo::UPLOAD_TEXT);
    unterminated.write("abcd", 4);
    EXPECT_EQ(-21, mUploader->setEventData(kelvo::EVENT_DAILY_USERS, unterminated, true));

    // Nothing is added to an event nobody started, and no data starts none.
    Parcel p;
    DataUploader::formIntData(0, 1, p);
    EXPECT_EQ(0, mUploader->setEventData(kelvo::EVENT_DAILY_SYSTEM, p, false));
    Parcel empty;
    EXPECT_EQ(0, mUploader->setEventData(kelvo::EVENT_DAILY_SYSTEM, empty, true));

    // The discarded event is gone with what it held: nothing is sent.
    EXPECT_EQ(0, mUploader->uploadEvent());
    EXPECT_TRUE(events().empty());
    EXPECT_TRUE(results().empty());
    EXPECT_EQ(mLiveBefore, ZendrelHost::liveObjects());
}

TEST_F(DataUploaderTest, LibraryFailuresAreRecordedAndNotReportedAsSuccess) {
    ZendrelHost::failCall(ZendrelHost::CALL_SEND, kelvo::EVENT_THERMAL_ABNORMALITY);
    Parcel p;
    DataUploader::formIntData(0, 1, p);
    LogCapture log;
    uint64_t failures = kelvo::HealthCounters::get(kelvo::Health::UploadFailures);
    EXPECT_EQ(-22, mUploader->setAndUploadEvent(kelvo::EVENT_THERMAL_ABNORMALITY, p, true));
    EXPECT_EQ(failures + 1, kelvo::HealthCounters::get(kelvo::Health::UploadFailures));
    EXPECT_TRUE(log.contains("Failed to send event: 903002050"));
    EXPECT_FALSE(log.contains("Upload eventid(903002050) success"));

    ZendrelHost::failCall(ZendrelHost::CALL_CREATE, 903009030);
    Parcel earlier;
    DataUploader::formIntData(0, 5, earlier);
    ASSERT_EQ(0, mUploader->setEventData(kelvo::EVENT_HOURLY_COMPONENTS, earlier, true));
    Parcel child;
    DataUploader::formIntData(0, 9, child);
    Parcel withChild;
    DataUploader::formIntData(1, 1, withChild);
    DataUploader::formClassData(2, 903009030, child, withChild);
    DataUploader::formIntData(3, 3, withChild);
    // A child that cannot be made costs only its own record: the event keeps
    // what other senders gathered and the records after it.
    uint64_t refused = kelvo::HealthCounters::get(kelvo::Health::UploadRecordsRefused);
    EXPECT_EQ(-21, mUploader->setEventData(kelvo::EVENT_HOURLY_COMPONENTS, withChild, false));
    EXPECT_EQ(refused + 1, kelvo::HealthCounters::get(kelvo::Health::UploadRecordsRefused));

    Parcel ok;
    DataUploader::formIntData(0, 2, ok);
    EXPECT_EQ(0, mUploader->setAndUploadEvent(kelvo::EVENT_THERMAL_SCENE, ok, true));
    EXPECT_EQ(0, mUploader->uploadEvent());
    EXPECT_EQ((std::vector<std::string>{"903002050:-1", "903001055:0", "903001060:0"}),
              results());
    std::vector<Json::Value> sent = events();
    ASSERT_FALSE(sent.empty());
    Json::Value kept = sent.back()["params"];
    EXPECT_EQ(5, kept["0"].asInt64());
    EXPECT_EQ(1, kept["1"].asInt64());
    EXPECT_FALSE(kept.isMember("2"));
    EXPECT_EQ(3, kept["3"].asInt64());
}

TEST_F(DataUploaderTest, DailyDatabaseCopyIsAnnouncedWithItsDay) {
    // The file manager's daily work on a beta device.
    kelvo::gLogUserType.store(3);
    mStorage->cleanDatabase(2 * 86400000LL);
    mStorage->flushAllEntries();
    kelvo::gLogUserType.store(-1);
    std::vector<Json::Value> sent = events();
    ASSERT_EQ(1u, sent.size());
    EXPECT_EQ(903999001u, sent[0]["event"].asUInt());
    EXPECT_TRUE(sent[0]["params"].isMember("0"));
    EXPECT_TRUE(sent[0]["params"].isMember("1"));
    EXPECT_NE(sent[0]["params"]["0"].asString(), sent[0]["params"]["1"].asString());
}
