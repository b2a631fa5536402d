// Imports beside `cp -a`, and deletions beside `rm -rf`, in one run.
//
//   edits_bench [--quick | --deletions]
//
// --deletions leaves out the imports: a tree of 100,000 files is made ten times, which takes minutes on a disk.
//
// Every figure is the median of several rounds in which the sides take turns, each after everything written before is
// on the disk; every ratio is of two such figures of the same run.

#include <fmt/format.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "Timing.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TesselManager.h"

namespace cindral::bench {
namespace {

namespace fs = std::filesystem;
constexpr int kRounds = 5;

struct Sizes {
    std::size_t bigBytes = std::size_t{1} << 30;
    int smallFiles = 10'000;
    int treeFolders = 1'000;
    static constexpr int kFilesInFolder = 99;
    static constexpr std::size_t kSmallBytes = 2'000;
};

[[noreturn]] void fail(const std::string& what) {
    fmt::print(stderr, "edits_bench: {}\n", what);
    std::exit(1);
}

/// With nothing left for the disk to do before.
double secondsFromRest(const std::function<void()>& work) {
    ::sync();
    return seconds(work);
}

void run(std::vector<std::string> words) {
    std::vector<char*> arguments;
    for (std::string& word : words) arguments.push_back(word.data());
    arguments.push_back(nullptr);
    pid_t child = 0;
    int status = 0;
    if (::posix_spawnp(&child, arguments[0], nullptr, nullptr, arguments.data(), environ) != 0 ||
        ::waitpid(child, &status, 0) != child || status != 0)
        fail(words[0] + " failed");
}

void write(const std::string& path, std::size_t bytes) {
    static std::mt19937_64 random(1);
    std::ofstream file(path, std::ios::binary);
    std::vector<std::uint64_t> chunk(std::min<std::size_t>(bytes, 1 << 20) / 8);
    for (std::size_t at = 0; at < bytes; at += chunk.size() * 8) {
        for (auto& value : chunk) value = random();
        file.write(reinterpret_cast<const char*>(chunk.data()), static_cast<std::streamsize>(chunk.size() * 8));
    }
    if (!file.flush()) fail("can't write " + path);
}

void importFile(const std::string& source, const std::string& target) {
    TesselProgress progress;
    const auto imported = file_operations::importUnderFolder(KsURL::fileURL(source), KsURL::fileURL(target), progress);
    if (!imported.ok()) fail(imported.error().description());
}

class Bench {
public:
    Bench(std::string folder, const Sizes& sizes) : folder_(std::move(folder)), sizes_(sizes) {
        fs::create_directories(storage_ + "/target");
        fs::create_directories(folder_ + "/copy");
        if (!RootDirectories::shared().add(storage_, RootPolicy::storage).ok()) fail("can't open the storage");
        TesselManager::defaultManager().setDocumentStorageURL(KsURL::fileURL(storage_));
    }
    ~Bench() { fs::remove_all(folder_); }
    Bench(const Bench&) = delete;
    Bench& operator=(const Bench&) = delete;

    void run(bool withImports) {
        fmt::print("| | theirs, s | ours, s | ratio | aim |\n|---|---|---|---|---|\n");
        if (withImports) compareImports();
        compareDeletion();
    }

private:
    void compareImports() {
        write(folder_ + "/big", sizes_.bigBytes);
        compareImport(fmt::format("import of {} MB, cp -a", sizes_.bigBytes >> 20), "big");
        fs::create_directory(folder_ + "/small");
        for (int i = 0; i < sizes_.smallFiles; ++i) write(fmt::format("{}/small/{}", folder_, i), Sizes::kSmallBytes);
        compareImport(fmt::format("import of {} files, cp -a", sizes_.smallFiles), "small");
    }

    static void line(const std::string& what, std::vector<double> theirs, std::vector<double> ours, double aim) {
        const double a = median(std::move(theirs));
        const double b = median(std::move(ours));
        fmt::print("| {} | {:.3f} | {:.3f} | {:.2f} | {} |\n", what, a, b, b / a, aim);
        std::fflush(stdout);
    }

    void compareImport(const std::string& what, const std::string& name) {
        std::vector<double> theirs;
        std::vector<double> ours;
        const std::string source = folder_ + "/" + name;
        for (int round = 0; round < kRounds; ++round) {
            theirs.push_back(secondsFromRest([&] { bench::run({"cp", "-a", source, folder_ + "/copy/"}); }));
            fs::remove_all(folder_ + "/copy/" + name);
            ours.push_back(secondsFromRest([&] { importFile(source, storage_ + "/target"); }));
            fs::remove_all(storage_ + "/target/" + name);
        }
        line(what, theirs, ours, 1.2);
    }

    void makeTree(const std::string& path) const {
        for (int folder = 0; folder < sizes_.treeFolders; ++folder) {
            const std::string at = fmt::format("{}/{}", path, folder);
            fs::create_directories(at);
            for (int file = 0; file < Sizes::kFilesInFolder; ++file) std::ofstream(fmt::format("{}/{}", at, file));
        }
    }

    void compareDeletion() {
        std::vector<double> theirs;
        std::vector<double> ours;
        for (int round = 0; round < kRounds; ++round) {
            makeTree(folder_ + "/copy/tree");
            theirs.push_back(secondsFromRest([&] { bench::run({"rm", "-rf", folder_ + "/copy/tree"}); }));
            makeTree(storage_ + "/target/tree");
            ours.push_back(secondsFromRest([&] {
                TesselProgress progress;
                const auto removed = file_operations::remove(KsURL::fileURL(storage_ + "/target/tree"), progress);
                if (!removed.ok()) fail(removed.error().description());
            }));
        }
        line(fmt::format("deletion of {}, rm -rf", sizes_.treeFolders * (Sizes::kFilesInFolder + 1)), theirs, ours,
             1.5);
    }

    const std::string folder_;
    const std::string storage_ = folder_ + "/Documents";
    const Sizes sizes_;
};

}  // namespace
}  // namespace cindral::bench

int main(int argc, char** argv) {
    using namespace cindral::bench;
    Sizes sizes;
    const std::string mode = argc > 1 ? argv[1] : "";
    if (mode == "--quick") sizes = {std::size_t{64} << 20, 1'000, 100};
    const char* parent = std::getenv("TMPDIR");
    std::string pattern = std::string(parent != nullptr ? parent : "/tmp") + "/edits-bench-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) return 1;
    Bench(pattern, sizes).run(mode != "--deletions");
    return 0;
}
