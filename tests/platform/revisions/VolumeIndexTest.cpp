#include "platform/revisions/VolumeIndex.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <filesystem>
#include <thread>

#include "platform/revisions/RevisionsNumbers.h"
#include "platform/revisions/VolumeStore.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::TemporaryFolder;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

/// What an event tells, in a line.
std::string lineOf(const JournalEvent& event) {
    switch (event.kind) {
        case JournalEvent::Kind::present:
            return std::to_string(event.id) + " present " + std::to_string(number(event.fileID)) + " " +
                   std::to_string(number(event.parent)) + "/" + event.name;
        case JournalEvent::Kind::departed:
            return std::to_string(event.id) + " departed " + std::to_string(number(event.fileID)) + " " +
                   std::to_string(number(event.parent)) + "/" + event.name + " at " +
                   std::to_string(number(event.root)) + ":" + event.path;
        case JournalEvent::Kind::document:
            return std::to_string(event.id) + " document " +
                   std::to_string(static_cast<std::uint32_t>(event.documentID)) + " " +
                   std::to_string(number(event.fileID)) + ">" + std::to_string(number(event.target));
    }
    return "";
}

/// In every test the rules hold whether what they build on is in memory, is being saved, or is in the tables.
enum class Saved { no, yes };

class VolumeIndexTest : public ::testing::TestWithParam<Saved> {
protected:
    VolumeIndexTest() { open(); }

    static VolumeStoreOptions onRequest() {
        VolumeStoreOptions options;
        options.checkpointsItself = false;
        return options;
    }
    std::string folder() const { return temporary_ / "store"; }
    void open() {
        VolumeStoreOptions options = onRequest();
        options.now = [this] { return now_; };
        options.onCheckpointStep = [this] { ++checkpointSteps_; };
        auto opened = VolumeStore::open(folder(), options);
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        store_ = std::move(opened).value();
    }
    void reopen() {
        store_.reset();
        open();
    }
    /// Between one step and the next.
    void settle() {
        if (GetParam() == Saved::yes) {
            ASSERT_TRUE(store_->checkpoint().ok());
        }
    }

    static IndexedObject file(std::uint64_t fileID, std::string_view name, std::uint64_t parent = 2) {
        return {.fileID = FileID{fileID},
                .birthTime = static_cast<std::int64_t>(fileID * 10),
                .parent = FileID{parent},
                .name = name,
                .kind = ObjectKind::file,
                .changeTime = 5,
                .size = 100};
    }
    static IndexedObject directory(std::uint64_t fileID, std::string_view name, std::uint64_t parent = 2) {
        IndexedObject object = file(fileID, name, parent);
        object.kind = ObjectKind::folder;
        return object;
    }
    std::uint64_t apply(const IndexChanges& changes) {
        const auto done = store_->apply(changes, std::vector<FileID>{kRoot});
        EXPECT_TRUE(done.ok()) << done.error().description();
        settle();
        return done.ok() ? *done : 0;
    }
    std::uint64_t put(const IndexedObject& object, IndexChanges::Journal journal = IndexChanges::Journal::yes) {
        IndexChanges changes(journal);
        changes.put(object);
        return apply(changes);
    }
    std::uint64_t remove(std::uint64_t fileID) {
        IndexChanges changes;
        changes.remove(FileID{fileID});
        return apply(changes);
    }
    /// As a listing sees it.
    DocumentID list(const IndexedObject& object, bool wantsDocumentID = true) {
        ObjectSighting sighting{.fileID = object.fileID,
                                .birthTime = object.birthTime,
                                .parent = object.parent,
                                .kind = object.kind,
                                .name = object.name,
                                .wantsDocumentID = wantsDocumentID};
        EXPECT_TRUE(store_->identify({&sighting, 1}).ok());
        settle();
        return sighting.documentID;
    }

    std::optional<std::string> placeOf(std::uint64_t fileID) const {
        std::optional<std::string> place;
        store_->indexed(FileID{fileID}, [&](const IndexedObject& object) {
            place = std::to_string(number(object.parent)) + "/" + std::string(object.name);
        });
        return place;
    }
    IndexedObject recordOf(std::uint64_t fileID) const {
        IndexedObject found;
        EXPECT_TRUE(store_->indexed(FileID{fileID}, [&](const IndexedObject& object) { found = object; })) << fileID;
        found.name = {};
        return found;
    }
    std::uint64_t childOf(std::uint64_t parent, std::string_view name) const {
        std::uint64_t found = 0;
        store_->childrenNamed(FileID{parent}, name,
                              [&](const IndexedObject& object) { found = number(object.fileID); });
        return found;
    }
    std::vector<std::uint64_t> childrenOf(std::uint64_t parent) const {
        std::vector<std::uint64_t> found;
        EXPECT_TRUE(
            store_
                ->children(FileID{parent}, [&](const IndexedObject& object) { found.push_back(number(object.fileID)); })
                .ok());
        EXPECT_EQ(store_->childCount(FileID{parent}), found.size());
        return found;
    }
    std::vector<std::string> eventsAfter(std::uint64_t after, std::size_t max = 1000) const {
        std::vector<std::string> lines;
        const std::vector<JournalEvent> events = store_->events(after, max).value();
        for (const JournalEvent& event : events) lines.push_back(lineOf(event));
        return lines;
    }
    std::vector<std::string> documentEventsAfter(std::uint64_t after, std::size_t max = 1000) const {
        std::vector<std::string> lines;
        const std::vector<JournalEvent> events = store_->documentEvents(after, max).value();
        for (const JournalEvent& event : events) lines.push_back(lineOf(event));
        return lines;
    }

    TemporaryFolder temporary_;
    std::chrono::system_clock::time_point now_{std::chrono::hours(500'000)};
    std::unique_ptr<VolumeStore> store_;
    int checkpointSteps_ = 0;
};

INSTANTIATE_TEST_SUITE_P(InMemory, VolumeIndexTest, ::testing::Values(Saved::no));
INSTANTIATE_TEST_SUITE_P(InTables, VolumeIndexTest, ::testing::Values(Saved::yes));

TEST_P(VolumeIndexTest, remembersWhatWasPut) {
    IndexedObject object = file(10, "report");
    object.isClosed = true;
    object.hasOtherNames = true;
    object.changeTime = -7;
    object.size = 1ULL << 40;
    EXPECT_EQ(put(object), 1U);
    EXPECT_EQ(placeOf(10), "2/report");
    EXPECT_EQ(placeOf(11), std::nullopt);
    const IndexedObject found = recordOf(10);
    EXPECT_EQ(found.birthTime, 100);
    EXPECT_EQ(found.kind, ObjectKind::file);
    EXPECT_EQ(found.changeTime, -7);
    EXPECT_EQ(found.size, 1ULL << 40);
    EXPECT_TRUE(found.isClosed);
    EXPECT_TRUE(found.hasOtherNames);
    EXPECT_FALSE(found.isListed);
    EXPECT_EQ(found.documentID, DocumentID{});
    EXPECT_EQ(found.eventID, 1U);
    EXPECT_EQ(childOf(2, "report"), 10U);
    EXPECT_EQ(childOf(2, "other"), 0U);
    EXPECT_EQ(childOf(3, "report"), 0U);
    EXPECT_THAT(childrenOf(2), ElementsAre(10));
    EXPECT_THAT(childrenOf(3), IsEmpty());
    EXPECT_THAT(eventsAfter(0), ElementsAre("1 present 10 2/report"));
    EXPECT_THAT(eventsAfter(1), IsEmpty());
    EXPECT_EQ(store_->counts().events, 1U);
    reopen();
    EXPECT_EQ(placeOf(10), "2/report");
    EXPECT_THAT(eventsAfter(0), ElementsAre("1 present 10 2/report"));
}

TEST_P(VolumeIndexTest, movesWhatIsPutElsewhere) {
    put(file(10, "a"));
    put(file(11, "b"));
    EXPECT_EQ(put(file(10, "c", 3)), 3U);
    EXPECT_EQ(childOf(2, "a"), 0U);
    EXPECT_EQ(childOf(3, "c"), 10U);
    EXPECT_THAT(childrenOf(2), ElementsAre(11));
    EXPECT_THAT(childrenOf(3), ElementsAre(10));
    // Nobody was given its identifier: nobody is told that it left.
    EXPECT_THAT(eventsAfter(0), ElementsAre("2 present 11 2/b", "3 present 10 3/c"));
}

TEST_P(VolumeIndexTest, tellsThatAListedObjectLeftItsPlace) {
    put(directory(3, "folder"));
    put(file(10, "a", 3));
    list(file(10, "a", 3), false);
    put(file(10, "b", 2));
    EXPECT_THAT(eventsAfter(0),
                ElementsAre("1 present 3 2/folder", "3 departed 10 3/a at 2:folder/a", "4 present 10 2/b"));
    EXPECT_TRUE(recordOf(10).isListed);
}

TEST_P(VolumeIndexTest, tellsThatAListedObjectIsNoLongerInWhatTookItsFoldersDocumentOver) {
    put(directory(3, "a~"));
    put(directory(4, "a"));
    put(file(10, "x", 3));
    put(file(11, "y", 3));
    list(file(10, "x", 3), false);
    const std::uint64_t before = store_->currentEventID();
    IndexChanges changes;
    changes.leave(FileID{10}, FileID{4});
    changes.leave(FileID{11}, FileID{4});  // Nobody knows of it.
    changes.leave(FileID{99}, FileID{4});  // Nor of this.
    apply(changes);
    EXPECT_THAT(eventsAfter(before), ElementsAre("5 departed 10 4/x at 2:a/x"));
    EXPECT_EQ(recordOf(10).parent, FileID{3});
}

TEST_P(VolumeIndexTest, tellsThatAListedObjectIsGone) {
    put(file(10, "a"));
    const DocumentID document = list(file(10, "a"));
    EXPECT_EQ(remove(10), 3U);
    EXPECT_THAT(eventsAfter(0), ElementsAre("2 departed 10 2/a at 2:a"));
    EXPECT_THAT(documentEventsAfter(0), ElementsAre("3 document 1 10>0"));
    EXPECT_EQ(store_->events(0, 10).value()[0].documentID, document);
    EXPECT_EQ(placeOf(10), std::nullopt);
    EXPECT_THAT(childrenOf(2), IsEmpty());
    EXPECT_EQ(store_->counts().objects, 0U);
    EXPECT_EQ(store_->counts().events, 2U);
    EXPECT_EQ(store_->document(document)->fileID, FileID{10});
    EXPECT_EQ(remove(10), 3U);
}

TEST_P(VolumeIndexTest, journalsNothingWhenToldSo) {
    put(file(10, "a"), IndexChanges::Journal::no);
    put(file(11, "b"), IndexChanges::Journal::no);
    list(file(10, "a"));
    IndexChanges changes(IndexChanges::Journal::no);
    changes.put(file(10, "moved"));
    changes.touch(FileID{10});
    changes.remove(FileID{10});
    EXPECT_EQ(apply(changes), 0U);
    EXPECT_EQ(recordOf(11).eventID, 0U);
    EXPECT_THAT(eventsAfter(0), IsEmpty());
    EXPECT_THAT(documentEventsAfter(0), IsEmpty());
}

TEST_P(VolumeIndexTest, givesAnObjectOneEvent) {
    put(file(10, "a"));
    put(file(11, "b"));
    put(file(10, "a"));
    IndexChanges changes;
    changes.touch(FileID{11});
    changes.touch(FileID{11});
    changes.touch(FileID{99});
    EXPECT_EQ(apply(changes), 5U);
    EXPECT_THAT(eventsAfter(0), ElementsAre("3 present 10 2/a", "5 present 11 2/b"));
    EXPECT_EQ(store_->counts().events, 2U);
    EXPECT_EQ(recordOf(11).size, 100U);
}

TEST_P(VolumeIndexTest, tellsAsManyEventsAsAreWanted) {
    for (std::uint64_t id = 10; id < 20; ++id) put(file(id, std::to_string(id)));
    put(file(12, "12"));
    EXPECT_EQ(eventsAfter(0, 0).size(), 0U);
    EXPECT_THAT(eventsAfter(0, 3), ElementsAre("1 present 10 2/10", "2 present 11 2/11", "4 present 13 2/13"));
    EXPECT_THAT(eventsAfter(9, 3), ElementsAre("10 present 19 2/19", "11 present 12 2/12"));
    EXPECT_THAT(eventsAfter(11), IsEmpty());
    EXPECT_THAT(eventsAfter(~std::uint64_t{0}), IsEmpty());
}

// Some events in the tables, some in memory, and among both some that were replaced.
TEST_P(VolumeIndexTest, tellsEventsInTheirOrderWhereverTheyAre) {
    IndexChanges first, second;
    for (std::uint64_t id = 10; id < 400; ++id) first.put(file(id, "a"));
    apply(first);
    ASSERT_TRUE(store_->checkpoint().ok());
    for (std::uint64_t id = 10; id < 400; id += 2) second.put(file(id, "b"));
    apply(second);
    std::uint64_t after = 0, count = 0;
    while (true) {
        const std::vector<JournalEvent> events = store_->events(after, 7).value();
        for (const JournalEvent& event : events) {
            EXPECT_GT(event.id, after);
            EXPECT_EQ(event.name, number(event.fileID) % 2 == 0 ? "b" : "a");
            after = event.id;
            ++count;
        }
        if (events.empty()) break;
        ASSERT_TRUE(events.size() == 7 || after == store_->currentEventID());
    }
    EXPECT_EQ(count, 390U);
}

TEST_P(VolumeIndexTest, tellsThePlaceThatWasLeftByTheFoldersOfTheTime) {
    put(directory(3, "outer"));
    put(directory(4, "inner", 3));
    for (const std::uint64_t id : {10, 11, 12}) {
        put(file(id, std::to_string(id), 4));
        list(file(id, std::to_string(id), 4), false);
    }
    list(directory(4, "inner", 3), false);
    const std::uint64_t before = store_->currentEventID();
    IndexChanges changes;
    changes.remove(FileID{10});
    changes.put(directory(3, "renamed"));
    changes.remove(FileID{11});
    changes.remove(FileID{12});
    changes.remove(FileID{4});
    apply(changes);
    EXPECT_THAT(eventsAfter(before),
                ElementsAre("6 departed 10 4/10 at 2:outer/inner/10", "7 present 3 2/renamed",
                            "8 departed 11 4/11 at 2:renamed/inner/11", "9 departed 12 4/12 at 2:renamed/inner/12",
                            "10 departed 4 3/inner at 2:renamed/inner"));
    EXPECT_EQ(store_->events(before, 1).value()[0].objectKind, ObjectKind::file);
}

TEST_P(VolumeIndexTest, leavesThePathEmptyWhereItCanNotBeMadeOut) {
    put(file(10, "orphan", 77));
    list(file(10, "orphan", 77), false);
    put(directory(5, "a", 6));
    put(directory(6, "b", 5));
    list(directory(6, "b", 5), false);
    IndexChanges changes;
    changes.remove(FileID{10});
    changes.remove(FileID{6});
    apply(changes);
    EXPECT_THAT(eventsAfter(3), ElementsAre("4 departed 10 77/orphan at 0:", "5 departed 6 5/b at 0:"));
}

TEST_P(VolumeIndexTest, tellsThatARootItselfIsGone) {
    put(directory(2, "Documents", 1));
    list(directory(2, "Documents", 1), false);
    remove(2);
    EXPECT_THAT(eventsAfter(0), ElementsAre("2 departed 2 1/Documents at 2:"));
}

TEST_P(VolumeIndexTest, takesAnotherBirthForAnotherObject) {
    put(file(10, "a"));
    list(file(10, "a"));
    IndexChanges changes;
    changes.addName(FileID{10}, FileID{3}, "linked");
    apply(changes);
    IndexedObject reborn = file(10, "a");
    reborn.birthTime = 7;
    EXPECT_EQ(put(reborn), 4U);
    EXPECT_THAT(eventsAfter(0), ElementsAre("2 departed 10 2/a at 2:a", "4 present 10 2/a"));
    EXPECT_THAT(documentEventsAfter(0), ElementsAre("3 document 1 10>0"));
    EXPECT_EQ(recordOf(10).birthTime, 7);
    EXPECT_EQ(recordOf(10).documentID, DocumentID{});
    EXPECT_FALSE(recordOf(10).isListed);
    EXPECT_EQ(childOf(3, "linked"), 0U);
}

TEST_P(VolumeIndexTest, tellsThatAnIdentifierOfTheOtherFormEnded) {
    put(directory(10, "a"));
    list(directory(10, "a"), false);
    IndexedObject package = directory(10, "a");
    package.kind = ObjectKind::package;
    EXPECT_EQ(put(package), 3U);
    EXPECT_THAT(eventsAfter(0), ElementsAre("2 departed 10 2/a at 2:a", "3 present 10 2/a"));
    EXPECT_EQ(store_->events(0, 1).value()[0].objectKind, ObjectKind::folder);
    EXPECT_NE(list(package), DocumentID{});
    IndexedObject plain = file(10, "a");
    EXPECT_EQ(put(plain), 4U);  // The same form: "did=" as before.
    EXPECT_EQ(put(directory(10, "a")), 6U);
    EXPECT_THAT(eventsAfter(3), ElementsAre("5 departed 10 2/a at 2:a", "6 present 10 2/a"));
    EXPECT_EQ(recordOf(10).documentID, DocumentID{1});
}

TEST_P(VolumeIndexTest, tellsNothingOfAFormThatNobodySaw) {
    put(directory(10, "a"));
    put(file(10, "a"));
    EXPECT_THAT(eventsAfter(0), ElementsAre("2 present 10 2/a"));
}

// MARK: Listings beside the recorder

TEST_P(VolumeIndexTest, letsListingsMoveOnlyWhatTheRecorderHasNotSeen) {
    IndexedObject unseen = file(10, "a");
    unseen.changeTime = 0;
    put(unseen);
    put(file(11, "b"));
    const std::uint64_t transactions = store_->transactionCount();
    list(file(10, "elsewhere", 3));
    list(file(11, "elsewhere", 3));
    EXPECT_EQ(placeOf(10), "3/elsewhere");
    EXPECT_EQ(placeOf(11), "2/b");
    EXPECT_NE(recordOf(11).documentID, DocumentID{});
    EXPECT_TRUE(recordOf(11).isListed);
    EXPECT_EQ(store_->transactionCount(), transactions + 2);
    list(file(10, "elsewhere", 3));
    list(file(11, "anywhere", 4));
    EXPECT_EQ(store_->transactionCount(), transactions + 2);  // Nothing new.
    EXPECT_THAT(eventsAfter(0), ElementsAre("1 present 10 3/elsewhere", "2 present 11 2/b"));
    EXPECT_THAT(childrenOf(3), ElementsAre(10));
}

TEST_P(VolumeIndexTest, listsAnObjectThatTheRecorderHasNeverSeen) {
    list(file(10, "a"));
    EXPECT_EQ(recordOf(10).changeTime, 0);
    EXPECT_TRUE(recordOf(10).isListed);
    EXPECT_EQ(recordOf(10).eventID, 0U);
    EXPECT_EQ(childOf(2, "a"), 10U);
    EXPECT_THAT(eventsAfter(0), IsEmpty());
    // Somebody has its identifier: its end is an event.
    put(file(10, "b"));
    EXPECT_THAT(eventsAfter(0), ElementsAre("1 departed 10 2/a at 2:a", "2 present 10 2/b"));
}

TEST_P(VolumeIndexTest, tellsOfTheEndOfAnObjectWhoseNumberAListingMeetsAgain) {
    put(directory(3, "folder"));
    put(file(10, "a", 3));
    const DocumentID old = list(file(10, "a", 3));
    IndexedObject reborn = file(10, "new", 4);
    reborn.birthTime = 7;
    const DocumentID fresh = list(reborn);
    EXPECT_NE(fresh, old);
    EXPECT_THAT(eventsAfter(2), ElementsAre("3 departed 10 3/a at 2:folder/a"));
    EXPECT_THAT(documentEventsAfter(0), ElementsAre("4 document 1 10>0"));
    EXPECT_EQ(store_->currentEventID(), 4U);
    EXPECT_EQ(placeOf(10), "4/new");
    EXPECT_EQ(recordOf(10).changeTime, 0);
    EXPECT_EQ(recordOf(10).documentID, fresh);
    // Of what only listings knew nothing is told.
    reborn.birthTime = 8;
    list(reborn);
    EXPECT_EQ(store_->currentEventID(), 4U);
}

TEST_P(VolumeIndexTest, givesAFolderThatBecameAPackageADocument) {
    put(directory(10, "a"));
    EXPECT_EQ(list(directory(10, "a"), false), DocumentID{});
    IndexedObject package = directory(10, "a");
    package.kind = ObjectKind::package;
    EXPECT_NE(list(package), DocumentID{});
    EXPECT_EQ(recordOf(10).kind, ObjectKind::folder);  // Until the recorder has looked.
}

TEST_P(VolumeIndexTest, takesTheSightingsOfAPageInTheirOrder) {
    put(file(10, "a"));
    list(file(10, "a"));
    std::array<ObjectSighting, 2> page;
    for (ObjectSighting& sighting : page) {
        sighting = {.fileID = FileID{10}, .birthTime = 7, .parent = kRoot, .name = "a", .wantsDocumentID = true};
    }
    page[1].birthTime = 100;  // As it was before the page.
    ASSERT_TRUE(store_->identify(page).ok());
    EXPECT_EQ(recordOf(10).birthTime, 100);
    EXPECT_EQ(recordOf(10).documentID, page[1].documentID);
    EXPECT_NE(page[0].documentID, page[1].documentID);
    EXPECT_NE(page[1].documentID, DocumentID{1});
}

// MARK: Documents

TEST_P(VolumeIndexTest, handsOverTheDocumentOfAnObjectThatIsGone) {
    put(file(10, "a"));
    const DocumentID document = list(file(10, "a"));
    remove(10);
    put(file(11, "a"));
    IndexChanges changes;
    changes.handOver(document, FileID{11});
    apply(changes);
    EXPECT_THAT(documentEventsAfter(3), ElementsAre("5 document 1 10>11"));
    EXPECT_EQ(recordOf(11).documentID, document);
    EXPECT_TRUE(recordOf(11).isListed);
    // The number may come back with another object, which has nothing to do with the document.
    put(file(10, "b"));
    remove(10);
    EXPECT_EQ(documentEventsAfter(3).size(), 1U);
}

TEST_P(VolumeIndexTest, handsADocumentOverInTheBatchInWhichItsObjectGoes) {
    put(file(10, "a"));
    const DocumentID document = list(file(10, "a"));
    IndexChanges changes;
    changes.put(file(11, "a"));
    changes.handOver(document, FileID{11});
    changes.remove(FileID{10});
    apply(changes);
    // Its first object had nothing to take with it any more.
    EXPECT_THAT(documentEventsAfter(0), ElementsAre("4 document 1 10>11"));
    EXPECT_EQ(store_->document(document)->fileID, FileID{11});
    remove(11);
    EXPECT_THAT(documentEventsAfter(4), ElementsAre("8 document 1 11>0"));
}

TEST_P(VolumeIndexTest, keepsTheAttributesWithTheDocument) {
    put(file(10, "a"));
    put(file(11, "b"));
    const DocumentID document = list(file(10, "a"));
    const Bytes bytes(3, std::byte{1});
    ASSERT_TRUE(store_->rememberAttributes(document, bytes).ok());
    const std::uint64_t transactions = store_->transactionCount();
    ASSERT_TRUE(store_->rememberAttributes(document, bytes).ok());
    EXPECT_EQ(store_->transactionCount(), transactions);  // Nothing new.
    IndexChanges changes;
    changes.handOver(document, FileID{11});
    changes.handOver(document, FileID{11});
    apply(changes);
    EXPECT_EQ(store_->attributes(document), bytes);
    EXPECT_EQ(documentEventsAfter(0).size(), 1U);
}

TEST_P(VolumeIndexTest, refusesWhatCanNotBe) {
    put(file(10, "a"));
    const DocumentID document = list(file(10, "a"));
    for (const auto& [given, to] : {std::pair(document, FileID{99}), std::pair(DocumentID{77}, FileID{10})}) {
        IndexChanges changes;
        changes.put(file(20, "b"));
        changes.handOver(given, to);
        const auto done = store_->apply(changes, {});
        ASSERT_FALSE(done.ok());
        EXPECT_TRUE(done.error().isPosix(ENOENT));
        EXPECT_EQ(placeOf(20), std::nullopt);  // Nothing of the batch.
    }
    for (const std::string& name : {std::string(1024, 'n'), std::string("a/b"), std::string("a\0b", 3)}) {
        IndexChanges changes, names;
        changes.put(file(20, name));
        names.addName(FileID{10}, kRoot, name);
        EXPECT_TRUE(store_->apply(changes, {}).error().isPosix(EINVAL));
        EXPECT_TRUE(store_->apply(names, {}).error().isPosix(EINVAL));
    }
    EXPECT_EQ(store_->currentEventID(), 1U);
    EXPECT_EQ(*store_->apply(IndexChanges(), {}), 1U);
}

TEST_P(VolumeIndexTest, takesNamesOfAnyBytes) {
    const std::string longest(1023, 'n');
    put(file(10, "\xFF\xFE\n\x01"));
    put(file(11, longest));
    put(file(12, ""));
    IndexChanges changes;
    changes.addName(FileID{10}, FileID{3}, longest);
    changes.addName(FileID{10}, FileID{3}, "\xFF");
    apply(changes);
    EXPECT_EQ(childOf(2, "\xFF\xFE\n\x01"), 10U);
    EXPECT_EQ(childOf(2, longest), 11U);
    EXPECT_EQ(childOf(2, ""), 12U);
    EXPECT_EQ(childOf(3, longest), 10U);
    EXPECT_EQ(childOf(3, "\xFF"), 10U);
    EXPECT_EQ(childOf(3, "\xFE"), 0U);
}

TEST_P(VolumeIndexTest, doesNotCallARecordedPlaceAnotherName) {
    put(file(10, "a"));
    IndexChanges changes;
    changes.addName(FileID{10}, FileID{2}, "b");
    changes.addName(FileID{99}, FileID{2}, "unknown");
    changes.put(file(10, "b"));
    apply(changes);
    EXPECT_THAT(store_->otherNames(FileID{10}), IsEmpty());
    EXPECT_THAT(store_->otherNames(FileID{99}), IsEmpty());
    EXPECT_EQ(childOf(2, "unknown"), 0U);
    IndexChanges back;
    back.put(file(10, "a"));
    apply(back);
    ASSERT_EQ(store_->otherNames(FileID{10}).size(), 1U);
    EXPECT_EQ(store_->otherNames(FileID{10})[0].name, "b");
}

// Enough for names whose hashes are equal to be among them, and for a list that is a tree of its own.
TEST_P(VolumeIndexTest, findsEveryChildOfALargeFolder) {
    constexpr std::uint64_t kFirst = 1000, kCount = 60'000;
    const auto nameOf = [](std::uint64_t id) { return "name " + std::to_string(id); };
    for (std::uint64_t first = kFirst; first < kFirst + kCount; first += 10'000) {
        IndexChanges changes;
        for (std::uint64_t id = first; id < first + 10'000; ++id) changes.put(file(id, nameOf(id)));
        apply(changes);
    }
    IndexChanges changes;
    for (std::uint64_t id = kFirst; id < kFirst + kCount; id += 3) changes.put(file(id, nameOf(id), 3));
    for (std::uint64_t id = kFirst + 1; id < kFirst + kCount; id += 3) changes.remove(FileID{id});
    apply(changes);
    EXPECT_EQ(childrenOf(2).size(), kCount / 3);
    EXPECT_EQ(childrenOf(3).size(), kCount / 3);
    for (std::uint64_t id = kFirst; id < kFirst + kCount; ++id) {
        const std::uint64_t kind = (id - kFirst) % 3;
        ASSERT_EQ(childOf(2, nameOf(id)), kind == 2 ? id : 0);
        ASSERT_EQ(childOf(3, nameOf(id)), kind == 0 ? id : 0);
    }
    reopen();
    EXPECT_EQ(childrenOf(2).size(), kCount / 3);
}

TEST_P(VolumeIndexTest, answersForManyObjectsAtOnce) {
    IndexChanges changes;
    for (std::uint64_t id = 10; id < 500; id += 2) changes.put(file(id, std::to_string(id)));
    apply(changes);
    std::vector<FileID> wanted;
    for (std::uint64_t id = 500; id-- > 10;) wanted.push_back(FileID{id});
    std::vector<int> answers(wanted.size());
    ASSERT_TRUE(store_
                    ->indexed(wanted,
                              [&](std::size_t i, const IndexedObject* object) {
                                  ++answers[i];
                                  ASSERT_EQ(object != nullptr, number(wanted[i]) % 2 == 0);
                                  if (object == nullptr) return;
                                  EXPECT_EQ(object->fileID, wanted[i]);
                                  EXPECT_EQ(object->name, std::to_string(number(wanted[i])));
                              })
                    .ok());
    EXPECT_EQ(std::ranges::count(answers, 1), static_cast<std::ptrdiff_t>(wanted.size()));
}

// MARK: History

TEST_P(VolumeIndexTest, forgetsTheOldestEventsBeyondTheCount) {
    *store_->beginHistory();
    for (std::uint64_t id = 10; id < 20; ++id) {
        put(file(id, "a", id));
        list(file(id, "a", id));
    }
    for (std::uint64_t id = 10; id < 15; ++id) remove(id);  // Two events each: 12, 13; 14, 15; …
    EXPECT_EQ(store_->counts().events, 15U);
    ASSERT_TRUE(store_->trimJournal(15, std::chrono::hours(1)).ok());
    EXPECT_EQ(store_->historyBegin(), 1U);
    ASSERT_TRUE(store_->trimJournal(8, std::chrono::hours(1)).ok());
    EXPECT_EQ(store_->historyBegin(), 13U);
    EXPECT_EQ(store_->counts().events, 8U);
    EXPECT_EQ(eventsAfter(0).size(), 4U);
    EXPECT_EQ(documentEventsAfter(0).size(), 4U);
    // An object whose event was forgotten gets another one as any.
    put(file(15, "a", 15));
    EXPECT_EQ(store_->counts().events, 9U);
    ASSERT_TRUE(store_->trimJournal(0, std::chrono::hours(1)).ok());
    EXPECT_EQ(store_->historyBegin(), store_->currentEventID());
    EXPECT_THAT(eventsAfter(0), IsEmpty());
    EXPECT_EQ(store_->counts().events, 0U);
    reopen();
    EXPECT_EQ(store_->historyBegin(), store_->currentEventID());
    EXPECT_EQ(store_->counts().events, 0U);
}

TEST_P(VolumeIndexTest, forgetsEventsThatAreTooOldAndNoOther) {
    using std::chrono::minutes;
    *store_->beginHistory();
    const auto begin = now_;
    for (std::uint64_t id = 10; id < 40; ++id) {  // Events 2 to 31, five minutes apart.
        put(file(id, "a", id));
        now_ += minutes(5);
        if (id == 25) reopen();
    }
    for (int i = 0; i < 40; ++i) {
        now_ = begin + minutes(60 + i * 5);
        ASSERT_TRUE(store_->trimJournal(1000, minutes(60)).ok());
        // Event n was journalled (n - 2) * 5 minutes after the beginning, and is known to be old ten minutes later.
        const std::uint64_t forgotten = *store_->historyBegin();
        EXPECT_LE((static_cast<int>(forgotten) - 2) * 5, std::max(-5, i * 5));
        EXPECT_GE((static_cast<int>(forgotten) - 2) * 5, std::min(29 * 5, i * 5 - 15));
    }
    EXPECT_EQ(store_->historyBegin(), store_->currentEventID());
}

TEST_P(VolumeIndexTest, knowsAboutWhenItsOldestEventWas) {
    using std::chrono::minutes;
    *store_->beginHistory();
    EXPECT_FALSE(store_->oldestEventTime());
    const auto begin = now_;
    for (std::uint64_t id = 10; id < 40; ++id) {  // Events 2 to 31, five minutes apart.
        put(file(id, "a", id));
        EXPECT_EQ(store_->oldestEventTime(), begin) << "also where it is not saved yet";
        now_ += minutes(5);
        if (id == 25) reopen();
    }
    for (std::uint64_t kept = 29; kept > 0; --kept) {
        ASSERT_TRUE(store_->trimJournal(kept, std::chrono::hours(10)).ok());
        const auto first = begin + minutes(5 * (30 - static_cast<int>(kept)));
        EXPECT_LE(store_->oldestEventTime(), first);
        EXPECT_GE(store_->oldestEventTime(), first - minutes(10));
    }
    ASSERT_TRUE(store_->renewUUID().ok());
    EXPECT_FALSE(store_->oldestEventTime());
    put(file(50, "later", 50));
    EXPECT_EQ(store_->oldestEventTime(), now_);
}

TEST_P(VolumeIndexTest, goesByAClockThatWasSetBack) {
    using std::chrono::hours;
    *store_->beginHistory();
    now_ += hours(10'000);
    put(file(10, "a"));  // 2
    now_ -= hours(10'000);
    put(file(11, "b"));  // 3
    now_ += hours(1);
    put(file(12, "c"));  // 4
    ASSERT_TRUE(store_->trimJournal(1000, hours(2)).ok());
    EXPECT_EQ(store_->historyBegin(), 1U);
    now_ += std::chrono::minutes(70);
    ASSERT_TRUE(store_->trimJournal(1000, hours(2)).ok());
    EXPECT_EQ(store_->historyBegin(), 3U);
    EXPECT_THAT(eventsAfter(0), ElementsAre("4 present 12 2/c"));
}

TEST_P(VolumeIndexTest, takesANewUUIDWithoutLosingAnObject) {
    const KsUUID old = store_->uuid();
    *store_->beginHistory();
    put(file(10, "a"));
    const DocumentID document = list(file(10, "a"));
    ASSERT_TRUE(store_->renewUUID().ok());
    const KsUUID fresh = store_->uuid();
    EXPECT_NE(fresh, old);
    EXPECT_EQ(store_->historyBegin(), 2U);
    EXPECT_EQ(store_->currentEventID(), 2U);
    EXPECT_THAT(eventsAfter(0), IsEmpty());
    EXPECT_EQ(store_->counts().events, 0U);
    put(file(10, "b"));
    EXPECT_THAT(eventsAfter(0), ElementsAre("3 departed 10 2/a at 2:a", "4 present 10 2/b"));
    reopen();
    EXPECT_EQ(store_->uuid(), fresh);
    EXPECT_EQ(store_->historyBegin(), 2U);
    EXPECT_EQ(placeOf(10), "2/b");
    EXPECT_EQ(recordOf(10).documentID, document);
    EXPECT_EQ(eventsAfter(0).size(), 2U);
}

TEST_P(VolumeIndexTest, hasNoHistoryOfItsOwnAccord) {
    put(file(10, "a"));
    ASSERT_TRUE(store_->renewUUID().ok());
    EXPECT_EQ(store_->historyBegin(), std::nullopt);
    put(file(10, "a"));
    EXPECT_EQ(store_->counts().events, 1U);
    ASSERT_TRUE(store_->trimJournal(0, std::chrono::hours(1)).ok());
    EXPECT_EQ(store_->historyBegin(), std::nullopt);
    EXPECT_EQ(store_->counts().events, 0U);
}

TEST_P(VolumeIndexTest, showsNoEventIDBeforeItsEvent) {
    std::atomic<bool> stops = false, failed = false;
    {
        std::jthread reader([&] {
            while (!stops) {
                const std::uint64_t current = store_->currentEventID();
                const auto events = store_->events(current == 0 ? 0 : current - 1, 10'000).value();
                // The event itself, or, where the object has changed since, a newer one.
                if (current > 0 && events.empty()) failed = true;
                std::uint64_t children = 0;
                store_->children(FileID{3}, [&](const IndexedObject&) { ++children; }).value();
                if (children > 20 || store_->childCount(FileID{3}) > 20) failed = true;
                store_->childrenNamed(FileID{3}, "5", [](const IndexedObject&) {});
            }
        });
        for (std::uint64_t i = 0; i < 600; ++i) {
            const std::string name = std::to_string(i % 20);
            IndexChanges changes;
            changes.put(file(10 + i % 20, name, 2 + i / 20 % 2));
            if (!store_->apply(changes, {&kRoot, 1}).ok()) failed = true;
            if (i % 100 == 0) settle();
        }
        stops = true;
    }
    EXPECT_FALSE(failed);
}

TEST_P(VolumeIndexTest, tellsNothingOfWhatCameAndWentUnlisted) {
    put(file(10, "a"));
    remove(10);
    EXPECT_THAT(eventsAfter(0), IsEmpty());
    EXPECT_EQ(store_->counts().events, 0U);
}

TEST_P(VolumeIndexTest, handsADocumentOver) {
    put(file(10, "a"));
    put(file(11, "a~"));
    const DocumentID document = list(file(10, "a"));
    const DocumentID young = list(file(11, "a~"));
    IndexChanges changes;
    changes.handOver(document, FileID{11});
    EXPECT_EQ(apply(changes), 6U);
    EXPECT_EQ(recordOf(11).documentID, document);
    EXPECT_EQ(recordOf(10).documentID, DocumentID{});
    EXPECT_TRUE(recordOf(10).isListed);
    EXPECT_EQ(store_->document(document)->fileID, FileID{11});
    EXPECT_EQ(store_->document(document)->birthTime, 110);
    EXPECT_EQ(store_->document(young)->fileID, FileID{11});
    EXPECT_THAT(documentEventsAfter(0), ElementsAre("4 document 2 11>0", "5 document 1 10>11"));
    EXPECT_THAT(eventsAfter(0), ElementsAre("3 present 10 2/a", "6 present 11 2/a~"));
    reopen();
    EXPECT_EQ(store_->document(document)->fileID, FileID{11});
    EXPECT_EQ(recordOf(11).documentID, document);
}

TEST_P(VolumeIndexTest, remembersOtherNames) {
    put(file(10, "a"));
    IndexChanges changes;
    changes.addName(FileID{10}, FileID{3}, "b");
    changes.addName(FileID{10}, FileID{2}, "c");
    changes.addName(FileID{10}, FileID{2}, "c");
    apply(changes);
    EXPECT_EQ(childOf(3, "b"), 10U);
    EXPECT_EQ(childOf(2, "c"), 10U);
    EXPECT_THAT(childrenOf(2), ElementsAre(10));
    EXPECT_THAT(childrenOf(3), IsEmpty());
    EXPECT_EQ(store_->otherNames(FileID{10}).size(), 2U);
    IndexChanges less;
    less.removeName(FileID{10}, FileID{3}, "b");
    apply(less);
    EXPECT_EQ(childOf(3, "b"), 0U);
    ASSERT_EQ(store_->otherNames(FileID{10}).size(), 1U);
    EXPECT_EQ(store_->otherNames(FileID{10})[0].name, "c");
    reopen();
    EXPECT_EQ(childOf(2, "c"), 10U);
    remove(10);
    EXPECT_EQ(childOf(2, "c"), 0U);
    EXPECT_THAT(store_->otherNames(FileID{10}), IsEmpty());
    put(file(10, "new"));
    EXPECT_EQ(childOf(2, "c"), 0U);
}

TEST_P(VolumeIndexTest, beginsItsHistory) {
    EXPECT_EQ(store_->historyBegin(), std::nullopt);
    put(file(10, "a"), IndexChanges::Journal::no);
    put(file(11, "b"));
    EXPECT_EQ(*store_->beginHistory(), 2U);
    EXPECT_EQ(store_->historyBegin(), 2U);
    EXPECT_EQ(store_->currentEventID(), 2U);
    EXPECT_THAT(eventsAfter(0), IsEmpty());
    EXPECT_EQ(store_->counts().events, 0U);
    put(file(11, "b"));
    EXPECT_THAT(eventsAfter(2), ElementsAre("3 present 11 2/b"));
    EXPECT_EQ(store_->counts().events, 1U);
    reopen();
    EXPECT_EQ(store_->historyBegin(), 2U);
    EXPECT_THAT(eventsAfter(2), ElementsAre("3 present 11 2/b"));
}

// Whoever waits for a first reading waits for no disk.
TEST_P(VolumeIndexTest, beginsAFirstHistoryWithoutACheckpoint) {
    put(file(10, "a"), IndexChanges::Journal::no);
    const int before = checkpointSteps_;
    EXPECT_EQ(*store_->beginHistory(), 1U);
    EXPECT_EQ(checkpointSteps_, before);
    put(file(11, "b"));
    // Killed here; and killed, with the file of numbers lost.
    const std::string killed = temporary_ / "killed";
    std::filesystem::copy(folder(), killed);
    for (const bool losesNumbers : {false, true}) {
        store_.reset();
        std::filesystem::remove_all(folder());
        std::filesystem::copy(killed, folder());
        if (losesNumbers) {
            ASSERT_TRUE(std::filesystem::remove(folder() + "/ids"));
        }
        open();
        EXPECT_EQ(store_->historyBegin(), 1U);
        EXPECT_THAT(eventsAfter(0), ElementsAre("2 present 11 2/b"));
        put(file(10, "a"));
        EXPECT_GT(store_->currentEventID(), 2U);
        EXPECT_EQ(eventsAfter(2).size(), 1U);
    }
}

TEST_P(VolumeIndexTest, keepsAttributes) {
    EXPECT_TRUE(store_->attributes(DocumentID{5}).empty());
    const Bytes bytes(65'536, std::byte{7});
    ASSERT_TRUE(store_->rememberAttributes(DocumentID{5}, bytes).ok());
    settle();
    EXPECT_EQ(store_->attributes(DocumentID{5}), bytes);
    reopen();
    EXPECT_EQ(store_->attributes(DocumentID{5}), bytes);
    EXPECT_TRUE(store_->rememberAttributes(DocumentID{5}, Bytes(65'537)).error().isPosix(EINVAL));
    ASSERT_TRUE(store_->rememberAttributes(DocumentID{5}, {}).ok());
    settle();
    EXPECT_TRUE(store_->attributes(DocumentID{5}).empty());
    reopen();
    EXPECT_TRUE(store_->attributes(DocumentID{5}).empty());
}

}  // namespace
}  // namespace cindral
