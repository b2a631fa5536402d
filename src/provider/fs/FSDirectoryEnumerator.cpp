#include "provider/fs/FSDirectoryEnumerator.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string_view>
#include <utility>

#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Sys.h"
#include "platform/tessel/TesselErrors.h"
#include "provider/Utilities.h"
#include "provider/fs/FSListingPositions.h"

namespace cindral {

namespace {

// Directories above these are closed while the scan is further down, and opened again on the way up.
constexpr std::size_t kOpenLevelsMax = 32;
// A page of 200 entries fills about one small buffer; what is read beyond the page is read again for the next.
constexpr std::size_t kSmallBufferSize = 8'192;
constexpr std::size_t kLargeBufferSize = 32'768;
constexpr std::uint64_t kSmallBufferEntriesMax = 256;

}  // namespace

Result<std::shared_ptr<const DirectoryReference>> describedDirectory(UniqueFd fd, std::string path,
                                                                     const DirectoryReference* parent) {
    auto directory = std::make_shared<DirectoryReference>();
    directory->path = std::move(path);
    directory->fd = std::move(fd);
    directory->seenAt = KsDate::now();
    directory->status = TRY(sys::statx(directory->fd.get(), ""));
    // A sub-directory on the same device is of the same file system; asking once is enough.
    const bool isMount = (directory->status.attributes & STATX_ATTR_MOUNT_ROOT) != 0;
    const bool same = parent != nullptr && parent->status.device == directory->status.device && !isMount;
    directory->traits = same ? parent->traits : sys::fileSystemTraits(directory->fd.get());
    return std::shared_ptr<const DirectoryReference>(std::move(directory));
}

/// One enumeration: the directories that are being scanned, from the listed one down to the innermost.
class FSDirectoryEnumerator::Scan {
public:
    Scan(FSDirectoryEnumerator& owner, const EnumeratorOptions& options, const Body& body)
        : owner_(owner), options_(options), body_(body) {}

    /// The scan's own failure, or the body's.
    Result<void> run() {
        std::size_t urlIndex = resume();
        for (; urlIndex < options_.urls.size(); ++urlIndex) {
            urlIndex_ = urlIndex;
            if (levels_.empty()) pushTop(options_.urls[urlIndex]);
            while (!levels_.empty() && owner_.complete_) TRY(step());
            if (!owner_.complete_) break;
        }
        return {};
    }

private:
    struct Level {
        std::shared_ptr<const DirectoryReference> directory;  ///< null while closed on the way down
        std::string path;
        std::uint64_t fileID = 0;
        DirectoryEnumerationOptions options = DirectoryEnumerationOptions::none;
        std::vector<std::byte> buffer;
        std::size_t at = 0;
        std::size_t filled = 0;
        std::int64_t nextOffset = 0;  ///< after the last entry consumed
        std::string lastName;         ///< of the last entry consumed; kept up to date only where nameIsStale is false
        std::size_t lastRecord = 0;
        bool nameIsStale = false;  ///< lastName is to be taken from the record at lastRecord
        bool mayRepeat = false;    ///< the next entry may be the last one consumed, again
    };

    bool limitReached() const {
        return owner_.counter_ >= options_.offset && owner_.counter_ - options_.offset >= options_.limit;
    }

    DirectoryEnumerationOptions optionsFor(const KsURL& url) const {
        if (!options_.directoryEnumerationOptionsFor) return DirectoryEnumerationOptions::none;
        return options_.directoryEnumerationOptionsFor(url).value_or(DirectoryEnumerationOptions::none);
    }

    void pushTop(const KsURL& url) {
        const std::optional<KsError> error =
            push(RootDirectories::openForReading(url.path()), url.path(), optionsFor(url));
        if (error && !owner_.openError_) owner_.openError_ = error;
    }

    void pushChild(const std::string& path, const char* name, DirectoryEnumerationOptions options) {
        push(sys::openDirectoryForReading(levels_.back().directory->fd.get(), name, O_NOFOLLOW), path, options);
        if (levels_.size() > kOpenLevelsMax) close(levels_[levels_.size() - 1 - kOpenLevelsMax]);
    }

    std::optional<KsError> push(Result<UniqueFd> fd, const std::string& path, DirectoryEnumerationOptions options) {
        auto directory = described(std::move(fd), path);
        if (!directory.ok()) {
            logError("can't open directory at {}; {}", path, directory.error().description());
            return directory.error().with("path", path);
        }
        Level level;
        level.path = path;
        level.fileID = (*directory)->status.fileID;
        level.options = options;
        level.directory = std::move(*directory);
        levels_.push_back(std::move(level));
        return std::nullopt;
    }

    Result<std::shared_ptr<const DirectoryReference>> described(Result<UniqueFd> fd, const std::string& path) const {
        return describedDirectory(TRY(std::move(fd)), path, levels_.empty() ? nullptr : levels_.back().directory.get());
    }

    /// The next record of the innermost directory, or null at its end.
    const DirectoryRecord* next(Level& level) {
        while (true) {
            if (level.at >= level.filled) {
                keepName(level);
                const std::uint64_t last =
                    options_.limit > UINT64_MAX - options_.offset ? UINT64_MAX : options_.offset + options_.limit;
                const bool few = last - std::min(last, owner_.counter_) <= kSmallBufferEntriesMax;
                level.buffer.resize(few ? kSmallBufferSize : kLargeBufferSize);
                const Result<std::size_t> size = sys::getdents(level.directory->fd.get(), level.buffer);
                // A directory that was removed while it was read has no more entries: that is its end.
                if (!size.ok() && !size.error().isPosix(ENOENT)) failedToRead(level, size.error());
                if (!size.ok() || *size == 0) return nullptr;
                level.filled = *size;
                level.at = 0;
            }
            const auto* record = reinterpret_cast<const DirectoryRecord*>(level.buffer.data() + level.at);
            level.at += record->length;
            if (record->isDots()) continue;
            if (std::exchange(level.mayRepeat, false) && level.lastName == record->name) continue;
            return record;
        }
    }

    void failedToRead(const Level& level, const KsError& error) {
        logError("can't read directory at {}; {}", level.path, error.description());
        if (levels_.size() == 1 && !owner_.openError_) owner_.openError_ = error.with("path", level.path);
    }

    static void keepName(Level& level) {
        if (!std::exchange(level.nameIsStale, false)) return;
        level.lastName = reinterpret_cast<const DirectoryRecord*>(level.buffer.data() + level.lastRecord)->name;
    }

    Result<void> step() {
        Level& level = levels_.back();
        // What is left of a directory that moved can't be told: the listing begins anew rather than miss it.
        if (!level.directory && !reopen(level)) return tesselErrorForExpiredPage();
        const DirectoryRecord* record = next(level);
        if (record == nullptr) {
            levels_.pop_back();
            return {};
        }
        if ((level.options & DirectoryEnumerationOptions::skipsHiddenNames) && record->name[0] == '.') return {};
        if (limitReached()) {
            owner_.complete_ = false;
            return {};
        }
        return consume(level, record);
    }

    Result<void> consume(Level& level, const DirectoryRecord* record) {
        KsURL entry = KsURL::child(level.directory, record->name);
        level.nextOffset = record->nextOffset;
        level.lastRecord = static_cast<std::size_t>(reinterpret_cast<const std::byte*>(record) - level.buffer.data());
        level.nameIsStale = true;
        const bool delivered = owner_.counter_ >= options_.offset;
        owner_.counter_ = checkedSum(owner_.counter_, 1);

        const bool descend = options_.recursively && isDirectory(record->type, entry) && shouldDescend(level, entry);
        const std::string path = descend ? entry.path() : std::string();
        const DirectoryEnumerationOptions childOptions =
            descend ? optionsFor(entry) : DirectoryEnumerationOptions::none;
        if (delivered) TRY(body_(std::move(entry)));
        if (descend) pushChild(path, record->name, childOptions);
        if (options_.positions != nullptr && limitReached()) savePosition();
        return {};
    }

    static bool isDirectory(std::uint8_t type, const KsURL& entry) {
        if (type != DT_UNKNOWN) return type == DT_DIR;
        const Result<FileStatus> status = entry.status();
        return status.ok() && status->isDirectory();
    }

    static bool shouldDescend(const Level& level, const KsURL& entry) {
        const Result<bool> isPackage = entry.isPackage();
        if (!isPackage.ok()) return false;
        const Result<FileStatus> status = entry.status();
        if (!status.ok() || status->device != level.directory->status.device) return false;
        return !(level.options & (*isPackage ? DirectoryEnumerationOptions::skipsPackageDescendants
                                             : DirectoryEnumerationOptions::skipsFolderDescendants));
    }

    static void close(Level& level) {
        keepName(level);
        level.directory.reset();
        level.buffer = {};
        level.at = level.filled = 0;
    }

    /// Opens a directory that was closed on the way down, at the entry after the last one consumed. False, after a
    /// line, when another is there now, or none.
    bool reopen(Level& level) const {
        auto directory = described(RootDirectories::openForReading(level.path), level.path);
        if (!directory.ok() || (*directory)->status.fileID != level.fileID ||
            ::lseek((*directory)->fd.get(), level.nextOffset, SEEK_SET) < 0) {
            logInfo("directory at {} moved while it was listed", level.path);
            return false;
        }
        level.directory = std::move(*directory);
        level.mayRepeat = true;
        return true;
    }

    void savePosition() {
        ListingPosition position;
        position.urlIndex = urlIndex_;
        for (Level& level : levels_) {
            if (!level.directory) return;  // Too deep for a hint; the next page counts.
            keepName(level);
            const FileStatus& status = level.directory->status;
            position.directories.push_back({level.path, status.fileID, status.device, status.modificationTime,
                                            status.changeTime, static_cast<std::int64_t>(level.options),
                                            level.nextOffset, level.lastName});
        }
        options_.positions->put(options_.positionsKey, owner_.counter_, std::move(position));
    }

    /// Takes the scan to its offset without counting, where a position is known and its directories are what they were.
    /// Answers the index of the listed directory to go on with.
    std::size_t resume() {
        if (options_.positions == nullptr || options_.offset == 0) return 0;
        const auto position = options_.positions->find(options_.positionsKey, options_.offset);
        if (!position || position->urlIndex >= options_.urls.size()) return 0;
        for (const DirectoryPosition& known : position->directories) {
            if (!resumeLevel(known)) {
                levels_.clear();
                return 0;
            }
        }
        owner_.counter_ = options_.offset;
        return position->urlIndex;
    }

    bool resumeLevel(const DirectoryPosition& known) {
        auto directory = described(RootDirectories::openForReading(known.path), known.path);
        if (!directory.ok()) return false;
        const FileStatus& status = (*directory)->status;
        if (status.fileID != known.fileID || status.device != known.device ||
            status.modificationTime != known.modificationTime || status.changeTime != known.changeTime ||
            ::lseek((*directory)->fd.get(), known.nextOffset, SEEK_SET) < 0) {
            return false;
        }
        Level level;
        level.path = known.path;
        level.fileID = known.fileID;
        level.options = static_cast<DirectoryEnumerationOptions>(known.options);
        level.directory = std::move(*directory);
        level.nextOffset = known.nextOffset;
        level.lastName = known.lastName;
        level.mayRepeat = !known.lastName.empty();
        levels_.push_back(std::move(level));
        return true;
    }

    FSDirectoryEnumerator& owner_;
    const EnumeratorOptions& options_;
    const Body& body_;
    std::vector<Level> levels_;
    std::size_t urlIndex_ = 0;
};

Result<void> FSDirectoryEnumerator::enumerate(const EnumeratorOptions& options, const Body& body) {
    counter_ = 0;
    complete_ = true;
    openError_.reset();
    return Scan(*this, options, body).run();
}

}  // namespace cindral
