#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/foundation/Sys.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// A directory and the path that it is presented under.
///
/// Thread safety: immutable.
struct DirectoryReference {
    DirectoryReference() = default;
    ~DirectoryReference();
    DirectoryReference(const DirectoryReference&) = delete;
    DirectoryReference& operator=(const DirectoryReference&) = delete;

    UniqueFd fd;                   ///< invalid: nothing is to be read of what is in the directory
    std::string path;              ///< absolute, without a trailing slash
    FileStatus status;             ///< without a descriptor only the file ID, the device and that it is a directory
    KsDate seenAt;                 ///< when the status was taken
    sys::FileSystemTraits traits;  ///< nothing to rely on where nobody asked
};

/// Whether links inside a root may be walked through. What an application can write to is not trusted.
enum class RootPolicy { storage, applicationContainer };

struct RootDirectory : DirectoryReference {
    RootPolicy policy = RootPolicy::storage;
};

/// The directories whose contents are published, each held open.
///
/// Every access to something below a root starts at the root's descriptor and stays beneath it, so that no link,
/// swapped at any moment, leads outside.
///
/// Thread safety: all operations, from any thread.
class RootDirectories {
public:
    static RootDirectories& shared();

    /// Opens the directory (links in the path itself are followed; an application's Documents folder is none) and
    /// publishes it under `path`, replacing an earlier one of that path.
    Result<std::shared_ptr<const RootDirectory>> add(const std::string& path, RootPolicy policy);
    void remove(std::string_view path);
    /// Makes the Documents folders at the paths the only ones of applications that are published, at once: opens those
    /// that are missing and those that another folder has taken the place of, and takes back all others. One that can't
    /// be opened is left out, with a debug line.
    void setApplicationContainers(const std::vector<std::string>& paths);
    /// The same, without taking any back.
    void addApplicationContainers(const std::vector<std::string>& paths);

    /// Hears of every change of the roots, with all of them as they are: one call at a time, on a queue of its own
    /// ("cindral.roots"), the last of them after the last change. Null hears nothing; a call never outlasts the
    /// setObserver() that replaces it.
    using Observer = std::function<void(const std::vector<std::shared_ptr<const RootDirectory>>&)>;
    void setObserver(Observer observer);
    /// Has the observer called as after a change.
    void tellObserver();
    /// Returns when the observer has been told of every change that was made before the call.
    void waitForObserver();

    /// The root that is or holds the path, by whole components; the innermost when there are several; null when there
    /// is none.
    std::shared_ptr<const RootDirectory> rootHolding(std::string_view path) const;
    std::vector<std::shared_ptr<const RootDirectory>> all() const;

    /// Whether a root lies on the device: numbers of another name nothing that is published.
    bool isPublishedDevice(std::uint64_t device) const;

    /// Tells that something below a root is not published, and why. True the first time that is said of the path.
    bool noteLeftOut(const std::string& path, const std::string& why);
    struct LeftOut {
        std::string path;
        std::string why;
    };
    std::vector<LeftOut> leftOut() const;

    /// Opens a directory to be listed, as open() does, leaving its access time alone where the process may.
    static Result<UniqueFd> openForReading(const std::string& path);
    /// Opens what is at the path: beneath its root, or, where no root holds it, from the top without following a final
    /// link.
    static Result<UniqueFd> open(const std::string& path, int flags);

private:
    using Roots = std::vector<std::shared_ptr<const RootDirectory>>;
    enum class TakeBack { no, yes };
    void changeApplicationContainers(const std::vector<std::string>& paths, TakeBack takeBack);
    void put(std::shared_ptr<const RootDirectory> root) REQUIRES(mutex_);

    mutable Mutex mutex_;
    std::shared_ptr<const std::vector<std::shared_ptr<const RootDirectory>>> roots_ GUARDED_BY(mutex_);
    std::vector<LeftOut> leftOut_ GUARDED_BY(mutex_);

    SerialQueue observerQueue_{"cindral.roots"};  // Below what its tasks use.
    Observer observer_ GUARDED_BY(observerQueue_);
};

}  // namespace cindral
