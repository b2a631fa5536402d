#include "platform/imaging/SvgRenderer.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <utility>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/Sys.h"
#include "platform/foundation/ThreadPool.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {
namespace {

using std::chrono::steady_clock;

constexpr const char* kProgramName = "cindral-render-svg";
// Beyond what the kernel lets the process have of the processor: a process that only sleeps takes none of it.
constexpr std::chrono::seconds kTimeMax{20};

struct GivenProgram {
    Mutex mutex;
    std::string path GUARDED_BY(mutex);

    static GivenProgram& instance() {
        static GivenProgram& given = *new GivenProgram;
        return given;
    }
};

/// A process that was started, and is never left behind.
class Child {
public:
    explicit Child(pid_t pid) : pid_(pid) {}
    ~Child() {
        if (pid_ < 0) return;
        ::kill(pid_, SIGKILL);
        wait();
    }
    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    bool endedWell() { return wait() == 0; }

private:
    int wait() {
        int status = -1;
        while (::waitpid(std::exchange(pid_, -1), &status, 0) < 0 && errno == EINTR) {
        }
        return status;
    }
    pid_t pid_;
};

struct Pipe {
    UniqueFd reading;
    UniqueFd writing;

    static Result<Pipe> make() {
        int ends[2];
        if (::pipe2(ends, O_CLOEXEC) != 0) return KsError::errorWithPOSIXCode();
        return Pipe{UniqueFd(ends[0]), UniqueFd(ends[1])};
    }
    /// One that can be written to without a signal when nobody reads any more.
    static Result<Pipe> makeQuiet() {
        int ends[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return KsError::errorWithPOSIXCode();
        return Pipe{UniqueFd(ends[0]), UniqueFd(ends[1])};
    }
};

class FileActions {
public:
    FileActions() { ::posix_spawn_file_actions_init(&actions_); }
    ~FileActions() { ::posix_spawn_file_actions_destroy(&actions_); }
    FileActions(const FileActions&) = delete;
    FileActions& operator=(const FileActions&) = delete;
    void use(int fd, int as) { ::posix_spawn_file_actions_adddup2(&actions_, fd, as); }
    void open(int fd, const char* path, int flags) {
        ::posix_spawn_file_actions_addopen(&actions_, fd, path, flags, 0);
    }
    const posix_spawn_file_actions_t* get() const { return &actions_; }

private:
    posix_spawn_file_actions_t actions_{};
};

Result<pid_t> start(const std::string& program, unsigned pixels, int input, int output) {
    FileActions actions;
    actions.use(input, STDIN_FILENO);
    actions.use(output, STDOUT_FILENO);
    actions.open(STDERR_FILENO, "/dev/null", O_WRONLY);
    std::string size = std::to_string(pixels);
    std::string name = kProgramName;
    std::array<char*, 3> words{name.data(), size.data(), nullptr};
    // Nothing of this process's surroundings is the drawing's business.
    std::array<char*, 1> environment{nullptr};
    pid_t pid = -1;
    const int failure = ::posix_spawn(&pid, program.c_str(), actions.get(), nullptr, words.data(), environment.data());
    if (failure != 0) return KsError::posix(failure, program);
    return pid;
}

bool setNonBlocking(int fd) {
    return ::fcntl(fd, F_SETFL, O_NONBLOCK) == 0;
}

/// Sends the drawing and receives the picture, both as far as the other end goes along.
class Exchange {
public:
    Exchange(UniqueFd sending, UniqueFd receiving, ByteView data, std::size_t expected)
        : sending_(std::move(sending)), receiving_(std::move(receiving)), rest_(data), picture_(expected + 1) {}

    Result<std::vector<std::uint8_t>> run() {
        if (!setNonBlocking(sending_.get()) || !setNonBlocking(receiving_.get())) return KsError::errorWithPOSIXCode();
        const auto deadline = steady_clock::now() + kTimeMax;
        while (receiving_) {
            const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - steady_clock::now()).count();
            if (left <= 0) return KsError::posix(ETIMEDOUT);
            pollfd descriptors[] = {{sending_.get(), POLLOUT, 0}, {receiving_.get(), POLLIN, 0}};
            if (::poll(descriptors, 2, static_cast<int>(left)) < 0 && errno != EINTR)
                return KsError::errorWithPOSIXCode();
            if (descriptors[0].revents != 0) send();
            if (descriptors[1].revents != 0) receive();
        }
        // Less is a drawing that was given up, more is no picture.
        if (filled_ + 1 != picture_.size()) return KsError::posix(EINVAL);
        picture_.resize(filled_);
        return std::move(picture_);
    }

private:
    void send() {
        const ssize_t sent = ::send(sending_.get(), rest_.data(), rest_.size(), MSG_NOSIGNAL);
        if (sent > 0) rest_ = rest_.subspan(static_cast<std::size_t>(sent));
        const bool mayGoOn = sent >= 0 || errno == EAGAIN || errno == EINTR;
        if (rest_.empty() || !mayGoOn) sending_.reset();
    }
    void receive() {
        const ssize_t got = ::read(receiving_.get(), picture_.data() + filled_, picture_.size() - filled_);
        if (got > 0) filled_ += static_cast<std::size_t>(got);
        const bool mayGoOn = got > 0 || (got < 0 && (errno == EAGAIN || errno == EINTR));
        if (!mayGoOn || filled_ == picture_.size()) receiving_.reset();
    }

    UniqueFd sending_;
    UniqueFd receiving_;
    ByteView rest_;
    std::vector<std::uint8_t> picture_;
    std::size_t filled_ = 0;
};

std::string folderOfThisProgram() {
    std::string path(4096, '\0');
    const ssize_t size = ::readlink("/proc/self/exe", path.data(), path.size());
    path.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
    return path.substr(0, path.rfind('/') + 1);
}

}  // namespace

void setSvgRendererProgram(std::string path) {
    GivenProgram& given = GivenProgram::instance();
    const MutexLock lock(given.mutex);
    given.path = std::move(path);
}

std::string svgRendererProgram() {
    GivenProgram& given = GivenProgram::instance();
    {
        const MutexLock lock(given.mutex);
        if (!given.path.empty()) return given.path;
    }
    const std::string folder = folderOfThisProgram();
    for (const std::string& candidate : {folder + kProgramName, folder + CINDRAL_LIBEXEC_FROM_BIN "/" + kProgramName}) {
        if (::access(candidate.c_str(), X_OK) == 0) return candidate;
    }
    return {};
}

Result<IconImage> renderSvg(ByteView data, unsigned pixels) {
    const std::string program = svgRendererProgram();
    if (program.empty()) return KsError::posix(ENOENT, kProgramName);
    Pipe drawing = TRY(Pipe::makeQuiet());
    Pipe picture = TRY(Pipe::make());
    const ThreadPool::BlockingRegion region;
    Child child(TRY(start(program, pixels, drawing.reading.get(), picture.writing.get())));
    drawing.reading.reset();
    picture.writing.reset();
    Exchange exchange(std::move(drawing.writing), std::move(picture.reading), data, std::size_t{pixels} * pixels * 4);
    IconImage image{pixels, pixels, TRY(exchange.run())};
    if (!child.endedWell()) return KsError::posix(EINVAL);
    return image;
}

}  // namespace cindral
