#include "host/http/HttpArchives.h"

#include <fmt/format.h>

#include <algorithm>
#include <cerrno>
#include <nlohmann/json.hpp>
#include <set>
#include <utility>

#include "host/ContainerListing.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/ItemText.h"
#include "host/JsonText.h"
#include "host/ProviderClient.h"
#include "host/http/ZipWriter.h"
#include "platform/foundation/KsUUID.h"

namespace cindral {
namespace {

constexpr std::size_t kFileReadBytes = 256 << 10;
constexpr std::size_t kChunkBytes = 64 << 10;
constexpr std::string_view kSeveral = "Documents";
constexpr std::string_view kLeftOut = "Left out.txt";

/// A body whose length nobody knows before its end.
class ChunkedBody {
public:
    explicit ChunkedBody(HttpConnection& connection) : connection_(connection) {}

    bool append(std::string_view bytes) {
        waiting_ += bytes;
        return waiting_.size() < kChunkBytes || flush();
    }
    bool finish() { return flush() && connection_.send("0\r\n\r\n"); }

private:
    bool flush() {
        if (waiting_.empty()) return true;
        const bool isSent = connection_.send(fmt::format("{:x}\r\n", waiting_.size())) && connection_.send(waiting_) &&
                            connection_.send("\r\n");
        waiting_.clear();
        return isSent;
    }

    HttpConnection& connection_;
    std::string waiting_;
};

/// Whether the bytes of such a document are packed as they are.
bool isPackedAlready(std::string_view type) {
    constexpr std::string_view kPacked[] = {"application/zip",     "application/gzip",
                                            "application/x-xz",    "application/x-bzip",
                                            "application/zstd",    "application/x-7z-compressed",
                                            "application/vnd.rar", "application/java-archive"};
    return type.starts_with("image/") || type.starts_with("audio/") || type.starts_with("video/") ||
           std::ranges::find(kPacked, type) != std::end(kPacked);
}

/// "Report 2.txt" for "Report.txt".
std::string alternativeName(std::string_view name, bool isFolder, int number) {
    const std::size_t dot = isFolder ? std::string_view::npos : name.rfind('.');
    if (dot == std::string_view::npos || dot == 0) return fmt::format("{} {}", name, number);
    return fmt::format("{} {}{}", name.substr(0, dot), number, name.substr(dot));
}

/// Puts items, and what is in them, into an archive.
class Packing {
public:
    Packing(const std::shared_ptr<TesselExtension>& provider, const HttpDocuments& documents, ZipWriter& archive,
            int stop)
        : client_(provider), documents_(documents), archive_(archive), stop_(stop), buffer_(kFileReadBytes) {}

    /// False where it can't go on.
    bool addAll(const std::vector<std::shared_ptr<const TesselItem>>& items) {
        for (const auto& item : items) {
            if (!addWithContents(item, nameAtTop(*item))) return false;
        }
        return sayWhatIsMissing();
    }

private:
    struct Level {
        ContainerListing listing;
        std::string path;
    };

    bool goesOn() const { return !descriptor::isReadable(stop_); }

    std::string nameAtTop(const TesselItem& item) {
        const bool isFolder = isContainer(kindOf(item));
        std::string name = item.filename();
        for (int number = 2; !namesAtTop_.insert(name).second; ++number)
            name = alternativeName(item.filename(), isFolder, number);
        return name;
    }

    /// Folders that lead to where it is at are a list, not calls: how deep they go is not ours to say.
    bool addWithContents(const std::shared_ptr<const TesselItem>& top, const std::string& name) {
        std::vector<Level> levels;
        if (!add(top, name, levels)) return false;
        while (!levels.empty()) {
            auto next = levels.back().listing.next();
            if (!next.ok()) leaveOut(levels.back().path, messageOf(next.error()));
            if (!next.ok() || *next == nullptr) {
                levels.pop_back();
                continue;
            }
            if (!add(*next, levels.back().path + "/" + (*next)->filename(), levels)) return false;
        }
        return true;
    }

    bool add(const std::shared_ptr<const TesselItem>& item, const std::string& path, std::vector<Level>& levels) {
        if (!goesOn()) return false;
        if (!ZipWriter::canHold(path)) return leaveOut(path.substr(0, 200) + "…", "The path is too long");
        const ItemKind kind = kindOf(*item);
        if (isContainer(kind)) {
            levels.push_back({ContainerListing(client_, item->itemIdentifier()), path});
            return archive_.addFolder(path, item->contentModificationDate().value_or(KsDate()));
        }
        if (kind != ItemKind::document) return leaveOut(path, "This is neither a folder nor a document");
        return addDocument(*item, path);
    }

    bool addDocument(const TesselItem& item, const std::string& path) {
        const auto opened = documents_.open(item.itemIdentifier());
        if (!opened.ok()) return leaveOut(path, messageOf(opened.error()));
        std::uint64_t left = opened->size;
        if (!archive_.beginDocument(
                {path, opened->changed, left, opened->isExecutable, !isPackedAlready(item.typeIdentifier())}))
            return false;
        while (left > 0) {
            if (!goesOn()) return false;
            const auto got = descriptor::read(opened->fd.get(),
                                              std::span(buffer_).first(std::min<std::uint64_t>(left, buffer_.size())));
            if (!got.ok()) leaveOut(path, fmt::format("It could be read in part only: {}", messageOf(got.error())));
            // One that was cut short meanwhile is as long as it is.
            if (!got.ok() || *got == 0) break;
            if (!archive_.append({buffer_.data(), *got})) return false;
            left -= *got;
        }
        return archive_.endDocument();
    }

    /// True: it goes on without it.
    bool leaveOut(std::string_view path, std::string_view why) {
        leftOut_ += fmt::format("{}\n    {}\n", path, why);
        return true;
    }

    bool sayWhatIsMissing() {
        if (leftOut_.empty()) return true;
        std::string name(kLeftOut);
        for (int number = 2; namesAtTop_.contains(name); ++number) name = alternativeName(kLeftOut, false, number);
        const std::string text = "These could not be put into the archive.\n\n" + leftOut_;
        return archive_.beginDocument({name, KsDate::now(), text.size()}) && archive_.append(text) &&
               archive_.endDocument();
    }

    ProviderClient client_;
    const HttpDocuments& documents_;
    ZipWriter& archive_;
    const int stop_;
    std::vector<char> buffer_;
    std::set<std::string> namesAtTop_;
    std::string leftOut_;
};

/// The identifiers that a message lists; none where it is no such message.
std::optional<std::vector<TesselItemIdentifier>> identifiersIn(std::string_view message) {
    const auto parsed = nlohmann::json::parse(message, nullptr, /*allow_exceptions=*/false);
    if (!parsed.is_object()) return std::nullopt;
    const auto list = parsed.find("identifiers");
    if (list == parsed.end() || !list->is_array() || list->empty()) return std::nullopt;
    std::vector<TesselItemIdentifier> identifiers;
    for (const auto& each : *list) {
        if (!each.is_string()) return std::nullopt;
        identifiers.push_back(each.get<std::string>());
        if (!HttpDocuments::isIdentifier(identifiers.back())) return std::nullopt;
    }
    return identifiers;
}

}  // namespace

HttpResponse HttpArchives::prepare(const std::shared_ptr<const HttpSession>& session, std::string_view message) {
    const auto identifiers = identifiersIn(message);
    if (!identifiers) return HttpResponse::refusal(400, "An archive is of a list of identifiers");
    Items items;
    for (const TesselItemIdentifier& each : *identifiers) {
        auto item = provider_->itemForIdentifier(each);
        // What all others are in is everything.
        if (each == kTesselRootContainerItemIdentifier || each == kTesselWorkingSetContainerItemIdentifier)
            return HttpResponse::refusal(400, "An archive is of folders and documents");
        if (!item.ok()) return HttpResponse::refusal(HttpDocuments::statusOf(item.error()), messageOf(item.error()));
        items.push_back(*std::move(item));
    }
    std::string name = KsUUID::random().string();
    std::string body = R"({"archive":)" + jsonString(name) + "}\n";
    const MutexLock lock(mutex_);
    waiting_.push_back({std::move(name), session, std::move(items)});
    if (waiting_.size() > kWaitingMax) waiting_.pop_front();
    return HttpResponse::json(std::move(body));
}

std::optional<HttpArchives::Items> HttpArchives::take(const HttpSession& session, std::string_view name) {
    const MutexLock lock(mutex_);
    const auto found = std::ranges::find_if(
        waiting_, [&](const Waiting& each) { return each.session.get() == &session && each.name == name; });
    if (found == waiting_.end()) return std::nullopt;
    Items items = std::move(found->items);
    waiting_.erase(found);
    return items;
}

void HttpArchives::send(HttpConnection& connection, const std::shared_ptr<const HttpSession>& session,
                        std::string_view name, int stop) {
    const auto items = take(*session, name);
    if (!items) {
        connection.answer(HttpResponse::refusal(404, "There is no such archive, or it was fetched before"));
        return;
    }
    const std::string title = items->size() == 1 ? items->front()->filename() : std::string(kSeveral);
    HttpResponse response;
    response.contentType = "application/zip";
    response.contentPolicy = HttpDocuments::kPolicy;
    response.fields = {{"Content-Disposition", HttpDocuments::dispositionOf(title + ".zip", /*isShown=*/false)},
                       {"Transfer-Encoding", "chunked"}};
    if (!connection.beginAnswer(response, std::nullopt)) return;
    ChunkedBody body(connection);
    ZipWriter archive([&](std::string_view bytes) { return body.append(bytes); });
    // Without its last chunk a browser knows that something is missing.
    if (Packing(provider_, documents_, archive, stop).addAll(*items) && archive.finish()) body.finish();
}

}  // namespace cindral
