#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/foundation/KsDate.h"

namespace cindral {

/// Writes a ZIP archive as its contents come: what was written is never gone back to, and nothing is kept but the list
/// of what is in it, which stands at the end.
///
/// Sizes and sums of documents follow their bytes; whatever needs more than 32 bits (and more than 65,534 entries) is
/// written as ZIP64. Names that are UTF-8 say so; others are the bytes that they are. A "\" in a name, by which some
/// systems would part folders, is written as U+FF3C, which looks like it.
///
/// The first false of the sink is the end: every call after that returns false.
///
/// Thread safety: for one thread at a time.
class ZipWriter {
public:
    /// False where nobody takes any more.
    using Sink = std::function<bool(std::string_view bytes)>;
    /// Longest path of an entry, in bytes as it is written.
    static constexpr std::size_t kPathBytesMax = 0xFFFF;

    explicit ZipWriter(Sink sink);
    ~ZipWriter();
    ZipWriter(const ZipWriter&) = delete;
    ZipWriter& operator=(const ZipWriter&) = delete;

    /// Whether an entry can have this path.
    static bool canHold(std::string_view path);

    /// Paths are relative; "/" parts the folders.
    bool addFolder(std::string_view path, const KsDate& changed);

    struct Document {
        std::string_view path;
        KsDate changed;
        std::uint64_t size = 0;  ///< no more bytes than this follow
        bool isExecutable = false;
        bool isPacked = true;  ///< false for what no packing makes smaller
    };
    bool beginDocument(const Document& document);
    bool append(std::string_view bytes);
    bool endDocument();

    /// The list of all.
    bool finish();

private:
    class Packer;
    struct Entry;
    bool put(std::string_view bytes);
    void begin(Entry entry);
    void list(const Entry& entry);

    const Sink sink_;
    std::unique_ptr<Packer> packer_;
    std::unique_ptr<Entry> current_;
    std::string central_;
    std::string packed_;
    std::uint64_t entries_ = 0;
    std::uint64_t position_ = 0;
    bool isOver_ = false;
};

}  // namespace cindral
