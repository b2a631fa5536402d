#include "host/Descriptor.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>

namespace cindral::descriptor {
namespace {

/// Waits for a descriptor that somebody else made non-blocking, as a shell's terminal may be.
Result<void> waitFor(int fd, short events) {
    pollfd entry{fd, events, 0};
    while (::poll(&entry, 1, -1) < 0) {
        if (errno != EINTR) return KsError::errorWithPOSIXCode();
    }
    return {};
}

}  // namespace

Result<std::size_t> read(int fd, std::span<char> buffer) {
    while (true) {
        const ssize_t got = ::read(fd, buffer.data(), buffer.size());
        if (got >= 0) return static_cast<std::size_t>(got);
        if (errno == EAGAIN) {
            TRY(waitFor(fd, POLLIN));
        } else if (errno != EINTR) {
            return KsError::errorWithPOSIXCode();
        }
    }
}

Result<void> writeAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t put = ::write(fd, bytes.data(), bytes.size());
        if (put >= 0) {
            bytes.remove_prefix(static_cast<std::size_t>(put));
        } else if (errno == EAGAIN) {
            TRY(waitFor(fd, POLLOUT));
        } else if (errno != EINTR) {
            return KsError::errorWithPOSIXCode();
        }
    }
    return {};
}

Result<Readiness> waitForInput(int input, int output, int interrupt) {
    // Errors and hang-ups are told without being asked for.
    pollfd entries[] = {{input, POLLIN, 0}, {output, 0, 0}, {interrupt, POLLIN, 0}};
    while (::poll(entries, std::size(entries), -1) < 0) {
        if (errno != EINTR) return KsError::errorWithPOSIXCode();
    }
    if (entries[2].revents != 0) return Readiness::interrupted;
    if (entries[0].revents != 0) return Readiness::input;
    return Readiness::outputGone;
}

Result<UniqueFd> makeInterrupt() {
    UniqueFd fd(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!fd) return KsError::errorWithPOSIXCode();
    return fd;
}

void interrupt(const UniqueFd& interrupt) {
    const std::uint64_t one = 1;
    // A counter that is already full is readable: nothing is lost.
    [[maybe_unused]] const ssize_t put = ::write(interrupt.get(), &one, sizeof one);
}

void clearInterrupt(const UniqueFd& interrupt) {
    std::uint64_t count = 0;
    // Nothing to read is as clear as it gets.
    [[maybe_unused]] const ssize_t got = ::read(interrupt.get(), &count, sizeof count);
}

bool isReadable(int fd) {
    pollfd entry{fd, POLLIN, 0};
    return ::poll(&entry, 1, 0) > 0;
}

void enlargePipe(int fd, std::size_t bytes) {
    ::fcntl(fd, F_SETPIPE_SZ, static_cast<int>(bytes));
}

void occupyStandardDescriptors() {
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
        // The lowest free number is the one that is missing.
        if (::fcntl(fd, F_GETFD) < 0 && ::open("/dev/null", fd == STDIN_FILENO ? O_RDONLY : O_WRONLY) < 0) return;
    }
}

}  // namespace cindral::descriptor
