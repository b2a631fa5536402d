#include "provider/KsURL+CdlFileObjectIdentifier.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "platform/foundation/Log.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselManager.h"
#include "provider/LocalAppLibraryManager.h"
#include "provider/Utilities.h"

namespace cindral {

namespace {

constexpr std::string_view kFileHost = "fid";
constexpr std::string_view kDocumentHost = "did";
// Bytes of the buffer that a path by file ID is asked into, its NUL included.
constexpr std::size_t kPathBufferSize = 1024;
constexpr int kDocumentResolutionRetriesMax = 5;
constexpr unsigned kDocumentResolutionRestMicroseconds = 1000;
// "For event notification only": the object itself, without opening its contents or following a link.
constexpr int kEventOnlyFlags = O_PATH | O_NOFOLLOW;

/// The root that a proper path is inside of, as text.
struct MatchedRoot {
    std::shared_ptr<const KsURL> url;
    bool isStorage = false;
};

std::optional<MatchedRoot> matchRoot(std::string_view path) {
    std::string rewritten;
    const auto begins = [&](const KsURL& root) { return path.starts_with(properPath(root.path(), rewritten)); };
    const auto libraries = CdlAppLibraryManager::sharedRootURLsForAppLibraries();
    for (const KsURL& root : *libraries) {
        if (begins(root)) return MatchedRoot{std::make_shared<const KsURL>(root), false};
    }
    auto storage = TesselManager::defaultManager().sharedDocumentStorageURL();
    if (begins(*storage)) return MatchedRoot{std::move(storage), true};
    return std::nullopt;
}

/// Numbers of another device than the roots' name nothing that is published. Entries of an open folder were asked before.
bool isOfAnotherDevice(const KsURL& url) {
    if (url.directory()) return false;
    const Result<FileStatus> status = url.status();
    return status.ok() && !RootDirectories::shared().isPublishedDevice(status->device);
}

void logMissingResource(std::string_view key, const KsError& error) {
    const LogLevel level = error.is(kKsGeneralErrorDomain, kKsFileNoSuchFileError) ? LogLevel::debug : LogLevel::error;
    logPlain(level, "can't get resource value for {}; {}", key, error.description());
}

/// A number held by reference, as the platform's collections hold it.
struct BoxedNumber {
    std::uint64_t value;
};

void cacheValue(KsURL& url, ResourceKey key, std::uint64_t value) {
    // The cache takes every value on this platform; there is no failure to log.
    url.setCachedResourceValue(key, value);
}

std::optional<TesselItemIdentifier> identifierFromFileSystem(KsURL& url) {
    const Result<bool> isPackage = url.isPackage();
    if (!isPackage.ok()) {
        logPlain(LogLevel::error, "can't get resource KsURLIsPackageKey for \"{}\"; {}", url.path(),
                 isPackage.error().description());
        return std::nullopt;
    }
    const Result<UniqueFd> fd = url.open(kEventOnlyFlags);
    if (!fd.ok()) {
        logPlain(LogLevel::error, "can't open file at \"{}\"; {}", url.path(),
                 errnoText(static_cast<int>(fd.error().code())));
        return std::nullopt;
    }
    const Result<FileStatus> status = sys::statx(fd->get(), "");
    if (!status.ok()) {
        logPlain(LogLevel::error, "can't get attribute list for \"{}\"; {}", url.path(),
                 errnoText(static_cast<int>(status.error().code())));
        return std::nullopt;
    }
    if (status->isRegular() || (status->isDirectory() && *isPackage)) {
        const std::uint32_t documentID = RvStorageManager::defaultManager().documentIDForDescriptor(fd->get());
        if (documentID == 0) {
            logPlain(LogLevel::error, "can't get permanent storage for \"{}\"", url.path());
            return std::nullopt;
        }
        cacheValue(url, ResourceKey::documentIdentifier, documentID);
        return CdlFileObjectIdentifier::fromDocumentID(documentID);
    }
    if (!status->isDirectory()) return CdlFileObjectIdentifier::fromFileID(status->fileID);
    // Reached only for a folder whose cached file number was absent. The digits are the boxed number's reference value:
    // such an identifier is good for one listing's lifetime only, and clients that hold one from before depend on
    // nothing else.
    const auto boxed = std::make_unique<BoxedNumber>(BoxedNumber{status->fileID});
    cacheValue(url, ResourceKey::fileID, boxed->value);
    return CdlFileObjectIdentifier::fromFileID(reinterpret_cast<std::uintptr_t>(boxed.get()));
}

struct NumberKind {
    ResourceKey key;
    std::string_view name;
    const char* what;
};
constexpr NumberKind kFolderNumber{ResourceKey::fileID, "_kKcURLFileIDKey", "file ID"};
constexpr NumberKind kDocumentNumber{ResourceKey::documentIdentifier, "KsURLDocumentIdentifierKey", "doc ID"};

void assertNumber(const NumberKind& kind, const ResourceValue& value) {
#ifndef NDEBUG
    if (std::holds_alternative<std::uint64_t>(value)) return;
    fmt::print(stderr, "unexpected class for {} (expected: KsNumber, actual: {})\n", kind.what,
               resourceValueClass(value));
    std::abort();
#else
    (void)kind, (void)value;
#endif
}

/// The lenient reading of an integer: leading blanks and a sign, then digits up to the first other character; 0 without
/// digits. What is written is unsigned, so numbers beyond the signed ones keep their bits; beyond those, it saturates.
std::int64_t lenientInteger(const std::string& text) {
    errno = 0;
    const std::int64_t number = std::strtoll(text.c_str(), nullptr, 10);
    if (errno != ERANGE || number < 0) return number;
    return static_cast<std::int64_t>(std::strtoull(text.c_str(), nullptr, 10));
}

}  // namespace

TesselItemIdentifier CdlFileObjectIdentifier::fromFileID(std::uint64_t fileID) {
    const fmt::format_int digits(fileID);
    TesselItemIdentifier identifier("fid=");
    return identifier.append(digits.data(), digits.size());
}

TesselItemIdentifier CdlFileObjectIdentifier::fromDocumentID(std::uint64_t documentID) {
    const fmt::format_int digits(documentID);
    TesselItemIdentifier identifier("did=");
    return identifier.append(digits.data(), digits.size());
}

std::optional<TesselItemIdentifier> CdlFileObjectIdentifier::fromAppLibraryDataContainerURL(const KsURL& url) {
    if (const auto proxy = RoBundleProxy::proxyAt(url)) return "#" + proxy->bundleIdentifier();
    logFrameworkDefault(LogLevel::error, "[ERROR] can't find bundle proxy at {}", url.description());
    return std::nullopt;
}

std::optional<TesselItemIdentifier> itemIdentifier(KsURL& url) {
    if (!url.isFileURL()) {
        logPlain(LogLevel::error, "can't compute file object identifier if not a file URL");
        return std::nullopt;
    }
    std::string rewritten;
    const std::string_view path = properPath(url.path(), rewritten);
    const std::optional<MatchedRoot> root = matchRoot(path);
    if (!root) {
        logPlain(LogLevel::debug, "can't compute file object identifier because \"{}\" is not part of Cindral Storage",
                 path);
        return std::nullopt;
    }
    std::string rewrittenRoot;
    if (path == properPath(root->url->path(), rewrittenRoot)) {
        if (root->isStorage) return kTesselRootContainerItemIdentifier;
        return CdlFileObjectIdentifier::fromAppLibraryDataContainerURL(*root->url);
    }
    if (isOfAnotherDevice(url)) {
        logPlain(LogLevel::debug, "can't compute file object identifier because \"{}\" is on another device", path);
        return std::nullopt;
    }
    const bool isFolder = url.ts_isFolder();
    const NumberKind& kind = isFolder ? kFolderNumber : kDocumentNumber;
    const Result<std::optional<ResourceValue>> value = url.resourceValue(kind.key);
    if (!value.ok()) {
        logMissingResource(kind.name, value.error());
        return std::nullopt;
    }
    if (*value) {
        assertNumber(kind, **value);
        if (const auto* number = std::get_if<std::uint64_t>(&**value)) {
            return isFolder ? CdlFileObjectIdentifier::fromFileID(*number)
                            : CdlFileObjectIdentifier::fromDocumentID(*number);
        }
    }
    return identifierFromFileSystem(url);
}

namespace {

/// The storage's device, or 0 after a log line.
std::uint32_t storageDevice() {
    const KsURL storage = TesselManager::defaultManager().documentStorageURL();
    std::optional<KsError> error;
    const std::uint32_t device = deviceIDWithError(storage, &error);
    if (device == 0) {
        logPlain(LogLevel::error, "can't get device ID for \"{}\"; {}", storage.path(),
                 errnoText(error ? static_cast<int>(error->code()) : 0));
    }
    return device;
}

/// The file ID of a document, or 0 after a log line. Rests and asks again while the store is busy or what it knows is
/// stale.
std::uint64_t fileIDOfDocument(std::int64_t documentID, std::uint32_t device) {
    for (int retries = 0;; ++retries) {
        errno = 0;
        const std::uint64_t fileID = RvStorageManager::defaultManager().resolveDocumentID(documentID, device);
        const int failure = errno;
        if (fileID != 0) return fileID;
        if (failure != EAGAIN && failure != EBUSY && failure != ESTALE) {
            // Not found is normal: items vanish between a listing and a look-up.
            logPlain(LogLevel::error, "can't resolve doc ID \"{}\"; {}", documentID, errnoText(failure));
            return 0;
        }
        if (retries == kDocumentResolutionRetriesMax) {
            logPlain(LogLevel::debug, "can't resolve doc ID \"{}\" after five attempts", documentID);
            return 0;
        }
        logPlain(LogLevel::debug, "doc ID resolution failed with errno({}), let's try again after resting", failure);
        ::usleep(kDocumentResolutionRestMicroseconds);
    }
}

/// A file number, and the device that it is of.
struct NumberOnDevice {
    std::uint64_t fileID;
    std::uint32_t device;
};

std::optional<NumberOnDevice> numberWithItemIdentifier(const TesselItemIdentifier& identifier) {
    const auto components = static_cast<std::size_t>(std::ranges::count(identifier, '=')) + 1;
    if (components != 2) {
        logPlain(LogLevel::error, "invalid identifier; identifier should have 2 components, not {}", components);
        return std::nullopt;
    }
    const std::size_t separator = identifier.find('=');
    const std::string_view host = std::string_view(identifier).substr(0, separator);
    if (host != kDocumentHost && host != kFileHost) {
        logPlain(LogLevel::error, "invalid host for identifier \"{}\"", identifier);
        return std::nullopt;
    }
    const std::uint32_t device = storageDevice();
    if (device == 0) return std::nullopt;
    const std::int64_t number = lenientInteger(identifier.substr(separator + 1));
    const std::uint64_t fileID =
        host == kFileHost ? static_cast<std::uint64_t>(number) : fileIDOfDocument(number, device);
    if (host == kDocumentHost && fileID == 0) return std::nullopt;
    return NumberOnDevice{fileID, device};
}

}  // namespace

std::optional<KsURL> fileURLWithItemIdentifier(const TesselItemIdentifier& identifier) {
    if (identifier == kTesselRootContainerItemIdentifier) return TesselManager::defaultManager().documentStorageURL();
    const std::optional<NumberOnDevice> number = numberWithItemIdentifier(identifier);
    return number ? fileURLWithFileIdentifierOnDevice(number->fileID, number->device) : std::nullopt;
}

std::optional<std::uint64_t> fileIDWithItemIdentifier(const TesselItemIdentifier& identifier) {
    const std::optional<NumberOnDevice> number = numberWithItemIdentifier(identifier);
    return number ? std::optional(number->fileID) : std::nullopt;
}

std::optional<KsURL> fileURLWithFileIdentifier(std::uint64_t fileID) {
    const std::uint32_t device = storageDevice();
    if (device == 0) return std::nullopt;
    return fileURLWithFileIdentifierOnDevice(fileID, device);
}

std::optional<KsURL> fileURLWithFileIdentifierOnDevice(std::uint64_t fileID, std::uint32_t device) {
    Result<std::string> path = RvStorageManager::defaultManager().pathOfFileID(fileID, device, kPathBufferSize);
    if (!path.ok()) {
        logPlain(LogLevel::debug, "can't resolve path matching file ID \"{}\"; {}", static_cast<std::int64_t>(fileID),
                 errnoText(static_cast<int>(path.error().code())));
        return std::nullopt;
    }
    return KsURL::fileURL(std::move(*path));
}

std::uint32_t deviceIDWithError(const KsURL& url, std::optional<KsError>* error) {
    const Result<UniqueFd> fd = url.open(kEventOnlyFlags);
    const Result<FileStatus> status = fd.ok() ? sys::statx(fd->get(), "") : Result<FileStatus>(fd.error());
    if (status.ok()) return status->deviceID();
    if (error != nullptr) *error = status.error();
    return 0;
}

std::uint32_t deviceID(const KsURL& url) {
    return deviceIDWithError(url, nullptr);
}

namespace {

bool skipText(const char*& at, std::string_view text) {
    if (std::strncmp(at, text.data(), text.size()) != 0) return false;
    at += text.size();
    return true;
}

bool readNumber(const char*& at, std::int64_t* number) {
    char* end = nullptr;
    errno = 0;
    *number = std::strtoll(at, &end, 10);
    if (errno != 0 || end == at) return false;
    at = end;
    return true;
}

}  // namespace

bool parseDocIDChangePath(const char* path, std::int64_t* documentID, std::int64_t* sourceFileID,
                          std::int64_t* destinationFileID) {
    const char* at = path;
    while (*at == '/') ++at;
    if (!skipText(at, ".docid/")) return false;
    if (*at >= '0' && *at <= '9') {
        std::int64_t device = 0;
        if (!readNumber(at, &device) || !skipText(at, "/")) return false;
    }
    return skipText(at, "changed/") && readNumber(at, documentID) && skipText(at, "/src=") &&
           readNumber(at, sourceFileID) && skipText(at, ",dst=") && readNumber(at, destinationFileID) && *at == '\0';
}

}  // namespace cindral
