#include "platform/eventstream/WatchTable.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <random>

namespace cindral {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

std::vector<FileID> objectsOf(const WatchTable& table, std::uint64_t watch) {
    std::vector<FileID> found{FileID{99}};
    table.find(watch, found);
    return found;
}

TEST(WatchTable, isEmptyAtFirst) {
    WatchTable table;
    EXPECT_EQ(table.size(), 0U);
    EXPECT_FALSE(table.contains(1));
    EXPECT_THAT(objectsOf(table, 1), IsEmpty());
    EXPECT_EQ(table.remove(FileID{1}), std::nullopt);
}

TEST(WatchTable, findsAnObjectByItsWatch) {
    WatchTable table;
    EXPECT_EQ(table.set(FileID{1}, 10), std::nullopt);
    EXPECT_EQ(table.set(FileID{1}, 10), std::nullopt);
    EXPECT_THAT(objectsOf(table, 10), ElementsAre(FileID{1}));
    EXPECT_EQ(table.size(), 1U);
}

TEST(WatchTable, answersTheWatchThatAnObjectHadBefore) {
    WatchTable table;
    table.set(FileID{1}, 10);
    EXPECT_EQ(table.set(FileID{1}, 11), 10U);
    EXPECT_FALSE(table.contains(10));
    EXPECT_THAT(objectsOf(table, 11), ElementsAre(FileID{1}));
}

TEST(WatchTable, findsAllObjectsOfASharedWatch) {
    WatchTable table;
    table.set(FileID{1}, 10);
    table.set(FileID{2}, 10);
    EXPECT_THAT(objectsOf(table, 10), UnorderedElementsAre(FileID{1}, FileID{2}));
    EXPECT_EQ(table.remove(FileID{1}), 10U);
    EXPECT_TRUE(table.contains(10));
    EXPECT_THAT(objectsOf(table, 10), ElementsAre(FileID{2}));
}

TEST(WatchTable, agreesWithAMapThroughAnyChanges) {
    std::mt19937_64 random(1);
    WatchTable table;
    std::map<std::uint64_t, std::uint64_t> model;
    for (int step = 0; step < 50'000; ++step) {
        const std::uint64_t object = random() % 500;
        // Some that lie close together, some that are equal in their lower half.
        const std::uint64_t watch = random() % 2 == 0 ? random() % 500 : (random() % 500) << 32;
        const auto known = model.find(object);
        const bool isKnown = known != model.end();
        if (random() % 3 == 0) {
            EXPECT_EQ(table.remove(FileID{object}), isKnown ? std::optional(known->second) : std::nullopt);
            model.erase(object);
        } else {
            const bool changes = isKnown && known->second != watch;
            EXPECT_EQ(table.set(FileID{object}, watch), changes ? std::optional(known->second) : std::nullopt);
            model[object] = watch;
        }
        std::vector<FileID> expected;
        for (const auto& [other, ofOther] : model) {
            if (ofOther == watch) expected.push_back(FileID{other});
        }
        ASSERT_THAT(objectsOf(table, watch), ::testing::UnorderedElementsAreArray(expected));
        ASSERT_EQ(table.contains(watch), !expected.empty());
        ASSERT_EQ(table.size(), model.size());
    }
}

}  // namespace
}  // namespace cindral
