#include "provider/LocalAppLibraryItem.h"

#include <filesystem>

#include "platform/foundation/KeyedArchive.h"
#include "provider/AppLibraryFixture.h"
#include "provider/Utilities.h"

namespace cindral::test {
namespace {

class LocalAppLibraryItemTest : public AppLibraryTest {
protected:
    std::shared_ptr<const LocalAppLibraryItem> item() {
        return LocalAppLibraryItem::initWithBundleProxy(
            RoBundleProxy({"org.example.Writer", KsURL::fileURL(container("org.example.Writer")), "The Writer"}));
    }
    std::string put(std::string_view name) {
        return apps_.file("data/org.example.Writer/Documents/" + std::string(name));
    }
};

TEST_F(LocalAppLibraryItemTest, isTheDocumentsFolderUnderTheApplicationsName) {
    put("report.txt");
    const auto library = item();
    ASSERT_TRUE(library);
    EXPECT_EQ(library->itemIdentifier(), "#org.example.Writer");
    EXPECT_EQ(library->parentItemIdentifier(), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(library->filename(), "The Writer");
    EXPECT_EQ(*library->fileURL(), KsURL::fileURL(documents("org.example.Writer")));
    EXPECT_EQ(library->typeIdentifier(), "inode/directory");
    ASSERT_TRUE(library->appContainerBundleIdentifier());
    EXPECT_EQ(*library->appContainerBundleIdentifier(), "org.example.Writer");
    EXPECT_EQ(library->vistorDomainIdentifier(), nullptr);
    EXPECT_EQ(library->childItemCount(), 1U);
    EXPECT_TRUE(library->isAppLibrary());
    EXPECT_FALSE(library->isTrashed());
}

TEST_F(LocalAppLibraryItemTest, doesNotCountItsInboxAndTrash) {
    put("Inbox/x");
    put(".Trash/y");
    EXPECT_EQ(item()->childItemCount(), 0U);
    put("report.txt");
    EXPECT_EQ(item()->childItemCount(), 1U);
    std::filesystem::remove_all(documents("org.example.Writer") + "/Inbox");
    EXPECT_EQ(item()->childItemCount(), 1U);
    std::filesystem::remove_all(documents("org.example.Writer") + "/.Trash");
    EXPECT_EQ(item()->childItemCount(), 1U);
    std::filesystem::remove_all(documents("org.example.Writer") + "/report.txt");
    EXPECT_EQ(item()->childItemCount(), 0U);
}

TEST_F(LocalAppLibraryItemTest, withoutADataContainerThereIsNone) {
    EXPECT_EQ(LocalAppLibraryItem::initWithBundleProxy(RoBundleProxy({"a", std::nullopt, "A"})), nullptr);
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] can't create an app library item without a data container URL"));
    EXPECT_EQ(log_.count("[ERROR]"), 1U);
}

TEST_F(LocalAppLibraryItemTest, withoutADocumentsFolderThereIsNone) {
    EXPECT_EQ(item(), nullptr);
}

TEST_F(LocalAppLibraryItemTest, isNeverMovedRenamedTrashedOrDeleted) {
    apps_.folder("data/org.example.Writer/Documents");
    EXPECT_EQ(item()->capabilities(), TesselItemCapabilities::allowsReading | TesselItemCapabilities::allowsWriting);
}

TEST_F(LocalAppLibraryItemTest, hasNoMetadataOfThePersons) {
    apps_.folder("data/org.example.Writer/Documents");
    const Result<UniqueFd> folder = sys::open(documents("org.example.Writer").c_str(), O_RDONLY | O_DIRECTORY);
    const auto set = [&](std::string_view name, const PropertyList& value) {
        ASSERT_FALSE(setXattr(folder->get(), keyed_archive::archive(value), name));
    };
    set(kXattrLastUsedDateName, KsDate{1'700'000'000, 0});
    set(kXattrTagDataName, PropertyList::Array{"red"});
    set(kXattrFavoriteRankName, std::uint64_t{7});
    EXPECT_EQ(item()->lastUsedDate(), std::nullopt);
    EXPECT_EQ(item()->tags(), std::nullopt);
    EXPECT_EQ(item()->favoriteRank(), std::nullopt);
}

using LocalAppLibraryItemDeathTest = LocalAppLibraryItemTest;

TEST_F(LocalAppLibraryItemDeathTest, isMadeFromARecordAlone) {
    EXPECT_DEATH((void)LocalAppLibraryItem::init(), "LocalAppLibraryItem has no init\\(\\)");
    EXPECT_DEATH((void)LocalAppLibraryItem::initWithURL(KsURL::fileURL("/"), {}),
                 "LocalAppLibraryItem has no init\\(withURL:customItemID:customParentItemID:customFilename:"
                 "hasVistorDomainIdentifier:bundleIdentifier:\\)");
}

}  // namespace
}  // namespace cindral::test
