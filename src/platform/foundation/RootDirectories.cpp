#include "platform/foundation/RootDirectories.h"

#include <fcntl.h>
#include <linux/openat2.h>

#include <algorithm>
#include <cerrno>

#include "platform/foundation/Log.h"

namespace cindral {

namespace {

bool holds(std::string_view root, std::string_view path) {
    return path.starts_with(root) && (path.size() == root.size() || path[root.size()] == '/' || root == "/");
}

// Enough to tell a person what is the matter; a tree with more mounts than that has one matter only.
constexpr std::size_t kLeftOutMax = 1000;

Result<std::shared_ptr<const RootDirectory>> openRoot(const std::string& path, RootPolicy policy) {
    auto root = std::make_shared<RootDirectory>();
    // An application may put a link in place of its Documents folder, to anywhere.
    const int flags = policy == RootPolicy::applicationContainer ? O_NOFOLLOW : 0;
    root->fd = TRY(sys::openDirectoryForReading(AT_FDCWD, path.c_str(), flags));
    root->path = path;
    root->status = TRY(sys::statx(root->fd.get(), ""));
    root->policy = policy;
    return std::shared_ptr<const RootDirectory>(std::move(root));
}

bool isSameRoot(const RootDirectory& a, const RootDirectory& b) {
    return a.path == b.path && a.policy == b.policy && a.status.fileID == b.status.fileID &&
           a.status.device == b.status.device && a.status.birthTime == b.status.birthTime;
}

}  // namespace

DirectoryReference::~DirectoryReference() {
    if (!fd) return;
    if (::close(fd.release()) != 0)
        logError("can't close directory at {}; {}", path, KsError::errorWithPOSIXCode().description());
}

RootDirectories& RootDirectories::shared() {
    // Never destroyed: work that ends with the process may still look a root up.
    static RootDirectories& directories = *new RootDirectories;
    return directories;
}

Result<std::shared_ptr<const RootDirectory>> RootDirectories::add(const std::string& path, RootPolicy policy) {
    auto root = TRY(openRoot(path, policy));
    {
        const MutexLock lock(mutex_);
        put(root);
    }
    tellObserver();
    return root;
}

void RootDirectories::put(std::shared_ptr<const RootDirectory> root) {
    Roots roots = roots_ ? *roots_ : Roots();
    std::erase_if(roots, [&](const auto& other) { return other->path == root->path; });
    roots.push_back(std::move(root));
    // The longest first, so that the first that holds a path is the innermost.
    std::ranges::sort(roots, std::ranges::greater(), [](const auto& other) { return other->path.size(); });
    roots_ = std::make_shared<const Roots>(std::move(roots));
}

void RootDirectories::remove(std::string_view path) {
    {
        const MutexLock lock(mutex_);
        if (!roots_) return;
        Roots roots = *roots_;
        if (std::erase_if(roots, [&](const auto& other) { return other->path == path; }) == 0) return;
        roots_ = std::make_shared<const Roots>(std::move(roots));
    }
    tellObserver();
}

void RootDirectories::setApplicationContainers(const std::vector<std::string>& paths) {
    changeApplicationContainers(paths, TakeBack::yes);
}

void RootDirectories::addApplicationContainers(const std::vector<std::string>& paths) {
    changeApplicationContainers(paths, TakeBack::no);
}

void RootDirectories::changeApplicationContainers(const std::vector<std::string>& paths, TakeBack takeBack) {
    Roots opened;
    for (const std::string& path : paths) {
        auto root = openRoot(path, RootPolicy::applicationContainer);
        if (root.ok()) {
            opened.push_back(*std::move(root));
        } else {
            logDebug("can't publish {}; {}", path, root.error().description());
        }
    }
    const auto isOpened = [&](const std::string& path) {
        return std::ranges::find(opened, path, [](const auto& root) { return root->path; }) != opened.end();
    };
    bool isChanged = false;
    {
        const MutexLock lock(mutex_);
        Roots roots = roots_ ? *roots_ : Roots();
        if (takeBack == TakeBack::yes) {
            isChanged = std::erase_if(roots, [&](const auto& root) {
                            return root->policy == RootPolicy::applicationContainer && !isOpened(root->path);
                        }) > 0;
            roots_ = std::make_shared<const Roots>(roots);
        }
        for (const auto& root : opened) {
            const bool isKnown =
                std::ranges::any_of(roots, [&](const auto& other) { return isSameRoot(*other, *root); });
            if (isKnown) continue;
            put(root);
            isChanged = true;
        }
    }
    if (isChanged) tellObserver();
}

void RootDirectories::setObserver(Observer observer) {
    observerQueue_.sync([&] {
        observerQueue_.assertCurrent();
        observer_.swap(observer);
    });
}

void RootDirectories::tellObserver() {
    // Who changes the roots doesn't wait: the observer may read all that is new.
    observerQueue_.async([this] {
        observerQueue_.assertCurrent();
        if (observer_) observer_(all());
    });
}

void RootDirectories::waitForObserver() {
    observerQueue_.sync([] {});
}

std::vector<std::shared_ptr<const RootDirectory>> RootDirectories::all() const {
    const MutexLock lock(mutex_);
    return roots_ ? *roots_ : Roots();
}

std::shared_ptr<const RootDirectory> RootDirectories::rootHolding(std::string_view path) const {
    std::shared_ptr<const Roots> roots;
    {
        const MutexLock lock(mutex_);
        roots = roots_;
    }
    if (!roots) return nullptr;
    const auto found = std::ranges::find_if(*roots, [&](const auto& root) { return holds(root->path, path); });
    return found == roots->end() ? nullptr : *found;
}

bool RootDirectories::isPublishedDevice(std::uint64_t device) const {
    const MutexLock lock(mutex_);
    return roots_ && std::ranges::any_of(*roots_, [device](const auto& root) { return root->status.device == device; });
}

bool RootDirectories::noteLeftOut(const std::string& path, const std::string& why) {
    const MutexLock lock(mutex_);
    if (leftOut_.size() >= kLeftOutMax || std::ranges::find(leftOut_, path, &LeftOut::path) != leftOut_.end())
        return false;
    leftOut_.push_back({path, why});
    return true;
}

std::vector<RootDirectories::LeftOut> RootDirectories::leftOut() const {
    const MutexLock lock(mutex_);
    return leftOut_;
}

Result<UniqueFd> RootDirectories::openForReading(const std::string& path) {
    constexpr int kFlags = O_RDONLY | O_DIRECTORY | O_NONBLOCK;
    Result<UniqueFd> opened = open(path, kFlags | O_NOATIME);
    // Only an object's owner may leave its access time alone.
    if (!opened.ok() && opened.error().isPosix(EPERM)) opened = open(path, kFlags);
    return opened;
}

Result<UniqueFd> RootDirectories::open(const std::string& path, int flags) {
    // A NUL would silently name another object.
    if (path.find('\0') != std::string::npos) return KsError::posix(EINVAL, path);
    const auto root = shared().rootHolding(path);
    if (!root) return sys::open(path.c_str(), flags | O_NOFOLLOW);
    std::string_view relative = std::string_view(path).substr(root->path.size());
    while (relative.starts_with('/')) relative.remove_prefix(1);
    const std::uint64_t resolve = root->policy == RootPolicy::applicationContainer ? RESOLVE_NO_SYMLINKS : 0;
    return sys::openBeneath(root->fd.get(), relative, flags | O_NOFOLLOW, resolve);
}

}  // namespace cindral
