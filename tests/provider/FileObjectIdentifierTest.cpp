#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/tessel/TesselManager.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/ProviderFixture.h"

namespace cindral::test {
namespace {

class FileObjectIdentifierTest : public ProviderTest {
protected:
    std::optional<TesselItemIdentifier> identifierOf(std::string_view name) {
        KsURL named = url(name);
        return itemIdentifier(named);
    }
    static std::string fid(const std::string& path) {
        struct stat status;
        EXPECT_EQ(::lstat(path.c_str(), &status), 0);
        return "fid=" + std::to_string(status.st_ino);
    }
    LogCapture log_;
};

TEST_F(FileObjectIdentifierTest, aFileIsADocument) {
    storage_.file("a.txt", "x");
    const auto identifier = identifierOf("a.txt");
    ASSERT_TRUE(identifier);
    EXPECT_TRUE(identifier->starts_with("did="));
    EXPECT_EQ(identifierOf("a.txt"), identifier);
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), url("a.txt"));
}

TEST_F(FileObjectIdentifierTest, aPlainFolderHasItsFileNumber) {
    EXPECT_EQ(identifierOf("missing"), std::nullopt);
    const std::string path = storage_.folder("folder");
    EXPECT_EQ(identifierOf("folder"), fid(path));
    EXPECT_EQ(fileURLWithItemIdentifier(fid(path)), url("folder"));
}

TEST_F(FileObjectIdentifierTest, aPackageIsADocument) {
    storage_.folder("report.folio");
    const auto identifier = identifierOf("report.folio");
    ASSERT_TRUE(identifier);
    EXPECT_TRUE(identifier->starts_with("did="));
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), url("report.folio"));
}

TEST_F(FileObjectIdentifierTest, linksAndSpecialFilesHaveTheirFileNumber) {
    storage_.folder("folder");
    ASSERT_EQ(::symlink("folder", (storage_ / "link").c_str()), 0);
    ASSERT_EQ(::symlink("nowhere", (storage_ / "dangling").c_str()), 0);
    ASSERT_EQ(::mkfifo((storage_ / "fifo").c_str(), 0600), 0);
    for (const char* name : {"link", "dangling", "fifo"}) EXPECT_EQ(identifierOf(name), fid(storage_ / name)) << name;
}

TEST_F(FileObjectIdentifierTest, theStorageIsTheRoot) {
    KsURL storage = storageURL();
    EXPECT_EQ(itemIdentifier(storage), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(fileURLWithItemIdentifier(kTesselRootContainerItemIdentifier), storageURL());
}

TEST_F(FileObjectIdentifierTest, aSiblingThatBeginsWithTheRootsPathIsInside) {
    const std::string path = storage_.outside().folder("Documents2");
    KsURL sibling = KsURL::fileURL(path);
    EXPECT_EQ(itemIdentifier(sibling), fid(path));
}

TEST_F(FileObjectIdentifierTest, whatIsOutsideHasNone) {
    KsURL outside = KsURL::fileURL(storage_.outside().file("elsewhere.txt"));
    EXPECT_EQ(itemIdentifier(outside), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "can't compute file object identifier because \"" + outside.path() +
                                                   "\" is not part of Cindral Storage"));
}

TEST_F(FileObjectIdentifierTest, aURLOfAnotherSchemeHasNone) {
    KsURL other = *KsURL::parse("https://example.org/a");
    EXPECT_EQ(itemIdentifier(other), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::error, "can't compute file object identifier if not a file URL"));
}

TEST_F(FileObjectIdentifierTest, aRootUnderPrivateVarHoldsPathsUnderVar) {
    // Both sides are compared in their proper form, whichever way they were presented.
    TesselManager::defaultManager().setDocumentStorageURL(KsURL::fileURL("/private/var/mobile/Documents"));
    KsURL storage = KsURL::fileURL("/var/mobile/Documents");
    EXPECT_EQ(itemIdentifier(storage), kTesselRootContainerItemIdentifier);
    KsURL missing = KsURL::fileURL("/var/mobile/Documents/missing");
    EXPECT_EQ(itemIdentifier(missing), std::nullopt);
    EXPECT_EQ(log_.count("is not part of Cindral Storage"), 0U);
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, "can't get resource value for KsURLDocumentIdentifierKey; "));
}

TEST_F(FileObjectIdentifierTest, aFolderWithoutACachedNumberGetsAReferenceValue) {
    const std::string path = storage_.folder("folder");
    KsURL folder = url("folder");
    folder.setCachedResourceValue(ResourceKey::fileID, std::nullopt);
    const auto identifier = itemIdentifier(folder);
    ASSERT_TRUE(identifier);
    EXPECT_TRUE(identifier->starts_with("fid="));
    EXPECT_NE(*identifier, fid(path));
    EXPECT_EQ(itemIdentifier(folder), fid(path)) << "the number itself is cached";
}

#ifndef NDEBUG
TEST_F(FileObjectIdentifierTest, aNumberOfAnotherClassStopsTheProcess) {
    storage_.folder("folder");
    storage_.file("a.txt");
    KsURL folder = url("folder");
    folder.setCachedResourceValue(ResourceKey::fileID, std::string("7"));
    EXPECT_DEATH((void)itemIdentifier(folder),
                 "unexpected class for file ID \\(expected: KsNumber, actual: KsString\\)");
    KsURL file = url("a.txt");
    file.setCachedResourceValue(ResourceKey::documentIdentifier, std::string("7"));
    EXPECT_DEATH((void)itemIdentifier(file), "unexpected class for doc ID \\(expected: KsNumber, actual: KsString\\)");
}
#endif

TEST_F(FileObjectIdentifierTest, anIdentifierHasTwoComponents) {
    EXPECT_EQ(fileURLWithItemIdentifier("did=12=3"), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::error, "invalid identifier; identifier should have 2 components, not 3"));
    EXPECT_EQ(fileURLWithItemIdentifier("#org.example.App"), std::nullopt);
    EXPECT_EQ(fileURLWithItemIdentifier(kTesselWorkingSetContainerItemIdentifier), std::nullopt);
    EXPECT_EQ(log_.count("invalid identifier; identifier should have 2 components, not 1"), 2U);
}

TEST_F(FileObjectIdentifierTest, anIdentifierNamesAKnownHost) {
    EXPECT_EQ(fileURLWithItemIdentifier("xid=5"), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::error, "invalid host for identifier \"xid=5\""));
}

TEST_F(FileObjectIdentifierTest, digitsAreReadLeniently) {
    EXPECT_EQ(fileURLWithItemIdentifier("fid=abc"), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::debug, "can't resolve path matching file ID \"0\"; ENOENT (2)"));
    const std::string path = storage_.folder("folder");
    const std::string digits = fid(path).substr(4);
    EXPECT_EQ(fileURLWithItemIdentifier("fid= +" + digits + "tail"), url("folder"));
    EXPECT_EQ(fileURLWithItemIdentifier("fid=99999999999999999999999999"), std::nullopt);
    EXPECT_EQ(fileURLWithItemIdentifier("fid=-1"), std::nullopt);
}

TEST_F(FileObjectIdentifierTest, anUnknownDocumentEndsAtOnce) {
    EXPECT_EQ(fileURLWithItemIdentifier("did=4000000000"), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::error, "can't resolve doc ID \"4000000000\"; ENOENT (2)"));
    EXPECT_EQ(log_.count("let's try again after resting"), 0U);
}

/// Answers every document with one errno, and counts.
class StubbornManager : public RvStorageManager {
public:
    explicit StubbornManager(int errorNumber) : errorNumber_(errorNumber) { replaceDefaultManager(this); }
    ~StubbornManager() override { replaceDefaultManager(nullptr); }
    std::uint64_t resolveDocumentID(std::int64_t /*documentID*/, std::uint32_t /*device*/) override {
        ++attempts;
        errno = errorNumber_;
        return 0;
    }
    int attempts = 0;

private:
    int errorNumber_;
};

TEST_F(FileObjectIdentifierTest, aBusyDocumentIsAskedForSixTimes) {
    for (const int errorNumber : {EAGAIN, EBUSY, ESTALE}) {
        StubbornManager manager(errorNumber);
        const std::size_t rests = log_.count("let's try again after resting");
        EXPECT_EQ(fileURLWithItemIdentifier("did=12"), std::nullopt);
        EXPECT_EQ(manager.attempts, 6);
        EXPECT_EQ(log_.count("let's try again after resting") - rests, 5U);
        EXPECT_TRUE(log_.contains(
            LogLevel::debug,
            "doc ID resolution failed with errno(" + std::to_string(errorNumber) + "), let's try again after resting"));
    }
    EXPECT_EQ(log_.count("can't resolve doc ID \"12\" after five attempts"), 3U);
}

TEST_F(FileObjectIdentifierTest, identifiersSurviveRenameMoveAndRestart) {
    storage_.file("a.txt", "x");
    storage_.folder("folder");
    const auto identifier = identifierOf("a.txt");
    ASSERT_TRUE(identifier);
    ASSERT_EQ(::rename((storage_ / "a.txt").c_str(), (storage_ / "folder/b.txt").c_str()), 0);
    EXPECT_EQ(identifierOf("folder/b.txt"), identifier);
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), url("folder/b.txt"));
    ASSERT_EQ(::rename((storage_ / "folder").c_str(), (storage_ / "moved").c_str()), 0);
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), url("moved/b.txt")) << "found though nobody listed it there";
    reopenStore();
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), url("moved/b.txt"));
    EXPECT_EQ(identifierOf("moved/b.txt"), identifier);
}

TEST_F(FileObjectIdentifierTest, aCopyIsAnotherDocument) {
    storage_.file("a.txt", "x");
    storage_.file("b.txt", "x");
    EXPECT_NE(identifierOf("a.txt"), identifierOf("b.txt"));
}

TEST_F(FileObjectIdentifierTest, aDeletedDocumentIsGoneThoughItsNumberIsUsedAgain) {
    storage_.file("a.txt", "x");
    const auto identifier = identifierOf("a.txt");
    ASSERT_TRUE(identifier);
    // The file system hands a number out again soon: one of these has it.
    ASSERT_EQ(::unlink((storage_ / "a.txt").c_str()), 0);
    for (int i = 0; i < 20; ++i) {
        const std::string name = "new" + std::to_string(i);
        storage_.file(name, "y");
        EXPECT_NE(identifierOf(name), identifier);
    }
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), std::nullopt);
}

TEST_F(FileObjectIdentifierTest, whatLeftTheStorageIsNotFound) {
    storage_.file("a.txt", "x");
    const std::string path = storage_.folder("folder");
    const auto identifier = identifierOf("a.txt");
    const std::string folder = fid(path);
    ASSERT_EQ(::rename((storage_ / "a.txt").c_str(), (storage_.outside() / "a.txt").c_str()), 0);
    ASSERT_EQ(::rename(path.c_str(), (storage_.outside() / "folder").c_str()), 0);
    EXPECT_EQ(fileURLWithItemIdentifier(*identifier), std::nullopt);
    EXPECT_EQ(fileURLWithItemIdentifier(folder), std::nullopt);
}

TEST_F(FileObjectIdentifierTest, aPathBeyondTheBufferIsNotResolvable) {
    std::string name;
    while (storage_.path().size() + name.size() < 1100) name += (name.empty() ? "" : "/") + std::string(100, 'd');
    const std::string path = storage_.folder(name);
    EXPECT_EQ(identifierOf(name), fid(path));
    EXPECT_EQ(fileURLWithItemIdentifier(fid(path)), std::nullopt);
    EXPECT_TRUE(log_.contains(
        LogLevel::debug, "can't resolve path matching file ID \"" + fid(path).substr(4) + "\"; ENAMETOOLONG (36)"));
}

TEST_F(FileObjectIdentifierTest, aLinkSwappedIntoThePathLeadsNowhere) {
    storage_.folder("folder/inner");
    const std::string inner = *identifierOf("folder/inner");
    ASSERT_EQ(fileURLWithItemIdentifier(inner), url("folder/inner"));
    ASSERT_EQ(::rename((storage_ / "folder").c_str(), (storage_.outside() / "folder").c_str()), 0);
    ASSERT_EQ(::symlink((storage_.outside() / "folder").c_str(), (storage_ / "folder").c_str()), 0);
    EXPECT_EQ(fileURLWithItemIdentifier(inner), std::nullopt);
}

TEST_F(FileObjectIdentifierTest, deviceOfAMissingFileIsAPosixError) {
    std::optional<KsError> error;
    EXPECT_EQ(deviceIDWithError(url("missing"), &error), 0U);
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPosix(ENOENT));
    EXPECT_NE(deviceID(storageURL()), 0U);
}

TEST_F(FileObjectIdentifierTest, aMissingBundleProxyIsToldOnTheFrameworksLog) {
    EXPECT_EQ(CdlFileObjectIdentifier::fromAppLibraryDataContainerURL(url("x")), std::nullopt);
    EXPECT_TRUE(log_.contains(LogLevel::error, "[ERROR] can't find bundle proxy at " + url("x").description()));
}

TEST(CdlFileObjectIdentifier, writesUnsignedDecimalNumbers) {
    EXPECT_EQ(CdlFileObjectIdentifier::fromFileID(18446744073709551615U), "fid=18446744073709551615");
    EXPECT_EQ(CdlFileObjectIdentifier::fromDocumentID(0), "did=0");
}

struct DocIDChange {
    bool ok;
    std::int64_t document = -7, source = -7, destination = -7;
};
DocIDChange parsed(const char* path) {
    DocIDChange change{};
    change.ok = parseDocIDChangePath(path, &change.document, &change.source, &change.destination);
    return change;
}

TEST(ParseDocIDChangePath, readsTheNumbers) {
    for (const char* path : {"/.docid/7/changed/42/src=100,dst=200", "/.docid/changed/42/src=100,dst=200",
                             "//.docid/7/changed/42/src=100,dst=200", ".docid/changed/42/src=100,dst=200"}) {
        const DocIDChange change = parsed(path);
        EXPECT_TRUE(change.ok) << path;
        EXPECT_EQ(change.document, 42);
        EXPECT_EQ(change.source, 100);
        EXPECT_EQ(change.destination, 200);
    }
}

TEST(ParseDocIDChangePath, refusesEverythingElse) {
    for (const char* path : {"", "/", "/.docid", "/.docid/changed/1/src=2,dst=3/x", "/.docid/7changed/1/src=2,dst=3",
                             "/.docid/changed/1/src=2", "/.docid/changed/1/dst=3", "/.docid/changed/1/src=,dst=3",
                             "/.docid/changed//src=2,dst=3", "/.docid/99999999999999999999/changed/1/src=2,dst=3",
                             "/.docid/changed/99999999999999999999/src=2,dst=3", "/.docid/changed/1/src=2,dst=3 ",
                             "/docid/changed/1/src=2,dst=3"}) {
        EXPECT_FALSE(parsed(path).ok) << path;
    }
}

TEST(ParseDocIDChangePath, mayLeaveEarlierNumbersWritten) {
    const DocIDChange change = parsed("/.docid/changed/1/src=2,dst=");
    EXPECT_FALSE(change.ok);
    EXPECT_EQ(change.document, 1);
    EXPECT_EQ(change.source, 2);
}

}  // namespace
}  // namespace cindral::test
