#include <benchmark/benchmark.h>
#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <numeric>
#include <random>
#include <string>
#include <vector>

#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeStore.h"

// What the store adds to a listing: pages of 200 sightings whose file IDs come in no order, as a folder of a million
// entries lists them. The store's folder is made below TMPDIR.

namespace cindral {
namespace {

constexpr std::size_t kPage = 200;
constexpr std::uint64_t kFirstFileID = 1'000'000;
constexpr FileID kRoot{2};

std::string temporaryFolder() {
    const char* folder = std::getenv("TMPDIR");
    std::string pattern = std::string(folder != nullptr ? folder : "/tmp") + "/cindral-bench-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    return pattern;
}

/// Anonymous memory of the process now, KiB.
std::size_t anonymousMemory() {
    std::ifstream status("/proc/self/status");
    for (std::string line; std::getline(status, line);) {
        if (line.starts_with("RssAnon:")) return std::strtoul(line.c_str() + 8, nullptr, 10);
    }
    return 0;
}

/// A flat folder's sightings, in the order in which they are listed.
class Listing {
public:
    explicit Listing(std::size_t count) : order_(count) {
        std::iota(order_.begin(), order_.end(), 0);
        std::ranges::shuffle(order_, std::mt19937_64(7));  // NOLINT: the same order in every run.
        page_.resize(kPage);
        names_.resize(kPage);
    }
    std::size_t pages() const { return order_.size() / kPage; }

    std::vector<ObjectSighting>& page(std::size_t number) {
        for (std::size_t i = 0; i < kPage; ++i) {
            const std::uint64_t index = order_[number * kPage + i];
            names_[i] = fmt::format("document-{:07}.txt", index);
            page_[i] = {.fileID = FileID{kFirstFileID + index},
                        .birthTime = static_cast<std::int64_t>(1'700'000'000'000'000'000 + index),
                        .parent = kRoot,
                        .kind = ObjectKind::file,
                        .name = names_[i],
                        .wantsDocumentID = true};
        }
        return page_;
    }

private:
    std::vector<std::uint64_t> order_;
    std::vector<ObjectSighting> page_;
    std::vector<std::string> names_;
};

/// A store that knows the listing; one for each size, kept for the run.
class KnownStore {
public:
    explicit KnownStore(std::size_t count) : folder_(temporaryFolder()), listing_(count) {
        store_ = std::move(VolumeStore::open(folder_)).value();
        for (std::size_t page = 0; page < listing_.pages(); ++page) store_->identify(listing_.page(page)).value();
        store_->checkpoint().value();
    }
    ~KnownStore() {
        store_.reset();
        std::filesystem::remove_all(folder_);
    }
    static KnownStore& ofSize(std::size_t count) {
        static std::map<std::size_t, std::unique_ptr<KnownStore>> all;
        auto& store = all[count];
        if (!store) store = std::make_unique<KnownStore>(count);
        return *store;
    }
    VolumeStore& store() { return *store_; }
    Listing& listing() { return listing_; }

private:
    std::string folder_;
    Listing listing_;
    std::unique_ptr<VolumeStore> store_;
};

void reportPerSighting(benchmark::State& state, std::size_t sightings) {
    state.counters["per_sighting"] =
        benchmark::Counter(static_cast<double>(sightings), benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}

// A whole listing in which everything is new, the last checkpoint included; with room for so many unsaved records.
void firstListing(benchmark::State& state) {
    const auto count = static_cast<std::size_t>(state.range(0));
    VolumeStoreOptions options;
    options.unsavedRecordsMax = static_cast<std::size_t>(state.range(1));
    Listing listing(count);
    std::size_t sightings = 0;
    std::size_t memory = 0;
    for (auto _ : state) {
        state.PauseTiming();
        const std::string folder = temporaryFolder();
        auto store = std::move(VolumeStore::open(folder, options)).value();
        const std::size_t memoryBefore = anonymousMemory();
        for (std::size_t page = 0; page < listing.pages(); ++page) {
            auto& sighted = listing.page(page);
            state.ResumeTiming();
            store->identify(sighted).value();
            state.PauseTiming();
            if (page % 64 == 0)
                memory = std::max(memory, anonymousMemory() - std::min(memoryBefore, anonymousMemory()));
        }
        sightings += count;
        state.ResumeTiming();
        store->checkpoint().value();
        state.PauseTiming();
        store.reset();
        std::filesystem::remove_all(folder);
        state.ResumeTiming();
    }
    reportPerSighting(state, sightings);
    state.counters["memory_KiB"] = static_cast<double>(memory);
}
BENCHMARK(firstListing)
    ->Args({10'000, 131'072})
    ->Args({100'000, 131'072})
    ->Args({1'000'000, 32'768})
    ->Args({1'000'000, 131'072})
    ->Args({1'000'000, 262'144})
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

// A page in which nothing is new.
void nextListing(benchmark::State& state) {
    KnownStore& known = KnownStore::ofSize(static_cast<std::size_t>(state.range(0)));
    std::vector<std::vector<ObjectSighting>> pages;
    // Pages are made ahead, with names of their own, so that the pages' making is not in the time.
    std::vector<std::vector<std::string>> names;
    for (std::size_t i = 0; i < std::min<std::size_t>(known.listing().pages(), 1000); ++i) {
        pages.push_back(known.listing().page(i * (known.listing().pages() / 1000 + 1) % known.listing().pages()));
        auto& kept = names.emplace_back();
        kept.reserve(kPage);
        for (auto& sighting : pages.back()) sighting.name = kept.emplace_back(sighting.name);
    }
    const std::uint64_t transactions = known.store().transactionCount();
    std::size_t next = 0, sightings = 0;
    for (auto _ : state) {
        known.store().identify(pages[next]).value();
        next = (next + 1) % pages.size();
        sightings += kPage;
    }
    if (known.store().transactionCount() != transactions) state.SkipWithError("something was new");
    reportPerSighting(state, sightings);
}
BENCHMARK(nextListing)->Arg(10'000)->Arg(100'000)->Arg(1'000'000);

// Four folders deep, any file of the million.
void recordedPath(benchmark::State& state) {
    KnownStore& known = KnownStore::ofSize(static_cast<std::size_t>(state.range(0)));
    // The listing's folder becomes the fourth below the root.
    std::vector<ObjectSighting> chain;
    for (std::uint64_t i = 0; i < 3; ++i) {
        chain.push_back({.fileID = FileID{2 + i},
                         .birthTime = 1,
                         .parent = FileID{3 + i},
                         .kind = ObjectKind::folder,
                         .name = "folder"});
    }
    known.store().identify(chain).value();
    known.store().checkpoint().value();
    const FileID root{5};
    std::mt19937_64 random(3);  // NOLINT: the same order in every run.
    const auto count = static_cast<std::uint64_t>(state.range(0));
    for (auto _ : state) {
        const auto path = known.store().recordedPath(FileID{kFirstFileID + random() % count}, {&root, 1});
        if (!path) state.SkipWithError("no path");
        benchmark::DoNotOptimize(path);
    }
}
BENCHMARK(recordedPath)->Arg(10'000)->Arg(1'000'000);

// MARK: The directory index

/// A tree as a crawl finds it: folders of ten files and a folder in each, or everything in one folder.
class Crawl {
public:
    Crawl(std::size_t count, bool isFlat) : count_(count), isFlat_(isFlat), order_(count) {
        std::iota(order_.begin(), order_.end(), 0);
        // A folder's entries come in no order; folders come one after the other.
        std::mt19937_64 random(7);  // NOLINT: the same order in every run.
        const std::size_t run = isFlat ? count : kFolder;
        for (std::size_t at = 0; at < count; at += run) {
            std::shuffle(order_.begin() + static_cast<std::ptrdiff_t>(at),
                         order_.begin() + static_cast<std::ptrdiff_t>(std::min(count, at + run)), random);
        }
    }
    std::size_t batches() const { return (count_ + kBatch - 1) / kBatch; }

    IndexedObject object(std::size_t index) {
        const bool isFolder = !isFlat_ && index % kFolder == 0;
        name_ = fmt::format("{}-{:07}.txt", isFolder ? "documents" : "document", index);
        return {.fileID = FileID{kFirstFileID + index},
                .birthTime = static_cast<std::int64_t>(1'700'000'000'000'000'000 + index),
                .parent = parentOf(index),
                .name = name_,
                .kind = isFolder ? ObjectKind::folder : ObjectKind::file,
                .changeTime = static_cast<std::int64_t>(1'700'000'001'000'000'000 + index),
                .size = index};
    }
    IndexChanges batch(std::size_t number, IndexChanges::Journal journal) {
        IndexChanges changes(journal);
        for (std::size_t i = number * kBatch; i < std::min(count_, (number + 1) * kBatch); ++i) {
            changes.put(object(order_[i]));
        }
        return changes;
    }

    static constexpr std::size_t kBatch = 1000;
    static constexpr std::size_t kFolder = 11;

private:
    FileID parentOf(std::size_t index) const {
        if (isFlat_ || index < kFolder) return kRoot;
        const std::size_t folder = index / kFolder;
        return FileID{kFirstFileID + (index % kFolder == 0 ? (folder - 1) / 10 * kFolder : folder * kFolder)};
    }
    std::size_t count_;
    bool isFlat_;
    std::vector<std::size_t> order_;
    std::string name_;
};

double bytesOnDisk(const std::string& folder) {
    return static_cast<double>(std::filesystem::file_size(folder + "/volume"));
}

// A first reading: everything is put, without events, and is in the tables at the end. Then all of it is listed, so
// that everything has a document ID, and the size of the tables is told.
void firstReading(benchmark::State& state) {
    const auto count = static_cast<std::size_t>(state.range(0));
    Crawl crawl(count, state.range(1) != 0);
    const auto journal = state.range(2) != 0 ? IndexChanges::Journal::yes : IndexChanges::Journal::no;
    std::size_t objects = 0;
    for (auto _ : state) {
        state.PauseTiming();
        const std::string folder = temporaryFolder();
        auto store = std::move(VolumeStore::open(folder)).value();
        for (std::size_t i = 0; i < crawl.batches(); ++i) {
            const IndexChanges changes = crawl.batch(i, journal);
            state.ResumeTiming();
            store->apply(changes, {&kRoot, 1}).value();
            state.PauseTiming();
        }
        state.ResumeTiming();
        store->checkpoint().value();
        state.PauseTiming();
        objects += count;
        state.counters["disk_B"] = bytesOnDisk(folder) / static_cast<double>(count);
        std::vector<ObjectSighting> page;
        std::vector<std::string> names(kPage);
        for (std::size_t i = 0; i < count; i += kPage) {
            page.clear();
            for (std::size_t j = i; j < std::min(count, i + kPage); ++j) {
                const IndexedObject object = crawl.object(j);
                names[j - i] = object.name;
                page.push_back({.fileID = object.fileID,
                                .birthTime = object.birthTime,
                                .parent = object.parent,
                                .kind = object.kind,
                                .name = names[j - i],
                                .wantsDocumentID = true});
            }
            store->identify(page).value();
        }
        store->checkpoint().value();
        state.counters["disk_listed_B"] = bytesOnDisk(folder) / static_cast<double>(count);
        store.reset();
        std::filesystem::remove_all(folder);
        state.ResumeTiming();
    }
    state.counters["per_object"] =
        benchmark::Counter(static_cast<double>(objects), benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(firstReading)
    ->Args({100'000, 0, 0})
    ->Args({1'000'000, 0, 0})
    ->Args({1'000'000, 1, 0})
    ->Args({1'000'000, 0, 1})
    ->Iterations(1)
    ->Unit(benchmark::kMillisecond)
    ->MeasureProcessCPUTime()
    ->UseRealTime();

/// A store that knows a crawl; one for each shape, kept for the run.
class CrawledStore {
public:
    CrawledStore(std::size_t count, bool isFlat) : folder_(temporaryFolder()) {
        store_ = std::move(VolumeStore::open(folder_)).value();
        Crawl crawl(count, isFlat);
        store_->beginHistory().value();
        for (std::size_t i = 0; i < crawl.batches(); ++i) {
            store_->apply(crawl.batch(i, IndexChanges::Journal::yes), {&kRoot, 1}).value();
        }
        store_->checkpoint().value();
    }
    ~CrawledStore() {
        store_.reset();
        std::filesystem::remove_all(folder_);
    }
    static VolumeStore& of(std::size_t count, bool isFlat) {
        static std::map<std::pair<std::size_t, bool>, std::unique_ptr<CrawledStore>> all;
        auto& store = all[{count, isFlat}];
        if (!store) store = std::make_unique<CrawledStore>(count, isFlat);
        return *store->store_;
    }

private:
    std::string folder_;
    std::unique_ptr<VolumeStore> store_;
};

// Many objects by their numbers, a thousand at a time, in no order.
void lookUpMany(benchmark::State& state) {
    const auto count = static_cast<std::size_t>(state.range(0));
    const VolumeStore& store = CrawledStore::of(count, false);
    std::mt19937_64 random(3);  // NOLINT: the same order in every run.
    std::vector<FileID> fileIDs(1000);
    std::size_t looked = 0;
    for (auto _ : state) {
        state.PauseTiming();
        for (FileID& fileID : fileIDs) fileID = FileID{kFirstFileID + random() % count};
        state.ResumeTiming();
        std::size_t found = 0;
        store.indexed(fileIDs, [&](std::size_t, const IndexedObject* object) { found += object != nullptr ? 1 : 0; })
            .value();
        if (found != fileIDs.size()) state.SkipWithError("something is missing");
        looked += found;
    }
    reportPerSighting(state, looked);
}
BENCHMARK(lookUpMany)->Arg(100'000)->Arg(1'000'000);

// One object by its folder and name; in a folder of ten, and in one of all.
void lookUpChild(benchmark::State& state) {
    const auto count = static_cast<std::size_t>(state.range(0));
    const VolumeStore& store = CrawledStore::of(count, state.range(1) != 0);
    Crawl crawl(count, state.range(1) != 0);
    std::mt19937_64 random(3);  // NOLINT: the same order in every run.
    for (auto _ : state) {
        const IndexedObject wanted = crawl.object(random() % count);
        const bool found = store.childrenNamed(wanted.parent, wanted.name,
                                               [](const IndexedObject& object) { benchmark::DoNotOptimize(object); });
        if (!found) state.SkipWithError("no child");
    }
}
BENCHMARK(lookUpChild)->Args({1'000'000, 0})->Args({1'000'000, 1});

void countChildren(benchmark::State& state) {
    const VolumeStore& store = CrawledStore::of(1'000'000, true);
    for (auto _ : state) {
        if (store.childCount(kRoot) != 1'000'000) state.SkipWithError("a wrong count");
    }
}
BENCHMARK(countChildren);

void listChildren(benchmark::State& state) {
    const VolumeStore& store = CrawledStore::of(1'000'000, true);
    for (auto _ : state) {
        std::size_t found = 0;
        store.children(kRoot, [&](const IndexedObject&) { ++found; }).value();
        if (found != 1'000'000) state.SkipWithError("something is missing");
    }
}
BENCHMARK(listChildren)->Unit(benchmark::kMillisecond);

// So many events, the last of a million.
void readEvents(benchmark::State& state) {
    const VolumeStore& store = CrawledStore::of(1'000'000, false);
    const auto wanted = static_cast<std::size_t>(state.range(0));
    const std::uint64_t after = store.currentEventID() - wanted;
    std::size_t read = 0;
    for (auto _ : state) {
        const auto events = store.events(after, wanted + 1).value();
        if (events.size() != wanted) state.SkipWithError("something is missing");
        read += events.size();
    }
    if (read > 0) reportPerSighting(state, read);
}
BENCHMARK(readEvents)->Arg(0)->Arg(1000)->Arg(100'000);

}  // namespace
}  // namespace cindral

BENCHMARK_MAIN();
