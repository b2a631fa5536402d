#include "provider/LocalTesselKit.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <thread>

#include "platform/tessel/NotificationCenter.h"
#include "platform/tessel/TesselManager.h"
#include "provider/AppLibraryFixture.h"
#include "provider/CindralProvider.h"
#include "provider/LocalRootEnumerator.h"
#include "provider/LocalTesselKitError.h"

namespace cindral::test {
namespace {

class LocalTesselKitTest : public ProviderTest {
protected:
    LocalTesselKitTest() {
        TesselManager::defaultManager().setHost(host_);
        provider_ = LocalTesselKit::init();
    }
    ~LocalTesselKitTest() override {
        provider_.reset();
        SerialQueue::main().sync([] {});
        TesselManager::defaultManager().setHost(nullptr);
    }
    std::string identifierOf(std::string_view name) {
        return provider_->persistentIdentifierForItemAtURL(url(name)).value_or("none");
    }

    LogCapture log_;
    std::shared_ptr<RecordingHost> host_ = std::make_shared<RecordingHost>();
    std::shared_ptr<LocalTesselKit> provider_;
};

TEST_F(LocalTesselKitTest, signalsTheWorkingSetOnceAtStart) {
    EXPECT_EQ(host_->signalled(), std::vector<TesselItemIdentifier>{kTesselWorkingSetContainerItemIdentifier});
    EXPECT_TRUE(log_.contains(LogLevel::info,
                              "[INFO] auto notify changes on TesselWorkingSetContainerItemIdentifier at startup"));
    // The signal of the start has had its event, and there was one only.
    provider_->appRefreshQueue().sync([] {});
    EXPECT_FALSE(provider_->appRefreshPacer().isSignalPending());
    EXPECT_EQ(log_.count("pacer event"), 1U);
}

TEST_F(LocalTesselKitTest, itsQueueAndPacerBearTheirNames) {
    EXPECT_EQ(provider_->appRefreshQueue().label(), "cindral.app-refresh.queue");
    EXPECT_EQ(provider_->appRefreshPacer().name(), "cindral.app-refresh.pacer");
}

TEST_F(LocalTesselKitTest, bothRegistryNotificationsSignalThePacer) {
    for (const std::string_view name : {kApplicationRegisteredNotification, kApplicationUnregisteredNotification}) {
        provider_->appRefreshPacer().suspend();
        NotificationCenter::distributedCenter()->post(name);
        EXPECT_TRUE(provider_->appRefreshPacer().isSignalPending()) << name;
    }
}

TEST_F(LocalTesselKitTest, aNotificationAfterTheProviderDoesNothing) {
    // The event of the start is over: what comes after would be another.
    provider_->appRefreshQueue().sync([] {});
    ASSERT_EQ(log_.count("pacer event"), 1U);
    const auto signalled = host_->signalled();
    provider_.reset();
    NotificationCenter::distributedCenter()->post(kApplicationRegisteredNotification);
    SerialQueue::main().sync([] {});
    NotificationCenter::distributedCenter()->post(kApplicationRegisteredNotification);
    EXPECT_EQ(log_.count("pacer event"), 1U);
    EXPECT_EQ(host_->signalled(), signalled);
    // Another provider has its own events: the one that is gone was not kept by a post.
    provider_ = LocalTesselKit::init();
    provider_->appRefreshQueue().sync([] {});
    EXPECT_EQ(log_.count("pacer event"), 2U);
}

TEST_F(LocalTesselKitTest, looksItemsUpByIdentifier) {
    storage_.file("folder/a.txt", "hello");
    const std::string identifier = identifierOf("folder/a.txt");
    const auto item = provider_->itemForIdentifier(identifier);
    ASSERT_TRUE(item.ok());
    EXPECT_EQ((*item)->filename(), "a.txt");
    EXPECT_EQ(provider_->URLForItemWithPersistentIdentifier(identifier), url("folder/a.txt"));
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " fetching item's properties for \"" + identifier + "\""));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] found " + identifier));
}

TEST_F(LocalTesselKitTest, anUnknownIdentifierIsInvalid) {
    for (const std::string identifier :
         {"fid=1", "did=4000000000", "#org.example.Unknown", "#", "", "x", "xid=5", "did=1=2"}) {
        const auto item = provider_->itemForIdentifier(identifier);
        ASSERT_FALSE(item.ok()) << identifier;
        EXPECT_EQ(item.error(), errorFor(LocalTesselKitError::invalidItemIdentifier));
        EXPECT_EQ(item.error().domain(), "CindralProvider.LocalTesselKitError");
        EXPECT_EQ(item.error().code(), 0);
        EXPECT_TRUE(log_.contains(LogLevel::error, "[ERROR] item lookup failed for identifier \"" + identifier + "\""));
        EXPECT_EQ(provider_->URLForItemWithPersistentIdentifier(identifier), std::nullopt);
    }
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't find URL matching identifier fid=1; "));
}

TEST_F(LocalTesselKitTest, identifiersOfAnyLengthAreAnswered) {
    const std::string digits = "did=" + std::string(100'000, '9');
    EXPECT_FALSE(provider_->itemForIdentifier(digits).ok());
    EXPECT_FALSE(provider_->itemForIdentifier(std::string(100'000, '=')).ok());
    EXPECT_FALSE(provider_->enumeratorForContainerItemIdentifier(std::string(100'000, 'x')).ok());
}

TEST_F(LocalTesselKitTest, theWorkingSetIsNoItem) {
    EXPECT_FALSE(provider_->itemForIdentifier(kTesselWorkingSetContainerItemIdentifier).ok());
    EXPECT_TRUE(provider_->itemForIdentifier(kTesselRootContainerItemIdentifier).ok());
}

TEST_F(LocalTesselKitTest, theTemporaryFolderIsMadeWhenAskedFor) {
    const auto item = provider_->itemForIdentifier(kTesselTemporaryLocalFolderItemIdentifier);
    ASSERT_TRUE(item.ok());
    EXPECT_EQ((*item)->filename(), ".TemporaryLocalFolder");
    EXPECT_TRUE(url(".TemporaryLocalFolder").ts_isFolder());
}

TEST_F(LocalTesselKitTest, aURLWithoutAnItemIsNoneSilently) {
    EXPECT_EQ(provider_->persistentIdentifierForItemAtURL(url("missing")), std::nullopt);
    EXPECT_EQ(log_.count("[ERROR]"), 0U);
}

TEST_F(LocalTesselKitTest, aFolderNamedDocumentsIsAnItemLikeAnother) {
    storage_.folder("folder/Documents");
    EXPECT_TRUE(identifierOf("folder/Documents").starts_with("fid="));
}

TEST_F(LocalTesselKitTest, theThreeTopContainersHaveOneClass) {
    for (const auto& container : {kTesselRootContainerItemIdentifier, kTesselWorkingSetContainerItemIdentifier,
                                  kTesselAllDirectoriesContainerItemIdentifier}) {
        const auto enumerator = provider_->enumeratorForContainerItemIdentifier(container);
        ASSERT_TRUE(enumerator.ok());
        const auto* root = dynamic_cast<const LocalRootEnumerator*>(enumerator->get());
        ASSERT_TRUE(root) << container;
        EXPECT_EQ(root->container(), container);
    }
}

TEST_F(LocalTesselKitTest, listsTheRootAndAFolder) {
    storage_.file("a.txt");
    storage_.file("folder/b.txt");
    const auto root = *provider_->enumeratorForContainerItemIdentifier(kTesselRootContainerItemIdentifier);
    EXPECT_EQ(all(*root).size(), 2U);
    const auto folder = *provider_->enumeratorForContainerItemIdentifier(identifierOf("folder"));
    EXPECT_EQ(firstPage(*folder).names(), std::vector<std::string>{"b.txt"});
}

TEST_F(LocalTesselKitTest, anUnknownContainerIsNoSuchItem) {
    const auto enumerator = provider_->enumeratorForContainerItemIdentifier("fid=1");
    ASSERT_FALSE(enumerator.ok());
    EXPECT_TRUE(enumerator.error().is("TesselErrorDomain", -1001));
    EXPECT_EQ(enumerator.error().userInfo().at("identifier"), "fid=1");
}

TEST_F(LocalTesselKitTest, placeholdersSucceedForAnyURL) {
    int calls = 0;
    const auto completion = [&](const std::optional<KsError>& error) {
        EXPECT_FALSE(error);
        ++calls;
    };
    provider_->providePlaceholderAtURL(url("missing"), completion);
    provider_->startProvidingItemAtURL(url("missing"), completion);
    provider_->stopProvidingItemAtURL(url("missing"));
    provider_->itemChangedAtURL(url("missing"));
    EXPECT_EQ(calls, 2);
    EXPECT_FALSE(url("missing").status().ok()) << "nothing is written";
}

TEST_F(LocalTesselKitTest, anUnknownApplicationHasNoDefaultContainer) {
    int calls = 0;
    provider_->defaultApplicationContainerForBundleIdentifier(
        "org.example.App", [&](const Result<std::shared_ptr<const TesselItem>>& item) {
            ++calls;
            ASSERT_FALSE(item.ok());
            EXPECT_TRUE(item.error().is("TSErrorDomain", 1));
            EXPECT_EQ(item.error().userInfo().at("value"), "org.example.App");
        });
    EXPECT_EQ(calls, 1);
    EXPECT_TRUE(log_.contains(LogLevel::error, "[ERROR] can't create bundle proxy with 'org.example.App'"));
}

class DefaultContainerTest : public AppLibraryTest {
protected:
    /// What the one call of the completion answers.
    Result<std::shared_ptr<const TesselItem>> containerOf(const std::string& identifier) {
        const auto provider = LocalTesselKit::init();
        provider->waitUntilReady();
        std::vector<Result<std::shared_ptr<const TesselItem>>> answers;
        provider->defaultApplicationContainerForBundleIdentifier(
            identifier, [&](auto answer) { answers.push_back(std::move(answer)); });
        EXPECT_EQ(answers.size(), 1U);
        return answers.at(0);
    }
};

TEST_F(DefaultContainerTest, isTheLibraryOfTheApplication) {
    install("org.example.App");
    const auto item = containerOf("org.example.App");
    ASSERT_TRUE(item.ok());
    EXPECT_EQ((*item)->itemIdentifier(), "#org.example.App");
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " default location for org.example.App"));
}

TEST_F(DefaultContainerTest, withoutADocumentsFolderThereIsNone) {
    install("org.example.App");
    std::filesystem::remove(documents("org.example.App"));
    const auto item = containerOf("org.example.App");
    ASSERT_FALSE(item.ok());
    EXPECT_TRUE(item.error().is("TSErrorDomain", 1));
    EXPECT_EQ(item.error().userInfo().at("parameter"), "bundleIdentifier");
    EXPECT_EQ(item.error().userInfo().at("value"), "org.example.App");
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] can't create an app library item with " +
                                           RoBundleProxy::bundleProxyForIdentifier("org.example.App")->description()));
}

TEST_F(LocalTesselKitTest, everySectionThatOpensCloses) {
    storage_.file("a.txt");
    (void)identifierOf("a.txt");
    (void)provider_->itemForIdentifier("fid=1");
    const auto openSections = [&] {
        std::vector<std::string> open;
        for (const auto& [level, message] : log_.lines()) {
            static constexpr std::string_view kOpening = "[DEBUG] ┏";
            static constexpr std::string_view kClosing = "[DEBUG] ┗";
            if (message.starts_with(kOpening))
                open.push_back(message.substr(kOpening.size(), message.find(' ', kOpening.size()) - kOpening.size()));
            if (!message.starts_with(kClosing)) continue;
            const auto found = std::ranges::find(open, message.substr(kClosing.size()));
            EXPECT_NE(found, open.end()) << message;
            if (found != open.end()) open.erase(found);
        }
        return open;
    };
    // The refresh at the start may still be at work.
    while (!openSections().empty()) std::this_thread::yield();
}

TEST(LocalTesselKitError, codesAreOrdinals) {
    EXPECT_EQ(errorFor(LocalTesselKitError::invalidItemIdentifier).code(), 0);
    EXPECT_EQ(errorFor(LocalTesselKitError::invalidItemURL).code(), 1);
    EXPECT_EQ(errorFor(LocalTesselKitError::itemNotFound).code(), 2);
    EXPECT_EQ(errorFor(LocalTesselKitError::unableToGetDeviceUUID).code(), 3);
}

}  // namespace
}  // namespace cindral::test
