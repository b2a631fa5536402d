#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <functional>
#include <limits>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/SysFaults.h"
#include "provider/EditsFixture.h"
#include "provider/Utilities.h"

namespace cindral::test {
namespace {

class LocalTesselKitMetadata : public EditsTest {
protected:
    LocalTesselKitMetadata() {
        storage_.file("a");
        storage_.folder("folder");
        storage_.folder("Song.tonemill");
    }
};

constexpr KsDate kDate{1'000'000'000, 500'000'000};

TEST_F(LocalTesselKitMetadata, theLastUsedDateIsKeptAndTakenAway) {
    for (const std::string name : {"a", "folder", "Song.tonemill"}) {
        const TesselItemIdentifier item = identifier(name);
        const LogCapture log;
        const auto dated = setLastUsedDate(item, kDate);
        ASSERT_EQ(errorOf(dated), "");
        EXPECT_EQ((*dated)->lastUsedDate(), kDate);
        EXPECT_EQ(keyed_archive::unarchiveDate(*attribute(name, kXattrLastUsedDateName)), kDate);
        const auto cleared = setLastUsedDate(item, std::nullopt);
        ASSERT_EQ(errorOf(cleared), "");
        EXPECT_EQ((*cleared)->lastUsedDate(), std::nullopt);
        EXPECT_EQ(attribute(name, kXattrLastUsedDateName), std::nullopt);
        EXPECT_EQ(errorOf(setLastUsedDate(item, std::nullopt)), "");
        EXPECT_TRUE(log.containsPart(LogLevel::debug,
                                     "set last used date \"2001-09-09T01:46:40.5Z\" to item \"" + item + "\""));
        EXPECT_TRUE(log.containsPart(LogLevel::debug, "clearing last used date for item \"" + item + "\""));
    }
}

TEST_F(LocalTesselKitMetadata, tagsAreKeptAsAnArrayOfStrings) {
    const std::vector<std::string> tags{"green", "to do", "\xf0\x9f\x8c\xb2"};
    const TesselItemIdentifier item = identifier("a");
    const LogCapture log;
    const auto tagged = setTags(item, tags);
    ASSERT_EQ(errorOf(tagged), "");
    EXPECT_EQ((*tagged)->tags(), tags);
    EXPECT_EQ(keyed_archive::unarchiveStrings(*attribute("a", kXattrTagDataName)), tags);
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "set tag data to item \"" + item + "\""));
    const auto cleared = setTags(item, {});
    ASSERT_EQ(errorOf(cleared), "");
    EXPECT_EQ((*cleared)->tags(), std::nullopt);
    EXPECT_EQ(attribute("a", kXattrTagDataName), std::nullopt);
}

TEST_F(LocalTesselKitMetadata, noTagDataIsNoTagsAndOtherBytesAreAnError) {
    ASSERT_EQ(errorOf(setTags(identifier("a"), {"green"})), "");
    const auto set = [&](const std::optional<Bytes>& data) {
        std::optional<Result<std::shared_ptr<const TesselItem>>> answer;
        provider_->setTagData(data, identifier("a"), [&](auto result) { answer = std::move(result); });
        return errorOf(*answer);
    };
    EXPECT_EQ(set(Bytes{std::byte{1}}), kInvalidParameter);
    EXPECT_NE(attribute("a", kXattrTagDataName), std::nullopt);
    EXPECT_EQ(set(std::nullopt), "");
    EXPECT_EQ(attribute("a", kXattrTagDataName), std::nullopt);
}

TEST_F(LocalTesselKitMetadata, theFavoriteRankIsKeptAndTakenAway) {
    const TesselItemIdentifier item = identifier("folder");
    for (const std::int64_t rank :
         {std::int64_t{0}, std::int64_t{7}, std::int64_t{-1}, std::numeric_limits<std::int64_t>::max(),
          std::numeric_limits<std::int64_t>::min()}) {
        const LogCapture log;
        const auto ranked = setFavoriteRank(item, rank);
        ASSERT_EQ(errorOf(ranked), "");
        EXPECT_EQ((*ranked)->favoriteRank(), rank);
        EXPECT_TRUE(log.containsPart(LogLevel::debug, "set favorite rank \"" + std::to_string(rank) + "\" " + item));
    }
    const auto cleared = setFavoriteRank(item, std::nullopt);
    ASSERT_EQ(errorOf(cleared), "");
    EXPECT_EQ((*cleared)->favoriteRank(), std::nullopt);
    EXPECT_EQ(attribute("folder", kXattrFavoriteRankName), std::nullopt);
}

TEST_F(LocalTesselKitMetadata, anUnknownItemIsSaidToBeSoInTwoWays) {
    const LogCapture log;
    EXPECT_EQ(errorOf(setLastUsedDate(kUnknownIdentifier, kDate)), kNoSuchItem);
    EXPECT_EQ(errorOf(setFavoriteRank(kUnknownIdentifier, 1)), kNoSuchItem);
    EXPECT_EQ(errorOf(setTags(kUnknownIdentifier, {"green"})), kItemNotFound);
    EXPECT_TRUE(log.contains(LogLevel::error, std::string("[ERROR] can't find URL for item; ") + kUnknownIdentifier));
}

TEST_F(LocalTesselKitMetadata, anAppLibrarysDateIsNeverWritten) {
    // No such application: what is looked up fails, and nothing is written anywhere.
    EXPECT_EQ(errorOf(setLastUsedDate("#com.example.None", kDate)), kInvalidItemIdentifier);
}

TEST_F(LocalTesselKitMetadata, whatTheFileSystemRefusesIsTheAnswer) {
    const TesselItemIdentifier item = identifier("a");
    ASSERT_EQ(errorOf(setTags(item, {"green"})), "");
    const auto before = attribute("a", kXattrTagDataName);
    for (const int reason : {ENOSPC, EACCES, EIO, EROFS, EDQUOT, EOPNOTSUPP}) {
        const std::string expected = "KsPOSIXErrorDomain " + std::to_string(reason);
        const LogCapture log;
        const sys::FaultInjection faults([&](const char* call) {
            const std::string_view name(call);
            return name == "fsetxattr" || name == "setxattr" || name == "fremovexattr" ? reason : 0;
        });
        EXPECT_EQ(errorOf(setTags(item, {"blue"})), expected);
        EXPECT_EQ(errorOf(setTags(item, {})), expected);
        EXPECT_EQ(errorOf(setFavoriteRank(item, 1)), expected);
        EXPECT_EQ(errorOf(setLastUsedDate(item, kDate)), expected);
        const std::string why = "; " + KsError::posix(reason).description();
        EXPECT_TRUE(log.contains(LogLevel::error, "[ERROR] can't set xattr com.vemra.metadata:_kMDItemUserTags" + why));
        EXPECT_TRUE(log.contains(LogLevel::error, "[ERROR] can't set xattr com.vemra.favorite-rank.number#PS" + why));
        EXPECT_TRUE(log.contains(LogLevel::error, "[ERROR] can't set xattr com.vemra.lastuseddate#PS"));
        EXPECT_EQ(attribute("a", kXattrTagDataName), before);
    }
}

// From any call on, the item is gone.
TEST_F(LocalTesselKitMetadata, whatVanishesBeforeItsWriteIsAnUnknownItem) {
    const TesselItemIdentifier item = identifier("a");
    const std::vector<std::pair<std::string, std::function<ItemResult()>>> writes{
        {kNoSuchItem, [&] { return setFavoriteRank(item, 1); }},
        {kNoSuchItem, [&] { return setLastUsedDate(item, kDate); }},
        {kItemNotFound, [&] { return setTags(item, {"green"}); }},
    };
    for (const auto& [unknown, write] : writes) {
        bool isReached = true;
        bool isSaid = false;
        for (int n = 1; isReached; ++n) {
            isReached = false;
            const sys::FaultInjection faults([&, calls = 0](const char* /*call*/) mutable {
                isReached |= ++calls >= n;
                return calls >= n ? ENOENT : 0;
            });
            const std::string error = errorOf(write());
            EXPECT_NE(error, kNoSuchFile) << n;
            isSaid = isSaid || error == unknown;
        }
        EXPECT_TRUE(isSaid);
    }
}

// More than one block of attributes: the file system says so, and the tags that were there stay.
TEST_F(LocalTesselKitMetadata, aFullAttributeSpaceChangesNothing) {
    const TesselItemIdentifier item = identifier("a");
    ASSERT_EQ(errorOf(setTags(item, {"green"})), "");
    const auto before = attribute("a", kXattrTagDataName);
    const auto tagged = setTags(item, {std::string(100'000, 'x')});
    ASSERT_FALSE(tagged.ok());
    const std::int64_t code = tagged.error().code();
    EXPECT_TRUE(code == E2BIG || code == ENOSPC) << code;
    EXPECT_EQ(attribute("a", kXattrTagDataName), before);
}

TEST_F(LocalTesselKitMetadata, aDocumentsContentsAreNotTouched) {
    struct stat before {};
    ASSERT_EQ(::stat((storage_ / "a").c_str(), &before), 0);
    ASSERT_EQ(errorOf(setTags(identifier("a"), {"green"})), "");
    struct stat after {};
    ASSERT_EQ(::stat((storage_ / "a").c_str(), &after), 0);
    EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
    EXPECT_EQ(after.st_atim.tv_nsec, before.st_atim.tv_nsec);
}

TEST_F(LocalTesselKitMetadata, whatCannotBeOpenedIsNotOpened) {
    // With a FIFO that was opened, this would wait for ever.
    ASSERT_EQ(::mkfifo((storage_ / "fifo").c_str(), 0600), 0);
    EXPECT_EQ(errorOf(setTags(identifier("fifo"), {"green"})), "KsPOSIXErrorDomain 1");
}

}  // namespace
}  // namespace cindral::test
