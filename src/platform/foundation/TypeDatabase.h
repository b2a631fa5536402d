#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/foundation/InternedString.h"

namespace cindral {

inline constexpr std::string_view kPackageTypeIdentifier = "com.vemra.package";

/// What kind of content a file holds: the shared MIME database, and the types that the system declares by extension.
///
/// Thread safety: immutable once made.
class TypeDatabase {
public:
    /// A type that is declared by file extension. Of folders only: "report.folio" that is a regular file is what the
    /// MIME database says of it.
    struct Declaration {
        std::string extension;   ///< without the dot; compared without case
        std::string identifier;  ///< reverse-DNS name
        std::string conformsTo;  ///< identifier of the parent type
    };

    /// The database of this machine: every "mime" folder of XDG_DATA_HOME and XDG_DATA_DIRS, read once.
    static const TypeDatabase& shared();

    /// From the given data directories (each holding a "mime" folder), most important first; missing files count as
    /// empty.
    static std::unique_ptr<TypeDatabase> load(std::span<const std::string> dataDirectories,
                                              std::span<const Declaration> declared);
    static std::span<const Declaration> builtInDeclarations();

    /// Bytes of the file from its beginning, at most as many as asked for; none when they can't be read.
    using ContentReader = std::function<std::optional<Bytes>(std::size_t count)>;

    /// Type of an object by its kind (st_mode) and name, and by its contents only when it is a regular file whose name
    /// says nothing. Never empty. `size` is st_size; an empty file without a telling name is "application/x-zerosize".
    InternedString typeOf(mode_t mode, std::string_view name, std::uint64_t size, const ContentReader& reader) const;

    /// Type of a regular file by its name alone; empty when the name says nothing.
    InternedString typeOfName(std::string_view name) const;
    /// Type by the first bytes alone; empty when they say nothing. `text/plain` or `application/octet-stream` are the
    /// caller's.
    InternedString typeOfContents(ByteView beginning) const;
    /// Bytes that typeOfContents can make use of.
    std::size_t contentBytesMax() const;

    /// Whether the type is the other or conforms to it, through declared parents, subclasses and aliases.
    bool conforms(std::string_view type, std::string_view to) const;
    /// Whether a folder of that name is a package.
    bool isPackageName(std::string_view folderName) const;
    /// Changes whenever the set of declared types changes.
    std::uint64_t declarationsFingerprint() const;

    ~TypeDatabase();
    TypeDatabase(const TypeDatabase&) = delete;
    TypeDatabase& operator=(const TypeDatabase&) = delete;

private:
    TypeDatabase();
    struct Tables;
    std::unique_ptr<Tables> tables_;
};

}  // namespace cindral
