#include "platform/foundation/Log.h"

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <optional>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {
namespace log {

// Made before any code runs and never destroyed, because static objects log from their constructors and destructors.
constinit std::atomic<LogLevel> detail::lowestLevel = LogLevel::info;

namespace {

struct FileNumbers {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
};

/// Where lines go. `mutex` is held over a whole line, so that long lines, which take several writes, stay whole.
struct Output {
    Mutex mutex;
    FileNumbers journal GUARDED_BY(mutex);
    bool hasJournal GUARDED_BY(mutex) = false;
    bool isMidLine GUARDED_BY(mutex) = false;
};
constinit Output output;

struct Observing {
    Mutex mutex;
    const Observer* observer GUARDED_BY(mutex) = nullptr;
    std::atomic<bool> isOn = false;  ///< spares the lock where nobody observes
};
constinit Observing observing;

std::string_view levelName(LogLevel level) {
    switch (level) {
        case LogLevel::debug: return "debug";
        case LogLevel::info: return "info";
        case LogLevel::error: return "error";
    }
    return {};
}

/// LOG_DEBUG, LOG_INFO and LOG_ERR of syslog.
int syslogPriority(LogLevel level) {
    switch (level) {
        case LogLevel::debug: return 7;
        case LogLevel::info: return 6;
        case LogLevel::error: return 3;
    }
    return 0;
}

LogLevel levelNamed(std::string_view name) {
    for (const LogLevel level : {LogLevel::debug, LogLevel::error}) {
        if (name == levelName(level)) return level;
    }
    return LogLevel::info;
}

/// "DEVICE:INODE", both decimal.
std::optional<FileNumbers> parseFileNumbers(std::string_view text) {
    FileNumbers numbers;
    const char* const end = text.data() + text.size();
    const auto device = std::from_chars(text.data(), end, numbers.device);
    if (device.ec != std::errc() || device.ptr == end || *device.ptr != ':') return std::nullopt;
    const auto inode = std::from_chars(device.ptr + 1, end, numbers.inode);
    if (inode.ec != std::errc() || inode.ptr != end) return std::nullopt;
    return numbers;
}

// Asked anew for each line: standard error may have been redirected since the service manager named its stream.
bool isJournal() REQUIRES(output.mutex) {
    struct stat status;
    return output.hasJournal && ::fstat(STDERR_FILENO, &status) == 0 && status.st_dev == output.journal.device &&
           status.st_ino == output.journal.inode;
}

void appendTime(std::string& line) {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    tm parts{};
    ::gmtime_r(&now.tv_sec, &parts);
    fmt::format_to(std::back_inserter(line), "{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:06}Z", parts.tm_year + 1900,
                   parts.tm_mon + 1, parts.tm_mday, parts.tm_hour, parts.tm_min, parts.tm_sec, now.tv_nsec / 1000);
}

bool isContinuation(unsigned char byte) {
    return (byte & 0xC0) == 0x80;
}

/// Bytes of the well-formed UTF-8 sequence that the text begins with, 0 when it begins with none.
std::size_t sequenceLength(std::string_view text) {
    const auto at = [&](std::size_t i) { return i < text.size() ? static_cast<unsigned char>(text[i]) : 0U; };
    const unsigned lead = at(0);
    if (lead < 0x80) return 1;
    const std::size_t length = lead >= 0xC2 && lead < 0xE0   ? 2
                               : lead >= 0xE0 && lead < 0xF0 ? 3
                               : lead >= 0xF0 && lead < 0xF5 ? 4
                                                             : 0;
    for (std::size_t i = 1; i < length; ++i) {
        if (!isContinuation(static_cast<unsigned char>(at(i)))) return 0;
    }
    // Overlong forms, surrogates, and what lies beyond the last code point.
    const unsigned second = at(1);
    if ((lead == 0xE0 && second < 0xA0) || (lead == 0xED && second >= 0xA0)) return 0;
    if ((lead == 0xF0 && second < 0x90) || (lead == 0xF4 && second >= 0x90)) return 0;
    return length;
}

/// Whether the sequence, which is well formed, could end a line or steer a terminal.
bool isControl(std::string_view sequence) {
    const auto lead = static_cast<unsigned char>(sequence[0]);
    if (sequence.size() == 1) return lead < 0x20 || lead == 0x7F;
    if (sequence.size() == 2) return lead == 0xC2 && static_cast<unsigned char>(sequence[1]) < 0xA0;
    return sequence == "\u2028" || sequence == "\u2029";
}

void appendEscaped(std::string& line, std::string_view message) {
    while (!message.empty()) {
        const std::size_t length = sequenceLength(message);
        const std::string_view sequence = message.substr(0, length == 0 ? 1 : length);
        if (length != 0 && !isControl(sequence)) {
            line += sequence;
        } else {
            for (const char byte : sequence)
                fmt::format_to(std::back_inserter(line), "\\x{:02x}", static_cast<unsigned char>(byte));
        }
        message.remove_prefix(sequence.size());
    }
}

/// Keeps a write to a pipe that nobody reads from ending the process.
class BrokenPipeGuard {
public:
    BrokenPipeGuard() {
        ::sigemptyset(&signal_);
        ::sigaddset(&signal_, SIGPIPE);
        ::pthread_sigmask(SIG_BLOCK, &signal_, &before_);
    }
    ~BrokenPipeGuard() {
        // The signal was raised for this thread. One that waited before, blocked by somebody else, is left to them.
        if (isBroken_ && ::sigismember(&before_, SIGPIPE) == 0) {
            const timespec none{};
            while (::sigtimedwait(&signal_, nullptr, &none) < 0 && errno == EINTR) {
            }
        }
        ::pthread_sigmask(SIG_SETMASK, &before_, nullptr);
    }
    BrokenPipeGuard(const BrokenPipeGuard&) = delete;
    BrokenPipeGuard& operator=(const BrokenPipeGuard&) = delete;
    void markBroken() { isBroken_ = true; }

private:
    sigset_t signal_;
    sigset_t before_;
    bool isBroken_ = false;
};

void writeLine(std::string_view line) REQUIRES(output.mutex) {
    BrokenPipeGuard guard;
    while (!line.empty()) {
        const ssize_t written = ::write(STDERR_FILENO, line.data(), line.size());
        if (written < 0 && errno == EINTR) continue;
        if (written <= 0) {
            if (written < 0 && errno == EPIPE) guard.markBroken();
            return;
        }
        line.remove_prefix(static_cast<std::size_t>(written));
        // Standard error may take no more than a part: then the next line begins with the end of this one.
        output.isMidLine = !line.empty();
    }
}

void notifyObserver(LogLevel level, std::string_view message, LogChannel channel) {
    if (!observing.isOn.load(std::memory_order_acquire)) return;
    const MutexLock lock(observing.mutex);
    if (observing.observer != nullptr) (*observing.observer)(level, message, channel);
}

[[maybe_unused]] const bool isConfigured = (configureFromEnvironment(), true);

}  // namespace

LogLevel level() {
    return detail::lowestLevel.load(std::memory_order_relaxed);
}

void setLevel(LogLevel level) {
    detail::lowestLevel.store(level, std::memory_order_relaxed);
}

void configureFromEnvironment() {
    const char* const name = std::getenv("CINDRAL_LOG");
    setLevel(levelNamed(name == nullptr ? "" : name));
    const char* const stream = std::getenv("JOURNAL_STREAM");
    const auto journal = parseFileNumbers(stream == nullptr ? "" : stream);
    const MutexLock lock(output.mutex);
    output.hasJournal = journal.has_value();
    output.journal = journal.value_or(FileNumbers{});
}

void write(LogLevel level, std::string_view message, LogChannel channel) {
    if (!enabled(level)) return;
    // Callers log between a failed call and their look at errno.
    const int savedErrno = errno;
    notifyObserver(level, message, channel);
    std::string line;
    line.reserve(message.size() + 48);
    {
        const MutexLock lock(output.mutex);
        if (output.isMidLine) line += '\n';
        if (isJournal()) {
            fmt::format_to(std::back_inserter(line), "<{}>", syslogPriority(level));
        } else {
            appendTime(line);
            line += ' ';
        }
        line += levelName(level);
        line += ' ';
        appendEscaped(line, message);
        line += '\n';
        writeLine(line);
    }
    errno = savedErrno;
}

void setObserver(Observer observer) {
    const Observer* const next = observer ? new Observer(std::move(observer)) : nullptr;
    const Observer* previous = nullptr;
    {
        const MutexLock lock(observing.mutex);
        previous = std::exchange(observing.observer, next);
        observing.isOn.store(next != nullptr, std::memory_order_release);
    }
    delete previous;
}

}  // namespace log

namespace {

/// Draws section numbers.
struct SectionCounter {
    SerialQueue queue{"cindral.log-section"};
    std::uint64_t last GUARDED_BY(queue) = 0;
};

SectionCounter& sectionCounter() {
    static SectionCounter& counter = *new SectionCounter;
    return counter;
}

}  // namespace

std::uint64_t newLogSection() {
    SectionCounter& counter = sectionCounter();
    std::uint64_t number = 0;
    counter.queue.sync([&] {
        counter.queue.assertCurrent();
        number = ++counter.last;
    });
    return number;
}

void openLogSection(std::uint64_t number, std::string_view title) {
    logDebug("┏{} {}", number, title);
}

void closeLogSection(std::uint64_t number) {
    logDebug("┗{}", number);
}

std::string errnoText(int errorNumber) {
    const char* const name = ::strerrorname_np(errorNumber);
    return fmt::format("{} ({})", name == nullptr ? "unknown" : name, errorNumber);
}

}  // namespace cindral
