#include "platform/roster/RosterScanner.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/roster/RosterFixture.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;

class RosterScannerTest : public RosterSourcesTest {
protected:
    std::vector<InstalledApplication> look(const std::set<std::string>& beingWritten = {}) {
        if (!scanner_) scanner_.emplace(sources_);
        return scanner_->scan(beingWritten).applications;
    }
    std::vector<std::string> identifiers() {
        std::vector<std::string> identifiers;
        for (const auto& each : look()) identifiers.push_back(each.record->bundleIdentifier());
        return identifiers;
    }
    InstalledApplication only() {
        const auto all = look();
        EXPECT_EQ(all.size(), 1U);
        return all.at(0);
    }
    static bool has(const InstalledApplication& application, const char* key) {
        const auto info = application.record->objectsForInfoDictionaryKeys({key});
        return info && info->contains(key) && info->at(key) == PropertyList(true);
    }

    std::optional<RosterScanner> scanner_;
};

using Names = std::vector<std::string>;

TEST_F(RosterScannerTest, nothingIsInstalledWhereNothingIs) {
    EXPECT_EQ(identifiers(), Names());
}

TEST_F(RosterScannerTest, readsAFlatpakApplicationOfThePerson) {
    user_.install("org.example.Writer",
                  FlatpakTree::named("org.example.Writer", "Writer", "X-Cindral-SupportsDocumentBrowser=true\n"));
    const std::string container = makeContainer("org.example.Writer");
    const auto application = only();
    EXPECT_EQ(application.type, 0U);
    EXPECT_EQ(application.record->bundleIdentifier(), "org.example.Writer");
    EXPECT_EQ(application.record->appLibraryIdentifier(), "#org.example.Writer");
    EXPECT_EQ(application.record->localizedName(), "Writer");
    EXPECT_EQ(application.record->dataContainerURL(), KsURL::fileURL(container));
    EXPECT_EQ(application.container, container);
    EXPECT_EQ(application.whyNoContainer, "");
    EXPECT_TRUE(has(application, kSupportsDocumentBrowserKey));
    EXPECT_FALSE(has(application, kSupportsOpenInPlaceKey));
}

TEST_F(RosterScannerTest, applicationsForEverybodyAreOfTheOtherType) {
    system_.install("org.example.Writer", FlatpakTree::named("org.example.Writer", "Writer"));
    installEntry("org.example.Entry", entry("Entry"));
    EXPECT_EQ(identifiers(), (Names{"org.example.Writer", "org.example.Entry"}));
    for (const auto& each : look()) EXPECT_EQ(each.type, 2U);
}

TEST_F(RosterScannerTest, theOrderIsTypeThenSourceThenName) {
    installEntry("b", entry("B"));
    installEntry("a", entry("A"));
    system_.install("d", FlatpakTree::named("d", "D"));
    user_.install("z", FlatpakTree::named("z", "Z"));
    user_.install("y", FlatpakTree::named("y", "Y"));
    EXPECT_EQ(identifiers(), (Names{"y", "z", "d", "a", "b"}));
}

TEST_F(RosterScannerTest, theFirstOfAnIdentifierCounts) {
    user_.install("a", FlatpakTree::named("a", "The person's"));
    system_.install("a", FlatpakTree::named("a", "Everybody's"));
    installEntry("a", entry("The entry's"));
    EXPECT_EQ(only().record->localizedName(), "The person's");
}

TEST_F(RosterScannerTest, configuredInstallationsAreReadByPriority) {
    const FlatpakTree low(folder_ / "low");
    const FlatpakTree high(folder_ / "high");
    low.install("a", FlatpakTree::named("a", "Low"));
    high.install("a", FlatpakTree::named("a", "High"));
    low.install("b", FlatpakTree::named("b", "B"));
    folder_.file("etc/installations.d/one.conf", "[Installation \"low\"]\nPath=" + low.path() + "/\nPriority=-1\n");
    folder_.file("etc/installations.d/two.conf", "[Installation \"high\"]\nPath=" + high.path() + "\nPriority=5\n");
    folder_.file("etc/installations.d/three.txt", "[Installation \"no\"]\nPath=" + user_.path() + "\n");
    folder_.file("etc/installations.d/bad.conf", "[Installation \"relative\"]\nPath=x\n[Installation \"\"]\nPath=/\n");
    EXPECT_EQ(identifiers(), (Names{"a", "b"}));
    EXPECT_EQ(look().front().record->localizedName(), "High");
    EXPECT_EQ(look().front().source, "Flatpak, installation high");
}

TEST_F(RosterScannerTest, flatpaksKeysMayStandInItsMetadata) {
    auto deployment = FlatpakTree::named("a", "A");
    deployment.metadata =
        "[Application]\nname=a\nX-Cindral-SupportsOpenInPlace=true\nX-Cindral-FileSharingEnabled=true\n";
    user_.install("a", deployment);
    EXPECT_TRUE(has(only(), kSupportsOpenInPlaceKey));
    EXPECT_TRUE(has(only(), kFileSharingEnabledKey));
    EXPECT_TRUE(only().record->supportsOpenInPlace());
    EXPECT_TRUE(only().record->fileSharingEnabled());
}

TEST_F(RosterScannerTest, theEntrySaysMoreThanTheMetadata) {
    auto deployment = FlatpakTree::named("a", "A", "X-Cindral-SupportsOpenInPlace=false\n");
    deployment.metadata = "[Application]\nname=a\nX-Cindral-SupportsOpenInPlace=true\n";
    user_.install("a", deployment);
    EXPECT_FALSE(has(only(), kSupportsOpenInPlaceKey));
}

TEST_F(RosterScannerTest, aFlatpakWithoutAnEntryBearsItsIdentifier) {
    auto deployment = FlatpakTree::named("org.example.Tool", "");
    deployment.entry.clear();
    user_.install("org.example.Tool", deployment);
    EXPECT_EQ(only().record->localizedName(), "org.example.Tool");
    EXPECT_TRUE(only().record->objectsForInfoDictionaryKeys({kSupportsDocumentBrowserKey}));
}

TEST_F(RosterScannerTest, aFlatpakWithoutAnythingToReadHasNoInfoDictionary) {
    user_.install("a", FlatpakTree::Deployment{});
    EXPECT_FALSE(only().record->objectsForInfoDictionaryKeys({kSupportsDocumentBrowserKey}));
    EXPECT_FALSE(only().record->supportsOpenInPlace());
}

// The application's publisher may say where it likes: the container is Flatpak's to give.
TEST_F(RosterScannerTest, aFlatpakDoesNotChooseItsContainer) {
    const std::string elsewhere = folder_.folder("elsewhere/Documents");
    user_.install("a", FlatpakTree::named("a", "A", "X-Cindral-DataContainer=" + (folder_ / "elsewhere") + "\n"));
    EXPECT_EQ(only().container, folder_ / "home/.var/app/a");
    EXPECT_EQ(only().record->dataContainerURL(), std::nullopt);
}

TEST_F(RosterScannerTest, anUpdateIsSeenWithTheNextLook) {
    auto deployment = FlatpakTree::named("a", "Before");
    user_.install("a", deployment);
    EXPECT_EQ(only().record->localizedName(), "Before");
    deployment = FlatpakTree::named("a", "After");
    deployment.commit = "2c3d";
    user_.deploy("a", deployment);
    EXPECT_EQ(only().record->localizedName(), "Before");
    user_.activate("a", deployment);
    EXPECT_EQ(only().record->localizedName(), "After");
    user_.uninstall("a");
    EXPECT_EQ(identifiers(), Names());
}

TEST_F(RosterScannerTest, linksOfADeploymentLeadNowhereElse) {
    auto deployment = FlatpakTree::named("a", "A");
    const fs::path active = user_.deploy("a", deployment);
    user_.activate("a", deployment);
    const std::string outside =
        folder_.file("outside.desktop", entry("Outside", "X-Cindral-SupportsDocumentBrowser=true\n"));
    const fs::path exported = active / "export/share/applications/a.desktop";
    fs::remove(exported);
    fs::create_symlink(outside, exported);
    EXPECT_EQ(only().record->localizedName(), "a");

    fs::remove(fs::path(user_.path()) / "app/a/current");
    fs::create_symlink(folder_ / "system/app/a/current", fs::path(user_.path()) / "app/a/current");
    system_.install("a", FlatpakTree::named("a", "Elsewhere"));
    EXPECT_EQ(only().type, 2U) << "only the installation whose links stay inside has the application";
}

TEST_F(RosterScannerTest, namesFollowTheLocale) {
    sources_.localeNames = localeNames("de_AT.UTF-8");
    installEntry("a", entry("Letters", "Name[de]=Briefe\nName[fr]=Lettres\n"));
    EXPECT_EQ(only().record->localizedName(), "Briefe");
}

TEST_F(RosterScannerTest, anEntrySaysWhereItsContainerIs) {
    const std::string container = folder_ / "data of\tb";
    folder_.folder("data of\tb/Documents");
    for (const std::string& said :
         {container, container + "//", KsURL::fileURL(container).absoluteString(), std::string("~/../data\\sof\\tb")}) {
        installEntry("b", entry("B", "X-Cindral-DataContainer=" + said + "\n"));
        EXPECT_EQ(only().whyNoContainer, "") << said;
        EXPECT_TRUE(only().record->dataContainerURL()) << said;
    }
    for (const std::string said : {"", "relative", "~", "file://other.host/x", "http://x/"}) {
        installEntry("b", entry("B", "X-Cindral-DataContainer=" + said + "\n"));
        EXPECT_EQ(only().whyNoContainer, "it names no data container") << said;
        EXPECT_EQ(only().record->dataContainerURL(), std::nullopt) << said;
    }
}

TEST_F(RosterScannerTest, withoutADocumentsFolderThereIsNoContainer) {
    user_.install("a", FlatpakTree::named("a", "A"));
    EXPECT_EQ(only().whyNoContainer, "its Documents folder is missing");
    EXPECT_EQ(only().record->dataContainerURL(), std::nullopt);
    folder_.folder("home/.var/app/a");
    EXPECT_EQ(only().whyNoContainer, "its Documents folder is missing");
    makeContainer("a");
    EXPECT_EQ(only().whyNoContainer, "");
}

// The application may write to its container, and put a link to anything there.
TEST_F(RosterScannerTest, aLinkIsNoDocumentsFolder) {
    user_.install("a", FlatpakTree::named("a", "A"));
    folder_.folder("home/.var/app/a");
    fs::create_directory_symlink(folder_.folder("secret"), folder_ / "home/.var/app/a/Documents");
    EXPECT_EQ(only().whyNoContainer, "its Documents is no folder");
    fs::remove(folder_ / "home/.var/app/a/Documents");
    ASSERT_EQ(::mkfifo((folder_ / "home/.var/app/a/Documents").c_str(), 0600), 0);
    EXPECT_EQ(only().whyNoContainer, "its Documents is no folder");
}

TEST_F(RosterScannerTest, aFileHasOneParent) {
    installEntry("storage", entry("S", "X-Cindral-DataContainer=" + (folder_ / "home") + "\n"));
    EXPECT_EQ(only().whyNoContainer, "its Documents folder overlaps that of the storage");
    folder_.folder("home/Documents/inner/Documents");
    installEntry("storage", entry("S", "X-Cindral-DataContainer=" + (folder_ / "home/Documents/inner") + "\n"));
    EXPECT_EQ(only().whyNoContainer, "its Documents folder overlaps that of the storage");
    folder_.folder("one/Documents/two/Documents");
    installEntry("storage", entry("S", "X-Cindral-DataContainer=" + (folder_ / "one") + "\n"));
    installEntry("two", entry("T", "X-Cindral-DataContainer=" + (folder_ / "one/Documents/two") + "\n"));
    EXPECT_EQ(look().front().whyNoContainer, "");
    EXPECT_EQ(look().back().whyNoContainer, "its Documents folder overlaps that of storage");
    fs::create_directory_symlink(folder_ / "one", folder_ / "link");
    installEntry("two", entry("T", "X-Cindral-DataContainer=" + (folder_ / "link") + "\n"));
    EXPECT_EQ(look().back().whyNoContainer, "its Documents folder overlaps that of storage");
}

TEST_F(RosterScannerTest, anotherDeviceIsLeftOutWithOneLine) {
    struct stat here;
    struct stat other;
    ASSERT_EQ(::stat(folder_.path().c_str(), &here), 0);
    ASSERT_EQ(::stat("/proc", &other), 0);
    ASSERT_NE(here.st_dev, other.st_dev);
    sources_.storage = "/proc";
    LogCapture log;
    user_.install("a", FlatpakTree::named("a", "A"));
    makeContainer("a");
    for (int looks = 0; looks < 3; ++looks)
        EXPECT_EQ(only().whyNoContainer, "its Documents folder is on another device than the storage");
    EXPECT_EQ(only().record->dataContainerURL(), std::nullopt);
    EXPECT_EQ(log.count("it is on another device than the storage"), 1U);
}

TEST_F(RosterScannerTest, whatIsNoApplicationIsNotInstalled) {
    installEntry("link", "[Desktop Entry]\nType=Link\nName=L\n");
    installEntry("nameless", "[Desktop Entry]\nType=Application\n");
    installEntry("empty", "[Desktop Entry]\nType=Application\nName=\n");
    installEntry("typeless", "[Desktop Entry]\nName=T\n");
    installEntry("other", "[Other]\nType=Application\nName=O\n");
    installEntry("hidden", entry("H", "Hidden=true\n"));
    installEntry("", entry("Suffix alone"));
    folder_.file("entries/readme.txt", entry("R"));
    folder_.folder("entries/folder.desktop");
    installEntry("half", "[Desktop Entry]\nType=Application\nName=H\nX-Cindral-Supp");
    EXPECT_EQ(identifiers(), Names());
    installEntry("shown", entry("S", "NoDisplay=true\nTryExec=/none\n"));
    EXPECT_EQ(identifiers(), Names{"shown"});
}

TEST_F(RosterScannerTest, nothingIsOpenedThatIsNoFile) {
    folder_.folder("entries");
    ASSERT_EQ(::mkfifo((folder_ / "entries/pipe.desktop").c_str(), 0600), 0);
    ASSERT_EQ(::symlink("/dev/zero", (folder_ / "entries/zero.desktop").c_str()), 0);
    folder_.file("entries/huge.desktop", entry("H") + std::string(KeyFile::kBytesMax, '\n'));
    EXPECT_EQ(identifiers(), Names());
    ASSERT_EQ(::symlink(folder_.file("real", entry("R")).c_str(), (folder_ / "entries/linked.desktop").c_str()), 0);
    EXPECT_EQ(identifiers(), Names{"linked"});
}

TEST_F(RosterScannerTest, namesOfEntriesAreAnyBytes) {
    installEntry("\xff\xfe \n", entry("X"));
    EXPECT_EQ(identifiers(), Names{"\xff\xfe \n"});
}

TEST_F(RosterScannerTest, whatIsBeingWrittenIsAsItWas) {
    installEntry("a", entry("Before"));
    EXPECT_EQ(only().record->localizedName(), "Before");
    const std::set<std::string> beingWritten{folder_ / "entries/a.desktop", folder_ / "entries/b.desktop"};
    installEntry("a", "");
    installEntry("b", entry("Half"));
    ASSERT_EQ(look(beingWritten).size(), 1U);
    EXPECT_EQ(look(beingWritten).front().record->localizedName(), "Before");
    installEntry("a", entry("After"));
    ASSERT_EQ(look().size(), 2U);
    EXPECT_EQ(look().front().record->localizedName(), "After");
}

TEST_F(RosterScannerTest, aPersonsChoiceCountsLikeTheKeys) {
    user_.install("a", FlatpakTree::named("a", "A"));
    EXPECT_EQ(only().choice, std::nullopt);
    ASSERT_TRUE(PersonalChoices::write(sources_.choicesFile, "a", PersonalChoices::Choice::enabled).ok());
    EXPECT_TRUE(has(only(), kSupportsDocumentBrowserKey));
    EXPECT_EQ(only().choice, true);
    user_.install("a", FlatpakTree::named("a", "A",
                                          "X-Cindral-SupportsDocumentBrowser=true\nX-Cindral-SupportsOpenInPlace=true\n"
                                          "X-Cindral-FileSharingEnabled=true\n"));
    ASSERT_TRUE(PersonalChoices::write(sources_.choicesFile, "a", PersonalChoices::Choice::disabled).ok());
    EXPECT_EQ(only().choice, false);
    for (const char* key : {kSupportsDocumentBrowserKey, kSupportsOpenInPlaceKey, kFileSharingEnabledKey})
        EXPECT_FALSE(has(only(), key)) << key;
}

TEST(RosterSources, comeFromTheEnvironment) {
    std::map<std::string, std::string> variables{{"LANG", "fr_FR.UTF-8"}};
    const auto sources = [&] {
        return RosterSources::from(
            [&](const char* name) -> std::optional<std::string> {
                const auto found = variables.find(name);
                return found == variables.end() ? std::nullopt : std::optional(found->second);
            },
            "/home/u");
    };
    EXPECT_EQ(sources().flatpakUser, "/home/u/.local/share/flatpak");
    EXPECT_EQ(sources().flatpakSystem, "/var/lib/flatpak");
    EXPECT_EQ(sources().flatpakConfig, "/etc/flatpak");
    EXPECT_EQ(sources().applicationData, "/home/u/.var/app");
    EXPECT_EQ(sources().localeNames, (Names{"fr_FR", "fr"}));
    EXPECT_EQ(sources().dataFolders, (Names{"/home/u/.local/share", "/usr/local/share", "/usr/share"}));
    variables = {{"LANG", "fr_FR"},          {"LC_MESSAGES", "de"},          {"LC_ALL", ""},
                 {"XDG_DATA_HOME", "/data"}, {"FLATPAK_SYSTEM_DIR", "/sys"}, {"FLATPAK_CONFIG_DIR", "relative"}};
    EXPECT_EQ(sources().flatpakUser, "/data/flatpak");
    EXPECT_EQ(sources().flatpakSystem, "/sys");
    EXPECT_EQ(sources().flatpakConfig, "/etc/flatpak");
    EXPECT_EQ(sources().localeNames, Names{"de"});
    variables["LC_ALL"] = "C";
    variables["FLATPAK_USER_DIR"] = "/mine";
    EXPECT_EQ(sources().localeNames, Names());
    EXPECT_EQ(sources().flatpakUser, "/mine");
}

TEST(RosterSources, withoutAHomeThereIsNothingOfThePersons) {
    const auto sources = RosterSources::from([](const char*) { return std::nullopt; }, "");
    EXPECT_EQ(sources.flatpakUser, "");
    EXPECT_EQ(sources.applicationData, "");
}

TEST(StepsOf, areFoldersAndNames) {
    const auto steps = [](std::string_view path) {
        std::vector<std::pair<std::string, std::string>> all;
        for (const auto& step : stepsOf(path)) all.emplace_back(step.folder, step.name);
        return all;
    };
    using Steps = std::vector<std::pair<std::string, std::string>>;
    EXPECT_EQ(steps("/a/b/c"), (Steps{{"/", "a"}, {"/a", "b"}, {"/a/b", "c"}}));
    EXPECT_EQ(steps("//a//b/"), (Steps{{"/", "a"}, {"//a", "b"}}));
    EXPECT_EQ(steps("/"), Steps());
    EXPECT_EQ(steps(""), Steps());
}

}  // namespace
}  // namespace cindral::test
