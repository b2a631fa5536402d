// What a search costs in an index of many items: search_bench [--items N]
//
// Beside it, in the same run and over the same names: a look at every folded name in memory, which finds and orders the
// same; `plocate`, an index of names on the disk, where it is installed; and `grep -F -i` over a list of the names.

#include <fmt/format.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <random>
#include <string>

#include "Timing.h"
#include "host/search/NameFolding.h"
#include "host/search/SearchStore.h"
#include "platform/tessel/TesselItem.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

namespace {

constexpr std::size_t kResults = 200;
constexpr int kRounds = 9;
constexpr std::size_t kItemsInFolder = 100;

struct Item final : TesselItem {
    std::string identifier, parent, name, type = "text/plain";
    KsDate date;
    std::uint64_t size = 0;
    std::string bundle = "com.vemra.CindralStorage";
    std::optional<std::vector<std::string>> noTags;

    const TesselItemIdentifier& itemIdentifier() const override { return identifier; }
    const TesselItemIdentifier& parentItemIdentifier() const override { return parent; }
    const std::string& filename() const override { return name; }
    const std::string& typeIdentifier() const override { return type; }
    TesselItemCapabilities capabilities() const override { return TesselItemCapabilities::allowsReading; }
    bool isTrashed() const override { return false; }
    bool isUbiquitous() const override { return false; }
    bool isAppLibrary() const override { return false; }
    std::optional<std::uint64_t> documentSize() const override { return size; }
    std::optional<KsDate> creationDate() const override { return date; }
    std::optional<KsDate> contentModificationDate() const override { return date; }
    std::optional<std::uint64_t> childItemCount() const override { return std::nullopt; }
    std::optional<ByteView> versionIdentifier() const override { return std::nullopt; }
    std::optional<KsDate> lastUsedDate() const override { return std::nullopt; }
    const std::optional<std::vector<std::string>>& tags() const override { return noTags; }
    std::optional<std::int64_t> favoriteRank() const override { return std::nullopt; }
    std::optional<std::uint64_t> fileID() const override { return std::nullopt; }
    std::optional<std::uint64_t> docID() const override { return std::nullopt; }
    const KsURL* fileURL() const override { return nullptr; }
    const std::string* appContainerBundleIdentifier() const override { return &bundle; }
    const std::string* vistorDomainIdentifier() const override { return nullptr; }
    std::string description() const override { return identifier; }
};

constexpr const char* kWords[] = {"report", "invoice", "letter",    "photo",   "scan",    "notes",    "draft",
                                  "final",  "meeting", "budget",    "travel",  "receipt", "contract", "summary",
                                  "IMG",    "backup",  "Übersicht", "lecture", "thesis",  "chapter",  "recipe",
                                  "garden", "house",   "insurance", "tax",     "holiday", "project",  "plan",
                                  "list",   "sketch",  "résumé",    "manual"};
constexpr const char* kExtensions[] = {"pdf", "txt", "jpg", "odt", "docx", "png", "xlsx", "md"};
constexpr const char* kTypes[] = {"application/pdf",
                                  "text/plain",
                                  "image/jpeg",
                                  "application/vnd.oasis.opendocument.text",
                                  "application/vnd.openxmlformats-officedocument.wordprocessingml.document",
                                  "image/png",
                                  "application/vnd.openxmlformats-officedocument.spreadsheetml.sheet",
                                  "text/markdown"};

/// Names of about twenty characters, as people give them; dates over three years.
std::shared_ptr<const TesselItem> makeItem(std::uint64_t number, std::mt19937_64& random) {
    const auto below = [&](std::uint64_t max) { return random() % max; };
    auto item = std::make_shared<Item>();
    const std::uint64_t folder = number / kItemsInFolder;
    item->identifier = fmt::format("did={}", number + 1);
    item->parent = fmt::format("fid={}", 1'000'000 + folder);
    const std::uint64_t kind = below(std::size(kExtensions));
    item->type = kTypes[kind];
    const char* first = kWords[below(std::size(kWords))];
    const char* second = kWords[below(std::size(kWords))];
    switch (below(3)) {
        case 0: item->name = fmt::format("{} {} {}.{}", first, second, below(1'000), kExtensions[kind]); break;
        case 1:
            item->name = fmt::format("{}_20{:02}-{:02}-{:02}.{}", first, 10 + below(17), 1 + below(12), 1 + below(28),
                                     kExtensions[kind]);
            break;
        default: item->name = fmt::format("{}{:06}.{}", first, below(1'000'000), kExtensions[kind]); break;
    }
    item->date = KsDate{1'700'000'000 + static_cast<std::int64_t>(below(95'000'000)),
                        static_cast<std::uint32_t>(below(1'000'000'000))};
    item->size = below(10'000'000);
    return item;
}

/// The peer: every folded name, in memory, looked at one after the other; the best are put in front as ours are.
class LinearScan {
public:
    void add(const TesselItem& item) {
        const KsDate date = *item.contentModificationDate();
        entries_.push_back({name_folding::fold(item.filename()), date.seconds * 1'000'000'000 + date.nanoseconds});
    }
    std::size_t find(const std::string& text) const {
        struct Found {
            NameMatch match;
            std::int64_t date;
        };
        std::vector<Found> found;
        for (const Entry& entry : entries_) {
            if (const auto match = nameMatchOf(entry.name, text)) found.push_back({*match, entry.date});
        }
        const std::size_t count = std::min(found.size(), kResults);
        std::partial_sort(
            found.begin(), found.begin() + static_cast<std::ptrdiff_t>(count), found.end(),
            [](const Found& a, const Found& b) { return std::pair(a.match, -a.date) < std::pair(b.match, -b.date); });
        return count;
    }

private:
    struct Entry {
        std::string name;
        std::int64_t date;
    };
    std::vector<Entry> entries_;
};

template <typename T>
T require(Result<T> result) {
    if (result.ok()) {
        if constexpr (std::is_void_v<T>) {
            return;
        } else {
            return *std::move(result);
        }
    }
    fmt::print(stderr, "{}\n", result.error().description());
    std::exit(1);
}

/// Programs that find names, each with all of them in a form of its own. They look at bytes: case is folded, accents are
/// not, and nothing is ordered.
class Programs {
public:
    explicit Programs(std::string folder) : list_(folder + "/names.txt"), index_(folder + "/names.plocate") {
        file_ = std::fopen(list_.c_str(), "w");
    }
    void add(const TesselItem& item) { fmt::print(file_, "{}\n", item.filename()); }
    void finish() {
        std::fclose(file_);
        // Where it is not found, the column is empty.
        hasLocate_ =
            std::system(
                fmt::format("PATH=$PATH:/usr/sbin plocate-build -p {} {} 2>/dev/null", list_, index_).c_str()) == 0;
    }
    std::string locateTime(const std::string& text) const {
        if (!hasLocate_) return "-";
        return timeOf(fmt::format("plocate -d {} -i -l {} -- '{}' >/dev/null", index_, kResults, text));
    }
    std::string grepTime(const std::string& text) const {
        return timeOf(fmt::format("grep -F -i -m {} -e '{}' {} >/dev/null", kResults, text, list_));
    }

private:
    static std::string timeOf(const std::string& command) {
        std::vector<double> times;
        for (int round = 0; round < kRounds; ++round)
            times.push_back(seconds([&] { (void)std::system(command.c_str()); }) * 1'000);
        return fmt::format("{:.1f}", median(std::move(times)));
    }
    const std::string list_;
    const std::string index_;
    std::FILE* file_ = nullptr;
    bool hasLocate_ = false;
};

double milliseconds(const std::function<void()>& work) {
    std::vector<double> times;
    for (int round = 0; round < kRounds; ++round) times.push_back(seconds(work) * 1'000);
    return median(std::move(times));
}

void measure(const std::string& path, std::uint64_t count) {
    const NameCollation collation("en_US.UTF-8");
    auto store = require(SearchStore::open(path, collation));
    LinearScan linear;
    Programs programs(std::filesystem::path(path).parent_path());
    std::mt19937_64 random(1);
    double filling = 0;
    const TesselItemIdentifier root = kTesselRootContainerItemIdentifier;
    require(store->beginGather(Bytes{std::byte{1}}, std::span(&root, 1)));
    for (std::uint64_t number = 0; number < count;) {
        std::vector<IndexedItem> items;
        for (const std::size_t atOnce = store->itemsAtOnce(); number < count && items.size() < atOnce; ++number) {
            const auto item = makeItem(number, random);
            linear.add(*item);
            programs.add(*item);
            items.push_back(IndexedItem::of(*item));
        }
        filling += seconds([&] { require(store->putListed(items, std::span(&root, 1), {})); });
    }
    filling += seconds([&] { require(store->endGather()); });
    programs.finish();
    // As it is left behind: with nothing beside it.
    store.reset();
    const auto bytes = std::filesystem::file_size(path);
    store = require(SearchStore::open(path, collation));
    fmt::print("{} items, put in in {:.1f} s ({:.1f} us an item), {:.0f} bytes an item on the disk\n\n", count, filling,
               filling * 1e6 / static_cast<double>(count), static_cast<double>(bytes) / static_cast<double>(count));

    fmt::print(
        "| what is looked for | results | ours, ms | scan of names in memory, ms | ratio | plocate, ms | grep, ms |\n"
        "|---|---|---|---|---|---|---|\n");
    for (const char* text : {"rep", "report", "pdf", ".pdf", "ort", "201", "2026-11-2", "résumé plan 77", "übersicht",
                             "img000", "no such name", "epor", "aaaa", "ta", "e", "qx"}) {
        const std::string folded = name_folding::fold(text);
        std::size_t found = 0;
        const double ours = milliseconds([&] {
            found = require(store->find({SearchQuery::Kind::names, text}, std::nullopt, kResults)).hits.size();
        });
        std::size_t alsoFound = 0;
        const double theirs = milliseconds([&] { alsoFound = linear.find(folded); });
        if (found != alsoFound) {
            fmt::print(stderr, "{} results of \"{}\" where there are {}\n", found, text, alsoFound);
            std::exit(1);
        }
        fmt::print("| {} | {} | {:.2f} | {:.1f} | {:.3f} | {} | {} |\n", text, found, ours, theirs, ours / theirs,
                   programs.locateTime(text), programs.grepTime(text));
        std::fflush(stdout);
    }
    fmt::print("| recents | {} | {:.2f} | - | - | - | - |\n", kResults, milliseconds([&] {
                   require(store->find({SearchQuery::Kind::recents, ""}, std::nullopt, kResults));
               }));

    // One change at a time, as they come from a person at work.
    double changing = 0;
    constexpr int kChanges = 300;
    for (int i = 0; i < kChanges; ++i) {
        ChangesBatch batch;
        batch.anchor = Bytes{std::byte{2}};
        const auto item = makeItem(random() % count, random);
        batch.log.push_back({item, item->itemIdentifier()});
        changing += seconds([&] { require(store->apply(batch)); });
    }
    fmt::print("\nA change of one item: {:.2f} ms\n", changing * 1'000 / kChanges);
}

/// A folder of 100,000, in its orders: the first page, and one far behind after a change.
void measureSorted(const std::string& path) {
    constexpr std::uint64_t kItems = 100'000;
    const NameCollation collation("en_US.UTF-8");
    const auto store = require(SearchStore::open(path, collation));
    std::mt19937_64 random(2);
    ChangesBatch batch;
    batch.anchor = Bytes{std::byte{1}};
    for (std::uint64_t number = 0; number < kItems; ++number) {
        auto item = std::dynamic_pointer_cast<const Item>(makeItem(number, random));
        auto placed = std::make_shared<Item>(*item);
        placed->parent = "fid=1";
        batch.log.push_back({placed, placed->identifier});
    }
    require(store->apply(batch));
    fmt::print("\n| folder of {} by | first look, ms | page {}, ms |\n|---|---|---|\n", kItems, kItems / 2 / kResults);
    constexpr std::pair<const char*, SortedQuery::Order> kOrders[] = {{"name", SortedQuery::Order::name},
                                                                      {"date", SortedQuery::Order::date},
                                                                      {"size", SortedQuery::Order::size},
                                                                      {"kind", SortedQuery::Order::kind}};
    for (const auto& [name, order] : kOrders) {
        ChangesBatch nothing;
        nothing.anchor = Bytes{std::byte{1}};
        std::vector<double> firsts;
        for (int round = 0; round < 5; ++round) {
            require(store->apply(nothing));
            firsts.push_back(seconds([&, order = order] {
                                 require(store->sorted({"fid=1", order, false, 0, kResults}));
                             }) *
                             1'000);
        }
        const double later = milliseconds([&, order = order] {
            require(store->sorted({"fid=1", order, true, kItems / 2, kResults}));
        });
        fmt::print("| {} | {:.1f} | {:.2f} |\n", name, median(firsts), later);
    }
}

}  // namespace

int main(int argc, char** argv) {
    std::uint64_t count = 100'000;
    if (argc == 3 && std::strcmp(argv[1], "--items") == 0) count = std::strtoull(argv[2], nullptr, 10);
    if ((argc != 1 && argc != 3) || count == 0) {
        fmt::print(stderr, "usage: search_bench [--items N]     (100,000; the aims are for 1,000,000)\n");
        return 2;
    }
    const char* parent = std::getenv("TMPDIR");
    std::string folder = std::string(parent != nullptr ? parent : "/tmp") + "/cindral-search-XXXXXX";
    if (::mkdtemp(folder.data()) == nullptr) return 1;
    measure(folder + "/many", count);
    measureSorted(folder + "/flat");
    if (std::getenv("KEEP") == nullptr) std::filesystem::remove_all(folder);
    return 0;
}
