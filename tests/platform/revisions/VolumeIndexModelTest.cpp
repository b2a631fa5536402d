#include <fmt/format.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <random>
#include <set>
#include <tuple>

#include "platform/revisions/RevisionsNumbers.h"
#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeStore.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::TemporaryFolder;

/// The rules of the index and the journal, carried out on plain maps.
class Model {
public:
    struct Object {
        std::int64_t birthTime = 0;
        std::uint64_t parent = 0;
        std::string name;
        ObjectKind kind = ObjectKind::other;
        std::int64_t changeTime = 0;
        std::uint64_t size = 0;
        std::uint32_t document = 0;
        bool isListed = false;
        std::uint64_t event = 0;

        friend bool operator==(const Object&, const Object&) = default;
    };

    void put(std::uint64_t fileID, const Object& given, bool journals) {
        if (objects.contains(fileID) && objects[fileID].birthTime != given.birthTime) remove(fileID, journals);
        Object now = given;
        if (const auto found = objects.find(fileID); found != objects.end()) {
            const Object& before = found->second;
            const bool changesForm = (before.kind == ObjectKind::folder) != (given.kind == ObjectKind::folder);
            if (isListed(before) && (before.parent != given.parent || before.name != given.name || changesForm)) {
                depart(fileID, journals);
            }
            now.document = before.document;
            now.isListed = before.isListed;
            now.event = before.event;
        }
        if (journals) now.event = nextEvent++;
        objects[fileID] = now;
    }

    void remove(std::uint64_t fileID, bool journals) {
        const auto found = objects.find(fileID);
        if (found == objects.end()) return;
        if (isListed(found->second)) depart(fileID, journals);
        const std::uint32_t document = found->second.document;
        if (document != 0 && documents[document].first == fileID) changeDocument(document, fileID, 0, journals);
        forget(fileID);
    }

    void touch(std::uint64_t fileID, bool journals) {
        if (objects.contains(fileID) && journals) objects[fileID].event = nextEvent++;
    }

    /// False when it cannot be.
    bool handOver(std::uint32_t document, std::uint64_t to, bool journals) {
        if (!objects.contains(to) || !documents.contains(document)) return false;
        Object& target = objects[to];
        if (target.document == document) return true;
        const std::uint64_t source = documents[document].first;
        if (objects.contains(source) && objects[source].document == document) {
            objects[source].document = 0;
            touch(source, journals);
        }
        if (target.document != 0) changeDocument(target.document, to, 0, journals);
        target.document = document;
        target.isListed = true;
        documents[document] = {to, target.birthTime};
        changeDocument(document, source, to, journals);
        touch(to, journals);
        return true;
    }

    /// Answers whether it is given a document.
    bool sight(std::uint64_t fileID, const Object& seen, bool wantsDocument) {
        if (objects.contains(fileID) && objects[fileID].birthTime != seen.birthTime) {
            if (objects[fileID].changeTime != 0) {
                remove(fileID, true);
            } else {
                forget(fileID);
            }
        }
        if (!objects.contains(fileID)) objects[fileID].birthTime = seen.birthTime;
        Object& object = objects[fileID];
        if (object.changeTime == 0) {
            object.parent = seen.parent;
            object.name = seen.name;
            object.kind = seen.kind;
        }
        object.isListed = true;
        return wantsDocument && object.document == 0;
    }
    void giveDocument(std::uint64_t fileID, std::uint32_t document) {
        objects[fileID].document = document;
        documents[document] = {fileID, objects[fileID].birthTime};
    }

    void trim(std::uint64_t eventsMax) {
        std::vector<std::uint64_t> ids;
        for (const auto& [id, line] : events()) ids.push_back(id);
        for (const auto& [id, line] : documentEvents) ids.push_back(id);
        std::ranges::sort(ids);
        if (ids.size() > eventsMax) forgetUpTo(ids[ids.size() - eventsMax - 1]);
    }
    void forgetUpTo(std::uint64_t id) {
        forgotten = std::max(id, forgotten);
        std::erase_if(departures, [&](const auto& entry) { return entry.first <= id; });
        std::erase_if(documentEvents, [&](const auto& entry) { return entry.first <= id; });
    }

    std::map<std::uint64_t, std::string> events() const {
        std::map<std::uint64_t, std::string> all = departures;
        for (const auto& [fileID, object] : objects) {
            if (object.event > forgotten) {
                all[object.event] = fmt::format("{} present {} at {}/{} kind {} document {}", object.event, fileID,
                                                object.parent, object.name, int(object.kind), object.document);
            }
        }
        return all;
    }

    std::map<std::uint64_t, Object> objects;
    std::map<std::uint32_t, std::pair<std::uint64_t, std::int64_t>> documents;
    std::set<std::tuple<std::uint64_t, std::uint64_t, std::string>> names;
    std::map<std::uint64_t, std::string> departures, documentEvents;
    std::map<std::uint32_t, Bytes> attributes;
    std::uint64_t forgotten = 0;
    bool hasHistory = false;
    std::uint64_t nextEvent = 1;
    bool knowsRoots = false;

private:
    static bool isListed(const Object& object) { return object.isListed || object.document != 0; }

    void forget(std::uint64_t fileID) {
        objects.erase(fileID);
        std::erase_if(names, [&](const auto& name) { return std::get<0>(name) == fileID; });
    }

    void depart(std::uint64_t fileID, bool journals) {
        if (!journals) return;
        const Object& object = objects[fileID];
        const auto path = pathOf(fileID);
        departures[nextEvent] =
            fmt::format("{} departed {} from {}/{} kind {} document {} at {}:{}", nextEvent, fileID, object.parent,
                        object.name, int(object.kind), object.document, path ? 2 : 0, path.value_or(""));
        ++nextEvent;
    }

    std::optional<std::string> pathOf(std::uint64_t fileID) const {
        if (!knowsRoots) return std::nullopt;
        std::string path;
        for (std::uint64_t at = fileID; at != 2;) {
            const auto found = objects.find(at);
            if (found == objects.end() || path.size() > 100'000) return std::nullopt;
            path = found->second.name + (path.empty() ? "" : "/") + path;
            at = found->second.parent;
        }
        return path;
    }

    void changeDocument(std::uint32_t document, std::uint64_t source, std::uint64_t target, bool journals) {
        if (!journals) return;
        documentEvents[nextEvent] = fmt::format("{} document {} from {} to {}", nextEvent, document, source, target);
        ++nextEvent;
    }
};

std::string modelLineOf(const JournalEvent& event) {
    switch (event.kind) {
        case JournalEvent::Kind::present:
            return fmt::format("{} present {} at {}/{} kind {} document {}", event.id, number(event.fileID),
                               number(event.parent), event.name, int(event.objectKind), number(event.documentID));
        case JournalEvent::Kind::departed:
            return fmt::format("{} departed {} from {}/{} kind {} document {} at {}:{}", event.id, number(event.fileID),
                               number(event.parent), event.name, int(event.objectKind), number(event.documentID),
                               number(event.root), event.path);
        case JournalEvent::Kind::document:
            return fmt::format("{} document {} from {} to {}", event.id, number(event.documentID), number(event.fileID),
                               number(event.target));
    }
    return "";
}

/// A store beside its model, and random steps that both take.
class VolumeIndexModelTest : public ::testing::TestWithParam<unsigned> {
protected:
    static constexpr std::uint64_t kFolders = 5;   // 2 is the root; 3 to 6 may be recorded.
    static constexpr std::uint64_t kObjects = 30;  // 3 to 32.

    VolumeIndexModelTest() : random_(GetParam()) { open(); }

    std::uint64_t pick(std::uint64_t count) { return random_() % count; }
    bool oneIn(std::uint64_t count) { return pick(count) == 0; }
    std::string folder() const { return temporary_ / "store"; }

    VolumeStoreOptions options() {
        VolumeStoreOptions options;
        options.checkpointsItself = false;
        options.checkpointPagesMax = 1 + pick(5);
        options.onCheckpointStep = [this] { withinACheckpoint(); };
        return options;
    }
    void open() {
        auto opened = VolumeStore::open(folder(), options());
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        store_ = std::move(opened).value();
        model_.knowsRoots = false;
        model_.nextEvent = store_->currentEventID() + 1;
    }

    // MARK: Steps

    Model::Object randomObject(std::uint64_t fileID) {
        static constexpr std::array<ObjectKind, 4> kKinds = {ObjectKind::file, ObjectKind::folder, ObjectKind::package,
                                                             ObjectKind::other};
        Model::Object object;
        object.birthTime = oneIn(8) ? 2 : 1;
        object.parent = 2 + pick(kFolders);
        object.name = std::string(1 + (oneIn(10) ? pick(300) : 0), static_cast<char>('a' + pick(6)));
        object.kind = kKinds[pick(4)];
        // Nothing is ever in a file, and the store counts on that.
        if (canHaveChildren(fileID) && object.kind == ObjectKind::file) object.kind = ObjectKind::folder;
        object.changeTime = oneIn(5) ? 0 : static_cast<std::int64_t>(1 + pick(3));
        object.size = pick(3);
        return object;
    }
    static bool canHaveChildren(std::uint64_t fileID) { return fileID < 2 + kFolders; }
    std::uint64_t randomFileID() { return 3 + pick(kObjects); }
    std::uint32_t randomDocument() {
        if (model_.documents.empty()) return 1;
        return std::next(model_.documents.begin(), static_cast<std::ptrdiff_t>(pick(model_.documents.size())))->first;
    }

    void apply() {
        const bool journals = !oneIn(6);
        IndexChanges changes(journals ? IndexChanges::Journal::yes : IndexChanges::Journal::no);
        const Model before = model_;
        model_.knowsRoots = true;
        bool isPossible = true;
        for (std::uint64_t i = 0, count = 1 + pick(oneIn(5) ? 40 : 6); i < count; ++i) {
            isPossible = addOperation(changes, journals) && isPossible;
        }
        const std::vector<FileID> roots{FileID{2}};
        const auto done = store_->apply(changes, roots);
        ASSERT_EQ(done.ok(), isPossible);
        if (!isPossible) {
            model_ = before;
            model_.knowsRoots = true;
        } else if (*done != model_.nextEvent - 1) {
            // What comes and goes within a batch that does nothing else takes no number.
            ASSERT_EQ(*done, before.nextEvent - 1);
            ASSERT_EQ(model_.events(), before.events());
            model_.nextEvent = before.nextEvent;
        }
    }
    bool addOperation(IndexChanges& changes, bool journals) {
        const std::uint64_t fileID = randomFileID();
        const FileID id{fileID};
        const Model::Object object = randomObject(fileID);
        switch (pick(12)) {
            case 0:
            case 1:
                changes.remove(id);
                model_.remove(fileID, journals);
                return true;
            case 2:
                changes.touch(id);
                model_.touch(fileID, journals);
                return true;
            case 3:
                changes.addName(id, FileID{object.parent}, object.name);
                if (model_.objects.contains(fileID)) model_.names.insert({fileID, object.parent, object.name});
                return true;
            case 4: {
                std::tuple<std::uint64_t, std::uint64_t, std::string> name{fileID, object.parent, object.name};
                if (!model_.names.empty() && !oneIn(3)) name = *model_.names.begin();
                changes.removeName(FileID{std::get<0>(name)}, FileID{std::get<1>(name)}, std::get<2>(name));
                model_.names.erase(name);
                return true;
            }
            case 5: {
                const std::uint32_t document = oneIn(30) ? 4'000'000'000 : randomDocument();
                changes.handOver(DocumentID{document}, id);
                // What cannot be is rare, or no batch would ever be carried out.
                if (!model_.objects.contains(fileID) && !oneIn(10)) {
                    changes.put(indexed(fileID, object));
                    model_.put(fileID, object, journals);
                    return false;
                }
                return model_.handOver(document, fileID, journals);
            }
            default:
                changes.put(indexed(fileID, object));
                model_.put(fileID, object, journals);
                return true;
        }
    }
    static IndexedObject indexed(std::uint64_t fileID, const Model::Object& object) {
        return {.fileID = FileID{fileID},
                .birthTime = object.birthTime,
                .parent = FileID{object.parent},
                .name = object.name,
                .kind = object.kind,
                .changeTime = object.changeTime,
                .size = object.size};
    }

    void list() {
        std::vector<std::pair<std::uint64_t, Model::Object>> seen;
        std::vector<ObjectSighting> page;
        for (std::uint64_t i = 0, count = 1 + pick(6); i < count; ++i) {
            const std::uint64_t fileID = randomFileID();
            Model::Object object = randomObject(fileID);
            const auto known = model_.objects.find(fileID);
            if (known != model_.objects.end() && !oneIn(3)) object = known->second;
            seen.emplace_back(fileID, object);
        }
        for (const auto& [fileID, object] : seen) {
            page.push_back({.fileID = FileID{fileID},
                            .birthTime = object.birthTime,
                            .parent = FileID{object.parent},
                            .kind = object.kind,
                            .name = object.name,
                            .wantsDocumentID = !oneIn(3)});
        }
        ASSERT_TRUE(store_->identify(page).ok());
        for (std::size_t i = 0; i < page.size(); ++i) {
            const auto& [fileID, object] = seen[i];
            if (model_.sight(fileID, object, page[i].wantsDocumentID)) {
                ASSERT_GT(number(page[i].documentID), lastDocument_);
                lastDocument_ = number(page[i].documentID);
                model_.giveDocument(fileID, lastDocument_);
            }
            ASSERT_EQ(number(page[i].documentID), model_.objects[fileID].document);
        }
        ASSERT_EQ(store_->currentEventID(), model_.nextEvent - 1);
    }

    void rememberAttributes() {
        const std::uint32_t document = randomDocument();
        const Bytes bytes(pick(4) * (oneIn(4) ? 10'000 : 3), static_cast<std::byte>(pick(256)));
        ASSERT_TRUE(store_->rememberAttributes(DocumentID{document}, bytes).ok());
        if (bytes.empty()) {
            model_.attributes.erase(document);
        } else {
            model_.attributes[document] = bytes;
        }
    }

    void trim() {
        const std::uint64_t eventsMax = pick(40);
        ASSERT_TRUE(store_->trimJournal(eventsMax, std::chrono::hours(1000)).ok());
        model_.trim(eventsMax);
    }

    void begin() {
        ASSERT_EQ(*store_->beginHistory(), model_.nextEvent);
        model_.forgetUpTo(model_.nextEvent++);
        model_.hasHistory = true;
    }

    void renew() {
        const KsUUID before = store_->uuid();
        ASSERT_TRUE(store_->renewUUID().ok());
        ASSERT_NE(store_->uuid(), before);
        model_.forgetUpTo(model_.nextEvent - 1);
    }

    // MARK: Ends

    /// The files as they are now become the store's, as if the process had been killed.
    void crash() {
        const std::string copy = temporary_ / "copy";
        std::filesystem::remove_all(copy);
        std::filesystem::copy(folder(), copy);
        goOnWith(copy);
    }
    void goOnWith(const std::string& copy) {
        crashes_ = false;
        store_.reset();
        std::filesystem::remove_all(folder());
        std::filesystem::rename(copy, folder());
        open();
    }
    void reopen() {
        store_.reset();
        open();
    }

    /// Between two transactions of a checkpoint: reading goes on, recording, too, and the process may be killed.
    void withinACheckpoint() {
        if (store_ == nullptr || isWithin_) return;
        isWithin_ = true;
        if (oneIn(8)) expectSame();
        if (mayWriteWithin_ && !crashes_ && oneIn(4)) {
            apply();
            list();
            expectSame();
        }
        if (!crashes_ && oneIn(6)) {
            std::filesystem::remove_all(temporary_ / "crashed");
            std::filesystem::copy(folder(), temporary_ / "crashed");
            crashes_ = true;
            crashedModel_ = model_;
        } else if (oneIn(6)) {
            expectOrderAfterPowerCut();
        }
        isWithin_ = false;
    }

    /// Without the logs some of a checkpoint is missing, and what there is fits together.
    void expectOrderAfterPowerCut() {
        const std::string cut = temporary_ / "cut";
        std::filesystem::remove_all(cut);
        std::filesystem::copy(folder(), cut);
        std::filesystem::remove(cut + "/log.0");
        std::filesystem::remove(cut + "/log.1");
        VolumeStoreOptions options;
        options.checkpointsItself = false;
        const auto store = std::move(VolumeStore::open(cut, options)).value();
        std::map<std::uint64_t, std::set<std::uint64_t>> children;
        for (std::uint64_t id = 3; id < 3 + kObjects; ++id) {
            store->indexed(FileID{id},
                           [&](const IndexedObject& object) { children[number(object.parent)].insert(id); });
        }
        for (std::uint64_t parent = 2; parent < 2 + kFolders; ++parent) {
            std::set<std::uint64_t> listed;
            store->children(FileID{parent}, [&](const IndexedObject& object) { listed.insert(number(object.fileID)); })
                .value();
            EXPECT_EQ(listed, children[parent]) << parent;
            EXPECT_EQ(store->childCount(FileID{parent}), listed.size());
        }
        // Every change of an object that is known has its event.
        const auto events = store->events(0, 100'000).value();
        std::set<std::uint64_t> ids;
        for (const JournalEvent& event : events) ids.insert(event.id);
        for (std::uint64_t id = 3; id < 3 + kObjects; ++id) {
            store->indexed(FileID{id}, [&](const IndexedObject& object) {
                if (object.eventID > model_.forgotten) {
                    EXPECT_TRUE(ids.contains(object.eventID)) << object.eventID;
                }
            });
        }
    }

    // MARK: Comparing

    void expectSame() {
        expectSameObjects();
        expectSameChildren();
        expectSameEvents();
        for (const auto& [document, object] : model_.documents) {
            const auto found = store_->document(DocumentID{document});
            ASSERT_TRUE(found.has_value());
            EXPECT_EQ(number(found->fileID), object.first);
            EXPECT_EQ(found->birthTime, object.second);
            const auto attributes = model_.attributes.find(document);
            EXPECT_EQ(store_->attributes(DocumentID{document}),
                      attributes != model_.attributes.end() ? attributes->second : Bytes());
        }
        EXPECT_EQ(store_->historyBegin(), model_.hasHistory ? std::optional(model_.forgotten) : std::nullopt);
        EXPECT_EQ(store_->counts().objects, model_.objects.size());
        EXPECT_EQ(store_->counts().documents, model_.documents.size());
    }

    void expectSameObjects() {
        std::vector<FileID> ids;
        for (std::uint64_t id = 3; id < 3 + kObjects; ++id) ids.push_back(FileID{id});
        std::size_t answers = 0;
        store_
            ->indexed(ids,
                      [&](std::size_t i, const IndexedObject* found) {
                          ++answers;
                          const auto known = model_.objects.find(number(ids[i]));
                          ASSERT_EQ(found != nullptr, known != model_.objects.end()) << number(ids[i]);
                          if (found == nullptr) return;
                          const Model::Object object{.birthTime = found->birthTime,
                                                     .parent = number(found->parent),
                                                     .name = std::string(found->name),
                                                     .kind = found->kind,
                                                     .changeTime = found->changeTime,
                                                     .size = found->size,
                                                     .document = number(found->documentID),
                                                     .isListed = found->isListed,
                                                     .event = found->eventID};
                          EXPECT_EQ(object, known->second) << number(ids[i]);
                      })
            .value();
        EXPECT_EQ(answers, ids.size());
        for (const FileID id : ids) {
            std::set<std::pair<std::uint64_t, std::string>> expected, found;
            const auto object = model_.objects.find(number(id));
            for (const auto& [itsID, parent, name] : model_.names) {
                if (itsID != number(id)) continue;
                if (parent != object->second.parent || name != object->second.name) expected.insert({parent, name});
            }
            const auto names = store_->otherNames(id);
            for (const auto& name : names) found.insert({number(name.parent), name.name});
            EXPECT_EQ(found, expected);
        }
    }

    void expectSameChildren() {
        for (std::uint64_t parent = 2; parent < 3 + kFolders; ++parent) {
            std::set<std::uint64_t> expected;
            std::multiset<std::uint64_t> found;
            std::map<std::string, std::set<std::uint64_t>> recorded, others;
            for (const auto& [id, object] : model_.objects) {
                if (object.parent != parent) continue;
                expected.insert(id);
                recorded[object.name].insert(id);
            }
            for (const auto& [id, itsParent, name] : model_.names) {
                if (itsParent == parent) others[name].insert(id);
            }
            store_->children(FileID{parent}, [&](const IndexedObject& object) { found.insert(number(object.fileID)); })
                .value();
            EXPECT_EQ(found, std::multiset<std::uint64_t>(expected.begin(), expected.end())) << parent;
            EXPECT_EQ(store_->childCount(FileID{parent}), expected.size()) << parent;
            for (char letter = 'a'; letter < 'h'; ++letter) {
                const std::string name(1, letter);
                std::set<std::uint64_t> all = recorded[name];
                all.insert(others[name].begin(), others[name].end());
                std::multiset<std::uint64_t> named;
                const bool isThere = store_->childrenNamed(
                    FileID{parent}, name, [&](const IndexedObject& object) { named.insert(number(object.fileID)); });
                EXPECT_EQ(named, std::multiset<std::uint64_t>(all.begin(), all.end())) << parent << "/" << name;
                EXPECT_EQ(isThere, !all.empty());
            }
        }
    }

    void expectSameEvents() {
        const std::map<std::uint64_t, std::string> expected = model_.events();
        expectSameLines(expected, [&](auto after, auto max) { return store_->events(after, max).value(); });
        expectSameLines(model_.documentEvents,
                        [&](auto after, auto max) { return store_->documentEvents(after, max).value(); });
        EXPECT_EQ(store_->counts().events, expected.size() + model_.documentEvents.size());
    }
    template <typename Read>
    void expectSameLines(const std::map<std::uint64_t, std::string>& expected, Read read) {
        const std::uint64_t last = model_.nextEvent - 1;
        for (const std::uint64_t after : {std::uint64_t{0}, last - std::min<std::uint64_t>(last, pick(60))}) {
            const std::size_t max = oneIn(2) ? 100'000 : pick(10);
            std::vector<std::string> wanted, found;
            for (auto at = expected.upper_bound(after); at != expected.end() && wanted.size() < max; ++at) {
                wanted.push_back(at->second);
            }
            const std::vector<JournalEvent> events = read(after, max);
            for (const JournalEvent& event : events) found.push_back(modelLineOf(event));
            ASSERT_EQ(found, wanted) << "after " << after << ", at most " << max;
        }
    }

    void step() {
        const std::uint64_t kind = pick(100);
        if (kind < 40) return apply();
        if (kind < 65) return list();
        if (kind < 70) return rememberAttributes();
        if (kind < 85) return checkpoint();
        if (kind < 88) return reopen();
        if (kind < 92) return crash();
        if (kind < 96) return withoutWritingWithin([&] { trim(); });
        if (kind < 98) return withoutWritingWithin([&] { begin(); });
        withoutWritingWithin([&] { renew(); });
    }
    void checkpoint() {
        ASSERT_TRUE(store_->checkpoint().ok());
        if (!crashes_) return;
        model_ = crashedModel_;
        goOnWith(temporary_ / "crashed");
    }
    // Its steps come while the model is behind.
    template <typename Body>
    void withoutWritingWithin(Body body) {
        ASSERT_TRUE(store_->checkpoint().ok());
        crashes_ = false;
        isWithin_ = true;
        body();
        isWithin_ = false;
    }

    std::mt19937_64 random_;
    TemporaryFolder temporary_;
    Model model_, crashedModel_;
    std::unique_ptr<VolumeStore> store_;
    std::uint32_t lastDocument_ = 0;
    bool isWithin_ = false;
    bool mayWriteWithin_ = true;
    bool crashes_ = false;
};

INSTANTIATE_TEST_SUITE_P(Seeds, VolumeIndexModelTest, ::testing::Range(1U, 7U));

// As after a first reading: there are objects, and no event to forget.
TEST_P(VolumeIndexModelTest, goesOnFromAFirstHistory) {
    for (std::uint64_t i = pick(3); i > 0; --i) list();
    begin();
    expectSame();
    for (int i = 0; i < 20; ++i) {
        SCOPED_TRACE(fmt::format("seed {}, step {}", GetParam(), i));
        i == 0 && oneIn(2) ? crash() : step();
        if (HasFatalFailure()) return;
        expectSame();
        if (HasFailure()) return;
    }
}

TEST_P(VolumeIndexModelTest, answersAsPlainMapsDo) {
    for (int i = 0; i < 80; ++i) {
        SCOPED_TRACE(fmt::format("seed {}, step {}", GetParam(), i));
        step();
        if (HasFatalFailure()) return;
        expectSame();
        if (HasFailure()) return;
    }
}

}  // namespace
}  // namespace cindral
