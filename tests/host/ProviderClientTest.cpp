#include "host/ProviderClient.h"

#include <gtest/gtest.h>

#include <cerrno>

#include "host/FakeProvider.h"

namespace cindral {
namespace {

class ProviderClientTest : public ::testing::Test {
protected:
    ProviderClientTest() { provider_->folder("fid=2", "folder"); }

    Result<ItemsPage> firstPage(ProviderClient& client, const std::string& container) {
        return client.itemsOnPage(container, tesselInitialPageSortedByName());
    }

    const std::shared_ptr<test::FakeProvider> provider_ = std::make_shared<test::FakeProvider>();
};

TEST_F(ProviderClientTest, listsAPage) {
    provider_->documents(4, "fid=2");
    ProviderClient client(provider_);
    const auto first = firstPage(client, "fid=2");
    ASSERT_TRUE(first.ok());
    EXPECT_EQ(first->items.size(), test::FakeProvider::kPageItems);
    ASSERT_TRUE(first->nextPage.has_value());
    const auto second = client.itemsOnPage("fid=2", *first->nextPage);
    ASSERT_TRUE(second.ok());
    EXPECT_EQ(second->items.size(), 1U);
    EXPECT_EQ(second->nextPage, std::nullopt);
}

TEST_F(ProviderClientTest, listsAPageThatIsAnsweredLater) {
    provider_->documents(4, "fid=2");
    provider_->isAsynchronous = true;
    ProviderClient client(provider_);
    EXPECT_EQ(firstPage(client, "fid=2")->items.size(), test::FakeProvider::kPageItems);
}

TEST_F(ProviderClientTest, passesErrorsOn) {
    ProviderClient client(provider_);
    EXPECT_EQ(firstPage(client, "fid=9").error(), tesselErrorForNonExistentItemWithIdentifier("fid=9"));
    EXPECT_EQ(client.anchor("fid=9").error(), tesselErrorForNonExistentItemWithIdentifier("fid=9"));
    provider_->listingErrors.emplace("fid=2", KsError::posix(EACCES));
    EXPECT_EQ(firstPage(client, "fid=2").error(), KsError::posix(EACCES));
}

TEST_F(ProviderClientTest, answersWhereTheProviderForgetsTo) {
    provider_->dropsObservers = true;
    ProviderClient client(provider_);
    EXPECT_EQ(firstPage(client, "fid=2").error(), KsError::posix(ECANCELED));
}

TEST_F(ProviderClientTest, asksForAnchors) {
    ProviderClient client(provider_);
    const auto anchor = client.anchor("fid=2");
    ASSERT_TRUE(anchor.ok());
    EXPECT_EQ(textOf(anchor->value()), "fid=2");
    EXPECT_EQ(*client.anchor("fid=noanchor"), std::nullopt);
}

TEST_F(ProviderClientTest, asksForAFoldersEnumeratorAnewEachTime) {
    {
        ProviderClient client(provider_);
        for (int i = 0; i < 3; ++i) ASSERT_TRUE(firstPage(client, "fid=2").ok());
        EXPECT_EQ(provider_->enumeratorsMade, 3);
    }
    EXPECT_EQ(provider_->enumeratorsInvalidated, 3);
}

TEST_F(ProviderClientTest, keepsTheRootsEnumerator) {
    {
        ProviderClient client(provider_);
        for (int i = 0; i < 3; ++i) ASSERT_TRUE(firstPage(client, kTesselRootContainerItemIdentifier).ok());
        ASSERT_TRUE(client.anchor(kTesselRootContainerItemIdentifier).ok());
        EXPECT_EQ(provider_->enumeratorsMade, 1);
        ASSERT_TRUE(firstPage(client, kTesselWorkingSetContainerItemIdentifier).ok());
        EXPECT_EQ(provider_->enumeratorsMade, 2);
        EXPECT_EQ(provider_->enumeratorsInvalidated, 0);
    }
    EXPECT_EQ(provider_->enumeratorsInvalidated, 2);
}

TEST_F(ProviderClientTest, letsGoOfEveryEnumeratorThatAnswersLater) {
    provider_->isAsynchronous = true;
    {
        ProviderClient client(provider_);
        for (int i = 0; i < 20; ++i) ASSERT_TRUE(firstPage(client, "fid=2").ok());
    }
    EXPECT_EQ(provider_->enumeratorsMade, 20);
    EXPECT_EQ(provider_->enumeratorsInvalidated, 20);
}

TEST_F(ProviderClientTest, collectsChangesInTheirOrder) {
    provider_->document("did=3", "a.txt", "fid=2");
    provider_->changes["fid=2"] = {{{"d did=9", "u did=3", "d fid=9"}, "next", true, std::nullopt}};
    ProviderClient client(provider_);
    const auto batch = client.changesSince("fid=2", *client.anchor("fid=2").value());
    ASSERT_TRUE(batch.ok());
    ASSERT_EQ(batch->log.size(), 3U);
    EXPECT_EQ(batch->log[0].item, nullptr);
    EXPECT_EQ(batch->log[0].identifier, "did=9");
    EXPECT_EQ(batch->log[1].item->filename(), "a.txt");
    EXPECT_EQ(batch->log[2].identifier, "fid=9");
    EXPECT_EQ(textOf(batch->anchor), "next");
    EXPECT_TRUE(batch->moreComing);
    EXPECT_EQ(provider_->askedAnchors, (std::vector<std::string>{"fid=2"}));
}

TEST_F(ProviderClientTest, passesErrorsOfChangesOn) {
    ProviderClient client(provider_);
    EXPECT_EQ(client.changesSince("fid=9", {}).error(), tesselErrorForNonExistentItemWithIdentifier("fid=9"));
    EXPECT_EQ(client.changesSince("fid=2", {}).error(), tesselErrorForExpiredPage());
    provider_->dropsObservers = true;
    EXPECT_EQ(client.changesSince("fid=2", {}).error(), KsError::posix(ECANCELED));
}

// What is told of a place is nothing to who asks for a container that is another place by then.
TEST_F(ProviderClientTest, asksAgainWhenTheContainerHasMovedMeanwhile) {
    test::FakeItem& folder = provider_->folder("fid=3", "moving");
    folder.url = KsURL::fileURL("/storage/before");
    provider_->changes["fid=3"] = {{{}, "stale", false, std::nullopt}, {{}, "fresh", false, std::nullopt}};
    provider_->beforeChanges = [&] { folder.url = KsURL::fileURL("/storage/after"); };
    ProviderClient client(provider_);
    EXPECT_EQ(textOf(client.changesSince("fid=3", {})->anchor), "fresh");
    int moves = 0;
    provider_->beforeChanges = [&] { folder.url = KsURL::fileURL("/storage/" + std::to_string(++moves)); };
    EXPECT_EQ(client.changesSince("fid=3", {}).error(), KsError::posix(ECANCELED)) << "nothing that may lack something";
    EXPECT_EQ(moves, 5);
}

TEST_F(ProviderClientTest, listsAgainWhenTheContainerHasMovedMeanwhile) {
    test::FakeItem& folder = provider_->folder("fid=3", "moving");
    folder.url = KsURL::fileURL("/storage/before");
    int pages = 0;
    provider_->beforePage = [&](const std::string&, std::size_t) {
        if (++pages == 1) folder.url = KsURL::fileURL("/storage/after");
    };
    ProviderClient client(provider_);
    EXPECT_TRUE(firstPage(client, "fid=3").ok());
    EXPECT_EQ(pages, 2);
    provider_->beforePage = [&](const std::string&, std::size_t) {
        folder.url = KsURL::fileURL("/storage/" + std::to_string(++pages));
    };
    EXPECT_EQ(firstPage(client, "fid=3").error(), KsError::posix(ECANCELED));
}

// Who stops monitoring stops the enumerator, and the request that another thread is in with it.
TEST_F(ProviderClientTest, asksAgainWhenChangesAreCutShort) {
    provider_->changes["fid=2"] = {{{}, "", false, KsError::posix(ECANCELED)},
                                   {{}, "", false, KsError::posix(ECANCELED)},
                                   {{}, "next", false, std::nullopt}};
    ProviderClient client(provider_);
    EXPECT_EQ(textOf(client.changesSince("fid=2", {})->anchor), "next");
    EXPECT_EQ(provider_->askedAnchors.size(), 3U);
    provider_->changes["fid=2"] = {{{}, "", false, KsError::posix(ECANCELED)}};
    EXPECT_EQ(client.changesSince("fid=2", {}).error(), KsError::posix(ECANCELED)) << "not for ever";
}

TEST_F(ProviderClientTest, keepsAnEnumeratorStartedWhileItIsMonitored) {
    {
        ProviderClient client(provider_);
        ASSERT_TRUE(client.startMonitoring("fid=2").ok());
        ASSERT_TRUE(client.startMonitoring(kTesselRootContainerItemIdentifier).ok());
        EXPECT_EQ(provider_->enumeratorsStarted, 2);
        EXPECT_EQ(provider_->enumeratorsInvalidated, 0);
        client.stopMonitoring("fid=2");
        client.stopMonitoring(kTesselRootContainerItemIdentifier);
        client.stopMonitoring("fid=2");
        EXPECT_EQ(provider_->enumeratorsStopped, 2);
        EXPECT_EQ(client.startMonitoring("fid=9").error(), tesselErrorForNonExistentItemWithIdentifier("fid=9"));
    }
    EXPECT_EQ(provider_->enumeratorsInvalidated, provider_->enumeratorsMade);
}

TEST_F(ProviderClientTest, monitorsAFolderWhereItWasFoundLast) {
    provider_->documents(4, "fid=2");
    provider_->changes["fid=2"] = {{{}, "next", false, std::nullopt}};
    {
        ProviderClient client(provider_);
        ASSERT_TRUE(client.startMonitoring("fid=2").ok());
        for (int i = 0; i < 3; ++i) ASSERT_TRUE(client.changesSince("fid=2", {}).ok());
        EXPECT_EQ(provider_->enumeratorsMade, 4) << "each request looks the folder up";
        EXPECT_EQ(provider_->enumeratorsStarted, 4) << "and monitors what it found";
        const auto first = client.itemsOnPage("fid=2", tesselInitialPageSortedByDate());
        ASSERT_TRUE(first.ok());
        EXPECT_EQ(provider_->enumeratorsStarted, 5) << "who lists it has come, too";
        ASSERT_TRUE(first->nextPage);
        ASSERT_TRUE(client.itemsOnPage("fid=2", *first->nextPage).ok());
        EXPECT_EQ(provider_->enumeratorsStarted, 5) << "and goes on with the next page";
    }
    EXPECT_EQ(provider_->enumeratorsInvalidated, provider_->enumeratorsMade);
}

}  // namespace
}  // namespace cindral
