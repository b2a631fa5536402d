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

}  // namespace
}  // namespace cindral
