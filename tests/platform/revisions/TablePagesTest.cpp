#include "platform/revisions/TablePages.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <random>
#include <set>

#include "platform/foundation/Sys.h"
#include "platform/revisions/ObjectTables.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::TemporaryFolder;

constexpr std::size_t kMapBytes = 64 << 20;

class TablePagesTest : public ::testing::Test {
protected:
    std::string path() const { return temporary_ / "volume"; }

    /// A table of so many objects that were written in no order, `gap` numbers apart.
    std::set<std::uint64_t> write(std::size_t count, std::uint64_t gap) {
        EXPECT_TRUE(ObjectTables::create(path(), {}).ok());
        auto tables = std::move(ObjectTables::open(path(), kMapBytes)).value();
        std::vector<std::uint64_t> keys;
        for (std::uint64_t i = 0; i < count; ++i) keys.push_back(1000 + i * gap);
        std::ranges::shuffle(keys, std::mt19937_64(5));  // NOLINT: the same order in every run.
        for (std::size_t begin = 0; begin < count; begin += count / 3 + 1) {
            Overlay overlay;
            for (std::size_t i = begin; i < std::min(count, begin + count / 3 + 1); ++i) {
                const DocumentID id{static_cast<std::uint32_t>(i + 1)};
                const std::string name = nameOf(keys[i]);
                const FileID parent = parentOf(keys[i]);
                overlay.put(FileID{keys[i]},
                            {.parent = parent, .birthTime = 5, .documentID = id, .eventID = keys[i], .name = name},
                            nameHash({}, name), true);
                overlay.addDocument(id, {FileID{keys[i]}, 5});
            }
            EXPECT_TRUE(tables->write(overlay, tables->head(), 100, {}).ok());
        }
        return {keys.begin(), keys.end()};
    }
    /// Folders of every size: of one child, of several, of many.
    static FileID parentOf(std::uint64_t key) {
        return FileID{key % 16 == 0 ? 1'000'000 + key : key % 16 == 1 ? 2'000'000 + key / 1000 : 2};
    }
    static std::string nameOf(std::uint64_t key) { return "name " + std::string(key % 40, 'n') + std::to_string(key); }

    /// How many children there are in all, having read every folder and every event.
    static std::size_t readFolders(const ObjectTables::Snapshot& snapshot, const std::set<std::uint64_t>& keys) {
        std::set<FileID> folders;
        for (const std::uint64_t key : keys) folders.insert(parentOf(key));
        std::size_t children = 0, counted = 0;
        for (const FileID folder : folders) {
            (void)snapshot.children(folder, [&](std::span<const FileID> some) { children += some.size(); });
            counted += snapshot.childCount(folder);
            (void)snapshot.childrenWithHash(folder, 0x80000000);
        }
        std::size_t events = 0;
        (void)snapshot.events(0, [&](std::uint64_t, ByteView) { return ++events < 1'000'000; });
        return children == counted && events == children ? children : 0;
    }

    std::optional<std::string> damage() const {
        const UniqueFd file = std::move(sys::open(path().c_str(), O_RDONLY)).value();
        return tablepages::findDamage(file.get()).value();
    }
    std::string bytes() const {
        std::ifstream stream(path(), std::ios::binary);
        return {std::istreambuf_iterator<char>(stream), {}};
    }
    void setBytes(const std::string& bytes) const {
        std::ofstream stream(path(), std::ios::binary | std::ios::trunc);
        stream << bytes;
    }
    void setByte(std::size_t at, char byte) const {
        std::fstream stream(path(), std::ios::binary | std::ios::in | std::ios::out);
        stream.seekp(static_cast<std::streamoff>(at));
        stream.put(byte);
    }

    TemporaryFolder temporary_;
};

TEST_F(TablePagesTest, findsNoDamageInWhatTheLibraryWrote) {
    for (const std::size_t count : {0, 1, 100, 3000, 40'000}) {
        write(count, 3);
        EXPECT_EQ(damage(), std::nullopt) << count;
    }
}

TEST_F(TablePagesTest, findsManyKeysAtOnceAsTheLibraryFindsThem) {
    for (const std::size_t count : {0, 1, 2, 100, 3000, 40'000}) {
        SCOPED_TRACE(count);
        const auto keys = write(count, 3);
        const auto tables = std::move(ObjectTables::open(path(), kMapBytes)).value();
        const ObjectTables::Snapshot snapshot(*tables);
        std::vector<tablepages::Lookup> lookups;
        for (std::uint64_t key = 990; key < 1010 + count * 3; ++key) lookups.push_back({.key = key});
        lookups.push_back({.key = 0});
        lookups.push_back({.key = ~std::uint64_t{0}});
        ASSERT_TRUE(snapshot.objects(lookups).ok());
        std::size_t found = 0;
        for (const auto& lookup : lookups) {
            ASSERT_EQ(lookup.found, keys.contains(lookup.key)) << lookup.key;
            const auto one = snapshot.object(FileID{lookup.key});
            ASSERT_EQ(lookup.found, one.has_value());
            if (!one) continue;
            ++found;
            const auto many = PackedRecord::decode(lookup.value);
            ASSERT_TRUE(many.has_value());
            EXPECT_EQ(many->name, one->name);
            EXPECT_EQ(many->name, nameOf(lookup.key));
            EXPECT_EQ(many->documentID, one->documentID);
        }
        EXPECT_EQ(found, count);
        EXPECT_EQ(readFolders(snapshot, keys), count);
        EXPECT_TRUE(snapshot.objects({}).ok());
    }
}

// Any bit that flips where a page's structure lies is found, or does no harm: the tables open, and all of them is read.
TEST_F(TablePagesTest, findsFlippedBitsBeforeTheLibraryDoes) {
    const auto keys = write(400, 3);
    const std::string good = bytes();
    std::size_t found = 0, harmless = 0;
    std::optional<std::size_t> changed;
    for (std::size_t page = 0; page < good.size(); page += 4096) {
        // The page's head, its first offsets, the end with the first entries that were written, and some of what is
        // between; in head pages all of it.
        for (std::size_t at = 0; at < 4096; at += at >= 40 && at < 4040 && page >= 8192 ? 41 : 1) {
            if (page < 8192 && at == 160) break;
            if (changed) setByte(*changed, good[*changed]);
            changed = page + at;
            setByte(page + at, static_cast<char>(good[page + at] ^ (1 << ((page / 4096 + at) % 8))));
            if (damage()) {
                ++found;
                continue;
            }
            ++harmless;
            auto tables = ObjectTables::open(path(), kMapBytes);
            if (!tables.ok()) continue;
            const ObjectTables::Snapshot snapshot(**tables);
            std::vector<tablepages::Lookup> lookups;
            for (const std::uint64_t key : keys) {
                lookups.push_back({.key = key});
                (void)snapshot.object(FileID{key});
            }
            (void)snapshot.objects(lookups);
            for (std::uint32_t id = 1; id <= keys.size(); ++id) (void)snapshot.document(DocumentID{id});
            readFolders(snapshot, keys);
        }
    }
    EXPECT_GT(found, 0U);
    EXPECT_GT(harmless, 0U);  // Free pages, padding, values.
}

TEST_F(TablePagesTest, findsEveryFlippedBitOfAPagesNumberAndKind) {
    write(400, 3);
    const std::string good = bytes();
    std::size_t inUse = 0;
    for (std::size_t page = 8192; page < good.size(); page += 4096) {
        std::string bad = good;
        bad.replace(page, 4096, 4096, '\xFF');
        setBytes(bad);
        if (!damage()) continue;  // A free page.
        ++inUse;
        setBytes(good);
        for (const std::size_t at : {0, 1, 2, 3, 4, 5, 6, 7, 10, 11}) {
            for (unsigned bit = 0; bit < 8; ++bit) {
                setByte(page + at, static_cast<char>(good[page + at] ^ (1 << bit)));
                EXPECT_TRUE(damage().has_value()) << page << " " << at << " " << bit;
            }
            setByte(page + at, good[page + at]);
        }
    }
    EXPECT_GT(inUse, 10U);
}

TEST_F(TablePagesTest, findsTruncationAtEveryPageInUse) {
    write(3000, 1);
    const std::string good = bytes();
    std::size_t found = 0;
    for (std::size_t size = 0; size < good.size(); size += 2048) {
        setBytes(good.substr(0, size));
        found += damage() ? 1 : 0;
    }
    EXPECT_GT(found, good.size() / 2048 * 9 / 10);
    setBytes("");
    EXPECT_TRUE(damage().has_value());
}

TEST_F(TablePagesTest, findsAPageThatIsInUseTwice) {
    write(3000, 1);
    const std::string good = bytes();
    // One leaf in another's place, number and all.
    std::string bad = good;
    std::vector<std::size_t> leaves;
    for (std::size_t page = 8192; page < good.size(); page += 4096) {
        if (good[page + 10] == 0x02) leaves.push_back(page);
    }
    ASSERT_GT(leaves.size(), 10U);
    bad.replace(leaves[3], 4096, good, leaves[7], 4096);
    setBytes(bad);
    EXPECT_TRUE(damage().has_value());
}

// Damage that comes after the check leads to a wrong answer at worst, not out of the map.
TEST_F(TablePagesTest, staysWithinThePagesWhateverTheyHold) {
    std::mt19937_64 random(11);  // NOLINT: the same order in every run.
    constexpr std::size_t kPages = 4, kPageBytes = 4096;
    alignas(kPageBytes) static std::array<std::byte, kPages * kPageBytes> map;
    std::size_t refused = 0;
    for (int round = 0; round < 2000; ++round) {
        for (auto& byte : map) byte = static_cast<std::byte>(random());
        for (std::size_t page = 0; page < kPages; ++page) {
            // Likely enough to be taken for pages of a tree.
            map[page * kPageBytes + 10] = std::byte{static_cast<unsigned char>(page == 0 ? 1 : 2)};
            map[page * kPageBytes + 11] = std::byte{};
            map[page * kPageBytes + 13] &= std::byte{0x0F};
            for (std::size_t at = 16; at < kPageBytes; at += 1 + random() % 64) {
                map[page * kPageBytes + at] = static_cast<std::byte>(random() % kPages);
            }
        }
        if (round % 2 == 0) std::ranges::fill(std::span(map).first(2000).subspan(16), std::byte{});
        tablepages::Tree tree{};
        tree.depth = static_cast<std::uint16_t>(1 + random() % 3);
        tree.root = random() % (kPages + 1);
        std::array<tablepages::Lookup, 3> lookups;
        for (auto& lookup : lookups) lookup.key = random();
        if (!tablepages::lookUp(map.data(), kPageBytes, kPages, tree, lookups)) ++refused;
        for (const auto& lookup : lookups) {
            if (!lookup.found) continue;
            ASSERT_GE(lookup.value.data(), map.data());
            ASSERT_LE(lookup.value.data() + lookup.value.size(), map.data() + map.size());
        }
    }
    EXPECT_GT(refused, 0U);
}

}  // namespace
}  // namespace cindral
