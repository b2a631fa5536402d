#include "provider/LocalItem.h"

#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "platform/foundation/KeyedArchive.h"
#include "provider/ProviderFixture.h"
#include "provider/Utilities.h"

namespace cindral::test {
namespace {

class LocalItemTest : public ProviderTest {
protected:
    std::shared_ptr<const LocalItem> item(std::string_view name) { return LocalItem::initWithURL(url(name)); }
    static void set(const std::string& path, std::string_view name, const PropertyList& value) {
        setRaw(path, name, keyed_archive::archive(value));
    }
    static void setRaw(const std::string& path, std::string_view name, const Bytes& bytes) {
        ASSERT_EQ(::setxattr(path.c_str(), ("user." + std::string(name)).c_str(), bytes.data(), bytes.size(), 0), 0);
    }
    static unsigned bits(const TesselItem& item) { return static_cast<unsigned>(item.capabilities()); }
    LogCapture log_;
};

TEST_F(LocalItemTest, describesAFile) {
    const std::string path = storage_.file("Letter.txt", "hello");
    const auto letter = item("Letter.txt");
    ASSERT_TRUE(letter);
    struct stat status;
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    EXPECT_TRUE(letter->itemIdentifier().starts_with("did="));
    EXPECT_EQ(letter->parentItemIdentifier(), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(letter->filename(), "Letter.txt");
    EXPECT_EQ(letter->typeIdentifier(), "text/plain");
    EXPECT_EQ(letter->documentSize(), 5U);
    EXPECT_EQ(letter->childItemCount(), std::nullopt);
    EXPECT_EQ(letter->fileID(), status.st_ino);
    EXPECT_EQ("did=" + std::to_string(*letter->docID()), letter->itemIdentifier());
    EXPECT_EQ(letter->contentModificationDate(), KsDate::from(status.st_mtim));
    EXPECT_TRUE(letter->creationDate());
    EXPECT_FALSE(letter->isTrashed());
    EXPECT_FALSE(letter->isUbiquitous());
    EXPECT_FALSE(letter->isAppLibrary());
    EXPECT_EQ(*letter->fileURL(), url("Letter.txt"));
    ASSERT_TRUE(letter->appContainerBundleIdentifier());
    EXPECT_EQ(*letter->appContainerBundleIdentifier(), "com.vemra.CindralStorage");
    EXPECT_FALSE(letter->lastUsedDate());
    EXPECT_FALSE(letter->tags());
    EXPECT_FALSE(letter->favoriteRank());
}

TEST_F(LocalItemTest, versionFollowsModificationAndChange) {
    const std::string path = storage_.file("a.txt", "x");
    const auto version = [&] {
        const auto read = item("a.txt");
        const auto view = *read->versionIdentifier();
        return Bytes(view.begin(), view.end());
    };
    const Bytes before = version();
    EXPECT_EQ(version(), before);
    struct stat status;
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    storage_.file("a.txt", "y");
    const timespec times[] = {status.st_atim, status.st_mtim};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    EXPECT_NE(version(), before) << "the modification date was set back, the change time can't be";
}

TEST_F(LocalItemTest, countsAFoldersEntries) {
    storage_.folder("folder/inner");
    storage_.file("folder/a.txt");
    storage_.file("folder/.hidden");
    const auto folder = item("folder");
    ASSERT_TRUE(folder);
    EXPECT_EQ(folder->childItemCount(), 3U);
    EXPECT_EQ(folder->documentSize(), std::nullopt);
    EXPECT_EQ(folder->docID(), std::nullopt);
    EXPECT_EQ(folder->typeIdentifier(), "inode/directory");
    storage_.folder("empty");
    EXPECT_EQ(item("empty")->childItemCount(), 0U);
}

TEST_F(LocalItemTest, onlyTheMeasuredPackageFamiliesHaveASize) {
    storage_.file("song.tonemill/Media/a.wav", std::string(1000, 'a'));
    storage_.file("song.tonemill/project", std::string(24, 'a'));
    storage_.file("report.folio/index", std::string(7, 'a'));
    EXPECT_EQ(item("song.tonemill")->documentSize(), 1024U);
    EXPECT_EQ(item("song.tonemill")->typeIdentifier(), "com.vemra.tonemill.project");
    EXPECT_EQ(item("report.folio")->documentSize(), 7U);
    storage_.file("plain/x", "abc");
    EXPECT_EQ(item("plain")->documentSize(), std::nullopt);
}

TEST_F(LocalItemTest, parentsAreTheFoldersThatHoldThem) {
    storage_.file("folder/a.txt");
    EXPECT_EQ(item("folder")->parentItemIdentifier(), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(item("folder/a.txt")->parentItemIdentifier(), item("folder")->itemIdentifier());
}

TEST_F(LocalItemTest, theRootHasNoParentAndCanOnlyBeRead) {
    const auto root = LocalItem::initWithURL(storageURL());
    ASSERT_TRUE(root);
    EXPECT_EQ(root->itemIdentifier(), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(root->parentItemIdentifier(), "");
    EXPECT_EQ(bits(*root), 1U);
}

TEST_F(LocalItemTest, capabilitiesFollowWritability) {
    const std::string path = storage_.file("a.txt");
    EXPECT_EQ(bits(*item("a.txt")), 63U);
    KsURL readOnly = url("a.txt");
    readOnly.setCachedResourceValue(ResourceKey::isWritable, false);
    EXPECT_EQ(bits(*LocalItem::initWithURL(readOnly)), 1U);
    KsURL unknown = url("a.txt");
    unknown.setCachedResourceValue(ResourceKey::isWritable, std::nullopt);
    EXPECT_EQ(bits(*LocalItem::initWithURL(unknown)), 1U);
}

TEST_F(LocalItemTest, readsTheUsersMetadata) {
    const std::string path = storage_.file("a.txt");
    const KsDate used{1'700'000'000, 0};
    set(path, kXattrLastUsedDateName, used);
    set(path, kXattrTagDataName, PropertyList::Array{"red", "näht"});
    set(path, kXattrFavoriteRankName, std::uint64_t{7});
    const auto read = item("a.txt");
    EXPECT_EQ(read->lastUsedDate(), used);
    EXPECT_EQ(read->tags(), (std::vector<std::string>{"red", "näht"}));
    EXPECT_EQ(read->favoriteRank(), 7);
}

TEST_F(LocalItemTest, metadataOfAnotherTypeIsAbsent) {
    const std::string path = storage_.file("a.txt");
    set(path, kXattrLastUsedDateName, "yesterday");
    set(path, kXattrTagDataName, PropertyList::Array{"red", std::uint64_t{1}});
    setRaw(path, kXattrFavoriteRankName, Bytes(5));
    const auto read = item("a.txt");
    ASSERT_TRUE(read);
    EXPECT_FALSE(read->lastUsedDate());
    EXPECT_FALSE(read->tags());
    EXPECT_FALSE(read->favoriteRank());
}

TEST_F(LocalItemTest, anItemWithoutAnIdentifierIsNone) {
    EXPECT_FALSE(item("missing"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] can't create an item without an ID"));
}

TEST_F(LocalItemTest, anItemWithoutAParentIsNone) {
    LocalItem::Customs customs;
    customs.itemID = "fid=1";
    EXPECT_FALSE(LocalItem::initWithURL(KsURL::fileURL("/nowhere/at/all"), customs));
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] can't create an item without a parent ID (itemIdentifier: fid=1)"));
}

TEST_F(LocalItemTest, anItemWithoutAFilenameIsNone) {
    storage_.file("a.txt");
    KsURL nameless = url("a.txt");
    nameless.setCachedResourceValue(ResourceKey::name, std::nullopt);
    LocalItem::Customs customs;
    customs.itemID = "did=1";
    EXPECT_FALSE(LocalItem::initWithURL(nameless, customs));
    EXPECT_TRUE(
        log_.contains(LogLevel::error,
                      "[ERROR] can't create an item without a filename (itemIdentifier: did=1, parentItemIdentifier: "
                      "TesselRootContainerItemIdentifier)"));
}

TEST_F(LocalItemTest, anItemWithoutATypeIsNone) {
    LocalItem::Customs customs;
    customs.itemID = "did=1";
    EXPECT_FALSE(LocalItem::initWithURL(url("missing"), customs));
    EXPECT_TRUE(log_.contains(
        LogLevel::error,
        "[ERROR] can't create an item without a type identifier (itemIdentifier: did=1, parentItemIdentifier: "
        "TesselRootContainerItemIdentifier, filename: missing)"));
}

TEST_F(LocalItemTest, theInboxOfAnAppLibraryIsNone) {
    storage_.folder("Inbox");
    LocalItem::Customs inLibrary;
    inLibrary.parentItemID = "#org.example.App";
    EXPECT_FALSE(LocalItem::initWithURL(url("Inbox"), inLibrary));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] can't create an item for the \"Inbox\" directory"));
    EXPECT_TRUE(item("Inbox"));
    storage_.folder("folder/Inbox");
    EXPECT_TRUE(item("folder/Inbox"));
}

TEST_F(LocalItemTest, aFileNamedInboxInAnAppLibraryIsAnItem) {
    storage_.file("Inbox");
    LocalItem::Customs inLibrary;
    inLibrary.parentItemID = "#org.example.App";
    EXPECT_TRUE(LocalItem::initWithURL(url("Inbox"), inLibrary));
}

TEST_F(LocalItemTest, itemsInATrashFolderAreTrashed) {
    storage_.file(".Trash/a.txt");
    EXPECT_TRUE(item(".Trash/a.txt")->isTrashed());
}

TEST_F(LocalItemTest, linksAreNeverFollowed) {
    storage_.file("folder/a.txt", "hello");
    ASSERT_EQ(::symlink("folder", (storage_ / "link").c_str()), 0);
    const auto link = item("link");
    ASSERT_TRUE(link);
    EXPECT_TRUE(link->itemIdentifier().starts_with("fid="));
    EXPECT_EQ(link->typeIdentifier(), "inode/symlink");
    EXPECT_EQ(link->childItemCount(), std::nullopt);
    EXPECT_EQ(link->documentSize(), 6U) << "the length of the link's own text";
}

TEST_F(LocalItemTest, theSearchIndexDomainIsTheApplication) {
    storage_.file("a.txt");
    EXPECT_EQ(item("a.txt")->vistorDomainIdentifier(), nullptr);
    LocalItem::Customs customs;
    customs.hasVistorDomainIdentifier = true;
    customs.bundleIdentifier = InternedString("org.example.App");
    const auto custom = LocalItem::initWithURL(url("a.txt"), customs);
    ASSERT_TRUE(custom->vistorDomainIdentifier());
    EXPECT_EQ(*custom->vistorDomainIdentifier(), "org.example.App");
}

TEST_F(LocalItemTest, putBackURLIsBelowTheLibrary) {
    const std::string path = storage_.file(".Trash/a.txt");
    set(path, kXattrTrashPutBackName, "folder/a.txt");
    const auto trashed = item(".Trash/a.txt");
    EXPECT_EQ(trashed->putBackURL(), url("folder/a.txt"));
    set(path, kXattrTrashPutBackName, "elsewhere");
    EXPECT_EQ(trashed->putBackURL(), url("folder/a.txt")) << "computed once";
}

TEST_F(LocalItemTest, withoutAPutBackRecordThereIsNone) {
    storage_.file(".Trash/a.txt");
    EXPECT_EQ(item(".Trash/a.txt")->putBackURL(), std::nullopt);
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] couldn't find putback xattr for " + url(".Trash/a.txt").description()));
}

TEST_F(LocalItemTest, aPutBackRecordMustNotLeadOut) {
    const std::string path = storage_.file(".Trash/a.txt");
    for (const char* hostile : {"../../etc/passwd", "/etc/passwd", "a/../../b", "", ".."}) {
        set(path, kXattrTrashPutBackName, hostile);
        EXPECT_EQ(item(".Trash/a.txt")->putBackURL(), std::nullopt) << hostile;
    }
    EXPECT_TRUE(log_.contains(LogLevel::error, "[ERROR] couldn't compute putback url"));
}

}  // namespace
}  // namespace cindral::test
