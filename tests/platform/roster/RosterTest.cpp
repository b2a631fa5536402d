#include "platform/roster/Roster.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

namespace cindral {
namespace {

class RosterTest : public ::testing::Test {
protected:
    ~RosterTest() override { workspace().setOwnRecord(nullptr); }

    static RoApplicationWorkspace& workspace() { return RoApplicationWorkspace::defaultWorkspace(); }

    static std::shared_ptr<const RoBundleProxy> recordAt(std::string container) {
        return std::make_shared<const RoBundleProxy>(
            RoBundleProxy::Values{"com.vemra.TesselKit", KsURL::fileURL(std::move(container)), "On This Computer"});
    }

    void setOwnContainer(std::string container) {
        own_ = recordAt(std::move(container));
        workspace().setOwnRecord(own_);
    }

    /// Whether the own record is said to contain the path.
    bool contains(std::string path) const {
        const auto found = RoBundleProxy::proxyWithContaining(KsURL::fileURL(std::move(path)));
        EXPECT_TRUE(found == nullptr || found == own_);
        return found != nullptr;
    }

    std::shared_ptr<const RoBundleProxy> own_;
};

TEST_F(RosterTest, knowsNoRecordBeforeTheHostSetsOne) {
    EXPECT_EQ(workspace().ownRecord(), nullptr);
    EXPECT_FALSE(contains("/home/u/Documents"));
}

TEST(RoApplicationProxy, saysWhetherItsDocumentsArePublished) {
    using Publication = RoApplicationProxy::Publication;
    const auto publication = [](const std::optional<PropertyList::Dictionary>& info, bool hasContainer = true) {
        RoBundleProxy::Values values{"a", std::nullopt, "A", info};
        if (hasContainer) values.dataContainerURL = KsURL::fileURL("/data/a");
        return RoApplicationProxy(values).publication();
    };
    EXPECT_EQ(publication(PropertyList::Dictionary{{kSupportsDocumentBrowserKey, true}}), Publication::published);
    EXPECT_EQ(
        publication(PropertyList::Dictionary{
            {kSupportsDocumentBrowserKey, false}, {kSupportsOpenInPlaceKey, true}, {kFileSharingEnabledKey, true}}),
        Publication::published);
    EXPECT_EQ(publication(PropertyList::Dictionary{{kSupportsOpenInPlaceKey, true}}), Publication::isNotAskedFor);
    EXPECT_EQ(publication(PropertyList::Dictionary{{kFileSharingEnabledKey, true}}), Publication::isNotAskedFor);
    EXPECT_EQ(publication(PropertyList::Dictionary{{kSupportsDocumentBrowserKey, "true"}}), Publication::isNotAskedFor);
    EXPECT_EQ(publication(PropertyList::Dictionary()), Publication::isNotAskedFor);
    EXPECT_EQ(publication(std::nullopt), Publication::cannotBeRead);
    EXPECT_EQ(publication(PropertyList::Dictionary{{kSupportsDocumentBrowserKey, true}}, false),
              Publication::hasNoDataContainer);
}

TEST_F(RosterTest, handsOutTheOwnRecord) {
    setOwnContainer("/home/u");
    EXPECT_EQ(workspace().ownRecord(), own_);
    workspace().setOwnRecord(nullptr);
    EXPECT_EQ(workspace().ownRecord(), nullptr);
    EXPECT_FALSE(contains("/home/u/Documents"));
}

TEST_F(RosterTest, theOwnContainerContainsItselfAndWhatIsBelow) {
    setOwnContainer("/home/u");
    EXPECT_TRUE(contains("/home/u"));
    EXPECT_TRUE(contains("/home/u/Documents"));
    EXPECT_TRUE(contains("/home/u/Documents/a/b/c.txt"));
    EXPECT_TRUE(contains("/home/u/..."));
    EXPECT_TRUE(contains("/home/u/..a/b.."));
}

TEST_F(RosterTest, comparesWholeComponents) {
    setOwnContainer("/home/u");
    EXPECT_FALSE(contains("/home/u2"));
    EXPECT_FALSE(contains("/home/u2/Documents"));
    EXPECT_FALSE(contains("/home/U"));
    EXPECT_FALSE(contains("/home"));
    EXPECT_FALSE(contains("/"));
    EXPECT_FALSE(contains("/other/home/u"));
}

TEST_F(RosterTest, aPathThatClimbsIsNotContained) {
    setOwnContainer("/home/u");
    EXPECT_FALSE(contains("/home/u/.."));
    EXPECT_FALSE(contains("/home/u/../v/secret"));
    EXPECT_FALSE(contains("/home/u/.../../.."));
}

TEST_F(RosterTest, theTopDirectoryContainsEverything) {
    setOwnContainer("/");
    EXPECT_TRUE(contains("/"));
    EXPECT_TRUE(contains("/home/u"));
    EXPECT_FALSE(contains("/home/../u"));
}

TEST_F(RosterTest, containsNoURLThatIsNoFile) {
    setOwnContainer("/home/u");
    const auto url = KsURL::parse("https://example.org/home/u");
    ASSERT_TRUE(url);
    EXPECT_EQ(RoBundleProxy::proxyWithContaining(*url), nullptr);
}

TEST_F(RosterTest, aRecordWithoutAContainerContainsNothing) {
    workspace().setOwnRecord(
        std::make_shared<const RoBundleProxy>(RoBundleProxy::Values{"com.vemra.TesselKit", std::nullopt, "x"}));
    EXPECT_FALSE(contains("/home/u"));
    EXPECT_NE(workspace().ownRecord(), nullptr);
}

// The provider's own record answers for paths alone: it is no application to be listed.
TEST_F(RosterTest, theOwnRecordIsNoApplication) {
    setOwnContainer("/home/u");
    EXPECT_EQ(RoBundleProxy::bundleProxyForIdentifier("com.vemra.TesselKit"), nullptr);
    EXPECT_EQ(RoBundleProxy::proxyAt(KsURL::fileURL("/home/u")), nullptr);
    EXPECT_EQ(RoBundleProxy::proxyAt(KsURL::fileURL("/home/u/Documents")), nullptr);
    for (const unsigned type : {0U, 1U, 2U}) {
        workspace().enumerateApplicationsOfType(type,
                                                [](const auto& record) { ADD_FAILURE() << record->description(); });
    }
}

TEST_F(RosterTest, describesARecord) {
    EXPECT_EQ(recordAt("/home/u")->description(), "com.vemra.TesselKit (\"On This Computer\")");
}

TEST_F(RosterTest, isReadWhileTheRecordIsReplaced) {
    std::atomic<bool> ends = false;
    std::atomic<std::uint64_t> found = 0;
    std::thread reader([&] {
        const KsURL url = KsURL::fileURL("/home/u/Documents/a");
        while (!ends) {
            const auto record = RoBundleProxy::proxyWithContaining(url);
            if (record != nullptr && record->dataContainerURL()->path() == "/home/u") ++found;
        }
    });
    for (int i = 0; i < 100; ++i) {
        workspace().setOwnRecord(recordAt("/home/u"));
        const std::uint64_t before = found;
        while (found == before) std::this_thread::yield();
        workspace().setOwnRecord(nullptr);
    }
    ends = true;
    reader.join();
}

}  // namespace
}  // namespace cindral
