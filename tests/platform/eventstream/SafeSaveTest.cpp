#include "platform/eventstream/SafeSave.h"

#include <gtest/gtest.h>

namespace cindral {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

TEST(SafeSave, knowsTheNamesThatEditorsGiveToBackups) {
    for (const char* name :
         {"doc.txt~", "doc.txt.bak", "doc.txt.BAK", "doc.txt.orig", "doc.txt.~1~", "doc.txt.old", "doc.txt_backup",
          "doc.txt.bak2", "doc.txt.20261121", "#doc.txt#", "~doc.txt", ".#doc.txt", "bak.doc.txt"}) {
        EXPECT_TRUE(isBackupName(name, "doc.txt")) << name;
    }
}

TEST(SafeSave, takesOtherNamesForMoves) {
    for (const char* name :
         {"doc.txt", "other.txt", "doc.tx", "doc.txt2", "doc.txt.pdf", "doc.txt copy", "my doc.txt", "doc", "~", ""}) {
        EXPECT_FALSE(isBackupName(name, "doc.txt")) << name;
    }
    EXPECT_FALSE(isBackupName("~", ""));
}

class RecentDeparturesTest : public ::testing::Test {
protected:
    std::optional<DocumentID> takeAfter(std::chrono::milliseconds time, std::string_view name = "doc") {
        return departures_.take(FileID{1}, name, start_ + time);
    }
    RecentDepartures::TimePoint start_ = RecentDepartures::TimePoint() + std::chrono::hours(1);
    RecentDepartures departures_;
};

TEST_F(RecentDeparturesTest, givesADocumentOnce) {
    departures_.add(FileID{1}, "doc", DocumentID{7}, start_);
    EXPECT_EQ(takeAfter(seconds(2)), DocumentID{7});
    EXPECT_EQ(takeAfter(seconds(2)), std::nullopt);
}

TEST_F(RecentDeparturesTest, givesNoneAfterTheWindow) {
    departures_.add(FileID{1}, "doc", DocumentID{7}, start_);
    EXPECT_EQ(takeAfter(milliseconds(2'001)), std::nullopt);
}

TEST_F(RecentDeparturesTest, givesNoneUnderAnotherName) {
    departures_.add(FileID{1}, "doc", DocumentID{7}, start_);
    EXPECT_EQ(takeAfter(seconds(1), "doc2"), std::nullopt);
    EXPECT_EQ(departures_.take(FileID{2}, "doc", start_), std::nullopt);
}

TEST_F(RecentDeparturesTest, forgetsWhatLeftAFolderThatIsGone) {
    for (const std::uint64_t folder : {1, 2, 3}) {
        departures_.add(FileID{folder}, "", DocumentID{7}, start_);
        departures_.add(FileID{folder}, "doc", DocumentID{7}, start_);
    }
    departures_.forgetFolder(FileID{2});
    EXPECT_EQ(departures_.size(), 4u);
    EXPECT_EQ(departures_.take(FileID{2}, "doc", start_), std::nullopt);
    EXPECT_EQ(departures_.take(FileID{3}, "", start_), DocumentID{7});
}

TEST_F(RecentDeparturesTest, forgetsWhatIsTooOld) {
    for (int i = 0; i < 100; ++i) departures_.add(FileID{1}, std::to_string(i), DocumentID{7}, start_);
    departures_.add(FileID{1}, "last", DocumentID{8}, start_ + seconds(10));
    EXPECT_EQ(departures_.size(), 1u);
}

}  // namespace
}  // namespace cindral
