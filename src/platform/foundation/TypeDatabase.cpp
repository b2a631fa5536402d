#include "platform/foundation/TypeDatabase.h"

#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <functional>
#include <tuple>
#include <utility>
#include <vector>

#include "platform/foundation/DataDirectories.h"
#include "platform/foundation/MimeGlobs.h"
#include "platform/foundation/MimeMagic.h"
#include "platform/foundation/MimeTypes.h"
#include "platform/foundation/Utf8.h"

namespace cindral {

namespace {

/// The installed files have some ten KB. What is beyond this is not read.
constexpr std::size_t kFileBytesMax = 16 * 1024 * 1024;
/// Bytes of a file that decide whether it looks like text.
constexpr std::size_t kTextBytes = 1024;

/// A cut at the limit leaves half a line, which readers of lines must not see; it is taken off.
std::string readDatabaseFile(const std::string& path) {
    // Anything but a regular file could keep the reader waiting for ever.
    std::error_code error;
    if (!std::filesystem::is_regular_file(path, error)) return {};
    std::ifstream stream(path, std::ios::binary);
    std::string text;
    std::array<char, 64 * 1024> buffer;
    while (text.size() < kFileBytesMax && stream.read(buffer.data(), buffer.size()).gcount() > 0) {
        text.append(buffer.data(), static_cast<std::size_t>(stream.gcount()));
    }
    if (text.size() >= kFileBytesMax) text.resize(text.rfind('\n', kFileBytesMax - 1) + 1);
    return text;
}

std::string lowerCase(std::string_view text) {
    std::string folded(text);
    std::ranges::transform(folded, folded.begin(), lowerASCII);
    return folded;
}

/// What follows the last dot; empty without one. A leading dot hides a name, it does not begin an extension.
std::string_view extensionOf(std::string_view name) {
    const std::size_t dot = name.rfind('.');
    return dot == std::string_view::npos || dot == 0 ? std::string_view() : name.substr(dot + 1);
}

bool isControl(unsigned char byte) {
    constexpr std::string_view kInText{"\t\n\v\f\r\b\x1b", 7};  // Backspace and escape: what terminals were sent.
    return (byte < 0x20 && kInText.find(static_cast<char>(byte)) == std::string_view::npos) || byte == 0x7f;
}

/// Length of the UTF-8 sequence that the byte begins; 0 for a byte that begins none.
std::size_t sequenceLength(unsigned char lead) {
    if (lead < 0x80) return 1;
    if (lead >= 0xc2 && lead <= 0xdf) return 2;
    if (lead >= 0xe0 && lead <= 0xef) return 3;
    return lead >= 0xf0 && lead <= 0xf4 ? 4 : 0;
}

bool isUTF8(std::string_view text) {
    while (!text.empty()) {
        const std::size_t length = sequenceLength(static_cast<unsigned char>(text[0]));
        if (length == 0) return false;
        const std::string_view tail = text.substr(1, length - 1);  // Shorter where the reading ended within it.
        if (!std::ranges::all_of(tail, [](char c) { return (static_cast<unsigned char>(c) & 0xc0U) == 0x80; }))
            return false;
        text.remove_prefix(tail.size() + 1);
    }
    return true;
}

/// No control characters, and UTF-8 or, for older encodings, mostly ASCII.
bool looksLikeText(ByteView beginning) {
    const std::string_view text = textOf(beginning).substr(0, kTextBytes);
    if (std::ranges::any_of(text, [](char c) { return isControl(static_cast<unsigned char>(c)); })) return false;
    const auto ascii = std::ranges::count_if(text, [](char c) { return static_cast<unsigned char>(c) < 0x80; });
    return isUTF8(text) || static_cast<std::size_t>(ascii) * 4 >= text.size() * 3;
}

/// FNV-1a, over the bytes of the text and its length.
std::uint64_t mixIn(std::uint64_t hash, std::string_view text) {
    constexpr std::uint64_t kPrime = 0x100000001b3;
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * kPrime;
    return (hash ^ (0x100 + text.size())) * kPrime;
}

}  // namespace

struct TypeDatabase::Tables {
    struct Folder {
        InternedString type;
        bool isPackage = false;
    };

    MimeTypes types;
    MimeGlobs globs;
    MimeMagic magic;
    std::vector<InternedString> interned;                            ///< by MimeType
    std::vector<std::pair<std::string, Folder>> foldersByExtension;  ///< few; lower-case
    std::uint64_t fingerprint = 0xcbf29ce484222325;

    InternedString directory{"inode/directory"};
    InternedString symlink{"inode/symlink"};
    InternedString fifo{"inode/fifo"};
    InternedString socket{"inode/socket"};
    InternedString characterDevice{"inode/chardevice"};
    InternedString blockDevice{"inode/blockdevice"};
    InternedString zeroSize{"application/x-zerosize"};
    InternedString plainText{"text/plain"};
    InternedString octetStream{"application/octet-stream"};

    InternedString text(std::optional<MimeType> type) const {
        return type ? interned[static_cast<std::size_t>(*type)] : InternedString();
    }
    void readFiles(std::span<const std::string> dataDirectories);
    void declare(std::span<const Declaration> declared);
    const Folder* folder(std::string_view name) const;
    /// Of a file that is not empty and whose name says nothing.
    InternedString typeOfFileContents(const ContentReader& reader) const;
};

void TypeDatabase::Tables::readFiles(std::span<const std::string> dataDirectories) {
    // Aliases first, so that every later mention of a type means the same one.
    for (const auto& folder : dataDirectories) types.addAliases(readDatabaseFile(folder + "/mime/aliases"));
    for (const auto& folder : dataDirectories) {
        types.addSubclasses(readDatabaseFile(folder + "/mime/subclasses"));
        globs.add(readDatabaseFile(folder + "/mime/globs2"), types);
        magic.add(bytesOf(readDatabaseFile(folder + "/mime/magic")), types);
    }
}

void TypeDatabase::Tables::declare(std::span<const Declaration> declared) {
    std::vector<std::tuple<std::string, std::string, std::string>> sorted;
    for (const auto& [extension, identifier, parent] : declared) {
        const MimeType type = types.add(identifier);
        if (!parent.empty()) types.addParent(type, types.add(parent));
        sorted.emplace_back(lowerCase(extension), identifier, parent);
    }
    for (const auto& declaration : declared) {
        if (declaration.extension.empty()) continue;
        const bool isPackage = types.conforms(declaration.identifier, kPackageTypeIdentifier);
        foldersByExtension.emplace_back(lowerCase(declaration.extension),
                                        Folder{InternedString(declaration.identifier), isPackage});
    }
    // The set counts, not the order in which it was given.
    std::ranges::sort(sorted);
    for (const auto& [extension, identifier, parent] : sorted) {
        fingerprint = mixIn(mixIn(mixIn(fingerprint, extension), identifier), parent);
    }
}

const TypeDatabase::Tables::Folder* TypeDatabase::Tables::folder(std::string_view name) const {
    const std::string_view extension = extensionOf(name);
    if (extension.empty()) return nullptr;
    const auto found = std::ranges::find_if(foldersByExtension, [&](const auto& declared) {
        return std::ranges::equal(extension, declared.first, std::equal_to(), lowerASCII);
    });
    return found == foldersByExtension.end() ? nullptr : &found->second;
}

InternedString TypeDatabase::Tables::typeOfFileContents(const ContentReader& reader) const {
    const auto beginning = reader ? reader(std::max(magic.contentBytesMax(), kTextBytes)) : std::nullopt;
    if (!beginning) return octetStream;
    if (beginning->empty()) return zeroSize;  // Emptied since its size was asked.
    if (const auto type = magic.find(*beginning)) return text(type);
    return looksLikeText(*beginning) ? plainText : octetStream;
}

TypeDatabase::TypeDatabase() : tables_(std::make_unique<Tables>()) {}
TypeDatabase::~TypeDatabase() = default;

const TypeDatabase& TypeDatabase::shared() {
    // Never freed: types may be asked for while the process ends.
    static const TypeDatabase& database = *load(dataDirectories(), builtInDeclarations()).release();
    return database;
}

std::unique_ptr<TypeDatabase> TypeDatabase::load(std::span<const std::string> dataDirectories,
                                                 std::span<const Declaration> declared) {
    std::unique_ptr<TypeDatabase> database(new TypeDatabase);
    Tables& tables = *database->tables_;
    tables.readFiles(dataDirectories);
    tables.declare(declared);
    for (std::size_t i = 0; i < tables.types.size(); ++i) {
        tables.interned.emplace_back(tables.types.name(tables.types.canonical(MimeType(i))));
    }
    return database;
}

std::span<const TypeDatabase::Declaration> TypeDatabase::builtInDeclarations() {
    static const std::array<Declaration, 3> kDeclarations{{
        {"", std::string(kPackageTypeIdentifier), "inode/directory"},
        {"folio", "com.vemra.folio.document", std::string(kPackageTypeIdentifier)},
        {"tonemill", "com.vemra.tonemill.project", std::string(kPackageTypeIdentifier)},
    }};
    return kDeclarations;
}

InternedString TypeDatabase::typeOf(mode_t mode, std::string_view name, std::uint64_t size,
                                    const ContentReader& reader) const {
    const Tables& tables = *tables_;
    switch (mode & S_IFMT) {
        case S_IFREG: break;
        case S_IFDIR: {
            const Tables::Folder* declared = tables.folder(name);
            return declared == nullptr ? tables.directory : declared->type;
        }
        case S_IFLNK: return tables.symlink;
        case S_IFIFO: return tables.fifo;
        case S_IFSOCK: return tables.socket;
        case S_IFCHR: return tables.characterDevice;
        case S_IFBLK: return tables.blockDevice;
        default: return tables.octetStream;
    }
    if (const InternedString type = typeOfName(name); !type.empty()) return type;
    return size == 0 ? tables.zeroSize : tables.typeOfFileContents(reader);
}

InternedString TypeDatabase::typeOfName(std::string_view name) const {
    return tables_->text(tables_->globs.find(name));
}

InternedString TypeDatabase::typeOfContents(ByteView beginning) const {
    return tables_->text(tables_->magic.find(beginning));
}

std::size_t TypeDatabase::contentBytesMax() const {
    return tables_->magic.contentBytesMax();
}

bool TypeDatabase::conforms(std::string_view type, std::string_view to) const {
    return tables_->types.conforms(type, to);
}

bool TypeDatabase::isPackageName(std::string_view folderName) const {
    const Tables::Folder* declared = tables_->folder(folderName);
    return declared != nullptr && declared->isPackage;
}

std::uint64_t TypeDatabase::declarationsFingerprint() const {
    return tables_->fingerprint;
}

}  // namespace cindral
