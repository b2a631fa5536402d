#include "platform/revisions/VolumeIndex.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/revisions/VolumeStore.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::TemporaryFolder;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

constexpr FileID kRoot{2};

std::uint64_t number(FileID id) {
    return static_cast<std::uint64_t>(id);
}

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
        store_->child(FileID{parent}, name, [&](const IndexedObject& object) { found = number(object.fileID); });
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
