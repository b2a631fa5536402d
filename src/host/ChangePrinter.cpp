#include "host/ChangePrinter.h"

#include <fmt/format.h>

#include "host/ItemWriter.h"
#include "host/JsonText.h"
#include "host/TerminalText.h"
#include "platform/foundation/Base64.h"

namespace cindral {
namespace {

// Who watches for days sees more than anybody remembers.
constexpr std::size_t kKnownMax = 100'000;

}  // namespace

ChangePrinter::ChangePrinter(const PresentedPaths& paths, Form form, TextOutput& output)
    : paths_(paths), form_(form), output_(output) {}

void ChangePrinter::print(const ChangesBatch& batch) {
    for (const ChangesBatch::Entry& entry : batch.log) {
        if (entry.item) {
            printUpdate(*entry.item);
        } else {
            printDeletion(entry.identifier);
        }
    }
}

std::string ChangePrinter::nameOf(const TesselItem& item) const {
    const KsURL* url = item.fileURL();
    if (url == nullptr) return item.filename();
    const std::string path = paths_.realPath(url->path());
    const auto below = PresentedPaths::remainder(path, paths_.real());
    return below && below->size() > 1 ? std::string(below->substr(1)) : path;
}

void ChangePrinter::printUpdate(const TesselItem& item) {
    if (form_ == Form::json) {
        output_.buffer() += R"({"updated":)";
        ItemWriter(paths_).append(output_.buffer(), item);
        output_.line("}");
        return;
    }
    const std::string name = nameOf(item);
    if (known_.size() >= kKnownMax) known_.clear();
    known_[item.itemIdentifier()] = {name, false};
    if (item.docID() && item.fileID()) known_[fmt::format("fid={}", *item.fileID())] = {name, true};
    printText("updated", name);
}

void ChangePrinter::printDeletion(const TesselItemIdentifier& identifier) {
    if (form_ == Form::json) return output_.line(fmt::format(R"({{"deleted":{}}})", jsonString(identifier)));
    const auto found = known_.find(identifier);
    if (found == known_.end()) return printText("deleted", identifier);
    // The document's own identifier is told, too.
    if (!found->second.isFile) printText("deleted", found->second.name);
    known_.erase(found);
}

void ChangePrinter::printText(std::string_view what, std::string_view name) {
    output_.line(fmt::format("{}  {}", what, terminalText(name)));
}

void ChangePrinter::printAnchor(const TesselSyncAnchor& anchor) {
    const std::string text = base64Encode(anchor);
    output_.line(form_ == Form::json ? fmt::format(R"({{"anchor":"{}"}})", text) : fmt::format("anchor   {}", text));
}

void ChangePrinter::printLost() {
    output_.line(form_ == Form::json ? R"({"expired":true})" : "unknown  anything may have changed");
}

}  // namespace cindral
