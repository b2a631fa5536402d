#include "platform/foundation/KsURL.h"

#include <fcntl.h>
#include <strings.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <utility>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/TypeDatabase.h"

namespace cindral {

namespace {

// What 16 bits of a link count can say, less the two for "." and "..".
constexpr std::uint64_t kCountedEntriesMax = 65'535 - 2;

bool isNotFound(const KsError& error) {
    return error.isPosix(ENOENT) || error.isPosix(ENOTDIR);
}

int hexValue(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

constexpr std::array<bool, 256> kKeptInURLs = [] {
    std::array<bool, 256> kept{};
    for (char c = 'a'; c <= 'z'; ++c) kept[static_cast<unsigned char>(c)] = true;
    for (char c = 'A'; c <= 'Z'; ++c) kept[static_cast<unsigned char>(c)] = true;
    for (char c = '0'; c <= '9'; ++c) kept[static_cast<unsigned char>(c)] = true;
    for (const char c : {'-', '.', '_', '~', '/'}) kept[static_cast<unsigned char>(c)] = true;
    return kept;
}();

struct DocumentIdentifiers {
    Mutex mutex;
    std::shared_ptr<const KsURL::DocumentIdentifierSource> source GUARDED_BY(mutex);
};

DocumentIdentifiers& documentIdentifiers() {
    static DocumentIdentifiers& identifiers = *new DocumentIdentifiers;
    return identifiers;
}

std::uint32_t storedDocumentIdentifier(const FileStatus& status) {
    std::shared_ptr<const KsURL::DocumentIdentifierSource> source;
    {
        DocumentIdentifiers& identifiers = documentIdentifiers();
        const MutexLock lock(identifiers.mutex);
        source = identifiers.source;
    }
    return source && *source ? (*source)(status) : 0;
}

}  // namespace

std::optional<std::string> percentDecoded(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            out += text[i];
            continue;
        }
        if (text.size() - i < 3) return std::nullopt;
        const int high = hexValue(text[i + 1]);
        const int low = hexValue(text[i + 2]);
        if (high < 0 || low < 0) return std::nullopt;
        out += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return out;
}

std::string_view resourceKeyName(ResourceKey key) {
    switch (key) {
        case ResourceKey::fileID: return "_kKcURLFileIDKey";
        case ResourceKey::documentIdentifier: return "KsURLDocumentIdentifierKey";
        case ResourceKey::isPackage: return "KsURLIsPackageKey";
        case ResourceKey::fileSize: return "KsURLFileSizeKey";
        case ResourceKey::creationDate: return "KsURLCreationDateKey";
        case ResourceKey::contentModificationDate: return "KsURLContentModificationDateKey";
        case ResourceKey::isWritable: return "KsURLIsWritableKey";
        case ResourceKey::name: return "KsURLNameKey";
        case ResourceKey::typeIdentifier: return "KsURLTypeIdentifierKey";
    }
    std::abort();  // No other value is made.
}

std::string_view resourceValueClass(const ResourceValue& value) {
    static constexpr std::array<std::string_view, 5> kClasses{"KsNumber", "KsNumber", "KsDate", "KsString", "KsData"};
    return kClasses[value.index()];
}

/// Values that were put into the cache, and outrank what the file system says.
struct KsURL::Overrides {
    std::vector<std::pair<ResourceKey, std::optional<ResourceValue>>> values;
};

/// Where the object is for system calls: a directory and a name in it, or the object's own descriptor and no name.
struct KsURL::Place {
    int directory = -1;
    const char* name = "";
    UniqueFd own;
};

KsURL KsURL::fileURL(std::string path) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    KsURL url;
    url.path_ = std::move(path);
    return url;
}

KsURL KsURL::child(std::shared_ptr<const DirectoryReference> directory, std::string_view name) {
    KsURL url;
    url.path_.reserve(directory->path.size() + 1 + name.size());
    url.path_ = directory->path;
    if (!url.path_.ends_with('/')) url.path_ += '/';
    url.path_ += name;
    url.directory_ = std::move(directory);
    return url;
}

std::optional<KsURL> KsURL::seenChild(std::shared_ptr<const DirectoryReference> directory, std::string_view name,
                                      const FileStatus& status) {
    const std::optional<bool> isWritable = sys::isWritableByStatus(status, directory->traits.ownerWhoseModeDecides);
    if (!isWritable) return std::nullopt;
    bool isRead = false;
    const auto reader = [&isRead](std::size_t) -> std::optional<Bytes> {
        isRead = true;
        return std::nullopt;
    };
    const InternedString type = TypeDatabase::shared().typeOf(status.mode, name, status.size, reader);
    if (isRead) return std::nullopt;
    KsURL url = child(std::move(directory), name);
    url.status_ = status;
    url.attributeNames_.emplace();
    url.typeIdentifier_ = type;
    url.isWritable_ = isWritable;
    url.wasSeenBefore_ = true;
    return url;
}

KsURL KsURL::of(const DirectoryReference& directory) {
    KsURL url = fileURL(directory.path);
    url.status_ = directory.status;
    return url;
}

std::optional<KsURL> KsURL::parse(std::string_view text) {
    static constexpr std::string_view kScheme = "file:";
    if (text.size() < kScheme.size() || ::strncasecmp(text.data(), kScheme.data(), kScheme.size()) != 0) {
        KsURL url;
        url.path_ = text;
        url.isFileURL_ = false;
        return url;
    }
    text.remove_prefix(kScheme.size());
    if (text.starts_with("//")) {
        text.remove_prefix(2);
        if (text.starts_with("localhost/")) text.remove_prefix(std::string_view("localhost").size());
    }
    if (!text.starts_with('/') || text.find_first_of("?#") != std::string_view::npos) return std::nullopt;
    std::optional<std::string> path = percentDecoded(text);
    if (!path || path->find('\0') != std::string::npos) return std::nullopt;
    return fileURL(*std::move(path));
}

std::string_view KsURL::lastPathComponent() const {
    if (path_.size() <= 1) return path_;
    return std::string_view(path_).substr(path_.rfind('/') + 1);
}

KsURL KsURL::appendingPathComponent(std::string_view name) const {
    std::string path = path_;
    if (!path.ends_with('/')) path += '/';
    path += name;
    return fileURL(std::move(path));
}

std::optional<KsURL> KsURL::deletingLastPathComponent() const {
    if (!isFileURL_ || path_.size() <= 1) return std::nullopt;
    const std::size_t slash = path_.rfind('/');
    return fileURL(slash == 0 ? "/" : path_.substr(0, slash));
}

void KsURL::appendAbsoluteString(std::string& out, std::string_view path) {
    static constexpr char kHex[] = "0123456789ABCDEF";
    for (std::size_t i = 0; i < path.size();) {
        std::size_t end = i;
        while (end < path.size() && kKeptInURLs[static_cast<unsigned char>(path[end])]) ++end;
        out.append(path.substr(i, end - i));
        if (end == path.size()) return;
        const auto byte = static_cast<unsigned char>(path[end]);
        const char encoded[] = {'%', kHex[byte >> 4], kHex[byte & 15]};
        out.append(encoded, sizeof encoded);
        i = end + 1;
    }
}

std::string KsURL::absoluteString() const {
    if (!isFileURL_) return path_;
    std::string text = "file://";
    appendAbsoluteString(text, path_);
    return text;
}

Result<KsURL::Place> KsURL::place() const {
    if (!isFileURL_) return KsError::posix(EINVAL, path_);
    Place place;
    if (directory_ && directory_->fd) {
        place.directory = directory_->fd.get();
        place.name = path_.c_str() + path_.rfind('/') + 1;
        return place;
    }
    place.own = TRY(RootDirectories::open(path_, O_PATH));
    place.directory = place.own.get();
    return place;
}

Result<UniqueFd> KsURL::open(int flags) const {
    if (!isFileURL_) return KsError::posix(EINVAL, path_);
    if (directory_ && directory_->fd)
        return sys::openat(directory_->fd.get(), path_.c_str() + path_.rfind('/') + 1, flags | O_NOFOLLOW);
    return RootDirectories::open(path_, flags);
}

Result<FileStatus> KsURL::status() const {
    if (status_) return *status_;
    const Place where = TRY(place());
    status_ = TRY(sys::statx(where.directory, where.name));
    return *status_;
}

Result<InternedString> KsURL::typeIdentifier() const {
    if (typeIdentifier_) return *typeIdentifier_;
    const FileStatus status = TRY(this->status());
    const auto reader = [this](std::size_t count) -> std::optional<Bytes> {
        const Result<Place> where = place();
        if (!where.ok()) return std::nullopt;
        Result<Bytes> bytes = sys::readBeginning(where->directory, where->name, count);
        return bytes.ok() ? std::optional(std::move(*bytes)) : std::nullopt;
    };
    typeIdentifier_ = TypeDatabase::shared().typeOf(status.mode, lastPathComponent(), status.size, reader);
    return *typeIdentifier_;
}

Result<bool> KsURL::isPackage() const {
    if (isPackage_) return *isPackage_;
    const FileStatus status = TRY(this->status());
    isPackage_ = status.isDirectory() && TypeDatabase::shared().isPackageName(lastPathComponent());
    return *isPackage_;
}

Result<bool> KsURL::isWritable() const {
    if (isWritable_) return *isWritable_;
    if (directory_ && status_)
        isWritable_ = sys::isWritableByStatus(*status_, directory_->traits.ownerWhoseModeDecides);
    if (isWritable_) return *isWritable_;
    const Place where = TRY(place());
    isWritable_ = TRY(sys::isWritable(where.directory, where.name));
    return *isWritable_;
}

Result<std::uint16_t> KsURL::linkCount() const {
    if (linkCount_) return *linkCount_;
    if (!TRY(status()).isDirectory()) return std::uint16_t{1};
    const Place where = TRY(place());
    // Through "." and not by the descriptor itself: an O_PATH descriptor can't be read from.
    const std::uint64_t entries = TRY(sys::countEntries(where.directory, where.name, kCountedEntriesMax));
    linkCount_ = static_cast<std::uint16_t>(entries + 2);
    return *linkCount_;
}

bool KsURL::ts_isFolder() const {
    const Result<FileStatus> status = this->status();
    if (!status.ok() || !status->isDirectory()) return false;
    return !isPackage().valueOr(false);
}

void KsURL::loadAttributeNames() const {
    if (attributeNames_) return;
    const Result<Place> where = place();
    if (!where.ok()) return;
    std::string names;
    if (sys::hasXattrs(where->directory, where->name, names).ok()) attributeNames_ = std::move(names);
}

namespace {

/// Whether one of the NUL-terminated names is what is looked for.
template <typename Test>
bool anyName(std::string_view names, Test test) {
    while (!names.empty()) {
        const std::size_t end = std::min(names.find('\0'), names.size());
        if (test(names.substr(0, end))) return true;
        names.remove_prefix(std::min(end + 1, names.size()));
    }
    return false;
}

}  // namespace

bool KsURL::mayHaveAttribute(std::string_view name) const {
    return !attributeNames_ || anyName(*attributeNames_, [name](std::string_view one) { return one == name; });
}

bool KsURL::mayHaveAttributeWithPrefix(std::string_view prefix) const {
    return !attributeNames_ ||
           anyName(*attributeNames_, [prefix](std::string_view one) { return one.starts_with(prefix); });
}

Result<std::size_t> KsURL::attribute(const char* name, std::span<std::byte> buffer) const {
    const Place where = TRY(place());
    return sys::getxattrat(where.directory, where.name, name, buffer);
}

Result<std::optional<ResourceValue>> KsURL::resourceValue(ResourceKey key) const {
    if (overrides_) {
        const auto found =
            std::ranges::find(overrides_->values, key, &std::pair<ResourceKey, std::optional<ResourceValue>>::first);
        if (found != overrides_->values.end()) return found->second;
    }
    Result<std::optional<ResourceValue>> value = readResourceValue(key);
    if (!value.ok() && isNotFound(value.error()))
        return KsError(kKsGeneralErrorDomain, kKsFileNoSuchFileError, {{"path", path_}});
    return value;
}

Result<std::optional<ResourceValue>> KsURL::readResourceValue(ResourceKey key) const {
    using Value = std::optional<ResourceValue>;
    switch (key) {
        case ResourceKey::fileID: return Value(TRY(status()).fileID);
        case ResourceKey::documentIdentifier: {
            if (!documentIdentifier_) documentIdentifier_ = storedDocumentIdentifier(TRY(status()));
            return *documentIdentifier_ == 0 ? Value() : Value(std::uint64_t{*documentIdentifier_});
        }
        case ResourceKey::isPackage: return Value(TRY(isPackage()));
        case ResourceKey::fileSize: return Value(TRY(status()).size);
        case ResourceKey::creationDate: {
            const FileStatus status = TRY(this->status());
            return status.birthTime ? Value(*status.birthTime) : Value();
        }
        case ResourceKey::contentModificationDate: return Value(TRY(status()).modificationTime);
        case ResourceKey::isWritable: return Value(TRY(isWritable()));
        case ResourceKey::name: return Value(std::string(lastPathComponent()));
        case ResourceKey::typeIdentifier: return Value(TRY(typeIdentifier()).string());
    }
    std::abort();  // No other value is made.
}

void KsURL::setCachedResourceValue(ResourceKey key, std::optional<ResourceValue> value) {
    if (key == ResourceKey::documentIdentifier && !overrides_ && value &&
        std::holds_alternative<std::uint64_t>(*value)) {
        documentIdentifier_ = static_cast<std::uint32_t>(std::get<std::uint64_t>(*value));
        return;
    }
    auto overrides = std::make_shared<Overrides>(overrides_ ? *overrides_ : Overrides());
    std::erase_if(overrides->values, [key](const auto& other) { return other.first == key; });
    overrides->values.emplace_back(key, std::move(value));
    overrides_ = std::move(overrides);
}

void KsURL::removeCachedResourceValues() {
    overrides_.reset();
    status_.reset();
    attributeNames_.reset();
    documentIdentifier_.reset();
    typeIdentifier_.reset();
    isPackage_.reset();
    isWritable_.reset();
    linkCount_.reset();
}

void KsURL::setDocumentIdentifierSource(DocumentIdentifierSource source) {
    DocumentIdentifiers& identifiers = documentIdentifiers();
    const MutexLock lock(identifiers.mutex);
    identifiers.source = std::make_shared<const DocumentIdentifierSource>(std::move(source));
}

}  // namespace cindral
