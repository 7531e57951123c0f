#pragma once

// A private root with the fake platform services of this process, for the
// tests of the platform service clients.

#include <binder/ServiceControl.h>
#include <gtest/gtest.h>

#include <memory>

#include "PlatformServices.h"
#include "binder/managers/ActivityManager.h"
#include "binder/managers/PackageManager.h"
#include "common/TestEnv.h"

namespace kelvo {
namespace test {

class PlatformServicesFixture : public ::testing::Test {
protected:
    void SetUp() override {
        // A missing service is given up quickly.
        ServiceControl::setServiceWaitMs(300);
        mServices.reset(new PlatformServices());
        ASSERT_EQ(android::NO_ERROR, mServices->startAll());
    }

    void TearDown() override {
        mServices.reset();
        // The clients are process-wide: let them see their services go
        // before the next test starts new ones.
        EXPECT_TRUE(waitFor([] { return !PackageManager::getInstance()->isConnected(); }));
        EXPECT_TRUE(waitFor([] { return !ActivityManager::getInstance()->isConnected(); }));
        ServiceControl::setServiceWaitMs(ServiceControl::kDefaultServiceWaitMs);
    }

    PlatformState& state() { return *mServices->state(); }

    TempRoot mRoot;
    std::unique_ptr<PlatformServices> mServices;
};

} // namespace test
} // namespace kelvo
