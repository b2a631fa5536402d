#include "platform/tessel/TreeWalk.h"

#include <dirent.h>
#include <fcntl.h>

#include <cerrno>
#include <utility>

namespace cindral {

namespace {

// Folders on the way down beyond these are closed, and opened again on the way back: sixty operations at once, each
// with two descriptors a level, stay within the usual limit of 1,024.
constexpr std::size_t kOpenLevelsMax = 6;
constexpr std::size_t kBufferSize = 32'768;

class Walk {
public:
    Walk(const std::string& path, TreeVisitor& visitor) : path_(path), visitor_(visitor) {}

    Result<void> run(UniqueFd top) {
        Result<void> walked = push(std::move(top), "");
        while (walked.ok() && !levels_.empty()) walked = step();
        if (walked.ok() || walked.error().userInfo().contains("path")) return walked;
        return std::move(walked).error().with("path", currentPath());
    }

private:
    struct Level {
        WalkedFolder folder;
        std::vector<std::string> subfolders;  ///< still to be entered
        bool isRead = false;
    };

    std::string currentPath() const {
        std::string path = path_;
        for (const Level& level : levels_) {
            if (!level.folder.name.empty()) path.append("/").append(level.folder.name);
        }
        if (!entry_.empty()) path.append("/").append(entry_);
        return path;
    }

    Result<void> push(UniqueFd fd, std::string name) {
        Level level;
        level.folder.fd = std::move(fd);
        level.folder.name = std::move(name);
        level.folder.status = TRY(sys::statx(level.folder.fd.get(), ""));
        const WalkedFolder* above = levels_.empty() ? nullptr : &levels_.back().folder;
        const Descend descend = TRY(visitor_.willEnter(level.folder, above));
        entry_.clear();
        if (descend == Descend::no) return {};
        levels_.push_back(std::move(level));
        if (levels_.size() > kOpenLevelsMax) {
            WalkedFolder& outer = levels_[levels_.size() - 1 - kOpenLevelsMax].folder;
            outer.fd.reset();
            outer.counterpart.reset();
        }
        return {};
    }

    Result<void> step() {
        Level& level = levels_.back();
        if (!std::exchange(level.isRead, true)) return readEntries(level);
        if (level.subfolders.empty()) return pop();
        entry_ = std::move(level.subfolders.back());
        level.subfolders.pop_back();
        return enter(level.folder);
    }

    Result<void> readEntries(Level& level) {
        buffer_.resize(kBufferSize);
        while (true) {
            const Result<std::size_t> got = sys::getdents(level.folder.fd.get(), buffer_);
            // A folder that was removed while it was read has no more entries.
            if (!got.ok() && got.error().isPosix(ENOENT) && TRY(isRemoved(level.folder))) return {};
            const std::size_t size = TRY(got);
            if (size == 0) return {};
            for (std::size_t at = 0; at < size;) {
                const auto* record = reinterpret_cast<const DirectoryRecord*>(buffer_.data() + at);
                at += record->length;
                if (record->isDots()) continue;
                entry_ = record->name;
                if (TRY(isFolder(level.folder, record->type))) {
                    level.subfolders.push_back(entry_);
                } else {
                    TRY(visitor_.visit(level.folder, record->name));
                }
                entry_.clear();
            }
        }
    }

    static Result<bool> isRemoved(const WalkedFolder& folder) {
        return TRY(sys::statx(folder.fd.get(), "")).names == 0;
    }

    Result<bool> isFolder(const WalkedFolder& folder, std::uint8_t type) const {
        if (type != DT_UNKNOWN) return type == DT_DIR;
        const Result<FileStatus> status = sys::statx(folder.fd.get(), entry_.c_str());
        if (!status.ok() && status.error().isPosix(ENOENT)) return false;
        return TRY(status).isDirectory();
    }

    /// Goes into the entry that is to be a folder.
    Result<void> enter(const WalkedFolder& folder) {
        bool isUnlocked = false;
        while (true) {
            Result<UniqueFd> fd = sys::openDirectoryForReading(folder.fd.get(), entry_.c_str(), O_NOFOLLOW);
            if (fd.ok()) return push(std::move(*fd), entry_);
            if (fd.error().isPosix(EACCES) && !std::exchange(isUnlocked, true) &&
                visitor_.hasUnlocked(folder, entry_.c_str()))
                continue;
            if (!fd.error().isPosix(ENOENT) && !fd.error().isPosix(ENOTDIR) && !fd.error().isPosix(ELOOP))
                return std::move(fd).error();
            // Gone, or something else now. A look tells which, and whether it is worth another try.
            const Result<FileStatus> status = sys::statx(folder.fd.get(), entry_.c_str());
            if (!status.ok() && status.error().isPosix(ENOENT)) return {};
            if (!TRY(status).isDirectory()) return visitor_.visit(folder, entry_.c_str());
        }
    }

    Result<void> pop() {
        Level& level = levels_.back();
        WalkedFolder* above = levels_.size() > 1 ? &levels_[levels_.size() - 2].folder : nullptr;
        if (above != nullptr && !above->fd) TRY(reopen(*above, level.folder));
        if (TRY(visitor_.didLeave(level.folder, above)) == Leave::readAgain) {
            level.folder.fd = TRY(sys::openDirectoryForReading(level.folder.fd.get(), "."));
            level.isRead = false;
            return {};
        }
        levels_.pop_back();
        return {};
    }

    static Result<UniqueFd> openAbove(const UniqueFd& fd, const FileStatus& expected) {
        UniqueFd above = TRY(sys::openDirectoryForReading(fd.get(), ".."));
        if (!TRY(sys::statx(above.get(), "")).isSameObject(expected)) return KsError::posix(ESTALE);
        return above;
    }

    static Result<void> reopen(WalkedFolder& folder, const WalkedFolder& below) {
        folder.fd = TRY(openAbove(below.fd, folder.status));
        if (below.counterpart) folder.counterpart = TRY(openAbove(below.counterpart, folder.counterpartStatus));
        return {};
    }

    const std::string& path_;
    TreeVisitor& visitor_;
    std::vector<Level> levels_;
    std::vector<std::byte> buffer_;
    std::string entry_;  ///< looked at, in the innermost folder; empty when none is
};

}  // namespace

Result<void> walkTree(UniqueFd top, const std::string& path, TreeVisitor& visitor) {
    return Walk(path, visitor).run(std::move(top));
}

}  // namespace cindral
