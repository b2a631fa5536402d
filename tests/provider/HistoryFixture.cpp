#include "provider/HistoryFixture.h"

#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>

#include "platform/foundation/Base64.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/fs/FSEntryFinder.h"

namespace cindral::test {

std::vector<std::string> GivenChanges::updatedNames() const {
    std::vector<std::string> names;
    for (const auto& item : updated) names.push_back(item->filename());
    return names;
}

void RecordingChangeObserver::didUpdateItems(TesselItems items) {
    EXPECT_EQ(finishes_, 0) << "nothing follows the end";
    for (auto& item : items) {
        given.log.emplace_back('u', item->filename());
        given.updated.push_back(std::move(item));
    }
}

void RecordingChangeObserver::didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) {
    EXPECT_EQ(finishes_, 0) << "nothing follows the end";
    for (auto& identifier : identifiers) {
        given.log.emplace_back('d', identifier);
        given.deleted.push_back(std::move(identifier));
    }
}

void RecordingChangeObserver::finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) {
    given.anchor = std::move(anchor);
    given.moreComing = moreComing;
    ++finishes_;
    finished_.signal();
}

void RecordingChangeObserver::finishEnumeratingWithError(const KsError& error) {
    given.error = error;
    ++finishes_;
    finished_.signal();
}

const GivenChanges& RecordingChangeObserver::wait() {
    finished_.wait();
    return given;
}

HistoryTest::HistoryTest() : history_(std::make_shared<ScriptedHistory>(store_->uuid())) {
    EventHistory::setShared(history_);
}

HistoryTest::~HistoryTest() {
    EventHistory::setShared(nullptr);
}

std::uint64_t HistoryTest::fileID(std::string_view name) const {
    struct stat status {};
    EXPECT_EQ(::lstat((storage_ / name).c_str(), &status), 0) << name;
    return status.st_ino;
}

TesselItemIdentifier HistoryTest::identifier(std::string_view name) const {
    KsURL named = url(name);
    return itemIdentifier(named).value_or("");
}

DocumentID HistoryTest::documentID(std::string_view name) const {
    const auto object = store_->object(FileID{fileID(name)});
    return object ? object->documentID : DocumentID{};
}

void HistoryTest::record(std::string_view name) {
    FSEntryFinder finder({storageURL()});
    auto found = finder.find(storage_ / name);
    ASSERT_TRUE(found.ok() && found->url) << name;
    std::vector<KsURL> entries{*found->url};
    ASSERT_TRUE(RvStorageManager::defaultManager().identify(entries).ok());
}

std::uint64_t HistoryTest::changed(std::string_view name) {
    Event event;
    event.path = storage_ / name;
    event.fileID = FileID{fileID(name)};
    event.documentID = documentID(name);
    event.kind = kindOf(name);
    return history_->add(std::move(event));
}

ObjectKind HistoryTest::kindOf(std::string_view name) const {
    const KsURL named = url(name);
    const auto status = named.status();
    if (!status.ok() || !(status->isDirectory() || status->isRegular())) return ObjectKind::other;
    if (status->isRegular()) return ObjectKind::file;
    return named.ts_isFolder() ? ObjectKind::folder : ObjectKind::package;
}

std::uint64_t HistoryTest::left(std::string_view name, std::uint64_t fileID, ObjectKind kind, DocumentID documentID) {
    Event event;
    event.path = storage_ / name;
    event.flags = EventFlags::removed;
    event.fileID = FileID{fileID};
    event.documentID = documentID;
    event.kind = kind;
    return history_->add(std::move(event));
}

std::uint64_t HistoryTest::documentWent(DocumentID document, std::uint64_t source, std::uint64_t target) {
    Event event;
    event.path =
        fmt::format("/.docid/7/changed/{}/src={},dst={}", static_cast<std::uint32_t>(document), source, target);
    event.documentID = document;
    return history_->addDocument(std::move(event));
}

void HistoryTest::move(std::string_view from, std::string_view to) {
    const std::uint64_t moved = fileID(from);
    const DocumentID document = documentID(from);
    const ObjectKind kind = kindOf(from);
    ASSERT_EQ(std::rename((storage_ / from).c_str(), (storage_ / to).c_str()), 0);
    record(to);
    left(from, moved, kind, document);
    changed(to);
    folderChanged(from);
    folderChanged(to);
}

void HistoryTest::folderChanged(std::string_view name) {
    if (const std::size_t slash = name.rfind('/'); slash != std::string_view::npos) changed(name.substr(0, slash));
}

void HistoryTest::made(std::string_view name) {
    record(name);
    changed(name);
    folderChanged(name);
}

void HistoryTest::remove(std::string_view name) {
    const std::uint64_t gone = fileID(name);
    const DocumentID document = documentID(name);
    const ObjectKind kind = kindOf(name);
    ASSERT_EQ(std::remove((storage_ / name).c_str()), 0);
    left(name, gone, kind, document);
    folderChanged(name);
}

GivenChanges HistoryTest::changes(TesselEnumerator& enumerator, const TesselSyncAnchor& anchor) {
    const auto observer = std::make_shared<RecordingChangeObserver>();
    enumerator.enumerateChangesForObserver(observer, anchor);
    GivenChanges given = observer->wait();
    EXPECT_EQ(observer->finishes(), 1);
    return given;
}

GivenChanges HistoryTest::allChanges(TesselEnumerator& enumerator, TesselSyncAnchor anchor) {
    GivenChanges all;
    do {
        GivenChanges given = changes(enumerator, anchor);
        EXPECT_FALSE(given.error) << given.error->description();
        if (given.error) return all;
        all.log.insert(all.log.end(), given.log.begin(), given.log.end());
        all.updated.insert(all.updated.end(), given.updated.begin(), given.updated.end());
        all.deleted.insert(all.deleted.end(), given.deleted.begin(), given.deleted.end());
        all.moreComing = given.moreComing;
        anchor = *given.anchor;
    } while (all.moreComing);
    all.anchor = std::move(anchor);
    return all;
}

TesselSyncAnchor HistoryTest::anchorOf(TesselEnumerator& enumerator) {
    std::optional<TesselSyncAnchor> anchor;
    enumerator.currentSyncAnchorWithCompletionHandler(
        [&](std::optional<TesselSyncAnchor> given) { anchor = std::move(given); });
    EXPECT_TRUE(anchor);
    return anchor.value_or(TesselSyncAnchor());
}

ClientView::ClientView(TesselItems items, TesselSyncAnchor anchor) : anchor_(std::move(anchor)) {
    for (auto& item : items) items_[item->itemIdentifier()] = std::move(item);
}

void ClientView::takeOut(const TesselItemIdentifier& identifier) {
    items_.erase(identifier);
    std::vector<TesselItemIdentifier> below;
    for (const auto& [other, item] : items_) {
        if (item->parentItemIdentifier() == identifier) below.push_back(other);
    }
    for (const auto& other : below) takeOut(other);
}

void ClientView::apply(const GivenChanges& changes) {
    std::size_t updates = 0;
    for (const auto& [kind, text] : changes.log) {
        if (kind == 'd') {
            takeOut(text);
        } else {
            const auto& item = changes.updated[updates++];
            items_[item->itemIdentifier()] = item;
        }
    }
    anchor_ = *changes.anchor;
}

std::map<TesselItemIdentifier, std::string> ClientView::contentsOf(const TesselItems& items) {
    std::map<TesselItemIdentifier, std::string> contents;
    for (const auto& item : items) {
        contents[item->itemIdentifier()] =
            fmt::format("{} in {}, {}, {} bytes, {} children, version {}, file {}, document {}, can {}, {}, app {}",
                        item->filename(), item->parentItemIdentifier(), item->typeIdentifier(),
                        item->documentSize().value_or(0), item->childItemCount().value_or(0),
                        base64Encode(*item->versionIdentifier()), item->fileID().value_or(0), item->docID().value_or(0),
                        static_cast<std::uint32_t>(item->capabilities()), item->isTrashed() ? "trashed" : "kept",
                        item->appContainerBundleIdentifier() ? *item->appContainerBundleIdentifier() : "none");
    }
    return contents;
}

std::map<TesselItemIdentifier, std::string> ClientView::contents() const {
    TesselItems items;
    for (const auto& [identifier, item] : items_) items.push_back(item);
    return contentsOf(items);
}

}  // namespace cindral::test
