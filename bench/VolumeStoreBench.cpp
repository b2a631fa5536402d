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

}  // namespace
}  // namespace cindral

BENCHMARK_MAIN();
