#include "provider/LocalAppLibraryManager.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/foundation/RootDirectories.h"
#include "provider/AppLibraryFixture.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;
using Names = std::vector<std::string>;

class LocalAppLibraryManagerTest : public AppLibraryTest {
protected:
    static bool refresh() { return LocalAppLibraryManager::refreshAppLibraries(); }
    /// Whether an application with these info-dictionary values qualifies.
    bool qualifies(std::optional<PropertyList::Dictionary> info) const {
        return isAdded(std::make_shared<const RoApplicationProxy>(
            RoBundleProxy::Values{"a", KsURL::fileURL("/data/a"), "A", std::move(info)}));
    }
    static bool isAdded(const std::shared_ptr<const RoBundleProxy>& record) {
        RoBundleProxies list;
        LocalAppLibraryManager::addIfQualified(record, list);
        return !list.empty();
    }
    Names mainList() const {
        Names names;
        for (const auto& proxy : cached(kMain).bundleProxies) names.push_back(proxy->bundleIdentifier());
        return names;
    }
    static Names applicationRoots() {
        Names paths;
        for (const auto& root : RootDirectories::shared().all()) {
            if (root->policy == RootPolicy::applicationContainer) paths.push_back(root->path);
        }
        std::ranges::sort(paths);
        return paths;
    }
};

TEST_F(LocalAppLibraryManagerTest, withoutApplicationsNothingIsSaved) {
    EXPECT_FALSE(refresh());
    EXPECT_EQ(cache(kMain)->versionToken(), 0U);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] bundle proxies []"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] bundle proxies are identical to previous version"));
    EXPECT_FALSE(fs::exists(cache(kMain)->cacheURL().path()));
    EXPECT_TRUE(CdlAppLibraryManager::rootURLsForAppLibraries().empty());
}

TEST_F(LocalAppLibraryManagerTest, aNewApplicationIsAVersionOfItsOwn) {
    install("a");
    EXPECT_TRUE(refresh());
    EXPECT_EQ(mainList(), Names{"a"});
    EXPECT_EQ(cached(kMain).versionToken, 1U);
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " refreshing app libraries"));
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " retrieving app libraries from roster"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] add a"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] bundle proxies [a (\"The a\")]"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] main cache version token is now 1"));
    EXPECT_FALSE(refresh());
    EXPECT_EQ(cached(kMain).versionToken, 1U);
    uninstall("a");
    EXPECT_TRUE(refresh());
    EXPECT_EQ(mainList(), Names());
    EXPECT_EQ(cached(kMain).versionToken, 2U);
}

TEST_F(LocalAppLibraryManagerTest, anotherOrderIsAChange) {
    install("a");
    install("b");
    EXPECT_TRUE(refresh());
    auto list = cached(kMain).bundleProxies;
    std::ranges::reverse(list);
    const auto main = cache(kMain);
    main->queue().sync([&] { ASSERT_TRUE(main->saveBundleProxies(list, 0, true).ok()); });
    EXPECT_EQ(mainList(), (Names{"b", "a"}));
    EXPECT_TRUE(refresh());
    EXPECT_EQ(mainList(), (Names{"a", "b"}));
    EXPECT_EQ(cached(kMain).versionToken, 3U);
}

TEST_F(LocalAppLibraryManagerTest, qualifiesByTheDocumentBrowserOrByBothOthers) {
    const auto info = [](bool browser, bool inPlace, bool sharing) {
        return PropertyList::Dictionary{{kSupportsDocumentBrowserKey, browser},
                                        {kSupportsOpenInPlaceKey, inPlace},
                                        {kFileSharingEnabledKey, sharing}};
    };
    EXPECT_TRUE(qualifies(info(true, false, false)));
    EXPECT_TRUE(qualifies(info(true, true, true)));
    EXPECT_TRUE(qualifies(info(false, true, true)));
    EXPECT_FALSE(qualifies(info(false, true, false)));
    EXPECT_FALSE(qualifies(info(false, false, true)));
    EXPECT_FALSE(qualifies(info(false, false, false)));
    EXPECT_FALSE(qualifies(PropertyList::Dictionary{}));
    EXPECT_TRUE(qualifies(PropertyList::Dictionary{{kSupportsOpenInPlaceKey, true}, {kFileSharingEnabledKey, true}}));
    EXPECT_FALSE(qualifies(std::nullopt));
    EXPECT_FALSE(qualifies(PropertyList::Dictionary{{kSupportsDocumentBrowserKey, "true"}}));
}

TEST_F(LocalAppLibraryManagerTest, skipsWhatIsNoApplicationWithAContainer) {
    const PropertyList::Dictionary info{{kSupportsDocumentBrowserKey, true}};
    EXPECT_FALSE(isAdded(nullptr));
    EXPECT_TRUE(log_.contains(LogLevel::error, "[ERROR] enumerate Application provided nil proxy"));
    EXPECT_FALSE(isAdded(
        std::make_shared<const RoBundleProxy>(RoBundleProxy::Values{"a", KsURL::fileURL("/data/a"), "A", info})));
    EXPECT_FALSE(
        isAdded(std::make_shared<const RoApplicationProxy>(RoBundleProxy::Values{"a", std::nullopt, "A", info})));
    EXPECT_EQ(log_.lines().size(), 1U);
    EXPECT_TRUE(isAdded(
        std::make_shared<const RoApplicationProxy>(RoBundleProxy::Values{"", KsURL::fileURL("/data/a"), "A", info})));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] add <unknown>"));
}

TEST_F(LocalAppLibraryManagerTest, isLoadedFromItsCache) {
    install("a");
    install("b");
    save(kMain, 5);
    save(kWorkingSet, 3);
    const auto main = manager(kMain);
    EXPECT_EQ(main->versionToken(), 5U);
    EXPECT_EQ(identifiers(main->items()), (Names{"#a", "#b"}));
    EXPECT_EQ(main->rootURLs(), (std::vector<KsURL>{KsURL::fileURL(documents("a")), KsURL::fileURL(documents("b"))}));
    EXPECT_EQ(main->itemForIdentifier("#a")->filename(), "The a");
    EXPECT_EQ(main->itemForIdentifier("#c"), nullptr);
    EXPECT_EQ(main->bundleProxyForRootURL(KsURL::fileURL(documents("b")))->bundleIdentifier(), "b");
    EXPECT_EQ(main->bundleProxyForRootURL(KsURL::fileURL(container("b"))), nullptr);
    EXPECT_EQ(manager(kWorkingSet)->versionToken(), 3U);
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " loading bundle proxies from main cache"));
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " loading bundle proxies from working-set cache"));
}

TEST_F(LocalAppLibraryManagerTest, recordsWithoutAFolderAreSkipped) {
    install("a");
    install("b");
    save(kMain, 5);
    fs::remove_all(documents("a"));
    const auto loaded = manager(kMain);
    EXPECT_EQ(identifiers(loaded->items()), Names{"#b"});
    EXPECT_EQ(loaded->versionToken(), 5U);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] can't create app library from bundle proxy"));
    const auto upgraded = manager(kWorkingSet);
    EXPECT_TRUE(upgraded->upgradeFromMainCache(nullptr, false));
    EXPECT_EQ(identifiers(upgraded->items()), Names{"#b"});
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] can't create app library for a"));
}

TEST_F(LocalAppLibraryManagerTest, aLaterRecordOfAnIdentifierReplacesAnEarlier) {
    RoBundleProxies list;
    for (const char* where : {"one", "two"}) {
        apps_.folder(std::string("data/") + where + "/Documents");
        list.push_back(
            std::make_shared<const RoBundleProxy>(RoBundleProxy::Values{"a", KsURL::fileURL(container(where)), where}));
    }
    const auto main = cache(kMain);
    main->queue().sync([&] { ASSERT_TRUE(main->saveBundleProxies(list, 1, false).ok()); });
    const auto loaded = manager(kMain);
    EXPECT_EQ(loaded->items().size(), 1U);
    EXPECT_EQ(loaded->itemForIdentifier("#a")->filename(), "two");
}

TEST_F(LocalAppLibraryManagerTest, describesItself) {
    install("a");
    save(kMain, 5);
    const std::string own = manager(kMain)->description();
    EXPECT_TRUE(own.starts_with("<LocalAppLibraryManager 0x")) << own;
    EXPECT_TRUE(own.ends_with(" versionToken:5 cache-source:main cache app-libraries:1>")) << own;
    EXPECT_EQ(own.find("SHARED"), std::string::npos);
    const std::string shared = LocalAppLibraryManager::shared()->description();
    EXPECT_TRUE(shared.ends_with(" SHARED versionToken:0 cache-source:working-set cache app-libraries:0>")) << shared;
}

TEST_F(LocalAppLibraryManagerTest, isNotUpgradedToItsOwnVersion) {
    install("a");
    save(kMain, 5);
    const auto main = manager(kMain);
    ChangeCalls observer;
    EXPECT_FALSE(main->upgradeFromMainCache(&observer, true));
    EXPECT_TRUE(observer.calls.empty());
    EXPECT_TRUE(host_->deletedDomains().empty());
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " upgrading content from main cache"));
}

TEST_F(LocalAppLibraryManagerTest, anUpgradeTellsWhatThereIsThenWhatIsGone) {
    install("a");
    install("b");
    save(kMain, 5);
    const auto main = manager(kMain);
    uninstall("a");
    install("c");
    EXPECT_TRUE(refresh());
    ChangeCalls observer;
    EXPECT_TRUE(main->upgradeFromMainCache(&observer, true));
    EXPECT_EQ(observer.calls, (Names{"update", "delete"}));
    EXPECT_EQ(observer.log, (Names{"u #b", "u #c", "d #a"}));
    EXPECT_EQ(host_->deletedDomains(), (std::vector<Names>{{"a"}}));
    EXPECT_EQ(main->versionToken(), 6U);
    EXPECT_EQ(identifiers(main->items()), (Names{"#b", "#c"}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] asking provider manager to delete index from deleted domains"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] items from domains [a] removed from index"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] upgraded manager " + main->description()));
}

TEST_F(LocalAppLibraryManagerTest, anUpgradeMayTellNobody) {
    install("a");
    save(kMain, 5);
    const auto main = manager(kMain);
    uninstall("a");
    EXPECT_TRUE(refresh());
    EXPECT_TRUE(main->upgradeFromMainCache(nullptr, false));
    EXPECT_TRUE(host_->deletedDomains().empty());
    EXPECT_TRUE(main->items().empty());
}

TEST_F(LocalAppLibraryManagerTest, anUpgradeToNothingTellsOfDeletionsAlone) {
    install("a");
    save(kMain, 5);
    const auto main = manager(kMain);
    uninstall("a");
    EXPECT_TRUE(refresh());
    ChangeCalls observer;
    EXPECT_TRUE(main->upgradeFromMainCache(&observer, false));
    EXPECT_EQ(observer.calls, Names{"delete"});
    EXPECT_EQ(observer.log, Names{"d #a"});
}

// Its folder may have gone before the manager was loaded, and after a client was told of it.
TEST_F(LocalAppLibraryManagerTest, anUpgradeTellsThatARecordWithoutAFolderIsGone) {
    install("a");
    install("b");
    save(kMain, 5);
    fs::remove_all(documents("a"));
    const auto main = manager(kMain);
    EXPECT_EQ(identifiers(main->items()), Names{"#b"});
    look();
    EXPECT_TRUE(refresh());
    ChangeCalls observer;
    EXPECT_TRUE(main->upgradeFromMainCache(&observer, true));
    EXPECT_EQ(observer.log, (Names{"u #b", "d #a"}));
    EXPECT_EQ(host_->deletedDomains(), (std::vector<Names>{{"a"}}));
}

TEST_F(LocalAppLibraryManagerTest, anIndexThatCannotBeDeletedStopsNothing) {
    install("a");
    install("b");
    save(kMain, 5);
    const auto main = manager(kMain);
    uninstall("a");
    uninstall("b");
    EXPECT_TRUE(refresh());
    host_->deletionError = KsError::posix(EIO);
    EXPECT_TRUE(main->upgradeFromMainCache(nullptr, true));
    EXPECT_EQ(host_->deletedDomains(), (std::vector<Names>{{"a", "b"}}));
    EXPECT_TRUE(log_.contains(
        LogLevel::error, "[ERROR] can't delete searchable items from [a, b]; " + KsError::posix(EIO).description()));
    EXPECT_EQ(main->versionToken(), 6U);
}

TEST_F(LocalAppLibraryManagerTest, theMainCacheWinsOverANewerManager) {
    install("a");
    save(kWorkingSet, 9);
    save(kMain, 4);
    const auto workingSet = manager(kWorkingSet);
    const std::string before = workingSet->description();
    uninstall("a");
    EXPECT_TRUE(refresh());
    EXPECT_TRUE(workingSet->upgradeFromMainCache(nullptr, false));
    EXPECT_TRUE(
        log_.contains(LogLevel::error,
                      "[ERROR] version token shouldn't be greater than the main's cache version (9 vs 5); " + before));
    EXPECT_EQ(workingSet->versionToken(), 5U);
    EXPECT_TRUE(workingSet->items().empty());
}

TEST_F(LocalAppLibraryManagerTest, anUpgradeIsSavedWhenItIsAskedFor) {
    install("a");
    EXPECT_TRUE(refresh());
    const auto workingSet = manager(kWorkingSet);
    EXPECT_TRUE(workingSet->upgradeFromMainCache(nullptr, false));
    EXPECT_EQ(cached(kWorkingSet).versionToken, 0U);
    EXPECT_TRUE(workingSet->saveToCache().ok());
    EXPECT_EQ(cached(kWorkingSet).versionToken, 1U);
    ASSERT_EQ(cached(kWorkingSet).bundleProxies.size(), 1U);
    EXPECT_EQ(cached(kWorkingSet).bundleProxies.front()->bundleIdentifier(), "a");
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " saving bundle proxies to working-set cache"));
}

TEST_F(LocalAppLibraryManagerTest, aRefreshThatCannotBeSavedKeepsTheOldList) {
    install("a");
    EXPECT_TRUE(refresh());
    install("b");
    const std::string path = cache(kMain)->cacheURL().path();
    // A folder of that name can't be replaced by a file.
    fs::rename(path, path + ".kept");
    fs::create_directory(path);
    EXPECT_FALSE(refresh());
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't refresh app libraries; "));
    EXPECT_EQ(cache(kMain)->versionToken(), 1U);
    fs::remove(path);
    fs::rename(path + ".kept", path);
    EXPECT_EQ(mainList(), Names{"a"});
    EXPECT_TRUE(refresh());
    EXPECT_EQ(mainList(), (Names{"a", "b"}));
}

TEST_F(LocalAppLibraryManagerTest, refreshesAtOnceAreOneAfterTheOther) {
    install("a");
    std::atomic<int> changes = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) {
        threads.emplace_back([&] {
            if (refresh()) ++changes;
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(changes, 1);
    EXPECT_EQ(cached(kMain).versionToken, 1U);
}

TEST_F(LocalAppLibraryManagerTest, theProcesssOwnPublishesItsFolders) {
    install("a");
    install("b");
    EXPECT_TRUE(refresh());
    const auto shared = LocalAppLibraryManager::shared();
    EXPECT_EQ(applicationRoots(), Names());
    EXPECT_TRUE(shared->upgradeFromMainCache(nullptr, false));
    shared->publishRoots();
    EXPECT_EQ(applicationRoots(), (Names{documents("a"), documents("b")}));
    EXPECT_EQ(CdlAppLibraryManager::rootURLsForAppLibraries().size(), 2U);
    uninstall("a");
    EXPECT_TRUE(refresh());
    EXPECT_TRUE(shared->upgradeFromMainCache(nullptr, false));
    shared->publishRoots();
    EXPECT_EQ(applicationRoots(), Names{documents("b")});
}

TEST_F(LocalAppLibraryManagerTest, aManagerOfItsOwnPublishesNothing) {
    install("a");
    EXPECT_TRUE(refresh());
    (void)manager(kMain);
    EXPECT_TRUE(manager(kWorkingSet)->upgradeFromMainCache(nullptr, false));
    EXPECT_EQ(applicationRoots(), Names());
}

TEST_F(LocalAppLibraryManagerTest, whatIsPublishedAtTheStartIsWhatWasLast) {
    install("a");
    save(kWorkingSet, 2);
    forgetAppLibraries();
    EXPECT_EQ(LocalAppLibraryManager::shared()->versionToken(), 2U);
    EXPECT_EQ(applicationRoots(), Names{documents("a")});
}

TEST_F(LocalAppLibraryManagerTest, itemsOfAnApplicationBelongToIt) {
    install("a");
    const std::string path = apps_.file("data/a/Documents/sub/report.txt", "hello");
    EXPECT_TRUE(refresh());
    EXPECT_TRUE(LocalAppLibraryManager::shared()->upgradeFromMainCache(nullptr, false));
    LocalAppLibraryManager::shared()->publishRoots();
    const auto folder = LocalItem::initWithURL(KsURL::fileURL(documents("a") + "/sub"));
    ASSERT_TRUE(folder);
    EXPECT_EQ(folder->parentItemIdentifier(), "#a");
    const auto item = LocalItem::initWithURL(KsURL::fileURL(path));
    ASSERT_TRUE(item);
    EXPECT_TRUE(item->itemIdentifier().starts_with("did="));
    EXPECT_EQ(item->parentItemIdentifier(), folder->itemIdentifier());
    EXPECT_EQ(*item->appContainerBundleIdentifier(), "a");
    apps_.folder("data/a/Documents/Inbox");
    EXPECT_EQ(LocalItem::initWithURL(KsURL::fileURL(documents("a") + "/Inbox")), nullptr);
    apps_.folder("data/a/Documents/sub/Inbox");
    EXPECT_TRUE(LocalItem::initWithURL(KsURL::fileURL(documents("a") + "/sub/Inbox")));
}

// The application may write what it likes below its folder: no link there leads out of it.
TEST_F(LocalAppLibraryManagerTest, linksInAnApplicationsFolderLeadNowhere) {
    install("a");
    const std::string secret = storage_.file("secret/key.txt", "key");
    fs::create_directory_symlink(storage_ / "secret", documents("a") + "/link");
    EXPECT_TRUE(refresh());
    EXPECT_TRUE(LocalAppLibraryManager::shared()->upgradeFromMainCache(nullptr, false));
    LocalAppLibraryManager::shared()->publishRoots();
    EXPECT_EQ(LocalItem::initWithURL(KsURL::fileURL(documents("a") + "/link/key.txt")), nullptr);
    const auto link = LocalItem::initWithURL(KsURL::fileURL(documents("a") + "/link"));
    ASSERT_TRUE(link);
    EXPECT_EQ(link->typeIdentifier(), "inode/symlink");
}

}  // namespace
}  // namespace cindral::test
