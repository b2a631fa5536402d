#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/KsURL.h"
#include "platform/tessel/FileOperations.h"
#include "support/TemporaryFolder.h"
#include "support/TreeSnapshot.h"

namespace cindral::test {

/// A published storage "Documents" with a folder "target", and things outside of it.
class FileOperationsTest : public ::testing::Test {
protected:
    FileOperationsTest() : FileOperationsTest(::testing::TempDir()) {}
    explicit FileOperationsTest(const std::string& parent);
    ~FileOperationsTest() override;

    static KsURL urlOf(const std::string& path) { return KsURL::fileURL(path); }
    KsURL url(std::string_view name) const { return urlOf(storage_ + "/" + std::string(name)); }
    std::string path(std::string_view name) const { return storage_ + "/" + std::string(name); }
    std::string outside(std::string_view name) const { return folder_ / name; }
    std::string file(std::string_view name, std::string_view contents = "contents") const {
        return folder_.file("Documents/" + std::string(name), contents);
    }
    std::string folder(std::string_view name) const { return folder_.folder("Documents/" + std::string(name)); }

    /// A folder with a file, a link, an empty folder, a folder with two names of one file, and a FIFO.
    void makeTree(const std::string& path) const;

    TreeSnapshot snapshot() const { return snapshotOf(folder_.path()); }
    /// Entries of the storage's temporary folder.
    std::vector<std::string> leftovers() const;

    /// Of what is at the name now.
    ObjectIdentity identityOf(std::string_view name) const;

    static std::string contentsOf(const std::string& path);
    static void setAttribute(const std::string& path, const char* name, std::string_view value);
    static std::optional<std::string> attribute(const std::string& path, const char* name);

    /// The error's domain and code as one text; "" for success.
    template <typename T>
    static std::string errorOf(const Result<T>& result) {
        return result.ok() ? "" : std::string(result.error().domain()) + " " + std::to_string(result.error().code());
    }

    TemporaryFolder folder_;
    std::string storage_;
    TesselProgress progress_;
};

}  // namespace cindral::test
