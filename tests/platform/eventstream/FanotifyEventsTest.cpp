#include "platform/eventstream/FanotifyEvents.h"

#include <gtest/gtest.h>
#include <sys/fanotify.h>

#include <set>

#include "support/Hex.h"

namespace cindral {
namespace {

using test::bytesFromHex;
using test::hexFromBytes;

// As Linux 6.18 wrote them, on ext4.
const Bytes kRename = bytesFromHex(
    "74000000 03 00 1800 0000001000000000 ffffffff e02d0000"                   // "a" renamed to "c"
    "0a 00 2000 36f246c0c2a88dee 08000000 01000000 041e00007bd17028 61000000"  // old folder and name
    "0c 00 2000 36f246c0c2a88dee 08000000 01000000 041e00007bd17028 63000000"  // new folder and name
    "01 00 1c00 36f246c0c2a88dee 08000000 01000000 0e00000076b15f1a");         // the file
const Bytes kFolderItself = bytesFromHex(
    "38000000 03 00 1800 0404004000000000 ffffffff e02d0000"
    "02 00 2000 36f246c0c2a88dee 08000000 01000000 0e0000000825b810 2e000000");
const Bytes kLinkCount = bytesFromHex(
    "34000000 03 00 1800 0400000000000000 ffffffff e02d0000"
    "01 00 1c00 36f246c0c2a88dee 08000000 01000000 0e00000076b15f1a");

std::optional<FanotifyEvent> first(ByteView bytes) {
    return takeFanotifyEvent(bytes);
}

TEST(FanotifyEvents, readBothNamesOfARename) {
    ByteView bytes = kRename;
    const auto event = takeFanotifyEvent(bytes);
    ASSERT_TRUE(event);
    EXPECT_TRUE(bytes.empty());
    EXPECT_EQ(event->mask, std::uint64_t{0x10000000});
    ASSERT_EQ(event->entryCount, 2U);
    EXPECT_EQ(event->entries[0].name, "a");
    EXPECT_EQ(event->entries[1].name, "c");
    EXPECT_EQ(hexFromBytes(event->entries[0].folder.handle), "041e00007bd17028");
    EXPECT_EQ(event->entries[0].folder.digest(), event->entries[1].folder.digest());
    ASSERT_TRUE(event->object);
    EXPECT_EQ(event->object->handleType, 1);
    EXPECT_EQ(hexFromBytes(event->object->handle), "0e00000076b15f1a");
}

TEST(FanotifyEvents, readAFolderItself) {
    const auto event = first(kFolderItself);
    ASSERT_TRUE(event);
    ASSERT_EQ(event->entryCount, 1U);
    EXPECT_TRUE(event->entries[0].isFolderItself());
    EXPECT_FALSE(event->object);
}

TEST(FanotifyEvents, readAnObjectWithoutAName) {
    const auto event = first(kLinkCount);
    ASSERT_TRUE(event);
    EXPECT_EQ(event->entryCount, 0U);
    ASSERT_TRUE(event->object);
    EXPECT_EQ(event->object->fileSystem, 0xee8da8c2c046f236);
}

TEST(FanotifyEvents, readOneAfterTheOther) {
    Bytes both = kLinkCount;
    both.insert(both.end(), kRename.begin(), kRename.end());
    ByteView rest = both;
    ASSERT_TRUE(takeFanotifyEvent(rest));
    EXPECT_EQ(rest.size(), kRename.size());
    EXPECT_EQ(takeFanotifyEvent(rest)->entryCount, 2U);
    EXPECT_TRUE(rest.empty());
}

TEST(FanotifyEvents, readAnOverflowWithoutRecords) {
    const auto event = first(bytesFromHex("18000000 03 00 1800 0040000000000000 ffffffff 00000000"));
    ASSERT_TRUE(event);
    EXPECT_EQ(event->mask, std::uint64_t{FAN_Q_OVERFLOW});
}

TEST(FanotifyEvents, leaveOutRecordsOfOtherKinds) {
    const auto event =
        first(bytesFromHex("20000000 03 00 1800 0400000000000000 ffffffff 00000000 63 00 0800 12345678"));
    ASSERT_TRUE(event);
    EXPECT_EQ(event->entryCount, 0U);
}

TEST(FanotifyEvents, areNoneWhereverTheyAreCutShort) {
    for (std::size_t size = 0; size < kRename.size(); ++size)
        EXPECT_FALSE(first(ByteView(kRename).first(size))) << size;
}

// The event's own length moved into its records, too.
TEST(FanotifyEvents, areNoneWhereverARecordIsCutShort) {
    std::size_t whole = 0;
    for (std::size_t size = 24; size < kRename.size(); ++size) {
        Bytes shorter(kRename.begin(), kRename.begin() + static_cast<std::ptrdiff_t>(size));
        shorter[0] = static_cast<std::byte>(size);
        if (first(shorter)) ++whole;
    }
    EXPECT_EQ(whole, 3U);  // Without records, and behind the first and the second.
}

TEST(FanotifyEvents, areNoneWithLengthsThatDoNotFit) {
    const auto changed = [](std::size_t at, std::uint8_t value) {
        Bytes bytes = kRename;
        bytes[at] = std::byte{value};
        return first(bytes).has_value();
    };
    EXPECT_FALSE(changed(0, 0)) << "no length";
    EXPECT_FALSE(changed(0, 0x75)) << "longer than what is there";
    EXPECT_FALSE(changed(4, 4)) << "another version";
    EXPECT_FALSE(changed(6, 0x17)) << "a shorter header";
    EXPECT_FALSE(changed(6, 0x75)) << "a header longer than the event";
    EXPECT_FALSE(changed(26, 0)) << "a record without a length";
    EXPECT_FALSE(changed(26, 0xFF)) << "a record beyond the event";
    EXPECT_FALSE(changed(36, 0xFF)) << "a handle beyond its record";
    EXPECT_FALSE(changed(39, 0xFF)) << "a handle of gigabytes";
    EXPECT_FALSE(changed(36, 0x0C)) << "no room for a name";
}

TEST(FanotifyEvents, areNoneWithANameThatDoesNotEnd) {
    Bytes bytes = kFolderItself;
    for (std::size_t at = bytes.size() - 4; at < bytes.size(); ++at) bytes[at] = std::byte{'x'};
    EXPECT_FALSE(first(bytes));
}

TEST(FanotifyEvents, areNoneWithThreeNames) {
    Bytes bytes = kRename;
    bytes.insert(bytes.end(), kRename.begin() + 24, kRename.begin() + 56);
    bytes[0] = static_cast<std::byte>(bytes.size());
    EXPECT_FALSE(first(bytes));
}

TEST(FanotifyEvents, tellObjectsApart) {
    std::set<std::uint64_t> digests;
    const auto digestOf = [&](std::uint64_t fileSystem, std::int32_t type, std::string_view handle) {
        return FanotifyEvent::Object{.fileSystem = fileSystem, .handleType = type, .handle = bytesOf(handle)}.digest();
    };
    for (const std::string_view handle : {"", "1", "12345678", "12345679", "123456781", "1234567812345678"}) {
        for (const std::int32_t type : {1, 2}) {
            for (const std::uint64_t fileSystem : {1, 2}) digests.insert(digestOf(fileSystem, type, handle));
        }
    }
    EXPECT_EQ(digests.size(), 24U);
    EXPECT_EQ(digestOf(1, 1, "12345678"), digestOf(1, 1, "12345678"));
}

}  // namespace
}  // namespace cindral
