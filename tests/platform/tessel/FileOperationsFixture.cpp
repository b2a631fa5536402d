#include "platform/tessel/FileOperationsFixture.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SysFaults.h"
#include "platform/tessel/StagingFolder.h"
#include "platform/tessel/TesselManager.h"

namespace cindral::test {

namespace {

// Whole seconds and nanoseconds, both of which a copy keeps.
constexpr timespec kThen[2] = {{1'000'000'000, 123'456'789}, {1'100'000'000, 987'654'321}};

}  // namespace

FileOperationsTest::FileOperationsTest(const std::string& parent)
    : folder_(parent), storage_(folder_.folder("Documents")) {
    if (!RootDirectories::shared().add(storage_, RootPolicy::storage).ok()) std::abort();
    TesselManager::defaultManager().setDocumentStorageURL(urlOf(storage_));
    folder("target");
}

FileOperationsTest::~FileOperationsTest() {
    RootDirectories::shared().remove(storage_);
}

void FileOperationsTest::makeTree(const std::string& path) const {
    std::filesystem::create_directories(path + "/empty");
    std::filesystem::create_directories(path + "/sub");
    const auto write = [&](const std::string& name, std::string_view contents) {
        std::ofstream(path + name, std::ios::binary) << contents;
        ::utimensat(AT_FDCWD, (path + name).c_str(), kThen, 0);
    };
    write("/file", "what is in the file");
    write("/sub/one", "of two names");
    std::filesystem::create_hard_link(path + "/sub/one", path + "/sub/other");
    std::filesystem::create_symlink("../nowhere", path + "/link");
    if (::mkfifo((path + "/sub/fifo").c_str(), 0620) != 0) std::abort();
    setAttribute(path + "/file", "user.tag", "green");
    setAttribute(path + "/sub", "user.tag", "blue");
    for (const char* name : {"/link", "/sub/fifo"})
        ::utimensat(AT_FDCWD, (path + name).c_str(), kThen, AT_SYMLINK_NOFOLLOW);
    ::chmod((path + "/file").c_str(), 0640);
    ::chmod((path + "/empty").c_str(), 0711);
}

std::vector<std::string> FileOperationsTest::leftovers() const {
    std::vector<std::string> names;
    std::error_code missing;
    for (const auto& entry : std::filesystem::directory_iterator(path(kTemporaryLocalFolderName), missing))
        names.push_back(entry.path().filename());
    return names;
}

ObjectIdentity FileOperationsTest::identityOf(std::string_view name) const {
    // No fault of a test's is in the way of looking.
    const sys::FaultInjection none([](const char* /*call*/) { return 0; });
    Result<FileStatus> status = sys::statx(AT_FDCWD, path(name).c_str());
    EXPECT_TRUE(status.ok()) << name;
    return std::move(status).valueOr(FileStatus()).identity();
}

std::string FileOperationsTest::contentsOf(const std::string& path) {
    std::ifstream stream(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), {}};
}

void FileOperationsTest::setAttribute(const std::string& path, const char* name, std::string_view value) {
    if (::lsetxattr(path.c_str(), name, value.data(), value.size(), 0) != 0) std::abort();
}

std::optional<std::string> FileOperationsTest::attribute(const std::string& path, const char* name) {
    std::array<char, 65'536> value{};
    const ssize_t size = ::lgetxattr(path.c_str(), name, value.data(), value.size());
    if (size < 0) return std::nullopt;
    return std::string(value.data(), static_cast<std::size_t>(size));
}

}  // namespace cindral::test
