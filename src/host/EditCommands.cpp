#include "host/EditCommands.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "host/Awaited.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/ImportStaging.h"
#include "host/ItemWriter.h"
#include "host/JsonText.h"
#include "host/ProgressPace.h"
#include "host/TerminalText.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Utf8.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselTags.h"

namespace cindral {
namespace {

constexpr std::string_view kFolderType = "inode/directory";

NameKind nameKindOf(const TesselItem& item) {
    return item.typeIdentifier() == kFolderType ? NameKind::folder : NameKind::document;
}

bool isCollision(const Result<std::shared_ptr<const TesselItem>>& result) {
    return !result.ok() &&
           result.error().is(kTesselErrorDomain, static_cast<std::int64_t>(TesselErrorCode::filenameCollision));
}

std::string progressText(const TesselProgress::Counts& counts) {
    if (counts.totalBytes > 0) {
        return fmt::format("{:3}%  {} of {}", counts.completedBytes * 100 / counts.totalBytes,
                           humanSize(counts.completedBytes), humanSize(counts.totalBytes));
    }
    return fmt::format("{:3}%  {} of {} items",
                       counts.completedItems * 100 / std::max<std::uint64_t>(counts.totalItems, 1),
                       counts.completedItems, counts.totalItems);
}

/// The last component of a path, and what leads to it; "" where nothing does.
std::pair<std::string, std::string> splitPath(const std::string& path) {
    const std::size_t end = path.find_last_not_of('/');
    if (end == std::string::npos) return {"", path};
    const std::size_t slash = path.rfind('/', end);
    const std::size_t begin = slash == std::string::npos ? 0 : slash + 1;
    return {path.substr(0, begin), path.substr(begin, end + 1 - begin)};
}

}  // namespace

EditTerminal EditTerminal::ofProcess() {
    const auto write = [](const std::string& text) {
        [[maybe_unused]] const auto written = descriptor::writeAll(STDERR_FILENO, text);
    };
    const bool isTerminal = ::isatty(STDERR_FILENO) == 1;
    EditTerminal terminal;
    terminal.complain = [write](const std::string& line) { write(fmt::format("cindral: {}\n", line)); };
    terminal.confirms = [write, isAsked = isTerminal && ::isatty(STDIN_FILENO) == 1](const std::string& question) {
        if (!isAsked) return true;
        write(question + " [y/N] ");
        char answer[64];
        const auto got = descriptor::read(STDIN_FILENO, answer);
        return got.ok() && *got > 0 && (answer[0] == 'y' || answer[0] == 'Y');
    };
    if (isTerminal) {
        // Back to the line's beginning, and the rest of it emptied.
        terminal.show = [write](const std::string& text) { write("\r\x1b[K" + text); };
    }
    return terminal;
}

EditCommands::EditCommands(const Commands::Context& context, EditTerminal terminal, TextOutput& output)
    : context_(context), options_(context.options.edit), terminal_(std::move(terminal)), output_(output) {}

Result<void> EditCommands::run() {
    const auto& words = options_.words;
    switch (options_.command) {
        case EditCommand::importFiles:
            return forEach([&, folder = TRY(target())](const std::string& word) { return importFile(word, folder); });
        case EditCommand::mkdir: return forEach([&](const std::string& word) { return makeFolder(word); });
        case EditCommand::rename: return rename(words[0], words[1]);
        case EditCommand::mv:
            return forEach(
                [&, folder = TRY(identify(words.back()))](const std::string& word) { return move(word, folder); }, 0,
                1);
        case EditCommand::rm:
            if (!confirmsDeletion()) return {};
            return forEach([&](const std::string& word) { return remove(word); });
        case EditCommand::trash: return forEach([&](const std::string& word) { return trash(word); });
        case EditCommand::restore: return forEach([&](const std::string& word) { return restore(word); });
        case EditCommand::emptyTrash: return emptyTrash();
        case EditCommand::tag:
            return forEach([&](const std::string& word) { return changeTag(word, words[0], true); }, 1);
        case EditCommand::untag:
            return forEach([&](const std::string& word) { return changeTag(word, words[0], false); }, 1);
        case EditCommand::tags: return forEach([&](const std::string& word) { return printTags(word); });
        case EditCommand::favorite:
            return forEach([&](const std::string& word) { return setRank(word, options_.rank); });
        case EditCommand::unfavorite:
            return forEach([&](const std::string& word) { return setRank(word, std::nullopt); });
        case EditCommand::touchUsed: return forEach([&](const std::string& word) { return touchUsed(word); });
    }
    return {};
}

/// Of what fails, the last is the command's own failure, whose line comes at its end.
Result<void> EditCommands::forEach(const std::function<Result<void>(const std::string&)>& edit, std::size_t first,
                                   std::size_t leftOver) {
    Result<void> failed;
    for (std::size_t i = first; i + leftOver < options_.words.size(); ++i) {
        Result<void> done = edit(options_.words[i]);
        if (done.ok()) continue;
        if (!failed.ok()) terminal_.complain(messageOf(failed.error()));
        failed = std::move(done);
    }
    return failed;
}

// MARK: What the items are

Result<TesselItemIdentifier> EditCommands::identify(const std::string& word) const {
    return Commands::identifierOf(context_, word);
}

Result<TesselItemIdentifier> EditCommands::target() const {
    return options_.folder ? identify(*options_.folder)
                           : Result<TesselItemIdentifier>(kTesselRootContainerItemIdentifier);
}

Result<std::shared_ptr<const TesselItem>> EditCommands::item(const std::string& word) const {
    auto found = provider().itemForIdentifier(TRY(identify(word)));
    if (!found.ok()) return failure(word, found.error());
    return found;
}

KsError EditCommands::failure(const std::string& subject, const KsError& error) const {
    const std::string named = terminalText(subject);
    if (const auto inTheWay = collidingItem(error)) {
        const KsURL* url = inTheWay->fileURL();
        const std::string there = url != nullptr ? context_.paths.realPath(url->path()) : inTheWay->filename();
        return hostFailure(fmt::format("{}: {} is in the way", named, terminalText(there)));
    }
    if (isNoSuchItem(error)) return hostFailure(fmt::format("no such item: {}", named));
    // A line of the host's own says what it is about.
    if (error.domain() == kCindralHostErrorDomain) return error;
    const auto path = error.userInfo().find("path");
    const std::string where = path != error.userInfo().end() ? context_.paths.realPath(path->second) : subject;
    if (where == subject || where.ends_with("/" + subject))
        return hostFailure(fmt::format("{}: {}", named, messageOf(error)));
    return hostFailure(fmt::format("{}: {}: {}", named, terminalText(where), messageOf(error)));
}

Result<void> EditCommands::print(const std::string& subject, const ItemResult& result) {
    if (!result.ok()) return failure(subject, result.error());
    if (context_.options.json) {
        ItemWriter(context_.paths).append(output_.buffer(), **result);
        output_.endLine();
    }
    return {};
}

// MARK: Waiting

void EditCommands::follow(const std::shared_ptr<TesselProgress>& progress, const std::string& subject) const {
    if (progress == nullptr || terminal_.show == nullptr) return;
    progress->setObserver([&show = terminal_.show, subject = terminalText(subject),
                           pace = std::make_shared<ProgressPace>()](const auto& counts) {
        if (pace->isTimeToTell(counts)) show(fmt::format("{}  {}", progressText(counts), subject));
    });
}

EditCommands::ItemResult EditCommands::await(const std::string& subject, const Start& start) const {
    Awaited<ItemResult> answer;
    const auto progress = start(answer.completion());
    follow(progress, subject);
    ItemResult result = answer.wait();
    if (progress != nullptr) progress->setObserver(nullptr);
    if (terminal_.show != nullptr) terminal_.show("");
    return result;
}

std::optional<KsError> EditCommands::awaitEnd(
    const std::string& subject,
    const std::function<std::shared_ptr<TesselProgress>(TesselExtension::Completion)>& start) const {
    Awaited<std::optional<KsError>> answer;
    const auto progress = start(answer.completion());
    follow(progress, subject);
    std::optional<KsError> error = answer.wait();
    if (progress != nullptr) progress->setObserver(nullptr);
    if (terminal_.show != nullptr) terminal_.show("");
    return error;
}

// MARK: Putting things in their place

EditCommands::ItemResult EditCommands::withFreeName(
    const std::string& name, NameKind kind, const std::function<ItemResult(const std::string& name)>& attempt) const {
    ItemResult result = attempt(name);
    for (std::uint64_t number = 2; options_.keepsBoth && isCollision(result); ++number)
        result = attempt(alternativeName(name, kind, number));
    return result;
}

EditCommands::ItemResult EditCommands::reparent(const TesselItem& item, const TesselItemIdentifier& folder,
                                                const std::string& subject) {
    return withFreeName(item.filename(), nameKindOf(item), [&](const std::string& name) {
        return await(subject, [&](auto completion) {
            return provider().reparentItemWithIdentifier(item.itemIdentifier(), folder, name, std::move(completion));
        });
    });
}

Result<void> EditCommands::importFile(const std::string& file, const TesselItemIdentifier& folder) {
    if (file.empty()) return hostFailure("no such file: the path is empty");
    const std::string absolute = TRY(Commands::absolutePath(context_, file));
    const KsURL source = KsURL::fileURL(context_.paths.presentedPath(absolute));
    const auto importInto = [&](const TesselItemIdentifier& parent) {
        return await(file, [&](auto completion) {
            return provider().importDocumentAtURL(source, parent, std::move(completion));
        });
    };
    if (folder != kTesselRootContainerItemIdentifier && !options_.keepsBoth) return print(file, importInto(folder));
    const ImportStaging staging = TRY(ImportStaging::make(provider(), context_.paths));
    const ItemResult built = importInto(staging.identifier);
    if (!built.ok()) return failure(file, built.error());
    return print(file, reparent(**built, folder, file));
}

Result<void> EditCommands::makeFolder(const std::string& word) {
    std::string name = word;
    TesselItemIdentifier parent;
    if (options_.folder) {
        parent = TRY(target());
    } else {
        const auto [folder, last] = splitPath(word);
        name = last;
        parent = TRY(Commands::identifierAt(context_, folder.empty() ? "." : folder));
    }
    const auto makeIn = [&](const TesselItemIdentifier& where, const std::string& given) {
        return await(word, [&](auto completion) {
            provider().createDirectoryWithName(given, where, std::move(completion));
            return nullptr;
        });
    };
    if (parent != kTesselRootContainerItemIdentifier) {
        return print(word,
                     withFreeName(name, NameKind::folder, [&](const auto& given) { return makeIn(parent, given); }));
    }
    const ImportStaging staging = TRY(ImportStaging::make(provider(), context_.paths));
    const ItemResult built = makeIn(staging.identifier, name);
    if (!built.ok()) return failure(word, built.error());
    return print(word, reparent(**built, parent, word));
}

Result<void> EditCommands::rename(const std::string& word, const std::string& name) {
    const auto named = TRY(item(word));
    return print(word, withFreeName(name, nameKindOf(*named), [&](const std::string& given) {
                     return await(word, [&](auto completion) {
                         provider().renameItemWithIdentifier(named->itemIdentifier(), given, std::move(completion));
                         return nullptr;
                     });
                 }));
}

Result<void> EditCommands::move(const std::string& word, const TesselItemIdentifier& folder) {
    return print(word, reparent(*TRY(item(word)), folder, word));
}

// MARK: Taking things away

bool EditCommands::confirmsDeletion() {
    if (options_.isSure) return true;
    const auto& words = options_.words;
    return terminal_.confirms(words.size() == 1 ? fmt::format("Delete {} for good?", terminalText(words.front()))
                                                : fmt::format("Delete {} items for good?", words.size()));
}

Result<void> EditCommands::remove(const std::string& word) {
    const TesselItemIdentifier identifier = TRY(identify(word));
    const auto error = awaitEnd(
        word, [&](auto completion) { return provider().deleteItemWithIdentifier(identifier, std::move(completion)); });
    return error ? Result<void>(failure(word, *error)) : Result<void>();
}

/// The trash holds every name once: an item whose name is taken there gets another one first, where it is.
Result<void> EditCommands::trash(const std::string& word) {
    const auto named = TRY(item(word));
    const TesselItemIdentifier& identifier = named->itemIdentifier();
    const auto attempt = [&] {
        return await(word, [&](auto completion) {
            provider().trashItemWithIdentifier(identifier, std::move(completion));
            return nullptr;
        });
    };
    const auto renameTo = [&](const std::string& name) {
        return await(word, [&](auto completion) {
            provider().renameItemWithIdentifier(identifier, name, std::move(completion));
            return nullptr;
        });
    };
    ItemResult result = attempt();
    bool isRenamed = false;
    for (std::uint64_t number = 2; isCollision(result); ++number) {
        const ItemResult renamed = renameTo(alternativeName(named->filename(), nameKindOf(*named), number));
        if (isCollision(renamed)) continue;
        if (!renamed.ok()) {
            result = renamed;
            break;
        }
        isRenamed = true;
        result = attempt();
    }
    if (!result.ok() && isRenamed) (void)renameTo(named->filename());
    return print(word, result);
}

Result<void> EditCommands::restore(const std::string& word) {
    const TesselItemIdentifier identifier = TRY(identify(word));
    std::optional<TesselItemIdentifier> folder;
    if (options_.folder) folder = TRY(target());
    return print(word, await(word, [&](auto completion) {
                     return provider().untrashItemWithIdentifier(identifier, folder, std::move(completion));
                 }));
}

Result<void> EditCommands::emptyTrash() {
    const KsDate now = KsDate::now();
    const KsDate date = options_.olderThan.empty() ? now : momentOf(options_.olderThan, now).value_or(now);
    if (!options_.isSure &&
        !terminal_.confirms(fmt::format("Delete for good what was trashed before {}?", humanMinute(date))))
        return {};
    const auto error = awaitEnd("the trash", [&](auto completion) {
        provider().removeTrashedItemsOlderThanDate(date, std::move(completion));
        return nullptr;
    });
    return error ? Result<void>(failure("the trash", *error)) : Result<void>();
}

// MARK: Metadata

Result<void> EditCommands::changeTag(const std::string& word, const std::string& tag, bool isPutOn) {
    if (!isUtf8(tag))
        return hostFailure(fmt::format("{}: the tag {} is not UTF-8", terminalText(word), terminalText(tag)));
    const auto named = TRY(item(word));
    std::vector<std::string> labels = named->tags().value_or(std::vector<std::string>());
    const bool isThere = std::ranges::find(labels, tag) != labels.end();
    if (isThere == isPutOn) return print(word, named);
    if (isPutOn) {
        labels.push_back(tag);
    } else {
        std::erase(labels, tag);
    }
    std::vector<TSTag> tags;
    for (std::string& label : labels) tags.push_back({std::move(label)});
    return print(word, await(word, [&](auto completion) {
                     provider().setTagData(tsTagsData(tags), named->itemIdentifier(), std::move(completion));
                     return nullptr;
                 }));
}

Result<void> EditCommands::printTags(const std::string& word) {
    const auto named = TRY(item(word));
    if (context_.options.json) return print(word, named);
    for (const std::string& label : named->tags().value_or(std::vector<std::string>())) {
        if (context_.options.endsWithNul) {
            output_.line(label);
            continue;
        }
        if (options_.words.size() > 1) output_.buffer() += terminalText(word) + "  ";
        output_.line(terminalText(label));
    }
    return {};
}

Result<void> EditCommands::setRank(const std::string& word, std::optional<std::int64_t> rank) {
    const TesselItemIdentifier identifier = TRY(identify(word));
    return print(word, await(word, [&](auto completion) {
                     provider().setFavoriteRank(rank, identifier, std::move(completion));
                     return nullptr;
                 }));
}

Result<void> EditCommands::touchUsed(const std::string& word) {
    const TesselItemIdentifier identifier = TRY(identify(word));
    const KsDate now = KsDate::now();
    const std::optional<KsDate> date = options_.isCleared      ? std::nullopt
                                       : options_.date.empty() ? std::optional(now)
                                                               : momentOf(options_.date, now);
    return print(word, await(word, [&](auto completion) {
                     provider().setLastUsedDate(date, identifier, std::move(completion));
                     return nullptr;
                 }));
}

}  // namespace cindral
