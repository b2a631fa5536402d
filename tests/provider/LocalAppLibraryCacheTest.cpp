#include "provider/LocalAppLibraryCache.h"

#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <limits>

#include "platform/foundation/KeyedArchive.h"
#include "provider/AppLibraryFixture.h"
#include "support/Hex.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;

class LocalAppLibraryCacheTest : public ::testing::Test {
protected:
    struct Outcome {
        std::uint64_t version = 0;
        std::vector<std::string> identifiers;
        friend bool operator==(const Outcome&, const Outcome&) = default;
    };
    Outcome load() {
        Outcome outcome;
        cache_->queue().sync([&] {
            const auto loaded = cache_->loadBundleProxies();
            outcome.version = loaded.versionToken;
            for (const auto& proxy : loaded.bundleProxies) outcome.identifiers.push_back(proxy->bundleIdentifier());
        });
        return outcome;
    }
    Result<std::uint64_t> save(const std::vector<std::string>& identifiers, std::uint64_t version, bool increment) {
        RoBundleProxies list;
        for (const auto& identifier : identifiers) {
            list.push_back(std::make_shared<const RoBundleProxy>(
                RoBundleProxy::Values{identifier, KsURL::fileURL("/data/" + identifier), "Name of " + identifier}));
        }
        Result<std::uint64_t> saved(std::uint64_t{0});
        cache_->queue().sync([&] { saved = cache_->saveBundleProxies(list, version, increment); });
        return saved;
    }
    void renew() { cache_.emplace(kMain, KsURL::fileURL(folder_ / "support")); }
    std::string path() const { return folder_ / "support/Cindral Storage/app-libraries.plist"; }
    void put(const Bytes& bytes) { folder_.file("support/Cindral Storage/app-libraries.plist", textOf(bytes)); }
    void putRoot(const PropertyList& root) { put(keyed_archive::archive(root)); }
    Bytes contents() const {
        std::ifstream stream(path(), std::ios::binary);
        const std::string text(std::istreambuf_iterator<char>(stream), {});
        const ByteView bytes = bytesOf(text);
        return {bytes.begin(), bytes.end()};
    }
    static PropertyList::Dictionary root(std::uint64_t version) {
        return {{"versionToken", version},
                {"bundleProxy", PropertyList::Array{RoBundleProxy({"a", KsURL::fileURL("/data/a"), "A"}).archived()}}};
    }
    std::vector<std::string> filesBeside() const {
        std::vector<std::string> names;
        for (const auto& entry : fs::directory_iterator(folder_ / "support/Cindral Storage"))
            names.push_back(entry.path().filename());
        return names;
    }

    LogCapture log_;
    TemporaryFolder folder_;
    std::optional<LocalAppLibraryCache> cache_{std::in_place, kMain, KsURL::fileURL(folder_ / "support")};
};

using Identifiers = std::vector<std::string>;

TEST_F(LocalAppLibraryCacheTest, theTwoDifferByNames) {
    LocalAppLibraryCache workingSet(kWorkingSet, KsURL::fileURL("/support"));
    LocalAppLibraryCache main(kMain, KsURL::fileURL("/support"));
    EXPECT_EQ(main.description(), "main cache");
    EXPECT_EQ(workingSet.description(), "working-set cache");
    EXPECT_EQ(main.cacheURL(), KsURL::fileURL("/support/Cindral Storage/app-libraries.plist"));
    EXPECT_EQ(workingSet.cacheURL(), KsURL::fileURL("/support/Cindral Storage/searchable-app-libraries.plist"));
    EXPECT_EQ(main.queue().label(), "cindral.app-library-cache.main");
    EXPECT_EQ(workingSet.queue().label(), "cindral.app-library-cache.working-set");
}

TEST_F(LocalAppLibraryCacheTest, aFirstStartFindsNothing) {
    for (const auto source : {kMain, kWorkingSet}) {
        LocalAppLibraryCache cache(source, KsURL::fileURL(folder_ / "support"));
        cache.queue().sync([&] {
            const auto loaded = cache.loadBundleProxies();
            EXPECT_EQ(loaded.versionToken, 0U);
            EXPECT_TRUE(loaded.bundleProxies.empty());
        });
    }
    EXPECT_EQ(log_.count("[DEBUG] nothing cached on disk"), 2U);
    EXPECT_EQ(log_.lines().size(), 2U);
    EXPECT_FALSE(fs::exists(folder_ / "support")) << "loading makes nothing";
}

TEST_F(LocalAppLibraryCacheTest, loadsWhatItSaved) {
    ASSERT_TRUE(save({"b", "a"}, 3, false).ok());
    renew();
    EXPECT_EQ(load(), (Outcome{3, {"b", "a"}}));
    EXPECT_EQ(cache_->versionToken(), 3U);
    const std::string size = std::to_string(contents().size());
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] wrote on disk " + size + " bytes at " + path()));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] read from disk " + size + " bytes at " + path()));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] loaded 2 app library items from data"));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] version token was set to 3 after load"));
}

TEST_F(LocalAppLibraryCacheTest, theFileIsAKeyedArchiveOfTwoEntries) {
    ASSERT_TRUE(save({"a"}, 7, false).ok());
    const auto root = keyed_archive::unarchiveRoot(contents());
    ASSERT_TRUE(root && root->dictionary());
    EXPECT_EQ(root->dictionary()->size(), 2U);
    EXPECT_EQ(*root->find("versionToken"), PropertyList(std::uint64_t{7}));
    const PropertyList::Dictionary record{{"class", "RoBundleProxy"},
                                          {"bundleIdentifier", "a"},
                                          {"dataContainerURL", "file:///data/a"},
                                          {"localizedName", "Name of a"}};
    EXPECT_EQ(*root->find("bundleProxy"), PropertyList(PropertyList::Array{record}));
}

// Bytes that this version wrote: every later one reads them.
TEST_F(LocalAppLibraryCacheTest, readsAGoldenFile) {
    const Bytes golden = bytesFromHex(
        "62706c6973743030d301020304050658617263686976657254726f6f745776657273696f6e5f100f4b734b6579656441"
        "72636869766572d20708090a10015b62756e646c6550726f78795c76657273696f6e546f6b656ea20b0c1007d40d0e0f"
        "1011121314d415161718191a1b1c5f101062756e646c654964656e74696669657255636c6173735f101064617461436f"
        "6e7461696e657255524c5d6c6f63616c697a65644e616d655f10126f72672e6578616d706c652e5772697465725d526f"
        "42756e646c6550726f78795f101f66696c653a2f2f2f646174612f6f72672e6578616d706c652e5772697465725f101a"
        "4e616d65206f66206f72672e6578616d706c652e5772697465725f101062756e646c654964656e74696669657255636c"
        "6173735f101064617461436f6e7461696e657255524c5d6c6f63616c697a65644e616d6551625d526f42756e646c6550"
        "726f78795e66696c653a2f2f2f646174612f62594e616d65206f6620620008000f0018001d00250037003c003e004a00"
        "57005a005c0065006e00810087009a00a800bd00cb00ed010a011d012301360144014601540163000000000000020100"
        "0000000000001d0000000000000000000000000000016d");
    put(golden);
    EXPECT_EQ(load(), (Outcome{7, {"org.example.Writer", "b"}}));
    ASSERT_TRUE(save({"org.example.Writer", "b"}, 7, false).ok());
    EXPECT_EQ(contents(), golden);
}

TEST_F(LocalAppLibraryCacheTest, bytesThatAreNoArchiveAreNothingSilently) {
    Bytes whole = keyed_archive::archive(root(3));
    const auto isNothing = [&](const Bytes& bytes) {
        put(bytes);
        return load() == Outcome{};
    };
    EXPECT_TRUE(isNothing({}));
    EXPECT_TRUE(isNothing(PropertyList(root(3)).encodeBinary()));
    for (std::size_t size = 0; size < whole.size(); ++size)
        EXPECT_TRUE(isNothing(Bytes(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(size)))) << size;
    EXPECT_EQ(log_.count("read from disk"), whole.size() + 2);
    EXPECT_EQ(log_.lines().size(), log_.count("read from disk")) << "and not another line";
}

TEST_F(LocalAppLibraryCacheTest, objectsOfOtherClassesAreNothingSilently) {
    PropertyList::Dictionary changed = root(3);
    changed.insert_or_assign("bundleProxy", PropertyList::Array{PropertyList::Dictionary{{"class", "Painting"}}});
    putRoot(changed);
    EXPECT_EQ(load(), Outcome{});
    changed = root(3);
    changed.emplace("more", PropertyList::Dictionary{{"class", "Painting"}});
    putRoot(changed);
    EXPECT_EQ(load(), Outcome{});
    putRoot(PropertyList::Dictionary{{"class", "Painting"}});
    EXPECT_EQ(load(), Outcome{});
    EXPECT_EQ(log_.lines().size(), log_.count("read from disk"));
}

TEST_F(LocalAppLibraryCacheTest, aVersionOfAnotherTypeIsCorrupted) {
    ASSERT_TRUE(save({"a"}, 5, false).ok());
    const PropertyList wrong[] = {"5", true, 5.0, PropertyList(std::int64_t{-5}), PropertyList::Array{}, KsDate{}};
    for (const PropertyList& value : wrong) {
        PropertyList::Dictionary changed = root(6);
        changed.insert_or_assign("versionToken", value);
        putRoot(changed);
        EXPECT_EQ(load(), Outcome{});
        EXPECT_EQ(cache_->versionToken(), 5U);
    }
    putRoot(PropertyList::Dictionary{{"bundleProxy", PropertyList::Array{}}});
    EXPECT_EQ(load(), Outcome{});
    EXPECT_EQ(log_.count("[DEBUG] version token invalid; data on disk is corrupted let's reset"), std::size(wrong) + 1);
}

TEST_F(LocalAppLibraryCacheTest, aListOfAnotherTypeIsCorrupted) {
    PropertyList::Dictionary record = *RoBundleProxy({"a", std::nullopt, "A"}).archived().dictionary();
    record.erase("localizedName");
    const PropertyList wrong[] = {"a", PropertyList::Array{"a"}, PropertyList::Array{record},
                                  PropertyList::Array{PropertyList::Dictionary{}}, PropertyList::Dictionary{}};
    for (const PropertyList& value : wrong) {
        PropertyList::Dictionary changed = root(6);
        changed.insert_or_assign("bundleProxy", value);
        putRoot(changed);
        EXPECT_EQ(load(), Outcome{});
        EXPECT_EQ(cache_->versionToken(), 0U);
    }
    putRoot(PropertyList::Dictionary{{"versionToken", std::uint64_t{6}}});
    EXPECT_EQ(load(), Outcome{});
    EXPECT_EQ(log_.count("[DEBUG] bundle proxies invalid; data on disk is corrupted let's reset"),
              std::size(wrong) + 1);
}

using LocalAppLibraryCacheDeathTest = LocalAppLibraryCacheTest;

TEST_F(LocalAppLibraryCacheDeathTest, anArchiveOfSomethingElseStopsTheProcess) {
    const auto stops = [&] {
        EXPECT_DEATH((void)load(),
                     "the main cache at .*/Cindral Storage/app-libraries\\.plist is an archive of something "
                     "else; remove that file, and it is made anew");
    };
    const PropertyList wrong[] = {"text",
                                  true,
                                  std::uint64_t{1},
                                  KsDate{},
                                  Bytes{},
                                  PropertyList::Array{root(3)},
                                  RoBundleProxy({"a", std::nullopt, "A"}).archived()};
    for (const PropertyList& value : wrong) {
        putRoot(value);
        stops();
    }
    put(PropertyList(PropertyList::Dictionary{{"archiver", "KsKeyedArchiver"}, {"version", std::uint64_t{1}}})
            .encodeBinary());
    stops();
}

TEST_F(LocalAppLibraryCacheDeathTest, loadsAndSavesOnItsQueueAlone) {
    EXPECT_DEATH((void)cache_->loadBundleProxies(), "cindral.app-library-cache.main");
    EXPECT_DEATH((void)cache_->saveBundleProxies({}, 0, false).ok(), "cindral.app-library-cache.main");
}

TEST_F(LocalAppLibraryCacheDeathTest, versionsDoNotBeginAnew) {
    ASSERT_TRUE(save({}, std::numeric_limits<std::uint64_t>::max(), false).ok());
    EXPECT_DEATH((void)save({}, 0, true).ok(), "app library versions are used up");
}

TEST_F(LocalAppLibraryCacheTest, aFileThatCannotBeReadIsAnErrorLine) {
    folder_.folder("support/Cindral Storage/app-libraries.plist");
    EXPECT_EQ(load(), Outcome{});
    EXPECT_EQ(log_.count("[ERROR] can't load cache from disk let's reset; "), 1U);
    fs::remove(path());
    ASSERT_EQ(::mkfifo(path().c_str(), 0600), 0);
    EXPECT_EQ(load(), Outcome{});
    fs::remove(path());
    ASSERT_EQ(::truncate(folder_.file("support/Cindral Storage/app-libraries.plist").c_str(),
                         LocalAppLibraryCache::kBytesMax + 1),
              0);
    EXPECT_EQ(load(), Outcome{});
    EXPECT_EQ(log_.count("[ERROR] can't load cache from disk let's reset; "), 3U);
    EXPECT_EQ(log_.lines().size(), 3U);
}

TEST_F(LocalAppLibraryCacheTest, aLoadNeverLowersTheVersion) {
    ASSERT_TRUE(save({"a"}, 9, false).ok());
    putRoot(root(4));
    EXPECT_EQ(load(), (Outcome{4, {"a"}}));
    EXPECT_EQ(cache_->versionToken(), 9U);
    EXPECT_EQ(log_.count("version token was set to"), 0U);
}

TEST_F(LocalAppLibraryCacheTest, anIncrementIsOneMoreWhateverIsAskedFor) {
    putRoot(root(7));
    EXPECT_EQ(load().version, 7U);
    EXPECT_EQ(*save({"a"}, 100, true), 8U);
    EXPECT_EQ(cache_->versionToken(), 8U);
    renew();
    EXPECT_EQ(load().version, 8U);
    EXPECT_EQ(*save({"a"}, 0, true), 9U);
}

TEST_F(LocalAppLibraryCacheTest, withoutAnIncrementTheVersionIsTheOneGiven) {
    ASSERT_EQ(*save({"a"}, 9, false), 9U);
    EXPECT_EQ(*save({"a"}, 4, false), 4U);
    EXPECT_EQ(cache_->versionToken(), 4U);
    renew();
    EXPECT_EQ(load().version, 4U);
}

TEST_F(LocalAppLibraryCacheTest, aSaveMakesItsFolder) {
    EXPECT_FALSE(fs::exists(folder_ / "support"));
    EXPECT_EQ(*save({}, 0, true), 1U);
    EXPECT_EQ(filesBeside(), Identifiers{"app-libraries.plist"});
    struct stat status;
    ASSERT_EQ(::stat(path().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600U);
    ASSERT_EQ(::stat((folder_ / "support/Cindral Storage").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0700U);
}

TEST_F(LocalAppLibraryCacheTest, aSaveReplacesWhatIsDamaged) {
    put(Bytes(100));
    EXPECT_EQ(load(), Outcome{});
    EXPECT_EQ(contents(), Bytes(100)) << "a reset deletes nothing";
    EXPECT_EQ(*save({"a"}, 0, true), 1U);
    renew();
    EXPECT_EQ(load(), (Outcome{1, {"a"}}));
}

TEST_F(LocalAppLibraryCacheTest, aSaveThatFailsChangesNothing) {
    ASSERT_TRUE(save({"a"}, 3, false).ok());
    const Bytes before = contents();
    const auto failsWith = [&](int expected) {
        const auto saved = save({"b"}, 5, true);
        ASSERT_FALSE(saved.ok());
        EXPECT_TRUE(saved.error().isPosix(expected)) << saved.error().description();
        EXPECT_EQ(cache_->versionToken(), 3U);
    };
    // No folder can be made where there is a file.
    fs::rename(folder_ / "support", folder_ / "kept");
    folder_.file("support");
    failsWith(ENOTDIR);
    fs::remove(folder_ / "support");
    fs::rename(folder_ / "kept", folder_ / "support");

    // A write that ends halfway, as on a full disk.
    const auto handler = std::signal(SIGXFSZ, SIG_IGN);
    rlimit limit;
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &limit), 0);
    const rlimit small{100, limit.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    failsWith(EFBIG);
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &limit), 0);
    std::signal(SIGXFSZ, handler);
    EXPECT_EQ(contents(), before);
    EXPECT_EQ(filesBeside(), Identifiers{"app-libraries.plist"}) << "nothing is left beside it";

    // A folder that may not be written to; root may, and is somebody else for as long.
    fs::permissions(folder_.path(), fs::perms(0755));
    fs::permissions(folder_ / "support", fs::perms(0555));
    fs::permissions(folder_ / "support/Cindral Storage", fs::perms(0555));
    const bool isRoot = ::geteuid() == 0;
    ASSERT_EQ(::seteuid(isRoot ? 65534 : ::geteuid()), 0);
    failsWith(EACCES);
    ASSERT_EQ(::seteuid(isRoot ? 0 : ::geteuid()), 0);
    fs::permissions(folder_ / "support", fs::perms(0700));
    fs::permissions(folder_ / "support/Cindral Storage", fs::perms(0700));
    EXPECT_EQ(contents(), before);
    EXPECT_EQ(*save({"b"}, 0, true), 4U) << "and afterwards it goes on";
}

}  // namespace
}  // namespace cindral::test
