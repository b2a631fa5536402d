#include "host/SearchCommands.h"

#include <fmt/format.h>

#include <algorithm>

#include "host/HostError.h"
#include "host/ItemWriter.h"
#include "host/JsonText.h"
#include "host/TerminalText.h"

namespace cindral {
namespace {

KsError failure(const KsError& error) {
    const std::string what = messageOf(error);
    return hostFailure(fmt::format("can't search: {}", what));
}

}  // namespace

SearchCommands::SearchCommands(const Commands::Context& context, TextOutput& output)
    : context_(context), output_(output), text_(context.environment.wantsColor) {}

void SearchCommands::printItem(const TesselItem& item) {
    if (context_.options.json) {
        ItemWriter(context_.paths).append(output_.buffer(), item);
    } else if (context_.options.endsWithNul) {
        appendBareName(output_.buffer(), item, context_.paths);
    } else {
        const KsURL* url = item.fileURL();
        text_.appendLine(output_.buffer(), item,
                         url != nullptr ? context_.paths.realPath(url->path()) : item.filename());
    }
    output_.endLine();
}

Result<void> SearchCommands::find(const SearchQuery& query) {
    std::uint64_t left = context_.options.limit;
    std::optional<Bytes> page;
    do {
        const auto limit = static_cast<std::size_t>(std::min<std::uint64_t>(left, SearchQueries::kLimitUsual));
        Result<ItemsPage> found = context_.search.find(query, page, limit);
        if (!found.ok()) return failure(found.error());
        for (const auto& item : found->items) printItem(*item);
        left -= limit;
        page = std::move(found->nextPage);
    } while (page && left > 0 && !output_.isBroken());
    return {};
}

Result<void> SearchCommands::allTags() {
    const auto tags = context_.search.tags();
    if (!tags.ok()) return failure(tags.error());
    for (const TagCount& each : *tags) {
        if (context_.options.endsWithNul) {
            output_.line(each.tag);
            continue;
        }
        output_.line(context_.options.json ? fmt::format(R"({{"tag":{},"count":{}}})", jsonString(each.tag), each.count)
                                           : fmt::format("{:>7}  {}", each.count, terminalText(each.tag)));
    }
    return {};
}

}  // namespace cindral
