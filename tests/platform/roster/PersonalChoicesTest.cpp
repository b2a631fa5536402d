#include "platform/roster/PersonalChoices.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <fstream>
#include <iterator>
#include <thread>
#include <vector>

#include "platform/foundation/SysFaults.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

using Choice = PersonalChoices::Choice;

class PersonalChoicesTest : public ::testing::Test {
protected:
    std::optional<Choice> choice(const std::string& identifier) const {
        return PersonalChoices::read(path_).of(identifier);
    }
    void choose(const std::string& identifier, Choice choice) {
        const auto written = PersonalChoices::write(path_, identifier, choice);
        ASSERT_TRUE(written.ok()) << written.error().description();
    }
    std::string contents() const {
        std::ifstream stream(path_, std::ios::binary);
        return {std::istreambuf_iterator<char>(stream), {}};
    }

    TemporaryFolder folder_;
    const std::string path_ = folder_ / "config/cindral/applications.conf";
};

TEST_F(PersonalChoicesTest, nothingIsChosenAtFirst) {
    EXPECT_EQ(choice("org.example.Writer"), std::nullopt);
}

TEST_F(PersonalChoicesTest, readsWhatItWrote) {
    choose("org.example.Writer", Choice::enabled);
    choose("org.example.Reader", Choice::disabled);
    EXPECT_EQ(choice("org.example.Writer"), Choice::enabled);
    EXPECT_EQ(choice("org.example.Reader"), Choice::disabled);
    choose("org.example.Writer", Choice::disabled);
    EXPECT_EQ(choice("org.example.Writer"), Choice::disabled);
    EXPECT_EQ(choice("org.example.Reader"), Choice::disabled);
}

TEST_F(PersonalChoicesTest, identifiersAreAnyBytes) {
    for (const std::string identifier : {"a=b", "#c", "[d]", "e f", "g\nh", "\xff", "%41", "100%", "ü"}) {
        choose(identifier, Choice::enabled);
        EXPECT_EQ(choice(identifier), Choice::enabled) << identifier;
    }
    EXPECT_EQ(choice("A"), std::nullopt);
    EXPECT_NE(contents().find("a%3Db=enabled\n"), std::string::npos) << contents();
}

TEST_F(PersonalChoicesTest, whatIsNotUnderstoodSaysNothing) {
    folder_.file("config/cindral/applications.conf", "[Applications]\na=enabled\nb=maybe\nc%4=enabled\nd%zz=enabled\n");
    EXPECT_EQ(choice("a"), Choice::enabled);
    EXPECT_EQ(choice("b"), std::nullopt);
    EXPECT_EQ(choice("c"), std::nullopt);
    folder_.file("config/cindral/applications.conf", "no key file");
    EXPECT_EQ(choice("a"), std::nullopt);
}

TEST_F(PersonalChoicesTest, theFileIsItsOwnersAlone) {
    choose("a", Choice::enabled);
    struct stat status;
    ASSERT_EQ(::stat(path_.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600U);
    ASSERT_EQ(::stat((folder_ / "config/cindral").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0700U);
}

TEST_F(PersonalChoicesTest, writersDoNotLoseEachOthersChoices) {
    std::vector<std::thread> writers;
    for (int i = 0; i < 8; ++i)
        writers.emplace_back(
            [&, i] { choose("app" + std::to_string(i), i % 2 == 0 ? Choice::enabled : Choice::disabled); });
    for (auto& writer : writers) writer.join();
    for (int i = 0; i < 8; ++i)
        EXPECT_EQ(choice("app" + std::to_string(i)), i % 2 == 0 ? Choice::enabled : Choice::disabled);
}

// What can't be read may hold choices, which a new file would not have.
TEST_F(PersonalChoicesTest, whatCannotBeReadIsNotReplaced) {
    const auto refused = [this] {
        const auto written = PersonalChoices::write(path_, "b", Choice::enabled);
        EXPECT_FALSE(written.ok());
        if (written.ok()) return std::string();
        EXPECT_EQ(written.error().userInfo().at("path"), path_);
        return written.error().reason();
    };
    const std::string partly = "[Applications]\na=enabled\nhalf a li";
    folder_.file("config/cindral/applications.conf", partly);
    EXPECT_EQ(refused(), "It holds lines that can't be read; mend it or take it away");
    EXPECT_EQ(contents(), partly);

    const std::string large = "[Applications]\na=enabled\n#" + std::string(1 << 20, '.');
    folder_.file("config/cindral/applications.conf", large);
    EXPECT_EQ(refused(), "File too large");
    EXPECT_EQ(contents(), large);

    const std::string whole = "[Applications]\na=enabled\n";
    folder_.file("config/cindral/applications.conf", whole);
    for (const int reason : {EIO, EACCES, EMFILE}) {
        {
            const sys::FaultInjection faults([&, opens = 0](const char* call) mutable {
                // The folder's lock comes first.
                return std::string_view(call) == "openat" && ++opens == 2 ? reason : 0;
            });
            EXPECT_EQ(refused(), KsError::posix(reason).reason());
        }
        EXPECT_EQ(contents(), whole);
    }
    choose("b", Choice::enabled);
    EXPECT_EQ(choice("a"), Choice::enabled);
}

TEST_F(PersonalChoicesTest, aFolderInTheWayIsAnError) {
    folder_.file("config");
    const auto written = PersonalChoices::write(path_, "a", Choice::enabled);
    ASSERT_FALSE(written.ok());
    EXPECT_TRUE(written.error().isPosix(ENOTDIR));
    EXPECT_EQ(written.error().userInfo().at("path"), folder_ / "config");
}

}  // namespace
}  // namespace cindral::test
