#include "host/SearchableItems.h"

#include <gtest/gtest.h>

#include "host/SignalDispatcher.h"

namespace cindral::test {
namespace {

using Items = std::set<std::string>;

TEST(SearchableItemsInMemory, forgetsTheItemsOfDomains) {
    SearchableItemsInMemory items;
    items.put("did=1", "a");
    items.put("did=2", "a");
    items.put("did=3", "b");
    items.put("did=4", "c");
    int completions = 0;
    items.deleteItems({"a", "c", "unknown"}, [&](const std::optional<KsError>& error) {
        EXPECT_FALSE(error);
        ++completions;
    });
    EXPECT_EQ(completions, 1);
    EXPECT_EQ(items.itemsOf("a"), Items());
    EXPECT_EQ(items.itemsOf("b"), Items{"did=3"});
    EXPECT_EQ(items.itemsOf("c"), Items());
    items.put("did=1", "b");
    EXPECT_EQ(items.itemsOf("b"), (Items{"did=1", "did=3"}));
}

TEST(SearchableItemsInMemory, anItemIsOfOneDomain) {
    SearchableItemsInMemory items;
    items.put("did=1", "a");
    items.put("did=1", "b");
    EXPECT_EQ(items.itemsOf("a"), Items());
    EXPECT_EQ(items.itemsOf("b"), Items{"did=1"});
    items.put("did=1", "b");
    EXPECT_EQ(items.itemsOf("b"), Items{"did=1"});
}

TEST(SearchableItemsInMemory, isWhereTheProvidersDeletionsArrive) {
    const auto items = std::make_shared<SearchableItemsInMemory>();
    items->put("did=1", "a");
    SignalDispatcher dispatcher;
    int completions = 0;
    const auto completion = [&](const std::optional<KsError>& error) {
        EXPECT_FALSE(error);
        ++completions;
    };
    dispatcher.deleteSearchableItems({"a"}, completion);
    EXPECT_EQ(items->itemsOf("a"), Items{"did=1"}) << "nothing is searchable yet";
    dispatcher.setSearchableItems(items);
    dispatcher.deleteSearchableItems({"a"}, completion);
    EXPECT_EQ(items->itemsOf("a"), Items());
    EXPECT_EQ(completions, 2);
}

}  // namespace
}  // namespace cindral::test
