#include "provider/LocalRootEnumerator.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>

#include "platform/foundation/Sys.h"
#include "provider/AppLibraryFixture.h"
#include "provider/fs/FSChangesNotifier.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;
using Names = std::vector<std::string>;

/// Each call of a listing's observer, with the names that it was given.
class PageCalls : public TesselEnumerationObserver {
public:
    void didEnumerateItems(TesselItems items) override {
        Names names;
        for (const auto& item : items) names.push_back(item->filename());
        std::ranges::sort(names);
        calls.push_back(std::move(names));
    }
    void finishEnumeratingUpToPage(std::optional<TesselPage> nextPage) override {
        next = std::move(nextPage);
        finished.signal();
    }
    void finishEnumeratingWithError(const KsError& why) override {
        error = why;
        finished.signal();
    }

    std::vector<Names> calls;
    std::optional<TesselPage> next;
    std::optional<KsError> error;
    DispatchSemaphore finished{0};
};

class LocalRootEnumeratorTest : public AppLibraryTest {
protected:
    /// The process's own list as the provider has it after a refresh.
    static void publish() {
        LocalAppLibraryManager::refreshAppLibraries();
        LocalAppLibraryManager::shared()->upgradeFromMainCache(nullptr, false);
        LocalAppLibraryManager::shared()->publishRoots();
    }
    void installAndPublish(const std::string& identifier) {
        install(identifier);
        publish();
    }
    void uninstallAndPublish(const std::string& identifier) {
        uninstall(identifier);
        publish();
    }
    static std::shared_ptr<LocalRootEnumerator> enumerator(const TesselItemIdentifier& container) {
        return LocalRootEnumerator::initWithContainer(container);
    }
    static std::shared_ptr<LocalRootEnumerator> root() { return enumerator(kTesselRootContainerItemIdentifier); }
    static std::shared_ptr<LocalRootEnumerator> workingSet() {
        return enumerator(kTesselWorkingSetContainerItemIdentifier);
    }
    /// A current anchor that says that the client was told of a version.
    static TesselSyncAnchor anchor(TesselEnumerator& of, std::uint64_t version) {
        FSChangeToken token = *FSChangeToken::decode(anchorOf(of));
        token.appLibraryVersionToken = version;
        return token.encode();
    }
    static std::shared_ptr<ChangeCalls> changesFrom(TesselEnumerator& of, const TesselSyncAnchor& anchor) {
        auto calls = std::make_shared<ChangeCalls>();
        of.enumerateChangesForObserver(calls, anchor);
        calls->finished.wait();
        return calls;
    }
    static std::shared_ptr<ChangeCalls> changesFromVersion(TesselEnumerator& of, std::uint64_t version) {
        return changesFrom(of, anchor(of, version));
    }
    static std::shared_ptr<PageCalls> listedFrom(TesselEnumerator& of, const TesselPage& page) {
        auto calls = std::make_shared<PageCalls>();
        of.enumerateItemsForObserver(calls, page);
        calls->finished.wait();
        return calls;
    }
    static bool hasExpired(const std::optional<KsError>& error) {
        return error && error->is("TesselErrorDomain", -1002);
    }
    static std::uint64_t versionIn(const std::optional<TesselSyncAnchor>& anchor) {
        return FSChangeToken::decode(*anchor)->appLibraryVersionToken;
    }
    static std::string identifierAt(const std::string& path) {
        KsURL url = KsURL::fileURL(path);
        return itemIdentifierOf(url);
    }
    static std::string itemIdentifierOf(KsURL& url) {
        const auto item = LocalItem::initWithURL(url);
        return item ? item->itemIdentifier() : "none";
    }
    /// What a recorder tells of what was listed below a folder that is no root any more.
    void departAllBelow(const std::string& folder) {
        for (const auto& entry : fs::recursive_directory_iterator(folder)) {
            Event event;
            event.path = entry.path();
            event.flags = EventFlags::removed;
            event.fileID = FileID{sys::statx(AT_FDCWD, event.path.c_str())->fileID};
            const std::string identifier = identifierAt(event.path);
            if (identifier.starts_with("did="))
                event.documentID = DocumentID{static_cast<std::uint32_t>(std::stoul(identifier.substr(4)))};
            history_->add(std::move(event));
        }
    }
    std::string put(const std::string& application, const std::string& name) {
        return apps_.file("data/" + application + "/Documents/" + name);
    }
};

// Items

TEST_F(LocalRootEnumeratorTest, sendsTheAppLibrariesBeforeAnyFile) {
    install("b");
    installAndPublish("a");
    put("a", "of a.txt");
    storage_.file("own.txt");
    const auto all = root();
    for (const auto& page : {tesselInitialPageSortedByName(), tesselInitialPageSortedByDate()}) {
        const auto listed = listedFrom(*all, page);
        EXPECT_EQ(listed->calls, (std::vector<Names>{{"The a", "The b"}, {"of a.txt", "own.txt"}}));
        EXPECT_EQ(listed->next, std::nullopt);
    }
    EXPECT_EQ(log_.count("[DEBUG] discovered 2 app-libraries"), 2U);
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " enumerate root items for TesselRootContainerItemIdentifier"));
}

TEST_F(LocalRootEnumeratorTest, withoutApplicationsTheFilesComeAlone) {
    storage_.file("own.txt");
    EXPECT_EQ(listedFrom(*root(), tesselInitialPageSortedByName())->calls, (std::vector<Names>{{}, {"own.txt"}}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] discovered 0 app-libraries"));
}

TEST_F(LocalRootEnumeratorTest, aLaterPageHoldsFilesAlone) {
    installAndPublish("a");
    for (int i = 0; i < 250; ++i) put("a", std::to_string(i) + ".txt");
    const auto all = root();
    const auto first = listedFrom(*all, tesselInitialPageSortedByName());
    ASSERT_TRUE(first->next);
    ASSERT_EQ(first->calls.size(), 2U);
    EXPECT_EQ(first->calls[1].size(), 200U);
    const auto second = listedFrom(*all, *first->next);
    EXPECT_FALSE(second->error);
    ASSERT_EQ(second->calls.size(), 1U);
    EXPECT_EQ(second->calls[0].size(), 50U);
    EXPECT_EQ(std::ranges::count(second->calls[0], "The a"), 0);
}

// An offset counts over the roots that there were: with others it would pass over what was never listed.
TEST_F(LocalRootEnumeratorTest, aPageOfAnotherListHasExpired) {
    install("a");
    installAndPublish("b");
    for (int i = 0; i < 250; ++i) put("b", std::to_string(i) + ".txt");
    const auto all = root();
    const auto first = listedFrom(*all, tesselInitialPageSortedByName());
    ASSERT_TRUE(first->next);
    uninstallAndPublish("a");
    EXPECT_FALSE(changesFromVersion(*all, 1)->error);
    const auto second = listedFrom(*all, *first->next);
    EXPECT_TRUE(hasExpired(second->error));
    EXPECT_TRUE(second->calls.empty());
    EXPECT_TRUE(log_.contains(LogLevel::info,
                              "[INFO] app libraries changed (1 -> 2), need to re-start gather phase from scratch"));
}

TEST_F(LocalRootEnumeratorTest, aPageThatIsNoneHasExpired) {
    const auto listed = listedFrom(*root(), Bytes(10));
    EXPECT_TRUE(hasExpired(listed->error));
    EXPECT_TRUE(listed->calls.empty());
}

TEST_F(LocalRootEnumeratorTest, theWorkingSetListsWhatItWasLastToldOf) {
    installAndPublish("a");
    put("a", "sub/deep.txt");
    const auto all = workingSet();
    EXPECT_EQ(all->appLibraryManager()->cacheSource(), kWorkingSet);
    EXPECT_EQ(listedFrom(*all, tesselInitialPageSortedByName())->calls, (std::vector<Names>{{}, {}}));
    EXPECT_FALSE(changesFromVersion(*all, 0)->error);
    EXPECT_EQ(listedFrom(*all, tesselInitialPageSortedByName())->calls,
              (std::vector<Names>{{"The a"}, {"deep.txt", "sub"}}));
    EXPECT_EQ(root()->appLibraryManager()->cacheSource(), kMain);
    EXPECT_EQ(enumerator(kTesselAllDirectoriesContainerItemIdentifier)->appLibraryManager()->cacheSource(), kMain);
}

// Anchors

TEST_F(LocalRootEnumeratorTest, anAnchorSaysWhichListTheClientKnows) {
    installAndPublish("a");
    EXPECT_EQ(versionIn(anchorOf(*root())), 1U);
    EXPECT_EQ(versionIn(anchorOf(*workingSet())), 0U);
}

TEST_F(LocalRootEnumeratorTest, withoutAVolumeThereIsNoAnchor) {
    const auto all = root();
    RvStorageManager::defaultManager().setStore(nullptr);
    EventHistory::setShared(nullptr);
    std::optional<TesselSyncAnchor> given = TesselSyncAnchor();
    all->currentSyncAnchorWithCompletionHandler([&](auto anchor) { given = std::move(anchor); });
    EXPECT_EQ(given, std::nullopt);
}

TEST_F(LocalRootEnumeratorTest, anAnchorThatIsNoneHasExpired) {
    installAndPublish("a");
    for (const auto& all : {root(), workingSet()}) {
        const auto given = changesFrom(*all, Bytes(10));
        EXPECT_TRUE(hasExpired(given->error));
        EXPECT_TRUE(given->calls.empty());
    }
    EXPECT_EQ(log_.count("[ERROR] can't create change token from anchor data, resetting"), 2U);
}

// The decision about the app libraries, row by row. T is the anchor's version, L the manager's, M the main cache's.

TEST_F(LocalRootEnumeratorTest, aVersionBeyondTheManagersHasExpired) {
    install("a");
    save(kMain, 3);
    save(kWorkingSet, 3);
    for (const auto& all : {root(), workingSet()}) {
        history_->onRead([] { ADD_FAILURE() << "no change of a file is looked for"; });
        const auto given = changesFromVersion(*all, 5);
        EXPECT_TRUE(hasExpired(given->error));
        EXPECT_TRUE(given->calls.empty());
        history_->onRead({});
    }
    const char* line = "[INFO] app-library version is greater than local version, need to restart from scratch";
    EXPECT_TRUE(log_.contains(LogLevel::info, line));
    EXPECT_EQ(log_.count(line), 2U);
}

TEST_F(LocalRootEnumeratorTest, versionZeroIsSentAllThatIsKnown) {
    install("b");
    install("a");
    save(kMain, 4);
    publish();
    const auto all = root();
    const auto given = changesFromVersion(*all, 0);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->calls, Names{"update"});
    EXPECT_EQ(given->log, (Names{"u #a", "u #b"}));
    EXPECT_EQ(versionIn(given->anchor), 4U);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] notifying app library changes since 0"));
    EXPECT_TRUE(
        log_.contains(LogLevel::debug, "[DEBUG] change token version is zero, let's send all the app-libraries known"));
    EXPECT_EQ(log_.count("updated root enumerator to monitor"), 0U) << "the manager was up to date";
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " enumerate root changes for TesselRootContainerItemIdentifier"));
}

TEST_F(LocalRootEnumeratorTest, versionZeroIsUpgradedFirst) {
    install("a");
    save(kMain, 4);
    const auto all = root();
    installAndPublish("b");
    put("b", "of b.txt");
    const auto given = changesFromVersion(*all, 0);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->log, (Names{"u #a", "u #b", "u " + identifierAt(documents("b") + "/of b.txt")}));
    EXPECT_EQ(versionIn(given->anchor), 5U);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] updated root enumerator to monitor [file://" + documents("a") +
                                                   ", file://" + documents("b") + ", " + storageURL().description() +
                                                   "]"));
    EXPECT_TRUE(host_->deletedDomains().empty());
    EXPECT_EQ(cached(kWorkingSet).versionToken, 0U) << "the root saves nothing";
}

TEST_F(LocalRootEnumeratorTest, aVersionThatIsAnothersMatchesNothing) {
    install("a");
    save(kMain, 3);
    const auto all = root();
    installAndPublish("b");
    const auto given = changesFromVersion(*all, 2);
    EXPECT_TRUE(hasExpired(given->error));
    EXPECT_TRUE(given->calls.empty());
    EXPECT_TRUE(log_.contains(LogLevel::error,
                              "[ERROR] change token version matches nothing, need to restart from scratch "
                              "[changeTokenVersion: 2, localVersion: 3, mainCacheVersion: 4]"));
}

TEST_F(LocalRootEnumeratorTest, aVersionThatIsUpToDateIsToldNothing) {
    install("a");
    save(kMain, 3);
    publish();
    const auto given = changesFromVersion(*root(), 3);
    EXPECT_FALSE(given->error);
    EXPECT_TRUE(given->calls.empty());
    EXPECT_EQ(versionIn(given->anchor), 3U);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] change token version matches local version"));
}

TEST_F(LocalRootEnumeratorTest, aVersionThatMatchesIsToldWhatCameAndWent) {
    install("a");
    install("b");
    save(kMain, 3);
    publish();
    const auto all = root();
    uninstall("a");
    installAndPublish("c");
    const std::string inside = identifierAt(put("c", "of c.txt"));
    const auto given = changesFromVersion(*all, 3);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->calls, (Names{"update", "delete", "update"}));
    EXPECT_EQ(given->log, (Names{"u #b", "u #c", "d #a", "u " + inside}));
    EXPECT_EQ(versionIn(given->anchor), 4U);
    EXPECT_EQ(all->localFileEnumerator()->urls(),
              (std::vector<KsURL>{KsURL::fileURL(documents("b")), KsURL::fileURL(documents("c")), storageURL()}));
    EXPECT_TRUE(host_->deletedDomains().empty());
    EXPECT_EQ(cached(kWorkingSet).versionToken, 0U);
    EXPECT_FALSE(changesFrom(*all, *given->anchor)->error);
}

TEST_F(LocalRootEnumeratorTest, allDirectoriesGoByTheRootsRules) {
    install("a");
    save(kMain, 3);
    const auto all = enumerator(kTesselAllDirectoriesContainerItemIdentifier);
    installAndPublish("b");
    put("b", "sub/deep/file.txt");
    const auto given = changesFromVersion(*all, 3);
    EXPECT_EQ(given->log, (Names{"u #a", "u #b", "u " + identifierAt(documents("b") + "/sub"),
                                 "u " + identifierAt(documents("b") + "/sub/deep")}));
    EXPECT_EQ(cached(kWorkingSet).versionToken, 0U);
    EXPECT_TRUE(hasExpired(changesFromVersion(*all, 3)->error));
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[changeTokenVersion: 3, localVersion: 4, mainCacheVersion: 4]"));
}

TEST_F(LocalRootEnumeratorTest, theWorkingSetsVersionZeroIsUpgradedAndSaved) {
    installAndPublish("a");
    put("a", "sub/deep.txt");
    const auto all = workingSet();
    const auto given = changesFromVersion(*all, 0);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->log, (Names{"u #a", "u " + identifierAt(documents("a") + "/sub"),
                                 "u " + identifierAt(documents("a") + "/sub/deep.txt")}));
    EXPECT_EQ(versionIn(given->anchor), 1U);
    EXPECT_EQ(cached(kWorkingSet).versionToken, 1U);
    EXPECT_TRUE(
        log_.contains(LogLevel::debug, "[DEBUG] change token version is zero, let's send all the app-libraries known"));
}

TEST_F(LocalRootEnumeratorTest, theWorkingSetsVersionZeroDeletesTheIndexOfWhatIsGone) {
    install("a");
    save(kWorkingSet, 1);
    save(kMain, 1);
    uninstallAndPublish("a");
    const auto given = changesFromVersion(*workingSet(), 0);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->log, Names()) << "a client that was told of nothing is told of no deletion";
    EXPECT_EQ(host_->deletedDomains(), (std::vector<Names>{{"a"}}));
}

TEST_F(LocalRootEnumeratorTest, theWorkingSetsVersionThatMatchesIsToldAndSaved) {
    install("a");
    install("b");
    save(kMain, 3);
    save(kWorkingSet, 3);
    const auto all = workingSet();
    EXPECT_TRUE(changesFromVersion(*all, 3)->log.empty());
    EXPECT_TRUE(host_->deletedDomains().empty());
    uninstallAndPublish("b");
    const auto given = changesFromVersion(*all, 3);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->log, (Names{"u #a", "d #b"}));
    EXPECT_EQ(versionIn(given->anchor), 4U);
    EXPECT_EQ(host_->deletedDomains(), (std::vector<Names>{{"b"}}));
    EXPECT_EQ(cached(kWorkingSet).versionToken, 4U);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] change token version matches local version"));
}

TEST_F(LocalRootEnumeratorTest, theWorkingSetsVersionThatIsAnothersMatchesNothing) {
    install("a");
    save(kMain, 4);
    publish();
    save(kWorkingSet, 3);
    const auto given = changesFromVersion(*workingSet(), 2);
    EXPECT_TRUE(hasExpired(given->error));
    EXPECT_TRUE(given->calls.empty());
    EXPECT_TRUE(log_.contains(LogLevel::error,
                              "[ERROR] change token version matches nothing, need to restart from scratch "
                              "[changeTokenVersion: 2, localVersion: 3, workingSetVersion: 4, mainCacheVersion: 4]"));
}

TEST_F(LocalRootEnumeratorTest, aWorkingSetThatCannotBeSavedIsToldAllTheSame) {
    installAndPublish("a");
    const std::string path = cache(kWorkingSet)->cacheURL().path();
    fs::create_directories(path);
    const auto given = changesFromVersion(*workingSet(), 0);
    EXPECT_FALSE(given->error);
    EXPECT_EQ(given->log, Names{"u #a"});
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't save working-set cache to disk; "));
}

// What is in a new library was recorded when it was published, before the anchor: no replay from there tells of it.
TEST_F(LocalRootEnumeratorTest, aClientHearsOfEverythingInANewLibrary) {
    storage_.file("own.txt");
    const auto all = workingSet();
    const auto before = anchorOf(*all);
    ClientView view(ProviderTest::all(*all), before);
    install("a");
    for (int i = 0; i < 450; ++i) put("a", "sub/" + std::to_string(i) + ".txt");
    put("a", "package.folio/inside.txt");
    put("a", ".Trash/gone.txt");
    put("a", "Inbox/incoming.txt");
    publish();
    view.apply(allChanges(*all, view.anchor()));
    EXPECT_EQ(view.contents(), ClientView::contentsOf(ProviderTest::all(*all)));
    EXPECT_GT(view.contents().size(), 450U);
    departAllBelow(documents("a"));
    uninstallAndPublish("a");
    view.apply(allChanges(*all, view.anchor()));
    EXPECT_EQ(view.contents(), ClientView::contentsOf(ProviderTest::all(*all)));
    EXPECT_EQ(view.contents().size(), 1U);
}

// The folder of the trash is never listed, so that nothing above goes along with what is in it.
TEST_F(LocalRootEnumeratorTest, aClientHearsThatWhatWasInTheTrashOfALibraryIsGone) {
    installAndPublish("a");
    const auto everything = workingSet();
    changesFrom(*everything, anchorOf(*everything));
    const auto before = anchorOf(*everything);
    Event event;
    event.flags = EventFlags::removed;
    const auto departed = [&](const std::string& path, std::uint64_t fileID, std::uint32_t documentID) {
        event.path = path;
        event.fileID = FileID{fileID};
        event.documentID = DocumentID{documentID};
        event.id = 0;
        history_->add(event);
    };
    departed(documents("a") + "/.Trash/file.txt", 70, 7);
    departed(documents("a") + "/.Trash/folder", 80, 0);
    departed(documents("ab") + "/not below.txt", 90, 9);
    event.flags = EventFlags();
    departed(documents("a") + "/still there.txt", 100, 10);
    uninstallAndPublish("a");
    const auto deep = changesFrom(*everything, before);
    EXPECT_EQ(deep->log, (Names{"d #a", "d fid=70", "d did=7", "d fid=80"}));
    EXPECT_FALSE(deep->error);

    installAndPublish("a");
    const auto shallow = root();
    const auto known = anchorOf(*shallow);
    event.flags = EventFlags::removed;
    departed(documents("a") + "/.Trash/other.txt", 110, 11);
    uninstallAndPublish("a");
    EXPECT_EQ(changesFrom(*shallow, known)->log, Names{"d #a"}) << "what is in a trash is not listed here";
}

// What can't be told is told anew from the beginning, whatever the reason.
TEST_F(LocalRootEnumeratorTest, libraryContentsThatCannotBeListedExpireTheAnchor) {
    const auto all = workingSet();
    const auto before = anchorOf(*all);
    install("a");
    put("a", "file.txt");
    publish();
    RvStorageManager::defaultManager().setStore(nullptr);
    const auto given = changesFrom(*all, before);
    RvStorageManager::defaultManager().setStore(store_);
    EXPECT_TRUE(hasExpired(given->error));
    EXPECT_FALSE(given->anchor);
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't list the app libraries that came; "));
}

TEST_F(LocalRootEnumeratorTest, departuresThatCannotBeReadExpireTheAnchor) {
    installAndPublish("a");
    const auto all = workingSet();
    changesFrom(*all, anchorOf(*all));
    const auto before = anchorOf(*all);
    uninstallAndPublish("a");
    history_->onDrain([] { return Result<void>(KsError::posix(EIO)); });
    const auto given = changesFrom(*all, before);
    EXPECT_TRUE(hasExpired(given->error));
    EXPECT_FALSE(given->anchor);
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't tell what was in the app libraries that went; "));
}

// Monitoring

TEST_F(LocalRootEnumeratorTest, itsQueueBearsItsName) {
    EXPECT_EQ(root()->enumQueue().label(), "cindral.root-enumerator.queue");
}

TEST_F(LocalRootEnumeratorTest, aListIsSavedOnceItsRootsAreMonitored) {
    installAndPublish("a");
    changesFromVersion(*workingSet(), 0);
    const auto lines = log_.lines();
    const auto at = [&](std::string_view part) {
        return std::ranges::find_if(lines,
                                    [&](const auto& line) { return line.second.find(part) != std::string::npos; });
    };
    const auto saving = at("saving bundle proxies to working-set cache");
    ASSERT_NE(saving, lines.end());
    EXPECT_LT(at("upgraded manager "), at("updated root enumerator to monitor "));
    EXPECT_LT(at("updated root enumerator to monitor "), saving);
}

TEST_F(LocalRootEnumeratorTest, isRunningBetweenStartAndStop) {
    const auto all = root();
    EXPECT_FALSE(all->isRunning());
    all->start();
    all->start();
    EXPECT_TRUE(all->isRunning());
    EXPECT_TRUE(all->localFileEnumerator()->notifier()->isStarted());
    all->stop();
    all->stop();
    EXPECT_FALSE(all->isRunning());
    EXPECT_FALSE(all->localFileEnumerator()->notifier()->isStarted());
    all->start();
    all->invalidate();
    EXPECT_FALSE(all->isRunning());
}

TEST_F(LocalRootEnumeratorTest, monitorsTheNewRootsWhereItMonitoredTheOld) {
    install("a");
    save(kMain, 3);
    const auto all = root();
    all->start();
    const auto before = all->localFileEnumerator();
    installAndPublish("b");
    EXPECT_FALSE(changesFromVersion(*all, 3)->error);
    const auto after = all->localFileEnumerator();
    EXPECT_NE(before, after);
    EXPECT_FALSE(before->notifier()->isStarted());
    EXPECT_TRUE(after->notifier()->isStarted());
    all->stop();
    EXPECT_FALSE(after->notifier()->isStarted());
}

TEST_F(LocalRootEnumeratorTest, monitorsNothingWhereItMonitoredNothing) {
    install("a");
    save(kMain, 3);
    const auto all = root();
    installAndPublish("b");
    EXPECT_FALSE(changesFromVersion(*all, 3)->error);
    EXPECT_FALSE(all->localFileEnumerator()->notifier()->isStarted());
}

}  // namespace
}  // namespace cindral::test
