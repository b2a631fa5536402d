#include "platform/revisions/RvStorageManager.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/foundation/RootDirectories.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

class RvStorageManagerTest : public ::testing::Test {
protected:
    RvStorageManagerTest() {
        root_.folder("storage");
        EXPECT_TRUE(RootDirectories::shared().add(storage(), RootPolicy::storage).ok());
        store_ = std::move(VolumeStore::open(root_ / "state").value());
        manager_.setStore(store_);
    }
    ~RvStorageManagerTest() override {
        manager_.setStore(nullptr);
        RootDirectories::shared().remove(storage());
    }

    std::string storage() const { return root_ / "storage"; }
    std::string file(std::string_view name) const { return root_.file("storage/" + std::string(name), "x"); }
    std::uint32_t device() const { return KsURL::fileURL(storage()).status().value().deviceID(); }
    std::uint32_t documentIDOf(const std::string& path) {
        const UniqueFd fd(::open(path.c_str(), O_PATH | O_CLOEXEC));
        return manager_.documentIDForDescriptor(fd.get());
    }
    static std::uint64_t fileIDOf(const std::string& path) { return KsURL::fileURL(path).status().value().fileID; }
    std::uint64_t resolve(std::int64_t documentID) {
        errno = 0;
        return manager_.resolveDocumentID(documentID, device());
    }
    Result<std::string> pathOf(std::uint64_t fileID) { return manager_.pathOfFileID(fileID, device(), 1024); }

    TemporaryFolder root_;
    std::shared_ptr<VolumeStore> store_;
    RvStorageManager manager_;
};

TEST_F(RvStorageManagerTest, givesADocumentOneLastingNumber) {
    const std::string a = file("a.txt");
    const std::uint32_t number = documentIDOf(a);
    EXPECT_NE(number, 0U);
    EXPECT_EQ(documentIDOf(a), number);
    EXPECT_NE(documentIDOf(file("b.txt")), number);
    EXPECT_EQ(resolve(number), fileIDOf(a));
}

TEST_F(RvStorageManagerTest, tellsWhyADocumentIsNotResolved) {
    EXPECT_EQ(resolve(4'000'000'000), 0U);
    EXPECT_EQ(errno, ENOENT);
    for (const std::int64_t number : {std::int64_t{0}, std::int64_t{-1}, std::int64_t{1} << 32}) {
        EXPECT_EQ(resolve(number), 0U);
        EXPECT_EQ(errno, EINVAL) << number;
    }
    const std::string a = file("a.txt");
    const std::uint32_t number = documentIDOf(a);
    ASSERT_EQ(::unlink(a.c_str()), 0);
    EXPECT_EQ(resolve(number), 0U);
    EXPECT_EQ(errno, ENOENT);
    manager_.setStore(nullptr);
    EXPECT_EQ(resolve(number), 0U);
    EXPECT_EQ(errno, EAGAIN);
}

TEST_F(RvStorageManagerTest, aPageOfEntriesIsOneTransaction) {
    auto directory = std::make_shared<DirectoryReference>();
    directory->path = storage();
    directory->fd = sys::openDirectoryForReading(AT_FDCWD, storage().c_str()).value();
    directory->status = sys::statx(directory->fd.get(), "").value();
    std::vector<KsURL> entries;
    for (int i = 0; i < 200; ++i) {
        const std::string name = "f" + std::to_string(i);
        file(name);
        entries.push_back(KsURL::child(directory, name));
    }
    entries.push_back(KsURL::child(directory, "missing"));
    const std::uint64_t before = store_->transactionCount();
    ASSERT_TRUE(manager_.identify(entries).ok());
    EXPECT_EQ(store_->transactionCount() - before, 1U);
    const auto number = entries[7].resourceValue(ResourceKey::documentIdentifier);
    ASSERT_TRUE(number.ok() && *number);
    EXPECT_EQ(std::get<std::uint64_t>(**number), documentIDOf(storage() + "/f7"));
    EXPECT_EQ(store_->transactionCount() - before, 1U);
}

TEST_F(RvStorageManagerTest, findsWhatNobodyEverSaw) {
    file("deep/er/a.txt");
    EXPECT_EQ(pathOf(fileIDOf(storage() + "/deep/er/a.txt")).value(), storage() + "/deep/er/a.txt");
    EXPECT_EQ(pathOf(fileIDOf(storage() + "/deep")).value(), storage() + "/deep");
    EXPECT_EQ(pathOf(fileIDOf(storage())).value(), storage());
}

TEST_F(RvStorageManagerTest, findsWhatMovedSinceItWasSeen) {
    const std::string a = file("one/a.txt");
    const std::uint64_t number = fileIDOf(a);
    EXPECT_EQ(pathOf(number).value(), a);
    ASSERT_EQ(::rename((storage() + "/one").c_str(), (storage() + "/two").c_str()), 0);
    EXPECT_EQ(pathOf(number).value(), storage() + "/two/a.txt");
    file("three/b.txt");
    ASSERT_EQ(::rename((storage() + "/two/a.txt").c_str(), (storage() + "/three/c.txt").c_str()), 0);
    file("two/a.txt");
    EXPECT_EQ(pathOf(number).value(), storage() + "/three/c.txt") << "another file has its old name";
}

TEST_F(RvStorageManagerTest, nothingOutsideIsFound) {
    const std::uint64_t outside = fileIDOf(root_.file("outside.txt"));
    EXPECT_TRUE(pathOf(outside).error().isPosix(ENOENT));
    EXPECT_TRUE(pathOf(fileIDOf("/")).error().isPosix(ENOENT));
    EXPECT_TRUE(manager_.pathOfFileID(fileIDOf(storage()), device() + 1, 1024).error().isPosix(ENOENT));
}

TEST_F(RvStorageManagerTest, aPathThatDoesNotFitIsTooLong) {
    const std::string a = file("a.txt");
    EXPECT_TRUE(manager_.pathOfFileID(fileIDOf(a), device(), a.size()).error().isPosix(ENAMETOOLONG));
    EXPECT_EQ(manager_.pathOfFileID(fileIDOf(a), device(), a.size() + 1).value(), a);
}

TEST_F(RvStorageManagerTest, numbersAreKeptOverRestarts) {
    const std::string a = file("a.txt");
    const std::uint32_t number = documentIDOf(a);
    manager_.setStore(nullptr);
    store_.reset();
    store_ = std::move(VolumeStore::open(root_ / "state").value());
    manager_.setStore(store_);
    EXPECT_EQ(documentIDOf(a), number);
    EXPECT_EQ(resolve(number), fileIDOf(a));
}

}  // namespace
}  // namespace cindral::test
