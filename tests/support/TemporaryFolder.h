#pragma once

#include <string>
#include <string_view>

namespace cindral::test {

/// A folder of its own that goes with the object, on the file system of TEST_TMPDIR, TMPDIR or /tmp.
class TemporaryFolder {
public:
    TemporaryFolder();
    explicit TemporaryFolder(const std::string& parent);
    ~TemporaryFolder();
    TemporaryFolder(const TemporaryFolder&) = delete;
    TemporaryFolder& operator=(const TemporaryFolder&) = delete;

    const std::string& path() const { return path_; }
    std::string operator/(std::string_view name) const { return path_ + "/" + std::string(name); }

    /// Writes a file below the folder, making the folders on the way.
    std::string file(std::string_view name, std::string_view contents = "") const;
    std::string folder(std::string_view name) const;

    /// Where folders are in memory, and nothing waits for a disk; where that keeps no attributes of one's own, the
    /// usual place.
    static std::string inMemory();

private:
    std::string path_;
};

}  // namespace cindral::test
