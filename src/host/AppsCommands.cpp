#include "host/AppsCommands.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "host/HostError.h"
#include "host/JsonText.h"
#include "host/TerminalText.h"
#include "platform/foundation/Files.h"
#include "platform/foundation/Sys.h"
#include "platform/roster/RosterScanner.h"

namespace cindral {
namespace {

constexpr const char* kDocumentsName = "Documents";

bool isPublished(const InstalledApplication& application) {
    return application.record->publication() == RoApplicationProxy::Publication::published;
}

/// Why an application's documents are not published; empty where they are.
std::string whyNot(const InstalledApplication& application) {
    using Publication = RoApplicationProxy::Publication;
    if (application.choice && !*application.choice) return "it was disabled with apps disable";
    switch (application.record->publication()) {
        case Publication::published: return "";
        case Publication::hasNoDataContainer: return application.whyNoContainer;
        case Publication::cannotBeRead: return "its keys can't be read";
        case Publication::isNotAskedFor: return "its keys don't ask for it";
    }
    return "";
}

std::string jsonOf(const InstalledApplication& application) {
    std::string out = R"({"bundleIdentifier":)";
    appendJsonString(out, application.record->bundleIdentifier());
    out += R"(,"name":)";
    appendJsonString(out, application.record->localizedName());
    out += R"(,"source":)";
    appendJsonString(out, application.source);
    out += fmt::format(R"(,"type":{},"published":{})", application.type, isPublished(application));
    if (!isPublished(application)) {
        out += R"(,"why":)";
        appendJsonString(out, whyNot(application));
    }
    if (!application.container.empty()) {
        out += R"(,"dataContainer":)";
        appendJsonString(out, KsURL::fileURL(application.container).absoluteString());
    }
    if (application.choice) out += *application.choice ? R"(,"choice":"enabled")" : R"(,"choice":"disabled")";
    return out + "}";
}

std::string textOf(const InstalledApplication& application, std::size_t width) {
    const std::string why = whyNot(application);
    return fmt::format("{:<{}}  {}  {}", terminalText(application.record->bundleIdentifier()), width,
                       why.empty() ? "published    " : "not published",
                       terminalText(application.record->localizedName()) +
                           (why.empty() ? "" : fmt::format(" ({})", terminalText(why))));
}

void list(const std::vector<InstalledApplication>& applications, const HostOptions& options, TextOutput& output) {
    if (options.endsWithNul) {
        for (const auto& each : applications) output.line(each.record->bundleIdentifier());
        return;
    }
    std::size_t width = 0;
    for (const auto& each : applications) width = std::max(width, terminalText(each.record->bundleIdentifier()).size());
    for (const auto& each : applications) output.line(options.json ? jsonOf(each) : textOf(each, width));
}

/// The application of a look, or null.
const InstalledApplication* find(const std::vector<InstalledApplication>& applications, const std::string& identifier) {
    const auto found = std::ranges::find_if(
        applications, [&](const auto& each) { return each.record->bundleIdentifier() == identifier; });
    return found == applications.end() ? nullptr : &*found;
}

KsError failureAt(std::string_view what, const KsError& error) {
    const auto path = error.userInfo().find("path");
    return hostFailure(fmt::format("{} {}: {}", what, path == error.userInfo().end() ? "" : terminalText(path->second),
                                   error.reason()));
}

/// What the application would make when it first keeps a document.
Result<void> makeDocuments(const std::string& container) {
    if (auto made = files::makeFolders(container); !made.ok()) return failureAt("can't make", made.error());
    const auto folder = sys::open(container.c_str(), O_PATH | O_DIRECTORY);
    if (!folder.ok()) return failureAt("can't open", folder.error().with("path", container));
    if (::mkdirat(folder->get(), kDocumentsName, 0700) == 0) return {};
    const KsError error = KsError::errorWithPOSIXCode();
    const auto status = sys::statx(folder->get(), kDocumentsName);
    if (error.isPosix(EEXIST) && status.ok() && status->isDirectory()) return {};
    return failureAt("can't make", error.with("path", container + "/" + kDocumentsName));
}

Result<void> choose(const RosterSources& sources, const std::string& identifier, PersonalChoices::Choice choice) {
    if (sources.choicesFile.empty()) return hostFailure("there is no home folder: nowhere to keep the choice");
    RosterScanner scanner(sources);
    const auto applications = scanner.scan().applications;
    const InstalledApplication* application = find(applications, identifier);
    const bool isKnown = application != nullptr || PersonalChoices::read(sources.choicesFile).of(identifier);
    const bool isEnabling = choice == PersonalChoices::Choice::enabled;
    if (isEnabling ? application == nullptr : !isKnown)
        return hostFailure(fmt::format("no such application: {}", terminalText(identifier)));
    if (isEnabling && !application->container.empty()) TRY(makeDocuments(application->container));
    if (auto written = PersonalChoices::write(sources.choicesFile, identifier, choice); !written.ok())
        return failureAt("can't write", written.error());
    if (!isEnabling) return {};

    const auto after = scanner.scan().applications;
    const InstalledApplication* enabled = find(after, identifier);
    if (enabled == nullptr || isPublished(*enabled)) return {};
    return hostFailure(
        fmt::format("{} is enabled, but not published: {}", terminalText(identifier), terminalText(whyNot(*enabled))));
}

}  // namespace

Result<void> runAppsCommand(const HostOptions& options, const HostEnvironment& environment, TextOutput& output) {
    const RosterSources sources = rosterSources(options, environment);
    if (options.command == HostCommand::apps) {
        list(RosterScanner(sources).scan().applications, options, output);
        return {};
    }
    const auto choice = options.command == HostCommand::appsEnable ? PersonalChoices::Choice::enabled
                                                                   : PersonalChoices::Choice::disabled;
    return choose(sources, options.item.value_or(""), choice);
}

}  // namespace cindral
