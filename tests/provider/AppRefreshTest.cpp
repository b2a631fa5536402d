#include "provider/AppRefresh.h"

#include <gtest/gtest.h>

#include "platform/tessel/TSPacer.h"
#include "provider/AppLibraryFixture.h"

namespace cindral::test {
namespace {

using Identifiers = std::vector<TesselItemIdentifier>;

class AppRefreshTest : public AppLibraryTest {
protected:
    /// What a refresh signals.
    Identifiers signalled() {
        const std::size_t before = host_->signalled().size();
        refreshApps([] {});
        const Identifiers all = host_->signalled();
        return {all.begin() + static_cast<std::ptrdiff_t>(before), all.end()};
    }
};

TEST_F(AppRefreshTest, aNewListIsSignalledToTheRootAndTheWorkingSet) {
    install("a");
    EXPECT_EQ(signalled(), (Identifiers{kTesselRootContainerItemIdentifier, kTesselWorkingSetContainerItemIdentifier}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] auto-upgrading shared app library manager"));
    EXPECT_TRUE(log_.contains(LogLevel::info, "[INFO] notify changes on TesselRootContainerItemIdentifier"));
    EXPECT_TRUE(log_.contains(LogLevel::info, "[INFO] notify changes on TesselWorkingSetContainerItemIdentifier"));
}

TEST_F(AppRefreshTest, theSameListIsSignalledToNobody) {
    install("a");
    (void)signalled();
    EXPECT_EQ(signalled(), Identifiers());
    EXPECT_EQ(log_.count("auto-upgrading shared app library manager"), 2U);
}

// As after a process that ended between the two: the main cache has the list already, the process's own does not.
TEST_F(AppRefreshTest, whatOnlyTheWorkingSetLacksIsSignalledToItAlone) {
    install("a");
    ASSERT_TRUE(LocalAppLibraryManager::refreshAppLibraries());
    EXPECT_EQ(signalled(), Identifiers{kTesselWorkingSetContainerItemIdentifier});
    EXPECT_EQ(log_.count("notify changes on TesselRootContainerItemIdentifier"), 0U);
}

TEST_F(AppRefreshTest, itsQueueBearsItsName) {
    EXPECT_EQ(LocalAppLibraryManager::backgroundQueue().label(), "cindral.app-library.background");
    EXPECT_EQ(LocalAppLibraryManager::shared()->queueLabel(), "cindral.app-library-manager");
    EXPECT_EQ(manager(kMain)->queueLabel(), "cindral.app-library-manager");
}

}  // namespace
}  // namespace cindral::test
