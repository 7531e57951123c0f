#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>
#include <ziparchive/zip_writer.h>

#include <map>
#include <string>
#include <vector>

#include "common/TestEnv.h"
#include "utils/ZipUtils.h"

using kelvo::ZipUtils;
using namespace kelvo::test;

namespace {

constexpr int64_t kNoLimit = 1 << 30;

// A zip with entries named at will, as a hostile or broken one could be.
void craftZip(const std::string& path,
              const std::vector<std::pair<std::string, std::string>>& entries) {
    FILE* fp = fopen(path.c_str(), "wb");
    ASSERT_NE(nullptr, fp);
    {
        ZipWriter writer(fp);
        for (const auto& entry : entries) {
            ASSERT_EQ(0, writer.StartEntry(entry.first, ZipWriter::kCompress));
            ASSERT_EQ(0, writer.WriteBytes(entry.second.data(), entry.second.size()));
            ASSERT_EQ(0, writer.FinishEntry());
        }
        ASSERT_EQ(0, writer.Finish());
    }
    fclose(fp);
}

class ZipUtilsTest : public ::testing::Test {
protected:
    void SetUp() override {
        mDir = mRoot.path() + "/work";
        mDest = mRoot.path() + "/dest";
        mkdir(mDir.c_str(), 0775);
        mkdir(mDest.c_str(), 0775);
    }

    TempRoot mRoot;
    LogCapture mLog;
    std::string mDir;
    std::string mDest;
};

} // namespace

TEST_F(ZipUtilsTest, ZippedFilesComeBackUnchanged) {
    std::string big;
    for (int i = 0; i < 5000; ++i) {
        big += std::to_string(i * 7919 % 104729) + ",";
    }
    writeHostFile(mDir + "/kelvo-1.db", big);
    writeHostFile(mDir + "/kelvo-2.db", "");
    writeHostFile(mDir + "/notes.txt", "not a database");
    std::string zip = mDir + "/out.zip";

    ASSERT_EQ(0, ZipUtils::zipFiles(
                     zip.c_str(), {mDir + "/kelvo-1.db", mDir + "/kelvo-2.db", mDir + "/notes.txt"},
                     false));
    std::map<std::string, std::string> entries = readZip(zip);
    ASSERT_EQ(3u, entries.size());
    EXPECT_EQ(big, entries["kelvo-1.db"]);
    EXPECT_EQ("", entries["kelvo-2.db"]);

    // Only the entries with the suffix are extracted, readable by the group.
    ASSERT_EQ(0, ZipUtils::unzipFiles(zip.c_str(), mDest.c_str(), ".db", kNoLimit));
    EXPECT_EQ(big, readHostFile(mDest + "/kelvo-1.db"));
    EXPECT_TRUE(hostPathExists(mDest + "/kelvo-2.db"));
    EXPECT_FALSE(hostPathExists(mDest + "/notes.txt"));
    struct stat st = {};
    ASSERT_EQ(0, stat((mDest + "/kelvo-1.db").c_str(), &st));
    EXPECT_EQ(0664u, st.st_mode & 0777);

    // With the parent directory kept, the entry carries it.
    std::string withParent = mDir + "/parent.zip";
    ASSERT_EQ(0, ZipUtils::zipFiles(withParent.c_str(), {mDir + "/kelvo-2.db"}, true));
    EXPECT_EQ(1u, readZip(withParent).count("work/kelvo-2.db"));
}

TEST_F(ZipUtilsTest, AZipMissingAFileIsAFailure) {
    writeHostFile(mDir + "/kelvo-1.db", "first");
    std::string zip = mDir + "/out.zip";
    std::string missing = mDir + "/kelvo-2.db";
    EXPECT_EQ(-14, ZipUtils::zipFiles(zip.c_str(), {mDir + "/kelvo-1.db", missing}, false));
    EXPECT_TRUE(mLog.contains("Failed to add file: " + missing, ANDROID_LOG_ERROR));

    EXPECT_EQ(-5, ZipUtils::zipFiles(zip.c_str(), {}, false));
    EXPECT_EQ(-5, ZipUtils::zipFiles(nullptr, {mDir + "/kelvo-1.db"}, false));
    EXPECT_EQ(-14, ZipUtils::zipFiles(zip.c_str(), {mDir + "/"}, false));
    EXPECT_TRUE(mLog.contains("Empty src file name", ANDROID_LOG_ERROR));
    EXPECT_EQ(-14, ZipUtils::zipFiles(zip.c_str(), {""}, false));
    EXPECT_TRUE(mLog.contains("Empty src file", ANDROID_LOG_ERROR));
}

TEST_F(ZipUtilsTest, NeverWritesThroughExistingNames) {
    std::string victim = mRoot.path() + "/victim";
    writeHostFile(victim, "precious");
    writeHostFile(mDir + "/kelvo-1.db", "first");
    std::string softLink = mDir + "/soft.zip";
    std::string hardLink = mDir + "/hard.zip";
    ASSERT_EQ(0, symlink(victim.c_str(), softLink.c_str()));
    ASSERT_EQ(0, link(victim.c_str(), hardLink.c_str()));
    EXPECT_EQ(-14, ZipUtils::zipFiles(softLink.c_str(), {mDir + "/kelvo-1.db"}, false));
    EXPECT_EQ(-14, ZipUtils::zipFiles(hardLink.c_str(), {mDir + "/kelvo-1.db"}, false));

    // Extraction leaves links and other files of the same name alone too.
    std::string zip = mDir + "/in.zip";
    craftZip(zip, {{"linked.db", "payload"}, {"taken.db", "payload"}});
    ASSERT_EQ(0, symlink(victim.c_str(), (mDest + "/linked.db").c_str()));
    writeHostFile(mDest + "/taken.db", "someone else's");
    EXPECT_EQ(-14, ZipUtils::unzipFiles(zip.c_str(), mDest.c_str(), ".db", kNoLimit));
    EXPECT_EQ("someone else's", readHostFile(mDest + "/taken.db"));
    EXPECT_TRUE(hostPathExists(mDest + "/linked.db"));
    EXPECT_EQ("precious", readHostFile(victim));
}

TEST_F(ZipUtilsTest, UnzipRefusesEscapingOrOversizedEntriesAndBrokenZips) {
    std::string zip = mDir + "/hostile.zip";
    craftZip(zip, {{"../x.db", "escape"}, {"a/b.db", "nested"}, {"..", "dots"},
                   {"small.db", std::string(100, 's')}, {"large.db", std::string(4096, 'l')}});
    EXPECT_EQ(-14, ZipUtils::unzipFiles(zip.c_str(), mDest.c_str(), ".db", 1000));
    EXPECT_EQ(std::string(100, 's'), readHostFile(mDest + "/small.db"));
    EXPECT_FALSE(hostPathExists(mRoot.path() + "/x.db"));
    EXPECT_FALSE(hostPathExists(mDest + "/a"));
    EXPECT_EQ(2u, mLog.count("Refuse zip entry", ANDROID_LOG_ERROR));
    EXPECT_FALSE(hostPathExists(mDest + "/large.db"));
    EXPECT_TRUE(mLog.contains("Zip entry is too large: large.db", ANDROID_LOG_ERROR));

    std::string broken = mDir + "/broken.zip";
    writeHostFile(broken, "PK but not really a zip");
    EXPECT_EQ(-14, ZipUtils::unzipFiles(broken.c_str(), mDest.c_str(), ".db", kNoLimit));
    EXPECT_TRUE(mLog.contains("Failed to open zip file: " + broken, ANDROID_LOG_ERROR));
    std::string missing = mDir + "/missing.zip";
    EXPECT_EQ(-14, ZipUtils::unzipFiles(missing.c_str(), mDest.c_str(), ".db", kNoLimit));
}
