#include "platform/revisions/VolumeLog.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <string>

#include "platform/revisions/Checksum.h"
#include "platform/revisions/HighWaterFile.h"

namespace cindral {
namespace {

const KsUUID kStore = *KsUUID::parse("00112233-4455-6677-8899-AABBCCDDEEFF");

std::string hex(ByteView bytes) {
    std::string text;
    for (const std::byte byte : bytes) text += fmt::format("{:02x}", static_cast<unsigned>(byte));
    return text;
}

Bytes batchOf(std::uint64_t sequence, const std::vector<std::string>& names) {
    BatchWriter writer;
    writer.begin();
    std::uint32_t id = 1;
    for (const std::string& name : names) {
        const bool gives = id % 2 == 1;
        writer.addObject(FileID{100 + id}, gives,
                         {.parent = FileID{2},
                          .birthTime = 3,
                          .documentID = DocumentID{id},
                          .kind = ObjectKind::file,
                          .name = name});
        ++id;
    }
    const ByteView bytes = writer.finish(kStore, sequence);
    return {bytes.begin(), bytes.end()};
}

Bytes joined(std::initializer_list<Bytes> parts) {
    Bytes all;
    for (const Bytes& part : parts) all.insert(all.end(), part.begin(), part.end());
    return all;
}

TEST(Checksum, isCastagnolis) {
    EXPECT_EQ(crc32c(bytesOf("123456789")), 0xE3069283U);
    EXPECT_EQ(crc32c({}), 0U);
    const std::string zeros(32, '\0');
    EXPECT_EQ(crc32c(bytesOf(zeros)), 0x8A9136AAU);
    EXPECT_EQ(crc32c(bytesOf("6789"), crc32c(bytesOf("12345"))), 0xE3069283U);
}

TEST(VolumeLog, decodesWhatWasWritten) {
    const Bytes log = joined({batchOf(7, {"a", "", std::string(1023, 'n')}), batchOf(8, {"b"})});
    const auto batches = volumelog::decode(log, kStore);
    ASSERT_EQ(batches.size(), 2U);
    EXPECT_EQ(batches[0].sequence, 7U);
    EXPECT_EQ(batches[1].sequence, 8U);
    const auto records = volumelog::records(batches[0]);
    ASSERT_EQ(records.size(), 3U);
    EXPECT_EQ(records[1].fileID(), FileID{102});
    EXPECT_EQ(records[0].type, LogRecordType::objectWithDocument);
    EXPECT_EQ(records[1].type, LogRecordType::object);
    const auto packed = PackedRecord::decode(records[2].value);
    ASSERT_TRUE(packed.has_value());
    EXPECT_EQ(packed->name, std::string(1023, 'n'));
    EXPECT_EQ(packed->parent, FileID{2});
    EXPECT_EQ(packed->birthTime, 3);
    EXPECT_EQ(packed->documentID, DocumentID{3});
    EXPECT_EQ(packed->kind, ObjectKind::file);
}

// The worked example of docs/volume-store.md, which older and newer versions have to read.
TEST(VolumeLog, writesTheBytesThatTheDocumentShows) {
    BatchWriter writer;
    writer.begin();
    writer.addObject(FileID{0x1234}, true,
                     {.parent = FileID{2},
                      .birthTime = 1'700'000'000'000'000'000,
                      .documentID = DocumentID{5},
                      .kind = ObjectKind::file,
                      .isListed = true,
                      .changeTime = 1'700'000'001'000'000'000,
                      .size = 1000,
                      .eventID = 9,
                      .name = "a.txt"});
    EXPECT_EQ(hex(writer.finish(kStore, 1)),
              "43564232"          // "CVB2"
              "3f000000"          // 63 bytes of records
              "0100000000000000"  // the first batch
              "b7d581f7"          // of the UUID and the rest
              "3412000000000000"  // file ID
              "02"                // an object with a document ID that it was given
              "32000000"          // 50 bytes of record
              "0200000000000000"  // parent
              "00002a36fe9c9717"  // birth time
              "05000000"          // document ID
              "11"                // a file, listed
              "00cac471fe9c9717"  // change time
              "e803000000000000"  // size
              "0900000000000000"  // event
              "612e747874");      // "a.txt"
}

TEST(VolumeLog, takesTheWholeBatchesOfEveryTruncation) {
    const Bytes first = batchOf(7, {"a"}), log = joined({first, batchOf(8, {"b", "c"})});
    for (std::size_t size = 0; size < log.size(); ++size) {
        EXPECT_EQ(volumelog::decode(ByteView(log).first(size), kStore).size(), size < first.size() ? 0U : 1U) << size;
    }
}

TEST(VolumeLog, stopsAtEveryFlippedBit) {
    const Bytes first = batchOf(7, {"a"}), log = joined({first, batchOf(8, {"b", "c"}), batchOf(9, {"d"})});
    for (std::size_t bit = 0; bit < first.size() * 8; ++bit) {
        Bytes bad = log;
        bad[bit / 8] ^= std::byte{static_cast<unsigned char>(1 << (bit % 8))};
        EXPECT_TRUE(volumelog::decode(bad, kStore).empty()) << bit;
    }
    for (std::size_t bit = first.size() * 8; bit < (log.size() - batchOf(9, {"d"}).size()) * 8; ++bit) {
        Bytes bad = log;
        bad[bit / 8] ^= std::byte{static_cast<unsigned char>(1 << (bit % 8))};
        EXPECT_EQ(volumelog::decode(bad, kStore).size(), 1U) << bit;
    }
}

TEST(VolumeLog, stopsWhereANumberIsMissing) {
    EXPECT_EQ(volumelog::decode(joined({batchOf(7, {"a"}), batchOf(9, {"b"})}), kStore).size(), 1U);
    EXPECT_EQ(volumelog::decode(joined({batchOf(7, {"a"}), batchOf(7, {"b"})}), kStore).size(), 1U);
    EXPECT_EQ(volumelog::decode(joined({batchOf(7, {"a"}), batchOf(6, {"b"})}), kStore).size(), 1U);
}

TEST(VolumeLog, isNoneOfAnotherStore) {
    EXPECT_TRUE(volumelog::decode(batchOf(7, {"a"}), KsUUID{}).empty());
    EXPECT_TRUE(volumelog::decode(Bytes(1000), kStore).empty());
}

TEST(HighWaterFile, readsTheHigherOfItsGoodSlots) {
    Bytes file(8192);
    EXPECT_EQ(decodeHighWaterFile(file), std::nullopt);
    EXPECT_EQ(decodeHighWaterFile({}), std::nullopt);
    const Bytes low = encodeHighWaterSlot({5, 900}), high = encodeHighWaterSlot({6, 800});
    std::ranges::copy(low, file.begin());
    EXPECT_EQ(decodeHighWaterFile(file), (HighWaterMarks{5, 900}));
    EXPECT_EQ(decodeHighWaterFile(low), (HighWaterMarks{5, 900}));
    std::ranges::copy(high, file.begin() + 4096);
    EXPECT_EQ(decodeHighWaterFile(file), (HighWaterMarks{6, 900}));
    file[9] ^= std::byte{1};
    EXPECT_EQ(decodeHighWaterFile(file), (HighWaterMarks{6, 800}));
    file[4096] ^= std::byte{1};
    EXPECT_EQ(decodeHighWaterFile(file), std::nullopt);
}

TEST(HighWaterFile, refusesEveryFlippedBitOfASlot) {
    const Bytes slot = encodeHighWaterSlot({0x0102030405060708, 0x1112131415161718});
    EXPECT_EQ(hex(slot),
              "63646c2d6964733108070605040302011817161514131211"
              "1bfb1d10");
    for (std::size_t bit = 0; bit < slot.size() * 8; ++bit) {
        Bytes bad = slot;
        bad[bit / 8] ^= std::byte{static_cast<unsigned char>(1 << (bit % 8))};
        EXPECT_EQ(decodeHighWaterFile(bad), std::nullopt) << bit;
    }
}

}  // namespace
}  // namespace cindral
