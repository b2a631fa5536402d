#include "host/ItemWriter.h"

#include <gtest/gtest.h>

#include <limits>
#include <nlohmann/json.hpp>

#include "host/FakeProvider.h"

namespace cindral {
namespace {

using nlohmann::json;
using test::FakeItem;

const PresentedPaths kSamePaths("/home/u/Documents", "/home/u/Documents", "/home/u/Documents");
const PresentedPaths kOtherPaths("/data/My Files", "/data/My Files", "/state/Documents");

std::string text(const FakeItem& item, const PresentedPaths& paths = kSamePaths) {
    return ItemWriter(paths).text(item);
}

json parsed(const FakeItem& item, const PresentedPaths& paths = kSamePaths) {
    return json::parse(text(item, paths));
}

TEST(ItemWriter, writesNoKeyForAnAbsentValue) {
    EXPECT_EQ(text(FakeItem()),
              R"({"identifier":"did=1","parentIdentifier":"TesselRootContainerItemIdentifier","filename":"report.txt",)"
              R"("typeIdentifier":"text/plain","capabilities":1,"isTrashed":false,"isUbiquitous":false})");
}

TEST(ItemWriter, writesEveryValue) {
    FakeItem item;
    item.identifier = "did=4294967295";
    item.parent = "fid=18446744073709551615";
    item.can = TesselItemCapabilities::allowsReading | TesselItemCapabilities::allowsDeleting;
    item.trashed = true;
    item.ubiquitous = true;
    item.appLibrary = true;
    item.size = std::numeric_limits<std::uint64_t>::max();
    item.created = KsDate{0, 0};
    item.modified = KsDate{1'795'168'320, 1};
    item.children = 0;
    item.version = Bytes{std::byte{0xFF}, std::byte{0x00}};
    item.lastUsed = KsDate{-1, 500'000'000};
    item.tagList = std::vector<std::string>{"red", "a\"b"};
    item.rank = std::numeric_limits<std::int64_t>::min();
    item.file = std::numeric_limits<std::uint64_t>::max();
    item.document = 4'294'967'295;
    item.url = KsURL::fileURL("/home/u/Documents/a/report 1.txt");
    item.bundle = "com.example.notes";
    EXPECT_EQ(text(item),
              R"({"identifier":"did=4294967295","parentIdentifier":"fid=18446744073709551615",)"
              R"("filename":"report.txt","typeIdentifier":"text/plain","capabilities":33,"isTrashed":true,)"
              R"("isUbiquitous":true,"isAppLibrary":true,"documentSize":18446744073709551615,)"
              R"("creationDate":"1970-01-01T00:00:00Z",)"
              R"("contentModificationDate":"2026-11-20T09:52:00.000000001Z","childItemCount":0,)"
              R"("versionIdentifier":"/wA=","lastUsedDate":"1969-12-31T23:59:59.5Z","tags":["red","a\"b"],)"
              R"("favoriteRank":-9223372036854775808,"fileID":18446744073709551615,"docID":4294967295,)"
              R"("fileURL":"file:///home/u/Documents/a/report%201.txt","bundleIdentifier":"com.example.notes"})");
}

TEST(ItemWriter, writesAnEmptyListOfTags) {
    FakeItem item;
    item.tagList.emplace();
    EXPECT_EQ(parsed(item)["tags"], json::array());
}

TEST(ItemWriter, writesAnyNameAsText) {
    FakeItem item;
    item.name = "a\nb\xFF\xE2\x82.txt";
    item.url = KsURL::fileURL("/home/u/Documents/" + item.name);
    EXPECT_EQ(parsed(item)["filename"], "a\nb\xEF\xBF\xBD\xEF\xBF\xBD.txt");
    EXPECT_EQ(parsed(item)["fileURL"], "file:///home/u/Documents/a%0Ab%FF%E2%82.txt");
}

TEST(ItemWriter, writesURLsOfOneFolderAfterAnother) {
    ItemWriter writer(kOtherPaths);
    const auto url = [&](const std::string& path) {
        FakeItem item;
        item.url = KsURL::fileURL(path);
        return json::parse(writer.text(item))["fileURL"].get<std::string>();
    };
    EXPECT_EQ(url("/state/Documents/a/1"), "file:///data/My%20Files/a/1");
    EXPECT_EQ(url("/state/Documents/a/2"), "file:///data/My%20Files/a/2");
    EXPECT_EQ(url("/state/Documents/a/b/3"), "file:///data/My%20Files/a/b/3");
    EXPECT_EQ(url("/state/Documents/4"), "file:///data/My%20Files/4");
    EXPECT_EQ(url("/state/Documents/aa/5"), "file:///data/My%20Files/aa/5");
}

TEST(ItemWriter, writesTheRealURLOfTheStorageItself) {
    FakeItem item;
    item.url = KsURL::fileURL("/state/Documents");
    EXPECT_EQ(parsed(item, kOtherPaths)["fileURL"], "file:///data/My%20Files");
}

TEST(ItemWriter, leavesURLsOutsideOfTheStorageAlone) {
    FakeItem item;
    item.url = KsURL::fileURL("/state/Documents2/x");
    EXPECT_EQ(parsed(item, kOtherPaths)["fileURL"], "file:///state/Documents2/x");
    item.url = KsURL::fileURL("/top");
    EXPECT_EQ(parsed(item, kOtherPaths)["fileURL"], "file:///top");
}

}  // namespace
}  // namespace cindral
