#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "kelvod/binder/PlatformServicesFixture.h"
#include "utils/PackageProperty.h"

using android::String8;
using kelvo::PackageProperty;
using kelvo::PlatformState;

namespace {

// Package service code for the packages of a uid (sdk level other than 24).
constexpr uint32_t kPackagesForUid = 34;

std::vector<String8> names(std::initializer_list<const char*> list) {
    return std::vector<String8>(list.begin(), list.end());
}

std::string combined(std::initializer_list<const char*> list) {
    String8 out;
    PackageProperty::combineName(names(list), out);
    return out.string();
}

// The name of a uid, or of a uid's process when a pid is given.
std::string byUid(int32_t uid, int32_t* ret = nullptr, int32_t pid = -1) {
    String8 out;
    PackageProperty* property = PackageProperty::getInstance();
    int32_t r = pid < 0 ? property->queryPackageByUid(uid, out)
                        : property->queryPackageByUidAndPid(uid, pid, out);
    if (ret != nullptr) *ret = r;
    return out.string();
}

} // namespace

TEST(PackagePropertyNames, CombinesAtMostThreeSortedNames) {
    EXPECT_EQ("a|b|c|more...", combined({"b", "a", "c", "d"}));
    EXPECT_EQ("a|a.b", combined({"a.b", "a"}));
    // "b" is already inside "ab".
    EXPECT_EQ("ab", combined({"ab", "b"}));
    EXPECT_EQ("", combined({}));
}

class PackagePropertyTest : public kelvo::test::PlatformServicesFixture {
protected:
    void TearDown() override {
        // The cache is process-wide: forget what the tests filled.
        for (int32_t uid : mUids) {
            PackageProperty::getInstance()->removeUid(uid);
        }
        PlatformServicesFixture::TearDown();
    }
    // A uid this test owns.
    int32_t use(int32_t uid) {
        mUids.push_back(uid);
        PackageProperty::getInstance()->removeUid(uid);
        return uid;
    }
    std::vector<int32_t> mUids;
};

TEST_F(PackagePropertyTest, NamesAUidFromThePackageServiceAndCachesIt) {
    int32_t uid = use(10061);
    state().setPackages(uid, {"com.example.mail"});
    EXPECT_EQ("com.example.mail", byUid(uid));
    EXPECT_EQ("com.example.mail", byUid(uid, nullptr, 4321));
    EXPECT_EQ(1, state().calls("package", kPackagesForUid));

    int32_t several = use(10062);
    state().setPackages(several, {"b", "a", "c", "d"});
    EXPECT_EQ("a|b|c|more...", byUid(several));

    int32_t ret = 0;
    int32_t none = use(10063);
    EXPECT_EQ("", byUid(none, &ret));
    EXPECT_EQ(-4, ret);
    // An empty answer is not cached: the service is asked again.
    int32_t before = state().calls("package", kPackagesForUid);
    byUid(none);
    EXPECT_EQ(before + 1, state().calls("package", kPackagesForUid));

    std::vector<String8> out;
    EXPECT_EQ(-5, PackageProperty::getInstance()->queryPackagesByUid(-1, out));
}

TEST_F(PackagePropertyTest, ProcessesAndFixedUidsNameSharedUids) {
    int32_t system = use(1000);
    state().setPackages(system, {"android", "com.example.settings", "com.example.keychain"});
    int32_t radio = use(1001);
    state().setPackages(radio, {"com.example.phone"});
    int32_t shared = use(10070);
    state().setPackages(shared, {"com.example.a", "com.example.b"});
    int32_t isolated = use(99123);
    state().setProcesses({{5001, shared, "com.example.b:sync", {"com.example.b"}},
                          {5002, 10071, "other", {"com.example.other"}},
                          {6001, 10080, "com.example.browser:sandboxed", {"com.example.browser"}}});
    // No CPU handler and no running process: the fixed name wins, unless
    // the fixed uid holds one package.
    EXPECT_EQ("system", byUid(system, nullptr, 1234));
    EXPECT_EQ("com.example.phone", byUid(radio, nullptr, 1234));
    EXPECT_EQ("com.example.b", byUid(shared, nullptr, 5001));
    // A pid of another uid does not count: the packages are combined.
    EXPECT_EQ("com.example.a|com.example.b", byUid(shared, nullptr, 5002));
    // An isolated process is named by its process.
    EXPECT_EQ("com.example.browser", byUid(isolated, nullptr, 6001));
    int32_t ret = 0;
    EXPECT_EQ("", byUid(isolated, &ret, 6002));
    EXPECT_EQ(-4, ret);
}

TEST_F(PackagePropertyTest, AddedAndRemovedPackagesKeepTheCacheTrue) {
    PackageProperty* property = PackageProperty::getInstance();
    int32_t uid = use(1000);
    state().setPackages(uid, {"android", "com.example.settings"});
    // An added package does not hide the others of an uncached uid (the
    // event comes before anything asked for the uid).
    ASSERT_EQ(0, property->addPackage(uid, String8("com.example.new")));
    std::vector<String8> out;
    ASSERT_EQ(0, property->queryPackagesByUid(uid, out));
    EXPECT_EQ(names({"android", "com.example.settings"}), out);
    EXPECT_EQ("system", byUid(uid));

    // Once cached, a new package joins the list without asking again.
    int32_t calls = state().calls("package", kPackagesForUid);
    ASSERT_EQ(0, property->addPackage(uid, String8("com.example.new")));
    ASSERT_EQ(0, property->addPackage(uid, String8("com.example.new")));
    out.clear();
    ASSERT_EQ(0, property->queryPackagesByUid(uid, out));
    EXPECT_EQ(names({"android", "com.example.settings", "com.example.new"}), out);
    EXPECT_EQ(calls, state().calls("package", kPackagesForUid));

    // Removing a package or the uid asks the service again.
    uid = use(10090);
    state().setPackages(uid, {"com.example.old"});
    EXPECT_EQ("com.example.old", byUid(uid));
    calls = state().calls("package", kPackagesForUid);

    // A name the uid does not hold keeps the cache.
    ASSERT_EQ(0, property->removePackage(uid, String8("com.example.other")));
    EXPECT_EQ("com.example.old", byUid(uid));
    EXPECT_EQ(calls, state().calls("package", kPackagesForUid));

    state().setPackages(uid, {"com.example.fresh"});
    ASSERT_EQ(0, property->removePackage(uid, String8("com.example.old")));
    EXPECT_EQ("com.example.fresh", byUid(uid));
    EXPECT_EQ(calls + 1, state().calls("package", kPackagesForUid));

    state().setPackages(uid, {"com.example.newer"});
    ASSERT_EQ(0, property->removeUid(uid));
    EXPECT_EQ("com.example.newer", byUid(uid));
}

TEST_F(PackagePropertyTest, MissingPackageServiceFailsFast) {
    int32_t uid = use(10100);
    ASSERT_EQ(android::NO_ERROR, mServices->stop("package"));
    ASSERT_TRUE(
        kelvo::test::waitFor([] { return !kelvo::PackageManager::getInstance()->isConnected(); }));
    std::vector<String8> out;
    EXPECT_EQ(-2, PackageProperty::getInstance()->queryPackagesByUid(uid, out));
    int32_t ret = 0;
    byUid(uid, &ret, 1);
    EXPECT_EQ(-2, ret);
    // A fixed uid still has its name.
    EXPECT_EQ("bluetooth", byUid(use(1002)));

    ASSERT_EQ(android::NO_ERROR, mServices->start("package"));
    state().setPackages(uid, {"com.example.back"});
    EXPECT_EQ("com.example.back", byUid(uid));
}

TEST_F(PackagePropertyTest, HangingPackageServiceDoesNotBlockCachedLookups) {
    int32_t cached = use(10110);
    int32_t slow = use(10111);
    state().setPackages(cached, {"com.example.cached"});
    state().setPackages(slow, {"com.example.slow"});
    ASSERT_EQ("com.example.cached", byUid(cached));

    state().setDelayMs("package", 2000);
    std::atomic<bool> slowDone(false);
    std::thread asker([&] {
        byUid(slow);
        slowDone = true;
    });
    ASSERT_TRUE(
        kelvo::test::waitFor([&] { return state().calls("package", kPackagesForUid) >= 2; }));
    // The slow question is inside the service now; the cache still answers.
    EXPECT_EQ("com.example.cached", byUid(cached));
    EXPECT_FALSE(slowDone.load());
    asker.join();
    EXPECT_EQ("com.example.slow", byUid(slow));
    state().setDelayMs("package", 0);
}
