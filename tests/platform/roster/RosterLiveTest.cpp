#include <algorithm>
#include <mutex>

#include "platform/foundation/Dispatch.h"
#include "platform/roster/RosterFixture.h"
#include "platform/tessel/NotificationCenter.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;

/// The registry as it follows its sources, and a listener that waits for what it is told.
class RosterLiveTest : public RosterSourcesTest {
protected:
    RosterLiveTest() {
        folder_.folder("entries");
        workspace().start(sources_);
        for (const auto name : {kApplicationRegisteredNotification, kApplicationUnregisteredNotification})
            NotificationCenter::distributedCenter()->addObserver(this, heard, name,
                                                                 SuspensionBehavior::deliverImmediately);
    }
    ~RosterLiveTest() override {
        NotificationCenter::distributedCenter()->removeEveryObserver(this);
        workspace().stop();
    }
    static RoApplicationWorkspace& workspace() { return RoApplicationWorkspace::defaultWorkspace(); }

    static void heard(const void* observer, std::string_view name) {
        auto& test = *const_cast<RosterLiveTest*>(static_cast<const RosterLiveTest*>(observer));
        (name == kApplicationRegisteredNotification ? test.registered_ : test.unregistered_).signal();
    }
    static std::shared_ptr<const RoApplicationProxy> application(const std::string& identifier) {
        return RoApplicationProxy::applicationProxyForIdentifier(identifier);
    }

    DispatchSemaphore registered_{0};
    DispatchSemaphore unregistered_{0};
};

TEST_F(RosterLiveTest, anEntryThatIsDroppedInIsRegisteredAndOneThatGoesUnregistered) {
    installEntry("a", entry("A"));
    registered_.wait();
    ASSERT_TRUE(application("a"));
    EXPECT_EQ(application("a")->localizedName(), "A");
    fs::remove(folder_ / "entries/a.desktop");
    unregistered_.wait();
    EXPECT_FALSE(application("a"));
}

TEST_F(RosterLiveTest, flatpaksInstallationsAreFollowed) {
    user_.install("a", FlatpakTree::named("a", "Before"));
    registered_.wait();
    ASSERT_TRUE(application("a"));
    auto deployment = FlatpakTree::named("a", "After");
    deployment.commit = "2c3d";
    user_.install("a", deployment);
    while (application("a")->localizedName() != "After") registered_.wait();
    makeContainer("a");
    while (!application("a")->dataContainerURL()) registered_.wait();
    fs::remove_all(folder_ / "home/.var/app/a");
    while (application("a")->dataContainerURL()) registered_.wait();
    user_.uninstall("a");
    while (application("a")) unregistered_.wait();
}

TEST_F(RosterLiveTest, answersWhoseContainerAURLIsIn) {
    user_.install("a", FlatpakTree::named("a", "A"));
    const std::string container = makeContainer("a");
    while (!application("a") || !application("a")->dataContainerURL()) registered_.wait();
    const auto record = application("a");
    const auto at = [](const std::string& path) { return RoBundleProxy::proxyAt(KsURL::fileURL(path)); };
    const auto containing = [](const std::string& path) {
        return RoBundleProxy::proxyWithContaining(KsURL::fileURL(path));
    };
    EXPECT_EQ(at(container), record);
    EXPECT_EQ(at(container + "/Documents"), record);
    EXPECT_EQ(at(container + "/Documents/Documents"), nullptr);
    EXPECT_EQ(at(container + "/cache"), nullptr);
    EXPECT_EQ(at(container + "2"), nullptr);
    EXPECT_EQ(at("/Documents"), nullptr);
    EXPECT_EQ(containing(container), record);
    EXPECT_EQ(containing(container + "/Documents/a/b"), record);
    EXPECT_EQ(containing(container + "2/a"), nullptr);
    EXPECT_EQ(containing(container + "/../b"), nullptr);
    EXPECT_EQ(RoBundleProxy::bundleProxyForIdentifier("a"), record);
    EXPECT_EQ(RoBundleProxy::bundleProxyForIdentifier(""), nullptr);

    // The provider's own container may hold those of applications: the innermost counts.
    const auto own =
        std::make_shared<const RoBundleProxy>(RoBundleProxy::Values{"own", KsURL::fileURL(folder_ / "home"), "Own"});
    workspace().setOwnRecord(own);
    EXPECT_EQ(containing(container + "/Documents/x"), record);
    EXPECT_EQ(containing(folder_ / "home/Documents/x"), own);
    EXPECT_EQ(containing(folder_ / "home/x/../y"), nullptr);
    EXPECT_EQ(at(folder_ / "home"), nullptr);
    workspace().setOwnRecord(nullptr);
}

// What lists its documents goes by the list of before until it has a new one.
TEST_F(RosterLiveTest, whereAnApplicationWasIsKnownUntilItsTypeIsEnumerated) {
    user_.install("a", FlatpakTree::named("a", "A"));
    const std::string container = makeContainer("a");
    while (!application("a") || !application("a")->dataContainerURL()) registered_.wait();
    const auto record = application("a");
    const auto url = KsURL::fileURL(container + "/Documents");
    const auto enumerate = [](unsigned type) { workspace().enumerateApplicationsOfType(type, [](const auto&) {}); };
    user_.uninstall("a");
    while (application("a")) unregistered_.wait();
    EXPECT_EQ(RoBundleProxy::proxyAt(url), record);
    EXPECT_EQ(RoBundleProxy::proxyWithContaining(url), record);
    EXPECT_EQ(RoBundleProxy::bundleProxyForIdentifier("a"), nullptr);
    enumerate(2);
    EXPECT_EQ(RoBundleProxy::proxyAt(url), record);

    auto again = FlatpakTree::named("a", "Again");
    again.commit = "2c3d";
    user_.install("a", again);
    while (!application("a")) registered_.wait();
    EXPECT_EQ(RoBundleProxy::proxyAt(url), application("a"));
    user_.uninstall("a");
    while (application("a")) unregistered_.wait();
    EXPECT_EQ(RoBundleProxy::proxyAt(url)->localizedName(), "Again");
    enumerate(0);
    EXPECT_EQ(RoBundleProxy::proxyAt(url), nullptr);
    EXPECT_EQ(RoBundleProxy::proxyWithContaining(url), nullptr);
}

TEST_F(RosterLiveTest, enumeratesByType) {
    installEntry("entry", entry("E"));
    user_.install("mine", FlatpakTree::named("mine", "M"));
    while (!application("entry") || !application("mine")) registered_.wait();
    const auto ofType = [](unsigned type) {
        std::vector<std::string> identifiers;
        workspace().enumerateApplicationsOfType(
            type, [&](const auto& record) { identifiers.push_back(record->bundleIdentifier()); });
        return identifiers;
    };
    EXPECT_EQ(ofType(0), std::vector<std::string>{"mine"});
    EXPECT_EQ(ofType(1), std::vector<std::string>());
    EXPECT_EQ(ofType(2), std::vector<std::string>{"entry"});
}

TEST_F(RosterLiveTest, theLastStateIsReachedAfterABurst) {
    for (int i = 0; i < 200; ++i) installEntry("app" + std::to_string(i), entry("A"));
    for (int i = 0; i < 200; i += 2) fs::remove(folder_ / ("entries/app" + std::to_string(i) + ".desktop"));
    installEntry("last", entry("Last"));
    while (!application("last") || workspace().applications().size() != 101) registered_.wait();
    EXPECT_FALSE(application("app0"));
    EXPECT_TRUE(application("app199"));
}

TEST_F(RosterLiveTest, nothingIsInstalledOnceItIsStopped) {
    installEntry("a", entry("A"));
    registered_.wait();
    workspace().stop();
    EXPECT_TRUE(workspace().applications().empty());
    installEntry("b", entry("B"));
    EXPECT_FALSE(application("b"));
    workspace().start(sources_);
    EXPECT_TRUE(application("a"));
    EXPECT_TRUE(application("b"));
}

TEST(RoBundleProxy, comesBackFromAnArchive) {
    RoBundleProxy::Values values{"org.example.A", KsURL::fileURL("/home/u/\xff%"), "Na\xffme"};
    const auto back = RoBundleProxy::unarchived(RoBundleProxy(values).archived());
    ASSERT_TRUE(back);
    EXPECT_EQ(back->bundleIdentifier(), values.bundleIdentifier);
    EXPECT_EQ(back->dataContainerURL(), values.dataContainerURL);
    EXPECT_EQ(back->localizedName(), values.localizedName);
    values.dataContainerURL.reset();
    EXPECT_EQ(RoBundleProxy::unarchived(RoBundleProxy(values).archived())->dataContainerURL(), std::nullopt);
}

TEST(RoBundleProxy, anythingElseIsNoArchive) {
    const PropertyList whole = RoBundleProxy(RoBundleProxy::Values{"a", KsURL::fileURL("/x"), "A"}).archived();
    for (const auto& [key, value] : *whole.dictionary()) {
        PropertyList::Dictionary changed = *whole.dictionary();
        changed.insert_or_assign(key, PropertyList(std::uint64_t{7}));
        EXPECT_EQ(RoBundleProxy::unarchived(changed), nullptr) << key;
        changed.erase(key);
        EXPECT_EQ(RoBundleProxy::unarchived(changed) == nullptr, key != "dataContainerURL") << key;
    }
    PropertyList::Dictionary other = *whole.dictionary();
    other.insert_or_assign("class", PropertyList("RoApplicationProxy"));
    EXPECT_EQ(RoBundleProxy::unarchived(other), nullptr);
    other = *whole.dictionary();
    other.insert_or_assign("dataContainerURL", PropertyList("https://x/"));
    EXPECT_EQ(RoBundleProxy::unarchived(other), nullptr);
    EXPECT_EQ(RoBundleProxy::unarchived(PropertyList("a")), nullptr);
}

}  // namespace
}  // namespace cindral::test
