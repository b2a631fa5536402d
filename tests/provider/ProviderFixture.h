#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/revisions/VolumeStore.h"
#include "platform/tessel/TesselEnumerator.h"
#include "platform/tessel/TesselErrors.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral {

// What the test framework prints for a URL.
inline void PrintTo(const KsURL& url, std::ostream* out) {  // NOLINT(readability-identifier-naming)
    *out << url.description();
}

}  // namespace cindral

namespace cindral::test {

/// A page of a listing as an observer got it.
struct ListedPage {
    TesselItems items;
    std::optional<TesselPage> next;
    std::optional<KsError> error;

    std::vector<std::string> names() const;
};

/// A storage with a store of its own, published as the host publishes it.
class ProviderTest : public ::testing::Test {
protected:
    ProviderTest();
    ~ProviderTest() override;

    KsURL url(std::string_view name) const { return KsURL::fileURL(storage_ / name); }
    KsURL storageURL() const { return KsURL::fileURL(storage_.path()); }
    /// Closes the store and opens it again, as a new process would.
    void reopenStore();
    /// Has the lists of app libraries read from their files again, as a new process would.
    static void forgetAppLibraries();

    static ListedPage page(TesselEnumerator& enumerator, const TesselPage& page);
    static ListedPage firstPage(TesselEnumerator& enumerator) {
        return page(enumerator, tesselInitialPageSortedByName());
    }
    /// All pages; fails the test when one ends with an error.
    static TesselItems all(TesselEnumerator& enumerator);
    static std::shared_ptr<const TesselItem> find(const TesselItems& items, std::string_view name);

    /// A "Documents" folder inside of a folder of its own.
    class Storage {
    public:
        Storage() { folder_.folder("Documents"); }
        std::string path() const { return folder_ / "Documents"; }
        std::string operator/(std::string_view name) const { return path() + "/" + std::string(name); }
        std::string file(std::string_view name, std::string_view contents = "") const {
            return folder_.file("Documents/" + std::string(name), contents);
        }
        std::string folder(std::string_view name) const { return folder_.folder("Documents/" + std::string(name)); }
        const TemporaryFolder& outside() const { return folder_; }

    private:
        TemporaryFolder folder_;
    };

    Storage storage_;
    TemporaryFolder state_;
    std::shared_ptr<VolumeStore> store_;
};

}  // namespace cindral::test
