#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/KsError.h"

namespace cindral {

/// What a command prints, written as it grows: a listing of any length costs one buffer.
///
/// Thread safety: for one thread at a time.
class TextOutput {
public:
    /// `fd` is borrowed for life. A terminal is shown each line at once. `lineEnd` stands behind each line.
    TextOutput(int fd, bool isTerminal, char lineEnd = '\n');
    /// Does not flush: what is to be written, and whether it was, is finish()'s.
    ~TextOutput() = default;
    TextOutput(const TextOutput&) = delete;
    TextOutput& operator=(const TextOutput&) = delete;

    /// Appends a line; its end is added.
    void line(std::string_view text);
    /// The same for text that was appended to buffer().
    void endLine();
    std::string& buffer() { return buffer_; }
    /// Writes what there is: nothing more may come for a while.
    void flush();

    /// What is written to.
    int descriptor() const { return fd_; }

    /// Nothing that is printed from now on arrives: there is no use in working on.
    bool isBroken() const { return isBroken_; }
    /// Writes what is left. What went wrong, also earlier; none where nothing did, and where only the reader has gone
    /// away.
    std::optional<KsError> finish();

private:
    const int fd_;
    const char lineEnd_;
    const std::size_t bufferBytesMax_;
    std::string buffer_;
    bool isBroken_ = false;
    std::optional<KsError> error_;
};

}  // namespace cindral
