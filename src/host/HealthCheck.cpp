#include "host/HealthCheck.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>

#include "host/TerminalText.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Sys.h"

namespace cindral {
namespace {

// With less, a checkpoint of the store may fail.
constexpr std::uint64_t kStateBytesFreeMin = 16 << 20;

class Problems {
public:
    explicit Problems(const HealthSources& sources) : sources_(sources) {}

    void add(std::string what, std::string remedy) { found_.push_back({std::move(what), std::move(remedy)}); }
    std::vector<HealthProblem> take() { return std::move(found_); }

    bool isThere(std::string_view what, const std::string& folder) {
        if (::access(folder.c_str(), R_OK | W_OK | X_OK) == 0) return true;
        const int why = errno;
        if (why == ENOENT || why == ENOTDIR) {
            add(fmt::format("{} {} is not there", what, folder),
                "put it back, or mount the disk that it is on; then restart cindral");
        } else {
            add(fmt::format("{} {}: {}", what, folder, KsError::posix(why).reason()),
                why == EROFS ? "mount the disk that it is on so that it may be written to"
                             : "give yourself the right to read it and write to it");
        }
        return false;
    }

    /// What is published is what was opened, wherever it went since.
    void checkIdentity() {
        const std::string& real = sources_.paths.real();
        const auto root = RootDirectories::shared().rootHolding(sources_.paths.presented());
        const Result<UniqueFd> folder = sys::open(real.c_str(), O_PATH);
        if (!root || !folder.ok()) return;
        const Result<FileStatus> status = sys::statx(folder->get(), "");
        if (status.ok() && status->identity() != root->status.identity())
            add(fmt::format("the storage {} is another folder than the one that is shown", real), "restart cindral");
    }

    void checkSpace() {
        struct statvfs space {};
        if (::statvfs(sources_.state.c_str(), &space) != 0) return;
        const std::uint64_t bytes = std::uint64_t{space.f_bavail} * space.f_frsize;
        if (bytes < kStateBytesFreeMin)
            add(fmt::format("{} free where the state is kept, in {}", humanSize(bytes), sources_.state),
                "make room on that disk; documents are not concerned, but what happens to them can't be kept");
    }

    void checkFailure(std::string_view what, const std::optional<KsError>& error) {
        if (!error) return;
        add(fmt::format("{}: {}", what, error->reason()), remedyOf(*error));
    }

    void checkWatches() {
        const Recorder::Status& recorder = sources_.recorder;
        if (recorder.unwatchedFolders == 0) return;
        add(fmt::format("the limit of {} watches is reached: {} more folders are compared at each request instead",
                        recorder.watches.limit, recorder.unwatchedFolders),
            fmt::format("raise it: sudo sysctl fs.inotify.max_user_watches={}, and restart cindral",
                        2 * (recorder.watches.limit + recorder.unwatchedFolders)));
    }

    void checkReadable() {
        for (const Recorder::Uncovered& part : sources_.recorder.uncovered) {
            if (part.why == Recorder::kUnreadable)
                add(fmt::format("{} can't be read", sources_.paths.realPath(part.path)),
                    "give yourself the right to read it, or move it out of the storage");
        }
    }

    void checkErrors() {
        const ErrorLog::Recent& errors = sources_.errors;
        if (errors.count == 0) return;
        add(errors.count == 1
                ? fmt::format("an error was logged within the last hour: {}", errors.last)
                : fmt::format("{} errors were logged within the last hour, the last: {}", errors.count, errors.last),
            "cindral doctor looks at everything, repairs what it can, and begins the count anew; the log tells more");
    }

private:
    std::string remedyOf(const KsError& error) const {
        if (error.isPosix(ENOSPC) || error.isPosix(EDQUOT))
            return fmt::format("make room on the disk of {}; then it goes on by itself", sources_.state);
        if (error.isPosix(EROFS) || error.isPosix(EACCES) || error.isPosix(EPERM))
            return fmt::format("see to it that {} can be written to; then it goes on by itself", sources_.state);
        return "cindral doctor repairs what it can; the log tells more";
    }

    const HealthSources& sources_;
    std::vector<HealthProblem> found_;
};

}  // namespace

std::vector<HealthProblem> findHealthProblems(const HealthSources& sources) {
    Problems problems(sources);
    if (problems.isThere("the storage", sources.paths.real())) problems.checkIdentity();
    if (problems.isThere("the state folder", sources.state)) problems.checkSpace();
    problems.checkFailure("the store can't save", sources.storeFailure);
    problems.checkFailure("what happens can't be recorded", sources.recorder.failure);
    problems.checkWatches();
    problems.checkReadable();
    problems.checkFailure("the search index can't follow", sources.search.error);
    problems.checkErrors();
    return problems.take();
}

}  // namespace cindral
