#pragma once

#include <fmt/format.h>

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral::test {

/// An item whose every value the test says.
struct FakeItem final : TesselItem {
    std::string identifier = "did=1";
    std::string parent = kTesselRootContainerItemIdentifier;
    std::string name = "report.txt";
    std::string type = "text/plain";
    TesselItemCapabilities can = TesselItemCapabilities::allowsReading;
    bool trashed = false;
    bool ubiquitous = false;
    bool appLibrary = false;
    std::optional<std::uint64_t> size;
    std::optional<KsDate> created;
    std::optional<KsDate> modified;
    std::optional<std::uint64_t> children;
    std::optional<Bytes> version;
    std::optional<KsDate> lastUsed;
    std::optional<std::vector<std::string>> tagList;
    std::optional<std::int64_t> rank;
    std::optional<std::uint64_t> file;
    std::optional<std::uint64_t> document;
    std::optional<KsURL> url;
    std::optional<std::string> bundle;

    const TesselItemIdentifier& itemIdentifier() const override { return identifier; }
    const TesselItemIdentifier& parentItemIdentifier() const override { return parent; }
    const std::string& filename() const override { return name; }
    const std::string& typeIdentifier() const override { return type; }
    TesselItemCapabilities capabilities() const override { return can; }
    bool isTrashed() const override { return trashed; }
    bool isUbiquitous() const override { return ubiquitous; }
    bool isAppLibrary() const override { return appLibrary; }
    std::optional<std::uint64_t> documentSize() const override { return size; }
    std::optional<KsDate> creationDate() const override { return created; }
    std::optional<KsDate> contentModificationDate() const override { return modified; }
    std::optional<std::uint64_t> childItemCount() const override { return children; }
    std::optional<ByteView> versionIdentifier() const override {
        return version ? std::optional<ByteView>(*version) : std::nullopt;
    }
    std::optional<KsDate> lastUsedDate() const override { return lastUsed; }
    const std::optional<std::vector<std::string>>& tags() const override { return tagList; }
    std::optional<std::int64_t> favoriteRank() const override { return rank; }
    std::optional<std::uint64_t> fileID() const override { return file; }
    std::optional<std::uint64_t> docID() const override { return document; }
    const KsURL* fileURL() const override { return url ? &*url : nullptr; }
    const std::string* appContainerBundleIdentifier() const override { return bundle ? &*bundle : nullptr; }
    const std::string* vistorDomainIdentifier() const override { return nullptr; }
    std::string description() const override { return identifier; }
};

/// A provider of a tree in memory, which hands out pages of kPageItems and counts what its host does.
class FakeProvider final : public TesselExtension, public std::enable_shared_from_this<FakeProvider> {
public:
    static constexpr std::size_t kPageItems = 3;

    FakeProvider() {
        folder(kTesselRootContainerItemIdentifier, "Documents", "");
        items_[kTesselRootContainerItemIdentifier]->can = TesselItemCapabilities::allowsReading;
    }

    FakeItem& folder(const std::string& identifier, const std::string& name,
                     const std::string& parent = kTesselRootContainerItemIdentifier) {
        FakeItem& item = add(identifier, name, parent);
        item.type = "inode/directory";
        return item;
    }
    FakeItem& document(const std::string& identifier, const std::string& name,
                       const std::string& parent = kTesselRootContainerItemIdentifier) {
        return add(identifier, name, parent);
    }
    void documents(int count, const std::string& parent) {
        for (int i = 0; i < count; ++i) document(fmt::format("did={}", i + 1), fmt::format("{:04}.txt", i), parent);
    }
    void remove(const std::string& identifier) {
        std::erase_if(children_[items_.at(identifier)->parent],
                      [&](const auto& child) { return child->identifier == identifier; });
        items_.erase(identifier);
    }

    /// What listing the container answers instead of a page.
    std::map<std::string, KsError> listingErrors;
    /// Called before a page is made, with the container and the number of its first item.
    std::function<void(const std::string& container, std::size_t offset)> beforePage;
    /// A page that is no first page is answered as expired as often as this says.
    int expiries = 0;
    /// What enumerating changes of a container answers, in order; the last of it from then on. Expired where nothing is
    /// said.
    struct Changes {
        std::vector<std::string> log;  ///< "u IDENTIFIER" of an item of the tree, or "d IDENTIFIER"
        std::string anchor;
        bool moreComing = false;
        std::optional<KsError> error;
    };
    std::map<std::string, std::vector<Changes>> changes;
    std::vector<std::string> askedAnchors;  ///< of enumerations of changes
    /// Called before changes are answered.
    std::function<void()> beforeChanges;
    /// Pages are answered on a queue of the enumerator's, after the call has returned.
    bool isAsynchronous = false;
    /// Deletions count so many items, and answer before the call returns.
    std::uint64_t itemsDeletedAtOnce = 0;
    /// Observers are dropped without an end.
    bool dropsObservers = false;

    std::atomic<int> enumeratorsMade = 0;
    std::atomic<int> enumeratorsInvalidated = 0;
    std::atomic<int> enumeratorsStarted = 0;
    std::atomic<int> enumeratorsStopped = 0;
    std::vector<std::string> askedURLs;

    std::optional<KsURL> URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) override {
        const auto found = items_.find(identifier);
        return found != items_.end() ? found->second->url : std::nullopt;
    }
    std::optional<TesselItemIdentifier> persistentIdentifierForItemAtURL(const KsURL& url) override {
        askedURLs.push_back(url.path());
        for (const auto& [identifier, item] : items_) {
            if (item->url && *item->url == url) return identifier;
        }
        return std::nullopt;
    }
    Result<std::shared_ptr<const TesselItem>> itemForIdentifier(const TesselItemIdentifier& identifier) override {
        const auto found = items_.find(identifier);
        if (found == items_.end()) return KsError("CindralProvider.LocalTesselKitError", 0);
        return std::shared_ptr<const TesselItem>(found->second);
    }
    Result<std::shared_ptr<TesselEnumerator>> enumeratorForContainerItemIdentifier(
        const TesselItemIdentifier& container) override;

    std::shared_ptr<TesselProgress> deleteItemWithIdentifier(const TesselItemIdentifier& /*identifier*/,
                                                             Completion completion) override {
        auto progress = std::make_shared<TesselProgress>();
        progress->setTotal(0, itemsDeletedAtOnce);
        progress->advance(0, itemsDeletedAtOnce);
        completion(std::nullopt);
        return progress;
    }
    void providePlaceholderAtURL(const KsURL& /*url*/, Completion completion) override { completion(std::nullopt); }
    void startProvidingItemAtURL(const KsURL& /*url*/, Completion completion) override { completion(std::nullopt); }
    void stopProvidingItemAtURL(const KsURL& /*url*/) override {}
    void itemChangedAtURL(const KsURL& /*url*/) override {}
    void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                        ItemCompletion completion) override {
        const auto found = items_.find("#" + bundleIdentifier);
        if (found != items_.end()) return completion(std::shared_ptr<const TesselItem>(found->second));
        completion(tsInvalidParameterError("bundleIdentifier", bundleIdentifier));
    }

private:
    friend class FakeEnumerator;

    FakeItem& add(const std::string& identifier, const std::string& name, const std::string& parent) {
        auto item = std::make_shared<FakeItem>();
        item->identifier = identifier;
        item->name = name;
        item->parent = parent.empty() ? identifier : parent;
        if (!parent.empty()) children_[parent].push_back(item);
        return *(items_[identifier] = item);
    }

    std::map<std::string, std::shared_ptr<FakeItem>> items_;
    std::map<std::string, std::vector<std::shared_ptr<FakeItem>>> children_;
};

class FakeEnumerator final : public TesselEnumerator {
public:
    FakeEnumerator(std::shared_ptr<FakeProvider> provider, std::string container)
        : provider_(std::move(provider)), container_(std::move(container)) {
        const auto item = provider_->items_.find(container_);
        if (item != provider_->items_.end()) url_ = item->second->url;
    }

    std::optional<KsURL> enumeratedItemURL() const override { return url_; }

    void enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                   const TesselPage& page) override {
        if (provider_->dropsObservers) return;
        if (!provider_->isAsynchronous) return list(*observer, page);
        queue_.async([this, observer, page] { list(*observer, page); });
    }
    void enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                     const TesselSyncAnchor& anchor) override {
        provider_->askedAnchors.emplace_back(textOf(anchor));
        if (provider_->beforeChanges) provider_->beforeChanges();
        if (provider_->dropsObservers) return;
        auto& script = provider_->changes[container_];
        if (script.empty()) return observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
        const FakeProvider::Changes said = script.front();
        if (script.size() > 1) script.erase(script.begin());
        if (said.error) return observer->finishEnumeratingWithError(*said.error);
        for (const std::string& line : said.log) {
            const std::string identifier = line.substr(2);
            if (line.front() == 'u') {
                observer->didUpdateItems({provider_->items_.at(identifier)});
            } else {
                observer->didDeleteItemsWithIdentifiers({identifier});
            }
        }
        const ByteView bytes = bytesOf(said.anchor);
        observer->finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor(bytes.begin(), bytes.end()), said.moreComing);
    }
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<TesselSyncAnchor>)> completion) override {
        const ByteView bytes = bytesOf(container_);
        completion(container_ == "fid=noanchor" ? std::nullopt : std::optional(Bytes(bytes.begin(), bytes.end())));
    }
    void start() override { ++provider_->enumeratorsStarted; }
    void stop() override { ++provider_->enumeratorsStopped; }
    void invalidate() override { ++provider_->enumeratorsInvalidated; }

private:
    void list(TesselEnumerationObserver& observer, const TesselPage& page) {
        const bool isFirst = page == tesselInitialPageSortedByName() || page == tesselInitialPageSortedByDate() ||
                             page == tesselInitialPageForFollowers();
        const std::size_t offset = isFirst ? 0 : std::stoul(std::string(textOf(page)));
        if (provider_->beforePage) provider_->beforePage(container_, offset);
        if (const auto error = provider_->listingErrors.find(container_); error != provider_->listingErrors.end()) {
            return observer.finishEnumeratingWithError(error->second);
        }
        if (!isFirst && provider_->expiries > 0) {
            --provider_->expiries;
            return observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
        }
        const auto& children = provider_->children_[container_];
        TesselItems items;
        for (std::size_t i = offset; i < std::min(children.size(), offset + FakeProvider::kPageItems); ++i) {
            items.push_back(children[i]);
        }
        const std::string next = std::to_string(offset + FakeProvider::kPageItems);
        const bool isFull = items.size() == FakeProvider::kPageItems;
        observer.didEnumerateItems(std::move(items));
        const ByteView bytes = bytesOf(next);
        observer.finishEnumeratingUpToPage(isFull ? std::optional(Bytes(bytes.begin(), bytes.end())) : std::nullopt);
    }

    const std::shared_ptr<FakeProvider> provider_;
    const std::string container_;
    std::optional<KsURL> url_;
    SerialQueue queue_{"cindral.fake-enumerator"};
};

inline Result<std::shared_ptr<TesselEnumerator>> FakeProvider::enumeratorForContainerItemIdentifier(
    const TesselItemIdentifier& container) {
    const bool isKnown = items_.contains(container) || container == kTesselWorkingSetContainerItemIdentifier ||
                         container == "fid=noanchor";
    if (!isKnown) return tesselErrorForNonExistentItemWithIdentifier(container);
    ++enumeratorsMade;
    return std::shared_ptr<TesselEnumerator>(std::make_shared<FakeEnumerator>(shared_from_this(), container));
}

}  // namespace cindral::test
