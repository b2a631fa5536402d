#include "host/Commands.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <thread>

#include "host/Descriptor.h"
#include "host/FakeProvider.h"
#include "host/FakeSearch.h"
#include "host/HostError.h"
#include "host/ProviderClient.h"
#include "platform/foundation/Base64.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using nlohmann::json;
using test::FakeItem;
using ::testing::HasSubstr;
using ::testing::StartsWith;

class CommandsTest : public ::testing::Test {
protected:
    CommandsTest() {
        std::signal(SIGPIPE, SIG_IGN);
        ::setenv("TZ", "UTC", 1);
        ::tzset();
        std::filesystem::create_directory(real_);
        environment_.workingFolder = real_;
    }

    FakeItem& document(const std::string& identifier, const std::string& name,
                       const std::string& parent = kTesselRootContainerItemIdentifier) {
        FakeItem& item = provider_->document(identifier, name, parent);
        item.url = KsURL::fileURL("/nowhere/Documents/" + name);
        return item;
    }

    /// What the command prints; its error, when there is one, in failure_.
    std::string run(HostCommand command, std::optional<std::string> item = std::nullopt) {
        const std::string path = folder_ / "output";
        const UniqueFd file(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
        TextOutput output(file.get(), /*isTerminal=*/false);
        runInto(output, command, std::move(item));
        EXPECT_EQ(output.finish(), std::nullopt);
        std::ifstream stream(path, std::ios::binary);
        return {std::istreambuf_iterator<char>(stream), {}};
    }
    void runInto(TextOutput& output, HostCommand command, std::optional<std::string> item = std::nullopt) {
        options_.command = command;
        options_.item = std::move(item);
        ProviderClient client(provider_);
        const auto done = Commands({client,
                                    paths_,
                                    options_,
                                    environment_,
                                    [this] { return status_; },
                                    signals_,
                                    [this]() -> Result<int> { return stop_.get(); },
                                    search_,
                                    [this] { return Result<std::string>(doctor_); },
                                    {}},
                                   output)
                              .run();
        failure_ = done.ok() ? "" : messageOf(done.error());
    }
    std::vector<json> jsonLines(const std::string& text) {
        std::vector<json> lines;
        for (std::size_t start = 0; start < text.size();) {
            const std::size_t end = text.find('\n', start);
            lines.push_back(json::parse(text.substr(start, end - start)));
            start = end + 1;
        }
        return lines;
    }

    /// The lines of a command that goes on until it is stopped, as they come.
    class Running {
    public:
        Running(CommandsTest& test, HostCommand command, std::optional<std::string> item) {
            int fds[2];
            if (::pipe2(fds, O_CLOEXEC) != 0) std::abort();
            readEnd_.reset(fds[0]);
            writeEnd_.reset(fds[1]);
            thread_ = std::thread([this, &test, command, item = std::move(item)] {
                TextOutput output(writeEnd_.get(), /*isTerminal=*/false);
                test.runInto(output, command, item);
                output.finish();
                writeEnd_.reset();
            });
        }
        ~Running() { thread_.join(); }
        std::string line() {
            std::string line;
            char c = 0;
            while (*descriptor::read(readEnd_.get(), {&c, 1}) == 1 && c != '\n') line += c;
            return line;
        }
        void stopReading() { readEnd_.reset(); }

    private:
        UniqueFd readEnd_;
        UniqueFd writeEnd_;
        std::thread thread_;
    };

    const test::TemporaryFolder folder_;
    const std::string real_ = std::filesystem::canonical(folder_.path()).string() + "/data";
    const PresentedPaths paths_{real_, real_, "/nowhere/Documents"};
    const std::shared_ptr<test::FakeProvider> provider_ = std::make_shared<test::FakeProvider>();
    HostEnvironment environment_;
    HostOptions options_;
    SignalDispatcher signals_;
    test::FakeSearch search_;
    std::string status_ = R"({"version":"1","events":0})";
    std::string doctor_;
    const UniqueFd stop_ = *descriptor::makeInterrupt();
    std::string failure_;
};

TEST_F(CommandsTest, listsWithColumns) {
    FakeItem& folder = provider_->folder("fid=2", "Projects");
    folder.children = 3;
    folder.modified = KsDate{1'795'168'320, 0};
    FakeItem& file = document("did=3", "notes.txt");
    file.size = 1'234'567;
    file.modified = KsDate{0, 0};
    file.can = TesselItemCapabilities::allowsReading | TesselItemCapabilities::allowsWriting |
               TesselItemCapabilities::allowsReparenting | TesselItemCapabilities::allowsRenaming |
               TesselItemCapabilities::allowsTrashing | TesselItemCapabilities::allowsDeleting;
    document("fid=4", "pipe").type = "inode/fifo";
    EXPECT_EQ(run(HostCommand::ls),
              "dr-----      3 items  2026-11-20 09:52  Projects\n"
              "-rwmntd       1.2 MB  1970-01-01 00:00  notes.txt\n"
              "fr-----                                 pipe\n");
    EXPECT_EQ(failure_, "");
}

TEST_F(CommandsTest, listsPageAfterPage) {
    provider_->folder("fid=2", "many");
    provider_->documents(100, "fid=2");
    const std::string text = run(HostCommand::ls, "fid=2");
    EXPECT_EQ(std::ranges::count(text, '\n'), 100);
}

TEST_F(CommandsTest, listsADocumentAsItself) {
    document("did=3", "notes.txt");
    EXPECT_THAT(run(HostCommand::ls, "did=3"), HasSubstr("  notes.txt\n"));
}

TEST_F(CommandsTest, listsAsJson) {
    document("did=3", "a\nb\xFF");
    document("did=4", "c");
    options_.json = true;
    const auto lines = jsonLines(run(HostCommand::ls));
    ASSERT_EQ(lines.size(), 2U);
    EXPECT_EQ(lines[0]["filename"], "a\nb\xEF\xBF\xBD");
    EXPECT_EQ(lines[0]["fileURL"], "file://" + real_ + "/a%0Ab%FF");
    EXPECT_EQ(lines[1]["identifier"], "did=4");
}

TEST_F(CommandsTest, escapesNames) {
    document("did=3", "a\nb\x1B[31m\xFF");
    EXPECT_THAT(run(HostCommand::ls), HasSubstr("  a\\x0Ab\\x1B[31m\\xFF\n"));
    EXPECT_THAT(run(HostCommand::tree), HasSubstr("└── a\\x0Ab\\x1B[31m\\xFF\n"));
    EXPECT_THAT(run(HostCommand::info, "did=3"), HasSubstr("a\\x0Ab\\x1B[31m\\xFF\n"));
}

TEST_F(CommandsTest, colorsOnlyWhereItIsWanted) {
    provider_->folder("fid=2", "Projects");
    EXPECT_EQ(run(HostCommand::ls).find('\x1B'), std::string::npos);
    environment_.wantsColor = true;
    EXPECT_THAT(run(HostCommand::ls), HasSubstr("\x1B[1;34mProjects\x1B[0m\n"));
    EXPECT_THAT(run(HostCommand::tree), HasSubstr("\x1B[1;34mProjects\x1B[0m\n"));
    options_.json = true;
    EXPECT_EQ(run(HostCommand::ls).find('\x1B'), std::string::npos);
}

TEST_F(CommandsTest, drawsATree) {
    provider_->folder("fid=2", "a");
    document("did=3", "one.txt", "fid=2");
    provider_->folder("fid=4", "b", "fid=2");
    document("did=5", "deep.txt", "fid=4");
    provider_->folder("fid=6", "empty", "fid=2");
    document("did=7", "two.txt", "fid=2");
    provider_->folder("fid=8", "z");
    document("did=9", "last.txt", "fid=8");
    document("fid=10", "link").type = "inode/symlink";
    EXPECT_EQ(run(HostCommand::tree), real_ +
                                          "\n"
                                          "├── a\n"
                                          "│   ├── one.txt\n"
                                          "│   ├── b\n"
                                          "│   │   └── deep.txt\n"
                                          "│   ├── empty\n"
                                          "│   └── two.txt\n"
                                          "├── z\n"
                                          "│   └── last.txt\n"
                                          "└── link\n"
                                          "\n"
                                          "4 folders, 4 documents, 1 other item\n");
}

TEST_F(CommandsTest, drawsATreeOfTheNamedFolder) {
    provider_->folder("fid=2", "a");
    document("did=3", "one.txt", "fid=2");
    EXPECT_EQ(run(HostCommand::tree, "fid=2"), "a\n└── one.txt\n\n0 folders, 1 document\n");
    EXPECT_THAT(run(HostCommand::tree, "did=3"), HasSubstr("  one.txt\n"));
}

TEST_F(CommandsTest, drawsATreeOfNothing) {
    EXPECT_EQ(run(HostCommand::tree), real_ + "\n\n0 folders, 0 documents\n");
}

TEST_F(CommandsTest, looksIntoPackagesWhenAsked) {
    document("did=2", "report.folio").type = "com.vemra.folio.document";
    document("did=3", "inside.xml", "did=2");
    EXPECT_EQ(run(HostCommand::tree), real_ + "\n└── report.folio\n\n0 folders, 1 document\n");
    options_.intoPackages = true;
    EXPECT_EQ(run(HostCommand::tree), real_ + "\n└── report.folio\n    └── inside.xml\n\n0 folders, 2 documents\n");
}

TEST_F(CommandsTest, marksFoldersThatCannotBeReadAndGoesOn) {
    provider_->folder("fid=2", "closed");
    document("did=3", "after.txt");
    provider_->listingErrors.emplace("fid=2", KsError::posix(EACCES));
    EXPECT_EQ(run(HostCommand::tree), real_ +
                                          "\n├── closed  [Permission denied]\n"
                                          "└── after.txt\n\n1 folder, 1 document\n");
    EXPECT_EQ(failure_, "1 folder could not be read, the first of them closed: Permission denied");
}

TEST_F(CommandsTest, doesNotFollowAFolderIntoItself) {
    provider_->folder("fid=2", "a");
    provider_->folder("fid=3", "b", "fid=2");
    // As where a folder is mounted below itself: the same object at two places.
    provider_->folder("fid=2", "a again", "fid=3");
    EXPECT_THAT(run(HostCommand::tree), HasSubstr("a again\n\n3 folders, 0 documents\n"));
}

TEST_F(CommandsTest, drawsATreeThatIsVeryDeep) {
    constexpr int kDepth = 2'000;
    std::string parent = kTesselRootContainerItemIdentifier;
    for (int i = 0; i < kDepth; ++i) {
        const std::string identifier = fmt::format("fid={}", i + 10);
        provider_->folder(identifier, "d", parent);
        parent = identifier;
    }
    EXPECT_THAT(run(HostCommand::tree), HasSubstr("\n2000 folders, 0 documents\n"));
}

TEST_F(CommandsTest, printsATreeAsJson) {
    provider_->folder("fid=2", "a");
    document("did=3", "one.txt", "fid=2");
    document("did=4", "two.txt");
    options_.json = true;
    const auto lines = jsonLines(run(HostCommand::tree));
    ASSERT_EQ(lines.size(), 3U);
    EXPECT_EQ(lines[0]["identifier"], "fid=2");
    EXPECT_EQ(lines[1]["identifier"], "did=3");
    EXPECT_EQ(lines[2]["identifier"], "did=4");
}

TEST_F(CommandsTest, showsEveryField) {
    FakeItem& item = document("did=3", "notes.txt");
    item.size = 1'234'567;
    item.modified = KsDate{1'795'168'320, 5};
    item.tagList = std::vector<std::string>{"red", "work"};
    item.rank = -7;
    item.file = 99;
    const std::string text = run(HostCommand::info, "did=3");
    EXPECT_THAT(text, StartsWith("identifier               did=3\n"));
    EXPECT_THAT(text, HasSubstr("capabilities             1 (read)\n"));
    EXPECT_THAT(text, HasSubstr("documentSize             1234567 B (1.2 MB)\n"));
    EXPECT_THAT(text, HasSubstr("contentModificationDate  2026-11-20 09:52:00 +0000\n"));
    EXPECT_THAT(text, HasSubstr("tags                     red, work\n"));
    EXPECT_THAT(text, HasSubstr("favoriteRank             -7\n"));
    EXPECT_THAT(text, HasSubstr("fileURL                  file://" + real_ + "/notes.txt\n"));
    EXPECT_EQ(text.find("creationDate"), std::string::npos);
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::info, "did=3"))[0]["favoriteRank"], -7);
}

TEST_F(CommandsTest, findsItemsByPath) {
    document("did=3", "notes.txt");
    EXPECT_EQ(run(HostCommand::id, real_ + "/notes.txt"), "did=3\n");
    EXPECT_EQ(run(HostCommand::id, "notes.txt"), "did=3\n");
    EXPECT_EQ(run(HostCommand::id, "./notes.txt"), "did=3\n");
    EXPECT_EQ(run(HostCommand::id, "../data/notes.txt"), "did=3\n");
    EXPECT_THAT(run(HostCommand::info, "notes.txt"), StartsWith("identifier               did=3\n"));
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::id, "notes.txt"))[0], (json{{"identifier", "did=3"}}));
}

// "did=1" is an identifier; the file of that name is "./did=1", and `id` takes paths only.
TEST_F(CommandsTest, tellsIdentifiersFromPaths) {
    document("did=3", "did=1");
    EXPECT_EQ(run(HostCommand::id, "did=1"), "did=3\n");
    EXPECT_EQ(run(HostCommand::url, "./did=1"), "file://" + real_ + "/did%3D1\n");
    run(HostCommand::url, "did=1");
    EXPECT_EQ(failure_, "no such item: did=1");
    for (const char* identifier : {"did=", "fid=1", "#com.example", "TesselRootContainerItemIdentifier",
                                   "TesselTemporaryLocalFolderItemIdentifier"}) {
        EXPECT_TRUE(Commands::isIdentifier(identifier)) << identifier;
    }
    for (const char* path : {"", "did", "DID=1", "./#x", "/did=1", "TesselRootContainerItemIdentifiers", "a did=1"})
        EXPECT_FALSE(Commands::isIdentifier(path)) << path;
}

TEST_F(CommandsTest, printsURLs) {
    document("did=3", "a b.txt");
    EXPECT_EQ(run(HostCommand::url, "did=3"), "file://" + real_ + "/a%20b.txt\n");
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::url, "did=3"))[0], (json{{"url", "file://" + real_ + "/a%20b.txt"}}));
}

TEST_F(CommandsTest, printsAnchors) {
    EXPECT_EQ(run(HostCommand::anchor, "fid=noanchor"), "");
    EXPECT_EQ(failure_, "there is no anchor for fid=noanchor");
    provider_->folder("fid=2", "a");
    EXPECT_EQ(run(HostCommand::anchor, "fid=2"), "ZmlkPTI=\n");
}

TEST_F(CommandsTest, printsStatus) {
    EXPECT_EQ(run(HostCommand::status), "All is well.\nversion   1\nhistory   0 events kept\n");
    EXPECT_EQ(failure_, "");
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::status))[0], (json{{"version", "1"}, {"events", 0}}));
}

TEST_F(CommandsTest, failsWhereTheStatusTellsOfAProblem) {
    status_ = R"({"version":"1","problems":[{"what":"it hurts","remedy":"don't do that"}]})";
    EXPECT_THAT(run(HostCommand::status), StartsWith("Not well: it hurts\n  To do: don't do that\n"));
    EXPECT_EQ(failure_, "one thing is not well");
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::status))[0]["version"], "1");
    EXPECT_EQ(failure_, "one thing is not well");
}

TEST_F(CommandsTest, saysWhatTheDoctorDid) {
    doctor_ = R"({"objects":7,"differences":0,"search":{"items":6}})";
    EXPECT_THAT(run(HostCommand::doctor), HasSubstr("it is whole.\n"));
    EXPECT_EQ(failure_, "");
    doctor_ = R"({"objects":7,"problems":[{"what":"it hurts","remedy":"rest"},{"what":"more","remedy":"r"}]})";
    EXPECT_THAT(run(HostCommand::doctor), HasSubstr("Not well: it hurts\n  To do: rest\n"));
    EXPECT_EQ(failure_, "2 things are not well");
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::doctor))[0]["setAside"], json::array());
    EXPECT_EQ(failure_, "2 things are not well");
}

TEST_F(CommandsTest, printsWhatIsFoundWithItsPath) {
    document("did=1", "report.txt");
    document("did=2", "other.txt");
    search_.pages = {{{*provider_->itemForIdentifier("did=1")}, Bytes{std::byte{'x'}}},
                     {{*provider_->itemForIdentifier("did=2")}, std::nullopt}};
    options_.text = "rep";
    const std::string found = run(HostCommand::find);
    EXPECT_THAT(found, HasSubstr("/report.txt\n"));
    EXPECT_THAT(found, HasSubstr("/other.txt\n"));
    EXPECT_THAT(search_.asked,
                ::testing::ElementsAre(test::FakeSearch::Asked{SearchQuery::Kind::names, "rep", "", 200},
                                       test::FakeSearch::Asked{SearchQuery::Kind::names, "rep", "x", 200}));
    search_.asked.clear();
    options_.limit = 3;
    run(HostCommand::tagged);
    EXPECT_EQ(search_.asked.at(0), (test::FakeSearch::Asked{SearchQuery::Kind::tagged, "rep", "", 3}));
    search_.error = KsError::posix(EIO);
    run(HostCommand::recents);
    EXPECT_EQ(failure_, "can't search: Input/output error");
}

TEST_F(CommandsTest, printsAllTags) {
    search_.tagCounts = {{"red", 2}, {"a\nb", 1}};
    EXPECT_EQ(run(HostCommand::allTags), "      2  red\n      1  a\\x0Ab\n");
    options_.json = true;
    EXPECT_EQ(jsonLines(run(HostCommand::allTags))[0], (json{{"tag", "red"}, {"count", 2}}));
}

TEST_F(CommandsTest, tellsOfItemsThatAreNotThere) {
    for (const HostCommand command :
         {HostCommand::ls, HostCommand::tree, HostCommand::info, HostCommand::url, HostCommand::anchor}) {
        EXPECT_EQ(run(command, "fid=999"), "");
        EXPECT_EQ(failure_, "no such item: fid=999");
        EXPECT_EQ(run(command, "none\n.txt"), "");
        EXPECT_EQ(failure_, "no such item: none\\x0A.txt");
    }
    run(HostCommand::ls, "");
    EXPECT_EQ(failure_, "no such item: the path is empty");
}

TEST_F(CommandsTest, tellsWhyAFolderCannotBeListed) {
    provider_->folder("fid=2", "closed");
    provider_->listingErrors.emplace("fid=2", KsError::posix(EACCES));
    EXPECT_EQ(run(HostCommand::ls, "fid=2"), "");
    EXPECT_EQ(failure_, "fid=2: Permission denied");
}

TEST_F(CommandsTest, stopsWhenNobodyReads) {
    provider_->folder("fid=2", "many");
    provider_->documents(5'000, "fid=2");
    int pages = 0;
    provider_->beforePage = [&](const std::string&, std::size_t) { ++pages; };
    int fds[2];
    ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
    const UniqueFd writeEnd(fds[1]);
    ::close(fds[0]);
    TextOutput output(writeEnd.get(), /*isTerminal=*/true);
    runInto(output, HostCommand::ls, "fid=2");
    EXPECT_EQ(failure_, "");
    EXPECT_EQ(output.finish(), std::nullopt);
    EXPECT_EQ(pages, 1);
}

TEST_F(CommandsTest, tellsOfOutputThatCannotBeWritten) {
    document("did=3", "notes.txt");
    const UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
    TextOutput output(full.get(), /*isTerminal=*/false);
    runInto(output, HostCommand::ls);
    EXPECT_EQ(output.finish(), KsError::posix(ENOSPC));
}

TEST_F(CommandsTest, changesPrintsAllThatIsToCome) {
    document("did=3", "a b\n.txt");
    provider_->folder("fid=2", "folder").url = KsURL::fileURL("/nowhere/Documents/folder");
    document("did=4", "folder/c.txt", "fid=2").file = 44;
    provider_->changes[kTesselRootContainerItemIdentifier] = {{{"u did=3", "d did=9"}, "second", true, std::nullopt},
                                                              {{"u fid=2", "d did=3"}, "third", false, std::nullopt}};
    options_.since = base64Encode(bytesOf("first"));
    EXPECT_EQ(run(HostCommand::changes),
              "updated  a b\\x0A.txt\ndeleted  did=9\nupdated  folder\ndeleted  a b\\x0A.txt\nanchor   " +
                  base64Encode(bytesOf("third")) + "\n");
    EXPECT_EQ(failure_, "");
    EXPECT_EQ(provider_->askedAnchors, (std::vector<std::string>{"first", "second"}));
}

TEST_F(CommandsTest, changesPrintsJSON) {
    document("did=3", "a.txt");
    provider_->changes[kTesselRootContainerItemIdentifier] = {{{"u did=3", "d did=9"}, "next", false, std::nullopt}};
    options_.since = base64Encode(bytesOf("first"));
    options_.json = true;
    const auto lines = jsonLines(run(HostCommand::changes));
    ASSERT_EQ(lines.size(), 3U);
    EXPECT_EQ(lines[0]["updated"]["identifier"], "did=3");
    EXPECT_EQ(lines[1], (json{{"deleted", "did=9"}}));
    EXPECT_EQ(lines[2], (json{{"anchor", base64Encode(bytesOf("next"))}}));
}

TEST_F(CommandsTest, changesTellsWhatIsWrongWithAnAnchor) {
    options_.since = base64Encode(bytesOf("first"));
    EXPECT_EQ(run(HostCommand::changes), "");
    EXPECT_EQ(failure_, real_ + ": the anchor has expired; list again, and take a new one");
    options_.since = "!";
    EXPECT_EQ(run(HostCommand::changes), "");
    EXPECT_EQ(failure_, "the anchor is not base64");
    options_.since = base64Encode(bytesOf("first"));
    document("did=3", "a.txt");
    run(HostCommand::changes, "did=3");
    EXPECT_EQ(failure_, "did=3 is not a folder");
}

TEST_F(CommandsTest, watchPrintsWhatChangesUntilItIsStopped) {
    document("did=3", "a.txt").document = 3;
    provider_->folder("fid=2", "folder").url = KsURL::fileURL("/nowhere/Documents/folder");
    provider_->document("did=3", "a.txt", "fid=2").url = KsURL::fileURL("/nowhere/Documents/folder/a.txt");
    provider_->changes["fid=2"] = {{{"u did=3"}, "second", true, std::nullopt},
                                   {{}, "third", false, std::nullopt},
                                   {{}, "", false, tesselErrorForExpiredPage()},
                                   {{"d did=3"}, "fourth", false, std::nullopt}};
    {
        Running watch(*this, HostCommand::watch, "fid=2");
        EXPECT_EQ(watch.line(), "updated  folder/a.txt");
        signals_.signalEnumerator("fid=3", {});
        signals_.signalEnumerator("fid=2", {});
        EXPECT_EQ(watch.line(), "unknown  anything may have changed");
        signals_.signalEnumerator("fid=2", {});
        EXPECT_EQ(watch.line(), "deleted  folder/a.txt");
        descriptor::interrupt(stop_);
        EXPECT_EQ(watch.line(), "") << "the end";
    }
    EXPECT_EQ(failure_, "");
    EXPECT_EQ(provider_->askedAnchors, (std::vector<std::string>{"fid=2", "second", "third", "fid=2"}));
}

TEST_F(CommandsTest, watchEndsWhenNobodyReads) {
    document("did=3", "a.txt");
    provider_->changes[kTesselRootContainerItemIdentifier] = {{{"u did=3"}, "next", false, std::nullopt}};
    Running watch(*this, HostCommand::watch, std::nullopt);
    EXPECT_EQ(watch.line(), "updated  a.txt");
    watch.stopReading();
}

TEST_F(CommandsTest, watchNeedsAFolder) {
    document("did=3", "a.txt");
    EXPECT_EQ(run(HostCommand::watch, "did=3"), "");
    EXPECT_EQ(failure_, "did=3 is not a folder");
    EXPECT_EQ(run(HostCommand::watch, "fid=99"), "");
    EXPECT_EQ(failure_, "no such item: fid=99");
}

}  // namespace
}  // namespace cindral
