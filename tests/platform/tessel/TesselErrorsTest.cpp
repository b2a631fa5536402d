#include "platform/tessel/TesselErrors.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>

#include "host/FakeProvider.h"
#include "platform/tessel/TesselTags.h"

namespace cindral {
namespace {

using ::testing::ElementsAre;
using ::testing::Pair;

TEST(TesselErrors, aMissingItemIsNamed) {
    const KsError error = tesselErrorForNonExistentItemWithIdentifier("fid=7");
    EXPECT_TRUE(error.is("TesselErrorDomain", -1001));
    EXPECT_THAT(error.userInfo(), ElementsAre(Pair("identifier", "fid=7"), Pair("message", "No such item")));
}

TEST(TesselErrors, anExpiredPageNamesNothing) {
    const KsError error = tesselErrorForExpiredPage();
    EXPECT_TRUE(error.is("TesselErrorDomain", -1002));
    EXPECT_THAT(error.userInfo(), ElementsAre(Pair("message", "The page or sync anchor has expired")));
}

TEST(TesselErrors, aCollisionHoldsTheItemInTheWay) {
    const auto item = std::make_shared<test::FakeItem>();
    item->url = KsURL::fileURL("/storage/Documents/a");
    const KsError error = tesselErrorForCollisionWithItem(item);
    EXPECT_TRUE(error.is("TesselErrorDomain", -1003));
    EXPECT_THAT(error.userInfo(), ElementsAre(Pair("message", "An item with that name already exists"),
                                              Pair("path", "/storage/Documents/a")));
    EXPECT_EQ(collidingItem(error), item);
    // It comes along with the error, whoever passes it on.
    EXPECT_EQ(collidingItem(KsError(error).with("more", "text")), item);
    EXPECT_EQ(collidingItem(tesselErrorForExpiredPage()), nullptr);
}

TEST(TesselTags, areReadAsTheyWereWritten) {
    const std::vector<TSTag> tags{{"green"}, {""}, {"\xf0\x9f\x8c\xb2"}, {"green"}};
    EXPECT_EQ(tsGetTagsFromTagsData(tsTagsData(tags)), tags);
    EXPECT_EQ(tsGetTagsFromTagsData(tsTagsData({})), std::vector<TSTag>());
    EXPECT_EQ(tsGetTagsFromTagsData(bytesOf(std::string_view("no tags"))), std::nullopt);
}

// More than one list of values is otherwise allowed to hold.
TEST(TesselTags, anyNumberOfThemIsRead) {
    std::vector<TSTag> tags;
    for (int i = 0; i < 100'000; ++i) tags.push_back({std::to_string(i)});
    EXPECT_EQ(tsGetTagsFromTagsData(tsTagsData(tags)), tags);
}

TEST(TesselErrors, anInvalidParameterIsNamedWithItsValue) {
    const KsError error = tsInvalidParameterError("itemIdentifier", "did=x");
    EXPECT_TRUE(error.is("TSErrorDomain", 1));
    EXPECT_THAT(error.userInfo(), ElementsAre(Pair("message", "A parameter is invalid"),
                                              Pair("parameter", "itemIdentifier"), Pair("value", "did=x")));
}

TEST(TesselErrors, anItemThatWasNotFoundIsNamed) {
    const KsError error = tsItemNotFoundError("did=9");
    EXPECT_TRUE(error.is("TSErrorDomain", 2));
    EXPECT_THAT(error.userInfo(), ElementsAre(Pair("identifier", "did=9"), Pair("message", "The item was not found")));
}

TEST(TesselErrors, tellPeopleWhatTheyMean) {
    EXPECT_EQ(tesselErrorForNonExistentItemWithIdentifier("x").reason(), "No such item");
    EXPECT_EQ(tesselErrorForExpiredPage().description(),
              "The page or sync anchor has expired (TesselErrorDomain -1002)");
}

TEST(TesselTypes, initialPagesDiffer) {
    EXPECT_NE(tesselInitialPageSortedByName(), tesselInitialPageSortedByDate());
    EXPECT_EQ(&tesselInitialPageSortedByName(), &tesselInitialPageSortedByName());
}

// An encoded position is a binary property list, which begins with "bplist".
TEST(TesselTypes, initialPagesAreNoEncodedPosition) {
    for (const TesselPage& page : {tesselInitialPageSortedByName(), tesselInitialPageSortedByDate()}) {
        EXPECT_FALSE(page.empty());
        EXPECT_FALSE(textOf(page).starts_with("bplist"));
    }
}

// The numbers are part of the host interface.
TEST(TesselTypes, capabilitiesAreBits) {
    EXPECT_EQ(
        static_cast<std::uint32_t>(TesselItemCapabilities::allowsReading | TesselItemCapabilities::allowsDeleting),
        33U);
    EXPECT_TRUE((TesselItemCapabilities::allowsReading | TesselItemCapabilities::allowsWriting) &
                TesselItemCapabilities::allowsWriting);
    EXPECT_FALSE(TesselItemCapabilities::allowsReading & TesselItemCapabilities::allowsWriting);
}

}  // namespace
}  // namespace cindral
