// Listings beside what the kernel charges for them, in one run: the floor (Floor.c), the provider's enumerators, and
// JSON-RPC.
//
//   listing_bench [--quick] [--program PATH/TO/cindral]
//
// Every figure is the median of several rounds in which the sides take turns; every ratio is of two such figures of the
// same run.

#include <fcntl.h>
#include <fmt/format.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "Floor.h"
#include "Timing.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselManager.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral::bench {
namespace {

constexpr int kRounds = 5;
constexpr long kSampleEntries = 50'000;
constexpr int kFirstsMax = 10;  // Each needs a state of its own.

[[noreturn]] void fail(const std::string& what) {
    fmt::print(stderr, "listing_bench: {}\n", what);
    std::exit(1);
}

/// Anonymous memory of a process, in MB: "Rss" + "Anon" of its status.
double anonymousMegabytes(pid_t process) {
    std::ifstream status("/proc/" + std::to_string(process) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.starts_with("RssAnon:")) return std::strtod(line.c_str() + 8, nullptr) / 1024;
    }
    return 0;
}

class Tree {
public:
    Tree() {
        std::string pattern = (std::filesystem::temp_directory_path() / "cindral-bench-XXXXXX").string();
        if (::mkdtemp(pattern.data()) == nullptr) fail("can't make a temporary folder");
        top_ = pattern;
        std::filesystem::create_directories(storage());
    }
    ~Tree() {
        std::error_code ignored;
        std::filesystem::remove_all(top_, ignored);
    }
    Tree(const Tree&) = delete;
    Tree& operator=(const Tree&) = delete;

    std::string storage() const { return top_ + "/Documents"; }
    std::string freshState() { return top_ + "/state" + std::to_string(++states_); }

    void files(const std::string& folder, long count) const {
        std::filesystem::create_directories(storage() + "/" + folder);
        const UniqueFd directory(::open((storage() + "/" + folder).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        for (long i = 0; i < count; ++i) {
            const UniqueFd file(::openat(directory.get(), fmt::format("document-{:07}.txt", i).c_str(),
                                         O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
            if (!file) fail("can't make a file");
        }
    }

private:
    std::string top_;
    int states_ = 0;
};

class CountingObserver : public TesselEnumerationObserver {
public:
    void didEnumerateItems(TesselItems items) override { count += items.size(); }
    void finishEnumeratingUpToPage(std::optional<TesselPage> page) override { next = std::move(page); }
    void finishEnumeratingWithError(const KsError& error) override { fail(error.description()); }
    std::size_t count = 0;
    std::optional<TesselPage> next;
};

/// The provider's platform over one storage and one state folder.
class Environment {
public:
    Environment(const std::string& storage, const std::string& state) : storage_(storage) {
        std::filesystem::create_directories(state);
        auto store = VolumeStore::open(state + "/store");
        if (!store.ok()) fail(store.error().description());
        RvStorageManager::defaultManager().setStore(std::move(*store));
        if (!RootDirectories::shared().add(storage, RootPolicy::storage).ok()) fail("can't open the storage");
        TesselManager::defaultManager().setDocumentStorageURL(KsURL::fileURL(storage));
        TesselManager::defaultManager().setApplicationSupportURL(KsURL::fileURL(state + "/Application Support"));
        RoApplicationWorkspace::defaultWorkspace().setOwnRecord(std::make_shared<RoBundleProxy>(RoBundleProxy::Values{
            "com.vemra.CindralStorage", KsURL::fileURL(storage).deletingLastPathComponent(), "Documents"}));
    }
    ~Environment() {
        RvStorageManager::defaultManager().setStore(nullptr);
        RootDirectories::shared().remove(storage_);
    }
    Environment(const Environment&) = delete;
    Environment& operator=(const Environment&) = delete;

    std::shared_ptr<LocalFileEnumerator> enumerator(const std::string& folder) const {
        KsURL url = KsURL::fileURL(storage_ + "/" + folder);
        return LocalFileEnumerator::initWithContainer(itemIdentifier(url).value_or("none"), {url});
    }
    std::shared_ptr<LocalFileEnumerator> workingSet() const {
        return LocalFileEnumerator::initWithContainer(kTesselWorkingSetContainerItemIdentifier,
                                                      {KsURL::fileURL(storage_)});
    }

private:
    std::string storage_;
};

std::size_t listAll(TesselEnumerator& enumerator) {
    auto observer = std::make_shared<CountingObserver>();
    observer->next = tesselInitialPageSortedByName();
    while (observer->next) enumerator.enumerateItemsForObserver(observer, *std::exchange(observer->next, std::nullopt));
    return observer->count;
}

/// Lists a folder, and each of its sub-folders as a container of its own.
std::size_t listTree(const Environment& environment, const std::string& folder, long folders) {
    std::size_t count = listAll(*environment.enumerator(folder));
    for (long i = 0; i < folders; ++i) count += listAll(*environment.enumerator(folder + "/" + std::to_string(i)));
    return count;
}

/// `cindral rpc` over a pipe.
class Program {
public:
    Program(const std::string& program, const std::string& storage, const std::string& state) {
        int in[2];
        int out[2];
        if (::pipe2(in, O_CLOEXEC) != 0 || ::pipe2(out, O_CLOEXEC) != 0) fail("can't make a pipe");
        process_ = ::fork();
        if (process_ == 0) {
            ::dup2(in[0], 0);
            ::dup2(out[1], 1);
            ::execl(program.c_str(), program.c_str(), "rpc", "--storage", storage.c_str(), "--state", state.c_str(),
                    nullptr);
            ::_exit(127);
        }
        ::close(in[0]);
        ::close(out[1]);
        to_ = UniqueFd(in[1]);
        from_ = UniqueFd(out[0]);
    }
    ~Program() {
        to_.reset();
        ::waitpid(process_, nullptr, 0);
    }
    Program(const Program&) = delete;
    Program& operator=(const Program&) = delete;

    pid_t process() const { return process_; }

    /// The answer's line, whole.
    const std::string& call(std::string_view method, const std::string& params) {
        const std::string request =
            fmt::format(R"({{"jsonrpc":"2.0","id":1,"method":"{}","params":{}}})", method, params) + "\n";
        for (std::size_t sent = 0; sent < request.size();) {
            const ssize_t size = ::write(to_.get(), request.data() + sent, request.size() - sent);
            if (size <= 0) fail("the program went away");
            sent += static_cast<std::size_t>(size);
        }
        answer_.clear();
        char buffer[65536];
        while (answer_.empty() || answer_.back() != '\n') {
            const ssize_t size = ::read(from_.get(), buffer, sizeof buffer);
            if (size <= 0) fail("the program went away");
            answer_.append(buffer, static_cast<std::size_t>(size));
        }
        return answer_;
    }

    std::string container(const std::string& path) {
        return text(call("identifierForItemAtURL", fmt::format(R"({{"path":"{}"}})", path)), "identifier");
    }

    /// Bytes of all answers of a listing.
    std::size_t listAll(const std::string& container) {
        std::size_t bytes = 0;
        std::string params = fmt::format(R"({{"container":"{}"}})", container);
        while (true) {
            const std::string& answer = call("enumerateItems", params);
            bytes += answer.size();
            if (answer.find("\"error\"") != std::string::npos) fail(answer.substr(0, 300));
            const std::string next = text(answer, "nextPage");
            if (next.empty()) return bytes;
            params = fmt::format(R"({{"container":"{}","page":"{}"}})", container, next);
        }
    }

private:
    /// The text value of a key that stands once, near the beginning or the end.
    static std::string text(const std::string& answer, std::string_view key) {
        const std::string pattern = fmt::format("\"{}\":", key);
        std::size_t at = answer.rfind(pattern);
        if (at == std::string::npos) return {};
        at += pattern.size();
        while (answer[at] == ' ') ++at;
        if (answer[at] != '"') return {};
        return answer.substr(at + 1, answer.find('"', at + 1) - at - 1);
    }

    pid_t process_ = -1;
    UniqueFd to_;
    UniqueFd from_;
    std::string answer_;
};

struct Row {
    std::string name;
    double floor = 0;
    double first = 0;
    double second = 0;
    double rpc = 0;
    long entries = 0;
};

void print(const Row& row) {
    const auto ratio = [&](double value) {
        return value == 0 ? std::string("-") : fmt::format("{:.2f}", value / row.floor);
    };
    fmt::print("| {} | {:.2f} | {} | {} | {} |\n", row.name, row.floor * 1e6 / static_cast<double>(row.entries),
               ratio(row.first), ratio(row.second), ratio(row.rpc));
    std::fflush(stdout);
}

struct Listing {
    std::string name;
    std::string folder;       ///< in the storage
    long folders = 0;         ///< numbered sub-folders, each listed as a container
    bool everything = false;  ///< as the working set
};

Row measure(Tree& tree, const Listing& listing, const std::string& program) {
    Row row;
    row.name = listing.name;
    const std::string path = tree.storage() + (listing.everything ? "" : "/" + listing.folder);
    const bool descend = listing.folders > 0 || listing.everything;
    const auto list = [&](const Environment& environment) {
        return listing.everything ? listAll(*environment.workingSet())
                                  : listTree(environment, listing.folder, listing.folders);
    };
    row.entries = floor_list(path.c_str(), descend);  // And once to warm the caches.
    // A short listing is repeated within its sample, so that no sample is a few milliseconds of somebody else's work.
    const int repeats = static_cast<int>(std::max(1L, kSampleEntries / row.entries));
    const auto repeated = [repeats](const std::function<void()>& work) {
        return seconds([&] {
                   for (int i = 0; i < repeats; ++i) work();
               }) /
               repeats;
    };
    std::vector<double> floors;
    std::vector<double> firsts;
    std::vector<double> seconds_;
    std::vector<double> rpcs;
    for (int round = 0; round < kRounds; ++round) {
        const std::string state = tree.freshState();
        std::size_t count = 0;
        floors.push_back(repeated([&] { (void)floor_list(path.c_str(), descend); }));
        for (int i = 1; i < std::min(repeats, kFirstsMax); ++i) {
            const Environment environment(tree.storage(), state + "-" + std::to_string(i));
            firsts.push_back(seconds([&] { count = list(environment); }));
        }
        {
            const Environment environment(tree.storage(), state);
            firsts.push_back(seconds([&] { count = list(environment); }));
            if (count != static_cast<std::size_t>(row.entries))
                fail(fmt::format("{} of {} entries listed", count, row.entries));
            floors.push_back(repeated([&] { (void)floor_list(path.c_str(), descend); }));
            seconds_.push_back(repeated([&] { count = list(environment); }));
        }
        if (!program.empty()) {
            Program host(program, tree.storage(), state);
            std::vector<std::string> containers;
            if (listing.everything) {
                containers.push_back(kTesselWorkingSetContainerItemIdentifier);
            } else {
                containers.push_back(host.container(path));
                for (long i = 0; i < listing.folders; ++i)
                    containers.push_back(host.container(path + "/" + std::to_string(i)));
            }
            rpcs.push_back(repeated([&] {
                for (const std::string& container : containers) (void)host.listAll(container);
            }));
        }
        std::filesystem::remove_all(state);
    }
    row.floor = median(floors);
    row.first = median(firsts);
    row.second = median(seconds_);
    if (!rpcs.empty()) row.rpc = median(rpcs);
    return row;
}

/// The cost of a page by its number, by the token that names it, asked for many times.
void measurePages(const Environment& environment, const std::string& folder) {
    const auto enumerator = environment.enumerator(folder);
    std::vector<TesselPage> pages{tesselInitialPageSortedByName()};
    double peak = 0;
    while (true) {
        auto observer = std::make_shared<CountingObserver>();
        enumerator->enumerateItemsForObserver(observer, pages.back());
        if (pages.size() % 100 == 0) peak = std::max(peak, anonymousMegabytes(::getpid()));
        if (!observer->next) break;
        pages.push_back(*observer->next);
    }
    // The second page and a late one: both resumed, both full.
    const std::size_t late = pages.size() - 3;
    const auto cost = [&](std::size_t number) {
        return seconds([&] {
            auto observer = std::make_shared<CountingObserver>();
            enumerator->enumerateItemsForObserver(observer, pages[number]);
        });
    };
    std::vector<double> firsts;
    std::vector<double> lates;
    for (int i = 0; i < 101; ++i) {
        firsts.push_back(cost(0));
        lates.push_back(cost(late));
    }
    fmt::print("\nPage {} of {}: {:.2f} ms, page 1: {:.2f} ms, ratio {:.2f}\n", late + 1, pages.size(),
               median(lates) * 1e3, median(firsts) * 1e3, median(lates) / median(firsts));
    fmt::print("Anonymous memory while paging, in process: {:.1f} MB\n", peak);
}

void measurePaths(const Environment& environment, const std::string& storage, const std::string& folder, long count) {
    (void)listAll(*environment.enumerator(folder));
    const auto store = RvStorageManager::defaultManager().store();
    const KsURL root = KsURL::fileURL(storage);
    const FileID rootID{root.status().value().fileID};
    const std::uint32_t device = root.status().value().deviceID();
    std::vector<std::uint64_t> numbers;
    for (long i = 0; i < 10'000; ++i) {
        const long which = (i * 7919) % count;
        numbers.push_back(
            KsURL::fileURL(fmt::format("{}/{}/document-{:07}.txt", storage, folder, which)).status().value().fileID);
    }
    std::vector<double> lookups;
    std::vector<double> verified;
    for (int round = 0; round < kRounds; ++round) {
        lookups.push_back(seconds([&] {
            for (const std::uint64_t number : numbers) {
                if (!store->recordedPath(FileID{number}, std::span(&rootID, 1))) fail("no path");
            }
        }));
        verified.push_back(seconds([&] {
            for (const std::uint64_t number : numbers) {
                if (!RvStorageManager::defaultManager().pathOfFileID(number, device, 1024).ok()) fail("no path");
            }
        }));
    }
    const auto each = static_cast<double>(numbers.size());
    fmt::print("File ID to path, {} objects: look-up {:.2f} us, with verification {:.2f} us\n", count,
               median(lookups) * 1e6 / each, median(verified) * 1e6 / each);
}

void measureProgramMemory(Tree& tree, const std::string& folder, const std::string& program) {
    const std::string state = tree.freshState();
    Program host(program, tree.storage(), state);
    const std::string container = host.container(tree.storage() + "/" + folder);
    (void)host.listAll(container);
    const double first = anonymousMegabytes(host.process());
    (void)host.listAll(container);
    fmt::print("Anonymous memory of the program: {:.1f} MB after a first listing, {:.1f} MB after a second\n", first,
               anonymousMegabytes(host.process()));
}

}  // namespace

int run(bool quick, const std::string& program) {
    const std::vector<long> sizes =
        quick ? std::vector<long>{1'000, 10'000, 100'000} : std::vector<long>{1'000, 10'000, 100'000, 1'000'000};
    fmt::print("| folder | floor, us an entry | first listing | second listing | JSON-RPC |\n|---|---|---|---|---|\n");
    {
        Tree tree;
        for (long i = 0; i < 1'000; ++i) tree.files("nested/" + std::to_string(i), 100);
        print(measure(tree, {"100,000 in 1,000 folders, each listed", "nested", 1'000, false}, program));
        print(measure(tree, {"100,000 in 1,000 folders, as the working set", "", 0, true}, program));
    }
    for (const long size : sizes) {
        Tree tree;
        tree.files("flat", size);
        print(measure(tree, {fmt::format("{} flat", size), "flat", 0, false}, program));
        if (size != sizes.back()) continue;
        {
            const Environment environment(tree.storage(), tree.freshState());
            measurePages(environment, "flat");
            measurePaths(environment, tree.storage(), "flat", size);
        }
        if (!program.empty()) measureProgramMemory(tree, "flat", program);
    }
    return 0;
}

}  // namespace cindral::bench

int main(int argc, char** argv) {
    bool quick = false;
    std::string program = CINDRAL_PROGRAM;
    for (int i = 1; i < argc; ++i) {
        const std::string_view word = argv[i];
        if (word == "--quick") {
            quick = true;
        } else if (word == "--program" && i + 1 < argc) {
            program = argv[++i];
        } else {
            fmt::print(stderr, "usage: listing_bench [--quick] [--program PATH]\n");
            return 2;
        }
    }
    if (::access(program.c_str(), X_OK) != 0) program.clear();
    return cindral::bench::run(quick, program);
}
