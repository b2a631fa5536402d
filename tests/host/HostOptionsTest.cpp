#include "host/HostOptions.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>

namespace cindral {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;

HostEnvironment environment() {
    HostEnvironment environment;
    environment.home = "/nowhere/u";
    environment.configHome = "/nowhere/u/.config";
    environment.stateHome = "/nowhere/u/.local/state";
    environment.workingFolder = "/desk";
    return environment;
}

std::variant<HostOptions, HostReply> parse(const std::vector<std::string>& words) {
    return parseHostOptions(words, environment());
}

HostOptions options(const std::vector<std::string>& words) {
    auto parsed = parse(words);
    if (const auto* reply = std::get_if<HostReply>(&parsed)) {
        ADD_FAILURE() << reply->text;
        return {};
    }
    return std::get<HostOptions>(parsed);
}

HostReply reply(const std::vector<std::string>& words) {
    auto parsed = parse(words);
    if (std::holds_alternative<HostOptions>(parsed)) {
        ADD_FAILURE() << "the words were taken";
        return {};
    }
    return std::get<HostReply>(parsed);
}

void expectUsageFailure(const std::vector<std::string>& words) {
    const HostReply refused = reply(words);
    EXPECT_EQ(refused.exitStatus, 2) << ::testing::PrintToString(words);
    EXPECT_THAT(refused.text, StartsWith("cindral: "));
    EXPECT_EQ(std::ranges::count(refused.text, '\n'), 1) << refused.text;
}

TEST(HostOptions, letBrowsersInOnlyWhenAskedTo) {
    EXPECT_EQ(options({"serve"}).httpPort, std::nullopt);
    EXPECT_EQ(options({"serve", "--http"}).httpPort, 0);
    EXPECT_EQ(options({"serve", "--http-port", "8080"}).httpPort, 8080);
    EXPECT_EQ(options({"serve", "--http-upload-max", "5"}).uploadBytesMax, 5U);
    expectUsageFailure({"serve", "--http-port", "65536"});
    expectUsageFailure({"serve", "--http-port", "-1"});
    expectUsageFailure({"tree", "--http"});
}

TEST(HostOptions, haveDefaults) {
    const HostOptions plain = options({"tree"});
    EXPECT_EQ(plain.command, HostCommand::tree);
    EXPECT_EQ(plain.item, std::nullopt);
    EXPECT_EQ(plain.storage, "/nowhere/u/Documents");
    EXPECT_EQ(plain.state, "/nowhere/u/.local/state/cindral");
    EXPECT_TRUE(plain.applications.empty());
    EXPECT_TRUE(plain.flatpak);
    EXPECT_EQ(plain.recorder, RecorderChoice::automatic);
    EXPECT_FALSE(plain.json);
    EXPECT_FALSE(plain.intoPackages);
}

TEST(HostOptions, standBeforeOrAfterTheCommand) {
    for (const std::vector<std::string>& words : {
             std::vector<std::string>{"--storage", "/s", "--state=/t", "--json", "--no-flatpak", "--recorder",
                                      "inotify", "ls", "did=1"},
             std::vector<std::string>{"ls", "--storage", "/s", "--state=/t", "--json", "--no-flatpak", "--recorder",
                                      "inotify", "did=1"},
             std::vector<std::string>{"ls", "did=1", "--storage=/s", "--state", "/t", "--json", "--no-flatpak",
                                      "--recorder=inotify"},
         }) {
        const HostOptions read = options(words);
        EXPECT_EQ(read.command, HostCommand::ls);
        EXPECT_EQ(read.item, "did=1");
        EXPECT_EQ(read.storage, "/s");
        EXPECT_EQ(read.state, "/t");
        EXPECT_TRUE(read.json);
        EXPECT_FALSE(read.flatpak);
        EXPECT_EQ(read.recorder, RecorderChoice::inotify);
    }
}

TEST(HostOptions, knowEveryCommand) {
    const std::pair<std::vector<std::string>, HostCommand> commands[] = {
        {{"ls"}, HostCommand::ls},         {{"tree"}, HostCommand::tree},  {{"info", "x"}, HostCommand::info},
        {{"url", "x"}, HostCommand::url},  {{"id", "x"}, HostCommand::id}, {{"anchor"}, HostCommand::anchor},
        {{"status"}, HostCommand::status}, {{"rpc"}, HostCommand::rpc},    {{"link"}, HostCommand::link},
    };
    for (const auto& [words, command] : commands) EXPECT_EQ(options(words).command, command) << words.front();
}

TEST(HostOptions, makePathsAbsolute) {
    EXPECT_EQ(options({"ls", "--storage", "docs/"}).storage, "/desk/docs");
    EXPECT_EQ(options({"ls", "--state", "./a//b"}).state, "/desk/a/b");
    EXPECT_THAT(options({"ls", "--apps", "one", "--apps", "/two"}).applications, ElementsAre("/desk/one", "/two"));
}

// What an item is called is nobody's option, command or list.
TEST(HostOptions, takeAnyItem) {
    for (const char* item : {"tree", "ls", "a b", "[x,y]", "{1}", "a,b", "#com.example.notes", "did=1", "did=", "a=b",
                             "--", "\xFF", "a\nb"}) {
        if (std::string_view(item) == "--") continue;
        EXPECT_EQ(options({"info", item}).item, item);
    }
    EXPECT_EQ(options({"info", "--", "--json"}).item, "--json");
    EXPECT_EQ(options({"info", "--", "-x"}).item, "-x");
    EXPECT_EQ(options({"info", "--json", "--", "tree"}).item, "tree");
    EXPECT_EQ(options({"ls", ""}).item, "");
}

TEST(HostOptions, showPackagesInATreeOnly) {
    EXPECT_TRUE(options({"tree", "--packages"}).intoPackages);
    expectUsageFailure({"ls", "--packages"});
}

TEST(HostOptions, refuseWordsThatAreOff) {
    expectUsageFailure({});
    expectUsageFailure({"frobnicate"});
    expectUsageFailure({"--json"});
    expectUsageFailure({"ls", "--frobnicate"});
    expectUsageFailure({"ls", "one", "two"});
    expectUsageFailure({"info"});
    expectUsageFailure({"url"});
    expectUsageFailure({"id"});
    expectUsageFailure({"status", "x"});
    expectUsageFailure({"rpc", "x"});
    expectUsageFailure({"link", "x"});
    expectUsageFailure({"ls", "--storage"});
    expectUsageFailure({"ls", "--storage", ""});
    expectUsageFailure({"ls", "--state="});
    expectUsageFailure({"ls", "--apps", ""});
    expectUsageFailure({"ls", "--recorder", "magic"});
    expectUsageFailure({"ls", "--recorder", "INOTIFY"});
    expectUsageFailure({"--storage", "/a", "--storage", "/b", "ls"});
    expectUsageFailure({"frob\nnicate\x1B[2J"});
}

TEST(HostOptions, sayWhichWordIsNoCommand) {
    EXPECT_EQ(reply({}).text, "cindral: a command is missing; cindral --help says which there are\n");
    EXPECT_EQ(reply({"frob\nnicate"}).text,
              "cindral: there is no command \"frob\\x0Anicate\"; cindral --help says which there are\n");
    EXPECT_EQ(reply({"--frob", "ls"}).text, "cindral: The following argument was not expected: --frob\n");
}

TEST(HostOptions, sayTheirVersionInOneLine) {
    const HostReply version = reply({"--version"});
    EXPECT_EQ(version.exitStatus, 0);
    EXPECT_THAT(version.text, ::testing::MatchesRegex("cindral [0-9]+\\.[0-9]+\\.[0-9]+\n"));
}

TEST(HostOptions, helpThemselves) {
    const HostReply help = reply({"--help"});
    EXPECT_EQ(help.exitStatus, 0);
    for (const char* word : {"--storage", "--state", "--apps", "--no-flatpak", "--recorder", "--json", "ls", "tree",
                             "info", "url", "id", "anchor", "status", "rpc"}) {
        EXPECT_THAT(help.text, HasSubstr(word));
    }
    for (const char* command : {"ls", "tree", "info", "url", "id", "anchor", "status", "rpc"}) {
        const HostReply ofCommand = reply({command, "--help"});
        EXPECT_EQ(ofCommand.exitStatus, 0) << command;
        EXPECT_THAT(ofCommand.text, HasSubstr(std::string("Usage: cindral ") + command));
    }
    EXPECT_THAT(reply({"tree", "--help"}).text, HasSubstr("--packages"));
}

TEST(HostOptions, sayNothingOfFoldersWhereThereIsNoHome) {
    HostEnvironment homeless;
    homeless.workingFolder = "/desk";
    const auto parsed = parseHostOptions(std::vector<std::string>{"ls"}, homeless);
    EXPECT_EQ(std::get<HostOptions>(parsed).storage, "");
    EXPECT_EQ(std::get<HostOptions>(parsed).state, "");
}

TEST(HostOptions, changesNeedsAnAnchor) {
    const auto missing = parseHostOptions(std::vector<std::string>{"changes"}, HostEnvironment{});
    ASSERT_TRUE(std::holds_alternative<HostReply>(missing));
    EXPECT_EQ(std::get<HostReply>(missing).exitStatus, 2);
    const auto given =
        parseHostOptions(std::vector<std::string>{"changes", "fid=2", "--since", "MA=="}, HostEnvironment{});
    ASSERT_TRUE(std::holds_alternative<HostOptions>(given));
    EXPECT_EQ(std::get<HostOptions>(given).command, HostCommand::changes);
    EXPECT_EQ(std::get<HostOptions>(given).since, "MA==");
    EXPECT_EQ(std::get<HostOptions>(given).item, "fid=2");
}

TEST(EditOptions, nameTheirItemsInOrder) {
    const HostOptions moved = options({"mv", "a", "did=1", "--keep-both", "folder", "--json"});
    EXPECT_EQ(moved.command, HostCommand::edit);
    EXPECT_EQ(moved.edit.command, EditCommand::mv);
    EXPECT_THAT(moved.edit.words, ElementsAre("a", "did=1", "folder"));
    EXPECT_TRUE(moved.edit.keepsBoth);
    EXPECT_TRUE(moved.json);
    EXPECT_THAT(options({"rm", "--yes", "--", "-rf", "--yes"}).edit.words, ElementsAre("-rf", "--yes"));
    EXPECT_EQ(options({"import", "a", "--to", "#com.example"}).edit.folder, "#com.example");
    EXPECT_EQ(options({"mkdir", "a", "--in", "fid=2"}).edit.folder, "fid=2");
    EXPECT_EQ(options({"favorite", "a", "--rank", "-3"}).edit.rank, -3);
    EXPECT_EQ(options({"empty-trash", "--older-than", "30d"}).edit.olderThan, "30d");
    EXPECT_TRUE(options({"touch-used", "a", "--clear"}).edit.isCleared);
}

TEST(EditOptions, areCheckedForTheirNumber) {
    for (const auto& words : std::vector<std::vector<std::string>>{{"import"},
                                                                   {"mkdir"},
                                                                   {"rename", "a"},
                                                                   {"rename", "a", "b", "c"},
                                                                   {"mv", "a"},
                                                                   {"rm"},
                                                                   {"restore"},
                                                                   {"empty-trash", "a"},
                                                                   {"tag", "a"},
                                                                   {"untag", "a"},
                                                                   {"favorite"},
                                                                   {"unfavorite"},
                                                                   {"touch-used"},
                                                                   {"favorite", "a", "--rank", "x"},
                                                                   {"favorite", "a", "--rank", "9223372036854775808"},
                                                                   {"empty-trash", "--older-than", "soon"},
                                                                   {"touch-used", "a", "--date", "2026-13-01"},
                                                                   {"trash", "a", "--yes"}}) {
        expectUsageFailure(words);
    }
}

TEST(EditOptions, everyCommandIsKnownByItsName) {
    const std::map<std::string, EditCommand> commands{{"import", EditCommand::importFiles},
                                                      {"mkdir", EditCommand::mkdir},
                                                      {"rename", EditCommand::rename},
                                                      {"mv", EditCommand::mv},
                                                      {"rm", EditCommand::rm},
                                                      {"trash", EditCommand::trash},
                                                      {"restore", EditCommand::restore},
                                                      {"empty-trash", EditCommand::emptyTrash},
                                                      {"tag", EditCommand::tag},
                                                      {"untag", EditCommand::untag},
                                                      {"tags", EditCommand::tags},
                                                      {"favorite", EditCommand::favorite},
                                                      {"unfavorite", EditCommand::unfavorite},
                                                      {"touch-used", EditCommand::touchUsed}};
    for (const auto& [name, command] : commands) {
        EXPECT_EQ(editCommandNamed(name), command) << name;
        EXPECT_EQ(reply({name, "--help"}).exitStatus, 0) << name;
    }
    EXPECT_EQ(editCommandNamed("ls"), std::nullopt);
}

TEST(MomentOf, isAnAgeADayOrADate) {
    const KsDate now{1'000'000'000, 5};
    EXPECT_EQ(momentOf("0s", now), now);
    EXPECT_EQ(momentOf("90s", now), (KsDate{999'999'910, 5}));
    EXPECT_EQ(momentOf("2m", now), (KsDate{999'999'880, 5}));
    EXPECT_EQ(momentOf("1h", now), (KsDate{999'996'400, 5}));
    EXPECT_EQ(momentOf("30d", now), (KsDate{997'408'000, 5}));
    EXPECT_EQ(momentOf("2w", now), (KsDate{998'790'400, 5}));
    EXPECT_EQ(momentOf("2001-09-09", now), (KsDate{999'993'600, 0}));
    EXPECT_EQ(momentOf("2001-09-09T01:46:40.5+00:00", now), (KsDate{1'000'000'000, 500'000'000}));
    for (const char* text :
         {"", "d", "30", "30y", "-1d", "1.5d", "30 d", "999999999999999999w", "99999999999999999999s", "yesterday"})
        EXPECT_EQ(momentOf(text, now), std::nullopt) << text;
}

TEST(RosterSources, followTheWords) {
    HostEnvironment surroundings = environment();
    surroundings.roster.flatpakUser = "/u";
    surroundings.roster.flatpakSystem = "/s";
    surroundings.roster.flatpakConfig = "/c";
    surroundings.roster.choicesFile = "/choices";
    const RosterSources all =
        rosterSources(options({"ls", "--apps", "one", "--apps", "/two", "--storage", "/docs"}), surroundings);
    EXPECT_THAT(all.entryFolders, ElementsAre("/desk/one", "/two"));
    EXPECT_EQ(all.storage, "/docs");
    EXPECT_EQ(all.flatpakUser + all.flatpakSystem + all.flatpakConfig + all.choicesFile, "/u/s/c/choices");
    const RosterSources none = rosterSources(options({"ls", "--no-flatpak"}), surroundings);
    EXPECT_EQ(none.flatpakUser + none.flatpakSystem + none.flatpakConfig, "");
    EXPECT_EQ(none.choicesFile, "/choices");
    EXPECT_THAT(none.entryFolders, ElementsAre());
}

}  // namespace
}  // namespace cindral
