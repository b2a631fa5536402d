#include "support/TemporaryFolder.h"

#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

namespace cindral::test {

TemporaryFolder::TemporaryFolder() : TemporaryFolder(::testing::TempDir()) {}

TemporaryFolder::TemporaryFolder(const std::string& parent) {
    std::string pattern = parent;
    if (!pattern.ends_with('/')) pattern += '/';
    pattern += "cindral-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    path_ = pattern;
}

TemporaryFolder::~TemporaryFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

std::string TemporaryFolder::file(std::string_view name, std::string_view contents) const {
    const std::string path = *this / name;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream stream(path, std::ios::binary);
    stream << contents;
    if (!stream.flush()) std::abort();
    return path;
}

std::string TemporaryFolder::folder(std::string_view name) const {
    std::filesystem::create_directories(*this / name);
    return *this / name;
}

std::string TemporaryFolder::inMemory() {
    const std::string memory = "/dev/shm";
    std::string pattern = memory + "/cindral-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) return ::testing::TempDir();
    const bool keepsAttributes = ::setxattr(pattern.c_str(), "user.probe", "", 0, 0) == 0;
    std::filesystem::remove(pattern);
    return keepsAttributes ? memory : ::testing::TempDir();
}

}  // namespace cindral::test
