#pragma once

#include <string>
#include <string_view>

namespace cindral::test {

/// A folder of its own that goes with the object, on the file system of TEST_TMPDIR, TMPDIR or /tmp.
class TemporaryFolder {
public:
    TemporaryFolder();
    ~TemporaryFolder();
    TemporaryFolder(const TemporaryFolder&) = delete;
    TemporaryFolder& operator=(const TemporaryFolder&) = delete;

    const std::string& path() const { return path_; }
    std::string operator/(std::string_view name) const { return path_ + "/" + std::string(name); }

    /// Writes a file below the folder, making the folders on the way.
    std::string file(std::string_view name, std::string_view contents = "") const;
    std::string folder(std::string_view name) const;

private:
    std::string path_;
};

}  // namespace cindral::test
