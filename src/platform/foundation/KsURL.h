#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/foundation/Data.h"
#include "platform/foundation/InternedString.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Sys.h"

namespace cindral {

/// What a URL can be asked about the object that it names.
enum class ResourceKey {
    fileID,                   ///< "_kKcURLFileIDKey": number
    documentIdentifier,       ///< "KsURLDocumentIdentifierKey": number
    isPackage,                ///< "KsURLIsPackageKey": bool
    fileSize,                 ///< "KsURLFileSizeKey": number, bytes
    creationDate,             ///< "KsURLCreationDateKey": date
    contentModificationDate,  ///< "KsURLContentModificationDateKey": date
    isWritable,               ///< "KsURLIsWritableKey": bool
    name,                     ///< "KsURLNameKey": string
    typeIdentifier,           ///< "KsURLTypeIdentifierKey": string
};
std::string_view resourceKeyName(ResourceKey key);

using ResourceValue = std::variant<bool, std::uint64_t, KsDate, std::string, Bytes>;
/// Name of the class that the value is of: "KsNumber" (also of a bool), "KsDate", "KsString", "KsData".
std::string_view resourceValueClass(const ResourceValue& value);

/// The bytes that a percent-encoded text stands for; none where a "%" is not followed by two hexadecimal digits.
std::optional<std::string> percentDecoded(std::string_view text);

/// The name of a file, with what has been read about it.
///
/// A file URL holds an absolute path as bytes, without trailing slashes; "." and ".." stay as they are. Anything else
/// is kept as text and names no file. Values read about the object are cached in the URL and in every copy made
/// afterwards, until removeCachedResourceValues(); they are of the object itself, never of what a link points to.
///
/// A URL made by child() reads through the directory's descriptor (cheaper, and of any path length) until it is
/// detached.
///
/// Thread safety: a value, for one thread at a time: also reading fills the cache.
class KsURL {
public:
    static KsURL fileURL(std::string path);
    /// The entry of an open directory. `directory` stays open for as long as the URL is not detached.
    static KsURL child(std::shared_ptr<const DirectoryReference> directory, std::string_view name);
    /// The same of an entry whose status is known, and that it has no extended attributes. Everything that is to be told
    /// of it is known then, and it is not looked at; none where something can't be told without a look.
    static std::optional<KsURL> seenChild(std::shared_ptr<const DirectoryReference> directory, std::string_view name,
                                          const FileStatus& status);
    bool wasSeenBefore() const { return wasSeenBefore_; }
    /// The open directory itself, with its status as it is known already.
    static KsURL of(const DirectoryReference& directory);
    /// Reads a URL as text. None for a file URL that is malformed, relative, of another machine, or holds a NUL.
    static std::optional<KsURL> parse(std::string_view text);

    bool isFileURL() const { return isFileURL_; }
    /// Bytes of the path; the text itself where this is no file URL.
    const std::string& path() const { return path_; }
    /// "/" for the top directory.
    std::string_view lastPathComponent() const;
    /// `name` may hold several components.
    KsURL appendingPathComponent(std::string_view name) const;
    /// None for the top directory and where this is no file URL. Nothing is cached in it.
    std::optional<KsURL> deletingLastPathComponent() const;
    /// "file://" and the path, percent-encoded byte by byte except for unreserved characters and "/".
    std::string absoluteString() const;
    static void appendAbsoluteString(std::string& out, std::string_view path);
    std::string description() const { return absoluteString(); }

    friend bool operator==(const KsURL& a, const KsURL& b) {
        return a.path_ == b.path_ && a.isFileURL_ == b.isFileURL_;
    }

    /// A value that was set or read before, or what the file system says now. None is "no value".
    ///
    /// Error 260 of the general domain when there is no such object; of the POSIX domain for everything else.
    Result<std::optional<ResourceValue>> resourceValue(ResourceKey key) const;
    /// Puts a value, or the absence of one, into the cache.
    void setCachedResourceValue(ResourceKey key, std::optional<ResourceValue> value);
    void removeCachedResourceValues();

    /// The same values without the detour through ResourceValue, for the paths where cost matters.
    Result<FileStatus> status() const;
    Result<InternedString> typeIdentifier() const;
    Result<bool> isPackage() const;
    Result<bool> isWritable() const;
    /// A folder's entries plus 2, saturating at what 16 bits hold: link counts don't count files here. 1 for anything
    /// else.
    Result<std::uint16_t> linkCount() const;

    /// The folder test of the host: a directory that is no package. False when it can't be told.
    bool ts_isFolder() const;  // NOLINT(readability-identifier-naming)

    /// One look at which attributes there are; mayHaveAttribute() then answers without a system call.
    void loadAttributeNames() const;
    /// False when it is known that the attribute is absent. `name` with its namespace ("user.…").
    bool mayHaveAttribute(std::string_view name) const;
    /// The same of every name that begins like this.
    bool mayHaveAttributeWithPrefix(std::string_view prefix) const;
    /// Reads into the buffer, or tells the size when it is empty.
    Result<std::size_t> attribute(const char* name, std::span<std::byte> buffer) const;

    /// Opens the object itself.
    Result<UniqueFd> open(int flags) const;
    const std::shared_ptr<const DirectoryReference>& directory() const { return directory_; }
    /// Lets go of the directory's descriptor; what was read stays.
    void detach() { directory_.reset(); }

    /// Where document identifiers are looked up; answers 0 for none. Set once, by the store that keeps them.
    using DocumentIdentifierSource = std::function<std::uint32_t(const FileStatus&)>;
    static void setDocumentIdentifierSource(DocumentIdentifierSource source);

private:
    KsURL() = default;
    struct Place;
    Result<Place> place() const;
    Result<std::optional<ResourceValue>> readResourceValue(ResourceKey key) const;

    struct Overrides;
    std::string path_;
    std::shared_ptr<const DirectoryReference> directory_;
    std::shared_ptr<const Overrides> overrides_;
    mutable std::optional<FileStatus> status_;
    mutable std::optional<std::string> attributeNames_;
    mutable std::optional<std::uint32_t> documentIdentifier_;
    mutable std::optional<InternedString> typeIdentifier_;
    mutable std::optional<bool> isPackage_;
    mutable std::optional<bool> isWritable_;
    mutable std::optional<std::uint16_t> linkCount_;
    bool isFileURL_ = true;
    bool wasSeenBefore_ = false;
};

}  // namespace cindral
