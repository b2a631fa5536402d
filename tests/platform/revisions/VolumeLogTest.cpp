#include "platform/revisions/VolumeLog.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <string>

#include "platform/revisions/Checksum.h"
#include "platform/revisions/HighWaterFile.h"
#include "platform/revisions/JournalRecord.h"
#include "platform/revisions/NameHash.h"

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

// Every type of record as it was first written, which newer versions have to read.
TEST(VolumeLog, writesAndReadsEveryTypeAsEver) {
    BatchWriter writer;
    writer.begin();
    PackedRecord record{.parent = FileID{2},
                        .birthTime = 1'700'000'000'000'000'000,
                        .kind = ObjectKind::file,
                        .isListed = true,
                        .isClosed = true,
                        .hasOtherNames = true,
                        .changeTime = 1'700'000'001'000'000'000,
                        .size = 1000,
                        .eventID = 4,
                        .name = "n"};
    writer.addObject(FileID{10}, false, record);
    record.documentID = DocumentID{5};
    record.eventID = 9;
    record.isClosed = record.hasOtherNames = false;
    writer.addObject(FileID{11}, true, record);
    writer.addObjectGone(FileID{12});
    writer.addDocument(LogRecordType::documentGiven, DocumentID{6}, {FileID{13}, -7});
    writer.addDocument(LogRecordType::documentHandedOver, DocumentID{5}, {FileID{14}, 8});
    const NameKey key{.fileID = FileID{10}, .parent = FileID{3}, .hash = 0x11223344, .index = 1};
    writer.addOtherName(key, "link");
    writer.addOtherNameGone(key);
    const Departure departure{.fileID = FileID{10},
                              .documentID = DocumentID{5},
                              .parent = FileID{3},
                              .objectKind = ObjectKind::file,
                              .root = FileID{2},
                              .name = "a.txt",
                              .path = "letters/a.txt"};
    writer.add(LogRecordType::departure, 21, departure.encode());
    const DocumentChange change{.documentID = DocumentID{5}, .source = FileID{11}, .target = FileID{14}};
    writer.add(LogRecordType::documentChange, 22, change.encode());
    writer.add(LogRecordType::attributes, 5, bytesOf("attributes"));
    writer.addTimeMark(21, 1'700'000'002'000'000'000);
    writer.add(LogRecordType::historyBegin, 20, ByteView());
    const ByteView batch = writer.finish(kStore, 1);
    ASSERT_EQ(hex(batch),
              "43564232900100000100000000000000a8a75aed0a00000000000000012e000000020000000000000000002a36fe9c971700"
              "0000007100cac471fe9c9717e80300000000000004000000000000006e0b00000000000000022e0000000200000000000000"
              "00002a36fe9c9717050000001100cac471fe9c9717e80300000000000009000000000000006e0c0000000000000003000000"
              "00060000000000000004100000000d00000000000000f9ffffffffffffff050000000000000005100000000e000000000000"
              "0008000000000000000a00000000000000061200000003000000000000004433221101006c696e6b0a00000000000000070e"
              "000000030000000000000044332211010015000000000000000832000000020a000000000000000500000003000000000000"
              "000102000000000000000500612e7478746c6574746572732f612e74787416000000000000000914000000050000000b0000"
              "00000000000e0000000000000005000000000000000a0a0000006174747269627574657315000000000000000b0800000000"
              "945fadfe9c971714000000000000000c00000000");

    const auto batches = volumelog::decode(batch, kStore);
    ASSERT_EQ(batches.size(), 1U);
    const auto records = volumelog::records(batches[0]);
    ASSERT_EQ(records.size(), 12U);
    EXPECT_EQ(PackedRecord::decode(records[1].value), record);
    EXPECT_EQ(records[2].fileID(), FileID{12});
    EXPECT_EQ(decodeDocument(records[3].value)->birthTime, -7);
    EXPECT_EQ(records[4].documentID(), DocumentID{5});
    EXPECT_EQ(records[5].nameKey(), key);
    EXPECT_EQ(records[5].otherName(), "link");
    EXPECT_EQ(records[6].nameKey(), key);
    EXPECT_EQ(Departure::decode(records[7].value), departure);
    EXPECT_EQ(DocumentChange::decode(records[8].value), change);
    EXPECT_EQ(textOf(records[9].value), "attributes");
    EXPECT_EQ(records[10].time(), 1'700'000'002'000'000'000);
    EXPECT_EQ(records[11].type, LogRecordType::historyBegin);
    EXPECT_EQ(records[11].key, 20U);
}

TEST(VolumeLog, holdsNothingThatNoStoreWrites) {
    const auto isRead = [](LogRecordType type, std::uint64_t key, std::size_t bytes) {
        BatchWriter writer;
        writer.begin();
        writer.add(type, key, Bytes(bytes));
        return !volumelog::decode(writer.finish(kStore, 1), kStore).empty();
    };
    EXPECT_TRUE(isRead(LogRecordType::objectGone, 5, 0));
    EXPECT_FALSE(isRead(LogRecordType::objectGone, 5, 1));
    EXPECT_FALSE(isRead(LogRecordType::object, 5, PackedRecord::kHeadBytes - 1));
    EXPECT_FALSE(isRead(LogRecordType::objectWithDocument, 5, PackedRecord::kHeadBytes));  // Document 0.
    EXPECT_TRUE(isRead(LogRecordType::documentGiven, 5, 16));
    EXPECT_FALSE(isRead(LogRecordType::documentGiven, 0, 16));
    EXPECT_FALSE(isRead(LogRecordType::documentHandedOver, 1ULL << 32, 16));
    EXPECT_FALSE(isRead(LogRecordType::documentHandedOver, 5, 17));
    EXPECT_FALSE(isRead(LogRecordType::otherName, 5, 13));
    EXPECT_FALSE(isRead(LogRecordType::otherName, 5, 14 + 1024));
    EXPECT_FALSE(isRead(LogRecordType::otherNameGone, 5, 15));
    EXPECT_FALSE(isRead(LogRecordType::departure, 5, Departure::kHeadBytes));  // Of another kind.
    EXPECT_FALSE(isRead(LogRecordType::documentChange, 5, 19));
    EXPECT_TRUE(isRead(LogRecordType::attributes, 5, 65'536));
    EXPECT_FALSE(isRead(LogRecordType::attributes, 5, 65'537));
    EXPECT_TRUE(isRead(LogRecordType::attributes, 0, 8));
    EXPECT_TRUE(isRead(LogRecordType::attributes, (1ULL << 32) - 1, 8));
    EXPECT_FALSE(isRead(LogRecordType::attributes, 1ULL << 32, 8));
    EXPECT_FALSE(isRead(LogRecordType::timeMark, 5, 7));
    EXPECT_TRUE(isRead(LogRecordType::historyBegin, 5, 0));
    EXPECT_FALSE(isRead(LogRecordType::historyBegin, 0, 0));
    EXPECT_FALSE(isRead(LogRecordType::historyBegin, 5, 1));
    EXPECT_FALSE(isRead(LogRecordType{0}, 5, 8));
    EXPECT_FALSE(isRead(LogRecordType{13}, 5, 8));
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

// A departure cut short is none, or one whose names end earlier; never one that reads beyond its bytes.
TEST(JournalRecord, takesTruncatedDeparturesForWhatTheyAre) {
    const Bytes bytes = Departure{.fileID = FileID{1}, .name = "name", .path = "folder/name"}.encode();
    for (std::size_t size = 0; size <= bytes.size(); ++size) {
        const auto departure = Departure::decode(ByteView(bytes).first(size));
        ASSERT_EQ(departure.has_value(), size >= Departure::kHeadBytes + 4) << size;
        if (!departure) continue;
        EXPECT_EQ(departure->name, "name");
        EXPECT_EQ(departure->path, std::string("folder/name").substr(0, size - Departure::kHeadBytes - 4));
    }
    EXPECT_EQ(Presence::decode(bytes), std::nullopt);
}

// From the paper that the function was published in.
TEST(NameHash, isSipHash) {
    NameHashKey key{};
    std::string bytes;
    for (std::uint8_t i = 0; i < 16; ++i) key[i] = i;
    for (char i = 0; i < 15; ++i) bytes += i;
    EXPECT_EQ(sipHash(key, bytesOf(bytes)), 0xA129CA6149BE45E5U);
    EXPECT_EQ(nameHash(key, bytes), 0x49BE45E5U);
    EXPECT_NE(nameHash(randomNameHashKey(), "a"), nameHash(randomNameHashKey(), "a"));
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
