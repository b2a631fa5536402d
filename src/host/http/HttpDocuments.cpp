#include "host/http/HttpDocuments.h"

#include <fcntl.h>
#include <fmt/format.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <utility>

#include "host/HostError.h"
#include "host/JsonText.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SysEdits.h"

namespace cindral {
namespace {

// A save puts another object under the name between the question and the opening.
constexpr int kListingAttemptsMax = 5;

// The browser's own viewer does not work in a sandbox. It is no part of any page, and runs nothing of the document's in
// our name.
constexpr std::string_view kViewerPolicy = "default-src 'none'; object-src 'self'; frame-ancestors 'self'";

constexpr std::string_view kShownTypes[] = {
    "application/pdf", "audio/aac",  "audio/flac",  "audio/mp4",  "audio/mpeg", "audio/ogg", "audio/opus",
    "audio/wav",       "audio/webm", "audio/x-wav", "image/avif", "image/bmp",  "image/gif", "image/jpeg",
    "image/png",       "image/webp", "video/mp4",   "video/ogg",  "video/webm",
};
// Other names of the type database for what browsers know by one.
constexpr std::pair<std::string_view, std::string_view> kOtherNames[] = {
    {"audio/x-flac", "audio/flac"},  {"audio/x-vorbis+ogg", "audio/ogg"}, {"audio/x-opus+ogg", "audio/ogg"},
    {"audio/vnd.wave", "audio/wav"}, {"video/x-theora+ogg", "video/ogg"}, {"image/x-ms-bmp", "image/bmp"},
    {"audio/x-m4a", "audio/mp4"},    {"video/x-m4v", "video/mp4"},
};
constexpr std::string_view kSvgType = "image/svg+xml";
constexpr std::string_view kTextTypes[] = {"application/json", "application/x-shellscript", "application/toml",
                                           "application/x-yaml", "application/yaml"};
// Texts that a browser would run, or take as the beginning of more.
constexpr std::string_view kRunnableTexts[] = {
    "text/html", "text/xml", "text/xsl", "text/javascript", "text/css", "text/cache-manifest", "text/calendar"};

template <std::size_t N>
bool isAmong(const std::string_view (&list)[N], std::string_view text) {
    return std::ranges::find(list, text) != std::end(list);
}

std::optional<std::uint64_t> numberOf(std::string_view digits) {
    std::uint64_t value = 0;
    const auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), value);
    if (digits.empty() || error != std::errc() || end != digits.data() + digits.size()) return std::nullopt;
    return value;
}

}  // namespace

bool HttpDocuments::isIdentifier(std::string_view text) {
    const bool isNumber = text.starts_with("did=") || text.starts_with("fid=");
    return !isNumber || text.find_first_not_of("0123456789", 4) == std::string_view::npos;
}

std::string HttpDocuments::dispositionOf(std::string_view name, bool isShown) {
    std::string field = isShown ? "inline" : "attachment";
    field += "; filename*=UTF-8''";
    // None of its bytes can end the field; "/" is no part of a name.
    appendPercentEncoded(field, name);
    return field;
}

int HttpDocuments::statusOf(const KsError& error) {
    if (isNoSuchItem(error) || error.isPosix(ENOENT) || error.is(kKsGeneralErrorDomain, kKsFileNoSuchFileError))
        return 404;
    if (error.isPosix(EACCES) || error.isPosix(EPERM) || error.isPosix(ELOOP) || error.isPosix(EXDEV)) return 403;
    if (error.isPosix(EISDIR)) return 415;
    return 500;
}

ServedType ServedType::of(std::string_view typeIdentifier) {
    for (const auto& [other, name] : kOtherNames) {
        if (typeIdentifier == other) typeIdentifier = name;
    }
    if (isAmong(kShownTypes, typeIdentifier)) return {std::string(typeIdentifier), true};
    const bool isText = (typeIdentifier.starts_with("text/") && !isAmong(kRunnableTexts, typeIdentifier)) ||
                        isAmong(kTextTypes, typeIdentifier);
    if (isText) return {"text/plain; charset=utf-8", true};
    // A picture in the page may be one of these; opened by itself it would be a page.
    if (typeIdentifier == kSvgType) return {std::string(kSvgType), false};
    return {"application/octet-stream", false};
}

std::optional<ByteRange> ByteRange::parse(std::string_view field, std::uint64_t size) {
    const ByteRange all{0, size};
    if (!field.starts_with("bytes=")) return all;
    field.remove_prefix(6);
    const std::size_t dash = field.find('-');
    // Several ranges at once are answered with everything, which is always allowed.
    if (dash == std::string_view::npos || field.find(',') != std::string_view::npos) return all;
    const auto first = numberOf(field.substr(0, dash));
    const auto last = numberOf(field.substr(dash + 1));
    const bool isSuffix = dash == 0;
    if (isSuffix) {
        if (!last) return all;
        const std::uint64_t length = std::min(*last, size);
        return length > 0 ? std::optional(ByteRange{size - length, length}) : std::nullopt;
    }
    if (!first || (!last && dash + 1 != field.size()) || (last && *last < *first)) return all;
    if (*first >= size) return std::nullopt;
    return ByteRange{*first, std::min(last.value_or(size - 1), size - 1) - *first + 1};
}

Result<HttpDocuments::Opened> HttpDocuments::open(const TesselItemIdentifier& identifier) const {
    for (int attempt = 1;; ++attempt) {
        auto opened = openOnce(identifier);
        if (opened.ok() || attempt == kListingAttemptsMax || !opened.error().isPosix(ESTALE)) return opened;
    }
}

/// ESTALE where another object has taken the place of the one that was asked for.
Result<HttpDocuments::Opened> HttpDocuments::openOnce(const TesselItemIdentifier& identifier) const {
    const auto item = TRY(provider_.itemForIdentifier(identifier));
    const KsURL* url = item->fileURL();
    if (url == nullptr) return KsError::posix(ENOENT);
    // A handle first: what may be neither opened nor waited for is known before it is.
    const UniqueFd handle = TRY(RootDirectories::open(url->path(), O_PATH | O_NOFOLLOW));
    const FileStatus status = TRY(sys::statx(handle.get(), ""));
    if (status.isDirectory()) return KsError::posix(EISDIR);
    if (!status.isRegular()) return KsError::posix(EACCES);
    if (item->fileID() && *item->fileID() != status.fileID) return KsError::posix(ESTALE);
    UniqueFd fd = TRY(sys::reopen(handle.get(), O_RDONLY));
    return Opened{std::move(fd),    status.size,           status.modificationTime, (status.mode & S_IXUSR) != 0,
                  item->filename(), item->typeIdentifier()};
}

void HttpDocuments::answer(HttpConnection& connection, const HttpRequest& request,
                           const TesselItemIdentifier& identifier, bool saves) const {
    const bool withoutBody = request.method == HttpRequest::Method::head;
    const auto opened = open(identifier);
    if (!opened.ok()) {
        connection.answer(HttpResponse::refusal(statusOf(opened.error()), messageOf(opened.error())), withoutBody);
        return;
    }
    const ServedType type = ServedType::of(opened->typeIdentifier);
    HttpResponse response;
    response.contentType = type.contentType;
    response.contentPolicy = type.contentType == "application/pdf" ? kViewerPolicy : kPolicy;
    response.fields = {{"Content-Disposition", dispositionOf(opened->name, type.isShown && !saves)},
                       {"Accept-Ranges", "bytes"}};
    const auto range = ByteRange::parse(request.only("range").value_or(""), opened->size);
    if (!range) {
        response = HttpResponse::refusal(416, "The document ends before that");
        response.fields = {{"Content-Range", fmt::format("bytes */{}", opened->size)}};
        connection.answer(response, withoutBody);
        return;
    }
    if (range->length < opened->size) {
        response.status = 206;
        response.fields.emplace_back("Content-Range", fmt::format("bytes {}-{}/{}", range->offset,
                                                                  range->offset + range->length - 1, opened->size));
    }
    if (!connection.beginAnswer(response, range->length) || withoutBody) return;
    connection.sendFile(opened->fd.get(), range->offset, range->length);
}

HttpResponse HttpDocuments::thumbnail(const TesselItemIdentifier& identifier, unsigned pixels) const {
    std::optional<Bytes> picture;
    provider_.fetchThumbnailsForItemIdentifiers(
        {identifier}, pixels, [&](const TesselItemIdentifier&, std::optional<Bytes> png) { picture = std::move(png); },
        [](const std::optional<KsError>&) {});
    if (!picture) return HttpResponse::refusal(404, "There is no picture of it");
    HttpResponse response;
    response.contentType = "image/png";
    response.contentPolicy = kPolicy;
    response.body = textOf(*picture);
    return response;
}

}  // namespace cindral
