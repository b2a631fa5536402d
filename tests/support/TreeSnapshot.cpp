#include "support/TreeSnapshot.h"

#include <fmt/format.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>

namespace cindral::test {

namespace {

std::string attributesOf(const std::string& path) {
    std::array<char, 4096> names{};
    const ssize_t size = ::llistxattr(path.c_str(), names.data(), names.size());
    std::set<std::string> texts;
    for (const char* name = names.data(); size > 0 && name < names.data() + size;
         name += std::string(name).size() + 1) {
        std::array<char, 4096> value{};
        const ssize_t length = ::lgetxattr(path.c_str(), name, value.data(), value.size());
        if (std::string_view(name).starts_with("user."))
            texts.insert(fmt::format(" {}={}", name, std::string(value.data(), length > 0 ? length : 0)));
    }
    std::string all;
    for (const std::string& text : texts) all += text;
    return all;
}

std::string describe(const std::string& path) {
    struct stat status {};
    if (::lstat(path.c_str(), &status) != 0) std::abort();
    std::string text = fmt::format("{:o}{}", status.st_mode, attributesOf(path));
    if (S_ISLNK(status.st_mode)) text += " -> " + std::filesystem::read_symlink(path).string();
    if (!S_ISDIR(status.st_mode)) text += fmt::format(" {}.{:09}", status.st_mtim.tv_sec, status.st_mtim.tv_nsec);
    if (S_ISREG(status.st_mode)) {
        std::ifstream stream(path, std::ios::binary);
        text += " \"" + std::string(std::istreambuf_iterator<char>(stream), {}) + "\"";
    }
    return text;
}

}  // namespace

TreeSnapshot snapshotOf(const std::string& folder, bool withTemporary) {
    TreeSnapshot snapshot;
    auto walk = std::filesystem::recursive_directory_iterator(folder);
    for (; walk != std::filesystem::recursive_directory_iterator(); ++walk) {
        if (!withTemporary && walk->path().filename() == ".TemporaryLocalFolder") {
            walk.disable_recursion_pending();
            continue;
        }
        snapshot.emplace(walk->path().lexically_relative(folder).string(), describe(walk->path().string()));
    }
    return snapshot;
}

}  // namespace cindral::test
