#include "platform/revisions/TablePages.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <vector>

namespace cindral::tablepages {

namespace {

constexpr std::uint32_t kMetaMagic = 0xBEEFC0DE;
constexpr std::uint32_t kDataVersion = 1;
constexpr std::uint64_t kNoPage = ~std::uint64_t{0};
constexpr std::uint64_t kMetaPages = 2;
constexpr unsigned kDepthMax = 32;  // The library's cursors go no deeper.

enum PageFlags : std::uint16_t {
    kBranch = 0x01,
    kLeaf = 0x02,
    kOverflow = 0x04,
    kMeta = 0x08,
    kChanged = 0x10,  // Of a page within a page what is on the disk may still say so.
    kFixed = 0x20,    // A leaf of keys of one size, one behind the other, without values.
    kWithin = 0x40,   // A page within an entry of another.
};
enum NodeFlags : std::uint16_t { kBigValue = 0x01, kTable = 0x02, kSeveral = 0x04 };

struct PageHead {
    std::uint64_t number;
    std::uint16_t padding;
    std::uint16_t flags;
    std::uint16_t
        lower;  // The end of the entries' offsets; of an overflow page: this and the next are its count of pages.
    std::uint16_t upper;  // Where the entries begin.

    std::uint32_t overflowPages() const { return lower | (std::uint32_t{upper} << 16); }
    std::size_t entryCount() const { return (lower - sizeof(PageHead)) / 2; }
};
static_assert(sizeof(PageHead) == 16);

struct NodeHead {
    std::uint16_t low;
    std::uint16_t high;
    std::uint16_t flags;
    std::uint16_t keyBytes;

    std::uint32_t valueBytes() const { return low | (std::uint32_t{high} << 16); }
    std::uint64_t childPage() const { return valueBytes() | (std::uint64_t{flags} << 32); }
};
static_assert(sizeof(NodeHead) == 8);

struct Meta {
    PageHead page;
    std::uint32_t magic;
    std::uint32_t version;
    std::uint64_t address;
    std::uint64_t mapBytes;
    Tree free;
    Tree main;
    std::uint64_t lastPage;
    std::uint64_t transaction;

    std::size_t pageBytes() const { return free.padding; }
    bool isGood() const { return (page.flags & kMeta) != 0 && magic == kMetaMagic && version == kDataVersion; }
};
static_assert(sizeof(Meta) == 152);

template <typename T>
T load(const std::byte* from) {
    T value;
    std::memcpy(&value, from, sizeof value);
    return value;
}

std::uint16_t entryOffset(const std::byte* page, std::size_t index) {
    return load<std::uint16_t>(page + sizeof(PageHead) + index * 2);
}

/// One entry of a page, after its bounds were checked.
struct Node {
    NodeHead head;
    ByteView key;
    const std::byte* value;
};

/// A table whose keys are integers.
struct Table {
    std::string_view name;
    std::size_t keyBytes = 0;
    std::size_t valueBytes = 0;  // Where a key may have several values, which then have one size.
};

constexpr Table kTables[] = {
    {"objects", 8}, {"documents", 4},      {"children", 8, 12}, {"attributes", 4},
    {"events", 8},  {"documentEvents", 8}, {"timeMarks", 8},
};

/// Walks every page that is in use, reading the file (a map of a file that is too short would end the process).
class Checker {
public:
    explicit Checker(int file) : file_(file) {}

    Result<std::optional<std::string>> check() {
        TRY(checkAll());
        return damage_;
    }

private:
    // Each step returns whether to go on: false after damage.
    Result<bool> checkAll();
    Result<bool> readMeta();
    /// Its keys are of any length when `keyBytes` is 0; a key has several values, of one size, when `valueBytes` is not.
    Result<bool> checkTree(const Tree& tree, std::string_view name, std::size_t keyBytes, std::size_t valueBytes = 0);
    Result<bool> walkTree(const Tree& tree);
    Result<bool> checkPage(std::uint64_t number, unsigned depth);
    Result<bool> checkBranch(const Bytes& page, unsigned depth);
    Result<bool> checkLeaf(const Bytes& page);
    bool checkFixedLeaf(ByteView page);
    Result<bool> checkValue(const Node& node);
    Result<bool> checkSeveral(const Node& node);
    Result<bool> checkValueTree(const Node& node);
    bool checkPageWithin(const Node& node);
    Result<bool> readBigValue(std::uint64_t number, std::size_t size, Bytes& value);
    Result<bool> readPages(std::uint64_t number, std::size_t count, Bytes& into);
    std::optional<Node> node(const Bytes& page, std::size_t index, bool branch) const;
    bool keyFollows(ByteView key);
    bool claim(std::uint64_t number);
    bool checkFreeList(ByteView value);
    Result<bool> checkTables();

    bool damaged(std::string what) {
        if (!damage_) damage_ = std::move(what);
        return false;
    }

    int file_;
    Meta meta_{};
    std::vector<bool> inUse_;
    std::optional<std::string> damage_;

    /// Of the tree that is being walked.
    struct Walk {
        std::string name;
        std::size_t keyBytes = 0;    // 0: of any length, in the order of their bytes.
        std::size_t valueBytes = 0;  // Of each of a key's values, where it may have several; otherwise 0.
        bool isFixed = false;        // The values of one key, which are its keys.
        std::uint64_t entries = 0;
        std::optional<Bytes> previousKey;
        bool separatorBefore = false;  // previousKey came from a branch: the next key may be equal to it.
    };
    Walk walk_;
    std::vector<std::pair<std::string, Tree>> tables_;
    std::vector<std::uint64_t> freePages_;
};

Result<bool> Checker::readPages(std::uint64_t number, std::size_t count, Bytes& into) {
    into.resize(count * meta_.pageBytes());
    std::size_t got = 0;
    while (got < into.size()) {
        const auto offset = static_cast<off_t>(number * meta_.pageBytes() + got);
        const ssize_t part = ::pread(file_, into.data() + got, into.size() - got, offset);
        if (part < 0 && errno == EINTR) continue;
        if (part < 0) return KsError::errorWithPOSIXCode();
        if (part == 0) return damaged(fmt::format("page {} is beyond the end of the file", number));
        got += static_cast<std::size_t>(part);
    }
    return true;
}

Result<bool> Checker::readMeta() {
    std::optional<Meta> best;
    std::size_t pageBytes = 0;
    for (std::uint64_t number = 0; number < kMetaPages; ++number) {
        std::array<std::byte, sizeof(Meta)> bytes{};
        const ssize_t got = ::pread(file_, bytes.data(), bytes.size(), static_cast<off_t>(number * pageBytes));
        if (got < 0) return KsError::errorWithPOSIXCode();
        const Meta meta = load<Meta>(bytes.data());
        if (got != sizeof(Meta) || !meta.isGood() || meta.page.number != number) {
            return damaged(fmt::format("page {} is no head page", number));
        }
        pageBytes = meta.pageBytes();
        if (!std::has_single_bit(pageBytes) || pageBytes < 512 || pageBytes > 65536) {
            return damaged(fmt::format("pages of {} bytes", pageBytes));
        }
        if (!best || meta.transaction > best->transaction) best = meta;
    }
    meta_ = *best;
    return true;
}

bool Checker::claim(std::uint64_t number) {
    if (number < kMetaPages || number > meta_.lastPage || number >= inUse_.size()) {
        return damaged(fmt::format("page {} of \"{}\" is none of the file's", number, walk_.name));
    }
    if (inUse_[number]) return damaged(fmt::format("page {} of \"{}\" is in use twice", number, walk_.name));
    inUse_[number] = true;
    return true;
}

std::optional<Node> Checker::node(const Bytes& page, std::size_t index, bool branch) const {
    const std::size_t upper = load<PageHead>(page.data()).upper;
    const std::size_t offset = entryOffset(page.data(), index);
    if (offset < upper || offset + sizeof(NodeHead) > page.size()) return std::nullopt;
    const auto head = load<NodeHead>(page.data() + offset);
    const std::size_t room = page.size() - offset - sizeof(NodeHead);
    const std::size_t valueBytes = branch                          ? 0
                                   : (head.flags & kBigValue) != 0 ? sizeof(std::uint64_t)
                                                                   : head.valueBytes();
    if (head.keyBytes > room || valueBytes > room - head.keyBytes) return std::nullopt;
    // The first key of a branch is never compared and may be left out.
    const bool keyCounts = !branch || index > 0;
    if (keyCounts && walk_.keyBytes != 0 && head.keyBytes != walk_.keyBytes) return std::nullopt;
    const std::byte* key = page.data() + offset + sizeof(NodeHead);
    return Node{head, ByteView(key, head.keyBytes), key + head.keyBytes};
}

bool Checker::keyFollows(ByteView key) {
    bool follows = true;
    if (walk_.previousKey) {
        int order = 0;
        if (walk_.keyBytes == 8) {
            const auto a = load<std::uint64_t>(walk_.previousKey->data()), b = load<std::uint64_t>(key.data());
            order = a < b ? -1 : a > b ? 1 : 0;
        } else if (walk_.keyBytes == 4) {
            const auto a = load<std::uint32_t>(walk_.previousKey->data()), b = load<std::uint32_t>(key.data());
            order = a < b ? -1 : a > b ? 1 : 0;
        } else {
            order = textOf(*walk_.previousKey).compare(textOf(key));
        }
        follows = order < 0 || (order == 0 && walk_.separatorBefore);
    }
    if (!walk_.previousKey) walk_.previousKey.emplace();
    walk_.previousKey->assign(key.begin(), key.end());
    return follows;
}

Result<bool> Checker::checkPage(std::uint64_t number, unsigned depth) {
    if (!claim(number)) return false;
    Bytes page;
    if (!TRY(readPages(number, 1, page))) return false;
    const auto head = load<PageHead>(page.data());
    const std::uint16_t leaf = walk_.isFixed ? kLeaf | kFixed : kLeaf;
    const std::uint16_t expected = depth == 1 ? leaf : std::uint16_t{kBranch};
    const bool sound = head.number == number && head.flags == expected && head.lower > sizeof(PageHead) &&
                       head.lower % 2 == 0 && head.lower <= head.upper && head.upper <= page.size();
    if (!sound) return damaged(fmt::format("page {} of \"{}\" is not what it should be", number, walk_.name));
    if (depth > 1) return checkBranch(page, depth);
    return walk_.isFixed ? checkFixedLeaf(page) : checkLeaf(page);
}

Result<bool> Checker::checkBranch(const Bytes& page, unsigned depth) {
    const auto head = load<PageHead>(page.data());
    for (std::size_t i = 0; i < head.entryCount(); ++i) {
        const auto entry = node(page, i, true);
        if (!entry) return damaged(fmt::format("an entry of page {} of \"{}\" is broken", head.number, walk_.name));
        if (i > 0) {
            const bool follows = keyFollows(entry->key);
            walk_.separatorBefore = true;
            if (!follows) return damaged(fmt::format("page {} of \"{}\" is out of order", head.number, walk_.name));
        }
        if (!TRY(checkPage(entry->head.childPage(), depth - 1))) return false;
    }
    return true;
}

Result<bool> Checker::checkLeaf(const Bytes& page) {
    const auto head = load<PageHead>(page.data());
    for (std::size_t i = 0; i < head.entryCount(); ++i) {
        const auto entry = node(page, i, false);
        if (!entry) return damaged(fmt::format("an entry of page {} of \"{}\" is broken", head.number, walk_.name));
        if (!keyFollows(entry->key))
            return damaged(fmt::format("page {} of \"{}\" is out of order", head.number, walk_.name));
        walk_.separatorBefore = false;
        if (walk_.valueBytes != 0) {
            if (!TRY(checkSeveral(*entry))) return false;
            continue;
        }
        ++walk_.entries;
        if (!TRY(checkValue(*entry))) return false;
    }
    return true;
}

bool Checker::checkFixedLeaf(ByteView page) {
    const auto head = load<PageHead>(page.data());
    if (head.padding != walk_.keyBytes || sizeof(PageHead) + head.entryCount() * walk_.keyBytes > page.size()) {
        return damaged(fmt::format("page {} of \"{}\" is not what it should be", head.number, walk_.name));
    }
    for (std::size_t i = 0; i < head.entryCount(); ++i) {
        if (!keyFollows(page.subspan(sizeof(PageHead) + i * walk_.keyBytes, walk_.keyBytes))) {
            return damaged(fmt::format("page {} of \"{}\" is out of order", head.number, walk_.name));
        }
        walk_.separatorBefore = false;
        ++walk_.entries;
    }
    return true;
}

/// The values of one key: one as any, several in a page within the entry, many in a tree of their own.
Result<bool> Checker::checkSeveral(const Node& node) {
    if (node.head.flags == 0) {
        ++walk_.entries;
        return node.head.valueBytes() == walk_.valueBytes ||
               damaged(fmt::format("\"{}\" has a value of another size", walk_.name));
    }
    if ((node.head.flags & ~kTable) != kSeveral)
        return damaged(fmt::format("\"{}\" has values of no kind", walk_.name));
    Walk inner;
    inner.name = fmt::format("values of {}", walk_.name);
    inner.keyBytes = walk_.valueBytes;
    inner.isFixed = true;
    std::swap(walk_, inner);
    Walk& outer = inner;
    const bool isGood = (node.head.flags & kTable) != 0 ? TRY(checkValueTree(node)) : checkPageWithin(node);
    outer.entries += walk_.entries;
    std::swap(walk_, outer);
    return isGood;
}

Result<bool> Checker::checkValueTree(const Node& node) {
    if (node.head.valueBytes() != sizeof(Tree)) return damaged("a table where none can be");
    const auto tree = load<Tree>(node.value);
    if (tree.padding != walk_.keyBytes || tree.root == kNoPage)
        return damaged(fmt::format("\"{}\" is no tree", walk_.name));
    return walkTree(tree);
}

bool Checker::checkPageWithin(const Node& node) {
    const ByteView page(node.value, node.head.valueBytes());
    if (page.size() < sizeof(PageHead)) return damaged(fmt::format("a page of \"{}\" is too short", walk_.name));
    const auto head = load<PageHead>(page.data());
    const bool sound = (head.flags & ~kChanged) == (kLeaf | kFixed | kWithin) && head.lower > sizeof(PageHead) &&
                       head.lower % 2 == 0 && head.lower <= head.upper && head.upper <= page.size();
    if (!sound) return damaged(fmt::format("a page of \"{}\" is not what it should be", walk_.name));
    return checkFixedLeaf(page);
}

Result<bool> Checker::checkValue(const Node& node) {
    const bool isTable = node.head.flags == kTable;
    if ((node.head.flags & ~kBigValue) != 0 && !isTable)
        return damaged(fmt::format("\"{}\" has values of no kind", walk_.name));
    if (isTable) {
        if (walk_.name != "tables" || node.head.valueBytes() != sizeof(Tree))
            return damaged("a table where none can be");
        tables_.emplace_back(textOf(node.key), load<Tree>(node.value));
        return true;
    }
    ByteView value(node.value, (node.head.flags & kBigValue) != 0 ? 0 : node.head.valueBytes());
    Bytes big;
    if ((node.head.flags & kBigValue) != 0) {
        if (!TRY(readBigValue(load<std::uint64_t>(node.value), node.head.valueBytes(), big))) return false;
        value = ByteView(big).subspan(sizeof(PageHead), node.head.valueBytes());
    }
    return walk_.name != "free" || checkFreeList(value);
}

Result<bool> Checker::readBigValue(std::uint64_t number, std::size_t size, Bytes& value) {
    const std::size_t count = (sizeof(PageHead) + size + meta_.pageBytes() - 1) / meta_.pageBytes();
    for (std::uint64_t page = number; page < number + count; ++page) {
        if (!claim(page)) return false;
    }
    if (!TRY(readPages(number, count, value))) return false;
    const auto head = load<PageHead>(value.data());
    if (head.number != number || head.flags != kOverflow || head.overflowPages() != count) {
        return damaged(fmt::format("page {} of \"{}\" is not what it should be", number, walk_.name));
    }
    return true;
}

// A list of free pages is a count and that many numbers, highest first.
bool Checker::checkFreeList(ByteView value) {
    const std::size_t room = value.size() / 8;
    const std::uint64_t count = room == 0 ? kNoPage : load<std::uint64_t>(value.data());
    if (room == 0 || count > room - 1) return damaged("a list of free pages is broken");
    for (std::uint64_t i = 0; i < count; ++i) {
        const auto page = load<std::uint64_t>(value.data() + 8 * (i + 1));
        if (i > 0 && page >= freePages_.back()) return damaged("a list of free pages is out of order");
        freePages_.push_back(page);
    }
    return true;
}

Result<bool> Checker::checkTree(const Tree& tree, std::string_view name, std::size_t keyBytes, std::size_t valueBytes) {
    walk_ = Walk();
    walk_.name = name;
    walk_.keyBytes = keyBytes;
    walk_.valueBytes = valueBytes;
    return walkTree(tree);
}

Result<bool> Checker::walkTree(const Tree& tree) {
    if (tree.root != kNoPage) {
        if (tree.depth == 0 || tree.depth > kDepthMax)
            return damaged(fmt::format("\"{}\" is {} deep", walk_.name, tree.depth));
        if (!TRY(checkPage(tree.root, tree.depth))) return false;
    }
    if (walk_.entries != tree.entries) {
        return damaged(fmt::format("\"{}\" holds {} entries of {}", walk_.name, walk_.entries, tree.entries));
    }
    return true;
}

Result<bool> Checker::checkTables() {
    const auto tables = std::exchange(tables_, {});
    for (const auto& [name, tree] : tables) {
        const Table* known = std::ranges::find(kTables, name, &Table::name);
        const Table& table = known != std::end(kTables) ? *known : Table{.name = name};
        if (!TRY(checkTree(tree, name, table.keyBytes, table.valueBytes))) return false;
    }
    return true;
}

Result<bool> Checker::checkAll() {
    if (!TRY(readMeta())) return false;
    const off_t fileBytes = ::lseek(file_, 0, SEEK_END);
    if (fileBytes < 0) return KsError::errorWithPOSIXCode();
    inUse_.resize(static_cast<std::size_t>(fileBytes) / meta_.pageBytes());
    if (!TRY(checkTree(meta_.free, "free", 8))) return false;
    if (!TRY(checkTree(meta_.main, "tables", 0))) return false;
    if (!TRY(checkTables())) return false;
    for (const std::uint64_t page : freePages_) {
        if (page < kMetaPages || page > meta_.lastPage)
            return damaged(fmt::format("free page {} is none of the file's", page));
        // Free pages at the end may never have been written.
        if (page < inUse_.size() && inUse_[page]) return damaged(fmt::format("page {} is in use and free", page));
        if (page >= inUse_.size()) continue;
        inUse_[page] = true;  // Found twice among the free ones it is damage, too.
    }
    return true;
}

}  // namespace

Result<std::optional<std::string>> findDamage(int file) {
    if constexpr (!kKnown) return std::optional<std::string>();
    return Checker(file).check();
}

namespace {

/// The pages of one search, with every number checked before it leads anywhere.
class Searcher {
public:
    Searcher(const std::byte* map, std::size_t pageBytes, std::uint64_t pages)
        : map_(map), pageBytes_(pageBytes), pages_(pages) {}

    bool search(const Tree& tree, std::span<Lookup> lookups) const {
        const std::byte* root = page(tree.root);
        if (root == nullptr || tree.depth > kDepthMax) return false;
        for (Lookup& lookup : lookups) lookup.page = root;
        for (unsigned depth = tree.depth; depth > 0; --depth) {
            if (!enterPages(lookups, depth == 1 ? kLeaf : kBranch)) return false;
            searchPages(lookups);
            if (!(depth == 1 ? takeValues(lookups) : descend(lookups))) return false;
        }
        return true;
    }

private:
    const std::byte* page(std::uint64_t number) const { return number < pages_ ? map_ + number * pageBytes_ : nullptr; }

    // The offset is kept inside the page, so that damage yields a wrong key and no fault.
    const std::byte* node(const std::byte* page, std::size_t index) const {
        return page + (entryOffset(page, index) & (pageBytes_ - 2));
    }

    static void prefetch(const std::byte* at) { __builtin_prefetch(at); }

    bool enterPages(std::span<Lookup> lookups, std::uint16_t kind) const {
        for (Lookup& lookup : lookups) {
            const auto head = load<PageHead>(lookup.page);
            if (head.flags != kind || head.lower <= sizeof(PageHead) || head.lower > pageBytes_) return false;
            lookup.low = 0;
            lookup.count = static_cast<std::uint32_t>(head.entryCount());
            prefetch(lookup.page + sizeof(PageHead) + lookup.count);  // The middle of the offsets.
        }
        for (const Lookup& lookup : lookups) prefetch(node(lookup.page, lookup.count / 2));
        return true;
    }

    /// Halves every lookup's range once a round, until each has the last entry whose key is not above its own (or the
    /// first).
    void searchPages(std::span<Lookup> lookups) const {
        for (bool more = true; more;) {
            more = false;
            for (Lookup& lookup : lookups) {
                if (lookup.count <= 1) continue;
                const std::uint32_t half = lookup.count / 2;
                const auto key = keyOf(node(lookup.page, lookup.low + half));
                lookup.low = key <= lookup.key ? lookup.low + half : lookup.low;
                lookup.count -= half;
                prefetch(node(lookup.page, lookup.low + lookup.count / 2));
                more |= lookup.count > 1;
            }
        }
    }

    std::uint64_t keyOf(const std::byte* node) const {
        // At the very end of a page there is no room for a key; only damage leads there.
        const std::size_t at = reinterpret_cast<std::uintptr_t>(node) & (pageBytes_ - 1);
        return at + sizeof(NodeHead) + 8 <= pageBytes_ ? load<std::uint64_t>(node + sizeof(NodeHead)) : 0;
    }

    bool descend(std::span<Lookup> lookups) const {
        for (Lookup& lookup : lookups) {
            const std::byte* entry = node(lookup.page, lookup.low);
            if (!fits(entry, 0)) return false;
            lookup.page = page(load<NodeHead>(entry).childPage());
            if (lookup.page == nullptr) return false;
            prefetch(lookup.page);
            prefetch(lookup.page + 64);
            prefetch(lookup.page + 128);
        }
        return true;
    }

    bool takeValues(std::span<Lookup> lookups) const {
        for (Lookup& lookup : lookups) {
            const std::byte* entry = node(lookup.page, lookup.low);
            if (!fits(entry, 8)) return false;
            const auto head = load<NodeHead>(entry);
            lookup.found = keyOf(entry) == lookup.key;
            if (!lookup.found) continue;
            if (head.flags != 0 || head.keyBytes != 8 || !fits(entry, 8 + std::size_t{head.valueBytes()})) return false;
            lookup.value = ByteView(entry + sizeof(NodeHead) + 8, head.valueBytes());
        }
        return true;
    }

    bool fits(const std::byte* entry, std::size_t bytes) const {
        const std::size_t at = reinterpret_cast<std::uintptr_t>(entry) & (pageBytes_ - 1);
        return at + sizeof(NodeHead) + bytes <= pageBytes_;
    }

    const std::byte* map_;
    std::size_t pageBytes_;
    std::uint64_t pages_;
};

}  // namespace

bool lookUp(const std::byte* map, std::size_t pageBytes, std::uint64_t pages, const Tree& tree,
            std::span<Lookup> lookups) {
    for (Lookup& lookup : lookups) lookup.found = false;
    if (tree.root == kNoPage) return true;
    return Searcher(map, pageBytes, pages).search(tree, lookups);
}

}  // namespace cindral::tablepages
