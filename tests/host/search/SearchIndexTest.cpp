#include "host/search/SearchIndex.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <thread>

#include "host/FakeProvider.h"
#include "platform/foundation/Dispatch.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr const char* kRootContainer = "TesselRootContainerItemIdentifier";
constexpr const char* kWorkingSet = "TesselWorkingSetContainerItemIdentifier";

std::vector<std::string> identifiersOf(const TesselItems& items) {
    std::vector<std::string> identifiers;
    for (const auto& item : items) identifiers.push_back(item->itemIdentifier());
    return identifiers;
}

class SearchIndexTest : public ::testing::Test {
protected:
    SearchIndexTest() {
        provider_->folder("fid=10", "projects");
        provider_->document("did=1", "report one.txt", "fid=10").modified = KsDate{10, 0};
        provider_->document("did=2", "report two.txt").modified = KsDate{20, 0};
        nothingChanges("anchor");
    }

    void nothingChanges(const std::string& anchor) { provider_->changes[kWorkingSet] = {{{}, anchor, false, {}}}; }
    /// The next request for changes is answered with these, later ones with none.
    void change(std::vector<std::string> log, const std::string& anchor) {
        provider_->changes[kWorkingSet] = {{std::move(log), anchor, false, {}}, {{}, anchor, false, {}}};
    }
    void open() { index_ = std::make_unique<SearchIndex>(provider_, signals_, file_, "C"); }
    std::vector<std::string> names(const std::string& text) {
        if (!index_) open();
        const auto found = index_->find({SearchQuery::Kind::names, text}, std::nullopt, 100);
        EXPECT_TRUE(found.ok()) << found.error().description();
        return found.ok() ? identifiersOf(found->items) : std::vector<std::string>();
    }

    const TemporaryFolder folder_;
    const std::string file_ = folder_ / "search-index";
    const std::shared_ptr<FakeProvider> provider_ = std::make_shared<FakeProvider>();
    SignalDispatcher signals_;
    std::unique_ptr<SearchIndex> index_;  // Last: it uses what stands above.
};

TEST_F(SearchIndexTest, answersTheFirstQuestionWhenAllIsGathered) {
    EXPECT_THAT(names("report two"), ElementsAre("did=2"));
    index_.reset();
    ASSERT_TRUE(SearchStore::remove(file_).ok());
    provider_->documents(20, "fid=10");
    EXPECT_EQ(names("000").size(), 10U) << "listed in pages, in a folder";
}

TEST_F(SearchIndexTest, makesNoFileBeforeItIsAsked) {
    open();
    EXPECT_FALSE(std::filesystem::exists(file_));
    index_->deleteItems({"org.example.App"}, [](const std::optional<KsError>& error) { EXPECT_FALSE(error); });
    EXPECT_FALSE(std::filesystem::exists(file_));
}

TEST_F(SearchIndexTest, knowsWhatChangedBeforeTheQuestion) {
    EXPECT_THAT(names("new"), IsEmpty());
    provider_->document("did=3", "new.txt");
    change({"u did=3"}, "next");
    EXPECT_THAT(names("new"), ElementsAre("did=3"));
    provider_->remove("did=3");
    change({"d did=3"}, "after");
    EXPECT_THAT(names("new"), IsEmpty());
    EXPECT_EQ(provider_->askedAnchors.back(), "next");
    EXPECT_THAT(names("new"), IsEmpty());
    EXPECT_EQ(provider_->askedAnchors.back(), "after");
}

TEST_F(SearchIndexTest, followsInSeveralSteps) {
    EXPECT_THAT(names("new"), IsEmpty());
    provider_->document("did=3", "new.txt");
    provider_->document("did=4", "newer.txt");
    provider_->changes[kWorkingSet] = {
        {{"u did=3"}, "one", true, {}}, {{"u did=4"}, "two", false, {}}, {{}, "two", false, {}}};
    EXPECT_EQ(names("new").size(), 2U);
}

TEST_F(SearchIndexTest, goesOnWhereAnEarlierProcessWas) {
    EXPECT_EQ(names("report").size(), 2U);
    index_.reset();
    provider_->document("did=3", "report three.txt", "fid=10");
    change({"u did=3"}, "next");
    const int listed = provider_->enumeratorsMade;
    EXPECT_EQ(names("report").size(), 3U);
    EXPECT_EQ(provider_->enumeratorsMade - listed, 1) << "only the working set's";
    EXPECT_EQ(provider_->askedAnchors.back(), "anchor");
}

TEST_F(SearchIndexTest, gathersAnewWhenTheAnchorHasExpired) {
    EXPECT_EQ(names("report").size(), 2U);
    provider_->remove("did=1");
    provider_->document("did=3", "report three.txt", "fid=10");
    provider_->changes[kWorkingSet] = {{{}, "", false, tesselErrorForExpiredPage()}, {{}, "next", false, {}}};
    EXPECT_THAT(names("report"), ::testing::UnorderedElementsAre("did=2", "did=3"));
}

// The listing of one folder begins again; what was listed before stays.
TEST_F(SearchIndexTest, getsToTheEndThoughPagesExpire) {
    provider_->documents(30, "fid=10");
    provider_->expiries = 25;
    EXPECT_EQ(names("000").size(), 10U);
    EXPECT_EQ(provider_->expiries, 0);
}

TEST_F(SearchIndexTest, listsAFolderThatComesWhileItGathers) {
    // It was moved from a folder that is not yet listed to one that is.
    provider_->folder("fid=20", "moved", "fid=10");
    provider_->document("did=5", "inside.txt", "fid=20");
    provider_->beforePage = [this, isMoved = false](const std::string& container, std::size_t) mutable {
        if (container != "fid=10" || std::exchange(isMoved, true)) return;
        FakeItem copy = *std::dynamic_pointer_cast<const FakeItem>(*provider_->itemForIdentifier("fid=20"));
        provider_->remove("fid=20");
        provider_->folder("fid=20", copy.name, kRootContainer);
        change({"u fid=20"}, "next");
    };
    EXPECT_THAT(names("inside"), ElementsAre("did=5"));
}

TEST_F(SearchIndexTest, leavesOutAFolderThatCannotBeRead) {
    provider_->listingErrors.emplace("fid=10", KsError::posix(EACCES));
    EXPECT_THAT(names("report"), ElementsAre("did=2"));
}

TEST_F(SearchIndexTest, givesUpWithTheProvidersError) {
    open();
    provider_->changes[kWorkingSet] = {{{}, "", false, KsError::posix(EIO)}};
    const auto found = index_->find({SearchQuery::Kind::names, "x"}, std::nullopt, 10);
    ASSERT_FALSE(found.ok());
    EXPECT_TRUE(found.error().isPosix(EIO));
    nothingChanges("anchor");
    EXPECT_EQ(names("report").size(), 2U) << "and works when the trouble is over";
}

TEST_F(SearchIndexTest, answersItemsAsTheProviderHasThem) {
    EXPECT_THAT(names("report two"), ElementsAre("did=2"));
    const auto before = *provider_->itemForIdentifier("did=2");
    const auto found = index_->find({SearchQuery::Kind::names, "report two"}, std::nullopt, 10);
    ASSERT_TRUE(found.ok());
    EXPECT_EQ(found->items.front(), before);
    provider_->remove("did=2");
    EXPECT_THAT(names("report two"), IsEmpty()) << "what went since is left out";
}

TEST_F(SearchIndexTest, refusesPagesThatItDidNotMake) {
    open();
    const auto found = index_->find({SearchQuery::Kind::names, "x"}, Bytes{std::byte{9}}, 10);
    ASSERT_FALSE(found.ok());
    EXPECT_EQ(found.error(), tesselErrorForExpiredPage());
}

TEST_F(SearchIndexTest, sortsWhatAFolderHolds) {
    open();
    const auto sorted = index_->sorted({"fid=10", SortedQuery::Order::name, false, 0, 10});
    ASSERT_TRUE(sorted.ok());
    EXPECT_EQ(sorted->total, 1U);
    EXPECT_THAT(identifiersOf(sorted->items), ElementsAre("did=1"));
    const auto none = index_->sorted({"fid=99", SortedQuery::Order::name, false, 0, 10});
    ASSERT_FALSE(none.ok());
    EXPECT_EQ(none.error().code(), static_cast<std::int64_t>(TesselErrorCode::noSuchItem));
    provider_->folder("fid=30", "empty");
    change({"u fid=30"}, "next");
    const auto empty = index_->sorted({"fid=30", SortedQuery::Order::name, false, 0, 10});
    ASSERT_TRUE(empty.ok());
    EXPECT_EQ(empty->total, 0U);
}

TEST_F(SearchIndexTest, forgetsTheDomainsThatTheProviderNames) {
    provider_->document("did=7", "of the app", "fid=10").bundle = "org.example.App";
    EXPECT_THAT(names("of the app"), ElementsAre("did=7"));
    signals_.setSearchableItems(std::shared_ptr<SearchableItems>(index_.get(), [](SearchableItems*) {}));
    int completions = 0;
    signals_.deleteSearchableItems({"org.example.App"}, [&](const std::optional<KsError>& error) {
        EXPECT_FALSE(error);
        ++completions;
    });
    signals_.setSearchableItems(nullptr);
    EXPECT_EQ(completions, 1);
    EXPECT_THAT(names("of the app"), IsEmpty());
    EXPECT_EQ(names("report").size(), 2U);
}

// It came back before the index asked, so that nobody tells of what is in it.
TEST_F(SearchIndexTest, gathersAnewWhenAForgottenDomainIsBack) {
    provider_->folder("#org.example.App", "App");
    provider_->document("did=7", "of the app", "#org.example.App").bundle = "org.example.App";
    EXPECT_THAT(names("of the app"), ElementsAre("did=7"));
    index_->deleteItems({"org.example.App"}, {});
    EXPECT_THAT(names("of the app"), ElementsAre("did=7"));
}

TEST_F(SearchIndexTest, isMadeAnewWhenItTurnsOutDamaged) {
    EXPECT_EQ(names("report").size(), 2U);
    index_.reset();
    {
        std::fstream file(file_, std::ios::in | std::ios::out | std::ios::binary);
        file.seekp(4'096);
        file << std::string(40'000, 'x');
    }
    const LogCapture log;
    EXPECT_EQ(names("report").size(), 2U);
    EXPECT_EQ(log.count("making the search index anew"), 1U);
}

TEST_F(SearchIndexTest, auditsItselfAgainstWhatIsListed) {
    EXPECT_EQ(names("report").size(), 2U);
    const auto whole = index_->audit();
    ASSERT_TRUE(whole.ok());
    EXPECT_EQ(whole->missing + whole->superfluous, 0U);
    EXPECT_FALSE(whole->wasDamaged);
    // Nobody told of these.
    provider_->remove("did=1");
    provider_->document("did=8", "report eight", "fid=10");
    provider_->document("did=9", "report nine", "fid=10");
    const auto audit = index_->audit();
    ASSERT_TRUE(audit.ok());
    EXPECT_EQ(audit->missing, 2U);
    EXPECT_EQ(audit->outdated, 0U);
    EXPECT_EQ(audit->superfluous, 1U);
    EXPECT_EQ(names("report").size(), 3U);
}

TEST_F(SearchIndexTest, tellsHowFarItIsBehind) {
    SearchIndex::Moment now{"history", 7};
    const auto open = [&] {
        index_ = std::make_unique<SearchIndex>(provider_, signals_, file_, "C", [&now] { return now; });
    };
    open();
    EXPECT_FALSE(index_->status().exists);
    EXPECT_EQ(names("report").size(), 2U);
    SearchIndex::Status status = index_->status();
    EXPECT_TRUE(status.exists);
    EXPECT_EQ(status.items, 3U);
    EXPECT_EQ(status.eventsBehind, 0U);
    EXPECT_FALSE(status.error);
    now.event = 10;
    EXPECT_EQ(index_->status().eventsBehind, 3U);
    index_.reset();
    open();
    EXPECT_EQ(index_->status().eventsBehind, 3U) << "also after a restart";
    names("report");
    EXPECT_EQ(index_->status().eventsBehind, 0U);
    now.history = "another";
    EXPECT_FALSE(index_->status().eventsBehind);
    now = {"history", 3};
    EXPECT_FALSE(index_->status().eventsBehind) << "a history that was put back";
    provider_->changes[kWorkingSet] = {{{}, "anchor", false, KsError::posix(EIO)}};
    EXPECT_FALSE(index_->find({SearchQuery::Kind::names, "report"}, std::nullopt, 1).ok());
    EXPECT_TRUE(index_->status().error->isPosix(EIO));
}

TEST_F(SearchIndexTest, sharesOneLookAmongManyQuestions) {
    open();
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) {
        threads.emplace_back([&] {
            for (int j = 0; j < 20; ++j) EXPECT_EQ(names("report").size(), 2U);
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_LE(provider_->askedAnchors.size(), 161U);
}

TEST_F(SearchIndexTest, letsGoOfWhoWaitsWhenItStops) {
    open();
    DispatchSemaphore isListing{0};
    DispatchSemaphore mayGoOn{0};
    provider_->beforePage = [&, isFirst = true](const std::string&, std::size_t) mutable {
        if (!std::exchange(isFirst, false)) return;
        isListing.signal();
        mayGoOn.wait();
    };
    std::thread asking([&] {
        const auto found = index_->find({SearchQuery::Kind::names, "x"}, std::nullopt, 10);
        ASSERT_FALSE(found.ok());
        EXPECT_TRUE(found.error().isPosix(ECANCELED));
    });
    isListing.wait();
    std::thread stopping([&] { index_->stop(); });
    asking.join();
    mayGoOn.signal();
    stopping.join();
    EXPECT_FALSE(index_->tags().ok()) << "nothing is answered any more";
}

// MARK: Watches

class SearchIndexWatchTest : public SearchIndexTest {
protected:
    std::uint64_t watch(SearchQuery query) {
        const auto number = index_->watch(query, [this] {
            ++calls_;
            told_.signal();
        });
        EXPECT_TRUE(number.ok());
        return number.ok() ? *number : 0;
    }
    /// Has the index take the changes in, as a signal has it; what is to be told then has been put on its way.
    void signal() {
        signals_.signalEnumerator(kWorkingSet, {});
        ASSERT_TRUE(index_->catchUp().ok());
    }

    std::atomic<int> calls_ = 0;
    DispatchSemaphore told_{0};
};

TEST_F(SearchIndexWatchTest, tellsOfWhatComesIntoAnAnswerAndGoes) {
    open();
    watch({SearchQuery::Kind::names, "new"});
    provider_->document("did=3", "NEW.txt");
    change({"u did=3"}, "next");
    signal();
    told_.wait();
    provider_->remove("did=3");
    change({"d did=3"}, "after");
    signal();
    told_.wait();
    EXPECT_EQ(provider_->enumeratorsStarted, 1) << "the working set is monitored";
}

TEST_F(SearchIndexWatchTest, keepsStillOverWhatIsInNoAnswer) {
    open();
    watch({SearchQuery::Kind::names, "new"});
    watch({SearchQuery::Kind::tagged, "red"});
    watch({SearchQuery::Kind::favorites, ""});
    watch({SearchQuery::Kind::trashed, ""});
    watch({SearchQuery::Kind::children, "fid=10"});
    watch({SearchQuery::Kind::tags, ""});
    provider_->document("did=3", "other.txt");
    change({"u did=3"}, "next");
    signal();
    // One that is told afterwards shows that the others were not.
    watch({SearchQuery::Kind::recents, ""});
    provider_->document("did=4", "another.txt");
    change({"u did=4"}, "after");
    signal();
    told_.wait();
    EXPECT_EQ(calls_, 1);
}

TEST_F(SearchIndexWatchTest, tellsEveryKindOfQuery) {
    open();
    for (const SearchQuery& query :
         {SearchQuery{SearchQuery::Kind::names, "x"}, SearchQuery{SearchQuery::Kind::recents, ""},
          SearchQuery{SearchQuery::Kind::tagged, "red"}, SearchQuery{SearchQuery::Kind::favorites, ""},
          SearchQuery{SearchQuery::Kind::children, "fid=10"}, SearchQuery{SearchQuery::Kind::tags, ""}})
        watch(query);
    FakeItem& item = provider_->document("did=3", "x", "fid=10");
    item.tagList = {"red"};
    item.rank = 1;
    change({"u did=3"}, "next");
    signal();
    for (int i = 0; i < 6; ++i) told_.wait();
    EXPECT_EQ(calls_, 6);
}

TEST_F(SearchIndexWatchTest, isSilentAfterItsEnd) {
    open();
    const std::uint64_t first = watch({SearchQuery::Kind::recents, ""});
    index_->unwatch(first);
    index_->unwatch(first);
    watch({SearchQuery::Kind::recents, ""});
    provider_->document("did=3", "x");
    change({"u did=3"}, "next");
    signal();
    told_.wait();
    EXPECT_EQ(calls_, 1);
}

TEST_F(SearchIndexWatchTest, tellsAllWhenEverythingIsGatheredAnew) {
    open();
    watch({SearchQuery::Kind::names, "nothing has this name"});
    provider_->changes[kWorkingSet] = {{{}, "", false, tesselErrorForExpiredPage()}, {{}, "next", false, {}}};
    signal();
    told_.wait();
    EXPECT_EQ(calls_, 1);
}

}  // namespace
}  // namespace cindral::test
