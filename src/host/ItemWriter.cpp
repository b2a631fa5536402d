#include "host/ItemWriter.h"

#include "host/JsonText.h"
#include "platform/foundation/Base64.h"

namespace cindral {
namespace {

constexpr std::size_t kItemBytesUsual = 512;

void appendDate(std::string& out, std::string_view key, const std::optional<KsDate>& date) {
    if (!date) return;
    out += key;
    date->appendRFC3339(out);
    out += '"';
}

template <typename Number>
void appendNumber(std::string& out, std::string_view key, const std::optional<Number>& number) {
    if (!number) return;
    out += key;
    appendJsonNumber(out, *number);
}

void appendTags(std::string& out, const std::optional<std::vector<std::string>>& tags) {
    if (!tags) return;
    out += R"(,"tags":[)";
    bool isFirst = true;
    for (const std::string& tag : *tags) {
        if (!isFirst) out += ',';
        isFirst = false;
        appendJsonString(out, tag);
    }
    out += ']';
}

}  // namespace

void ItemWriter::reserve(std::string& out, std::size_t items) {
    out.reserve(out.size() + (items + 2) * kItemBytesUsual);
}

void ItemWriter::append(std::string& out, const TesselItem& item) {
    out += R"({"identifier":)";
    appendJsonString(out, item.itemIdentifier());
    out += R"(,"parentIdentifier":)";
    appendJsonString(out, item.parentItemIdentifier());
    out += R"(,"filename":)";
    appendJsonString(out, item.filename());
    out += R"(,"typeIdentifier":)";
    appendJsonString(out, item.typeIdentifier());
    out += R"(,"capabilities":)";
    appendJsonNumber(out, static_cast<std::uint64_t>(item.capabilities()));
    out += item.isTrashed() ? std::string_view(R"(,"isTrashed":true)") : std::string_view(R"(,"isTrashed":false)");
    out += item.isUbiquitous() ? std::string_view(R"(,"isUbiquitous":true)")
                               : std::string_view(R"(,"isUbiquitous":false)");
    if (item.isAppLibrary()) out += R"(,"isAppLibrary":true)";

    appendNumber(out, R"(,"documentSize":)", item.documentSize());
    appendDate(out, R"(,"creationDate":")", item.creationDate());
    appendDate(out, R"(,"contentModificationDate":")", item.contentModificationDate());
    appendNumber(out, R"(,"childItemCount":)", item.childItemCount());
    if (const auto version = item.versionIdentifier()) {
        out += R"(,"versionIdentifier":")";
        appendBase64(out, *version);
        out += '"';
    }
    appendDate(out, R"(,"lastUsedDate":")", item.lastUsedDate());
    appendTags(out, item.tags());
    appendNumber(out, R"(,"favoriteRank":)", item.favoriteRank());
    appendNumber(out, R"(,"fileID":)", item.fileID());
    appendNumber(out, R"(,"docID":)", item.docID());
    if (const KsURL* url = item.fileURL()) {
        out += R"(,"fileURL":")";
        appendFileURL(out, *url);
        out += '"';
    }
    if (const std::string* bundle = item.appContainerBundleIdentifier()) {
        out += R"(,"bundleIdentifier":)";
        appendJsonString(out, *bundle);
    }
    out += '}';
}

std::string ItemWriter::text(const TesselItem& item) {
    std::string out;
    append(out, item);
    return out;
}

void ItemWriter::appendFileURL(std::string& out, const KsURL& url) {
    const std::string_view path = url.path();
    const std::size_t slash = path.rfind('/');
    const std::size_t nameStart = slash + 1;
    // The storage itself is presented by its own name, not below a folder.
    if (!url.isFileURL() || slash == std::string_view::npos || path == paths_.presented()) {
        const std::string text = jsonString(paths_.realURL(url));
        out.append(text, 1, text.size() - 2);
        return;
    }
    if (path.substr(0, nameStart) != folder_) {
        folder_ = path.substr(0, nameStart);
        folderURL_ = "file://";
        appendPercentEncoded(folderURL_, paths_.realPath(folder_));
    }
    // What is percent-encoded needs no escape.
    out += folderURL_;
    appendPercentEncoded(out, path.substr(nameStart));
}

}  // namespace cindral
