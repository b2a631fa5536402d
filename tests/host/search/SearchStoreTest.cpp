#include "host/search/SearchStore.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "host/FakeProvider.h"
#include "platform/foundation/Log.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

constexpr const char* kRoot = "TesselRootContainerItemIdentifier";

class SearchStoreTest : public ::testing::Test {
protected:
    SearchStoreTest() { open(); }

    void open() {
        store_.reset();
        auto opened = SearchStore::open(path_, collation_);
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        store_ = *std::move(opened);
    }
    std::shared_ptr<FakeItem> item(const std::string& identifier, const std::string& name, std::int64_t seconds = 0,
                                   const std::string& parent = kRoot) {
        auto made = std::make_shared<FakeItem>();
        made->identifier = identifier;
        made->name = name;
        made->parent = parent;
        made->modified = KsDate{seconds, 0};
        return made;
    }
    std::shared_ptr<FakeItem> folder(const std::string& identifier, const std::string& name,
                                     const std::string& parent = kRoot) {
        auto made = item(identifier, name, 0, parent);
        made->type = "inode/directory";
        return made;
    }
    void put(const TesselItems& items, const std::string& anchor = "anchor") {
        ChangesBatch batch;
        for (const auto& each : items) batch.log.push_back({each, each->itemIdentifier()});
        apply(std::move(batch), anchor);
    }
    void remove(const std::string& identifier) {
        ChangesBatch batch;
        batch.log.push_back({nullptr, identifier});
        apply(std::move(batch), "anchor");
    }
    void apply(ChangesBatch batch, const std::string& anchor) {
        const ByteView bytes = bytesOf(anchor);
        batch.anchor.assign(bytes.begin(), bytes.end());
        const auto applied = store_->apply(batch);
        ASSERT_TRUE(applied.ok()) << applied.error().description();
    }
    std::vector<std::string> find(SearchQuery query, std::size_t limit = 1'000) {
        std::vector<std::string> found;
        std::optional<QueryPage> page;
        while (true) {
            const auto hits = store_->find(query, page, limit);
            EXPECT_TRUE(hits.ok()) << hits.error().description();
            if (!hits.ok()) return found;
            EXPECT_LE(hits->hits.size(), limit);
            for (const auto& hit : hits->hits) found.push_back(hit.identifier);
            if (!hits->hasMore) return found;
            page = hits->hits.back().place;
        }
    }
    std::vector<std::string> names(const std::string& text, std::size_t limit = 1'000) {
        return find({SearchQuery::Kind::names, text}, limit);
    }
    std::vector<std::string> sorted(SortedQuery::Order order, bool isDescending = false) {
        const auto page = store_->sorted({kRoot, order, isDescending, 0, 1'000});
        EXPECT_TRUE(page.ok());
        return page.ok() ? page->identifiers : std::vector<std::string>();
    }
    std::string anchor() {
        const auto position = store_->position();
        return position.ok() && position->anchor ? std::string(textOf(*position->anchor)) : "";
    }
    void damage(std::streamoff at, std::size_t bytes) {
        store_.reset();
        std::fstream file(path_, std::ios::in | std::ios::out | std::ios::binary);
        file.seekp(at);
        file << std::string(bytes, '\xA5');
    }

    const TemporaryFolder folder_;
    const std::string path_ = folder_ / "search-index";
    const NameCollation collation_{"C"};
    std::unique_ptr<SearchStore> store_;
};

TEST_F(SearchStoreTest, findsByBeginningThenWordThenPart) {
    put({item("did=1", "xreport", 50), item("did=2", "My report", 40), item("did=3", "Report", 1),
         item("did=4", "other", 60), item("did=5", "reports", 2), item("did=6", "the-report", 41)});
    EXPECT_THAT(names("report"), ElementsAre("did=5", "did=3", "did=6", "did=2", "did=1"));
    EXPECT_THAT(names("RÉPORT"), ElementsAre("did=5", "did=3", "did=6", "did=2", "did=1"));
    EXPECT_THAT(names("nothing"), IsEmpty());
    EXPECT_THAT(names(""), IsEmpty());
}

TEST_F(SearchStoreTest, findsOneAndTwoLettersToo) {
    put({item("did=1", "ab"), item("did=2", "b"), item("did=3", "xb"), item("did=4", "x b"),
         item("did=5", "中文名字")});
    EXPECT_THAT(names("b"), ElementsAre("did=2", "did=4", ::testing::AnyOf("did=1", "did=3"), ::testing::_));
    EXPECT_THAT(names("ab"), ElementsAre("did=1"));
    EXPECT_THAT(names("文"), ElementsAre("did=5"));
    EXPECT_THAT(names("文名"), ElementsAre("did=5"));
    EXPECT_THAT(names("ba"), IsEmpty());
}

TEST_F(SearchStoreTest, findsWhatIsNoTextAndWhatLooksLikeAQuery) {
    put({item("did=1", "a\xFFzz"), item("did=2", "\"x\" AND y*"), item("did=3", "100% _sure_")});
    EXPECT_THAT(names("a\xFFz"), ElementsAre("did=1"));
    EXPECT_THAT(names("\"x\" and"), ElementsAre("did=2"));
    EXPECT_THAT(names("y*"), ElementsAre("did=2"));
    EXPECT_THAT(names("% _s"), ElementsAre("did=3"));
    EXPECT_THAT(names("a/z"), IsEmpty());
    EXPECT_THAT(names(std::string("a\0b", 3)), IsEmpty());
    EXPECT_THAT(names(std::string(100'000, 'a')), IsEmpty());
}

// All grams of the text are in the name, but not the text.
TEST_F(SearchStoreTest, isNotFooledByScatteredGrams) {
    put({item("did=1", "abcd bcde"), item("did=2", "aaa")});
    EXPECT_THAT(names("abcde"), IsEmpty());
    EXPECT_THAT(names("aaaa"), IsEmpty());
    EXPECT_THAT(names("abcd"), ElementsAre("did=1"));
}

TEST_F(SearchStoreTest, pagesThroughAllKindsOfMatch) {
    TesselItems items;
    for (int i = 0; i < 40; ++i) {
        const std::string number = std::to_string(i);
        const std::string forms[] = {"doc" + number, "a doc" + number, "adoc" + number};
        for (int form = 0; form < 3; ++form)
            items.push_back(item(fmt::format("did={}", 100 * form + i), forms[form], i));
    }
    put(items);
    const auto whole = names("doc");
    ASSERT_EQ(whole.size(), 120U);
    EXPECT_EQ(whole.front(), "did=39");
    EXPECT_EQ(whole[40], "did=139");
    EXPECT_EQ(whole.back(), "did=200");
    for (const std::size_t limit : {1, 7, 40, 119, 120, 121}) EXPECT_EQ(names("doc", limit), whole) << limit;
}

TEST_F(SearchStoreTest, findsManyOfOneDate) {
    TesselItems items;
    for (int i = 0; i < 3'000; ++i) items.push_back(item(fmt::format("did={}", i), fmt::format("file{}", i), 1'000));
    items.push_back(item("did=9000", "file after", 2'000));
    items.push_back(item("did=9001", "file before", -90'000'000));
    auto undated = item("did=9002", "file without");
    undated->modified.reset();
    items.push_back(undated);
    put(items);
    const auto found = names("file", 200);
    EXPECT_EQ(std::set(found.begin(), found.end()).size(), 3'003U);
    EXPECT_EQ(found.front(), "did=9000");
    EXPECT_EQ(found[found.size() - 2], "did=9001");
    EXPECT_EQ(found.back(), "did=9002");
}

TEST_F(SearchStoreTest, takesDatesFromTheEndsOfTime) {
    auto first = item("did=1", "file", std::numeric_limits<std::int64_t>::min());
    auto last = item("did=2", "file", std::numeric_limits<std::int64_t>::max());
    put({first, last, item("did=3", "file", 0)});
    EXPECT_THAT(names("file"), ElementsAre("did=2", "did=3", "did=1"));
}

TEST_F(SearchStoreTest, replacesWhatIsUpdated) {
    put({item("did=1", "before", 1), item("did=2", "other", 5)});
    put({item("did=1", "after", 1)});
    EXPECT_THAT(names("before"), IsEmpty());
    EXPECT_THAT(names("after"), ElementsAre("did=1"));
    EXPECT_THAT(find({SearchQuery::Kind::recents, ""}), ElementsAre("did=2", "did=1"));
    put({item("did=1", "after", 9)});
    EXPECT_THAT(find({SearchQuery::Kind::recents, ""}), ElementsAre("did=1", "did=2"));
    EXPECT_THAT(names("after"), ElementsAre("did=1"));
}

TEST_F(SearchStoreTest, takesOutEverythingBelow) {
    put({folder("fid=1", "top"), folder("fid=2", "middle", "fid=1"), item("did=3", "bottom", 0, "fid=2"),
         item("did=4", "beside")});
    remove("fid=1");
    remove("fid=77");
    EXPECT_THAT(names("o"), IsEmpty());
    EXPECT_THAT(names("bottom"), IsEmpty());
    EXPECT_THAT(names("beside"), ElementsAre("did=4"));
}

TEST_F(SearchStoreTest, survivesAFolderThatHoldsItself) {
    put({folder("fid=1", "one", "fid=2"), folder("fid=2", "two", "fid=1")});
    remove("fid=1");
    EXPECT_THAT(names("t"), IsEmpty());
}

TEST_F(SearchStoreTest, keepsTheTrashApart) {
    auto trashed = item("did=1", "gone", 3, "fid=90");
    trashed->trashed = true;
    trashed->rank = 1;
    trashed->tagList = {"x"};
    auto inTrash = folder("fid=2", "gone folder", "fid=90");
    inTrash->trashed = true;
    auto below = item("did=3", "gone below", 9, "fid=2");
    below->trashed = true;
    put({trashed, inTrash, below, item("did=4", "here")});
    EXPECT_THAT(names("gone"), IsEmpty());
    EXPECT_THAT(find({SearchQuery::Kind::recents, ""}), ElementsAre("did=4"));
    EXPECT_THAT(find({SearchQuery::Kind::favorites, ""}), IsEmpty());
    EXPECT_THAT(find({SearchQuery::Kind::tagged, "x"}), IsEmpty());
    EXPECT_THAT(find({SearchQuery::Kind::trashed, ""}), ElementsAre("did=1", "fid=2"));
    const auto tags = store_->tags();
    ASSERT_TRUE(tags.ok());
    EXPECT_TRUE(tags->empty());
}

TEST_F(SearchStoreTest, movesWhatIsBelowATrashedFolderAlong) {
    put({folder("fid=1", "top"), folder("fid=2", "middle", "fid=1"), item("did=3", "bottom", 0, "fid=2")});
    auto trashed = folder("fid=1", "top", "fid=90");
    trashed->trashed = true;
    put({trashed});
    EXPECT_THAT(names("bottom"), IsEmpty());
    EXPECT_THAT(find({SearchQuery::Kind::trashed, ""}), ElementsAre("fid=1"));
    put({folder("fid=1", "top")});
    EXPECT_THAT(names("bottom"), ElementsAre("did=3"));
    EXPECT_THAT(find({SearchQuery::Kind::trashed, ""}), IsEmpty());
}

TEST_F(SearchStoreTest, leavesOutWhatIsInATemporaryFolder) {
    const auto expectHidden = [&](bool isHidden) {
        const std::vector<std::string> all = isHidden ? std::vector<std::string>() : std::vector<std::string>{"did=3"};
        EXPECT_EQ(names("bottom"), all);
        EXPECT_EQ(names("ttom"), all);
        EXPECT_EQ(names("m"), all) << "where every name is compared";
        EXPECT_EQ(find({SearchQuery::Kind::recents, ""}), all);
        EXPECT_EQ(find({SearchQuery::Kind::favorites, ""}), all);
        EXPECT_EQ(find({SearchQuery::Kind::tagged, "x"}), all);
        EXPECT_EQ(store_->tags()->size(), all.size());
        for (const auto order : {SortedQuery::Order::name, SortedQuery::Order::date}) {
            const auto page = store_->sorted({"fid=2", order, false, 0, 10});
            ASSERT_TRUE(page.ok());
            EXPECT_EQ(page->identifiers, all);
            EXPECT_EQ(page->total, all.size());
        }
    };
    const auto bottom = item("did=3", "bottom", 5, "fid=2");
    bottom->rank = 1;
    bottom->tagList = {"x"};
    const auto workshop = folder("fid=1", ".TemporaryLocalFolder");
    // In any order.
    put({bottom, folder("fid=2", "piece", "fid=1"), workshop});
    expectHidden(true);
    EXPECT_THAT(sorted(SortedQuery::Order::name), IsEmpty());
    put({bottom});
    expectHidden(true);
    open();
    put({bottom});
    expectHidden(true);
    // Put together, it moves to where it is to be, which one change tells.
    put({folder("fid=2", "piece")});
    expectHidden(false);
    EXPECT_THAT(sorted(SortedQuery::Order::name), ElementsAre("fid=2"));
    put({folder("fid=2", "piece", "fid=1")});
    expectHidden(true);
    const auto trashed = folder("fid=2", "piece", "fid=1");
    trashed->trashed = true;
    put({trashed});
    EXPECT_THAT(find({SearchQuery::Kind::trashed, ""}), IsEmpty());
    put({folder("fid=2", "piece")});
    // A number that comes back is another folder.
    remove("fid=1");
    put({item("did=4", "other bottom", 0, "fid=1"), folder("fid=1", "ordinary")});
    EXPECT_THAT(names("other"), ElementsAre("did=4"));
    // Of an application's documents, too; elsewhere it is a name as any.
    put({folder("fid=5", ".TemporaryLocalFolder", "#org.example"), item("did=5", "of the app", 0, "fid=5"),
         folder("fid=6", ".TemporaryLocalFolder", "fid=2"), item("did=6", "of a person", 0, "fid=6")});
    EXPECT_THAT(names("of the app"), IsEmpty());
    EXPECT_THAT(names("of a person"), ElementsAre("did=6"));
}

TEST_F(SearchStoreTest, listsDocumentsByWhenTheyWereUsed) {
    auto used = item("did=1", "old but used", 1);
    used->lastUsed = KsDate{100, 0};
    auto package = folder("fid=5", "deck.folio");
    package->type = "com.vemra.folio.document";
    package->modified = KsDate{60, 0};
    auto link = item("did=6", "link", 90);
    link->type = "inode/symlink";
    put({used, item("did=2", "new", 50), folder("fid=3", "folder"), package, link});
    EXPECT_THAT(find({SearchQuery::Kind::recents, ""}), ElementsAre("did=1", "fid=5", "did=2"));
    EXPECT_THAT(find({SearchQuery::Kind::recents, ""}, 1), ElementsAre("did=1", "fid=5", "did=2"));
}

TEST_F(SearchStoreTest, listsWhatBearsATag) {
    auto red = item("did=1", "a", 1);
    red->tagList = {"red", "Ünï", "red"};
    auto both = item("did=2", "b", 2);
    both->tagList = {"red", "10"};
    put({red, both, item("did=3", "c")});
    EXPECT_THAT(find({SearchQuery::Kind::tagged, "red"}), ElementsAre("did=2", "did=1"));
    EXPECT_THAT(find({SearchQuery::Kind::tagged, "red"}, 1), ElementsAre("did=2", "did=1"));
    EXPECT_THAT(find({SearchQuery::Kind::tagged, "Red"}), IsEmpty());
    const auto counts = store_->tags();
    ASSERT_TRUE(counts.ok());
    std::vector<std::string> texts;
    for (const TagCount& each : *counts) texts.push_back(fmt::format("{} {}", each.tag, each.count));
    EXPECT_THAT(texts, ElementsAre("10 1", "red 2", "Ünï 1"));
    both->tagList = {};
    put({both});
    EXPECT_THAT(find({SearchQuery::Kind::tagged, "red"}), ElementsAre("did=1"));
    remove("did=1");
    EXPECT_THAT(find({SearchQuery::Kind::tagged, "red"}), IsEmpty());
}

TEST_F(SearchStoreTest, listsFavoritesByRank) {
    const auto favorite = [&](const std::string& identifier, std::int64_t rank, std::int64_t seconds) {
        auto made = item(identifier, "x", seconds);
        made->rank = rank;
        return made;
    };
    put({favorite("did=1", 5, 1), favorite("did=2", -3, 1), favorite("did=3", 5, 9), item("did=4", "none"),
         favorite("did=5", std::numeric_limits<std::int64_t>::max(), 1),
         favorite("did=6", std::numeric_limits<std::int64_t>::min(), 1)});
    const auto order = ElementsAre("did=6", "did=2", "did=3", "did=1", "did=5");
    EXPECT_THAT(find({SearchQuery::Kind::favorites, ""}), order);
    EXPECT_THAT(find({SearchQuery::Kind::favorites, ""}, 1), order);
}

TEST_F(SearchStoreTest, sortsAFolderInEveryOrder) {
    auto big = item("did=1", "file10", 1);
    big->size = 900;
    auto small = item("did=2", "File9", 3);
    small->size = 10;
    auto picture = item("did=3", "a", 2);
    picture->type = "image/png";
    put({big, small, picture, folder("fid=4", "Zoo"), item("did=5", "elsewhere", 9, "fid=4")});
    EXPECT_THAT(sorted(SortedQuery::Order::name), ElementsAre("did=3", "did=2", "did=1", "fid=4"));
    EXPECT_THAT(sorted(SortedQuery::Order::name, true), ElementsAre("fid=4", "did=1", "did=2", "did=3"));
    EXPECT_THAT(sorted(SortedQuery::Order::date), ElementsAre("fid=4", "did=1", "did=3", "did=2"));
    EXPECT_THAT(sorted(SortedQuery::Order::size), ElementsAre("did=3", "fid=4", "did=2", "did=1"));
    EXPECT_THAT(sorted(SortedQuery::Order::kind), ElementsAre("fid=4", "did=3", "did=2", "did=1"));
    const auto page = store_->sorted({kRoot, SortedQuery::Order::name, false, 1, 2});
    ASSERT_TRUE(page.ok());
    EXPECT_EQ(page->total, 4U);
    EXPECT_THAT(page->identifiers, ElementsAre("did=2", "did=1"));
    const auto beyond = store_->sorted({kRoot, SortedQuery::Order::name, false, UINT64_MAX, 2});
    ASSERT_TRUE(beyond.ok());
    EXPECT_THAT(beyond->identifiers, IsEmpty());
    // A view is not kept beyond a change.
    remove("did=2");
    EXPECT_THAT(sorted(SortedQuery::Order::name), ElementsAre("did=3", "did=1", "fid=4"));
}

TEST_F(SearchStoreTest, keepsItemsAndTheAnchorTogether) {
    EXPECT_EQ(anchor(), "");
    put({item("did=1", "kept")}, "first");
    open();
    EXPECT_EQ(anchor(), "first");
    EXPECT_THAT(names("kept"), ElementsAre("did=1"));
}

TEST_F(SearchStoreTest, gathersAnewAndLeavesOutWhatWasNotFound) {
    put({item("did=1", "stays"), item("did=2", "went"), folder("fid=3", "old folder")}, "old");
    const TesselItemIdentifier first = kRoot;
    ASSERT_TRUE(store_->beginGather(Bytes{std::byte{'n'}}, std::span(&first, 1)).ok());
    open();
    EXPECT_TRUE(store_->position()->isGathering) << "also after a restart";
    EXPECT_EQ(anchor(), "n");
    EXPECT_THAT(*store_->unlisted(9), ElementsAre(kRoot));
    const std::vector<IndexedItem> listed{IndexedItem::of(*item("did=1", "stays")),
                                          IndexedItem::of(*folder("fid=5", "new folder"))};
    ASSERT_TRUE(store_->putListed(listed, std::span(&first, 1), {}).ok());
    EXPECT_THAT(*store_->unlisted(9), ElementsAre("fid=5")) << "what is come upon is to be listed";
    // One that comes with the changes is to be listed as well, unless it was come upon before.
    put({folder("fid=3", "old folder"), folder("fid=5", "new folder")}, "later");
    EXPECT_THAT(*store_->unlisted(9), UnorderedElementsAre("fid=3", "fid=5"));
    const TesselItemIdentifier both[] = {"fid=3", "fid=5"};
    ASSERT_TRUE(store_->putListed({}, both, {}).ok());
    put({folder("fid=5", "new folder")}, "later");
    EXPECT_THAT(*store_->unlisted(9), IsEmpty());
    ASSERT_TRUE(store_->endGather().ok());
    EXPECT_FALSE(store_->position()->isGathering);
    EXPECT_THAT(names("went"), IsEmpty());
    EXPECT_THAT(names("stays"), ElementsAre("did=1"));
    EXPECT_THAT(names("old f"), ElementsAre("fid=3"));
}

TEST_F(SearchStoreTest, forgetsDomains) {
    auto app = item("did=1", "of the app");
    app->bundle = "org.example.App";
    auto other = item("did=2", "of another");
    other->bundle = "org.example.Other";
    put({app, other});
    ASSERT_TRUE(store_->forgetDomains({"org.example.App", "org.example.Unknown"}).ok());
    EXPECT_THAT(names("of"), ElementsAre("did=2"));
    EXPECT_THAT(*store_->forgottenDomains(), ElementsAre("org.example.App", "org.example.Unknown"));
    ASSERT_TRUE(store_->confirmDomains().ok());
    EXPECT_THAT(*store_->forgottenDomains(), IsEmpty());
}

TEST_F(SearchStoreTest, refusesPagesOfOthers) {
    put({item("did=1", "file1"), item("did=2", "file2")});
    const SearchQuery query{SearchQuery::Kind::names, "file"};
    const auto hits = store_->find(query, std::nullopt, 1);
    ASSERT_TRUE(hits.ok());
    ASSERT_TRUE(hits->hasMore);
    QueryPage page = hits->hits.back().place;
    const auto expired = [&](const SearchQuery& asked) {
        const auto found = store_->find(asked, page, 1);
        return !found.ok() && found.error() == tesselErrorForExpiredPage();
    };
    EXPECT_TRUE(expired({SearchQuery::Kind::names, "fil"}));
    page.index += 1;
    EXPECT_TRUE(expired(query));
    page.index -= 1;
    page.stage = 99;
    const auto beyond = store_->find(query, page, 1);
    ASSERT_TRUE(beyond.ok());
    EXPECT_THAT(beyond->hits, IsEmpty());
}

TEST_F(SearchStoreTest, showsTheWitnessWhatWasAndWhatIs) {
    std::vector<std::string> seen;
    store_->setWitness([&](const IndexedItem& each) { seen.push_back(each.identifier + " " + each.name); });
    put({item("did=1", "first")});
    put({item("did=1", "second")});
    remove("did=1");
    EXPECT_THAT(seen, ElementsAre("did=1 first", "did=1 second", "did=1 first", "did=1 second"));
}

// MARK: The file

TEST_F(SearchStoreTest, isForItsOwnerAlone) {
    struct stat status {};
    ASSERT_EQ(::stat(path_.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600U);
    put({item("did=1", "x")});
    ASSERT_EQ(::stat((path_ + "-wal").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600U);
}

class SearchStoreFileTest : public SearchStoreTest {
protected:
    /// What is there is put aside with one line, and the index is empty and works.
    void expectAnew(LogLevel level = LogLevel::error) {
        LogCapture log;
        open();
        ASSERT_TRUE(store_);
        EXPECT_EQ(log.count("making the search index anew"), 1U);
        EXPECT_TRUE(log.containsPart(level, "making the search index anew"));
        EXPECT_EQ(anchor(), "");
        put({item("did=7", "afresh")});
        EXPECT_THAT(names("afresh"), ElementsAre("did=7"));
        open();
        EXPECT_EQ(log.count("making the search index anew"), 1U) << "and not again";
    }
    void write(const std::string& text) {
        store_.reset();
        std::filesystem::remove(path_ + "-wal");
        std::ofstream(path_, std::ios::binary | std::ios::trunc) << text;
    }
    void execute(const std::string& sql) {
        store_.reset();
        auto database = SqliteDatabase::open(path_, SqliteDatabase::Mode::readWrite);
        ASSERT_TRUE(database.ok());
        ASSERT_TRUE(database->run(sql).ok());
    }
};

TEST_F(SearchStoreFileTest, isMadeAnewInPlaceOfAForeignFile) {
    write(std::string(100'000, 'x'));
    expectAnew();
}

TEST_F(SearchStoreFileTest, isMadeAnewInPlaceOfAnotherDatabase) {
    store_.reset();
    ASSERT_TRUE(SearchStore::remove(path_).ok());
    execute("CREATE TABLE items(x)");
    expectAnew();
}

TEST_F(SearchStoreFileTest, isMadeAnewInPlaceOfAnotherVersion) {
    execute("PRAGMA user_version = 99");
    expectAnew(LogLevel::info);
}

TEST_F(SearchStoreFileTest, isMadeAnewWhereTablesAreMissing) {
    execute("DROP TABLE tags");
    expectAnew();
}

TEST_F(SearchStoreFileTest, isMadeAnewWhereFactsAreMissing) {
    execute("DELETE FROM facts WHERE name = 'index'");
    expectAnew();
}

TEST_F(SearchStoreFileTest, isMadeAnewForAnotherOrderOfNames) {
    execute("UPDATE facts SET value = 'another' WHERE name = 'names'");
    expectAnew(LogLevel::info);
}

TEST_F(SearchStoreFileTest, isMadeAnewInPlaceOfWhatIsNoFile) {
    store_.reset();
    ASSERT_TRUE(SearchStore::remove(path_).ok());
    ASSERT_EQ(::mkfifo(path_.c_str(), 0600), 0);
    expectAnew();
}

TEST_F(SearchStoreFileTest, beginsInAnEmptyFile) {
    write("");
    LogCapture log;
    open();
    ASSERT_TRUE(store_);
    EXPECT_EQ(log.count("anew"), 0U);
    put({item("did=7", "afresh")});
}

// Whatever is cut off or overwritten: the file is made anew, or what it answers is an error that says so.
TEST_F(SearchStoreFileTest, neverFailsOtherwiseOverDamage) {
    TesselItems items;
    for (int i = 0; i < 300; ++i) items.push_back(item(fmt::format("did={}", i), fmt::format("file {}", i), i));
    put(items);
    store_.reset();
    const auto size = static_cast<std::streamoff>(std::filesystem::file_size(path_));
    std::filesystem::copy_file(path_, path_ + ".whole");
    LogCapture log;
    for (std::streamoff at = 0; at < size; at += 3'061) {
        for (const bool isCut : {false, true}) {
            store_.reset();
            ASSERT_TRUE(SearchStore::remove(path_).ok());
            std::filesystem::copy_file(path_ + ".whole", path_);
            if (isCut) {
                std::filesystem::resize_file(path_, static_cast<std::uintmax_t>(at));
            } else {
                damage(at, 13);
            }
            auto opened = SearchStore::open(path_, collation_);
            ASSERT_TRUE(opened.ok()) << at << opened.error().description();
            const auto hits = (*opened)->find({SearchQuery::Kind::names, "file"}, std::nullopt, 1'000);
            EXPECT_TRUE(hits.ok() || isDamagedDatabase(hits.error())) << at;
            ChangesBatch batch;
            batch.log.push_back({item("did=5", "changed", 5), "did=5"});
            const auto applied = (*opened)->apply(batch);
            EXPECT_TRUE(applied.ok() || isDamagedDatabase(applied.error())) << at;
        }
    }
}

}  // namespace
}  // namespace cindral::test
