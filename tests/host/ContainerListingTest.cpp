#include "host/ContainerListing.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>

#include "host/FakeProvider.h"
#include "host/ProviderClient.h"

namespace cindral {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class ContainerListingTest : public ::testing::Test {
protected:
    ContainerListingTest() { provider_->folder("fid=2", "folder"); }

    /// Names, in the order listed; an error ends them with its code.
    std::vector<std::string> names(const std::string& container) {
        ProviderClient client(provider_);
        ContainerListing listing(client, container);
        std::vector<std::string> names;
        while (true) {
            const auto next = listing.next();
            if (!next.ok()) names.push_back(std::to_string(next.error().code()));
            if (!next.ok() || *next == nullptr) return names;
            names.push_back((*next)->filename());
        }
    }

    const std::shared_ptr<test::FakeProvider> provider_ = std::make_shared<test::FakeProvider>();
};

TEST_F(ContainerListingTest, listsPageAfterPage) {
    provider_->documents(7, "fid=2");
    EXPECT_THAT(names("fid=2"),
                ElementsAre("0000.txt", "0001.txt", "0002.txt", "0003.txt", "0004.txt", "0005.txt", "0006.txt"));
}

TEST_F(ContainerListingTest, endsAfterAnEmptyLastPage) {
    provider_->documents(6, "fid=2");
    EXPECT_EQ(names("fid=2").size(), 6U);
}

TEST_F(ContainerListingTest, listsAnEmptyFolder) {
    EXPECT_THAT(names("fid=2"), IsEmpty());
}

TEST_F(ContainerListingTest, endsWithAnError) {
    provider_->documents(7, "fid=2");
    provider_->beforePage = [&](const std::string&, std::size_t offset) {
        if (offset == 3) provider_->listingErrors.emplace("fid=2", KsError::posix(EIO));
    };
    EXPECT_THAT(names("fid=2"), ElementsAre("0000.txt", "0001.txt", "0002.txt", std::to_string(EIO)));
    EXPECT_THAT(names("fid=9"), ElementsAre("-1001"));
}

TEST_F(ContainerListingTest, beginsAgainWhenAPageHasExpiredAndListsNothingTwice) {
    provider_->documents(10, "fid=2");
    bool isDone = false;
    provider_->beforePage = [&](const std::string&, std::size_t offset) {
        if (offset != 6 || std::exchange(isDone, true)) return;
        // One that was listed is gone, so that everything after it moves up.
        provider_->remove("did=2");
        provider_->expiries = 1;
    };
    EXPECT_THAT(names("fid=2"), ElementsAre("0000.txt", "0001.txt", "0002.txt", "0003.txt", "0004.txt", "0005.txt",
                                            "0006.txt", "0007.txt", "0008.txt", "0009.txt"));
}

TEST_F(ContainerListingTest, goesOnThroughManyExpiriesWhileItFindsSomethingNew) {
    provider_->documents(200, "fid=2");
    int expiries = 0;
    provider_->beforePage = [&](const std::string&, std::size_t offset) {
        if (offset != 9) return;
        for (int i = 0; i < 3; ++i) provider_->remove(fmt::format("did={}", expiries * 3 + i + 1));
        provider_->expiries = 1;
        ++expiries;
    };
    EXPECT_EQ(names("fid=2").size(), 200U);
    EXPECT_GT(expiries, ContainerListing::kFruitlessRestartsMax);
}

TEST_F(ContainerListingTest, givesUpOnAFolderThatNeverHoldsStill) {
    provider_->documents(10, "fid=2");
    provider_->expiries = 1'000;
    EXPECT_THAT(names("fid=2"), ElementsAre("0000.txt", "0001.txt", "0002.txt", "-1002"));
    EXPECT_EQ(provider_->expiries, 1'000 - ContainerListing::kFruitlessRestartsMax - 1);
}

// The root lists what is in every root; an application's documents are not at the top.
TEST_F(ContainerListingTest, listsAtTheTopWhatHasTheRootAsParent) {
    provider_->document("did=7", "top.txt");
    provider_->document("did=8", "below.txt").parent = "#com.example.notes";
    EXPECT_THAT(names(kTesselRootContainerItemIdentifier), ElementsAre("folder", "top.txt"));
}

}  // namespace
}  // namespace cindral
