#include "host/Commands.h"

#include <fmt/format.h>

#include <nlohmann/json.hpp>

#include "host/ContainerListing.h"
#include "host/ContainerMonitor.h"
#include "host/Descriptor.h"
#include "host/EditCommands.h"
#include "host/HostError.h"
#include "host/ItemWriter.h"
#include "host/JsonText.h"
#include "host/SearchCommands.h"
#include "host/StatusReport.h"
#include "host/TerminalText.h"
#include "host/TreePrinter.h"
#include "platform/foundation/Base64.h"
#include "platform/foundation/Sys.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

// A wish: icons come in the sizes of the screen.
constexpr unsigned kThumbnailPixels = 256;

bool isManyFolders(const TesselItemIdentifier& container) {
    return container == kTesselRootContainerItemIdentifier || container == kTesselWorkingSetContainerItemIdentifier ||
           container == kTesselAllDirectoriesContainerItemIdentifier;
}

KsError notWell(std::size_t problems) {
    return hostFailure(problems == 1 ? "one thing is not well" : fmt::format("{} things are not well", problems));
}

}  // namespace

Commands::Commands(Context context, TextOutput& output)
    : context_(std::move(context)), output_(output), text_(context_.environment.wantsColor) {}

bool Commands::isIdentifier(std::string_view item) {
    return item == kTesselRootContainerItemIdentifier || item == kTesselWorkingSetContainerItemIdentifier ||
           item == kTesselAllDirectoriesContainerItemIdentifier || item == kTesselTemporaryLocalFolderItemIdentifier ||
           item.starts_with("did=") || item.starts_with("fid=") || item.starts_with('#');
}

Result<void> Commands::run() {
    switch (context_.options.command) {
        case HostCommand::ls: return list();
        case HostCommand::tree: return tree();
        case HostCommand::info: return info();
        case HostCommand::url: return url();
        case HostCommand::id: return id();
        case HostCommand::anchor: return anchor();
        case HostCommand::changes: return changes();
        case HostCommand::watch: return watch();
        case HostCommand::status: return status();
        case HostCommand::doctor: return doctor();
        case HostCommand::edit: return EditCommands(context_, EditTerminal::ofProcess(), output_).run();
        case HostCommand::thumbnail: return thumbnail();
        case HostCommand::find: return search({SearchQuery::Kind::names, context_.options.text});
        case HostCommand::recents: return search({SearchQuery::Kind::recents, ""});
        case HostCommand::tagged: return search({SearchQuery::Kind::tagged, context_.options.text});
        case HostCommand::favorites: return search({SearchQuery::Kind::favorites, ""});
        case HostCommand::trashed: return search({SearchQuery::Kind::trashed, ""});
        case HostCommand::allTags: return SearchCommands(context_, output_).allTags();
        case HostCommand::apps:
        case HostCommand::appsEnable:
        case HostCommand::appsDisable:
        case HostCommand::serve:
        case HostCommand::link:
        case HostCommand::rpc: break;
    }
    return usageFailure("that is no command that prints");
}

std::string Commands::subject() const {
    return terminalText(context_.options.item.value_or(context_.paths.real()));
}

KsError Commands::failure(const KsError& error) const {
    if (isNoSuchItem(error)) return hostFailure(fmt::format("no such item: {}", subject()));
    return hostFailure(fmt::format("{}: {}", subject(), messageOf(error)));
}

Result<TesselItemIdentifier> Commands::identifier() const {
    const auto& named = context_.options.item;
    return named ? identifierOf(context_, *named) : Result<TesselItemIdentifier>(kTesselRootContainerItemIdentifier);
}

Result<TesselItemIdentifier> Commands::identifierOf(const Context& context, const std::string& named) {
    return isIdentifier(named) ? Result<TesselItemIdentifier>(named) : identifierAt(context, named);
}

Result<std::string> Commands::absolutePath(const Context& context, const std::string& path) {
    if (path.starts_with('/')) return path;
    if (context.environment.workingFolder.empty())
        return hostFailure("the working folder is gone: a path must be absolute");
    return context.environment.workingFolder + "/" + path;
}

Result<TesselItemIdentifier> Commands::identifierAt(const Context& context, const std::string& path) {
    // An empty path names nothing, not the working folder.
    if (path.empty()) return hostFailure("no such item: the path is empty");
    const std::string absolute = TRY(absolutePath(context, path));
    const KsURL url = KsURL::fileURL(context.paths.presentedPath(absolute));
    if (url.path() == context.paths.presented()) return kTesselRootContainerItemIdentifier;
    auto identifier = context.client.provider().persistentIdentifierForItemAtURL(url);
    if (!identifier) return hostFailure(fmt::format("no such item: {}", terminalText(path)));
    return *std::move(identifier);
}

Result<std::shared_ptr<const TesselItem>> Commands::item() const {
    auto found = context_.client.provider().itemForIdentifier(TRY(identifier()));
    if (!found.ok()) return failure(found.error());
    return found;
}

void Commands::printItem(const TesselItem& item) {
    if (context_.options.json) {
        ItemWriter(context_.paths).append(output_.buffer(), item);
    } else if (context_.options.endsWithNul) {
        appendBareName(output_.buffer(), item, context_.paths);
    } else {
        text_.appendLine(output_.buffer(), item);
    }
    output_.endLine();
}

void Commands::printValue(std::string_view key, const std::string& value) {
    if (context_.options.endsWithNul) return output_.line(value);
    output_.line(context_.options.json ? fmt::format("{{{}:{}}}", jsonString(key), jsonString(value))
                                       : terminalText(value));
}

Result<void> Commands::list() {
    const TesselItemIdentifier container = TRY(identifier());
    if (!isManyFolders(container)) {
        const auto named = TRY(item());
        if (!isContainer(kindOf(*named))) {
            printItem(*named);
            return {};
        }
    }
    ContainerListing listing(context_.client, container);
    while (!output_.isBroken()) {
        const auto next = listing.next();
        if (!next.ok()) return failure(next.error());
        if (*next == nullptr) break;
        printItem(**next);
    }
    return {};
}

Result<void> Commands::tree() {
    const TesselItemIdentifier container = TRY(identifier());
    TreePrinter::Options options;
    options.form = context_.options.json          ? TreePrinter::Form::json
                   : context_.options.endsWithNul ? TreePrinter::Form::bareNames
                                                  : TreePrinter::Form::drawing;
    options.intoPackages = context_.options.intoPackages;
    options.title = terminalText(context_.paths.real());
    if (!isManyFolders(container)) {
        const auto named = TRY(item());
        if (!isContainer(kindOf(*named))) {
            printItem(*named);
            return {};
        }
        options.title = terminalText(named->filename());
    }
    TreePrinter printer(context_.client, context_.paths, text_, output_, std::move(options));
    if (auto printed = printer.print(container); !printed.ok()) return failure(printed.error());
    return printer.unreadableFolders();
}

Result<void> Commands::info() {
    const auto named = TRY(item());
    if (context_.options.json) {
        output_.line(ItemWriter(context_.paths).text(*named));
        return {};
    }
    const KsURL* url = named->fileURL();
    output_.buffer() += text_.allFields(*named, url != nullptr ? context_.paths.realURL(*url) : "");
    return {};
}

Result<void> Commands::url() {
    const auto url = context_.client.provider().URLForItemWithPersistentIdentifier(TRY(identifier()));
    if (!url) return hostFailure(fmt::format("no such item: {}", subject()));
    printValue("url", context_.paths.realURL(*url));
    return {};
}

Result<void> Commands::id() {
    // Always a path, whatever it looks like.
    printValue("identifier", TRY(identifierAt(context_, *context_.options.item)));
    return {};
}

Result<TesselSyncAnchor> Commands::anchorOf(const TesselItemIdentifier& container) const {
    auto anchor = context_.client.anchor(container);
    if (!anchor.ok()) return failure(anchor.error());
    if (!*anchor) return hostFailure(fmt::format("there is no anchor for {}", subject()));
    return **std::move(anchor);
}

Result<void> Commands::anchor() {
    printValue("anchor", base64Encode(TRY(anchorOf(TRY(identifier())))));
    return {};
}

Result<TesselItemIdentifier> Commands::container() const {
    TesselItemIdentifier container = TRY(identifier());
    if (!isManyFolders(container) && !isContainer(kindOf(*TRY(item()))))
        return hostFailure(fmt::format("{} is not a folder", subject()));
    return container;
}

ChangePrinter Commands::changePrinter() {
    return {context_.paths, context_.options.json ? ChangePrinter::Form::json : ChangePrinter::Form::text, output_};
}

Result<void> Commands::follow(ChangePrinter& printer, const TesselItemIdentifier& container, TesselSyncAnchor& anchor,
                              int stop) {
    bool moreComing = true;
    while (moreComing && !output_.isBroken() && !(stop >= 0 && descriptor::isReadable(stop))) {
        ChangesBatch batch = TRY(context_.client.changesSince(container, anchor));
        printer.print(batch);
        anchor = std::move(batch.anchor);
        moreComing = batch.moreComing;
    }
    return {};
}

Result<void> Commands::changes() {
    const auto anchorBytes = base64Decode(context_.options.since);
    if (!anchorBytes) return usageFailure("the anchor is not base64");
    const TesselItemIdentifier container = TRY(this->container());
    TesselSyncAnchor anchor = *anchorBytes;
    ChangePrinter printer = changePrinter();
    const auto followed = follow(printer, container, anchor, /*stop=*/-1);
    if (!followed.ok() && isExpiredPage(followed.error()))
        return hostFailure(fmt::format("{}: the anchor has expired; list again, and take a new one", subject()));
    if (!followed.ok()) return failure(followed.error());
    printer.printAnchor(anchor);
    return {};
}

Result<void> Commands::watch() {
    const TesselItemIdentifier container = TRY(this->container());
    const UniqueFd news = TRY(descriptor::makeInterrupt());
    ContainerMonitor monitor(context_.client, context_.signals,
                             [&](const TesselItemIdentifier&) { descriptor::interrupt(news); });
    TesselSyncAnchor anchor = TRY(anchorOf(container));
    if (const auto started = monitor.start(container); !started.ok()) return failure(started.error());
    const int stop = TRY(context_.stopDescriptor());
    ChangePrinter printer = changePrinter();
    auto readiness = descriptor::Readiness::input;
    while (readiness == descriptor::Readiness::input && !output_.isBroken()) {
        // Before what it tells of is asked for: what comes later sets it off again.
        descriptor::clearInterrupt(news);
        const auto followed = follow(printer, container, anchor, stop);
        if (!followed.ok() && !isExpiredPage(followed.error())) return failure(followed.error());
        if (!followed.ok()) {
            printer.printLost();
            anchor = TRY(anchorOf(container));
        }
        output_.flush();
        readiness = TRY(descriptor::waitForInput(news.get(), output_.descriptor(), stop));
    }
    return {};
}

Result<void> Commands::status() {
    const std::string text = TRY(context_.statusText());
    const StatusReport report = StatusReport::of(text);
    if (context_.options.json) {
        output_.line(text);
    } else {
        output_.buffer() += report.text;
    }
    return report.problems == 0 ? Result<void>() : notWell(report.problems);
}

Result<void> Commands::doctor() {
    const std::string text = TRY(context_.doctorText());
    const DoctorReport report = DoctorReport::of(text, context_.setAside);
    if (context_.options.json) {
        output_.line(report.json);
    } else {
        output_.buffer() += report.text;
    }
    return report.problems == 0 ? Result<void>() : notWell(report.problems);
}

Result<void> Commands::search(const SearchQuery& query) {
    return SearchCommands(context_, output_).find(query);
}

Result<void> Commands::thumbnail() {
    const std::string& file = context_.options.outputFile;
    if (file.empty()) return hostFailure("the working folder is gone: the output must be an absolute path");
    std::optional<Bytes> png;
    const TesselItemIdentifier identifier = TRY(this->identifier());
    context_.client.provider().fetchThumbnailsForItemIdentifiers(
        {identifier}, kThumbnailPixels,
        [&](const TesselItemIdentifier&, std::optional<Bytes> data) { png = std::move(data); },
        [](const std::optional<KsError>&) {});
    if (!png) return hostFailure(fmt::format("there is no thumbnail of {}", subject()));
    if (file == "-") {
        output_.buffer() += textOf(*png);
        return {};
    }
    const auto written = [&]() -> Result<void> {
        const UniqueFd fd = TRY(sys::open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOCTTY, 0666));
        return descriptor::writeAll(fd.get(), textOf(*png));
    }();
    if (written.ok()) return {};
    return hostFailure(fmt::format("can't write {}: {}", terminalText(file), written.error().reason()));
}

}  // namespace cindral
