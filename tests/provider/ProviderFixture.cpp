#include "provider/ProviderFixture.h"

#include "platform/foundation/Dispatch.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselManager.h"
#include "provider/LocalAppLibraryManager.h"
#include "provider/fs/FSListingPositions.h"

namespace cindral::test {

namespace {

class PageObserver : public TesselEnumerationObserver {
public:
    void didEnumerateItems(TesselItems items) override {
        for (auto& item : items) page.items.push_back(std::move(item));
    }
    void finishEnumeratingUpToPage(std::optional<TesselPage> next) override {
        page.next = std::move(next);
        finish();
    }
    void finishEnumeratingWithError(const KsError& error) override {
        page.error = error;
        finish();
    }

    ListedPage page;
    int finishes = 0;
    DispatchSemaphore finished{0};

private:
    void finish() {
        ++finishes;
        finished.signal();
    }
};

}  // namespace

std::vector<std::string> ListedPage::names() const {
    std::vector<std::string> names;
    for (const auto& item : items) names.push_back(item->filename());
    return names;
}

ProviderTest::ProviderTest() {
    FSListingPositions::shared().removeAll();
    if (!RootDirectories::shared().add(storage_.path(), RootPolicy::storage).ok()) std::abort();
    TesselManager::defaultManager().setDocumentStorageURL(storageURL());
    TesselManager::defaultManager().setApplicationSupportURL(KsURL::fileURL(state_ / "Application Support"));
    forgetAppLibraries();
    RoApplicationWorkspace::defaultWorkspace().setOwnRecord(std::make_shared<RoBundleProxy>(
        RoBundleProxy::Values{"com.vemra.CindralStorage", KsURL::fileURL(storage_.outside().path()), "Documents"}));
    reopenStore();
}

ProviderTest::~ProviderTest() {
    forgetAppLibraries();
    RvStorageManager::defaultManager().setStore(nullptr);
    RootDirectories::shared().remove(storage_.path());
}

void ProviderTest::forgetAppLibraries() {
    LocalAppLibraryCache::forgetShared();
    LocalAppLibraryManager::forgetShared();
}

void ProviderTest::reopenStore() {
    RvStorageManager::defaultManager().setStore(nullptr);
    store_.reset();
    auto opened = VolumeStore::open(state_ / "volume");
    if (!opened.ok()) std::abort();
    store_ = std::move(*opened);
    RvStorageManager::defaultManager().setStore(store_);
}

ListedPage ProviderTest::page(TesselEnumerator& enumerator, const TesselPage& page) {
    auto observer = std::make_shared<PageObserver>();
    enumerator.enumerateItemsForObserver(observer, page);
    observer->finished.wait();
    EXPECT_EQ(observer->finishes, 1);
    return observer->page;
}

TesselItems ProviderTest::all(TesselEnumerator& enumerator) {
    TesselItems items;
    std::optional<TesselPage> next = tesselInitialPageSortedByName();
    while (next) {
        ListedPage listed = page(enumerator, *next);
        EXPECT_FALSE(listed.error) << listed.error->description();
        items.insert(items.end(), listed.items.begin(), listed.items.end());
        next = listed.next;
    }
    return items;
}

std::shared_ptr<const TesselItem> ProviderTest::find(const TesselItems& items, std::string_view name) {
    for (const auto& item : items) {
        if (item->filename() == name) return item;
    }
    return nullptr;
}

}  // namespace cindral::test
