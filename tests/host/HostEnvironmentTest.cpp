#include "host/HostEnvironment.h"

#include <gtest/gtest.h>

#include <map>

#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using Variables = std::map<std::string, std::string>;

HostEnvironment environment(const Variables& variables, bool outputIsTerminal = true) {
    const auto lookup = [&](const char* name) -> std::optional<std::string> {
        const auto found = variables.find(name);
        return found != variables.end() ? std::optional(found->second) : std::nullopt;
    };
    return HostEnvironment::from(lookup, "/account", "/desk", outputIsTerminal);
}

std::optional<std::string> chosen(std::string_view text) {
    return documentsFolderFrom(text, "/home/u");
}

TEST(HostEnvironment, saysWhereApplicationsAre) {
    const RosterSources account = environment({}).roster;
    EXPECT_EQ(account.flatpakUser, "/account/.local/share/flatpak");
    EXPECT_EQ(account.flatpakSystem, "/var/lib/flatpak");
    EXPECT_EQ(account.flatpakConfig, "/etc/flatpak");
    EXPECT_EQ(account.applicationData, "/account/.var/app");
    EXPECT_EQ(account.choicesFile, "/account/.config/cindral/applications.conf");
    const RosterSources set = environment({{"HOME", "/home/u"},
                                           {"XDG_CONFIG_HOME", "/conf"},
                                           {"FLATPAK_USER_DIR", "/fu"},
                                           {"FLATPAK_SYSTEM_DIR", "/fs"},
                                           {"FLATPAK_CONFIG_DIR", "relative"},
                                           {"LANG", "de_AT.UTF-8"}})
                                  .roster;
    EXPECT_EQ(set.flatpakUser + set.flatpakSystem, "/fu/fs");
    EXPECT_EQ(set.flatpakConfig, "/etc/flatpak");
    EXPECT_EQ(set.choicesFile, "/conf/cindral/applications.conf");
    EXPECT_EQ(set.localeNames, (std::vector<std::string>{"de_AT", "de"}));
}

TEST(HostEnvironment, takesTheFoldersOfTheConventionWhereNothingIsSaid) {
    const HostEnvironment plain = environment({{"HOME", "/home/u"}});
    EXPECT_EQ(plain.configHome, "/home/u/.config");
    EXPECT_EQ(plain.stateHome, "/home/u/.local/state");
    EXPECT_EQ(plain.runtimeFolder, "");
}

TEST(HostEnvironment, takesWhatIsSaid) {
    const HostEnvironment said = environment({{"HOME", "/home/u"},
                                              {"XDG_CONFIG_HOME", "/c"},
                                              {"XDG_STATE_HOME", "/s/"},
                                              {"XDG_RUNTIME_DIR", "/run/user/1"}});
    EXPECT_EQ(said.configHome, "/c");
    EXPECT_EQ(said.stateHome, "/s");
    EXPECT_EQ(said.runtimeFolder, "/run/user/1");
}

TEST(HostEnvironment, ignoresRelativeValues) {
    const HostEnvironment relative = environment(
        {{"HOME", "/home/u"}, {"XDG_CONFIG_HOME", "c"}, {"XDG_STATE_HOME", "./s"}, {"XDG_RUNTIME_DIR", ""}});
    EXPECT_EQ(relative.configHome, "/home/u/.config");
    EXPECT_EQ(relative.stateHome, "/home/u/.local/state");
    EXPECT_EQ(relative.runtimeFolder, "");
}

TEST(HostEnvironment, takesTheAccountsHomeWhereTheVariableIsMissingOrRelative) {
    EXPECT_EQ(environment({}).home, "/account");
    EXPECT_EQ(environment({{"HOME", "u"}}).home, "/account");
}

TEST(HostEnvironment, wantsColorOnATerminalThatCan) {
    EXPECT_TRUE(environment({{"TERM", "xterm"}}).wantsColor);
    EXPECT_FALSE(environment({{"TERM", "xterm"}}, /*outputIsTerminal=*/false).wantsColor);
    EXPECT_FALSE(environment({{"TERM", "dumb"}}).wantsColor);
    EXPECT_FALSE(environment({}).wantsColor);
}

TEST(HostEnvironment, wantsNoColorWhereNobodyWantsIt) {
    EXPECT_FALSE(environment({{"TERM", "xterm"}, {"NO_COLOR", "1"}}).wantsColor);
    EXPECT_FALSE(environment({{"TERM", "xterm"}, {"NO_COLOR", "0"}}).wantsColor);
    EXPECT_TRUE(environment({{"TERM", "xterm"}, {"NO_COLOR", ""}}).wantsColor);
}

TEST(DocumentsFolder, isReadFromTheUserDirectories) {
    EXPECT_EQ(chosen("XDG_DOCUMENTS_DIR=\"$HOME/Dokumente\"\n"), "/home/u/Dokumente");
    EXPECT_EQ(chosen("XDG_DOCUMENTS_DIR=\"/data/docs/\""), "/data/docs");
    EXPECT_EQ(chosen("# comment\nXDG_MUSIC_DIR=\"$HOME/M\"\n  XDG_DOCUMENTS_DIR = \"$HOME/My \\\"Docs\\\"\"\n"),
              "/home/u/My \"Docs\"");
}

TEST(DocumentsFolder, isTheLastOfSeveral) {
    EXPECT_EQ(chosen("XDG_DOCUMENTS_DIR=\"/a\"\nXDG_DOCUMENTS_DIR=\"/b\"\n"), "/b");
}

TEST(DocumentsFolder, isNotWhatWouldHaveToBeExpandedOrRun) {
    for (const char* line :
         {"XDG_DOCUMENTS_DIR=\"docs\"", "XDG_DOCUMENTS_DIR=\"$HOMEdocs\"", "XDG_DOCUMENTS_DIR=\"$(rm -rf /)\"",
          "XDG_DOCUMENTS_DIR=\"$OTHER/docs\"", "XDG_DOCUMENTS_DIR=/docs", "XDG_DOCUMENTS_DIR=\"/docs",
          "XDG_DOCUMENTS_DIR=\"\\", "#XDG_DOCUMENTS_DIR=\"/docs\"", "XDG_DOCUMENTS_DIRS=\"/docs\"",
          "XDG_DOCUMENTS_DIR=\"\"", ""}) {
        EXPECT_EQ(chosen(line), std::nullopt) << line;
    }
}

// The convention's way to say that there is no such folder.
TEST(DocumentsFolder, isNotTheHomeFolderItself) {
    EXPECT_EQ(chosen("XDG_DOCUMENTS_DIR=\"$HOME\""), std::nullopt);
    EXPECT_EQ(chosen("XDG_DOCUMENTS_DIR=\"$HOME/\""), std::nullopt);
    EXPECT_EQ(chosen("XDG_DOCUMENTS_DIR=\"/home/u/\""), std::nullopt);
}

TEST(DocumentsFolder, fallsBackToDocumentsInTheHomeFolder) {
    const test::TemporaryFolder folder;
    EXPECT_EQ(documentsFolder(environment({{"HOME", folder.path()}})), folder / "Documents");
    folder.file(".config/user-dirs.dirs", "XDG_DOCUMENTS_DIR=\"$HOME/Papers\"\n");
    EXPECT_EQ(documentsFolder(environment({{"HOME", folder.path()}})), folder / "Papers");
    EXPECT_EQ(documentsFolder(environment({{"HOME", folder.path()}, {"XDG_CONFIG_HOME", folder / "other"}})),
              folder / "Documents");
    // A folder in the file's place.
    folder.folder("odd/user-dirs.dirs");
    EXPECT_EQ(documentsFolder(environment({{"HOME", folder.path()}, {"XDG_CONFIG_HOME", folder / "odd"}})),
              folder / "Documents");
}

}  // namespace
}  // namespace cindral
